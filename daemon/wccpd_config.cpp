// The configuration: read once at start, then followed change by change while groups run.
//
// All configuration lives in mgmtd as bindings; the only storage here is the table of policy memberships. Two
// paths lead into the engine. The group path builds a whole wccp_grp_config from the subtree of one group and
// adds the group, or deletes it: at start for every group, later for a change that adds or removes a group's
// root node. The node path looks at one changed binding at a time and modifies one field of the running
// group.
//
// A bad word is no failure: it is logged and a fallback takes its place. A binding of the wrong type is one,
// and ends the walk of its array; what was applied stays. Node kinds are one table. Every group looks up some
// fifty nodes, so an array is indexed by name once before it is walked, and the time to start grows with the
// size of the tree only.
//
// Main thread only; it may run nested in a wait for mgmtd, but never waits itself in the middle of a walk.
#include "daemon/wccpd_config.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "daemon/protocol_names.h"
#include "daemon/wccpd_main.h"
#include "daemon/wccpd_mgmt.h"
#include "engine/wccp_config.h"
#include "engine/wccp_host.h"
#include "engine/wccp_mgr.h"
#include "engine/wccp_utils.h"
#include "engine/wccpd_common.h"
#include "mgmt/bnode.h"
#include "mgmt/log_sync.h"
#include "mgmt/mdc_main.h"
#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "runtime/hash_table.h"
#include "runtime/logging.h"

constexpr const char *GROUP_ROOTS = NODE_GROUP_CONFIG "/*";
constexpr const char *POLICY_ROOTS = NODE_POLICY_CONFIG "/*";
constexpr const char *CONFIG_PREFIX = "WCCP config: ";
constexpr uint16_t ORPHANED_POLICY = 300; // where the members of a deleted policy group go

static uint16_t svc_grp_policy[WCCP_MAX_GROUPS]; // policy group of each service group, 0 for none

static const char *yes_or_no(uint32_t value) {
    return value ? "yes" : "no";
}

// --- Node kinds
// -----------------------------------------------------------------------------------------------------

struct config_word {
    const char *word;
    uint32_t value;
};
// A value given by a word: what the words mean, and what a bad one gives (0: the node is ignored).
struct config_words {
    const config_word *words;
    uint32_t fallback;
    void (*complain)(const char *text);
};

struct config_kind {
    int number;
    const char *node; // name below the group's root
    uint32_t flag;    // of config_flags
    lc_status (*take)(const config_kind *kind, wccp_grp_config *config, const bn_binding *binding);
    uint32_t offset, size; // of the field
    void (*say)(const char *text, uint32_t value);
    const config_words *words;
    bool changes; // a change of the node alone is followed
};

static void store(const config_kind *kind, wccp_grp_config *config, uint32_t value) {
    char *field = reinterpret_cast<char *>(config) + kind->offset;
    const uint16_t half = static_cast<uint16_t>(value);
    const uint8_t byte = static_cast<uint8_t>(value);
    if (kind->size == sizeof value)
        memcpy(field, &value, sizeof value);
    else if (kind->size == sizeof half)
        memcpy(field, &half, sizeof half);
    else
        memcpy(field, &byte, sizeof byte);
}

static lc_status read_text(const bn_binding *binding, owned_tstring *out) {
    CHECK_STATUS(bn_binding_get_tstr(binding, bn_attrib_value, bn_type_str, nullptr, &out->pointer));
    CHECK_NULL(out->pointer);
    return LC_OK;
}

static lc_status take_word(const config_kind *kind, wccp_grp_config *config, const bn_binding *binding) {
    owned_tstring text;
    CHECK_STATUS(read_text(binding, &text));
    const char *string = ts_str(text.pointer);
    uint32_t value = 0;
    for (const config_word *word = kind->words->words; word->word; word++)
        if (strcmp(word->word, string) == 0)
            value = word->value;
    if (value == 0) {
        kind->words->complain(string);
        if (kind->words->fallback == 0)
            return LC_OK;
        value = kind->words->fallback;
    }
    store(kind, config, value);
    config->config_flags |= kind->flag;
    kind->say(string, value);
    return LC_OK;
}

