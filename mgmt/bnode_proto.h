// Management messages: their records, how they are built, read and sent on a session, and the callbacks that
// receive them.
//
// A request has an ordered list of nodes, each with a binding; a response has the bindings of the answer. On
// the wire a message is the body of a frame of protocol 2, "bnode" (docs/mgmtd.md describes the messages,
// gcl_wire.h the frame).
//
// Messages have no lock and are used by one thread at a time. The functions that send take the locks of the
// session's instance and of the session. Except in the _takeover functions arguments stay the caller's;
// results are the caller's. A message of the wrong type is LC_ASSERTION, null arguments are LC_NULL.
#pragma once

#include <cstdint>

#include "mgmt/bnode.h"
#include "mgmt/gcl.h"
#include "runtime/tbuffer.h"
#include "runtime/tstring.h"
#include "runtime/typed_arrays.h"

// Message types, in the message header and, with the same number, in the frame header. Even ones are
// responses.
enum : uint16_t {
    bn_msg_none = 0,
    bn_msg_query_request = 1,
    bn_msg_query_response = 2,
    bn_msg_set_request = 3,
    bn_msg_set_response = 4,
    bn_msg_action_request = 5,
    bn_msg_action_response = 6,
    bn_msg_event = 7,
    bn_msg_event_ack = 8,
};
enum : uint32_t { bn_query_none = 0, bn_query_get = 1, bn_query_iterate = 2, bn_query_registration_info = 3 };
enum : uint32_t {
    bn_set_none = 0,
    bn_set_create = 1,
    bn_set_delete = 2,
    bn_set_reset = 3,
    bn_set_modify = 4,
    bn_set_reparent = 5,
};
// Query flags of a node of sub-operation "iterate". Without any, the direct children of the node are
// reported.
enum : uint32_t {
    bn_qf_walk_only = 0x200,     // nodes are visited, but not reported
    bn_qf_subtree = 0x1000,      // everything below the node
    bn_qf_include_self = 0x2000, // also the node itself
    bn_qf_leaves_only = 0x4000,  // only nodes without children
    bn_qf_quiet = 0x8000,        // the query is repeated all the time: daemons log it at debug level only
};
// Commit flags of a set request. The request's text may be the purpose of the commit, and its number the
// revision that the change was made for: mgmtd refuses it if the configuration has another revision by then.
// 0 is any.
enum : uint32_t {
    bn_cf_check_only = 0x1, // report what the commit would do, and change nothing
    bn_cf_ends_wait = 0x2,  // accepted even while another commit waits to be confirmed, and ends that wait
};
// The bits from here up: minutes within which the commit has to be confirmed, or it is undone. 0: no
// confirmation.
constexpr uint32_t bn_cf_minutes_shift = 16;
constexpr uint16_t BN_PROTO = 2;
constexpr uint32_t BN_FRAME_HEADER_BYTES = 32;
// The message of the LC_NO_BUFFER_SPACE that a query gets if its answer is larger than a frame.
constexpr const char *BN_TOO_LARGE = "The answer is larger than a message: ask for less";

extern const lc_enum_entry bn_msg_type_table[];
extern const lc_enum_entry bn_query_subop_table[];
extern const lc_enum_entry bn_set_subop_table[];

struct bn_block; // bnode_block.h
struct bn_request_node {
    uint32_t node_id;
    bn_binding *binding; // owned
    uint32_t msg_type;
    uint32_t subop; // query and set
    uint32_t flags;
    uint32_t placed; // part of the message's block
    tstring *source; // set, "reparent" only; owned
    tstring *target;
};
struct bn_response_node {
    uint32_t node_id;
    bn_binding *binding; // owned
    uint32_t msg_type;
    uint32_t placed; // part of the message's block
};
TYPED_ARRAY_DECLARE(bn_request_per_node_array, bn_request_node *)
TYPED_ARRAY_DECLARE(bn_response_per_node_array, bn_response_node *)

