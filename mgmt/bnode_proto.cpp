// Messages in memory: making, filling, reading and freeing requests and responses. bnode_proto_wire.cpp
// converts them to bytes and back, bnode_proto_session.cpp sends and receives them, bnode_proto_dump.cpp logs
// them.
//
// The nodes of a message that was built here are allocated one by one. Those of a received message, and all
// copies, are in one block (bnode_block.h). The same functions work on both: a node knows whether it is part
// of a block.
#include "mgmt/bnode_proto.h"

#include <cstdlib>
#include <cstring>

#include "mgmt/bnode_block.h"
#include "mgmt/bnode_proto_arrays.h"
#include "runtime/logging.h"

constexpr uint32_t FIRST_NODE_ID = 1000;

const lc_enum_entry bn_msg_type_table[] = {
    {bn_msg_none, "none"},
    {bn_msg_query_request, "query_request"},
    {bn_msg_query_response, "query_response"},
    {bn_msg_set_request, "set_request"},
    {bn_msg_set_response, "set_response"},
    {bn_msg_action_request, "action_request"},
    {bn_msg_action_response, "action_response"},
    {bn_msg_event, "event"},
    {bn_msg_event_ack, "event_ack"},
    {0, nullptr},
};
const lc_enum_entry bn_query_subop_table[] = {
    {bn_query_none, "none"},
    {bn_query_get, "get"},
    {bn_query_iterate, "iterate"},
    {bn_query_registration_info, "registration_info"},
    {0, nullptr},
};
const lc_enum_entry bn_set_subop_table[] = {
    {bn_set_none, "invalid_NONE"},
    {bn_set_create, "create"},
    {bn_set_delete, "delete"},
    {bn_set_reset, "reset"},
    {bn_set_modify, "modify"},
    {bn_set_reparent, "reparent"},
    {0, nullptr},
};

uint16_t bn_request_msg_response_msg_type(uint16_t request_type) {
    switch (request_type) {
    case bn_msg_query_request:
    case bn_msg_set_request:
    case bn_msg_action_request:
    case bn_msg_event:
        // The response to a type always has the next number.
        return static_cast<uint16_t>(request_type + 1);
    default:
        LC_LOG(LC_LOG_WARNING, "Request message had unrecognized message type: %d", request_type);
        return 0;
    }
}

// --- Nodes

void bn_request_node_free(bn_request_node *node) {
    if (!node)
        return;
    (void)bn_binding_free(&node->binding);
    // Both are null except in a set request that moves a node.
    ts_free(&node->source);
    ts_free(&node->target);
    if (!node->placed)
        free(node);
}
void bn_response_node_free(bn_response_node *node) {
    if (!node)
        return;
    (void)bn_binding_free(&node->binding);
    if (!node->placed)
        free(node);
}

namespace {

void free_request_node(void *node) {
    bn_request_node_free(static_cast<bn_request_node *>(node));
}
void free_response_node(void *node) {
    bn_response_node_free(static_cast<bn_response_node *>(node));
}
void set_request_node_options(array_options *options) {
    options->free = free_request_node;
}
void set_response_node_options(array_options *options) {
    options->free = free_response_node;
}

} // namespace

TYPED_ARRAY_DEFINE(bn_request_per_node_array, bn_request_node *, set_request_node_options)
TYPED_ARRAY_DEFINE(bn_response_per_node_array, bn_response_node *, set_response_node_options)

namespace {

// Options for an array that will have `count` elements.
array_options array_options_for(uint32_t count, void (*fill)(array_options *)) {
    array_options options = {};
    (void)array_options_get_defaults(&options);
    fill(&options);
    options.initial_size = count ? count : 1;
    return options;
}

} // namespace

lc_status bn_request_nodes_new(bn_request_per_node_array **out, uint32_t count) {
    const array_options options = array_options_for(count, set_request_node_options);
    return bn_request_per_node_array_new_full(out, &options);
}
lc_status bn_response_nodes_new(bn_response_per_node_array **out, uint32_t count) {
    const array_options options = array_options_for(count, set_response_node_options);
    return bn_response_per_node_array_new_full(out, &options);
}

// --- Requests

lc_status bn_request_msg_free(bn_request_msg **inout) {
    if (!inout || !*inout)
        return LC_OK;
    ts_free(&(*inout)->audit_user);
    ts_free(&(*inout)->text);
    (void)bn_request_per_node_array_free(&(*inout)->nodes);
    // Last: the nodes, and what they contain, may be in the block.
    bn_block_release((*inout)->block);
    free(*inout);
    *inout = nullptr;
    return LC_OK;
}

