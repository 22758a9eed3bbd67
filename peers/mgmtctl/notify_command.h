// The commands of "mgmtctl notify": files of a directory, run one after the other. Each has a process group
// of its own, which is ended when it takes too long.
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
// The regular files of the directory whose names have letters, digits, "-" and "_" only. A file is refused
// unless it is executable, root's, and writable by nobody else; so are all files of a directory that is not
// root's, or that others may write to. A directory that does not exist has none.
notify_commands find_notify_commands(const std::string &directory);

enum notify_outcome : int { NOTIFY_DONE = 0, NOTIFY_FAILED = 1, NOTIFY_TIMED_OUT = 2 };

struct notify_run {
    std::vector<std::string> paths;
    std::vector<std::string> environment; // "NAME=VALUE", in addition to the program's own
    int64_t limit_ms = 0;                 // for each command, with all that it has started
    int64_t patience_ms = 5000;           // from SIGTERM to SIGKILL, and for a command when the program ends
    std::function<void(const std::string &line)> say;
};
// Runs the commands and waits for their ends. SIGTERM, SIGINT and SIGHUP, which have to be blocked along with
// SIGCHLD, leave the command that runs `patience_ms` and skip the others. The worst outcome.
notify_outcome run_notify_commands(const notify_run &run);
// The same in a process of its own, which ends with the outcome as its code, and by SIGTERM if this program
// ends before it. Gives its number and a descriptor that becomes readable at its end; false with errno.
bool start_notify_commands(const notify_run &run, pid_t *out_pid, int *out_pidfd);
