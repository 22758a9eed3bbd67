// The log of a test that logs more than the socket's queue holds: a thread reads it all the time.
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
    int count_now(const std::string &part) {
        const std::lock_guard<std::mutex> guard(mutex);
        return static_cast<int>(std::count_if(lines.begin(), lines.end(), [&](const std::string &line) {
            return line.find(part) != std::string::npos;
        }));
    }
    // Lines arrive in order: once the mark has been read, so has everything that was logged before it.
    void settle() {
        const std::string mark = "mark " + std::to_string(++marks) + ".";
        for (int tries = 0; tries < 10000 && count_now(mark) == 0; tries++) {
            if (tries % 100 == 0) // again, in case the queue was full
                QV_LOG(LC_LOG_ERR, "%s", mark.c_str());
            usleep(500);
        }
    }
    int count(const std::string &part) {
        settle();
        return count_now(part);
    }
    void clear() {
        settle();
        const std::lock_guard<std::mutex> guard(mutex);
        lines.clear();
    }
};