lc_status bn_request_msg_new(bn_request_msg **out, uint16_t type) {
    *out = static_cast<bn_request_msg *>(calloc(1, sizeof(bn_request_msg)));
    CHECK_NULL(*out);
    (*out)->msg_type = type;
    (*out)->next_node_id = FIRST_NODE_ID;
    return LC_OK;
}
lc_status bn_request_msg_create(bn_request_msg **out, uint16_t type) {
    CHECK_NULL(out);
    *out = nullptr;
    owned_request msg;
    CHECK_STATUS(bn_request_msg_new(&msg.pointer, type));
    CHECK_STATUS(bn_request_per_node_array_new(&msg.pointer->nodes));
    *out = msg.take();
    return LC_OK;
}

namespace {

lc_status create_with_text(bn_request_msg **out, uint16_t type, const char *text) {
    CHECK_NULL(out);
    *out = nullptr;
    owned_request msg;
    CHECK_STATUS(bn_request_msg_create(&msg.pointer, type));
    if (text)
        CHECK_STATUS(ts_new_str(&msg.pointer->text, text));
    *out = msg.take();
    return LC_OK;
}

} // namespace

lc_status bn_query_request_msg_create(bn_request_msg **out, uint32_t flags, const char *database) {
    CHECK_STATUS(create_with_text(out, bn_msg_query_request, database));
    (*out)->flags = flags;
    return LC_OK;
}
lc_status bn_set_request_msg_create(bn_request_msg **out, uint32_t commit_flags) {
    CHECK_STATUS(create_with_text(out, bn_msg_set_request, nullptr));
    (*out)->flags = commit_flags;
    return LC_OK;
}
lc_status bn_action_request_msg_create(bn_request_msg **out, const char *action_name) {
    CHECK_NULL(action_name);
    CHECK_STATUS(create_with_text(out, bn_msg_action_request, action_name));
    return LC_OK;
}
lc_status bn_event_request_msg_create(bn_request_msg **out, const char *event_name) {
    CHECK_NULL(event_name);
    CHECK_STATUS(create_with_text(out, bn_msg_event, event_name));
    return LC_OK;
}

namespace {

lc_status append_node(bn_request_msg *msg, uint16_t type, uint32_t subop, uint32_t flags,
                      bn_binding **inout_binding, uint32_t *out_node_id) {
    if (out_node_id)
        *out_node_id = 0;
    CHECK_NULL(msg);
    CHECK_NULL(inout_binding);
    CHECK_NULL(*inout_binding);
    CHECK_CONDITION(msg->msg_type == type);
    owned_request_node node(static_cast<bn_request_node *>(calloc(1, sizeof(bn_request_node))));
    CHECK_NULL(node.pointer);
    node.pointer->node_id = msg->next_node_id;
    node.pointer->msg_type = type;
    node.pointer->subop = subop;
    node.pointer->flags = flags;
    node.pointer->binding = *inout_binding;
    // The node owns the binding from here on, also if it can't be appended.
    *inout_binding = nullptr;
    CHECK_STATUS(bn_request_per_node_array_append_takeover(msg->nodes, &node.pointer));
    if (out_node_id)
        *out_node_id = msg->next_node_id;
    msg->next_node_id++;
    return LC_OK;
}

} // namespace

lc_status bn_query_request_msg_append_str(bn_request_msg *msg, uint32_t subop, uint32_t flags,
                                          const char *node_name, uint32_t *out_node_id) {
    CHECK_STATUS(
        bn_query_request_msg_append_with_attribs(msg, subop, flags, node_name, nullptr, out_node_id));
    return LC_OK;
}

namespace {

// Adds an attribute without a value for each of these ids.
lc_status add_requested_attributes(bn_binding *binding, const bn_attrib_array *attributes) {
    const uint32_t count = bn_attrib_array_length_quick(attributes);
    for (uint32_t id = 0; id < count; id++)
        if (bn_attrib_array_get_quick(attributes, id))
            CHECK_STATUS(bn_binding_set_str(binding, id, bn_type_none, 0, ""));
    return LC_OK;
}

} // namespace

