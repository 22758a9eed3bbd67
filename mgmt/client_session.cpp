// The management session of a daemon; client_session.h describes how requests wait and when a wait ends.
#include "mgmt/client_session.h"

#include "mgmt/owners.h"
#include "runtime/logging.h"

lc_status mgmt_client_init(mgmt_client *client, fdic_handler close_handler) {
    loop_context *context = nullptr;
    CHECK_STATUS(lew_get_event_context(*client->loop, &context));
    CHECK_STATUS(fdic_libevent_init(context, client->bridge));
    CHECK_STATUS(fdic_init(client->interests, fdic_libevent_callback, *client->bridge));
    CHECK_STATUS(fdic_libevent_set_fd_close_handler(*client->bridge, close_handler, nullptr));
    gcl_options options;
    CHECK_STATUS(gcl_options_get_defaults(&options));
    options.ending = client->exiting;
    CHECK_STATUS(gcl_init(client->instance, &options, *client->interests));
    return LC_OK;
}

namespace {

// LC_IO_ERROR and LC_IO_CLOSED mean that mgmtd isn't running, which the caller logs.
lc_status connect_to_mgmtd(gcl_session *session) {
    const lc_status status = gcl_session_client_connect_by_provider(session, "mgmtd", 1);
    if (status == LC_IO_ERROR || status == LC_IO_CLOSED)
        CHECK_QUIET(status);
    CHECK_STATUS(status);
    return LC_OK;
}

} // namespace

lc_status mgmt_client_open(mgmt_client *client, const char *client_name, mdc_send_function msg_handler) {
    CHECK_STATUS(gcl_session_client_new(*client->instance, client_name, nullptr, 0, client->session));
    CHECK_QUIET(connect_to_mgmtd(*client->session));
    // Body protocol 2, bnode, uses service 2.
    CHECK_STATUS(gcl_session_client_open_service_blocking(*client->session, 2, 2, nullptr, 0, -1));
    CHECK_STATUS(mdc_init(msg_handler, nullptr, nullptr, nullptr, *client->session, client->handle));
    return LC_OK;
}

void mgmt_client_deinit(mgmt_client *client) {
    // In this order, since closing a session removes its interests, which the bridge passes to the loop.
    LOG_STATUS(gcl_deinit(client->instance));
    *client->session = nullptr;
    mdc_free(client->handle);
    (void)bn_response_msg_free(client->captured_response);
    LOG_STATUS(fdic_libevent_deinit(client->bridge));
    LOG_STATUS(fdic_deinit(client->interests));
}

namespace {

bool exit_has_begun(const mgmt_client *client) {
    return client->exiting->load() != 0;
}

} // namespace

lc_status mgmt_client_request(mgmt_client *client, bn_request_msg *request, bn_response_msg **out_response) {
    CHECK_NULL(request);
    CHECK_NULL(out_response);
    *out_response = nullptr;
    if (!*client->session)
        return LC_GENERIC;
    if (exit_has_begun(client))
        return LC_CANCELLED;
    CHECK_STATUS(bn_request_msg_send(*client->session, request));
    // A nested request overwrites the id that the outer one waits for, whose answer is then ignored. That is
    // a mistake of the caller, and is logged.
    if (*client->response_expected)
        (void)lc_check_condition(__func__, LC_FILE_NAME, __LINE__);
    // Setting this after sending is early enough: the answer is read by this thread, in the loop below.
    *client->response_expected = 1;
    *client->expected_request_id = bn_request_get_msg_id(request);
    (void)bn_response_msg_free(client->captured_response);
    int no_events = 0;
    lc_status status = LC_OK;
    while (*client->response_expected && status == LC_OK && !no_events && !exit_has_begun(client))
        status = lew_dispatch_once(*client->loop, &no_events, nullptr);
    *out_response = *client->captured_response;
    *client->captured_response = nullptr;
    *client->response_expected = 0;
    // An answer that has arrived is returned even if the exit has begun.
    return status == LC_OK && !*out_response && exit_has_begun(client) ? LC_CANCELLED : status;
}

lc_status mgmt_client_response(mgmt_client *client, const bn_response_msg *response) {
    uint32_t id = 0;
    CHECK_STATUS(bn_response_get_msg_ids(response, &id, nullptr));
    if (!*client->response_expected) {
        LC_LOG(LC_LOG_WARNING, "%sGot response to request %d when no response was expected; ignoring",
               client->warning_prefix, static_cast<int>(id));
        return LC_OK;
    }
    if (static_cast<int32_t>(id) != *client->expected_request_id) {
        LC_LOG(LC_LOG_WARNING,
               "%sGot response to request %d, but was expecting response to request %d; ignoring",
               client->warning_prefix, static_cast<int>(id), *client->expected_request_id);
        return LC_OK;
    }
    *client->response_expected = 0;
    // No message has the id 0; they begin at 1.
    *client->expected_request_id = 0;
    // The receive path frees the message when its callback returns.
    CHECK_STATUS(bn_response_msg_dup(response, client->captured_response));
    return LC_OK;
}
