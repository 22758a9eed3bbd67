// The end of a child is reported at once, and the child is started again after a delay. The delay doubles
// with each end, from one second to thirty, and starts over after a long run. wccpd exits when it receives
// the report that tunneld has ended, and is started again like any child. Children get default signal
// handling, an empty signal mask, and SIGTERM if mgmtd dies before them, so that the next mgmtd finds none of
// them running.
//
// A child that takes over (tunneld) is different. If it crashes or fails after it has had a session, it is
// started again at once, and its loss is reported only if the new process has no session in time: what the
// old process has made in the kernel is still there, and the new one continues with it.
//
// A process that another program starts is known by its sessions. When its last session closes, it has ended,
// in a way that mgmtd cannot know. For a process that can be taken over this counts as a crash, which is
// reported unless the next process has a session in time. An orderly end removes what the process has made in
// the kernel, and must be reported at once; the process therefore reports it itself.
//
// A child is referred to by a descriptor and not by its number, which the kernel may give to another process
// once the child has been waited for.
#include "peers/mgmtd/supervise.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <iterator>
#include <sstream>
#include <utility>

#include <fcntl.h>
#include <sys/file.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

extern "C" {
#include <sys/pidfd.h> // without extern "C" of its own in glibc 2.36
}

#include "mgmt/node_paths.h"
#include "runtime/common.h"
#include "runtime/logging.h"

std::vector<std::string> command_words(const std::string &line) {
    std::istringstream words(line);
    return {std::istream_iterator<std::string>(words), {}};
}

int64_t next_delay(int64_t before_ms, int64_t ran_ms) {
    // 0 also after an immediate restart, so that the delays begin anew.
    if (before_ms == 0 || ran_ms >= SETTLED_MS)
        return RESTART_DELAY_FIRST_MS;
    return std::min(before_ms * 2, RESTART_DELAY_MAX_MS);
}

const char *end_event(int wait_status, bool ending) {
    // SIGTERM is how an operator ends a program: not a crash, although a signal has ended it.
    if (ending || (WIFSIGNALED(wait_status) && WTERMSIG(wait_status) == SIGTERM))
        return EVENT_PROCESS_TERMINATE;
    return WIFSIGNALED(wait_status) ? EVENT_PROCESS_CRASH : EVENT_PROCESS_EXIT;
}