lc_status bn_query_request_msg_append_with_attribs(bn_request_msg *msg, uint32_t subop, uint32_t flags,
                                                   const char *node_name, const bn_attrib_array *attributes,
                                                   uint32_t *out_node_id) {
    CHECK_NULL(msg);
    CHECK_NULL(node_name);
    CHECK_CONDITION(msg->msg_type == bn_msg_query_request);
    owned_binding binding;
    // Registration info carries the values of its attributes; any other query only names the attributes that
    // it asks for.
    if (attributes && subop == bn_query_registration_info) {
        CHECK_STATUS(bn_binding_new_components(&binding.pointer, node_name, attributes));
    } else {
        CHECK_STATUS(bn_binding_new_named(&binding.pointer, node_name));
        if (attributes)
            CHECK_STATUS(add_requested_attributes(binding.pointer, attributes));
    }
    CHECK_STATUS(append_node(msg, bn_msg_query_request, subop, flags, &binding.pointer, out_node_id));
    return LC_OK;
}

lc_status bn_set_request_msg_append_binding_takeover(bn_request_msg *msg, uint32_t subop, uint32_t flags,
                                                     bn_binding **inout_binding, uint32_t *out_node_id) {
    CHECK_STATUS(append_node(msg, bn_msg_set_request, subop, flags, inout_binding, out_node_id));
    return LC_OK;
}

lc_status bn_query_request_msg_set_option_cond_db_revision_id(bn_request_msg *msg, uint32_t revision) {
    CHECK_NULL(msg);
    CHECK_CONDITION(msg->msg_type == bn_msg_query_request);
    msg->number = revision;
    return LC_OK;
}
lc_status bn_query_request_msg_get_option_cond_db_revision_id(const bn_request_msg *msg,
                                                              uint32_t *out_revision) {
    CHECK_NULL(out_revision);
    *out_revision = 0;
    CHECK_NULL(msg);
    CHECK_CONDITION(msg->msg_type == bn_msg_query_request);
    *out_revision = msg->number;
    return LC_OK;
}

lc_status bn_action_request_msg_append_binding_takeover(bn_request_msg *msg, uint32_t,
                                                        bn_binding **inout_binding, uint32_t *out_node_id) {
    CHECK_STATUS(append_node(msg, bn_msg_action_request, 0, 0, inout_binding, out_node_id));
    return LC_OK;
}
lc_status bn_event_request_msg_append_binding_takeover(bn_request_msg *msg, uint32_t,
                                                       bn_binding **inout_binding, uint32_t *out_node_id) {
    CHECK_STATUS(append_node(msg, bn_msg_event, 0, 0, inout_binding, out_node_id));
    return LC_OK;
}

namespace {

lc_status append_new_binding(bn_request_msg *msg, uint16_t msg_type, const char *name, uint32_t type,
                             const char *text, uint32_t *out_node_id) {
    owned_binding binding;
    CHECK_STATUS(bn_binding_new_str_autoinval(&binding.pointer, name, bn_attrib_value, type, 0, text));
    CHECK_STATUS(append_node(msg, msg_type, 0, 0, &binding.pointer, out_node_id));
    return LC_OK;
}

} // namespace

lc_status bn_action_request_msg_append_new_binding(bn_request_msg *msg, uint32_t, const char *name,
                                                   uint32_t type, const char *text, uint32_t *out_node_id) {
    return append_new_binding(msg, bn_msg_action_request, name, type, text, out_node_id);
}
lc_status bn_event_request_msg_append_new_binding(bn_request_msg *msg, uint32_t, const char *name,
                                                  uint32_t type, const char *text, uint32_t *out_node_id) {
    return append_new_binding(msg, bn_msg_event, name, type, text, out_node_id);
}

namespace {

lc_status copy_message_text(const bn_request_msg *msg, uint16_t type, tstring **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(msg);
    CHECK_CONDITION(msg->msg_type == type);
    if (msg->text)
        CHECK_STATUS(ts_dup(msg->text, out));
    return LC_OK;
}

} // namespace

lc_status bn_action_request_msg_get_action_name(const bn_request_msg *msg, tstring **out) {
    CHECK_STATUS(copy_message_text(msg, bn_msg_action_request, out));
    return LC_OK;
}
lc_status bn_event_request_msg_get_event_name(const bn_request_msg *msg, tstring **out) {
    CHECK_STATUS(copy_message_text(msg, bn_msg_event, out));
    return LC_OK;
}
lc_status bn_request_set_transaction_id(bn_request_msg *msg, uint32_t transaction_id) {
    CHECK_NULL(msg);
    msg->transaction_id = transaction_id;
    return LC_OK;
}

// --- Responses