static lc_status take_number(const config_kind *kind, wccp_grp_config *config, const bn_binding *binding) {
    uint32_t value = 0;
    CHECK_STATUS(bn_binding_get_uint32(binding, bn_attrib_value, nullptr, &value));
    store(kind, config, value);
    config->config_flags |= kind->flag;
    kind->say("", value);
    return LC_OK;
}

static lc_status take_port_mask(const config_kind *kind, wccp_grp_config *config, const bn_binding *binding) {
    uint16_t value = 0;
    CHECK_STATUS(bn_binding_get_uint16(binding, bn_attrib_value, nullptr, &value));
    store(kind, config, value);
    config->config_flags |= kind->flag;
    kind->say("", value);
    return LC_OK;
}

static lc_status take_bool(const config_kind *kind, wccp_grp_config *config, const bn_binding *binding) {
    uint32_t value = 0;
    CHECK_STATUS(bn_binding_get_tbool(binding, bn_attrib_value, nullptr, &value));
    store(kind, config, value ? 1 : 0);
    config->config_flags |= kind->flag;
    kind->say(yes_or_no(value), value);
    return LC_OK;
}

static lc_status take_router(const config_kind *kind, wccp_grp_config *config, const bn_binding *binding) {
    uint32_t address = 0;
    CHECK_STATUS(bn_binding_get_ipv4addr(binding, bn_attrib_value, nullptr, &address));
    config->config_flags |= kind->flag;
    for (uint16_t i = 0; i < WCCP_MAX_ROUTERS; i++) {
        if (!is_zero(config->routers[i]))
            continue;
        config->routers[i] = to_be32(address);
        config->router_count = static_cast<uint16_t>(i + 1);
        util_log(LC_LOG_INFO, CONFIG_PREFIX, "set router ip to %s, position %d",
                 addr_text(to_be32(address)).s, i);
        break;
    }
    return LC_OK;
}

static lc_status take_protocol(const config_kind *, wccp_grp_config *config, const bn_binding *binding) {
    owned_tstring text;
    CHECK_STATUS(read_text(binding, &text));
    const char *string = ts_str(text.pointer);
    long number = wccpd_protocol_by_name(string);
    if (number < 0)
        number = strtol(string, nullptr, 10);
    if (number < 1 || number > 255) {
        QV_LOG(LC_LOG_ERR, "Bad wccp protocol: %s", string);
        return LC_OK;
    }
    config->protocol = static_cast<uint8_t>(number);
    util_log(LC_LOG_INFO, CONFIG_PREFIX, "set protocol %s to %d", string, config->protocol);
    return LC_OK;
}

static lc_status take_password(const config_kind *kind, wccp_grp_config *config, const bn_binding *binding) {
    owned_tstring text;
    CHECK_STATUS(read_text(binding, &text));
    memset(config->password, 0, sizeof config->password);
    strlcpy(config->password, ts_str(text.pointer), sizeof config->password);
    config->config_flags |= kind->flag;
    util_log(LC_LOG_INFO, CONFIG_PREFIX, "set password");
    return LC_OK;
}

static lc_status take_interface(const config_kind *, wccp_grp_config *config, const bn_binding *binding) {
    owned_tstring text;
    CHECK_STATUS(read_text(binding, &text));
    strlcpy(config->interface, ts_str(text.pointer), sizeof config->interface);
    config->interface_set = 1;
    util_log(LC_LOG_INFO, CONFIG_PREFIX, "set interface to %s", config->interface);
    return LC_OK;
}

