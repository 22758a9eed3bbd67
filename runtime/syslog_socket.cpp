// The C library's syslog blocks while the log daemon doesn't read: after a dozen lines with a short queue, at
// the latest when the send buffer is full. The engine logs under its lock, so a stopped log daemon would stop
// the engine. Here a line is sent without blocking. A full queue is waited for as long as there is patience
// left, some milliseconds in all; a daemon that reads empties its queue within that, so that a burst arrives
// whole and in order. Once the patience is used up a line is tried and given up at once, until one gets
// through, which restores it.
//
// The wait consists of short steps with a try after each: poll() reports room only when half of the socket's
// send buffer is free. A slow daemon may take long for that, while a line fits much earlier.
//
// When the daemon ends, its socket ends too, and the next line connects again. A daemon that has stopped
// while another one took over its path is noticed by the socket file when a line would be lost. Without
// /dev/log lines are lost quietly, at the price of a look at the path. As in the C library, a /dev/log that
// is a stream gets each line with its NUL.
//
// One line is made in a buffer of this file, under the log's lock; only a line that is longer allocates.
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
constexpr int64_t LEAST_STEP_NS = 1000; // a wait that finds room each time and no place in it ends as well

// The C library's own mask is guarded by a lock that another thread's blocked syslog call may hold.
static std::atomic<int32_t> mask{0xff};

void syslog_set_mask(int32_t level) {
    mask = (1 << ((level + 1) & 31)) - 1;
}

void syslog_socket_close(syslog_socket *log) {
    if (log->fd >= 0)
        close(log->fd);
    log->fd = -1;
}

static int connect_as(syslog_socket *log, int type) {
    struct stat file = {}; // looked at ahead of the connect: a later change is then seen as one
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

static int connect_to_daemon(syslog_socket *log) {
    const int result = connect_as(log, SOCK_DGRAM);
    return result == EPROTOTYPE ? connect_as(log, SOCK_STREAM) : result;
}

static bool path_is_anothers(const syslog_socket *log) {
    struct stat file = {};
    return stat(LOG_PATH, &file) == 0 && (file.st_dev != log->device || file.st_ino != log->inode);
}

void syslog_socket_open(syslog_socket *log, const char *ident, bool with_pid, int32_t facility) {
    strlcpy(log->ident, ident, sizeof log->ident);
    log->with_pid = with_pid;
    log->facility = facility & ~LOG_FACMASK ? LOG_USER : facility;
    log->fd = -1;
    log->patience_ns = SYSLOG_PATIENCE_NS;
    (void)connect_to_daemon(log);
}

// Waits a step for room, on account of the patience. False when there is none left. A step counts for no more
// than its own length: when the machine is so busy that this thread runs late, so does the daemon.
static bool wait_for_room(syslog_socket *log) {
    if (log->patience_ns <= 0)
        return false;
    const timespec step = {0, WAIT_STEP_NS};
    pollfd writable = {log->fd, POLLOUT, 0};
    const int64_t began = lt_monotonic_ns();
    (void)ppoll(&writable, log->fd >= 0, &step, nullptr);
    const int64_t waited = lt_monotonic_ns() - began;
    log->patience_ns -= std::clamp<int64_t>(waited, LEAST_STEP_NS, WAIT_STEP_NS);
    return true;
}

// Sends all of a line on the present connection: 0, or the errno of what stopped it.
static int send_whole(syslog_socket *log, const char *line, size_t length) {
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
    return 0;
}

static int send_line(syslog_socket *log, const char *line, size_t length) {
    int result = ENOTCONN;
    for (int failures = 0; failures < 2;) {
        if (log->fd < 0) {
            result = connect_to_daemon(log);
            if (result == EAGAIN && wait_for_room(log))
                continue; // a stream whose daemon has yet to accept
            if (result != 0)
                return result;
        }
        result = send_whole(log, line, length + (log->stream ? 1 : 0));
        if (result == 0) {
            log->patience_ns = SYSLOG_PATIENCE_NS;
            return 0;
        }
        if (result == EAGAIN && !path_is_anothers(log))
            return result;
        syslog_socket_close(log); // the daemon has ended; another may listen at its path
        failures++;
    }
    return result;
}

// The C library's head of a line.
static size_t write_head(const syslog_socket *log, int32_t level, char *line, size_t size) {
    static const char months[][4] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                     "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
    const time_t now = time(nullptr);
    tm local = {};
    localtime_r(&now, &local);
    char process[16] = "";
    if (log->with_pid)
        snprintf(process, sizeof process, "[%d]", static_cast<int>(getpid()));
    return static_cast<size_t>(snprintf(line, size, "<%d>%s %2d %02d:%02d:%02d %s%s: ", log->facility | level,
                                        months[local.tm_mon], local.tm_mday, local.tm_hour, local.tm_min,
                                        local.tm_sec, log->ident, process));
}

int syslog_socket_vsend(syslog_socket *log, int32_t level, const char *format, va_list arguments) {
    static char line[LINE_BYTES];
    const int saved_errno = errno;
    if (!((1 << (level & LOG_PRIMASK)) & mask))
        return 0;
    const size_t head = write_head(log, level & LOG_PRIMASK, line, sizeof line);
    va_list again;
    va_copy(again, arguments);
    errno = saved_errno;
    const int text = vsnprintf(line + head, sizeof line - head, format, arguments);
    const size_t length = text < 0 ? head : head + static_cast<size_t>(text);
    int result = 0;
    char *longer = nullptr;
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