lc_status bn_response_msg_free(bn_response_msg **inout) {
    if (!inout || !*inout)
        return LC_OK;
    ts_free(&(*inout)->return_message);
    (void)bn_response_per_node_array_free(&(*inout)->nodes);
    bn_block_release((*inout)->block);
    free(*inout);
    *inout = nullptr;
    return LC_OK;
}

lc_status bn_response_msg_new(bn_response_msg **out, uint16_t type) {
    *out = static_cast<bn_response_msg *>(calloc(1, sizeof(bn_response_msg)));
    CHECK_NULL(*out);
    (*out)->msg_type = type;
    return LC_OK;
}
lc_status bn_response_msg_create(bn_response_msg **out, uint16_t type, uint32_t response_to,
                                 uint32_t return_code, const char *message) {
    CHECK_NULL(out);
    *out = nullptr;
    owned_response msg;
    CHECK_STATUS(bn_response_msg_new(&msg.pointer, type));
    msg.pointer->response_to = response_to;
    msg.pointer->return_code = return_code;
    if (message)
        CHECK_STATUS(ts_new_str(&msg.pointer->return_message, message));
    CHECK_STATUS(bn_response_per_node_array_new(&msg.pointer->nodes));
    *out = msg.take();
    return LC_OK;
}
lc_status bn_query_response_msg_create(bn_response_msg **out, uint32_t response_to, uint32_t return_code,
                                       const char *message) {
    CHECK_STATUS(bn_response_msg_create(out, bn_msg_query_response, response_to, return_code, message));
    return LC_OK;
}
lc_status bn_action_response_msg_create(bn_response_msg **out, uint32_t response_to, uint32_t return_code,
                                        const char *message) {
    CHECK_STATUS(bn_response_msg_create(out, bn_msg_action_response, response_to, return_code, message));
    return LC_OK;
}

lc_status bn_response_msg_append_binding_takeover(bn_response_msg *msg, bn_binding **inout_binding,
                                                  uint32_t node_id) {
    CHECK_NULL(msg);
    CHECK_NULL(inout_binding);
    CHECK_NULL(*inout_binding);
    owned_response_node node(static_cast<bn_response_node *>(calloc(1, sizeof(bn_response_node))));
    CHECK_NULL(node.pointer);
    node.pointer->node_id = node_id;
    node.pointer->msg_type = msg->msg_type;
    node.pointer->binding = *inout_binding;
    *inout_binding = nullptr;
    CHECK_STATUS(bn_response_per_node_array_append_takeover(msg->nodes, &node.pointer));
    return LC_OK;
}
lc_status bn_query_response_msg_append_binding_takeover(bn_response_msg *msg, bn_binding **inout_binding,
                                                        uint32_t node_id) {
    CHECK_NULL(msg);
    CHECK_CONDITION(msg->msg_type == bn_msg_query_response);
    CHECK_STATUS(bn_response_msg_append_binding_takeover(msg, inout_binding, node_id));
    return LC_OK;
}

namespace {

lc_status copy_node(const bn_response_node *node, bn_block_builder *builder, bn_response_msg *out) {
    owned_response_node copy(static_cast<bn_response_node *>(bn_place_record(builder, sizeof *node)));
    CHECK_NULL(copy.pointer);
    copy.pointer->placed = true;
    copy.pointer->node_id = node->node_id;
    copy.pointer->msg_type = node->msg_type;
    if (node->binding)
        CHECK_STATUS(bn_place_copy(builder, node->binding, &copy.pointer->binding));
    // A placed copy comes without parts. If they were made already, splitting the name again is avoided.
    if (node->binding && node->binding->parts)
        CHECK_STATUS(tstr_array_duplicate(node->binding->parts, &copy.pointer->binding->parts));
    CHECK_STATUS(bn_response_per_node_array_append_takeover(out->nodes, &copy.pointer));
    return LC_OK;
}
lc_status copy_nodes(const bn_response_msg *msg, bn_response_msg *out) {
    const uint32_t count = bn_response_per_node_array_length_quick(msg->nodes);
    CHECK_STATUS(bn_response_nodes_new(&out->nodes, count));
    bn_block_size size = {};
    for (uint32_t i = 0; i < count; i++) {
        const bn_response_node *node = bn_response_per_node_array_get_quick(msg->nodes, i);
        bn_size_record(&size, sizeof *node);
        if (node->binding)
            bn_size_copy(&size, node->binding);
    }
    bn_block_builder builder;
    CHECK_STATUS(bn_block_new(&size, &builder));
    out->block = builder.block;
    for (uint32_t i = 0; i < count; i++)
        CHECK_STATUS(copy_node(bn_response_per_node_array_get_quick(msg->nodes, i), &builder, out));
    return LC_OK;
}

} // namespace

