// The log daemon's socket, written without ever blocking the caller for long. The bytes are those that the C
// library's vsyslog sends. Callers hold the log state's lock.
#pragma once

#include <cstddef>
#include <cstdint>

struct syslog_socket {
    char ident[32];
    bool with_pid;
    int32_t facility;
    int fd; // -1 closed
    bool stream;
    int32_t patience_ms; // waiting that is left until a line gets through again
};

constexpr int32_t SYSLOG_PATIENCE_MS = 20;

void syslog_socket_open(syslog_socket *log, const char *ident, bool with_pid, int32_t facility);
void syslog_socket_close(syslog_socket *log);
// 0 when the line has gone, else the errno: EAGAIN when the log daemon doesn't read.
int syslog_socket_send(syslog_socket *log, int32_t level, const char *text, size_t length);
