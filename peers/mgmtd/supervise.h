// The processes that mgmtd starts: started, seen to end, reported, started again. Without --supervise
// somebody else does, such as systemd, and mgmtd reports their ends by what it sees of their sessions.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include <poll.h>
#include <sys/types.h>

constexpr int64_t RESTART_DELAY_FIRST_MS = 1000, RESTART_DELAY_MAX_MS = 30000;
constexpr int64_t SETTLED_MS = 60000; // a run of this length starts the delays over
// From SIGTERM to SIGKILL. wccpd's orderly exit takes up to 5 s when tunneld doesn't answer.
constexpr int64_t END_PATIENCE_MS = 10000;

// For a child whose next run goes on with what the one before has left: from its end until the new process
// has a session. Only then is the loss reported.
constexpr int64_t TAKE_OVER_MS = 3000;
constexpr int64_t EARLIER_RUN_EVERY_MS = 200; // to the next look at a run that has to end first
constexpr int64_t SHORT_RUN_MS = 500;         // a run that has ended sooner is not started again at once

struct process_loss { // of a run whose next one may take over
    const char *event;
    std::string text; // "ended by SIGKILL"
    int64_t ended_ms;
};
struct child {
    std::string name;
    std::vector<std::string> command; // empty: somebody else starts it
    pid_t pid = 0;
    int pidfd = -1; // -1: does not run
    int64_t started_ms = 0, start_at_ms = 0, delay_ms = 0;
    int64_t kill_at_ms = -1;
    bool takes_over = false;
    bool has_session = false; // this run has opened one
    // Of a process that somebody else starts.
    int sessions = 0;          // that are open
    bool end_reported = false; // by the process itself, whose sessions are about to close
    std::optional<process_loss> loss = {};
    std::string last_end = {}; // "ended by SIGKILL"; "" before the first end
    // A file that each run holds locked, or "". The run of a mgmtd that was killed may not have ended yet,
    // and two at a time get into each other's way.
    std::string lock_file = {};
    int lock = -1;
    bool waits = false; // for the end of such a run
};
struct supervisor {
    std::vector<child> children; // in the order of their start
    std::function<int64_t()> now_ms;
    std::function<void(const std::string &line)> say;
    std::function<void(const std::string &event, const std::string &process)> tell;
    // A child has been started again after this end; null: nobody counts.
    std::function<void(const std::string &process, const std::string &last_end)> restarted;
    bool ending = false;
};

// The program and its options from a command line, which is split at blanks; nothing is quoted. Empty for one
// that has no word.
std::vector<std::string> command_words(const std::string &line);
// Appends what becomes readable when a process ends.
void supervisor_watch(const supervisor &self, std::vector<pollfd> *inout);
// Takes in who has ended.
void supervisor_reap(supervisor *self);
// The session of this name, "tunneld-123", is open, or has been.
void supervisor_session_opened(supervisor *self, const std::string &name);
void supervisor_session_closed(supervisor *self, const std::string &name);
// A report of the end of a process. False when it is not to be passed on: the supervisor sees the end itself.
bool supervisor_take_report(supervisor *self, const std::string &process);
// Starts who is due, or when ending, ends one after the other, the last started first. Gives the time of the
// next thing to do, or -1.
int64_t supervisor_tick(supervisor *self);
bool supervisor_is_done(const supervisor &self); // nobody runs
// What an end is called: the event, by the wait status.
const char *end_event(int wait_status, bool ending);
// The delay before the next start, after a run of so long after a delay of `before_ms`.
int64_t next_delay(int64_t before_ms, int64_t ran_ms);
