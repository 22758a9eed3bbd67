// The process itself: start-up order, signals and orderly exit.
#pragma once

#include <atomic>
#include <cstdint>

#include "runtime/common.h"
#include "runtime/loop_host.h"

extern const char *const wccpd_program_name;
constexpr uint32_t WCCPD_LOG_COMPONENT = 0x1060000;
extern lew *wccpd_lwc; // the main thread's event loop; null before lew_init and after lew_deinit

// How far the start has come. The daemon stores 0 and 1 only, and a start that fails stays at 0; the whole
// table is what monitoring prints.
enum : int32_t { WCCPD_INITIALIZING = 0, WCCPD_READY = 1 };
extern std::atomic<int32_t> m_daemon_status;
extern const lc_enum_entry wccpd_status_table[];

extern uint32_t g_qv_encap_entry_count;
extern uint32_t g_qv_encap_clstr_first, g_qv_encap_clstr_last;
extern int32_t bonding_enabled;

int wccpd_main(); // what main() calls; ends the process
lc_status wccpd_init();
lc_status wccpd_main_loop();
lc_status wccpd_deinit();
lc_status wccpd_serv_init();
lc_status wccpd_pid_init();
lc_status wccpd_handle_signal(int signal_number, short flags, void *data, lew *context);
lc_status wccpd_initiate_exit(); // main thread, from inside the loop
uint32_t qv_encap_setup_entries();
