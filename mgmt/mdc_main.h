// The thin layer with which a daemon queries mgmtd and reports to it, without handling messages
// itself.
//
// It doesn't touch the session: sending and waiting are done by the send function that the daemon gives to
// mdc_init, so it has no thread and no loop of its own. A handle is used by one thread. Every `out_code` and
// `out_message` may be null; they get the return code and message of the response. A non-zero return code is
// no failure of a call, and neither is a node that doesn't exist: the result is then 0 with a null out.
#pragma once

#include <cstdint>

#include "mgmt/bnode.h"
#include "mgmt/bnode_proto.h"
#include "mgmt/gcl.h"
#include "runtime/tstr_array.h"
#include "runtime/tstring.h"

struct mdc;

// On success `out_response` is the library's from then on; null means that there is nothing to report.
using mdc_send_function = lc_status (*)(void *client_data, gcl_session *session, bn_request_msg *request,
                                        bn_response_msg **out_response);
lc_status mdc_init(mdc_send_function send, void *client_data, void *reserved_1, void *reserved_2,
                   gcl_session *session, mdc **out_handle);
void mdc_free(mdc **inout_handle);

// The request stays the caller's; the outs are the caller's afterwards.
lc_status mdc_send_mgmt_msg(mdc *handle, bn_request_msg *request, int keep_parts,
                            bn_binding_array **out_bindings, uint32_t *out_code, tstring **out_message);
lc_status mdc_get_binding(mdc *handle, uint32_t *out_code, tstring **out_message, int keep_parts,
                          bn_binding **out_binding, const char *node_name, const char *database);
lc_status mdc_get_binding_children(mdc *handle, uint32_t *out_code, tstring **out_message, int keep_parts,
                                   bn_binding_array **out_bindings, int include_self, int subtree,
                                   const char *node_name);
lc_status mdc_get_binding_children_ex(mdc *handle, uint32_t *out_code, tstring **out_message, int keep_parts,
                                      bn_binding_array **out_bindings, uint32_t flags, const char *node_name,
                                      const char *database, uint32_t revision_condition,
                                      uint32_t *out_revision);
// `count` triples follow: name (const char *), type (uint32_t), value text (const char *).
lc_status mdc_send_action_with_bindings_str_va(mdc *handle, uint32_t *out_code, tstring **out_message,
                                               const char *action_name, uint32_t count, ...);

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

// Takes a configuration change event apart. Either out may be null. A deleted node is among the new
// values with the deleted mark in its flags.
lc_status mdc_event_config_change_notif_extract(bn_binding_array *bindings, bn_binding_array **out_old,
                                                bn_binding_array **out_new);

// Answers a monitoring query. `get` appends the bindings it has for exactly that name; `iterate` the last
// name parts of that node's children.
using mdc_mon_get_function = lc_status (*)(const char *node_name, const tstr_array *name_parts, void *data,
                                           bn_binding_array *out_bindings);
using mdc_mon_iterate_function = lc_status (*)(const char *node_name, const tstr_array *name_parts,
                                               void *data, tstr_array *out_names);
lc_status mdc_dispatch_mon_request(gcl_session *session, bn_request_msg *request, mdc_mon_get_function get,
                                   void *get_data, mdc_mon_iterate_function iterate, void *iterate_data);
