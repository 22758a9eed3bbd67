// Sends lines to the syslog daemon without blocking on it.
//
// syslog(3) blocks while the daemon doesn't read: after about a dozen lines if the socket's queue is short,
// at the latest when the send buffer is full. The engine logs with its lock held; therefore a stopped syslog
// daemon would stop the engine. Here a line is sent without blocking. If the queue is full, the line waits,
// but all lines together only for 30 ms (the patience). A daemon that works empties its queue in that time;
// therefore a burst arrives complete and in order. When the patience is used up, each line is tried once and
// dropped, until one is sent, which restores the patience.
//
// A line waits in short steps and is tried after each, because poll() reports a socket as writable only when
// half of its send buffer is free. A slow daemon may take long for that, although a line would fit much
// earlier.
//
// When the daemon ends, sending fails and the line is sent on a new connection. If a daemon hangs and another
// one has taken its path, sending doesn't fail; that is noticed by the inode of the socket file when a line
// would be dropped. Without /dev/log, lines are dropped silently, at the cost of one stat() each. As
// syslog(3) does, a line on a stream socket ends with a NUL.
//
// Lines are formatted in a static buffer, under the log's lock; only a line that is longer is allocated.
#include "runtime/syslog_socket.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include "runtime/common.h"
#include "runtime/ttime.h"

constexpr const char *LOG_PATH = "/dev/log";
constexpr size_t LINE_BYTES = 4096;
constexpr int64_t WAIT_STEP_NS = 500000;
// Every step costs some patience, so that a wait also ends if poll() reports room each time and no line fits
// in it.
constexpr int64_t LEAST_STEP_NS = 1000;

namespace {

// Bit n is level n. setlogmask(3) isn't used, since its lock may be held by a thread that is blocked in
// syslog(3).
std::atomic<int32_t> mask{0xff};

} // namespace

void syslog_set_mask(int32_t level) {
    mask = (1 << ((level + 1) & 31)) - 1;
}

void syslog_socket_close(syslog_socket *log) {
    if (log->fd >= 0)
        close(log->fd);
    log->fd = -1;
}

namespace {

int connect_as(syslog_socket *log, int type) {
    // Before connect(): if the path changes in between, the next comparison finds a difference.
    struct stat file = {};
    if (stat(LOG_PATH, &file) != 0)
        return errno;
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
    log->device = file.st_dev;
    log->inode = file.st_ino;
    return 0;
}

// 0, or an errno. Most daemons have a datagram socket, some a stream.
int connect_to_daemon(syslog_socket *log) {
    const int result = connect_as(log, SOCK_DGRAM);
    // EPROTOTYPE: the socket at the path has another type.
    return result == EPROTOTYPE ? connect_as(log, SOCK_STREAM) : result;
}

// Whether the path now leads to another socket than the one that we are connected to.
bool path_has_changed(const syslog_socket *log) {
    struct stat file = {};
    // Without a path the connection is kept: a daemon that is being replaced may still read it.
    return stat(LOG_PATH, &file) == 0 && (file.st_dev != log->device || file.st_ino != log->inode);
}

} // namespace

void syslog_socket_open(syslog_socket *log, const char *ident, bool with_pid, int32_t facility) {
    strlcpy(log->ident, ident, sizeof log->ident);
    log->with_pid = with_pid;
    // Other bits would change the level of the lines.
    log->facility = facility & ~LOG_FACMASK ? LOG_USER : facility;
    log->fd = -1;
    log->patience_ns = SYSLOG_PATIENCE_NS;
    (void)connect_to_daemon(log);
}

