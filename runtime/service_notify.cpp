#include "runtime/service_notify.h"

#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <initializer_list>

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "runtime/guards.h"

namespace {

sockaddr_un manager = {};
socklen_t manager_length; // 0: no service manager
int64_t watchdog_ms = -1;

bool parse_positive(const char *text, int64_t *out) {
    char *end = nullptr;
    *out = strtoll(text, &end, 10);
    return end != text && *end == '\0' && *out > 0;
}

void read_socket(const char *path) {
    const size_t length = strlen(path);
    // A leading "@" represents the NUL at the start of the name of an abstract socket (unix(7)).
    if ((path[0] != '/' && path[0] != '@') || length < 2 || length >= sizeof manager.sun_path)
        return;
    manager.sun_family = AF_UNIX;
    memcpy(manager.sun_path, path, length);
    if (path[0] == '@')
        manager.sun_path[0] = '\0';
    // The name of an abstract socket is all bytes of the given length. A NUL at its end would be part of it,
    // and is not counted.
    manager_length = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + length);
}

void read_watchdog(const char *microseconds, const char *pid) {
    int64_t whose = 0, limit = 0;
    // The watchdog may be meant for another process of the service.
    if (pid && (!parse_positive(pid, &whose) || whose != getpid()))
        return;
    if (parse_positive(microseconds, &limit) && limit >= 1000)
        watchdog_ms = limit / 1000;
}

} // namespace

void service_open() {
    if (const char *path = getenv("NOTIFY_SOCKET"))
        read_socket(path);
    if (const char *limit = getenv("WATCHDOG_USEC"))
        read_watchdog(limit, getenv("WATCHDOG_PID"));
    // A child process must not inherit them, or it would report on our behalf.
    for (const char *name : {"NOTIFY_SOCKET", "WATCHDOG_USEC", "WATCHDOG_PID"})
        unsetenv(name);
}

void service_report(const char *state) {
    if (manager_length == 0)
        return;
    const cancel_off_guard uncancelled;
    // Non-blocking and without a retry: a service manager that doesn't read must not hold up the daemon.
    const int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0)
        return;
    (void)sendto(fd, state, strlen(state), MSG_NOSIGNAL, reinterpret_cast<const sockaddr *>(&manager),
                 manager_length);
    close(fd);
}

int64_t service_watchdog_ms() {
    return manager_length ? watchdog_ms : -1;
}
