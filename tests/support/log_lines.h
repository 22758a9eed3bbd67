// The log lines of a test, all but debug. They wait in the socket's short queue: take them after each step.
#pragma once

#include "runtime/logging.h"
#include "tests/support/log_daemon.h"

// How often a text contains another.
inline int count_of(const std::string &part, const std::string &in) {
    int count = 0;
    for (size_t at = 0; (at = in.find(part, at)) != std::string::npos; at++)
        count++;
    return count;
}

struct log_lines {
    log_daemon daemon;

    log_lines() {
        lc_log_init("wccpd", "wccpd", 0, 0x1060000, LC_LOG_INFO, 128, 1);
        lc_log_set_daemon_log_level(LC_LOG_INFO);
    }
    ~log_lines() {
        lc_log_set_daemon_log_level(-1);
        lc_log_close();
    }
    // All lines since the last call.
    std::string take() {
        std::string lines;
        for (const std::string &line : daemon.take(0))
            lines += line + '\n';
        return lines;
    }
    // Whether the lines since the last call contain this text.
    bool say(const std::string &text) { return take().find(text) != std::string::npos; }
};
