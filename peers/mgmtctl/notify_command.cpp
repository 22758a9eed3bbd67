// A process between mgmtctl and the commands waits for them, so that their time limit is kept while mgmtctl
// waits for mgmtd.
//
// It is the "subreaper" of the commands' children: it inherits those that outlive their command. A command
// has finished when no process of its group is left; until then the number of the group cannot be reused.
#include "peers/mgmtctl/notify_command.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <filesystem>

#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

extern "C" {
#include <sys/pidfd.h> // without extern "C" of its own in glibc 2.36
}

#include "peers/mgmtctl/show_model.h"
#include "runtime/common.h"
#include "runtime/ttime.h"

namespace {

// --- Which files are commands

bool is_command_name(const std::string &name) {
    return std::all_of(name.begin(), name.end(), [](char c) {
        return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' ||
               c == '_';
    });
}

// "" if only root can have written it.
std::string why_not_trusted(const struct stat &about) {
    if (about.st_uid != 0)
        return "does not belong to root";
    if ((about.st_mode & S_IWOTH) || ((about.st_mode & S_IWGRP) && about.st_gid != 0))
        return "others than root may write to it";
    return "";
}

std::string why_refused(const std::string &path, const std::string &name) {
    struct stat about = {};
    if (!is_command_name(name))
        return "the name of a command has letters, digits, \"-\" and \"_\" only";
    if (lstat(path.c_str(), &about) != 0)
        return strerror(errno);
    if (!S_ISREG(about.st_mode))
        return "is not a regular file";
    if (const std::string why = why_not_trusted(about); !why.empty())
        return why;
    return access(path.c_str(), X_OK) != 0 ? "is not executable by this user" : "";
}

// --- Running one

sigset_t awaited_signals() {
    sigset_t set;
    sigemptyset(&set);
    for (const int number : {SIGCHLD, SIGTERM, SIGINT, SIGHUP})
        sigaddset(&set, number);
    return set;
}

[[noreturn]] void become_command(const notify_run &run, const std::string &path) {
    setpgid(0, 0);
    sigset_t none;
    sigemptyset(&none);
    for (int number = 1; number < NSIG; number++) // ignored signals would remain ignored
        signal(number, SIG_DFL);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    // Standard output and error stay those of the service: its log.
    const int nothing = open("/dev/null", O_RDWR);
    if (nothing < 0 || dup2(nothing, STDIN_FILENO) < 0 || chdir("/") != 0)
        _exit(127);
    close_range(3, ~0U, 0);
    std::vector<std::string> kept = run.environment;
    for (char **each = environ; *each; each++)
        // Variables of the service's own environment could pass for those of the change.
        if (strncmp(*each, "WCCP_", 5) != 0)
            kept.emplace_back(*each);
    std::vector<char *> environment;
    environment.reserve(kept.size() + 1);
    for (std::string &each : kept)
        environment.push_back(each.data());
    environment.push_back(nullptr);
    std::string program = path;
    char *arguments[] = {program.data(), nullptr};
    execve(path.c_str(), arguments, environment.data());
    _exit(127);
}

std::string describe_end(int status) {
    return WIFSIGNALED(status) ? std::string("was ended by ") + lc_signal_num_to_name(WTERMSIG(status))
                               : "exited with " + std::to_string(WEXITSTATUS(status));
}

// Whether the group has no process left. `out_status` gets the status of its leader.
bool reap_group(pid_t group, int *out_status) {
    for (;;) {
        int status = 0;
        // Children of the command are reaped as well, because this process is their subreaper.
        const pid_t ended = waitpid(-group, &status, WNOHANG);
        if (ended == group)
            *out_status = status;
        if (ended < 0)
            return errno == ECHILD;
        if (ended == 0)
            return false;
    }
}

// Waits for one of the awaited signals; 0 at `due_ms`.
int wait_for_signal(int64_t due_ms) {
    const sigset_t set = awaited_signals();
    const int64_t left = std::max<int64_t>(due_ms - lt_monotonic_ms(), 0);
    const timespec limit = {static_cast<time_t>(left / 1000), static_cast<long>(left % 1000 * 1000000)};
    return std::max(sigtimedwait(&set, nullptr, &limit), 0);
}

notify_outcome wait_for_group(pid_t group, const notify_run &run, const std::string &path, bool *inout_stop) {
    int64_t due_ms = lt_monotonic_ms() + run.limit_ms;
    int sent = 0, status = 0;
    while (!reap_group(group, &status)) {
        const int got = wait_for_signal(due_ms);
        // A signal that stops the service shortens the wait once; further ones change nothing.
        if (got != 0 && got != SIGCHLD && !*inout_stop) {
            *inout_stop = true;
            due_ms = std::min(due_ms, lt_monotonic_ms() + run.patience_ms);
        }
        if (lt_monotonic_ms() < due_ms)
            continue;
        if (sent == SIGKILL) { // it cannot be killed, for example in a file system that hangs
            run.say(path + ": does not end");
            return NOTIFY_TIMED_OUT;
        }
        if (sent == 0)
            run.say(path + (*inout_stop
                                ? ": ended with this service"
                                : ": not done after " + std::to_string(run.limit_ms / 1000) + " s, ended"));
        // First SIGTERM; if that does not help within the patience, SIGKILL; then the command is given up
        // above.
        sent = sent == 0 ? SIGTERM : SIGKILL;
        kill(-group, sent);
        due_ms = lt_monotonic_ms() + run.patience_ms;
    }
    // Even if it exited with 0 after the signal.
    if (sent != 0)
        return NOTIFY_TIMED_OUT;
    if (status == 0)
        return NOTIFY_DONE;
    run.say(path + ": " + describe_end(status));
    return NOTIFY_FAILED;
}

} // namespace

