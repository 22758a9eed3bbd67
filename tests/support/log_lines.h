// The log of a test: takes /dev/log for its lifetime and lets every level but debug through. What comes waits
// in the socket's queue, which is short: take it after each step.
#pragma once

#include <string>

struct log_lines {
    log_lines();
    ~log_lines();
    log_lines(const log_lines &) = delete;
    log_lines &operator=(const log_lines &) = delete;

    // All lines since the last call, each as its datagram was.
    std::string take();
    // Whether they hold this text.
    bool say(const std::string &text) { return take().find(text) != std::string::npos; }

    int fd;
};
