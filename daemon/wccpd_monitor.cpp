// Monitoring: mgmtd asks for a node by name and gets at most one binding, or for a node's children and gets
// names.
//
// Nothing is cached. Each request goes to the engine's queries, which take the engine lock for their own
// length, and the answer is rendered here: every node is a row that says what it is asked of and how its
// value is written. The text nodes carry the engine's dumps in buffers that live for the one request.
//
// Main thread only, and only once the daemon is ready. Router and appliance numbers are places in a list at
// the moment of the request and may name somebody else at the next.
#include "daemon/wccpd_monitor.h"

#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "daemon/wccpd_main.h"
#include "daemon/wccpd_mgmt.h"
#include "engine/wccp_debug_utils.h"
#include "engine/wccp_owners.h"
#include "engine/wccp_query.h"
#include "engine/wccp_utils.h"
#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "runtime/csys.h"
#include "runtime/logging.h"
#include "runtime/version.h"

namespace {

// Parts of a name below the state root, counted from 0.
enum : uint32_t { GROUP_PART = 5, NUMBER_PART = 7, ADDRESS_PART = 9 };

// What a request is about, and what the engine said of it.
struct mon_subject {
    const char *name;
    const tstr_array *parts;
    uint8_t group;
    wccp_grp_info group_info;
    wccp_grp_router_info router;
    wccp_grp_appliance_info appliance;
    uint32_t load_percent;
};

struct mon_value {
    char text[160];
};
struct mon_dump {
    uint32_t size;
    int (*print)(csys_display_buf *buffer, uint8_t group);
    bool cut_text_counts; // what was written is the value even when it did not fit
};
struct mon_node {
    const char *pattern;
    uint32_t type;
    void (*value)(const mon_subject *subject, mon_value *out);
    const mon_dump *dump;
};

const char *address_text(be32 address, mon_value *out) {
    return get_addr_str(4, address, 0, out->text, 46);
}
void put_number(mon_value *out, uint32_t number) {
    snprintf(out->text, sizeof out->text, "%d", static_cast<int>(number));
}
void put_seconds_as_ms(mon_value *out, uint32_t seconds) {
    snprintf(out->text, sizeof out->text, "%" PRId64, static_cast<int64_t>(seconds) * 1000);
}
void put_words(mon_value *out, const char *words) {
    strlcpy(out->text, words, sizeof out->text);
}

#define VALUE(statement)                                                                                     \
    [](const mon_subject *s, mon_value *out) {                                                               \
        (void)s;                                                                                             \
        statement;                                                                                           \
    }

const mon_dump global_dump = {WCCP_DUMP_GLOBAL_BYTES,
                              [](csys_display_buf *b, uint8_t) { return wccp_print_global(b); }, false};
const mon_dump all_dump = {WCCP_DUMP_ALL_BYTES,
                           [](csys_display_buf *b, uint8_t) { return wccp_print_all_wccp_info(b); }, false};
const mon_dump group_dump = {
    WCCP_DUMP_GROUP_BYTES, [](csys_display_buf *b, uint8_t g) { return wccp_print_service_grp(b, g); }, true};
const mon_dump assignment_dump = {
    WCCP_DUMP_ASSIGNMENT_BYTES,
    [](csys_display_buf *b, uint8_t g) { return wccp_print_service_grp_assignment_details(g, b); }, false};
const mon_dump owners_dump = {WCCP_OWNERS_BYTES,
                              [](csys_display_buf *b, uint8_t g) { return wccp_print_owners(g, b); }, false};

// First match wins.
const mon_node mon_nodes[] = {
    {NODE_WCCPD_STATE "/proto_ver", bn_type_str, VALUE(put_words(out, "2.0")), nullptr},
    {NODE_WCCPD_VERSION, bn_type_str, VALUE(put_words(out, wccp_version())), nullptr},
    {NODE_GROUP_STATE "/*/oper", bn_type_str, VALUE(put_words(out, s->group_info.oper)), nullptr},
    {NODE_GROUP_STATE "/*/uptime", bn_type_duration_ms, VALUE(put_seconds_as_ms(out, s->group_info.uptime)),
     nullptr},
    {NODE_GROUP_STATE "/*/app_id", bn_type_str, VALUE(address_text(s->group_info.appliance_ipa, out)),
     nullptr},
    {NODE_GROUP_STATE "/*/num_routers", bn_type_uint32, VALUE(put_number(out, s->group_info.num_routers)),
     nullptr},
    {NODE_GROUP_STATE "/*/num_appliances", bn_type_uint32,
     VALUE(put_number(out, s->group_info.num_appliances)), nullptr},
    {NODE_GROUP_STATE "/*/router/*/state", bn_type_str, VALUE(put_words(out, s->router.state)), nullptr},
    {NODE_GROUP_STATE "/*/router/*/fwd_method", bn_type_str, VALUE(put_words(out, s->router.fwd)), nullptr},
    {NODE_GROUP_STATE "/*/router/*/assign_method", bn_type_str, VALUE(put_words(out, s->router.assign)),
     nullptr},
    {NODE_GROUP_STATE "/*/router/*/ret_method", bn_type_str, VALUE(put_words(out, s->router.ret)), nullptr},
    {NODE_GROUP_STATE "/*/router/*/id", bn_type_ipv4addr, VALUE(address_text(s->router.router_id, out)),
     nullptr},
    {NODE_GROUP_STATE "/*/router/*/ipaddr", bn_type_ipv4addr, VALUE(address_text(s->router.src_ipa, out)),
     nullptr},
    {NODE_GROUP_STATE "/*/router/*/conn_time", bn_type_duration_ms,
     VALUE(put_seconds_as_ms(out, s->router.conn_time)), nullptr},
    {NODE_GROUP_STATE "/*/router/*/appliance/*/load_dist", bn_type_uint32,
     VALUE(snprintf(out->text, sizeof out->text, "%u", s->load_percent)), nullptr},
    {NODE_GROUP_STATE "/*/appliance/*/ipaddr", bn_type_ipv4addr, VALUE(address_text(s->appliance.ipa, out)),
     nullptr},
    {NODE_GROUP_STATE "/*/appliance/*/weight", bn_type_uint32, VALUE(put_number(out, s->appliance.weight)),
     nullptr},
    {NODE_GROUP_STATE "/*/debug", bn_type_str, nullptr, &group_dump},
    {NODE_GROUP_STATE "/*/assignment", bn_type_str, nullptr, &assignment_dump},
    {NODE_GROUP_STATE "/*/owners", bn_type_str, nullptr, &owners_dump},
    {NODE_WCCPD_STATE "/debug_global", bn_type_str, nullptr, &global_dump},
    {NODE_WCCPD_STATE "/debug_all", bn_type_str, nullptr, &all_dump},
    {NODE_WCCPD_STATE "/is_alive", bn_type_str,
     VALUE(put_words(out, lc_enum_to_string(wccpd_status_table, m_daemon_status))), nullptr},
};

// Nodes that exist so that what iterate finds can be listed; they answer with their own last part.
const char *const wildcard_nodes[] = {
    NODE_GROUP_STATE "/*",
    NODE_GROUP_STATE "/*/router/*",
    NODE_GROUP_STATE "/*/router/*/appliance/*",
};

bool matches(const mon_subject *subject, const char *pattern) {
    return bn_binding_name_parts_pattern_match(subject->parts, 1, pattern) != 0;
}

long number_part(const mon_subject *subject, uint32_t index) {
    const char *text = tstr_array_get_str_quick(subject->parts, index);
    return text ? strtol(text, nullptr, 10) : 0;
}

lc_status append_text(const char *name, uint32_t type, const char *text, bn_binding_array *out) {
    owned_binding binding;
    CHECK_STATUS(bn_binding_new_str(&binding.pointer, name, bn_attrib_value, type, 0, text));
    CHECK_STATUS(bn_binding_array_append_takeover(out, &binding.pointer));
    return LC_OK;
}

lc_status wccpd_mon_handle_get_wildcard(const mon_subject *subject, const char *last, bn_binding_array *out) {
    CHECK_STATUS(append_text(subject->name, bn_type_str, last, out));
    return LC_OK;
}

// Asks the engine for what the name is about. `answered` stays false where there is nothing to say.
lc_status ask_engine(mon_subject *subject, bool *answered) {
    char routers[64], appliances[64], router_appliances[96];
    *answered = true;
    if (!wccpd_is_under(subject->name, NODE_GROUP_STATE))
        return LC_OK;
    subject->group = static_cast<uint8_t>(number_part(subject, GROUP_PART));
    const char *group_text = tstr_array_get_str_quick(subject->parts, GROUP_PART);
    const int group = static_cast<int>(group_text ? strtol(group_text, nullptr, 10) : 0);
    // The parents themselves count as well: a get of one finds no number after it.
    snprintf(routers, sizeof routers, "%s/%d/router", NODE_GROUP_STATE, group);
    snprintf(appliances, sizeof appliances, "%s/%d/appliance", NODE_GROUP_STATE, group);
    if (!lc_is_prefix(routers, subject->name, 0)) {
        const int status = wccp_get_grp_info(subject->group, &subject->group_info);
        if (status != 0) {
            LC_LOG(LC_LOG_ERR, "wccp_get_grp_info failed: %d", status);
            *answered = false;
            return LC_OK;
        }
    } else {
        subject->router.router_num = static_cast<uint32_t>(number_part(subject, NUMBER_PART));
        CHECK_STATUS(wccp_get_grp_router_info(subject->group, &subject->router));
        snprintf(router_appliances, sizeof router_appliances, "%s/%d/router/%d/appliance", NODE_GROUP_STATE,
                 group, static_cast<int>(subject->router.router_num));
        if (lc_is_prefix(router_appliances, subject->name, 0) &&
            !tstr_array_get_str_quick(subject->parts, ADDRESS_PART)) {
            LC_LOG(LC_LOG_ERR, "Appliance number (at 9th) not found in %s", subject->name);
            *answered = false;
            return LC_OK;
        }
    }
    if (lc_is_prefix(appliances, subject->name, 0)) {
        subject->appliance.appliance_num = static_cast<uint32_t>(number_part(subject, NUMBER_PART));
        const int status = wccp_get_grp_appliance_info(subject->group, &subject->appliance);
        if (status != 0) {
            LC_LOG(LC_LOG_ERR, "wccp_get_grp_appliance_info failed: status=%d", status);
            *answered = false;
        }
    }
    return LC_OK;
}

// An address that is none is nobody's: no binding, as for an appliance that the router doesn't list.
void ask_load(mon_subject *subject, bool *answered) {
    uint32_t address = 0;
    wccp_router_appliance_info info = {};
    info.group_id = subject->group;
    info.router_num = subject->router.router_num;
    int status = lc_str_to_ipv4addr(tstr_array_get_str_quick(subject->parts, ADDRESS_PART), &address);
    info.ipa = to_be32(address);
    if (status == 0)
        status = wccp_get_router_appliance_info(&info);
    if (status != 0) {
        LC_LOG(LC_LOG_ERR, "wccp_get_router_appliance_info: failed: status=%d", status);
        *answered = false;
    }
    subject->load_percent = info.load_percent;
}

struct dump_failures_logged_at {
    explicit dump_failures_logged_at(int32_t level) : before(wccp_dump_failure_level) {
        wccp_dump_failure_level = level;
    }
    ~dump_failures_logged_at() { wccp_dump_failure_level = before; }
    dump_failures_logged_at(const dump_failures_logged_at &) = delete;
    dump_failures_logged_at &operator=(const dump_failures_logged_at &) = delete;
    int32_t before;
};

lc_status append_dump(const mon_subject *subject, const mon_node *node, bool in_walk, bn_binding_array *out) {
    const mon_dump *dump = node->dump;
    owned<void, wccp_free> memory(wccp_malloc(dump->size));
    if (!memory.pointer) {
        LC_LOG(LC_LOG_ERR, "%s: malloc failed", __func__);
        return LC_OK;
    }
    csys_display_buf *buffer = csys_create_safe_display_buf_desc(memory.pointer, dump->size);
    CHECK_NULL(buffer);
    const dump_failures_logged_at level(in_walk ? LC_LOG_INFO : LC_LOG_ERR);
    if (dump->print(buffer, subject->group) != 0 && !dump->cut_text_counts)
        return LC_OK;
    CHECK_STATUS(append_text(subject->name, node->type, csys_display_buf_text(buffer), out));
    return LC_OK;
}

} // namespace

