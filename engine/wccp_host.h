// What the engine needs from its program. The daemon defines all of it; tests have their own definitions.
#pragma once

#include <atomic>
#include <cstdint>

#include "runtime/common.h"

// 1 once an orderly exit has begun. Any thread.
int32_t wccpd_shutdown_in_progress();
extern std::atomic<int32_t> wccpd_exiting;

extern struct lew *wccpd_lwc; // the main thread's loop, null without one

// First and last tunnel id reserved for WCCP tunnels, both inclusive; 32 in all.
extern uint32_t g_qv_encap_wccp_first, g_qv_encap_wccp_last;

// The name of the primary WAN interface, set by the function below. On failure it stays as it was. Main
// thread. It runs the event loop; therefore no lock may be held.
extern char wccp_primary_wan_interface_name[32];
lc_status wccp_init_primary_wan_interface();

// 1 when the system mode in mgmtd is "bridge"; 0 otherwise, also when it cannot be read. As above.
int wccp_is_system_in_bridge_mode();
