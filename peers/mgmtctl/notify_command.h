// The commands of "mgmtctl notify": the files of a directory, run one after the other. Each has a process
// group of its own, which is ended when it takes too long.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include <sys/types.h>

struct notify_commands {
    std::vector<std::string> paths;   // in the order of their names
    std::vector<std::string> refused; // lines: the path, and why it is not run
};
// Finds the regular files of the directory whose names have only letters, digits, "-" and "_". A file is
// refused unless it is executable, belongs to root, and is writable by nobody else. All files are refused if
// the directory does not belong to root or is writable by others. A directory that does not exist has no
// files.
notify_commands find_notify_commands(const std::string &directory);

enum notify_outcome : int { NOTIFY_DONE = 0, NOTIFY_FAILED = 1, NOTIFY_TIMED_OUT = 2 };

struct notify_run {
    std::vector<std::string> paths;
    std::vector<std::string> environment; // "NAME=VALUE", in addition to the program's own
    int64_t limit_ms = 0;                 // for each command, with all processes that it has started
    int64_t patience_ms = 5000;           // from SIGTERM to SIGKILL, and for a command when the program ends
    std::function<void(const std::string &line)> say;
};
// Runs the commands and waits until they have finished; returns the worst outcome. SIGTERM, SIGINT, SIGHUP
// and SIGCHLD must be blocked: the first three give the running command `patience_ms` to finish and skip the
// others.
notify_outcome run_notify_commands(const notify_run &run);
// Does the same in a child process, whose exit code is the outcome and which gets SIGTERM if this program
// ends. `out_pidfd` becomes readable when the child exits; the caller closes it. False with errno.
bool start_notify_commands(const notify_run &run, pid_t *out_pid, int *out_pidfd);