static lc_status take_policy(const config_kind *, wccp_grp_config *config, const bn_binding *binding) {
    uint32_t value = 0;
    CHECK_STATUS(bn_binding_get_uint32(binding, bn_attrib_value, nullptr, &value));
    const uint16_t policy = static_cast<uint16_t>(value);
    const uint8_t id = config->group_id;
    if (svc_grp_policy[id] != 0)
        (void)wccp_remove_policy_grp(svc_grp_policy[id], id);
    svc_grp_policy[id] = policy;
    if (wccp_add_policy_grp(policy, 1, &id) != 0)
        util_log(LC_LOG_ERR, CONFIG_PREFIX, "Failed set policy grp to %d", policy);
    else
        util_log(LC_LOG_INFO, CONFIG_PREFIX, "set policy grp to %d", policy);
    return LC_OK;
}

static const config_word admin_list[] = {{"up", 1}, {"down", 2}, {nullptr, 0}};
static const config_words admin_words = {
    admin_list, 0,
    [](const char *text) { util_log(LC_LOG_ERR, CONFIG_PREFIX, "Invalid admin: %s, ignoring", text); }};
static const config_word encap_list[] = {{"gre", 1}, {"l2", 2}, {"either", 3}, {nullptr, 0}};
static const config_words encap_words = {encap_list, 3, [](const char *text) {
                                             util_log(LC_LOG_ERR, CONFIG_PREFIX,
                                                      "Invalid forwarding method: %s, using EITHER", text);
                                         }};
static const config_word assign_list[] = {{"hash", 1}, {"mask", 2}, {"either", 3}, {nullptr, 0}};
static const config_words assign_words = {assign_list, 3, [](const char *text) {
                                              util_log(LC_LOG_ERR, CONFIG_PREFIX,
                                                       "Invalid assignment method: %s, using EITHER", text);
                                          }};
static const config_word compatibility_list[] = {{"ios", 1}, {"nexus", 2}, {nullptr, 0}};
static const config_words compatibility_words = {
    compatibility_list, 1, [](const char *text) {
        util_log(LC_LOG_ERR, CONFIG_PREFIX, "Invalid compatibility mode: %s, using ios", text);
    }};

#define FIELD(name) offsetof(wccp_grp_config, name), sizeof(wccp_grp_config::name)
#define NO_FIELD 0, 0
#define SAY(...)                                                                                             \
    [](const char *text, uint32_t value) {                                                                   \
        (void)text, (void)value;                                                                             \
        util_log(LC_LOG_INFO, CONFIG_PREFIX, __VA_ARGS__);                                                   \
    }

// In the order in which a new group's nodes are read.
static const config_kind config_kinds[] = {
    {4, "priority", 0, take_number, FIELD(priority), SAY("set priority to %d", static_cast<uint8_t>(value)),
     nullptr, false},
    {3, "protocol", 0, take_protocol, NO_FIELD, nullptr, nullptr, false},
    {7, "password", WCCP_CFG_PASSWORD, take_password, NO_FIELD, nullptr, nullptr, true},
    {5, "encap", WCCP_CFG_FWD_METHOD, take_word, FIELD(fwd_method),
     SAY("set encap %s to %d", text, static_cast<int>(value)), &encap_words, true},
    {6, "weight", WCCP_CFG_WEIGHT, take_number, FIELD(weight),
     SAY("set weight to %d", static_cast<uint16_t>(value)), nullptr, true},
    {1, "admin", WCCP_CFG_ADMIN, take_word, FIELD(admin),
     SAY("set admin %s:%d", text, static_cast<int>(value)), &admin_words, true},
    {8, "policy_grp", 0, take_policy, NO_FIELD, nullptr, nullptr, true},
    {10, "force_l2_return", WCCP_CFG_FORCE_L2_RETURN, take_bool, FIELD(force_l2_return),
     SAY("set force l2 return to %s", text), nullptr, true},
    {9, "interface", 0, take_interface, NO_FIELD, nullptr, nullptr, true},
    {11, "assign_method", WCCP_CFG_ASSIGN_METHOD, take_word, FIELD(assign_method),
     SAY("set assignment method to %s", text), &assign_words, true},
    {13, "hash_src_ip", WCCP_CFG_HASH_SRC_IP, take_bool, FIELD(hash_src_ip),
     SAY("set hash src ip to %s", text), nullptr, true},
    {14, "hash_dst_ip", WCCP_CFG_HASH_DST_IP, take_bool, FIELD(hash_dst_ip),
     SAY("set hash dst ip to %s", text), nullptr, true},
    {15, "hash_src_port", WCCP_CFG_HASH_SRC_PORT, take_bool, FIELD(hash_src_port),
     SAY("set hash src port to %s", text), nullptr, true},
    {16, "hash_dst_port", WCCP_CFG_HASH_DST_PORT, take_bool, FIELD(hash_dst_port),
     SAY("set hash dst port to %s", text), nullptr, true},
    {17, "mask_src_ip", WCCP_CFG_MASK_SRC_IP, take_number, FIELD(mask_src_ip),
     SAY("set mask src ip to 0x%x", value), nullptr, true},
    {18, "mask_dst_ip", WCCP_CFG_MASK_DST_IP, take_number, FIELD(mask_dst_ip),
     SAY("set mask dst ip to 0x%x", value), nullptr, true},
    {19, "mask_src_port", WCCP_CFG_MASK_SRC_PORT, take_port_mask, FIELD(mask_src_port),
     SAY("set mask src port to 0x%x", value), nullptr, true},
    {20, "mask_dst_port", WCCP_CFG_MASK_DST_PORT, take_port_mask, FIELD(mask_dst_port),
     SAY("set mask dst port to 0x%x", value), nullptr, true},
    {21, "compatibility", WCCP_CFG_COMPATIBILITY, take_word, FIELD(compatibility),
     SAY("set compatibility mode to %s(%d)", text, static_cast<int>(value)), &compatibility_words, true},
    {2, nullptr, WCCP_CFG_ROUTERS, take_router, NO_FIELD, nullptr, nullptr, false},
};

