// Supervises tunneld and wccpd: starts them, reports their ends and starts them again. Without --supervise
// another program, such as systemd, starts them, and their ends are known by their sessions only.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include <poll.h>
#include <sys/types.h>

constexpr int64_t RESTART_DELAY_FIRST_MS = 1000, RESTART_DELAY_MAX_MS = 30000;
constexpr int64_t SETTLED_MS = 60000; // after a run of this length the delays begin with the first one again
// From SIGTERM to SIGKILL. wccpd's orderly exit takes up to 5 s when tunneld doesn't answer.
constexpr int64_t END_PATIENCE_MS = 10000;

// A child that takes over continues with what its predecessor has left. Its loss is reported only if the new
// process has no session within this time.
constexpr int64_t TAKE_OVER_MS = 3000;
constexpr int64_t EARLIER_RUN_EVERY_MS = 200; // between two checks whether an earlier run has ended
constexpr int64_t SHORT_RUN_MS = 500;         // after a shorter run the next start is delayed

struct process_loss { // that is not reported yet, because the next run may take over
    const char *event;
    std::string text; // "ended by SIGKILL"
    int64_t ended_ms;
};
struct child {
    std::string name;
    std::vector<std::string> command; // empty: another program starts it
    pid_t pid = 0;
    int pidfd = -1; // -1: it does not run
    int64_t started_ms = 0, start_at_ms = 0, delay_ms = 0;
    int64_t kill_at_ms = -1;
    bool takes_over = false;
    bool has_session = false; // this run has opened a session
    // For a process that another program starts:
    int sessions = 0;          // that are open
    bool end_reported = false; // the process has reported its end itself; its sessions are about to close
    std::optional<process_loss> loss = {};
    std::string last_end = {}; // "ended by SIGKILL"; "" before the first end
    // A file that each run keeps locked; "": none. A run that a killed mgmtd has started may still be ending,
    // and two runs at a time would disturb each other.
    std::string lock_file = {};
    int lock = -1;
    bool waits = false; // for the end of such an earlier run
};
struct supervisor {
    std::vector<child> children; // in the order of their start
    std::function<int64_t()> now_ms;
    std::function<void(const std::string &line)> say;
    std::function<void(const std::string &event, const std::string &process)> report;
    // Called after a child has been started again, with how it ended before; may be null.
    std::function<void(const std::string &process, const std::string &last_end)> restarted;
    bool ending = false; // the children are being ended
};

// Splits a command line at blanks. There are no quotes.
std::vector<std::string> command_words(const std::string &line);
// Appends descriptors that become readable when a child ends.
void supervisor_watch(const supervisor &self, std::vector<pollfd> *inout);
// Handles the ends of children.
void supervisor_reap(supervisor *self);
// To be called when a session, "tunneld-123", has opened or closed.
void supervisor_session_opened(supervisor *self, const std::string &name);
void supervisor_session_closed(supervisor *self, const std::string &name);
// Takes the report of a process's end. False: it is not to be passed on, because the supervisor sees the end
// itself.
bool supervisor_take_report(supervisor *self, const std::string &process);
// Starts the children that are due. When ending, ends them one after the other, the one that was started last
// first. Returns the time of the next work, or -1.
int64_t supervisor_tick(supervisor *self);
bool supervisor_is_done(const supervisor &self); // no child runs
// The event for a wait status.
const char *end_event(int wait_status, bool ending);
// The delay before the next start, after a run of `ran_ms` that was started after a delay of `before_ms`.
int64_t next_delay(int64_t before_ms, int64_t ran_ms);
