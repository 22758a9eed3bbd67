// Collects in the background the log lines of the process under test, with every level on. It owns /dev/log.
#pragma once

#include <algorithm>
#include <atomic>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "runtime/logging.h"
#include "tests/support/log_daemon.h"

struct gcl_log {
    log_daemon daemon;
    std::atomic<bool> stop{false};
    std::mutex mutex;
    std::vector<std::string> lines;
    std::thread reader;
    int marks = 0;

    gcl_log() {
        reader = std::thread([this] {
            while (!stop)
                for (const std::string &line : daemon.take(20, 1)) {
                    const std::lock_guard<std::mutex> guard(mutex);
                    lines.push_back(line);
                }
        });
        (void)lc_log_init("gcltest", nullptr, 0, 0x1060000, LC_LOG_DEBUG, 136, 1);
        (void)lc_log_set_daemon_log_level(LC_LOG_DEBUG);
    }
    ~gcl_log() {
        stop = true;
        reader.join();
    }
    // Datagrams arrive in order: once the mark has been read, everything sent before it has been read as
    // well.
    void settle() {
        sockaddr_un address = {AF_UNIX, "/dev/log"};
        const std::string mark = "mark " + std::to_string(++marks);
        const int sender = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        (void)sendto(sender, mark.data(), mark.size(), 0, reinterpret_cast<sockaddr *>(&address),
                     sizeof address);
        close(sender);
        for (int tries = 0; tries < 10000; tries++, usleep(500)) {
            const std::lock_guard<std::mutex> guard(mutex);
            if (std::find(lines.begin(), lines.end(), mark) != lines.end())
                return;
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
