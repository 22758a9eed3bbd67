// The working session with mgmtd: how it is opened, which events it subscribes to, and what each message
// does.
//
// Everything runs on the main thread inside the loop, and nests: the daemon waits for the answer to a request
// of its own by running the loop again (mgmt/client_session.h); therefore events, queries and the loss of the
// session are handled in the middle of the wait. The exceptions are configuration changes during the start,
// which are kept until the whole configuration has been read. Handlers run with the session's recursive locks
// held; the engine takes its lock after them. A handler that fails does not end the session. The session is
// never reopened: when it is lost, or when mgmtd reports the end of tunneld, the daemon exits.
#include "daemon/wccpd_mgmt.h"

#include <cstring>

#include "daemon/wccpd_config.h"
#include "daemon/wccpd_early_changes.h"
#include "daemon/wccpd_main.h"
#include "daemon/wccpd_monitor.h"
#include "engine/wccp_host.h"
#include "mgmt/client_session.h"
#include "mgmt/log_sync.h"
#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "runtime/logging.h"

gcl_session *wccpd_mgmt_session;
mdc *wccpd_mcc;
namespace {

gcl *wccpd_gcl_handle;
fdic *wccpd_fdic_handle;
fdic_libevent *wccpd_fdic_lew_handle;
int32_t wccpd_response_expected;
int32_t wccpd_expected_request_id;
bn_response_msg *wccpd_captured_response;

mgmt_client wccpd_client = {&wccpd_lwc,
                            &wccpd_mgmt_session,
                            &wccpd_mcc,
                            &wccpd_response_expected,
                            &wccpd_expected_request_id,
                            &wccpd_captured_response,
                            &wccpd_exiting,
                            "",
                            &wccpd_gcl_handle,
                            &wccpd_fdic_handle,
                            &wccpd_fdic_lew_handle};

lc_status wccpd_mgmt_msg_handler(void *, gcl_session *, bn_request_msg *request,
                                 bn_response_msg **out_response) {
    return mgmt_client_request(&wccpd_client, request, out_response);
}

lc_status wccpd_mgmt_handle_response(gcl_session *, bn_response_msg *response, void *) {
    CHECK_STATUS(mgmt_client_response(&wccpd_client, response));
    early_changes_are_answered(); // changes that arrived before the answer are contained in it
    return LC_OK;
}

lc_status wccpd_mgmt_handle_event_response(gcl_session *, bn_response_msg *, void *) {
    return LC_OK;
}

lc_status wccpd_mgmt_handle_query_request(gcl_session *session, bn_request_msg *request, void *) {
    if (m_daemon_status != WCCPD_READY) {
        LC_LOG(LC_LOG_INFO, "Discard event req because init not ready");
        return LC_OK;
    }
    // One of its nodes is enough to make the whole request a walk, or a quiet one.
    wccpd_mon_request how = {};
    for (uint32_t i = 0; i < bn_request_per_node_array_length_quick(request->nodes); i++) {
        const bn_request_node *node = bn_request_per_node_array_get_quick(request->nodes, i);
        how.in_walk = how.in_walk || node->subop == bn_query_iterate;
        how.quiet = how.quiet || (node->flags & bn_qf_quiet) != 0;
    }
    CHECK_STATUS(mdc_dispatch_mon_request(session, request, wccpd_mon_handle_get, &how,
                                          wccpd_mon_handle_iterate, nullptr));
    return LC_OK;
}

lc_status wccpd_mgmt_handle_action_request(gcl_session *session, bn_request_msg *request, void *) {
    uint16_t type = 0;
    CHECK_STATUS(bn_request_get(request, &type, nullptr, 0, nullptr, nullptr, nullptr));
    CHECK_CONDITION(type == bn_msg_action_request);
    owned_tstring name;
    CHECK_STATUS(bn_action_request_msg_get_action_name(request, &name.pointer));
    LC_LOG(LC_LOG_INFO, "Received action %s", ts_str(name.pointer));
    // Every action is acknowledged, because its sender waits; none has an effect.
    owned_response response;
    CHECK_STATUS(bn_action_response_msg_create(
        &response.pointer, static_cast<uint32_t>(bn_request_get_msg_id(request)), 0, nullptr));
    CHECK_STATUS(bn_response_msg_send(session, response.pointer));
    return LC_OK;
}

lc_status wccpd_process_proc_fail(const char *event_name, const bn_binding_array *bindings) {
    LC_LOG(LC_LOG_INFO, "Processing proc event: %s", event_name);
    // The first binding has the name of the process.
    bn_binding *first = bn_binding_array_get_quick(bindings, 0);
    if (!first)
        return LC_OK;
    owned_tstring process;
    CHECK_STATUS(bn_binding_get_tstr(first, bn_attrib_value, bn_type_str, nullptr, &process.pointer));
    // Other programs may end without consequences for wccpd.
    if (!process.pointer || strcmp(ts_str(process.pointer), "tunneld") != 0)
        return LC_OK;
    LC_LOG(LC_LOG_INFO, "WCCP: Detected that tunneld has exited");
    CHECK_STATUS(wccpd_initiate_exit());
    return LC_OK;
}

lc_status wccpd_config_changed(const char *, bn_binding_array *bindings) {
    owned_bindings old_values, new_values;
    CHECK_STATUS(mdc_event_config_change_notif_extract(bindings, &old_values.pointer, &new_values.pointer));
    if (m_daemon_status == WCCPD_READY)
        CHECK_STATUS(wccpd_config_apply(new_values.pointer));
    else if (early_changes_are_kept())
        CHECK_STATUS(keep_early_change(&new_values.pointer));
    else
        LC_LOG(LC_LOG_WARNING, "Configuration change ignored: the start has failed");
    return LC_OK;
}

lc_status wccpd_proc_event(const char *event_name, bn_binding_array *bindings) {
    CHECK_STATUS(wccpd_process_proc_fail(event_name, bindings));
    return LC_OK;
}

const struct {
    const char *name;
    lc_status (*handle)(const char *event_name, bn_binding_array *bindings);
} wccpd_events[] = {
    {EVENT_CONFIG_CHANGE, wccpd_config_changed},
    {EVENT_PROCESS_CRASH, wccpd_proc_event},
    {EVENT_PROCESS_EXIT, wccpd_proc_event},
    {EVENT_PROCESS_TERMINATE, wccpd_proc_event},
};

lc_status wccpd_mgmt_handle_event_request(gcl_session *, bn_request_msg *request, void *) {
    uint16_t type = 0;
    owned_bindings bindings;
    CHECK_STATUS(bn_request_get(request, &type, nullptr, 0, &bindings.pointer, nullptr, nullptr));
    CHECK_CONDITION(type == bn_msg_event);
    owned_tstring stored;
    CHECK_STATUS(bn_event_request_msg_get_event_name(request, &stored.pointer));
    CHECK_NULL(stored.pointer);
    const char *name = ts_str(stored.pointer);
    LC_LOG(LC_LOG_INFO, "Received event: %s", name);
    for (const auto &known : wccpd_events)
        if (strcmp(known.name, name) == 0) {
            CHECK_STATUS(known.handle(name, bindings.pointer));
            return LC_OK;
        }
    if (qv_handle_time_zone_change(name) != LC_OK) // not that event either
        LC_LOG(LC_LOG_WARNING, "Received unexpected event %s", name);
    return LC_OK;
}

lc_status wccpd_mgmt_handle_session_close(int, uint32_t, void *, void *) {
    if (wccpd_exiting) // the daemon closed it itself
        return LC_OK;
    wccpd_response_expected = 0; // ends the wait of a request
    LC_LOG(LC_LOG_ERR, "Lost connection to mgmtd; exiting");
    CHECK_STATUS(wccpd_initiate_exit());
    return LC_OK;
}

lc_status wccpd_mgmt_register_interests() {
    CHECK_STATUS(mdc_send_action_with_bindings_str_va(
        wccpd_mcc, nullptr, nullptr, ACTION_ADD_INTEREST, 5,                           //
        "event_name", static_cast<uint32_t>(bn_type_name), EVENT_CONFIG_CHANGE,        //
        "match/1/pattern", static_cast<uint32_t>(bn_type_str), NODE_WCCPD "/**",       //
        "match/2/pattern", static_cast<uint32_t>(bn_type_str), NODE_SYSTEM_MODE "/**", //
        "match/3/pattern", static_cast<uint32_t>(bn_type_str), "/logging/**",          //
        "match/4/pattern", static_cast<uint32_t>(bn_type_str), NODE_SYSLOG_FACILITY "/**"));
    // Without a pattern the interest covers all events of that name.
    static const char *const process_events[] = {
        EVENT_PROCESS_CRASH,
        EVENT_PROCESS_EXIT,
        EVENT_PROCESS_TERMINATE,
    };
    for (const char *event : process_events)
        CHECK_STATUS(mdc_send_action_with_bindings_str_va(wccpd_mcc, nullptr, nullptr, ACTION_ADD_INTEREST, 1,
                                                          "event_name", static_cast<uint32_t>(bn_type_name),
                                                          event));
    CHECK_STATUS(qv_register_time_zone_change(wccpd_mcc));
    return LC_OK;
}

lc_status wccpd_mgmt_open_session() {
    lc_status status = mgmt_client_open(&wccpd_client, wccpd_program_name, wccpd_mgmt_msg_handler);
    if (status == LC_OK)
        status = wccpd_mgmt_register_interests();
    if (status != LC_OK && status != LC_CANCELLED)
        LC_LOG(LC_LOG_ERR, "Unable to connect to the management daemon");
    return status;
}

} // namespace