lc_status wccpd_config_update_group_binding(wccp_grp_config *config, const bn_binding *binding, int kind) {
    for (const config_kind &known : config_kinds)
        if (known.number == kind)
            return known.take(&known, config, binding);
    util_log(LC_LOG_ERR, CONFIG_PREFIX, "node type %d unknown", kind);
    return LC_OK;
}

// --- An array of bindings, indexed for one walk
// ---------------------------------------------------------------------

struct config_tree {
    const bn_binding_array *bindings;
    ht *by_name;      // name to binding; both belong to the array
    ht *router_count; // name of a group's router list to the number of its entries
};
struct config_tree_guard {
    config_tree tree = {};
    config_tree_guard() = default;
    ~config_tree_guard() {
        (void)ht_free(&tree.by_name);
        (void)ht_free(&tree.router_count);
    }
    config_tree_guard(const config_tree_guard &) = delete;
    config_tree_guard &operator=(const config_tree_guard &) = delete;
};

// Length of a name without its last part, 0 when it has none above it.
static int32_t parent_length(const char *name) {
    const char *slash = strrchr(name, '/');
    return slash ? static_cast<int32_t>(slash - name) : 0;
}

static lc_status count_router(config_tree *tree, const char *name) {
    const int32_t length = parent_length(name);
    constexpr int32_t tail = sizeof "/router" - 1;
    if (length < tail || memcmp(name + length - tail, "/router", tail) != 0)
        return LC_OK;
    void *count = nullptr;
    CHECK_STATUS(ht_lookup(tree->router_count, name, length, nullptr, nullptr, nullptr, &count));
    count = reinterpret_cast<void *>(reinterpret_cast<uintptr_t>(count) + 1);
    CHECK_STATUS(ht_insert(tree->router_count, name, length, count));
    return LC_OK;
}