notify_commands find_notify_commands(const std::string &directory) {
    notify_commands out;
    std::error_code failed;
    struct stat about = {};
    if (stat(directory.c_str(), &about) != 0) {
        if (errno != ENOENT)
            out.refused.push_back(directory + ": " + strerror(errno));
        return out;
    }
    const std::string distrust = why_not_trusted(about);
    std::vector<std::filesystem::path> found;
    for (std::filesystem::directory_iterator at(directory, failed), end; !failed && at != end;
         at.increment(failed))
        found.push_back(at->path());
    if (failed || !distrust.empty()) {
        out.refused.push_back(directory + ": " + (failed ? failed.message() : distrust));
        return out;
    }
    std::sort(found.begin(), found.end());
    for (const std::filesystem::path &path : found) {
        const std::string why = why_refused(path, path.filename());
        if (why.empty())
            out.paths.push_back(path);
        else
            out.refused.push_back(clean_text(path, 255) + ": " + why);
    }
    return out;
}

notify_outcome run_notify_commands(const notify_run &run) {
    notify_outcome worst = NOTIFY_DONE;
    bool stop = false;
    prctl(PR_SET_CHILD_SUBREAPER, 1);
    for (const std::string &path : run.paths) {
        if (stop)
            return NOTIFY_FAILED; // the others have not been run
        const pid_t pid = fork();
        if (pid == 0)
            become_command(run, path);
        if (pid < 0) {
            run.say(path + ": fork: " + strerror(errno));
            worst = std::max(worst, NOTIFY_FAILED);
            continue;
        }
        setpgid(pid, pid); // both processes do this, because either may be first
        worst = std::max(worst, wait_for_group(pid, run, path, &stop));
    }
    return worst;
}

bool start_notify_commands(const notify_run &run, pid_t *out_pid, int *out_pidfd) {
    const sigset_t set = awaited_signals();
    sigset_t before;
    sigprocmask(SIG_BLOCK, &set, &before); // signals must not reach this program's handlers in the child
    const pid_t parent = getpid(), pid = fork();
    if (pid != 0)
        sigprocmask(SIG_SETMASK, &before, nullptr);
    if (pid < 0)
        return false;
    if (pid == 0) {
        signal(SIGCHLD, SIG_DFL); // if it were ignored, waitpid would not report the commands
        prctl(PR_SET_PDEATHSIG, SIGTERM);
        // A parent that ended before prctl() sends no signal any more.
        _exit(getppid() == parent ? run_notify_commands(run) : NOTIFY_FAILED);
    }
    *out_pid = pid;
    *out_pidfd = pidfd_open(pid, 0);
    if (*out_pidfd >= 0)
        return true;
    // Without a pidfd the end of the process would not be noticed.
    const int error = errno;
    kill(pid, SIGTERM);
    waitpid(pid, nullptr, 0);
    errno = error;
    return false;
}
