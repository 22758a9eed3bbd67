// The daemon's process: start-up, signals and orderly exit. Main thread only, except for the atomic
// variables.
#pragma once

#include <atomic>
#include <cstdint>

#include "runtime/common.h"
#include "runtime/loop_host.h"

extern const char *const wccpd_program_name;
constexpr uint32_t WCCPD_LOG_COMPONENT = 0x1060000;
extern lew *wccpd_lwc; // the main thread's event loop; null before lew_init and after lew_deinit

// The progress of the start. Only 0 and 1 are ever stored; a start that fails stays at 0. The table has the
// names that monitoring prints.
enum : int32_t { WCCPD_INITIALIZING = 0, WCCPD_READY = 1 };
extern std::atomic<int32_t> m_daemon_status;
extern const lc_enum_entry wccpd_status_table[];

// The ranges of the platform's encapsulation table; the one for WCCP tunnels is in engine/wccp_host.h. First
// and last entries are inclusive.
extern uint32_t g_qv_encap_entry_count;
extern uint32_t g_qv_encap_clstr_first, g_qv_encap_clstr_last;
extern int32_t bonding_enabled; // as read when the primary interface was chosen

int wccpd_main(); // the whole life of the daemon; does not return
// The three phases.
lc_status wccpd_init();      // LC_CANCELLED when an exit has begun meanwhile
lc_status wccpd_main_loop(); // until an exit
lc_status wccpd_deinit();
lc_status wccpd_serv_init(); // starts the engine
lc_status wccpd_pid_init();  // writes the pid file
lc_status wccpd_handle_signal(int signal_number, short flags, void *data, lew *context); // a lew_callback
// Begins the orderly exit. Called from a callback of the loop, which ends after it. When a step fails, the
// status is returned, the rest is not done, and the loop continues.
lc_status wccpd_initiate_exit();
uint32_t qv_encap_setup_entries(); // computes the ranges; returns the size of the table
