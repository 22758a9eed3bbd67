// Monitoring: mgmtd gets a node by name, which gives at most one binding, or iterates over a node, which
// gives the names of its children.
//
// Nothing is cached. Each request calls the engine's queries, which take the engine lock for themselves, and
// formats the answer here. Each node is a row that defines what to ask and how to format the value. The text
// nodes contain the engine's dumps, in buffers that are allocated for the request.
//
// Main thread only, and only once the daemon is ready. Router and appliance numbers are positions in a list
// at the moment of the request, and may belong to another one at the next.
#include "daemon/wccpd_monitor.h"

#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "daemon/wccpd_main.h"
#include "daemon/wccpd_mgmt.h"
#include "engine/wccp_debug_utils.h"
#include "engine/wccp_metrics.h"
#include "engine/wccp_owners.h"
#include "engine/wccp_query.h"
#include "engine/wccp_utils.h"
#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "runtime/csys.h"
#include "runtime/logging.h"
#include "runtime/version.h"

namespace {

// Indexes of parts of a node's name: below the state of the groups, and the last one below that of the
// system.
enum : uint32_t { GROUP_PART = 5, NUMBER_PART = 7, ADDRESS_PART = 9, SYSTEM_ENTRY_PART = 5 };

// A request, and what the engine has answered.
struct mon_subject {
    const char *name;
    const tstr_array *parts;
    uint8_t group;
    wccp_grp_info group_info;
    wccp_grp_router_info router;
    wccp_grp_appliance_info appliance;
    uint32_t load_percent, counter;
    wccp_reason_info reason;
    wccp_interface_info interface;
};

struct mon_value {
    char text[160];
};
struct mon_dump {
    uint32_t size; // bytes of the buffer
    int (*print)(csys_display_buf *buffer, uint8_t group);
    bool cut_text_counts; // a text that did not fit is a valid value
};
struct mon_node {
    const char *pattern;
    uint32_t type;
    void (*value)(const mon_subject *subject, mon_value *out);
    const mon_dump *dump;
    // Queries the engine for this node in particular; there is no value when `answered` becomes false.
    void (*ask)(mon_subject *subject, bool *answered) = nullptr;
};

const char *put_address(be32 address, mon_value *out) {
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

// For counters, which may exceed INT_MAX.
void put_count(mon_value *out, uint32_t number) {
    snprintf(out->text, sizeof out->text, "%u", number);
}

// An invalid address gets no binding, like an appliance that the router does not list.
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

long get_number_part(const mon_subject *subject, uint32_t index) {
    const char *text = tstr_array_get_str_quick(subject->parts, index);
    return text ? strtol(text, nullptr, 10) : 0;
}

void ask_reason(mon_subject *subject, bool *answered) {
    // The same nodes exist for each group and for packets that belong to none.
    const bool of_group = wccpd_is_under(subject->name, NODE_GROUP_STATE);
    const auto place =
        static_cast<uint32_t>(get_number_part(subject, of_group ? NUMBER_PART : SYSTEM_ENTRY_PART));
    *answered = wccp_get_reason(of_group ? subject->group : WCCP_NO_GROUP, place, &subject->reason) == 0 &&
                subject->reason.reason.code != WCCP_REASON_NONE;
}

void ask_counter(mon_subject *subject, bool *answered) {
    const char *word = tstr_array_get_str_quick(subject->parts, NUMBER_PART);
    *answered = wccp_get_counter(subject->group, word, &subject->counter) == 0;
}

void ask_interface(mon_subject *subject, bool *answered) {
    const char *name = tstr_array_get_str_quick(subject->parts, SYSTEM_ENTRY_PART);
    // One by one without a lock: interfaces are never removed, so their indexes stay valid.
    for (uint32_t i = 0; name && wccp_get_interface_info(i, &subject->interface) == 0; i++)
        if (strcmp(subject->interface.name, name) == 0)
            return;
    *answered = false;
}

#define WRITE_VALUE(statement)                                                                               \
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
const mon_dump metrics_dump = {
    WCCP_METRICS_BYTES, [](csys_display_buf *b, uint8_t g) { return wccp_print_metrics(g, b); }, false};
const mon_dump global_metrics_dump = {
    WCCP_METRICS_BYTES, [](csys_display_buf *b, uint8_t) { return wccp_print_global_metrics(b); }, false};
const mon_dump owners_dump = {WCCP_OWNERS_BYTES,
                              [](csys_display_buf *b, uint8_t g) { return wccp_print_owners(g, b); }, false};

#define REASON_NODES(root)                                                                                   \
    {root "/reason/*/code", bn_type_str,                                                                     \
     WRITE_VALUE(put_words(out, wccp_reason_word(s->reason.reason.code))), nullptr, ask_reason},             \
        {root "/reason/*/sender", bn_type_ipv4addr, WRITE_VALUE(put_address(s->reason.reason.sender, out)),  \
         nullptr, ask_reason},                                                                               \
        {root "/reason/*/source", bn_type_ipv4addr, WRITE_VALUE(put_address(s->reason.reason.source, out)),  \
         nullptr, ask_reason},                                                                               \
        {root "/reason/*/offered", bn_type_str, WRITE_VALUE(put_words(out, s->reason.reason.offered.s)),     \
         nullptr, ask_reason},                                                                               \
        {root "/reason/*/wanted", bn_type_str, WRITE_VALUE(put_words(out, s->reason.reason.wanted.s)),       \
         nullptr, ask_reason},                                                                               \
        {root "/reason/*/count", bn_type_uint32, WRITE_VALUE(put_count(out, s->reason.reason.count)),        \
         nullptr, ask_reason},                                                                               \
        {root "/reason/*/first", bn_type_duration_ms,                                                        \
         WRITE_VALUE(put_seconds_as_ms(out, s->reason.first_before)), nullptr, ask_reason},                  \
    {                                                                                                        \
        root "/reason/*/last", bn_type_duration_ms,                                                          \
            WRITE_VALUE(put_seconds_as_ms(out, s->reason.last_before)), nullptr, ask_reason                  \
    }
#define INTERFACE_NODE(node, type, value)                                                                    \
    { NODE_WCCPD_STATE "/interface/*/" node, type, WRITE_VALUE(value), nullptr, ask_interface }

// The first row whose pattern matches is used.
const mon_node mon_nodes[] = {
    {NODE_WCCPD_STATE "/proto_ver", bn_type_str, WRITE_VALUE(put_words(out, "2.0")), nullptr},
    {NODE_WCCPD_VERSION, bn_type_str, WRITE_VALUE(put_words(out, wccp_version())), nullptr},
    {NODE_GROUP_STATE "/*/oper", bn_type_str, WRITE_VALUE(put_words(out, s->group_info.oper)), nullptr},
    {NODE_GROUP_STATE "/*/uptime", bn_type_duration_ms,
     WRITE_VALUE(put_seconds_as_ms(out, s->group_info.uptime)), nullptr},
    {NODE_GROUP_STATE "/*/app_id", bn_type_str, WRITE_VALUE(put_address(s->group_info.appliance_ipa, out)),
     nullptr},
    {NODE_GROUP_STATE "/*/num_routers", bn_type_uint32,
     WRITE_VALUE(put_number(out, s->group_info.num_routers)), nullptr},
    {NODE_GROUP_STATE "/*/num_appliances", bn_type_uint32,
     WRITE_VALUE(put_number(out, s->group_info.num_appliances)), nullptr},
    {NODE_GROUP_STATE "/*/router/*/state", bn_type_str, WRITE_VALUE(put_words(out, s->router.state)),
     nullptr},
    {NODE_GROUP_STATE "/*/router/*/fwd_method", bn_type_str, WRITE_VALUE(put_words(out, s->router.fwd)),
     nullptr},
    {NODE_GROUP_STATE "/*/router/*/assign_method", bn_type_str, WRITE_VALUE(put_words(out, s->router.assign)),
     nullptr},
    {NODE_GROUP_STATE "/*/router/*/ret_method", bn_type_str, WRITE_VALUE(put_words(out, s->router.ret)),
     nullptr},
    {NODE_GROUP_STATE "/*/router/*/id", bn_type_ipv4addr, WRITE_VALUE(put_address(s->router.router_id, out)),
     nullptr},
    {NODE_GROUP_STATE "/*/router/*/ipaddr", bn_type_ipv4addr,
     WRITE_VALUE(put_address(s->router.src_ipa, out)), nullptr},
    {NODE_GROUP_STATE "/*/router/*/conn_time", bn_type_duration_ms,
     WRITE_VALUE(put_seconds_as_ms(out, s->router.conn_time)), nullptr},
    {NODE_GROUP_STATE "/*/router/*/appliance/*/load_dist", bn_type_uint32,
     WRITE_VALUE(put_count(out, s->load_percent)), nullptr, ask_load},
    {NODE_GROUP_STATE "/*/appliance/*/ipaddr", bn_type_ipv4addr,
     WRITE_VALUE(put_address(s->appliance.ipa, out)), nullptr},
    {NODE_GROUP_STATE "/*/appliance/*/weight", bn_type_uint32,
     WRITE_VALUE(put_number(out, s->appliance.weight)), nullptr},
    {NODE_GROUP_STATE "/*/debug", bn_type_str, nullptr, &group_dump},
    {NODE_GROUP_STATE "/*/assignment", bn_type_str, nullptr, &assignment_dump},
    {NODE_GROUP_STATE "/*/metric/all", bn_type_str, nullptr, &metrics_dump},
    {NODE_WCCPD_STATE "/metric/all", bn_type_str, nullptr, &global_metrics_dump},
    {NODE_GROUP_STATE "/*/owners", bn_type_str, nullptr, &owners_dump},
    {NODE_WCCPD_STATE "/debug_global", bn_type_str, nullptr, &global_dump},
    {NODE_WCCPD_STATE "/debug_all", bn_type_str, nullptr, &all_dump},
    {NODE_WCCPD_STATE "/is_alive", bn_type_str,
     WRITE_VALUE(put_words(out, lc_enum_to_string(wccpd_status_table, m_daemon_status))), nullptr},
    {NODE_GROUP_STATE "/*/since", bn_type_duration_ms,
     WRITE_VALUE(put_seconds_as_ms(out, s->group_info.since)), nullptr},
    {NODE_GROUP_STATE "/*/pending_acks", bn_type_uint32,
     WRITE_VALUE(put_count(out, s->group_info.pending_acks)), nullptr},
    {NODE_GROUP_STATE "/*/router/*/heard", bn_type_duration_ms,
     WRITE_VALUE(put_seconds_as_ms(out, s->router.heard)), nullptr},
    {NODE_GROUP_STATE "/*/counter/*", bn_type_uint32, WRITE_VALUE(put_count(out, s->counter)), nullptr,
     ask_counter},
    REASON_NODES(NODE_GROUP_STATE "/*"),
    REASON_NODES(NODE_WCCPD_STATE),
    INTERFACE_NODE("address", bn_type_ipv4addr, put_address(s->interface.ipa, out)),
    INTERFACE_NODE("link", bn_type_str, put_words(out, s->interface.link_up ? "up" : "down")),
    INTERFACE_NODE("starts", bn_type_uint32, put_count(out, s->interface.starts)),
    INTERFACE_NODE("stops", bn_type_uint32, put_count(out, s->interface.stops)),
    INTERFACE_NODE("link_downs", bn_type_uint32, put_count(out, s->interface.link_downs)),
    INTERFACE_NODE("address_changes", bn_type_uint32, put_count(out, s->interface.address_changes)),
};

// Nodes that exist only so that the children which iterate finds can be listed. Their value is their last
// name part.
const char *const wildcard_nodes[] = {
    NODE_GROUP_STATE "/*",
    NODE_GROUP_STATE "/*/router/*",
    NODE_GROUP_STATE "/*/router/*/appliance/*",
    NODE_GROUP_STATE "/*/reason/*",
    NODE_WCCPD_STATE "/reason/*",
    NODE_WCCPD_STATE "/interface/*",
};

bool name_matches(const mon_subject *subject, const char *pattern) {
    return bn_binding_name_parts_pattern_match(subject->parts, 1, pattern) != 0;
}

lc_status append_binding(const char *name, uint32_t type, const char *text, bn_binding_array *out) {
    owned_binding binding;
    CHECK_STATUS(bn_binding_new_str(&binding.pointer, name, bn_attrib_value, type, 0, text));
    CHECK_STATUS(bn_binding_array_append_takeover(out, &binding.pointer));
    return LC_OK;
}

lc_status wccpd_mon_handle_get_wildcard(const mon_subject *subject, const char *last, bn_binding_array *out) {
    CHECK_STATUS(append_binding(subject->name, bn_type_str, last, out));
    return LC_OK;
}

// Queries the engine for the group, router or appliance in the name. `answered` becomes false when there is
// none.
lc_status ask_engine(mon_subject *subject, bool *answered) {
    char routers[64], appliances[64], router_appliances[96];
    *answered = true;
    if (!wccpd_is_under(subject->name, NODE_GROUP_STATE))
        return LC_OK;
    subject->group = static_cast<uint8_t>(get_number_part(subject, GROUP_PART));
    // The number as it is in the name, for the prefixes below; the engine takes its low 8 bits.
    const char *group_text = tstr_array_get_str_quick(subject->parts, GROUP_PART);
    const int group = static_cast<int>(group_text ? strtol(group_text, nullptr, 10) : 0);
    // These are prefixes of text and therefore also match the parent nodes; the numbers are then 0.
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
        // A number that is not in the list leaves the record empty; only an unknown group is a failure.
        subject->router.router_num = static_cast<uint32_t>(get_number_part(subject, NUMBER_PART));
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
        subject->appliance.appliance_num = static_cast<uint32_t>(get_number_part(subject, NUMBER_PART));
        const int status = wccp_get_grp_appliance_info(subject->group, &subject->appliance);
        if (status != 0) {
            LC_LOG(LC_LOG_ERR, "wccp_get_grp_appliance_info failed: status=%d", status);
            *answered = false;
        }
    }
    return LC_OK;
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

lc_status append_dump(const mon_subject *subject, const mon_node *node, const wccpd_mon_request &request,
                      bn_binding_array *out) {
    const mon_dump *dump = node->dump;
    owned<void, wccp_free> memory(wccp_malloc(dump->size));
    if (!memory.pointer) {
        LC_LOG(LC_LOG_ERR, "%s: malloc failed", __func__);
        return LC_OK;
    }
    // The descriptor lies at the end of this memory and is freed with it.
    csys_display_buf *buffer = csys_create_safe_display_buf_desc(memory.pointer, dump->size);
    CHECK_NULL(buffer);
    const dump_failures_logged_at level(request.quiet     ? LC_LOG_DEBUG
                                        : request.in_walk ? LC_LOG_INFO
                                                          : LC_LOG_ERR); // for this dump
    // A dump that did not fit has no value, except where the beginning is useful by itself.
    if (dump->print(buffer, subject->group) != 0 && !dump->cut_text_counts)
        return LC_OK;
    CHECK_STATUS(append_binding(subject->name, node->type, csys_display_buf_text(buffer), out));
    return LC_OK;
}

} // namespace

lc_status wccpd_mon_handle_get(const char *node_name, const tstr_array *name_parts, void *data,
                               bn_binding_array *out) {
    const wccpd_mon_request request =
        data ? *static_cast<const wccpd_mon_request *>(data) : wccpd_mon_request{};
    const int32_t level = request.quiet ? LC_LOG_DEBUG : LC_LOG_INFO;
    LC_LOG(level, "MonGet %s", node_name);
    if (!wccpd_is_under(node_name, NODE_WCCPD)) {
        LC_LOG(level, "MonGet not for wccpd, bailing - %s", node_name);
        return LC_OK;
    }
    mon_subject subject = {};
    subject.name = node_name;
    subject.parts = name_parts;
    const uint32_t count = tstr_array_length_quick(name_parts);
    const char *last = count ? tstr_array_get_str_quick(name_parts, count - 1) : nullptr;
    CHECK_NULL(last);
    LC_LOG(level, "MonGet: last_name_part=%s", last);
    // Answered without the engine: such a node exists for every number or name.
    for (const char *pattern : wildcard_nodes)
        if (name_matches(&subject, pattern)) {
            CHECK_STATUS(wccpd_mon_handle_get_wildcard(&subject, last, out));
            return LC_OK;
        }
    bool answered = false;
    CHECK_STATUS(ask_engine(&subject, &answered));
    if (!answered)
        return LC_OK;
    // The general answer is there; some rows ask one more question.
    for (const mon_node &node : mon_nodes) {
        if (!name_matches(&subject, node.pattern))
            continue;
        if (node.dump) {
            CHECK_STATUS(append_dump(&subject, &node, request, out));
            return LC_OK;
        }
        if (node.ask)
            node.ask(&subject, &answered);
        if (!answered)
            return LC_OK;
        mon_value value = {};
        node.value(&subject, &value);
        CHECK_STATUS(append_binding(node_name, node.type, value.text, out));
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
    list.group_id = static_cast<uint8_t>(get_number_part(subject, GROUP_PART));
    list.router_num = static_cast<uint32_t>(get_number_part(subject, NUMBER_PART));
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
    list.group_id = static_cast<uint8_t>(get_number_part(subject, GROUP_PART));
    const int status = wccp_get_router_list(&list);
    if (status != 0) {
        LC_LOG(LC_LOG_ERR, "wccp_get_router_list: failed: status=%d", status);
        return LC_OK;
    }
    for (uint32_t i = 0; i < list.count; i++)
        CHECK_STATUS(append_number(out, list.router_nums[i]));
    return LC_OK;
}

lc_status append_reasons(int group, tstr_array *out) {
    wccp_reason_list list = {};
    (void)wccp_get_reason_list(group, &list); // a group that has been deleted has none
    for (uint32_t i = 0; i < list.count; i++)
        CHECK_STATUS(append_number(out, list.places[i]));
    return LC_OK;
}
lc_status iterate_group_reasons(const mon_subject *subject, tstr_array *out) {
    return append_reasons(static_cast<uint8_t>(get_number_part(subject, GROUP_PART)), out);
}
lc_status iterate_other_reasons(const mon_subject *, tstr_array *out) {
    return append_reasons(WCCP_NO_GROUP, out);
}

lc_status iterate_counters(const mon_subject *, tstr_array *out) {
    // All groups have the same counters.
    for (uint32_t i = 0; wccp_counter_word(i); i++)
        CHECK_STATUS(append_name(out, wccp_counter_word(i)));
    return LC_OK;
}

lc_status iterate_interfaces(const mon_subject *, tstr_array *out) {
    wccp_interface_info info;
    for (uint32_t i = 0; wccp_get_interface_info(i, &info) == 0; i++)
        CHECK_STATUS(append_name(out, info.name));
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
        {NODE_GROUP_STATE "/*/reason", iterate_group_reasons},
        {NODE_GROUP_STATE "/*/counter", iterate_counters},
        {NODE_WCCPD_STATE "/reason", iterate_other_reasons},
        {NODE_WCCPD_STATE "/interface", iterate_interfaces},
    };
    LC_LOG(LC_LOG_DEBUG, "iterate %s", node_name);
    mon_subject subject = {};
    subject.name = node_name;
    subject.parts = name_parts;
    for (const auto &parent : parents)
        if (name_matches(&subject, parent.pattern)) {
            CHECK_STATUS(parent.children(&subject, out));
            return LC_OK;
        }
    return LC_OK;
}
