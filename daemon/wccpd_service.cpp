// The daemon needs few privileges: its port does not need root, and only tunneld changes network interfaces.
// It needs permission to lock its memory and access to mgmtd.
//
// All memory is locked when it is mapped. With a limit below what the daemon needs in the end, threads cannot
// be created, groups cannot be added and shared memory cannot be attached, at some point in its life. A limit
// therefore counts as a missing privilege even if it would suffice at first.
//
// Keep-alive messages are sent by a timer of the main loop, which also tries to take the engine lock. An
// engine that holds it for long, because it waits for tunneld for each of many tunnels, is not dead; the
// watchdog period of the unit allows for that.
#include "daemon/wccpd_service.h"

#include <cerrno>
#include <cstdio>
#include <cstring>

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include "daemon/wccpd_main.h"
#include "engine/wccp_records.h"
#include "mgmt/gcl_wire.h"
#include "runtime/capabilities.h"
#include "runtime/logging.h"
#include "runtime/service_notify.h"

namespace {

constexpr int64_t CHECKS_IN_LIMIT = 24; // tries to take the lock within the watchdog period
constexpr size_t TEXT_BYTES = 256;

loop_event *alive_timer;

bool may_lock_memory(char *out_missing) {
    rlimit limit = {};
    if (lc_has_capability(CAP_IPC_LOCK) || getrlimit(RLIMIT_MEMLOCK, &limit) != 0 ||
        limit.rlim_cur == RLIM_INFINITY)
        return true;
    snprintf(out_missing, TEXT_BYTES,
             "CAP_IPC_LOCK, or no limit for locked memory (now %llu KiB): all memory is locked",
             static_cast<unsigned long long>(limit.rlim_cur / 1024));
    return false;
}

// mgmtd accepts root and its own user; others cannot write to its socket. If the socket does not exist, mgmtd
// is not running yet, which is not a matter of privileges.
bool may_reach_mgmtd(char *out_missing) {
    char path[sizeof(sockaddr_un::sun_path)];
    gcl_socket_path("provider", "mgmtd", path, sizeof path);
    struct stat about;
    // If the directory cannot be searched, the caller's text, which is there already, names the cause.
    if (stat(path, &about) != 0)
        return errno != EACCES;
    // With the effective ids, which connect() is checked against.
    if (faccessat(AT_FDCWD, path, W_OK, AT_EACCESS) == 0)
        return true;
    snprintf(out_missing, TEXT_BYTES, "running as root or as user %u, like mgmtd: %s: %s",
             static_cast<unsigned>(about.st_uid), path, strerror(errno));
    return false;
}

bool (*const privileges[])(char *out_missing) = {may_lock_memory, may_reach_mgmtd};

void report_alive(int, short, void *) {
    // Without waiting: the main thread must not stop when the engine does.
    if (pthread_mutex_trylock(&wccp_g.lock) == 0) {
        pthread_mutex_unlock(&wccp_g.lock);
        service_report("WATCHDOG=1");
    }
    // Timers run once; this starts the next period.
    LOG_STATUS(loop_event_set_timer(alive_timer, service_watchdog_ms() / CHECKS_IN_LIMIT));
}

} // namespace

int wccpd_report_missing_privileges() {
    int missing = 0;
    for (const auto has : privileges) {
        char text[TEXT_BYTES] = "permission to search the directory of mgmtd's socket";
        if (has(text))
            continue;
        missing++;
        fprintf(stderr, "wccpd: missing privilege: %s\n", text);
        LC_LOG(LC_LOG_ERR, "Missing privilege: %s", text);
    }
    return missing;
}

lc_status wccpd_service_ready() {
    service_report("READY=1");
    if (service_watchdog_ms() < 0)
        return LC_OK;
    loop_context *context = nullptr;
    CHECK_STATUS(lew_get_event_context(wccpd_lwc, &context));
    CHECK_STATUS(loop_event_new(context, report_alive, nullptr, &alive_timer));
    report_alive(-1, 0, nullptr);
    return LC_OK;
}

void wccpd_service_deinit() {
    if (alive_timer)
        loop_event_free(&alive_timer);
}
