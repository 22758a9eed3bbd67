// The C library's syslog blocks while the log daemon doesn't read: after a dozen lines with a short queue, at
// the latest when the send buffer is full. The engine logs under its lock, so a stopped log daemon would stop
// the engine. Here a line is sent without blocking. A full queue is waited for as long as there is patience
// left, some milliseconds in all; a daemon that reads empties its queue within that, so that a burst arrives
// whole and in order. Once the patience is used up a line is tried and given up at once, until one gets
// through, which restores it.
//
// A daemon that goes takes its socket along: the next line connects again. Without /dev/log lines are lost
// quietly.
#include "runtime/syslog_socket.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include "runtime/common.h"

constexpr const char *LOG_PATH = "/dev/log";
constexpr size_t LINE_BYTES = 6144;

void syslog_socket_close(syslog_socket *log) {
    if (log->fd >= 0)
        close(log->fd);
    log->fd = -1;
}

static int connect_as(syslog_socket *log, int type) {
    const int fd = socket(AF_UNIX, type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    if (fd < 0)
        return errno;
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    strlcpy(address.sun_path, LOG_PATH, sizeof address.sun_path);
    if (connect(fd, reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0) {
        const int failure = errno;
        close(fd);
        return failure;
    }
    log->fd = fd;
    log->stream = type == SOCK_STREAM;
    return 0;
}

static int connect_to_daemon(syslog_socket *log) {
    const int result = connect_as(log, SOCK_DGRAM);
    return result == EPROTOTYPE ? connect_as(log, SOCK_STREAM) : result;
}

void syslog_socket_open(syslog_socket *log, const char *ident, bool with_pid, int32_t facility) {
    strlcpy(log->ident, ident, sizeof log->ident);
    log->with_pid = with_pid;
    log->facility = facility;
    log->fd = -1;
    log->patience_ms = SYSLOG_PATIENCE_MS;
    (void)connect_to_daemon(log);
}

static int64_t now_ms() {
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<int64_t>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

// Waits for room, on account of the patience. False when there is none left.
static bool wait_for_room(syslog_socket *log) {
    if (log->patience_ms <= 0)
        return false;
    pollfd writable = {log->fd, POLLOUT, 0};
    const int64_t began = now_ms();
    (void)poll(&writable, 1, log->patience_ms);
    const int64_t waited = now_ms() - began;
    log->patience_ms -= static_cast<int32_t>(waited < log->patience_ms ? waited : log->patience_ms);
    return true;
}

// Sends all of a line on the present connection: 0, or the errno of what stopped it.
static int send_line(syslog_socket *log, const char *line, size_t length) {
    size_t sent = 0;
    while (sent < length) {
        const ssize_t went = send(log->fd, line + sent, length - sent, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (went >= 0) {
            sent += static_cast<size_t>(went);
        } else if (errno == EAGAIN || errno == ENOBUFS) {
            if (wait_for_room(log))
                continue;
            if (sent > 0)
                syslog_socket_close(log); // half a line on a stream would spoil the next one
            return EAGAIN;
        } else if (errno != EINTR) {
            return errno;
        }
    }
    log->patience_ms = SYSLOG_PATIENCE_MS;
    return 0;
}

int syslog_socket_send(syslog_socket *log, int32_t level, const char *text, size_t length) {
    if (!(LOG_MASK(level) & setlogmask(0)))
        return 0;
    char line[LINE_BYTES];
    const time_t now = time(nullptr);
    tm local = {};
    localtime_r(&now, &local);
    int used = snprintf(line, sizeof line, "<%d>", log->facility | level);
    used +=
        static_cast<int>(strftime(line + used, sizeof line - static_cast<size_t>(used), "%h %e %T ", &local));
    used += log->with_pid
                ? snprintf(line + used, sizeof line - static_cast<size_t>(used), "%s[%d]: ", log->ident,
                           static_cast<int>(getpid()))
                : snprintf(line + used, sizeof line - static_cast<size_t>(used), "%s: ", log->ident);
    const size_t head = static_cast<size_t>(used);
    if (length > sizeof line - head - 1)
        length = sizeof line - head - 1;
    memcpy(line + head, text, length);
    line[head + length] = '\0';
    for (int attempt = 0; attempt < 2; attempt++) {
        if (log->fd < 0) {
            const int result = connect_to_daemon(log);
            if (result != 0)
                return result;
        }
        const int result = send_line(log, line, head + length + (log->stream ? 1 : 0));
        if (result == 0 || result == EAGAIN)
            return result;
        syslog_socket_close(log); // the daemon has gone; perhaps another stands in its place
    }
    return ENOTCONN;
}