struct bn_request_msg {
    uint16_t service_id;
    uint16_t msg_type;
    uint32_t length;
    uint32_t msg_id;
    uint32_t transaction_id;
    tstring *audit_user; // who caused the request; or null
    bn_request_per_node_array *nodes;
    bn_block *block;       // contains the nodes of a received message; or null
    uint32_t flags;        // query: flags; set: commit flags
    tstring *text;         // query: database name; set: text; action: its name; event: its name
    uint32_t number;       // query: revision id condition; set: number
    uint32_t next_node_id; // starts at 1000
};
struct bn_response_msg {
    uint16_t service_id;
    uint16_t msg_type;
    uint32_t length;
    uint32_t msg_id;
    uint32_t transaction_id;
    uint32_t response_to;
    uint32_t return_code;
    tstring *return_message;
    bn_response_per_node_array *nodes;
    bn_block *block;         // as for a request
    uint32_t db_revision_id; // query and set responses
};

// The fields of a request's node besides its binding.
struct bn_node_info {
    uint32_t subop;
    uint32_t flags;
};

// The type of the response to a request; 0, logged, for another type.
uint16_t bn_request_msg_response_msg_type(uint16_t request_type);

// --- Building requests. Nodes get the node ids 1000, 1001 and so on; `out_node_id` may be null. Node ids
// that are passed are ignored.
lc_status bn_request_msg_create(bn_request_msg **out, uint16_t type);
lc_status bn_query_request_msg_create(bn_request_msg **out, uint32_t flags, const char *database);
lc_status bn_set_request_msg_create(bn_request_msg **out, uint32_t commit_flags);
lc_status bn_action_request_msg_create(bn_request_msg **out, const char *action_name);
lc_status bn_event_request_msg_create(bn_request_msg **out, const char *event_name);
lc_status bn_query_request_msg_append_str(bn_request_msg *msg, uint32_t subop, uint32_t flags,
                                          const char *node_name, uint32_t *out_node_id);
// With attributes, a registration_info node has copies of them, and another node asks for the attributes of
// these ids.
lc_status bn_query_request_msg_append_with_attribs(bn_request_msg *msg, uint32_t subop, uint32_t flags,
                                                   const char *node_name, const bn_attrib_array *attributes,
                                                   uint32_t *out_node_id);
lc_status bn_set_request_msg_append_binding_takeover(bn_request_msg *msg, uint32_t subop, uint32_t flags,
                                                     bn_binding **inout_binding, uint32_t *out_node_id);
lc_status bn_query_request_msg_set_option_cond_db_revision_id(bn_request_msg *msg, uint32_t revision);
lc_status bn_query_request_msg_get_option_cond_db_revision_id(const bn_request_msg *msg,
                                                              uint32_t *out_revision);
// A text that can't be converted gives a binding with bn_flag_invalid.
lc_status bn_action_request_msg_append_new_binding(bn_request_msg *msg, uint32_t node_id, const char *name,
                                                   uint32_t type, const char *text, uint32_t *out_node_id);
lc_status bn_event_request_msg_append_new_binding(bn_request_msg *msg, uint32_t node_id, const char *name,
                                                  uint32_t type, const char *text, uint32_t *out_node_id);
lc_status bn_action_request_msg_append_binding_takeover(bn_request_msg *msg, uint32_t node_id,
                                                        bn_binding **inout_binding, uint32_t *out_node_id);
lc_status bn_event_request_msg_append_binding_takeover(bn_request_msg *msg, uint32_t node_id,
                                                       bn_binding **inout_binding, uint32_t *out_node_id);
lc_status bn_action_request_msg_get_action_name(const bn_request_msg *msg, tstring **out);
lc_status bn_event_request_msg_get_event_name(const bn_request_msg *msg, tstring **out);
lc_status bn_request_set_transaction_id(bn_request_msg *msg, uint32_t transaction_id);
lc_status bn_request_msg_free(bn_request_msg **inout);

// --- Building responses. The return message may be null.
lc_status bn_response_msg_create(bn_response_msg **out, uint16_t type, uint32_t response_to,
                                 uint32_t return_code, const char *message);
lc_status bn_query_response_msg_create(bn_response_msg **out, uint32_t response_to, uint32_t return_code,
                                       const char *message);
lc_status bn_action_response_msg_create(bn_response_msg **out, uint32_t response_to, uint32_t return_code,
                                        const char *message);
lc_status bn_response_msg_append_binding_takeover(bn_response_msg *msg, bn_binding **inout_binding,
                                                  uint32_t node_id);
lc_status bn_query_response_msg_append_binding_takeover(bn_response_msg *msg, bn_binding **inout_binding,
                                                        uint32_t node_id);
