// One management session of a process with all that belongs to it, and the wait for an answer inside the
// loop. A process has one of these for each session; the cells that other files name are lent to it.
//
// A request is answered while its maker waits: the loop is run from inside the call, so that everything else
// is delivered meanwhile, and waits nest. A wait ends with its answer, with the loss of the session, with a
// failing loop, and, at every depth, once the exit has begun: the loop's escape flag is sticky, so that a
// wait that went on by its own flag alone would spin. A request that the exit leaves without an answer, and
// one that is made after it has begun, gives LC_CANCELLED, which travels up without a line: an orderly stop
// is no failure.
#pragma once

#include <atomic>
#include <cstdint>

#include "mgmt/bnode_proto.h"
#include "mgmt/gcl.h"
#include "mgmt/mdc_main.h"
#include "runtime/event_fdintrcb.h"
#include "runtime/loop_host.h"

struct mgmt_client {
    lew **loop;
    gcl_session **session;
    mdc **handle;
    int32_t *response_expected;          // 1 while a request waits
    int32_t *expected_request_id;        // of that request, 0 when none waits
    bn_response_msg **captured_response; // passes to the maker of the request
    const std::atomic<int32_t> *exiting;
    const char *warning_prefix; // in front of the warnings about stray responses
    gcl **instance;
    fdic **interests;
    fdic_libevent **bridge;
};

// Loop context, bridge, interest list, close handler and GCL instance, in this order.
lc_status mgmt_client_init(mgmt_client *client, fdic_handler close_handler);
// Connects to mgmtd and opens the bnode service; then `msg_handler` is what the client handle sends with. A
// failure says that the management daemon cannot be reached.
lc_status mgmt_client_open(mgmt_client *client, const char *client_name, mdc_send_function msg_handler);
// Frees everything, each failure logged and the next step run.
void mgmt_client_deinit(mgmt_client *client);
lc_status mgmt_client_request(mgmt_client *client, bn_request_msg *request, bn_response_msg **out_response);
lc_status mgmt_client_response(mgmt_client *client, const bn_response_msg *response);