static lc_status config_tree_make(config_tree *tree, const bn_binding_array *bindings) {
    tree->bindings = bindings;
    CHECK_STATUS(ht_new(&tree->by_name, nullptr));
    CHECK_STATUS(ht_new(&tree->router_count, nullptr));
    const uint32_t count = bn_binding_array_length_quick(bindings);
    for (uint32_t i = 0; i < count; i++) {
        bn_binding *binding = bn_binding_array_get_quick(bindings, i);
        const char *name = binding ? bn_binding_get_name_quick(binding) : nullptr;
        if (!name)
            continue;
        int known = 0;
        CHECK_STATUS(ht_lookup(tree->by_name, name, -1, &known, nullptr, nullptr, nullptr));
        if (known)
            continue; // the first of a name is the one that a search would find
        CHECK_STATUS(ht_insert(tree->by_name, name, -1, binding));
        CHECK_STATUS(count_router(tree, name));
    }
    return LC_OK;
}

static lc_status config_tree_find(const config_tree *tree, const char *root, const char *relative,
                                  bn_binding **out) {
    char name[512];
    *out = nullptr;
    if (static_cast<size_t>(snprintf(name, sizeof name, "%s%s%s", root, relative[0] ? "/" : "", relative)) >=
        sizeof name)
        return LC_OK;
    void *value = nullptr;
    CHECK_STATUS(ht_lookup(tree->by_name, name, -1, nullptr, nullptr, nullptr, &value));
    *out = static_cast<bn_binding *>(value);
    return LC_OK;
}

static lc_status is_deleted(const bn_binding *binding, bool *out) {
    uint32_t flags = 0;
    CHECK_STATUS(bn_binding_get_type(binding, bn_attrib_value, nullptr, &flags));
    *out = (flags & bn_flag_deleted) != 0;
    return LC_OK;
}

static lc_status root_is_deleted(const config_tree *tree, const char *root, bool *out) {
    bn_binding *binding = nullptr;
    CHECK_STATUS(config_tree_find(tree, root, "", &binding));
    if (!binding)
        CHECK_STATUS(LC_NOT_FOUND);
    CHECK_STATUS(is_deleted(binding, out));
    return LC_OK;
}

// --- Whole groups
// ---------------------------------------------------------------------------------------------------

static void delete_group(uint8_t id) {
    if (wccp_del_group(id) == 0)
        QV_LOG(LC_LOG_INFO, "WCCP update: Deleted Group %d", id);
    else
        QV_LOG(LC_LOG_ERR, "WCCP update: Failed to delete Group %d", id);
}

static lc_status take_routers(const config_tree *tree, const char *root, wccp_grp_config *config) {
    char list[512];
    snprintf(list, sizeof list, "%s/router", root);
    void *count = nullptr;
    CHECK_STATUS(ht_lookup(tree->router_count, list, -1, nullptr, nullptr, nullptr, &count));
    for (uintptr_t number = 1; number <= reinterpret_cast<uintptr_t>(count); number++) {
        char relative[48];
        snprintf(relative, sizeof relative, "router/%lu/ipaddr", static_cast<unsigned long>(number));
        bn_binding *binding = nullptr;
        CHECK_STATUS(config_tree_find(tree, root, relative, &binding));
        if (binding)
            CHECK_STATUS(wccpd_config_update_group_binding(config, binding, 2));
    }
    return LC_OK;
}

static lc_status wccpd_config_update_group(const char *id_text, const config_tree *tree, const char *root) {
    CHECK_NULL(id_text);
    CHECK_NULL(tree);
    CHECK_NULL(root);
    const uint8_t id = static_cast<uint8_t>(strtol(id_text, nullptr, 10));
    QV_LOG(LC_LOG_INFO, "WCCP config query group %s(%d) - %s", id_text, id, root);
    wccp_grp_config config = {};
    bool deleted = false;
    CHECK_STATUS(root_is_deleted(tree, root, &deleted));
    if (deleted) {
        delete_group(id);
        (void)wccp_remove_policy_grp(svc_grp_policy[id], id);
        svc_grp_policy[id] = 0;
        return LC_OK;
    }
    config.group_id = id;
    CHECK_STATUS(take_routers(tree, root, &config));
    for (const config_kind &kind : config_kinds) {
        if (!kind.node)
            continue;
        bn_binding *binding = nullptr;
        CHECK_STATUS(config_tree_find(tree, root, kind.node, &binding));
        if (binding)
            CHECK_STATUS(wccpd_config_update_group_binding(&config, binding, kind.number));
    }
    if (wccp_add_group(&config) == 0)
        QV_LOG(LC_LOG_INFO, "Created WCCP group %d", id);
    else
        QV_LOG(LC_LOG_ERR, "FAILED to create WCCP group %d", id);
    return LC_OK;
}