lc_status bn_response_msg_dup(const bn_response_msg *msg, bn_response_msg **out);
lc_status bn_response_msg_free(bn_response_msg **inout);

// --- Reading. Outs may be null. `keep_parts`: the bindings get the parts of their names. _get copies the
// bindings, _get_takeover moves them out of the message.
int32_t bn_request_get_msg_id(const bn_request_msg *msg); // -1 for null
lc_status bn_request_get(const bn_request_msg *msg, uint16_t *out_type, const void **out_body, int keep_parts,
                         bn_binding_array **out_bindings, uint32_array **out_node_ids,
                         bn_node_info **out_node_info); // an array, to be freed with free()
lc_status bn_response_get_msg_ids(const bn_response_msg *msg, uint32_t *out_response_to,
                                  uint32_t *out_msg_id);
lc_status bn_response_get_takeover(bn_response_msg *msg, uint32_t *out_code, tstring **out_message,
                                   int keep_parts, bn_binding_array **out_bindings,
                                   uint32_array **out_node_ids);
lc_status bn_response_get(const bn_response_msg *msg, uint32_t *out_code, tstring **out_message,
                          int keep_parts, bn_binding_array **out_bindings, uint32_array **out_node_ids);
lc_status bn_query_response_msg_get_db_revision_id(const bn_response_msg *msg, uint32_t *out_revision);

// --- Sending. On a session that isn't connected a message is dropped with result 0. A response that doesn't
// fit in a frame or in the session's queue is replaced by one of the same type without bindings, with the
// code LC_NO_BUFFER_SPACE and a message. A request that doesn't fit is LC_NO_BUFFER_SPACE, or LC_CANCELLED if
// the queue is full.
lc_status bn_request_msg_send(gcl_session *session, bn_request_msg *msg);
lc_status bn_response_msg_send(gcl_session *session, bn_response_msg *msg);
// To and from bytes; `header_bytes` zero bytes come before the message, and `offset` is where it begins. A
// message that is cut or malformed is LC_ASSERTION or LC_NO_BUFFER_SPACE, or LC_GENERIC for an attribute, and
// is not made.
lc_status bn_request_msg_serialize(bn_request_msg *msg, uint32_t header_bytes, tbuffer **out);
lc_status bn_response_msg_serialize(bn_response_msg *msg, uint32_t header_bytes, tbuffer **out);
lc_status bn_request_msg_deserialize(const tbuffer *buffer, uint32_t offset, bn_request_msg **out);
lc_status bn_response_msg_deserialize(const tbuffer *buffer, uint32_t offset, bn_response_msg **out);
// Log a message, at `level` if it is enabled; -1 does nothing.
void bn_request_msg_dump(gcl_session *session, const bn_request_msg *msg, int32_t level, const char *title);
void bn_response_msg_dump(gcl_session *session, const bn_response_msg *msg, int32_t level, const char *title);

// --- Callbacks. A callback is called for each received message of its type, with the locks of the instance
// and of the session held. It may send on the session, and run the loop to wait for an answer. The message is
// freed when it returns; to keep it, copy it. The status that it returns is ignored.
//
// A session copies the instance's callbacks when it is made. The setters are
// bn_set_global_callback_query_request_msg, bn_set_session_callback_query_request_msg and so on.
using bn_request_callback = lc_status (*)(gcl_session *session, bn_request_msg *msg, void *data);
using bn_response_callback = lc_status (*)(gcl_session *session, bn_response_msg *msg, void *data);
#define BN_CALLBACK_SETTERS(kind, type)                                                                      \
    lc_status bn_set_global_callback_##kind##_msg(gcl *instance, type callback, void *data);                 \
    lc_status bn_set_session_callback_##kind##_msg(gcl_session *session, type callback, void *data);
BN_CALLBACK_SETTERS(query_request, bn_request_callback)
BN_CALLBACK_SETTERS(query_response, bn_response_callback)
BN_CALLBACK_SETTERS(set_request, bn_request_callback)
BN_CALLBACK_SETTERS(set_response, bn_response_callback)
BN_CALLBACK_SETTERS(action_request, bn_request_callback)
BN_CALLBACK_SETTERS(action_response, bn_response_callback)
BN_CALLBACK_SETTERS(event_request, bn_request_callback)
BN_CALLBACK_SETTERS(event_response, bn_response_callback)
#undef BN_CALLBACK_SETTERS