namespace {

std::string end_text(int wait_status) {
    return WIFSIGNALED(wait_status) ? std::string("ended by ") + lc_signal_num_to_name(WTERMSIG(wait_status))
                                    : "exited with " + std::to_string(WEXITSTATUS(wait_status));
}

[[noreturn]] void exec_child(const std::vector<std::string> &command, pid_t parent, int lock) {
    prctl(PR_SET_PDEATHSIG, SIGTERM);
    // mgmtd may have died before prctl took effect; no signal would follow.
    if (getppid() != parent)
        _exit(127);
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
    for (int number = 1; number < NSIG; number++) // ignored signals would stay ignored in the program
        signal(number, SIG_DFL);
    if (lock >= 0)
        // The lock belongs to the open file, which the program now inherits and keeps until it ends.
        fcntl(lock, F_SETFD, 0);
    std::vector<char *> arguments;
    arguments.reserve(command.size() + 1);
    for (const std::string &word : command)
        // execvp does not write to its arguments.
        arguments.push_back(const_cast<char *>(word.c_str()));
    arguments.push_back(nullptr);
    execvp(arguments[0], arguments.data());
    dprintf(STDERR_FILENO, "%s: %s\n", arguments[0], strerror(errno));
    // Not exit(): buffers and exit handlers inherited from mgmtd must not run here.
    _exit(127);
}

// Null, or the name of the call that failed, with errno.
const char *fork_child(child *process) {
    const pid_t parent = getpid();
    signal(SIGCHLD, SIG_DFL); // if it were ignored, the kernel would discard the child's status
    const pid_t pid = fork();
    if (pid == 0)
        exec_child(process->command, parent, process->lock);
    if (pid < 0)
        return "fork";
    process->pid = pid;
    process->pidfd = pidfd_open(pid, 0); // the number is valid until the child is waited for
    if (process->pidfd >= 0)
        return nullptr;
    // A child without a descriptor could not be watched; kill and waitpid overwrite errno.
    const int error = errno;
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
    errno = error;
    return "pidfd_open";
}

// False while a run that an earlier mgmtd started still holds the lock. The program inherits the lock and
// keeps it until it ends. If the lock file cannot be made, the program is started without it.
bool lock_run(child *process) {
    if (process->lock_file.empty())
        return true;
    process->lock = open(process->lock_file.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    // The lock is on a file of its own and not on a process id, so that a killed mgmtd leaves nothing to
    // clean up.
    if (process->lock < 0 || flock(process->lock, LOCK_EX | LOCK_NB) == 0)
        return true;
    close(process->lock);
    process->lock = -1;
    return false;
}

void start_child(supervisor *self, child *process) {
    if (!lock_run(process)) {
        if (!process->waits)
            self->say("process " + process->name + ": an earlier one still runs; waits for its end");
        process->waits = true;
        process->start_at_ms = self->now_ms() + EARLIER_RUN_EVERY_MS;
        return;
    }
    process->waits = false;
    const char *failed = fork_child(process);
    const int error = errno;
    // Only this copy: the child's descriptor keeps the lock.
    if (process->lock >= 0)
        close(process->lock);
    process->lock = -1;
    process->started_ms = self->now_ms();
    if (failed) {
        const std::string reason = strerror(error);
        // Counts as a run of no length; the failure may be a lack of memory or processes that passes.
        process->delay_ms = next_delay(process->delay_ms, 0);
        process->start_at_ms = process->started_ms + process->delay_ms;
        self->say("process " + process->name + ": " + failed + ": " + reason);
        return;
    }
    process->kill_at_ms = -1;
    process->has_session = false;
    self->say("process " + process->name + ": started, pid " + std::to_string(process->pid));
    if (self->restarted && !process->last_end.empty())
        self->restarted(process->name, process->last_end);
}

} // namespace

void supervisor_watch(const supervisor &self, std::vector<pollfd> *inout) {
    for (const child &process : self.children)
        inout->push_back({process.pidfd, POLLIN, 0});
}

namespace {

// Whether the child has ended, and its wait status. If somebody else has waited for it, it counts as exited
// with 0.
bool has_ended(const child &process, int *out_status) {
    siginfo_t info = {};
    *out_status = 0;
    if (process.pidfd < 0)
        return false;
    if (waitid(P_PIDFD, static_cast<id_t>(process.pidfd), &info, WEXITED | WNOHANG) != 0)
        // ECHILD: there is no status to wait for, and nothing would ever come.
        return errno == ECHILD;
    // With WNOHANG this is how waitid reports that the child still runs.
    if (info.si_pid == 0)
        return false;
    // waitid has no wait status; a signal's number is one by itself.
    *out_status = info.si_code == CLD_EXITED ? W_EXITCODE(info.si_status, 0) : info.si_status;
    return true;
}

bool is_orderly(int wait_status) {
    return WIFSIGNALED(wait_status) ? WTERMSIG(wait_status) == SIGTERM : WEXITSTATUS(wait_status) == 0;
}

void take_end(supervisor *self, child *process, int status) {
    const int64_t now = self->now_ms(), ran = now - process->started_ms;
    // After an orderly end the tunnels are gone, and there is nothing to take over.
    const bool may_be_replaced = process->takes_over && !self->ending && !is_orderly(status);
    process->last_end = end_text(status);
    // If the replacement fails too, the loss counts from the first end.
    if (may_be_replaced && process->has_session && !process->loss)
        process->loss = {end_event(status, false), end_text(status), now};
    // A child that crashes right after it has opened its session must not be restarted in a tight loop.
    process->delay_ms =
        process->loss && process->has_session && ran >= SHORT_RUN_MS ? 0 : next_delay(process->delay_ms, ran);
    process->start_at_ms = now + process->delay_ms;
    if (may_be_replaced && process->loss && process->delay_ms == 0)
        return; // a later line says whether it has been replaced
    self->say("process " + process->name + ": " + end_text(status) +
              (self->ending ? "" : ", starts again in " + std::to_string(process->delay_ms / 1000) + " s"));
    // report_loss() reports it unless a new run has a session in time.
    if (may_be_replaced && process->loss)
        return;
    process->loss.reset();
    self->report(end_event(status, self->ending), process->name);
}

} // namespace

void supervisor_reap(supervisor *self) {
    for (child &process : self->children) {
        int status = 0;
        if (!has_ended(process, &status))
            continue;
        close(process.pidfd);
        process.pidfd = -1;
        take_end(self, &process, status);
    }
}

namespace {

bool is_session_of(const child &process, const std::string &name) {
    // Its process id is not known: every session with its name counts.
    if (process.command.empty())
        return name.starts_with(process.name + "-");
    // A late session of an earlier run is not one of this child.
    return process.pidfd >= 0 && name == process.name + "-" + std::to_string(process.pid);
}

} // namespace

void supervisor_session_opened(supervisor *self, const std::string &name) {
    for (child &process : self->children) {
        if (!is_session_of(process, name))
            continue;
        process.has_session = true;
        process.sessions++;
        process.end_reported = false;
        if (process.loss)
            self->say("process " + process.name + ": " + process.loss->text + ", replaced after " +
                      std::to_string(self->now_ms() - process.loss->ended_ms) + " ms");
        process.loss.reset();
    }
}

void supervisor_session_closed(supervisor *self, const std::string &name) {
    for (child &process : self->children) {
        // The end of a child is known from its descriptor. wccpd has two sessions, and only the last one to
        // close counts.
        if (!process.command.empty() || !is_session_of(process, name) || --process.sessions > 0 ||
            process.end_reported || self->ending)
            continue;
        if (process.takes_over)
            process.loss = {EVENT_PROCESS_CRASH, "its session is lost", self->now_ms()};
        else
            self->report(EVENT_PROCESS_EXIT, process.name);
    }
}

bool supervisor_take_report(supervisor *self, const std::string &process) {
    for (child &each : self->children) {
        if (each.name != process)
            continue;
        // The supervisor has the exit status, which is more reliable than the report.
        if (!each.command.empty())
            return false;
        // The sessions are about to close and would otherwise be reported as another end.
        each.end_reported = true;
        each.loss.reset();
    }
    return true;
}

namespace {

// Reports the loss of a child that nobody has replaced in time. Returns when to call it again, or -1.
int64_t report_loss(supervisor *self, child *process, int64_t now) {
    if (!process->loss)
        return -1;
    const int64_t due = process->loss->ended_ms + TAKE_OVER_MS;
    if (now < due)
        return due;
    const process_loss loss = *std::exchange(process->loss, std::nullopt);
    self->say("process " + process->name + ": " + loss.text + ", not replaced in " +
              std::to_string(TAKE_OVER_MS) + " ms");
    self->report(loss.event, process->name);
    return -1;
}

int64_t end_last(supervisor *self, int64_t now) {
    // wccpd first: during its orderly exit it still needs tunneld, which deletes the tunnels. The next child
    // is signalled only after this one has ended.
    for (auto process = self->children.rbegin(); process != self->children.rend(); ++process) {
        if (process->pidfd < 0)
            continue;
        if (process->kill_at_ms < 0) {
            pidfd_send_signal(process->pidfd, SIGTERM, nullptr, 0);
            process->kill_at_ms = now + END_PATIENCE_MS;
        } else if (now >= process->kill_at_ms) {
            self->say("process " + process->name + ": does not end, killed");
            pidfd_send_signal(process->pidfd, SIGKILL, nullptr, 0);
            process->kill_at_ms = now + END_PATIENCE_MS;
        }
        return process->kill_at_ms;
    }
    return -1;
}

} // namespace

int64_t supervisor_tick(supervisor *self) {
    const int64_t now = self->now_ms();
    if (self->ending)
        return end_last(self, now);
    int64_t next = -1;
    for (child &process : self->children) {
        const bool may_start = process.pidfd < 0 && !process.command.empty();
        if (may_start && process.start_at_ms <= now)
            start_child(self, &process);
        // A start that failed or waits for an earlier run has set a new time meanwhile.
        for (const int64_t due :
             {may_start && process.pidfd < 0 ? process.start_at_ms : -1, report_loss(self, &process, now)})
            if (due >= 0 && (next < 0 || due < next))
                next = due;
    }
    return next;
}

bool supervisor_is_done(const supervisor &self) {
    return std::all_of(self.children.begin(), self.children.end(),
                       [](const child &process) { return process.pidfd < 0; });
}
