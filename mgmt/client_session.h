// A management session of a daemon, with everything that it needs, and requests that wait for their answer. A
// process has one mgmt_client per session. It consists of pointers to variables of the program, which other
// files use by name.
//
// mgmt_client_request runs the loop until the answer arrives: everything else is handled in the meantime, and
// requests nest. The wait ends with the answer, with the loss of the session, with a failure of the loop,
// and, at every level of nesting, when the process begins to exit: from then on the loop returns at once, and
// a wait for the answer alone would spin. A request that is not answered because of that, and one that is
// made afterwards, is LC_CANCELLED, which is not logged, since an orderly exit is not a failure.
//
// The functions are called on the thread that owns the loop.
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
    int32_t *response_expected;          // 1 while a request waits for its answer
    int32_t *expected_request_id;        // of that request
    bn_response_msg **captured_response; // its answer, until the request returns it
    const std::atomic<int32_t> *exiting; // not 0 when the process is exiting
    const char *warning_prefix;          // of the warnings about unexpected responses
    gcl **instance;
    fdic **interests;
    fdic_libevent **bridge;
};

// Makes the bridge, the interest list and the GCL instance. The close handler is called when the session is
// lost.
lc_status mgmt_client_init(mgmt_client *client, fdic_handler close_handler);
// Connects to mgmtd, opens the bnode service, and makes the client handle, which sends by `msg_handler`.
// LC_IO_ERROR and LC_IO_CLOSED, not logged as failures, if mgmtd can't be reached.
lc_status mgmt_client_open(mgmt_client *client, const char *client_name, mdc_send_function msg_handler);
// Frees everything; a failure is logged and doesn't stop it.
void mgmt_client_deinit(mgmt_client *client);
// Sends a request and waits for the answer, which is the caller's to free; null if the session was lost.
lc_status mgmt_client_request(mgmt_client *client, bn_request_msg *request, bn_response_msg **out_response);
// To be called for each response that the session receives: keeps the answer of the waiting request, and logs
// others.
lc_status mgmt_client_response(mgmt_client *client, const bn_response_msg *response);
