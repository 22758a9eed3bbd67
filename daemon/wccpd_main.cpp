// The start, the loop and the exit of the daemon, in their fixed order.
//
// Everything here runs on the main thread, the only one that receives signals: all others block them, so that
// none of their sleeps or waits is interrupted. Signals and management messages are callbacks of the loop. A
// callback may wait for mgmtd by running the loop again from inside itself (wccpd_mgmt.cpp).
// wccpd_initiate_exit can therefore run nested in such a wait; every wait ends once wccpd_exiting is set.
//
// Start. The session with mgmtd must be open before the engine starts, because the engine asks mgmtd for the
// system mode and the primary interface; the alarm session must be open before the engine can raise an alarm.
// m_daemon_status alone shows how far the start has come. Until it is WCCPD_READY, queries are dropped and
// configuration changes are kept (wccpd_early_changes.h). A start that fails does not end the process: it
// stays in its loop, not ready and ignoring changes, until a signal ends it. Only a missing privilege ends it
// at once.
//
// Exit. Alarms are cleared while their session is open. Then the alarm session and its thread end, the signal
// registrations are removed, the working session is closed, and the mailbox is reset. Groups are still
// running at this point, with the tick idle; wccpd_deinit deletes them once the loop has returned. The daemon
// never reconnects and never repairs anything; its supervisor starts it again.
//
// The notifier thread of the platform's library runs until exit() has finished and can call into the engine
// until then. Therefore the engine's records have no destructors, and its callbacks return at once when
// wccpd_exiting is set.
//
// All memory is locked; therefore every mapped page counts, used or not. Threads have small stacks
// (engine/cthread.cpp), malloc has one arena and returns large buffers to the kernel, and received bindings
// share their names. scripts/memory.sh shows locked memory by component; bench/daemon_start.sh measures at
// full size.
#include "daemon/wccpd_main.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <malloc.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include "daemon/wccpd_config.h"
#include "daemon/wccpd_early_changes.h"
#include "daemon/wccpd_mgmt.h"
#include "daemon/wccpd_service.h"
#include "engine/wccp_alarm_client.h"
#include "engine/wccp_host.h"
#include "engine/wccp_mgr.h"
#include "engine/wccpd_common.h"
#include "platform/file_utils.h"
#include "platform/limits.h"
#include "runtime/logging.h"
#include "runtime/service_notify.h"
#include "runtime/version.h"

const char *const wccpd_program_name = "wccpd";
lew *wccpd_lwc;
std::atomic<int32_t> m_daemon_status{WCCPD_INITIALIZING};
std::atomic<int32_t> wccpd_exiting;
uint32_t g_qv_encap_entry_count;
uint32_t g_qv_encap_wccp_first, g_qv_encap_wccp_last;
uint32_t g_qv_encap_clstr_first, g_qv_encap_clstr_last;

const lc_enum_entry wccpd_status_table[] = {
    {0, "Initializing"},
    {1, "Ready"},
    {50, "Failed-Partial"},
    {51, "Failed-Initialization"},
    {52, "Failed-DB Loading"},
    {53, "Failed-Memory Initialization"},
    {54, "Failed-Thread Initialization"},
    {90, "Shutdown"},
    {91, "DeInitialization"},
    {0, nullptr},
};

namespace {

constexpr const char *WCCPD_PID_FILE = "/var/run/wccpd.pid";

// The signals that the daemon handles, in the order of their registration and removal.
struct wccpd_signal {
    int number;
    bool ends_daemon;
    lew_event *slot;
};
wccpd_signal wccpd_signals[] = {
    {SIGHUP, true, nullptr},  {SIGINT, true, nullptr},   {SIGPIPE, false, nullptr},
    {SIGTERM, true, nullptr}, {SIGUSR1, false, nullptr}, {SIGUSR2, false, nullptr},
};

lc_status wccpd_alarms_init() {
    return qv_alm_mgmt_init(wccpd_program_name);
}

// The steps of the start that wait for mgmtd. If an exit begins during one of them, the start ends there:
// nothing may be started after the exit.
lc_status (*const wccpd_start_steps[])() = {
    wccpd_mgmt_init,
    wccpd_alarms_init,
    wccpd_serv_init,
    wccpd_config_query,
};

} // namespace

int32_t wccpd_shutdown_in_progress() {
    return wccpd_exiting.load(std::memory_order_relaxed);
}

lc_status wccpd_handle_signal(int signal_number, short, void *, lew *) {
    LC_LOG(LC_LOG_INFO, "Received %s", lc_signal_num_to_name(signal_number));
    for (const wccpd_signal &known : wccpd_signals) {
        if (known.number != signal_number)
            continue;
        // SIGPIPE, SIGUSR1 and SIGUSR2 are only logged: their default actions would end the process.
        if (known.ends_daemon)
            CHECK_STATUS(wccpd_initiate_exit());
        return LC_OK;
    }
    LC_LOG(LC_LOG_WARNING, "Got unexpected signal %s", lc_signal_num_to_name(signal_number));
    return LC_OK;
}

uint32_t qv_encap_setup_entries() {
    // Each range has 32 ids, as many as wccp_tunnel.cpp has bits for them.
    const uint32_t base = get_max_tunnel_number();
    g_qv_encap_wccp_first = base + 10;
    g_qv_encap_wccp_last = base + 41;
    g_qv_encap_clstr_first = base + 51;
    g_qv_encap_clstr_last = base + 82;
    return base + 84;
}

