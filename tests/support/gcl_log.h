// Collects in the background the log lines of the process under test, with every level on. It owns /dev/log.
#pragma once

#include <atomic>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "runtime/logging.h"
#include "tests/support/log_lines.h"

struct gcl_log {
    log_daemon daemon;
    std::atomic<bool> stop{false};
    std::mutex mutex;
    std::string lines;
    std::thread reader;
    std::atomic<int> quiet{0}; // how often nothing came for a millisecond

    gcl_log() {
        reader = std::thread([this] {
            while (!stop) {
                const std::vector<std::string> got = daemon.take(1, 1);
                const std::lock_guard<std::mutex> guard(mutex);
                lines += got.empty() ? "" : got[0];
                quiet += got.empty();
            }
        });
        (void)lc_log_init("gcltest", nullptr, 0, 0x1060000, LC_LOG_DEBUG, 136, 1);
        (void)lc_log_set_daemon_log_level(LC_LOG_DEBUG);
    }
    ~gcl_log() {
        stop = true;
        reader.join();
    }
    // Waits until everything that was sent before has been read: the second time began after this call.
    void settle() {
        for (const int before = quiet; quiet < before + 2;)
            usleep(500);
    }
    int count(const std::string &part) {
        settle();
        const std::lock_guard<std::mutex> guard(mutex);
        return count_of(part, lines);
    }
    void clear() {
        settle();
        const std::lock_guard<std::mutex> guard(mutex);
        lines.clear();
    }
};
