// The log lines of a test, all but debug. It owns /dev/log. Lines wait in the socket's short queue: take them
// after each step.
#pragma once

#include <string>

struct log_lines {
    log_lines();
    ~log_lines();
    log_lines(const log_lines &) = delete;
    log_lines &operator=(const log_lines &) = delete;

    // All lines since the last call.
    std::string take();
    // Whether the lines since the last call contain this text.
    bool say(const std::string &text) { return take().find(text) != std::string::npos; }

    int fd;
};