lc_status wccpd_mgmt_init() {
    CHECK_STATUS(mgmt_client_init(&wccpd_client, wccpd_mgmt_handle_session_close));
    // All callbacks first: messages may arrive as soon as the session is open.
    CHECK_STATUS(
        bn_set_global_callback_query_response_msg(wccpd_gcl_handle, wccpd_mgmt_handle_response, nullptr));
    CHECK_STATUS(
        bn_set_global_callback_action_response_msg(wccpd_gcl_handle, wccpd_mgmt_handle_response, nullptr));
    CHECK_STATUS(bn_set_global_callback_event_response_msg(wccpd_gcl_handle, wccpd_mgmt_handle_event_response,
                                                           nullptr));
    CHECK_STATUS(
        bn_set_global_callback_query_request_msg(wccpd_gcl_handle, wccpd_mgmt_handle_query_request, nullptr));
    CHECK_STATUS(
        bn_set_global_callback_event_request_msg(wccpd_gcl_handle, wccpd_mgmt_handle_event_request, nullptr));
    CHECK_STATUS(bn_set_global_callback_action_request_msg(wccpd_gcl_handle, wccpd_mgmt_handle_action_request,
                                                           nullptr));
    CHECK_STATUS(wccpd_mgmt_open_session());
    return LC_OK;
}

lc_status wccpd_mgmt_shutdown() {
    CHECK_STATUS(gcl_shutdown(wccpd_gcl_handle));
    return LC_OK;
}

lc_status wccpd_mgmt_deinit() {
    mgmt_client_deinit(&wccpd_client);
    return LC_OK;
}