lc_status wccpd_mon_handle_get(const char *node_name, const tstr_array *name_parts, void *in_walk,
                               bn_binding_array *out) {
    LC_LOG(LC_LOG_INFO, "MonGet %s", node_name);
    if (!wccpd_is_under(node_name, NODE_WCCPD)) {
        LC_LOG(LC_LOG_INFO, "MonGet not for wccpd, bailing - %s", node_name);
        return LC_OK;
    }
    mon_subject subject = {};
    subject.name = node_name;
    subject.parts = name_parts;
    const uint32_t count = tstr_array_length_quick(name_parts);
    const char *last = count ? tstr_array_get_str_quick(name_parts, count - 1) : nullptr;
    CHECK_NULL(last);
    LC_LOG(LC_LOG_INFO, "MonGet: last_name_part=%s", last);
    for (const char *pattern : wildcard_nodes)
        if (matches(&subject, pattern)) {
            CHECK_STATUS(wccpd_mon_handle_get_wildcard(&subject, last, out));
            return LC_OK;
        }
    bool answered = false;
    CHECK_STATUS(ask_engine(&subject, &answered));
    if (!answered)
        return LC_OK;
    for (const mon_node &node : mon_nodes) {
        if (!matches(&subject, node.pattern))
            continue;
        if (node.dump) {
            CHECK_STATUS(append_dump(&subject, &node, in_walk && *static_cast<const bool *>(in_walk), out));
            return LC_OK;
        }
        if (strcmp(last, "load_dist") == 0)
            ask_load(&subject, &answered);
        if (!answered)
            return LC_OK;
        mon_value value = {};
        node.value(&subject, &value);
        CHECK_STATUS(append_text(node_name, node.type, value.text, out));
        return LC_OK;
    }
    return LC_OK;
}

