#include "lab/router/tools.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>

namespace lab {
namespace {

constexpr const char *LOG_SOCKET = "/dev/log";

volatile sig_atomic_t ended;

bool fill_address(const std::string &path, sockaddr_un *place) {
    *place = {};
    place->sun_family = AF_UNIX;
    if (path.size() >= sizeof place->sun_path) {
        errno = ENAMETOOLONG;
        return false;
    }
    // The NUL is there already.
    memcpy(place->sun_path, path.c_str(), path.size());
    return true;
}

} // namespace

int listen_at(const std::string &path) {
    sockaddr_un place;
    if (!fill_address(path, &place))
        return -1;
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return -1;
    // A socket of an earlier run.
    unlink(path.c_str());
    if (bind(fd, reinterpret_cast<const sockaddr *>(&place), sizeof place) != 0 || listen(fd, 16) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

int run_logd(const std::string &file) {
    const int out =
        file == "-" ? STDOUT_FILENO : open(file.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    sockaddr_un place;
    const int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    unlink(LOG_SOCKET);
    if (out < 0 || fd < 0 || !fill_address(LOG_SOCKET, &place) ||
        bind(fd, reinterpret_cast<const sockaddr *>(&place), sizeof place) != 0) {
        perror("logd");
        return 1;
    }
    struct sigaction action = {};
    // Without SA_RESTART, so that a signal ends recv.
    action.sa_handler = [](int) { ended = 1; };
    sigaction(SIGTERM, &action, nullptr);
    sigaction(SIGINT, &action, nullptr);
    signal(SIGCHLD, SIG_IGN); // the kernel reaps zombies
    char line[8192];
    while (!ended) {
        ssize_t length = recv(fd, line, sizeof line - 1, 0);
        if (length < 0 && errno != EINTR)
            break;
        // Programs end their datagrams with a newline, a NUL, or neither.
        while (length > 0 && (line[length - 1] == '\n' || line[length - 1] == '\0'))
            length--;
        if (length <= 0)
            continue;
        line[length++] = '\n';
        if (write(out, line, static_cast<size_t>(length)) != length)
            break;
    }
    unlink(LOG_SOCKET);
    return ended ? 0 : 1;
}

int run_ctl(const std::string &socket_path, const std::string &command) {
    sockaddr_un place;
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0 || !fill_address(socket_path, &place) ||
        connect(fd, reinterpret_cast<const sockaddr *>(&place), sizeof place) != 0) {
        fprintf(stderr, "wccp_router ctl: %s: %s\n", socket_path.c_str(), strerror(errno));
        return 2;
    }
    const std::string line = command + "\n";
    if (send(fd, line.data(), line.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(line.size()))
        return 2;
    // The router answers after a line or the end of the input.
    shutdown(fd, SHUT_WR);
    char part[4096];
    std::string answer;
    for (ssize_t got; (got = read(fd, part, sizeof part)) > 0;)
        answer.append(part, static_cast<size_t>(got));
    fwrite(answer.data(), 1, answer.size(), stdout);
    if (answer.empty())
        return 2;
    return answer.starts_with("error:") ? 1 : 0;
}

} // namespace lab