lc_status bn_response_msg_dup(const bn_response_msg *msg, bn_response_msg **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(msg);
    owned_response copy;
    CHECK_STATUS(bn_response_msg_new(&copy.pointer, msg->msg_type));
    // The pointers are cleared at once, so that a failure doesn't free what belongs to the original.
    *copy.pointer = *msg;
    copy.pointer->return_message = nullptr;
    copy.pointer->nodes = nullptr;
    copy.pointer->block = nullptr;
    if (msg->return_message)
        CHECK_STATUS(ts_dup(msg->return_message, &copy.pointer->return_message));
    CHECK_STATUS(copy_nodes(msg, copy.pointer));
    *out = copy.take();
    return LC_OK;
}

// --- Reading

int32_t bn_request_get_msg_id(const bn_request_msg *msg) {
    return msg ? static_cast<int32_t>(msg->msg_id) : -1;
}

namespace {

// Makes the parts of a name if the reader wants them, otherwise drops them. A name that has none ("" or "/")
// gets none.
lc_status make_or_drop_parts(bn_binding *binding, int keep_parts) {
    if (!keep_parts)
        return bn_binding_drop_name_parts(binding);
    const char *name = ts_str(binding->name);
    if (!binding->parts && name[binding->absolute ? 1 : 0])
        CHECK_STATUS(bn_binding_name_to_parts(name, &binding->parts, nullptr));
    return LC_OK;
}

// What is read from a message: bindings, and the ids of their nodes.
struct reading {
    owned_bindings bindings;
    owned_uint32_array ids;
};

lc_status begin_reading(reading *into, uint32_t count) {
    array_options options = {};
    CHECK_STATUS(array_options_get_defaults(&options));
    // The slots hold the ids themselves.
    options.duplicate = array_std_assign_func;
    options.initial_size = count ? count : 1;
    CHECK_STATUS(uint32_array_new_full(&into->ids.pointer, &options));
    CHECK_STATUS(bn_binding_array_new_sized(&into->bindings.pointer, count));
    return LC_OK;
}
lc_status append_to_reading(reading *into, bn_binding **inout_binding, int keep_parts) {
    CHECK_STATUS(make_or_drop_parts(*inout_binding, keep_parts));
    CHECK_STATUS(bn_binding_array_append_takeover(into->bindings.pointer, inout_binding));
    return LC_OK;
}
template <typename NodeArray, typename Get>
lc_status copy_bindings(const NodeArray *nodes, uint32_t count, Get get, int keep_parts, reading *into) {
    bn_block_size size = {};
    for (uint32_t i = 0; i < count; i++)
        if (const bn_binding *binding = get(nodes, i)->binding)
            bn_size_copy(&size, binding);
    bn_block_builder builder;
    CHECK_STATUS(bn_block_new(&size, &builder));
    // All copies are in one block, each with a reference to it; this is the maker's.
    const owned_block held(builder.block);
    for (uint32_t i = 0; i < count; i++) {
        const bn_binding *binding = get(nodes, i)->binding;
        owned_binding copy;
        if (!binding)
            continue;
        CHECK_STATUS(bn_place_copy(&builder, binding, &copy.pointer));
        if (keep_parts && binding->parts)
            CHECK_STATUS(tstr_array_duplicate(binding->parts, &copy.pointer->parts));
        CHECK_STATUS(append_to_reading(into, &copy.pointer, keep_parts));
    }
    return LC_OK;
}

} // namespace

lc_status bn_request_get(const bn_request_msg *msg, uint16_t *out_type, const void **out_body, int keep_parts,
                         bn_binding_array **out_bindings, uint32_array **out_node_ids,
                         bn_node_info **out_node_info) {
    if (out_type)
        *out_type = 0;
    if (out_body)
        *out_body = nullptr;
    if (out_bindings)
        *out_bindings = nullptr;
    if (out_node_ids)
        *out_node_ids = nullptr;
    if (out_node_info)
        *out_node_info = nullptr;
    CHECK_NULL(msg);
    // Requests have odd numbers.
    if (msg->msg_type % 2 == 0 || msg->msg_type > bn_msg_event)
        FAIL_WITH(LC_UNEXPECTED_CASE);
    const uint32_t count = bn_request_per_node_array_length_quick(msg->nodes);
    reading read;
    owned_node_info info;
    CHECK_STATUS(begin_reading(&read, count));
    info.pointer = static_cast<bn_node_info *>(calloc(count ? count : 1, sizeof(bn_node_info)));
    CHECK_NULL(info.pointer);
    for (uint32_t i = 0; i < count; i++) {
        const bn_request_node *node = bn_request_per_node_array_get_quick(msg->nodes, i);
        CHECK_STATUS(uint32_array_append(read.ids.pointer, node->node_id));
        info.pointer[i] = {node->subop, node->flags};
    }
    if (out_bindings)
        CHECK_STATUS(
            copy_bindings(msg->nodes, count, bn_request_per_node_array_get_quick, keep_parts, &read));
    if (out_type)
        *out_type = msg->msg_type;
    if (out_body)
        // The body begins with the flags.
        *out_body = &msg->flags;
    if (out_bindings)
        *out_bindings = read.bindings.take();
    if (out_node_ids)
        *out_node_ids = read.ids.take();
    if (out_node_info)
        *out_node_info = info.take();
    return LC_OK;
}

