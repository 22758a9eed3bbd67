// What the engine asks of the program that it runs in. The daemon defines these; tests have their own.
#pragma once

#include <atomic>
#include <cstdint>

#include "runtime/common.h"

// 1 from the moment an orderly exit has begun.
int32_t wccpd_shutdown_in_progress();
extern std::atomic<int32_t> wccpd_exiting;

extern struct lew *wccpd_lwc; // the main thread's loop, null when it has none

// First and last tunnel id reserved for redirected traffic, both inclusive, 32 in all.
extern uint32_t g_qv_encap_wccp_first, g_qv_encap_wccp_last;

// Name of the primary WAN interface, filled by the call below.
extern char wccp_primary_wan_interface_name[32];
lc_status wccp_init_primary_wan_interface();

// 1 when the management daemon says that the system is a bridge.
int wccp_is_system_in_bridge_mode();