static lc_status wccpd_config_update_policy_group(const config_tree *tree, const char *root,
                                                  const char *id_text) {
    CHECK_NULL(tree);
    const uint16_t id = static_cast<uint16_t>(strtol(id_text, nullptr, 10));
    QV_LOG(LC_LOG_INFO, "WCCP policy config query group %s(%d) - %s", id_text, id, root);
    bool deleted = false;
    CHECK_STATUS(root_is_deleted(tree, root, &deleted));
    if (!deleted) {
        if (wccp_add_policy_grp(id, 0, nullptr) == 0)
            QV_LOG(LC_LOG_INFO, "WCCP update: Added policy Group %d", id);
        else
            QV_LOG(LC_LOG_ERR, "WCCP update: Failed to add policy Group %d", id);
        return LC_OK;
    }
    if (wccp_del_entire_policy_grp(id) == 0)
        QV_LOG(LC_LOG_INFO, "WCCP update: Deleted policy Group %d", id);
    else
        QV_LOG(LC_LOG_ERR, "WCCP update: Failed to delete policy Group %d", id);
    for (uint32_t group = 0; group < WCCP_MAX_GROUPS; group++) {
        if (svc_grp_policy[group] != id)
            continue;
        const uint8_t member = static_cast<uint8_t>(group);
        svc_grp_policy[group] = ORPHANED_POLICY;
        (void)wccp_add_policy_grp(ORPHANED_POLICY, 1, &member);
    }
    return LC_OK;
}

static lc_status wccpd_config_update_handler(const bn_binding_array *, uint32_t, bn_binding *,
                                             const tstring *name, const tstr_array *,
                                             const tstring *last_part, const tstring *, void *tree) {
    CHECK_STATUS(
        wccpd_config_update_group(ts_str(last_part), static_cast<const config_tree *>(tree), ts_str(name)));
    return LC_OK;
}

static lc_status wccpd_config_policy_update_handler(const bn_binding_array *, uint32_t, bn_binding *,
                                                    const tstring *name, const tstr_array *,
                                                    const tstring *last_part, const tstring *, void *tree) {
    CHECK_STATUS(wccpd_config_update_policy_group(static_cast<const config_tree *>(tree), ts_str(name),
                                                  ts_str(last_part)));
    return LC_OK;
}

static lc_status walk_roots(const bn_binding_array *bindings, const char *pattern,
                            mdc_foreach_function handler, uint32_t *out_count) {
    config_tree_guard indexed;
    CHECK_STATUS(config_tree_make(&indexed.tree, bindings));
    CHECK_STATUS(
        mdc_foreach_binding_prequeried(bindings, pattern, nullptr, handler, &indexed.tree, out_count));
    return LC_OK;
}

// --- One changed node
// -----------------------------------------------------------------------------------------------

static lc_status change_facility(const bn_binding *binding) {
    uint32_t facility = 0;
    CHECK_STATUS(bn_binding_get_uint32(binding, bn_attrib_value, nullptr, &facility));
    const char *name = lc_enum_to_string(lc_log_facility_table, static_cast<int32_t>(facility));
    LC_LOG(LC_LOG_INFO, "system facility to %d(%s), %s", static_cast<int>(facility >> 3), name,
           wccpd_program_name);
    (void)lc_log_file(nullptr, "system facility set to %s, %s", name, wccpd_program_name);
    // Initialising forgets what management has set of the levels, which has nothing to do with the facility.
    lc_log_levels levels;
    CHECK_STATUS(lc_log_save_levels(&levels));
    CHECK_STATUS(lc_log_init(wccpd_program_name, nullptr, 0, WCCPD_LOG_COMPONENT, LC_LOG_DEBUG,
                             static_cast<int32_t>(facility), 1));
    CHECK_STATUS(lc_log_restore_levels(&levels));
    return LC_OK;
}