namespace {

// Waits one step for room. False if no patience is left. No step uses up more patience than its own length:
// on a machine so busy that this thread runs late, the daemon does too.
bool wait_for_room(syslog_socket *log) {
    if (log->patience_ns <= 0)
        return false;
    const timespec step = {0, WAIT_STEP_NS};
    pollfd writable = {log->fd, POLLOUT, 0};
    const int64_t began = lt_monotonic_ns();
    // Without a connection this is only a pause.
    (void)ppoll(&writable, log->fd >= 0, &step, nullptr);
    const int64_t waited = lt_monotonic_ns() - began;
    log->patience_ns -= std::clamp<int64_t>(waited, LEAST_STEP_NS, WAIT_STEP_NS);
    return true;
}

// Sends a line on the present connection. 0, or an errno.
int send_all_bytes(syslog_socket *log, const char *line, size_t length) {
    // A datagram is sent whole or not at all; only a stream takes a part of a line.
    size_t sent = 0;
    while (sent < length) {
        const ssize_t went = send(log->fd, line + sent, length - sent, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (went >= 0) {
            sent += static_cast<size_t>(went);
        } else if (errno == EAGAIN || errno == ENOBUFS) {
            if (wait_for_room(log))
                continue;
            if (sent > 0)
                syslog_socket_close(log); // otherwise the next line would be appended to this half
            return EAGAIN;
        } else if (errno != EINTR) {
            return errno;
        }
    }
    return 0;
}

// Sends a line and connects as often as needed, but gives up after two failures.
int send_line(syslog_socket *log, const char *line, size_t length) {
    int result = ENOTCONN;
    for (int failures = 0; failures < 2;) {
        if (log->fd < 0) {
            result = connect_to_daemon(log);
            if (result == EAGAIN && wait_for_room(log))
                continue; // a stream whose backlog is full
            if (result != 0)
                return result;
        }
        result = send_all_bytes(log, line, length + (log->stream ? 1 : 0));
        if (result == 0) {
            log->patience_ns = SYSLOG_PATIENCE_NS;
            return 0;
        }
        // A full queue is worth a new connection only if it belongs to a daemon that has been replaced.
        if (result == EAGAIN && !path_has_changed(log))
            return result;
        syslog_socket_close(log); // the daemon has ended or been replaced
        failures++;
    }
    return result;
}

// The head of a line as syslog(3) writes it, e.g. "<139>Jan  2 03:04:05 wccpd[123]: ".
size_t format_head(const syslog_socket *log, int32_t level, char *line, size_t size) {
    // Month names independent of the locale.
    static const char months[][4] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                     "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
    const time_t now = time(nullptr);
    tm local = {};
    localtime_r(&now, &local);
    char process[16] = "";
    if (log->with_pid)
        snprintf(process, sizeof process, "[%d]", static_cast<int>(getpid()));
    // The number in angle brackets is the priority: the facility, which has its low three bits clear, and the
    // level.
    return static_cast<size_t>(snprintf(line, size, "<%d>%s %2d %02d:%02d:%02d %s%s: ", log->facility | level,
                                        months[local.tm_mon], local.tm_mday, local.tm_hour, local.tm_min,
                                        local.tm_sec, log->ident, process));
}

} // namespace

int syslog_socket_vsend(syslog_socket *log, int32_t level, const char *format, va_list arguments) {
    static char line[LINE_BYTES];
    const int saved_errno = errno;
    if (!((1 << (level & LOG_PRIMASK)) & mask))
        return 0;
    const size_t head = format_head(log, level & LOG_PRIMASK, line, sizeof line);
    va_list again;
    va_copy(again, arguments);
    // The time functions above may have changed it, and the format may contain "%m".
    errno = saved_errno;
    const int text = vsnprintf(line + head, sizeof line - head, format, arguments);
    const size_t length = text < 0 ? head : head + static_cast<size_t>(text);
    int result = 0;
    char *longer = nullptr;
    // Without memory for a long line its beginning is sent.
    if (length >= sizeof line && (longer = static_cast<char *>(malloc(length + 1)))) {
        memcpy(longer, line, head);
        errno = saved_errno;
        vsnprintf(longer + head, length + 1 - head, format, again);
        result = send_line(log, longer, length);
        free(longer);
    } else {
        result = send_line(log, line, length < sizeof line ? length : sizeof line - 1);
    }
    va_end(again);
    return result;
}

int syslog_socket_send(syslog_socket *log, int32_t level, const char *format, ...) {
    va_list arguments;
    va_start(arguments, format);
    const int result = syslog_socket_vsend(log, level, format, arguments);
    va_end(arguments);
    return result;
}
