// The log daemon's socket, written without ever blocking the caller for long. The bytes are those that the C
// library's vsyslog sends. Callers hold the log state's lock, but for syslog_set_mask.
#pragma once

#include <cstdarg>
#include <cstddef>
#include <cstdint>

#include <sys/types.h>

struct syslog_socket {
    char ident[32];
    bool with_pid;
    int32_t facility;
    int fd; // -1 closed
    bool stream;
    dev_t device; // of the socket file that was connected to
    ino_t inode;
    int64_t patience_ns; // waiting that is left until a line gets through again
};

constexpr int64_t SYSLOG_PATIENCE_NS = 30000000;

void syslog_socket_open(syslog_socket *log, const char *ident, bool with_pid, int32_t facility);
void syslog_socket_close(syslog_socket *log);
// 0 when the line has gone or the mask stops it, else the errno: EAGAIN when the log daemon doesn't read.
// A "%m" in the format means errno as it is.
int syslog_socket_vsend(syslog_socket *log, int32_t level, const char *format, va_list arguments)
    __attribute__((format(printf, 3, 0)));
int syslog_socket_send(syslog_socket *log, int32_t level, const char *format, ...)
    __attribute__((format(printf, 3, 4)));

// Passes levels up to this one: bit n of the mask is level n.
void syslog_set_mask(int32_t level);
