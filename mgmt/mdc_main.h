// The client library: how a daemon queries mgmtd, carries out actions, follows changes of the configuration
// and answers monitoring queries, without handling messages itself.
//
// A handle sends requests by the function that is given to mdc_init, which waits for the answer
// (mgmt_client_request); the library has no thread, no loop and no lock. A handle is used by one thread.
// `out_code` and `out_message` may be null; they get the return code and message of the response. A return
// code that isn't 0 is not a failure of the call, nor is a node that doesn't exist: the result is 0, and the
// out is null. Results are the caller's.
#pragma once

#include <cstdint>

#include "mgmt/bnode.h"
#include "mgmt/bnode_proto.h"
#include "mgmt/gcl.h"
#include "runtime/tstr_array.h"
#include "runtime/tstring.h"

struct mdc;

// Sends a request and waits for the answer. The response belongs to the library; null means that there is
// none.
using mdc_send_function = lc_status (*)(void *client_data, gcl_session *session, bn_request_msg *request,
                                        bn_response_msg **out_response);
lc_status mdc_init(mdc_send_function send, void *client_data, void *reserved_1, void *reserved_2,
                   gcl_session *session, mdc **out_handle);
void mdc_free(mdc **inout_handle);

// Sends any request; it stays the caller's. `keep_parts`: the bindings get the parts of their names.
lc_status mdc_send_mgmt_msg(mdc *handle, bn_request_msg *request, int keep_parts,
                            bn_binding_array **out_bindings, uint32_t *out_code, tstring **out_message);
// One node. `database` may be null.
lc_status mdc_get_binding(mdc *handle, uint32_t *out_code, tstring **out_message, int keep_parts,
                          bn_binding **out_binding, const char *node_name, const char *database);
// The children of a node, with `include_self` also the node, with `subtree` everything below it. `flags` are
// bn_qf_...
lc_status mdc_get_binding_children(mdc *handle, uint32_t *out_code, tstring **out_message, int keep_parts,
                                   bn_binding_array **out_bindings, int include_self, int subtree,
                                   const char *node_name);
lc_status mdc_get_binding_children_ex(mdc *handle, uint32_t *out_code, tstring **out_message, int keep_parts,
                                      bn_binding_array **out_bindings, uint32_t flags, const char *node_name,
                                      const char *database, uint32_t revision_condition,
                                      uint32_t *out_revision);
// Carries out an action. `count` triples follow: name (const char *), type (uint32_t), value as text (const
// char *).
lc_status mdc_send_action_with_bindings_str_va(mdc *handle, uint32_t *out_code, tstring **out_message,
                                               const char *action_name, uint32_t count, ...);

// Calls a function for each binding whose name matches the pattern, in the order of the array; `match_index`
// counts the matches from 0. A failure ends it and is returned. `out_count`, which may be null, is the number
// of calls that returned 0, also after a failure.
using mdc_foreach_function = lc_status (*)(const bn_binding_array *bindings, uint32_t match_index,
                                           bn_binding *binding, const tstring *name,
                                           const tstr_array *name_parts, const tstring *last_name_part,
                                           const tstring *value, void *data);
lc_status mdc_foreach_binding_prequeried(const bn_binding_array *bindings, const char *pattern,
                                         void *reserved, mdc_foreach_function callback, void *data,
                                         uint32_t *out_count);
lc_status mdc_foreach_binding_prequeried_parsed(const bn_binding_array *bindings,
                                                const tstr_array *pattern_parts, void *reserved,
                                                mdc_foreach_function callback, void *data,
                                                uint32_t *out_count);

// Extracts the old and the new values from the bindings of a configuration change event, and sorts these
// bindings. Either out may be null. A deleted node is also among the new values, with bn_flag_deleted and
// without a value. Both outs are null after a failure.
lc_status mdc_event_config_change_notif_extract(bn_binding_array *bindings, bn_binding_array **out_old,
                                                bn_binding_array **out_new);

// Answers a monitoring query on a session. `get` appends the bindings of the node with exactly this name,
// `iterate` the last name parts of its children; both may append nothing. Called in the session's callback,
// with its locks held. After a failure no answer is sent. An answer that is larger than a frame is replaced
// by LC_NO_BUFFER_SPACE and BN_TOO_LARGE.
using mdc_mon_get_function = lc_status (*)(const char *node_name, const tstr_array *name_parts, void *data,
                                           bn_binding_array *out_bindings);
using mdc_mon_iterate_function = lc_status (*)(const char *node_name, const tstr_array *name_parts,
                                               void *data, tstr_array *out_names);
lc_status mdc_dispatch_mon_request(gcl_session *session, bn_request_msg *request, mdc_mon_get_function get,
                                   void *get_data, mdc_mon_iterate_function iterate, void *iterate_data);