static lc_status change_global(const char *name, const bn_binding *binding) {
    if (strcmp(name, NODE_MCAST_TTL) != 0) {
        QV_LOG(LC_LOG_ERR, "WCCP update: Unknown global binding %s", name);
        return LC_OK;
    }
    uint32_t ttl = 0;
    CHECK_STATUS(bn_binding_get_uint32(binding, bn_attrib_value, nullptr, &ttl));
    if (wccp_set_mcast_ttl(static_cast<uint8_t>(ttl)) != 0)
        QV_LOG(LC_LOG_ERR, "FAILED to update multicast TTL (%d)", static_cast<uint8_t>(ttl));
    return LC_OK;
}

static lc_status change_group(const char *name, const tstr_array *parts, const bn_binding *binding,
                              bool deleted) {
    constexpr uint32_t GROUP_PART = 5, NODE_PART = 6, NODE_PARTS = 7;
    const char *id_text = tstr_array_get_str_quick(parts, GROUP_PART);
    const uint8_t id = static_cast<uint8_t>(id_text ? strtol(id_text, nullptr, 10) : 0);
    if (deleted) {
        delete_group(id);
        return LC_OK;
    }
    const char *node =
        tstr_array_length_quick(parts) == NODE_PARTS ? tstr_array_get_str_quick(parts, NODE_PART) : nullptr;
    wccp_grp_config config = {};
    config.group_id = id;
    bool known = node && strcmp(node, "assign_detail") == 0;
    for (const config_kind &kind : config_kinds) {
        if (!node || known || !kind.changes || strcmp(kind.node, node) != 0)
            continue;
        known = true;
        CHECK_STATUS(wccpd_config_update_group_binding(&config, binding, kind.number));
    }
    if (!known) {
        QV_LOG(LC_LOG_ERR, "WCCP update: Unknown binding %s", name);
        return LC_OK;
    }
    if (wccp_modify_grp(&config) != 0)
        QV_LOG(LC_LOG_ERR, "WCCP update group %d failed.", id);
    return LC_OK;
}

static lc_status wccpd_config_handle_change(bn_binding_array *, uint32_t, bn_binding *binding, void *) {
    const tstring *stored = nullptr;
    CHECK_STATUS(bn_binding_get_name(binding, &stored));
    const char *name = ts_str(stored);
    CHECK_NULL(name);
    owned_tstr_array parts;
    CHECK_STATUS(bn_binding_name_to_parts(name, &parts.pointer, nullptr));
    LC_LOG(LC_LOG_INFO, "%s: updating %s", __func__, name);
    if (strcmp(name, NODE_SYSTEM_FACILITY) == 0) {
        CHECK_STATUS(change_facility(binding));
        return LC_OK;
    }
    if (!wccpd_is_under(name, NODE_WCCPD) && strcmp(name, NODE_SYSTEM_MODE) != 0) {
        LC_LOG(LC_LOG_DEBUG, "%s: %s not for us, discarding", __func__, name);
        return LC_OK;
    }
    bool deleted = false;
    CHECK_STATUS(is_deleted(binding, &deleted));
    if (wccpd_is_under(name, NODE_WCCPD_CONFIG)) {
        CHECK_STATUS(change_global(name, binding));
    } else if (wccpd_is_under(name, NODE_GROUP_CONFIG)) {
        CHECK_STATUS(change_group(name, parts.pointer, binding, deleted));
    } else if (strcmp(name, NODE_SYSTEM_MODE) == 0) {
        owned_tstring mode;
        CHECK_STATUS(read_text(binding, &mode));
        (void)wccp_system_mode_change_event(ts_str(mode.pointer));
    } else if (!wccpd_is_under(name, NODE_POLICY_CONFIG)) {
        QV_LOG(LC_LOG_INFO, "WCCP update: Unsupported binding %s", name);
    }
    return LC_OK;
}