namespace {

lc_status append_name(tstr_array *out, const char *text) {
    owned_text copy(safe_strdup(text));
    CHECK_NULL(copy.pointer);
    CHECK_STATUS(tstr_array_append_str_takeover(out, &copy.pointer));
    return LC_OK;
}
lc_status append_number(tstr_array *out, uint32_t number) {
    char text[16];
    snprintf(text, sizeof text, "%d", static_cast<int>(number));
    CHECK_STATUS(append_name(out, text));
    return LC_OK;
}

lc_status iterate_router_appliances(const mon_subject *subject, tstr_array *out) {
    wccp_router_appliance_list list = {};
    list.group_id = static_cast<uint8_t>(number_part(subject, GROUP_PART));
    list.router_num = static_cast<uint32_t>(number_part(subject, NUMBER_PART));
    const int status = wccp_get_router_appliance_list(&list);
    if (status != 0) {
        LC_LOG(LC_LOG_ERR, "wccp_get_router_appliance_list failed: status=%d", status);
        return LC_OK;
    }
    for (uint32_t i = 0; i < list.count; i++)
        CHECK_STATUS(append_name(out, addr_text(list.ipa[i]).s));
    return LC_OK;
}

lc_status iterate_routers(const mon_subject *subject, tstr_array *out) {
    wccp_router_list list = {};
    list.group_id = static_cast<uint8_t>(number_part(subject, GROUP_PART));
    const int status = wccp_get_router_list(&list);
    if (status != 0) {
        LC_LOG(LC_LOG_ERR, "wccp_get_router_list: failed: status=%d", status);
        return LC_OK;
    }
    for (uint32_t i = 0; i < list.count; i++)
        CHECK_STATUS(append_number(out, list.router_nums[i]));
    return LC_OK;
}

lc_status iterate_groups(const mon_subject *, tstr_array *out) {
    static_assert(sizeof(wccp_grp_list) == 260);
    owned<void, wccp_free> memory(wccp_malloc(sizeof(wccp_grp_list)));
    wccp_grp_list *list = static_cast<wccp_grp_list *>(memory.pointer);
    if (!list) {
        LC_LOG(LC_LOG_ERR, "%s: malloc failed", __func__);
        return LC_OK;
    }
    const int status = wccp_get_grp_list(list);
    if (status != 0) {
        LC_LOG(LC_LOG_ERR, "wccp_get_grp_list failed: status=%d", status);
        return LC_OK;
    }
    for (uint32_t i = 0; i < list->count; i++)
        CHECK_STATUS(append_number(out, list->ids[i]));
    return LC_OK;
}

} // namespace

lc_status wccpd_mon_handle_iterate(const char *node_name, const tstr_array *name_parts, void *,
                                   tstr_array *out) {
    static const struct {
        const char *pattern;
        lc_status (*children)(const mon_subject *subject, tstr_array *out);
    } parents[] = {
        {NODE_GROUP_STATE "/*/router/*/appliance", iterate_router_appliances},
        {NODE_GROUP_STATE "/*/router", iterate_routers},
        {NODE_GROUP_STATE, iterate_groups},
    };
    LC_LOG(LC_LOG_DEBUG, "iterate %s", node_name);
    mon_subject subject = {};
    subject.name = node_name;
    subject.parts = name_parts;
    for (const auto &parent : parents)
        if (matches(&subject, parent.pattern)) {
            CHECK_STATUS(parent.children(&subject, out));
            return LC_OK;
        }
    return LC_OK;
}
