// The privileges of the daemon are few. Its port is above those of root, and it makes no links: that is
// tunneld's. What it needs is that its memory may be locked, and that mgmtd lets it in.
//
// All memory is locked as it is mapped. Under a limit below what is needed in the end, threads do not start,
// groups are not made and blocks cannot be attached, now or in a week. Hence a limit counts as a missing
// privilege even where it would do for the moment.
//
// Reports of being alive come from a timer on the main loop, which also tries the engine's lock. An engine
// that holds it for long, because tunneld lets it wait for each of many tunnels, is not dead yet; the unit
// gives it the time.
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

constexpr int64_t CHECKS_IN_LIMIT = 24; // at the lock, within the time of the watchdog
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

// mgmtd lets in root and its own user, and nobody else may write to its socket. Without a socket there is
// no mgmtd yet, which is another matter.
bool may_reach_mgmtd(char *out_missing) {
    char path[sizeof(sockaddr_un::sun_path)];
    gcl_socket_path("provider", "mgmtd", path, sizeof path);
    struct stat about;
    if (stat(path, &about) != 0)
        return errno != EACCES;
    if (faccessat(AT_FDCWD, path, W_OK, AT_EACCESS) == 0)
        return true;
    snprintf(out_missing, TEXT_BYTES, "running as root or as user %u, like mgmtd: %s: %s",
             static_cast<unsigned>(about.st_uid), path, strerror(errno));
    return false;
}

bool (*const privileges[])(char *out_missing) = {may_lock_memory, may_reach_mgmtd};

void report_alive(int, short, void *) {
    if (pthread_mutex_trylock(&wccp_g.lock) == 0) {
        pthread_mutex_unlock(&wccp_g.lock);
        service_report("WATCHDOG=1");
    }
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
