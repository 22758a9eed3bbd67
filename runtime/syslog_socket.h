// A client of the syslog daemon's socket that never blocks its caller for long. It sends the same bytes as
// vsyslog(3). Callers hold the lock of the log state, except for syslog_set_mask.
#pragma once

#include <cstdarg>
#include <cstddef>
#include <cstdint>

#include <sys/types.h>

struct syslog_socket {
    char ident[32];
    bool with_pid;
    int32_t facility;
    int fd;       // -1: not connected
    bool stream;  // a stream socket, otherwise datagrams
    dev_t device; // of the socket file to which it was connected
    ino_t inode;
    int64_t patience_ns; // how long lines may still wait, in all, before one is sent successfully
};

constexpr int64_t SYSLOG_PATIENCE_NS = 30000000; // 30 ms

void syslog_socket_open(syslog_socket *log, const char *ident, bool with_pid, int32_t facility);
void syslog_socket_close(syslog_socket *log);
// Sends a line. Returns 0 when it was sent or the mask suppresses it, else an errno: EAGAIN if the daemon
// doesn't read. "%m" in the format is the caller's errno.
int syslog_socket_vsend(syslog_socket *log, int32_t level, const char *format, va_list arguments)
    __attribute__((format(printf, 3, 0)));
int syslog_socket_send(syslog_socket *log, int32_t level, const char *format, ...)
    __attribute__((format(printf, 3, 4)));

// Only lines up to this level are sent from now on. Any thread, without a lock.
void syslog_set_mask(int32_t level);