lc_status bn_response_get_msg_ids(const bn_response_msg *msg, uint32_t *out_response_to,
                                  uint32_t *out_msg_id) {
    CHECK_NULL(msg);
    if (out_response_to)
        *out_response_to = msg->response_to;
    if (out_msg_id)
        *out_msg_id = msg->msg_id;
    return LC_OK;
}

namespace {

lc_status move_bindings(const bn_response_msg *msg, uint32_t count, int keep_parts, reading *into) {
    for (uint32_t i = 0; i < count; i++) {
        bn_response_node *node = bn_response_per_node_array_get_quick(msg->nodes, i);
        if (node->binding)
            // This leaves the node without a binding; such a node is skipped wherever nodes are read.
            CHECK_STATUS(append_to_reading(into, &node->binding, keep_parts));
    }
    return LC_OK;
}

lc_status read_response(const bn_response_msg *msg, bool take, uint32_t *out_code, tstring **out_message,
                        int keep_parts, bn_binding_array **out_bindings, uint32_array **out_node_ids) {
    if (out_code)
        *out_code = 0;
    if (out_message)
        *out_message = nullptr;
    if (out_bindings)
        *out_bindings = nullptr;
    if (out_node_ids)
        *out_node_ids = nullptr;
    CHECK_NULL(msg);
    reading read;
    owned_tstring message;
    const uint32_t count =
        out_bindings || out_node_ids ? bn_response_per_node_array_length_quick(msg->nodes) : 0;
    CHECK_STATUS(begin_reading(&read, count));
    if (out_message && msg->return_message)
        CHECK_STATUS(ts_dup(msg->return_message, &message.pointer));
    for (uint32_t i = 0; i < count; i++) {
        const bn_response_node *node = bn_response_per_node_array_get_quick(msg->nodes, i);
        if (node->binding)
            CHECK_STATUS(uint32_array_append(read.ids.pointer, node->node_id));
    }
    if (out_bindings && take)
        CHECK_STATUS(move_bindings(msg, count, keep_parts, &read));
    else if (out_bindings)
        CHECK_STATUS(
            copy_bindings(msg->nodes, count, bn_response_per_node_array_get_quick, keep_parts, &read));
    if (out_code)
        *out_code = msg->return_code;
    if (out_message)
        *out_message = message.take();
    if (out_bindings)
        *out_bindings = read.bindings.take();
    if (out_node_ids)
        *out_node_ids = read.ids.take();
    return LC_OK;
}

} // namespace

lc_status bn_response_get_takeover(bn_response_msg *msg, uint32_t *out_code, tstring **out_message,
                                   int keep_parts, bn_binding_array **out_bindings,
                                   uint32_array **out_node_ids) {
    CHECK_STATUS(read_response(msg, true, out_code, out_message, keep_parts, out_bindings, out_node_ids));
    return LC_OK;
}
lc_status bn_response_get(const bn_response_msg *msg, uint32_t *out_code, tstring **out_message,
                          int keep_parts, bn_binding_array **out_bindings, uint32_array **out_node_ids) {
    CHECK_STATUS(read_response(msg, false, out_code, out_message, keep_parts, out_bindings, out_node_ids));
    return LC_OK;
}

lc_status bn_query_response_msg_get_db_revision_id(const bn_response_msg *msg, uint32_t *out_revision) {
    CHECK_NULL(out_revision);
    *out_revision = 0;
    CHECK_NULL(msg);
    CHECK_CONDITION(msg->msg_type == bn_msg_query_response);
    *out_revision = msg->db_revision_id;
    return LC_OK;
}
