#include "tests/support/log_lines.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>

#include "runtime/logging.h"

static constexpr const char *LOG_SOCKET = "/dev/log";

log_lines::log_lines() : fd(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    unlink(LOG_SOCKET);
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    strcpy(address.sun_path, LOG_SOCKET);
    EXPECT_EQ(bind(fd, reinterpret_cast<const sockaddr *>(&address), sizeof address), 0);
    lc_log_init("wccpd", "wccpd", 0, 0x1060000, LC_LOG_INFO, 128, 1);
    lc_log_set_daemon_log_level(LC_LOG_INFO);
}

log_lines::~log_lines() {
    lc_log_set_daemon_log_level(-1);
    lc_log_close();
    close(fd);
    unlink(LOG_SOCKET);
}

std::string log_lines::take() {
    std::string lines;
    char line[4096];
    ssize_t length;
    while ((length = recv(fd, line, sizeof line, MSG_DONTWAIT)) > 0)
        lines.append(line, static_cast<size_t>(length)) += '\n';
    return lines;
}
