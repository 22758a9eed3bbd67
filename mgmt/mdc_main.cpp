// The client library: blocking requests by the daemon's send function, and the search of an array of bindings
// by pattern. mdc_misc.cpp answers monitoring queries and decodes change events.
#include "mgmt/mdc_main.h"

#include <cstdarg>
#include <cstdlib>

#include "mgmt/log_sync.h"
#include "mgmt/owners.h"
#include "runtime/logging.h"

struct mdc {
    mdc_send_function send;
    void *client_data;
    void *reserved_1;
    void *reserved_2;
    gcl_session *session;
};

lc_status mdc_init(mdc_send_function send, void *client_data, void *reserved_1, void *reserved_2,
                   gcl_session *session, mdc **out_handle) {
    CHECK_NULL(send);
    CHECK_NULL(out_handle);
    *out_handle = nullptr;
    mdc *handle = static_cast<mdc *>(calloc(1, sizeof *handle));
    CHECK_NULL(handle);
    *handle = {send, client_data, reserved_1, reserved_2, session};
    *out_handle = handle;
    // The log may not include this room; it is given the function instead.
    lc_log_facility_from_session = qv_read_log_facility;
    return LC_OK;
}

void mdc_free(mdc **inout_handle) {
    if (!inout_handle)
        return;
    free(*inout_handle);
    *inout_handle = nullptr;
}

namespace {

void clear_outs(uint32_t *out_code, tstring **out_message, bn_binding_array **out_bindings) {
    if (out_code)
        *out_code = 0;
    if (out_message)
        *out_message = nullptr;
    if (out_bindings)
        *out_bindings = nullptr;
}

} // namespace

lc_status mdc_send_mgmt_msg(mdc *handle, bn_request_msg *request, int keep_parts,
                            bn_binding_array **out_bindings, uint32_t *out_code, tstring **out_message) {
    clear_outs(out_code, out_message, out_bindings);
    CHECK_NULL(handle);
    CHECK_NULL(request);
    owned_response response;
    CHECK_STATUS(handle->send(handle->client_data, handle->session, request, &response.pointer));
    if (!response.pointer)
        return LC_OK;
    CHECK_STATUS(
        bn_response_get_takeover(response.pointer, out_code, out_message, keep_parts, out_bindings, nullptr));
    return LC_OK;
}

lc_status mdc_get_binding(mdc *handle, uint32_t *out_code, tstring **out_message, int keep_parts,
                          bn_binding **out_binding, const char *node_name, const char *database) {
    clear_outs(out_code, out_message, nullptr);
    CHECK_NULL(out_binding);
    *out_binding = nullptr;
    CHECK_NULL(node_name);
    owned_request request;
    CHECK_STATUS(bn_query_request_msg_create(&request.pointer, 0, database));
    CHECK_STATUS(bn_query_request_msg_append_str(request.pointer, bn_query_get, 0, node_name, nullptr));
    owned_bindings bindings;
    CHECK_STATUS(
        mdc_send_mgmt_msg(handle, request.pointer, keep_parts, &bindings.pointer, out_code, out_message));
    if (bindings.pointer)
        CHECK_STATUS(bn_binding_array_detach_binding_by_name(bindings.pointer, node_name, out_binding));
    return LC_OK;
}

lc_status mdc_get_binding_children(mdc *handle, uint32_t *out_code, tstring **out_message, int keep_parts,
                                   bn_binding_array **out_bindings, int include_self, int subtree,
                                   const char *node_name) {
    uint32_t flags = 0;
    if (subtree)
        flags |= bn_qf_subtree;
    if (include_self)
        flags |= bn_qf_include_self;
    CHECK_STATUS(mdc_get_binding_children_ex(handle, out_code, out_message, keep_parts, out_bindings, flags,
                                             node_name, nullptr, 0, nullptr));
    return LC_OK;
}

lc_status mdc_get_binding_children_ex(mdc *handle, uint32_t *out_code, tstring **out_message, int keep_parts,
                                      bn_binding_array **out_bindings, uint32_t flags, const char *node_name,
                                      const char *database, uint32_t revision_condition,
                                      uint32_t *out_revision) {
    clear_outs(out_code, out_message, out_bindings);
    if (out_revision)
        *out_revision = 0;
    CHECK_NULL(handle);
    CHECK_NULL(node_name);
    owned_request request;
    CHECK_STATUS(bn_query_request_msg_create(&request.pointer, 0, database));
    CHECK_STATUS(
        bn_query_request_msg_append_str(request.pointer, bn_query_iterate, flags, node_name, nullptr));
    CHECK_STATUS(bn_query_request_msg_set_option_cond_db_revision_id(request.pointer, revision_condition));
    owned_response response;
    CHECK_STATUS(handle->send(handle->client_data, handle->session, request.pointer, &response.pointer));
    if (!response.pointer)
        return LC_OK;
    uint32_t revision = 0;
    // Refuses a response of another type before anything is taken from it.
    CHECK_STATUS(bn_query_response_msg_get_db_revision_id(response.pointer, &revision));
    if (out_revision)
        *out_revision = revision;
    CHECK_STATUS(
        bn_response_get_takeover(response.pointer, out_code, out_message, keep_parts, out_bindings, nullptr));
    return LC_OK;
}