// A walk goes on behind any other failure.
static lc_status change_or_halt(bn_binding_array *bindings, uint32_t index, bn_binding *binding, void *data) {
    return wccpd_config_handle_change(bindings, index, binding, data) == LC_OK ? LC_OK
                                                                               : LC_FOREACH_HALT_ERROR;
}

// --- The whole, at start and in a change event
// ----------------------------------------------------------------------

static lc_status query_tree(const char *root, owned_bindings *out) {
    CHECK_STATUS(mdc_get_binding_children(wccpd_mcc, nullptr, nullptr, 1, &out->pointer, 0, 1, root));
    return LC_OK;
}

static lc_status query_nodes(const char *root) {
    owned_bindings bindings;
    CHECK_STATUS(query_tree(root, &bindings));
    if (bindings.pointer)
        CHECK_STATUS(bn_binding_array_foreach(bindings.pointer, change_or_halt, nullptr));
    return LC_OK;
}

static lc_status query_roots(const char *root, const char *pattern, mdc_foreach_function handler) {
    owned_bindings bindings;
    CHECK_STATUS(query_tree(root, &bindings));
    if (bindings.pointer)
        CHECK_STATUS(walk_roots(bindings.pointer, pattern, handler, nullptr));
    return LC_OK;
}

lc_status wccpd_config_query() {
    memset(svc_grp_policy, 0, sizeof svc_grp_policy);
    CHECK_STATUS(query_nodes(NODE_SYSTEM_CONFIG));
    CHECK_STATUS(query_nodes(NODE_WCCPD_CONFIG));
    (void)qv_init_log_level(wccpd_mcc);
    CHECK_STATUS(query_roots(NODE_POLICY_CONFIG, POLICY_ROOTS, wccpd_config_policy_update_handler));
    CHECK_STATUS(query_roots(NODE_GROUP_CONFIG, GROUP_ROOTS, wccpd_config_update_handler));
    return LC_OK;
}

lc_status wccpd_config_apply_to_log(const bn_binding_array *new_values) {
    (void)qv_handle_log_level_change(new_values);
    const bn_binding *facility = nullptr;
    CHECK_STATUS(bn_binding_array_get_binding_by_name(new_values, NODE_SYSTEM_FACILITY, &facility));
    if (facility)
        CHECK_STATUS(change_facility(facility));
    return LC_OK;
}

lc_status wccpd_config_apply(bn_binding_array *new_values) {
    (void)qv_handle_log_level_change(new_values);
    uint32_t count = 0;
    CHECK_STATUS(walk_roots(new_values, POLICY_ROOTS, wccpd_config_policy_update_handler, &count));
    QV_LOG(LC_LOG_INFO, "WCCP Group policy config callbacks: %d", static_cast<int>(count));
    CHECK_STATUS(walk_roots(new_values, GROUP_ROOTS, wccpd_config_update_handler, &count));
    QV_LOG(LC_LOG_INFO, "WCCP Group config callbacks: %d", static_cast<int>(count));
    if (count != 0)
        return LC_OK;
    CHECK_STATUS(bn_binding_array_foreach(new_values, change_or_halt, nullptr));
    QV_LOG(LC_LOG_INFO, "WCCP Modify config complete");
    return LC_OK;
}

static lc_status read_system_mode(owned_tstring *out) {
    owned_binding binding;
    CHECK_STATUS(
        mdc_get_binding(wccpd_mcc, nullptr, nullptr, 0, &binding.pointer, NODE_SYSTEM_MODE, nullptr));
    CHECK_NULL(binding.pointer);
    CHECK_STATUS(read_text(binding.pointer, out));
    return LC_OK;
}

int wccp_is_system_in_bridge_mode() {
    owned_tstring mode;
    if (read_system_mode(&mode) != LC_OK)
        return 0;
    QV_LOG(LC_LOG_INFO, "WCCP current system mode: %s", ts_str(mode.pointer));
    return strcmp(ts_str(mode.pointer), "bridge") == 0;
}
