// The configuration nodes of a service group.
//
// Each node is a row of `group_nodes`, which both paths of the configuration (wccpd_config.cpp) use. An
// invalid word is not a failure: it is logged and replaced by the row's fallback. A binding of the wrong type
// is a failure.
#include "daemon/wccpd_group_nodes.h"

#include <cstdlib>
#include <cstring>

#include "daemon/wccpd_mgmt.h"
#include "engine/wccp_config.h"
#include "engine/wccp_utils.h"
#include "engine/wccpd_common.h"
#include "mgmt/owners.h"
#include "mgmt/protocol_names.h"
#include "runtime/logging.h"

struct group_node_words {
    struct word {
        const char *text;
        uint32_t value;
    };
    std::span<const word> list;
    uint32_t fallback;                  // for an invalid word; 0: the node is ignored
    void (*complain)(const char *text); // logs the invalid word
};

namespace {

uint16_t svc_grp_policy[WCCP_MAX_GROUPS];

void store_value(const group_node *node, wccp_grp_config *config, const char *text, uint32_t value) {
    node->set(config, value);
    config->config_flags |= node->flag;
    node->log(text, value);
}

lc_status take_word(const group_node *node, wccp_grp_config *config, const bn_binding *binding) {
    owned_tstring text;
    CHECK_STATUS(wccpd_read_text(binding, &text));
    const char *string = ts_str(text.pointer);
    uint32_t value = 0;
    for (const group_node_words::word &word : node->words->list)
        if (strcmp(word.text, string) == 0)
            value = word.value;
    // No word has the value 0.
    if (value == 0) {
        node->words->complain(string);
        value = node->words->fallback;
    }
    if (value != 0)
        store_value(node, config, string, value);
    return LC_OK;
}

lc_status take_number(const group_node *node, wccp_grp_config *config, const bn_binding *binding) {
    uint32_t value = 0;
    CHECK_STATUS(bn_binding_get_uint32(binding, bn_attrib_value, nullptr, &value));
    store_value(node, config, "", value);
    return LC_OK;
}

lc_status take_port_mask(const group_node *node, wccp_grp_config *config, const bn_binding *binding) {
    uint16_t value = 0;
    CHECK_STATUS(bn_binding_get_uint16(binding, bn_attrib_value, nullptr, &value));
    store_value(node, config, "", value);
    return LC_OK;
}

lc_status take_bool(const group_node *node, wccp_grp_config *config, const bn_binding *binding) {
    uint32_t value = 0;
    CHECK_STATUS(bn_binding_get_tbool(binding, bn_attrib_value, nullptr, &value));
    store_value(node, config, value ? "yes" : "no", value ? 1 : 0);
    return LC_OK;
}

lc_status take_router(const group_node *node, wccp_grp_config *config, const bn_binding *binding) {
    uint32_t address = 0;
    CHECK_STATUS(bn_binding_get_ipv4addr(binding, bn_attrib_value, nullptr, &address));
    config->config_flags |= node->flag;
    for (uint16_t i = 0; i < WCCP_MAX_ROUTERS; i++) { // the first free entry; a 33rd router is dropped
        if (!is_zero(config->routers[i]))
            continue;
        config->routers[i] = to_be32(address);
        config->router_count = static_cast<uint16_t>(i + 1);
        util_log(LC_LOG_INFO, CONFIG_LOG_PREFIX, "set router ip to %s, position %d",
                 addr_text(to_be32(address)).s, i);
        break;
    }
    return LC_OK;
}

lc_status take_protocol(const group_node *, wccp_grp_config *config, const bn_binding *binding) {
    owned_tstring text;
    CHECK_STATUS(wccpd_read_text(binding, &text));
    const char *string = ts_str(text.pointer);
    long number = ip_protocol_by_name(string);
    if (number < 0) // not the name of a protocol
        number = strtol(string, nullptr, 10);
    if (number < 1 || number > 255) {
        QV_LOG(LC_LOG_ERR, "Bad wccp protocol: %s", string);
        return LC_OK;
    }
    config->protocol = static_cast<uint8_t>(number);
    util_log(LC_LOG_INFO, CONFIG_LOG_PREFIX, "set protocol %s to %d", string, config->protocol);
    return LC_OK;
}

lc_status take_password(const group_node *node, wccp_grp_config *config, const bn_binding *binding) {
    owned_tstring text;
    CHECK_STATUS(wccpd_read_text(binding, &text));
    memset(config->password, 0, sizeof config->password); // the digest is computed over all 8 bytes
    strlcpy(config->password, ts_str(text.pointer), sizeof config->password);
    config->config_flags |= node->flag;
    util_log(LC_LOG_INFO, CONFIG_LOG_PREFIX, "set password");
    return LC_OK;
}

lc_status take_interface(const group_node *, wccp_grp_config *config, const bn_binding *binding) {
    owned_tstring text;
    CHECK_STATUS(wccpd_read_text(binding, &text));
    strlcpy(config->interface, ts_str(text.pointer), sizeof config->interface);
    config->interface_set = 1;
    util_log(LC_LOG_INFO, CONFIG_LOG_PREFIX, "set interface to %s", config->interface);
    return LC_OK;
}

lc_status take_policy(const group_node *, wccp_grp_config *config, const bn_binding *binding) {
    uint32_t value = 0;
    CHECK_STATUS(bn_binding_get_uint32(binding, bn_attrib_value, nullptr, &value));
    const uint16_t policy = static_cast<uint16_t>(value);
    const uint8_t id = config->group_id;
    // The removal first: it clears the engine's record of the membership, even that of a newer one.
    if (svc_grp_policy[id] != 0)
        (void)wccp_remove_policy_grp(svc_grp_policy[id], id);
    svc_grp_policy[id] = policy; // also if the next step fails
    if (wccp_add_policy_grp(policy, 1, &id) != 0)
        util_log(LC_LOG_ERR, CONFIG_LOG_PREFIX, "Failed set policy grp to %d", policy);
    else
        util_log(LC_LOG_INFO, CONFIG_LOG_PREFIX, "set policy grp to %d", policy);
    return LC_OK;
}

constexpr group_node_words::word admin_list[] = {{"up", WCCP_ADMIN_UP}, {"down", WCCP_ADMIN_DOWN}};
constexpr group_node_words::word encap_list[] = {
    {"gre", WCCP_METHOD_GRE}, {"l2", WCCP_METHOD_L2}, {"either", WCCP_METHOD_EITHER}};
constexpr group_node_words::word assign_list[] = {
    {"hash", WCCP_ASSIGN_HASH}, {"mask", WCCP_ASSIGN_MASK}, {"either", WCCP_ASSIGN_EITHER}};
constexpr group_node_words::word compatibility_list[] = {{"ios", WCCP_COMPAT_IOS},
                                                         {"nexus", WCCP_COMPAT_NEXUS}};

#define LOG_BAD_WORD(format) [](const char *text) { util_log(LC_LOG_ERR, CONFIG_LOG_PREFIX, format, text); }
constexpr group_node_words admin_words = {admin_list, 0, LOG_BAD_WORD("Invalid admin: %s, ignoring")};
constexpr group_node_words encap_words = {encap_list, WCCP_METHOD_EITHER,
                                          LOG_BAD_WORD("Invalid forwarding method: %s, using EITHER")};
constexpr group_node_words assign_words = {assign_list, WCCP_ASSIGN_EITHER,
                                           LOG_BAD_WORD("Invalid assignment method: %s, using EITHER")};
constexpr group_node_words compatibility_words = {compatibility_list, WCCP_COMPAT_IOS,
                                                  LOG_BAD_WORD("Invalid compatibility mode: %s, using ios")};

#define SET_FIELD(field)                                                                                     \
    [](wccp_grp_config *config, uint32_t value) {                                                            \
        config->field = static_cast<decltype(config->field)>(value);                                         \
    }
#define LOG_VALUE(...)                                                                                       \
    [](const char *text, uint32_t value) {                                                                   \
        (void)text, (void)value;                                                                             \
        util_log(LC_LOG_INFO, CONFIG_LOG_PREFIX, __VA_ARGS__);                                               \
    }

// clang-format off
constexpr group_node rows[] = {
    {GROUP_NODE_ROUTER, nullptr, false, WCCP_CFG_ROUTERS, take_router, nullptr, nullptr, nullptr},
    {GROUP_NODE_PRIORITY, "priority", false, 0, take_number, SET_FIELD(priority),
     LOG_VALUE("set priority to %d", static_cast<uint8_t>(value)), nullptr},
    {GROUP_NODE_PROTOCOL, "protocol", false, 0, take_protocol, nullptr, nullptr, nullptr},
    {GROUP_NODE_PASSWORD, "password", true, WCCP_CFG_PASSWORD, take_password, nullptr, nullptr, nullptr},
    {GROUP_NODE_ENCAP, "encap", true, WCCP_CFG_FWD_METHOD, take_word, SET_FIELD(fwd_method),
     LOG_VALUE("set encap %s to %d", text, static_cast<int>(value)), &encap_words},
    {GROUP_NODE_WEIGHT, "weight", true, WCCP_CFG_WEIGHT, take_number, SET_FIELD(weight),
     LOG_VALUE("set weight to %d", static_cast<uint16_t>(value)), nullptr},
    {GROUP_NODE_ADMIN, "admin", true, WCCP_CFG_ADMIN, take_word, SET_FIELD(admin),
     LOG_VALUE("set admin %s:%d", text, static_cast<int>(value)), &admin_words},
    {GROUP_NODE_POLICY_GRP, "policy_grp", true, 0, take_policy, nullptr, nullptr, nullptr},
    {GROUP_NODE_FORCE_L2_RETURN, "force_l2_return", true, WCCP_CFG_FORCE_L2_RETURN, take_bool,
     SET_FIELD(force_l2_return), LOG_VALUE("set force l2 return to %s", text), nullptr},
    {GROUP_NODE_INTERFACE, "interface", true, 0, take_interface, nullptr, nullptr, nullptr},
    {GROUP_NODE_ASSIGN_METHOD, "assign_method", true, WCCP_CFG_ASSIGN_METHOD, take_word,
     SET_FIELD(assign_method), LOG_VALUE("set assignment method to %s", text), &assign_words},
    {GROUP_NODE_HASH_SRC_IP, "hash_src_ip", true, WCCP_CFG_HASH_SRC_IP, take_bool, SET_FIELD(hash_src_ip),
     LOG_VALUE("set hash src ip to %s", text), nullptr},
    {GROUP_NODE_HASH_DST_IP, "hash_dst_ip", true, WCCP_CFG_HASH_DST_IP, take_bool, SET_FIELD(hash_dst_ip),
     LOG_VALUE("set hash dst ip to %s", text), nullptr},
    {GROUP_NODE_HASH_SRC_PORT, "hash_src_port", true, WCCP_CFG_HASH_SRC_PORT, take_bool,
     SET_FIELD(hash_src_port), LOG_VALUE("set hash src port to %s", text), nullptr},
    {GROUP_NODE_HASH_DST_PORT, "hash_dst_port", true, WCCP_CFG_HASH_DST_PORT, take_bool,
     SET_FIELD(hash_dst_port), LOG_VALUE("set hash dst port to %s", text), nullptr},
    {GROUP_NODE_MASK_SRC_IP, "mask_src_ip", true, WCCP_CFG_MASK_SRC_IP, take_number, SET_FIELD(mask_src_ip),
     LOG_VALUE("set mask src ip to 0x%x", value), nullptr},
    {GROUP_NODE_MASK_DST_IP, "mask_dst_ip", true, WCCP_CFG_MASK_DST_IP, take_number, SET_FIELD(mask_dst_ip),
     LOG_VALUE("set mask dst ip to 0x%x", value), nullptr},
    {GROUP_NODE_MASK_SRC_PORT, "mask_src_port", true, WCCP_CFG_MASK_SRC_PORT, take_port_mask,
     SET_FIELD(mask_src_port), LOG_VALUE("set mask src port to 0x%x", value), nullptr},
    {GROUP_NODE_MASK_DST_PORT, "mask_dst_port", true, WCCP_CFG_MASK_DST_PORT, take_port_mask,
     SET_FIELD(mask_dst_port), LOG_VALUE("set mask dst port to 0x%x", value), nullptr},
    {GROUP_NODE_COMPATIBILITY, "compatibility", true, WCCP_CFG_COMPATIBILITY, take_word,
     SET_FIELD(compatibility), LOG_VALUE("set compatibility mode to %s(%d)", text, static_cast<int>(value)),
     &compatibility_words},
};
// clang-format on

} // namespace

constexpr std::span<const group_node> group_nodes = rows;

lc_status wccpd_config_update_group_binding(wccp_grp_config *config, const bn_binding *binding, int kind) {
    for (const group_node &node : group_nodes)
        if (node.kind == kind)
            return node.take(&node, config, binding);
    util_log(LC_LOG_ERR, CONFIG_LOG_PREFIX, "node type %d unknown", kind);
    return LC_OK;
}

void forget_policy_memberships() {
    memset(svc_grp_policy, 0, sizeof svc_grp_policy);
}

void leave_policy_group(uint8_t group_id) {
    // For a group without a policy group, number 0, this removes nothing.
    (void)wccp_remove_policy_grp(svc_grp_policy[group_id], group_id);
    svc_grp_policy[group_id] = 0;
}

void move_policy_members(uint16_t from, uint16_t to) {
    for (uint32_t group = 0; group < WCCP_MAX_GROUPS; group++) {
        if (svc_grp_policy[group] != from)
            continue;
        // The engine has dropped the earlier membership together with the policy group.
        const uint8_t member = static_cast<uint8_t>(group);
        svc_grp_policy[group] = to;
        (void)wccp_add_policy_grp(to, 1, &member);
    }
}
