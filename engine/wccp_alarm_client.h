// The session with mgmtd on which alarms and state events are sent, and the thread that serves it. All
// functions are called by the main thread, except qv_initiate_exit, which the alarm thread also calls when
// its session is lost.
#pragma once

#include <cstdint>

#include "engine/wccp_alarms.h"
#include "runtime/common.h"

// Starts the thread and returns once its session is open or has failed to open, or an exit has begun. Runs
// the main loop meanwhile. Returns the result of the thread's creation; a session that failed is only logged.
// `client_name` must stay valid.
lc_status qv_alm_mgmt_init(const char *client_name);
// Ends the client for good: ends the thread's loop, joins the thread, and closes the session.
lc_status qv_initiate_exit();
lc_status qv_alm_mgmt_shutdown(); // part of qv_initiate_exit
// Frees everything. Senders get no session afterwards. Always 0.
lc_status qv_alm_mgmt_deinit();
