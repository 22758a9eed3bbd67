// Logs messages at debug level: their headers and names, and the first nodes with their values. Only messages
// that are sent are logged; the receive path passes the level -1.
#include "mgmt/bnode_proto.h"
#include "mgmt/owners.h"
#include "runtime/logging.h"

constexpr uint32_t DUMPED_NODES = 50;

namespace {

struct dump_target {
    int32_t level;
    const char *title;
};
// The names of the session's ends, each with the blank before it, or empty.
struct dump_names {
    const char *local_gap, *local, *peer_gap, *peer;
};
#define DUMP(target, ...)                                                                                    \
    do {                                                                                                     \
        if (lc_log_check_level((target)->level))                                                             \
            (void)lc_log_internal(nullptr, nullptr, 0, 0, 0, (target)->level, __VA_ARGS__);                  \
    } while (0)

bool is_level_wanted(int32_t level) {
    int32_t maximum = 0;
    // The system level decides whether there is a dump at all. Each line is tested once more, since the
    // process may have a level of its own.
    return level != -1 && lc_log_get_max_log_level(&maximum) == LC_OK && maximum >= level;
}

const char *text_or_empty(const tstring *text) {
    return text ? ts_str(text) : "";
}

dump_names get_dump_names(gcl_session *session) {
    const char *local = nullptr, *peer = nullptr;
    if (session)
        (void)gcl_session_get_session_names(session, &local, &peer);
    return {local ? " " : "", local ? local : "", peer ? " " : "", peer ? peer : ""};
}

void dump_count(const dump_target *to, uint32_t count) {
    if (count > DUMPED_NODES)
        DUMP(to, "%s: num nodes: %d (but only logging the first %d)", to->title, static_cast<int>(count),
             static_cast<int>(DUMPED_NODES));
    else
        DUMP(to, "%s: num nodes: %d", to->title, static_cast<int>(count));
}

void dump_attributes(const dump_target *to, uint32_t index, const bn_binding *binding) {
    const uint32_t slots = bn_attrib_array_length_quick(binding->attributes);
    for (uint32_t id = 0; id < slots; id++) {
        const bn_attrib *attribute = bn_attrib_array_get_quick(binding->attributes, id);
        if (!attribute)
            continue;
        char *text = nullptr;
        if ((attribute->type_flags & bn_flag_no_value) == 0)
            (void)bn_attrib_get_str(attribute, nullptr, 0, nullptr, &text);
        const owned_text owner(text);
        DUMP(to, "%s: rn[%d]: attrib %d(%s) type %d(%s) value \"%.1023s\"", to->title,
             static_cast<int>(index), static_cast<int>(id),
             lc_enum_to_string_quiet(bn_attribute_id_table, static_cast<int32_t>(id)),
             static_cast<int>(attribute->type),
             lc_enum_to_string_quiet(bn_type_table, static_cast<int32_t>(attribute->type)), text ? text : "");
    }
}

void dump_node(const dump_target *to, uint32_t index, uint32_t id, const bn_binding *binding) {
    DUMP(to, "%s: rn[%d]: id %d %s", to->title, static_cast<int>(index), static_cast<int>(id),
         bn_binding_get_name_quick(binding));
}

void dump_subop(const dump_target *to, uint32_t index, const bn_request_node *node) {
    const int32_t subop = static_cast<int32_t>(node->subop);
    if (node->msg_type == bn_msg_query_request)
        DUMP(to, "%s: rn[%d]: query subop: %s flags: %08x", to->title, static_cast<int>(index),
             lc_enum_to_string_quiet(bn_query_subop_table, subop), node->flags);
    else if (node->msg_type == bn_msg_set_request)
        DUMP(to, "%s: rn[%d]: set subop: %s flags: %08x", to->title, static_cast<int>(index),
             lc_enum_to_string_quiet(bn_set_subop_table, subop), node->flags);
}

} // namespace

void bn_request_msg_dump(gcl_session *session, const bn_request_msg *msg, int32_t level, const char *title) {
    if (!msg || !is_level_wanted(level))
        return;
    const dump_target to = {level, title};
    const dump_names names = get_dump_names(session);
    DUMP(&to, "%s:%s%s%s%s%s service %d type %d (%s) msg id %d", title, names.local_gap, names.local,
         names.peer_gap, names.peer, "", msg->service_id, msg->msg_type,
         lc_enum_to_string_quiet(bn_msg_type_table, msg->msg_type), static_cast<int>(msg->msg_id));
    if (msg->msg_type == bn_msg_action_request)
        DUMP(&to, "%s: action name: %s", title, text_or_empty(msg->text));
    else if (msg->msg_type == bn_msg_event)
        DUMP(&to, "%s: event name: %s", title, text_or_empty(msg->text));
    DUMP(&to, "%s: audit userinfo string - %s", title, text_or_empty(msg->audit_user));
    const uint32_t count = bn_request_per_node_array_length_quick(msg->nodes);
    dump_count(&to, count);
    for (uint32_t i = 0; i < count && i < DUMPED_NODES; i++) {
        const bn_request_node *node = bn_request_per_node_array_get_quick(msg->nodes, i);
        if (!node || !node->binding)
            continue;
        dump_node(&to, i, node->node_id, node->binding);
        dump_subop(&to, i, node);
        dump_attributes(&to, i, node->binding);
    }
}

void bn_response_msg_dump(gcl_session *session, const bn_response_msg *msg, int32_t level,
                          const char *title) {
    if (!msg || !is_level_wanted(level))
        return;
    const dump_target to = {level, title};
    const dump_names names = get_dump_names(session);
    DUMP(&to, "%s: ret code: %d ret msg: \"%s\"", title, static_cast<int>(msg->return_code),
         text_or_empty(msg->return_message));
    DUMP(&to, "%s:%s%s%s%s%s service %d type %d (%s) msg id %d to %d", title, names.local_gap, names.local,
         names.peer_gap, names.peer, "", msg->service_id, msg->msg_type,
         lc_enum_to_string_quiet(bn_msg_type_table, msg->msg_type), static_cast<int>(msg->msg_id),
         static_cast<int>(msg->response_to));
    const uint32_t count = bn_response_per_node_array_length_quick(msg->nodes);
    dump_count(&to, count);
    for (uint32_t i = 0; i < count && i < DUMPED_NODES; i++) {
        const bn_response_node *node = bn_response_per_node_array_get_quick(msg->nodes, i);
        if (!node || !node->binding)
            continue;
        dump_node(&to, i, node->node_id, node->binding);
        dump_attributes(&to, i, node->binding);
    }
}