namespace {

lc_status append_triples(bn_request_msg *request, uint32_t count, va_list triples) {
    for (uint32_t i = 0; i < count; i++) {
        const char *name = va_arg(triples, const char *);
        // A null name ends the list early.
        if (!name)
            break;
        const uint32_t type = va_arg(triples, uint32_t);
        const char *text = va_arg(triples, const char *);
        CHECK_STATUS(bn_action_request_msg_append_new_binding(request, 0, name, type, text, nullptr));
    }
    return LC_OK;
}

} // namespace

lc_status mdc_send_action_with_bindings_str_va(mdc *handle, uint32_t *out_code, tstring **out_message,
                                               const char *action_name, uint32_t count, ...) {
    clear_outs(out_code, out_message, nullptr);
    owned_request request;
    CHECK_STATUS(bn_action_request_msg_create(&request.pointer, action_name));
    va_list triples;
    va_start(triples, count);
    const lc_status status = append_triples(request.pointer, count, triples);
    va_end(triples);
    CHECK_STATUS(status);
    CHECK_STATUS(mdc_send_mgmt_msg(handle, request.pointer, 0, nullptr, out_code, out_message));
    return LC_OK;
}

lc_status mdc_foreach_binding_prequeried(const bn_binding_array *bindings, const char *pattern,
                                         void *reserved, mdc_foreach_function callback, void *data,
                                         uint32_t *out_count) {
    if (out_count)
        *out_count = 0;
    CHECK_NULL(pattern);
    owned_tstr_array parts;
    CHECK_STATUS(bn_binding_name_to_parts(pattern, &parts.pointer, nullptr));
    CHECK_STATUS(
        mdc_foreach_binding_prequeried_parsed(bindings, parts.pointer, reserved, callback, data, out_count));
    return LC_OK;
}

namespace {

lc_status call_if_matching(const bn_binding_array *bindings, bn_binding *binding,
                           const tstr_array *pattern_parts, mdc_foreach_function callback, void *data,
                           uint32_t *matches) {
    const tstr_array *parts = nullptr;
    int absolute = 0;
    CHECK_STATUS(bn_binding_get_name_parts_const(binding, &parts, &absolute));
    owned_tstr_array split;
    if (!parts) {
        CHECK_STATUS(bn_binding_name_to_parts(bn_binding_get_name_quick(binding), &split.pointer, nullptr));
        parts = split.pointer;
    }
    int matched = 0;
    // Only the parts are compared: a relative pattern also matches absolute names.
    CHECK_STATUS(tstr_array_wildcard_match(pattern_parts, parts, &matched));
    if (!matched)
        return LC_OK;
    owned_tstring value;
    CHECK_STATUS(bn_binding_get_tstr(binding, 1, 0, nullptr, &value.pointer));
    const uint32_t count = tstr_array_length_quick(parts);
    CHECK_CONDITION(count > 0);
    const tstring *name = nullptr;
    CHECK_STATUS(bn_binding_get_name(binding, &name));
    CHECK_STATUS(callback(bindings, *matches, binding, name, parts, tstr_array_get_quick(parts, count - 1),
                          value.pointer, data));
    ++*matches;
    return LC_OK;
}

} // namespace

lc_status mdc_foreach_binding_prequeried_parsed(const bn_binding_array *bindings,
                                                const tstr_array *pattern_parts, void *,
                                                mdc_foreach_function callback, void *data,
                                                uint32_t *out_count) {
    uint32_t matches = 0;
    if (out_count)
        *out_count = 0;
    CHECK_NULL(bindings);
    CHECK_NULL(callback);
    const uint32_t count = bn_binding_array_length_quick(bindings);
    lc_status status = LC_OK;
    for (uint32_t i = 0; i < count && status == LC_OK; i++) {
        bn_binding *binding = bn_binding_array_get_quick(bindings, i);
        if (binding)
            status = call_if_matching(bindings, binding, pattern_parts, callback, data, &matches);
    }
    if (out_count)
        *out_count = matches;
    return status;
}