lc_status wccpd_pid_init() {
    char text[16];
    const int length = snprintf(text, sizeof text, "%d\n", static_cast<int>(getpid()));
    LOG_STATUS(lf_ensure_dir_of_file(WCCPD_PID_FILE, 0755));
    // A failure need not be one of a system call; 0 then shows that errno says nothing.
    errno = 0;
    const lc_status status = lf_write_file(WCCPD_PID_FILE, 0644, text, 1, static_cast<uint32_t>(length));
    if (status != LC_OK) {
        const int failure = errno;
        char action[64];
        snprintf(action, sizeof action, "Writing %s", WCCPD_PID_FILE);
        const char *words = failure ? strerror(failure) : "(unknown error)";
        LC_LOG(LC_LOG_ERR, "%s: %s", action, words);
    }
    return status;
}

lc_status wccpd_serv_init() {
    CHECK_CONDITION(wccpd_lwc != nullptr);
    // The engine's threads create tunnels as soon as a group has found a router, which can happen while later
    // groups are still being added. They need the range of ids before wccpd_init computes it again to log it.
    (void)qv_encap_setup_entries();
    return wccp_init_mgr();
}

lc_status wccpd_init() {
    // The modes of files and sockets are exactly those that the code states.
    umask(0);
    const int32_t facility = lc_log_get_facility(nullptr, wccpd_program_name);
    CHECK_STATUS(lc_log_init(wccpd_program_name, nullptr, 0, WCCPD_LOG_COMPONENT, LC_LOG_DEBUG, facility, 1));
    LC_LOG(LC_LOG_NOTICE, "WCCP daemon launched");
    LC_LOG(LC_LOG_DEBUG, "wccpd version %s", wccp_version());
    if (wccpd_report_missing_privileges() > 0) { // they cannot appear while the process runs
        (void)lc_log_close();
        exit(EXIT_FAILURE);
    }
    CHECK_STATUS(lew_init(&wccpd_lwc));
    CHECK_NULL(wccpd_lwc);
    for (wccpd_signal &known : wccpd_signals)
        CHECK_STATUS(
            lew_event_reg_signal(wccpd_lwc, &known.slot, known.number, wccpd_handle_signal, nullptr));
    // From before the session is opened, so that no change is missed.
    const early_changes_scope early_changes;
    for (lc_status (*step)() : wccpd_start_steps) {
        CHECK_STATUS(step());
        if (wccpd_shutdown_in_progress())
            return LC_CANCELLED;
    }
    // Before the daemon is ready: from then on changes are applied as they arrive.
    apply_early_changes();
    g_qv_encap_entry_count = qv_encap_setup_entries();
    LC_LOG(LC_LOG_NOTICE, "%s: encap entries:%d wccp start %d/%d clstr start %d/%d", "wccpd_init",
           static_cast<int>(g_qv_encap_entry_count), static_cast<int>(g_qv_encap_wccp_first),
           static_cast<int>(g_qv_encap_wccp_last), static_cast<int>(g_qv_encap_clstr_first),
           static_cast<int>(g_qv_encap_clstr_last));
    m_daemon_status = WCCPD_READY;
    CHECK_STATUS(wccpd_pid_init());
    CHECK_STATUS(wccpd_service_ready());
    return LC_OK;
}

lc_status wccpd_main_loop() {
    CHECK_STATUS(lew_dispatch(wccpd_lwc, nullptr, nullptr));
    return LC_OK;
}

lc_status wccpd_initiate_exit() {
    // First: it ends all waits, and the tick, receive threads and notifications stop working.
    wccpd_exiting = 1;
    service_report("STOPPING=1");
    wccp_alarms_clear_all();
    LOG_STATUS(qv_initiate_exit());
    // One of these may be the registration whose callback is running.
    for (wccpd_signal &known : wccpd_signals)
        CHECK_STATUS(lew_event_delete(wccpd_lwc, &known.slot));
    CHECK_STATUS(wccpd_mgmt_shutdown());
    CHECK_STATUS(lew_escape_from_dispatch(wccpd_lwc));
    if (wccp_cleanup_shmem() != 0) {
        LC_LOG(LC_LOG_ERR, "WCCP: Cannot cleanup shared memory");
        return 1;
    }
    return LC_OK;
}

lc_status wccpd_deinit() {
    CHECK_STATUS(wccpd_mgmt_deinit());
    CHECK_STATUS(qv_alm_mgmt_deinit());
    // Deletes the groups and ends the engine's threads.
    (void)wccp_exit_mgr();
    wccpd_service_deinit();
    CHECK_STATUS(lew_deinit(&wccpd_lwc));
    return LC_OK;
}

int wccpd_main() {
    // A limit that is too low is reported by wccpd_report_missing_privileges.
    (void)mlockall(MCL_CURRENT | MCL_FUTURE);
    // All mapped memory is locked. By default each thread that allocates maps an arena of 64 MB, and malloc
    // raises its mmap threshold to the largest block freed so far, which after the answers of the start would
    // keep some megabytes on the heap.
    (void)mallopt(M_ARENA_MAX, 1);
    (void)mallopt(M_MMAP_THRESHOLD, 128 << 10);
    (void)mallopt(M_TRIM_THRESHOLD, 128 << 10);
    const lc_status first = lc_init();
    if (first != LC_OK) { // the only failure of the start that ends the process with its status
        LOG_STATUS(first);
        exit(first);
    }
    service_open();
    LOG_STATUS(wccpd_init());
    LOG_STATUS(wccpd_main_loop());
    // Failures of the start or of the loop do not show in the exit code; those of the clean-up do.
    const lc_status code = wccpd_deinit();
    LOG_STATUS(code);
    LC_LOG(LC_LOG_NOTICE, "WCCP daemon exiting with code %d", code);
    (void)lc_log_close();
    exit(code);
}
