// What the process under test writes to the log: a reader of /dev/log, which is the test's own.
#pragma once

#include <algorithm>
#include <atomic>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "runtime/logging.h"

struct gcl_log {
    int fd = -1;
    std::atomic<bool> stop{false};
    std::mutex mutex;
    std::vector<std::string> lines;
    std::thread reader;
    int marks = 0;

    gcl_log() {
        fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        snprintf(address.sun_path, sizeof address.sun_path, "/dev/log");
        unlink(address.sun_path);
        if (bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof address) != 0)
            perror("bind /dev/log");
        reader = std::thread([this] {
            while (!stop) {
                pollfd watched = {fd, POLLIN, 0};
                if (poll(&watched, 1, 20) <= 0)
                    continue;
                char text[4096];
                const ssize_t got = recv(fd, text, sizeof text, 0);
                if (got <= 0)
                    continue;
                const std::lock_guard<std::mutex> guard(mutex);
                lines.emplace_back(text, static_cast<size_t>(got));
            }
        });
        (void)lc_log_init("gcltest", nullptr, 0, 0x1060000, LC_LOG_DEBUG, 136, 1);
        (void)lc_log_set_daemon_log_level(LC_LOG_DEBUG);
    }
    ~gcl_log() {
        stop = true;
        reader.join();
        close(fd);
        unlink("/dev/log");
    }
    // Datagrams come in order: once the mark has been read, so has everything that was sent before it.
    void settle() {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        snprintf(address.sun_path, sizeof address.sun_path, "/dev/log");
        const std::string mark = "mark " + std::to_string(++marks);
        const int sender = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        (void)sendto(sender, mark.data(), mark.size(), 0, reinterpret_cast<sockaddr *>(&address),
                     sizeof address);
        close(sender);
        for (int tries = 0; tries < 10000; tries++) {
            {
                const std::lock_guard<std::mutex> guard(mutex);
                if (!lines.empty() && lines.back() == mark) {
                    lines.pop_back();
                    return;
                }
                if (std::find(lines.begin(), lines.end(), mark) != lines.end())
                    return;
            }
            usleep(500);
        }
    }
    int count(const std::string &part) {
        settle();
        const std::lock_guard<std::mutex> guard(mutex);
        return static_cast<int>(std::count_if(lines.begin(), lines.end(), [&](const std::string &line) {
            return line.find(part) != std::string::npos;
        }));
    }
    void clear() {
        settle();
        const std::lock_guard<std::mutex> guard(mutex);
        lines.clear();
    }
};
