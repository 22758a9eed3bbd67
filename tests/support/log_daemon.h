// A log daemon for tests: owns /dev/log and reads on request.
#pragma once

#include <cstring>
#include <string>
#include <vector>

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

struct log_daemon {
    int type;
    int listener = -1; // the datagram socket, or the listening one of a stream
    int accepted = -1;
    std::string partial;

    explicit log_daemon(int socket_type = SOCK_DGRAM) : type(socket_type) { start(); }
    ~log_daemon() { stop(); }

    void start() {
        unlink("/dev/log");
        listener = socket(AF_UNIX, type | SOCK_CLOEXEC, 0);
        sockaddr_un address = {AF_UNIX, "/dev/log"};
        if (bind(listener, reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0)
            perror("bind /dev/log");
        if (type == SOCK_STREAM)
            listen(listener, 4);
    }
    void stop() {
        close(accepted);
        close(listener);
        accepted = listener = -1;
        unlink("/dev/log");
    }

    // The lines that arrive until there has been none for `quiet_ms`, or until there are `enough`.
    std::vector<std::string> take(int quiet_ms = 20, size_t enough = SIZE_MAX) {
        std::vector<std::string> lines;
        for (;;) {
            const bool waits = type == SOCK_STREAM && accepted < 0;
            pollfd watched = {type == SOCK_STREAM && !waits ? accepted : listener, POLLIN, 0};
            if (lines.size() >= enough || poll(&watched, 1, quiet_ms) <= 0)
                return lines;
            if (waits) {
                accepted = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
                continue;
            }
            char text[65536];
            const ssize_t got = recv(watched.fd, text, sizeof text, 0);
            if (got <= 0) {
                close(accepted);
                accepted = -1;
                continue;
            }
            partial.append(text, static_cast<size_t>(got));
            if (type == SOCK_DGRAM) {
                lines.push_back(partial);
                partial.clear();
                continue;
            }
            for (size_t end; (end = partial.find('\0')) != std::string::npos; partial.erase(0, end + 1))
                lines.push_back(partial.substr(0, end));
        }
    }
    // The only line that has arrived, otherwise a text with their number.
    std::string one() {
        const std::vector<std::string> lines = take();
        return lines.size() == 1 ? lines[0] : std::to_string(lines.size()) + " lines";
    }
};
