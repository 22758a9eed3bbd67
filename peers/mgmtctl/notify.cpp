// "mgmtctl notify run" is a separate service without privileges, which follows mgmtd like any viewer. It can
// hang or be killed without harm to the appliance.
//
// Events report changes immediately. Every COMPARE_MS, in each new session and when a daemon has ended, all
// states are queried and compared with those for which commands have been run. These are kept in a file,
// which is written after the commands of a change have finished. A change that happens while the service is
// down is therefore reported late, and one whose commands were interrupted is reported again. Events that
// arrive during a query are applied after its answer. They may be older than the answer, but the event
// of the latest change is always applied last.
//
// Changes are reported one at a time. The reason is queried just before, while no command is running.
#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <iterator>

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/connection.h"
#include "peers/mgmtctl/group_words.h"
#include "peers/mgmtctl/notify_command.h"
#include "peers/mgmtctl/notify_words.h"
#include "peers/mgmtctl/show_gather.h"
#include "runtime/common.h"
#include "runtime/service_notify.h"
#include "runtime/ttime.h"

namespace {

constexpr int64_t COMPARE_MS = 60000;      // between two comparisons with the states of mgmtd
constexpr int64_t CONNECT_MS = 1000;       // between two attempts to reach mgmtd
constexpr int64_t GIVE_UP_MS = 30000;      // without mgmtd, before roles become UNKNOWN
constexpr int64_t LOOK_MS = 1000;          // longest wait, for the watchdog and signals that arrive before it
constexpr size_t BOOK_BYTES_MAX = 1 << 20; // of the file

const char *const FOLLOWED_EVENTS[] = {EVENT_ROLE_CHANGE,      EVENT_RAISE_ALARM,   EVENT_CLEAR_ALARM,
                                       EVENT_PROXY_CHANGE,     EVENT_PROCESS_CRASH, EVENT_PROCESS_EXIT,
                                       EVENT_PROCESS_TERMINATE};

void log_line(const std::string &line) {
    fprintf(stderr, "notify: %s\n", clean_text(line, 512).c_str());
}

int64_t clock_s() {
    return static_cast<int64_t>(time(nullptr));
}

// --- The service

struct notifier {
    const ctl_options &options;
    const ctl_notify_options &how;
    notify_book book;
    ctl_held_session session;
    int64_t connect_at_ms = 0, compare_at_ms = 0;
    int64_t lost_at_ms = 0;           // when mgmtd was lost; -1: it was not, or roles are already UNKNOWN
    std::string complaint;            // why mgmtd cannot be reached, as last logged
    std::vector<std::string> refused; // commands, as last logged
    std::string saved;                // content of the file
    pid_t runner = 0;                 // process that runs the commands of a change; 0: none
    int runner_fd = -1;
    uint64_t reported = 0, failed = 0, timed_out = 0;

    notifier(const ctl_options &given, const ctl_notify_options &wanted) : options(given), how(wanted) {
        book.say = log_line;
        book.clock_s = clock_s;
        lost_at_ms = lt_monotonic_ms();
    }
};

// Logs a complaint once, until it changes or ends.
void log_complaint(notifier *self, const std::string &complaint) {
    if (complaint != self->complaint && !complaint.empty())
        log_line(complaint);
    self->complaint = complaint;
}

// --- The file of the reported states

bool load_book(notifier *self) {
    std::ifstream in(self->how.state_file, std::ios::binary);
    if (!in)
        // Without a file, as at the first start, all subjects are in their first state.
        return errno == ENOENT;
    std::string text(BOOK_BYTES_MAX, '\0');
    in.read(text.data(), static_cast<std::streamsize>(text.size()));
    text.resize(static_cast<size_t>(in.gcount()));
    if (const size_t unreadable = notify_read_book(&self->book, text))
        log_line(self->how.state_file + ": " + std::to_string(unreadable) + " invalid lines are ignored");
    self->saved = text;
    return true;
}

void save_book(notifier *self) {
    const std::string text = notify_book_text(self->book), fresh = self->how.state_file + ".new";
    if (text == self->saved)
        return;
    std::ofstream out(fresh, std::ios::binary | std::ios::trunc);
    out << text;
    out.close();
    // The name always leads to a complete file, the old one or the new one.
    if (!out || rename(fresh.c_str(), self->how.state_file.c_str()) != 0)
        log_line(self->how.state_file + ": " + strerror(errno) +
                 "; after a restart, changes will be reported again");
    else
        self->saved = text;
}

// --- mgmtd

void lose_session(notifier *self, const std::string &reason) {
    self->session.reset();
    self->lost_at_ms = lt_monotonic_ms();
    self->connect_at_ms = self->lost_at_ms + CONNECT_MS;
    log_complaint(self, reason + "; changes are reported once it is back");
}

bool follow_mgmtd(notifier *self, std::string *out_reason) {
    self->session.reset(ctl_open(self->options.timeout_ms, out_reason));
    if (!self->session)
        return false;
    for (const char *event : FOLLOWED_EVENTS)
        if (!ctl_add_interest(self->session.get(), event, {}, out_reason))
            return false;
    return true;
}

void try_to_connect(notifier *self) {
    const int64_t now = lt_monotonic_ms();
    std::string reason;
    if (self->session || now < self->connect_at_ms)
        return;
    if (follow_mgmtd(self, &reason)) {
        log_line("follows mgmtd");
        self->complaint.clear();
        self->lost_at_ms = -1;
        // At once: changes may have been missed while there was no session.
        self->compare_at_ms = now;
        return;
    }
    self->session.reset();
    self->connect_at_ms = lt_monotonic_ms() + CONNECT_MS;
    log_complaint(self, reason);
    if (self->lost_at_ms >= 0 && now - self->lost_at_ms >= GIVE_UP_MS) {
        // So that the roles become UNKNOWN only once.
        self->lost_at_ms = -1;
        notify_compare(&self->book, notify_kind::role, {}); // wccpd doesn't run without mgmtd
    }
}

void compare_states(notifier *self) {
    self->compare_at_ms = lt_monotonic_ms() + COMPARE_MS;
    for (const notify_kind kind : {notify_kind::role, notify_kind::alarm, notify_kind::health}) {
        ctl_reply reply;
        std::string reason;
        if (!ctl_query(self->session.get(), ctl_walk::subtree, notify_node(kind), &reply, &reason)) {
            // A signal also makes the query fail; the session is not lost then.
            if (!ctl_stop_signal)
                lose_session(self, reason);
            return;
        }
        if (reply.code == LC_OK) // otherwise tunneld is gone, and the proxies are unknown
            notify_compare(&self->book, kind, read_notify_states(kind, reply));
    }
}

void take_event(notifier *self, const ctl_event &event) {
    notify_subject subject;
    notify_state state;
    if (read_notify_event(event, &subject, &state))
        notify_note(&self->book, subject, state.state, state.detail);
    else // a process has ended, and with it the states that it reported
        self->compare_at_ms = std::min(self->compare_at_ms, lt_monotonic_ms() + CONNECT_MS);
}

// --- The commands

std::vector<reason> find_reasons(notifier *self, const notify_change &change) {
    snapshot_limits limits;
    limits.only = notify_group(change.subject);
    if (limits.only < 0)
        limits.queries = 0; // no queries about groups
    // The gathering still uses the session: it is dropped afterwards.
    std::string lost;
    const snapshot shown = gather_snapshot(
        [&](ctl_walk walk, const std::string &node, ctl_reply *out, std::string *out_reason) {
            if (!self->session) {
                *out_reason = self->complaint;
                return false;
            }
            if (ctl_query(self->session.get(), walk, node, out, out_reason))
                return true;
            lost = *out_reason;
            return false;
        },
        limits);
    if (!lost.empty() && !ctl_stop_signal)
        lose_session(self, lost);
    return reasons_of(shown);
}

// Reads the directory at each change: a new command needs no restart of the service.
std::vector<std::string> find_commands(notifier *self) {
    notify_commands found = find_notify_commands(self->how.directory);
    if (found.refused != self->refused)
        for (const std::string &line : found.refused)
            log_line("refused: " + line);
    self->refused = found.refused;
    return found.paths;
}

void start_next_change(notifier *self) {
    if (self->runner != 0 || self->book.waiting.empty())
        return;
    // The change stays in the queue during the query. If a signal ends the program meanwhile, it is reported
    // after the next start.
    const std::vector<reason> reasons = find_reasons(self, self->book.waiting.front());
    notify_change change;
    if (ctl_stop_signal || !notify_take(&self->book, &change))
        return;
    notify_run run;
    run.paths = find_commands(self);
    run.environment = notify_environment(change, reasons);
    run.limit_ms = int64_t{self->how.limit_s} * 1000;
    run.say = log_line;
    log_line(std::string(notify_kind_word(change.subject.kind)) + " " + change.subject.name + ": " +
             change.state + " (was " + change.previous + "), " + std::to_string(run.paths.size()) +
             " commands");
    if (!start_notify_commands(run, &self->runner, &self->runner_fd)) {
        log_line(std::string("fork: ") + strerror(errno));
        self->runner = 0;
        self->failed++;
    }
}

// Finishes a change whose commands have finished; with `wait`, waits for them.
void finish_change(notifier *self, bool wait) {
    int status = 0;
    if (self->runner == 0 || waitpid(self->runner, &status, wait ? 0 : WNOHANG) == 0)
        return;
    close(self->runner_fd);
    self->runner = 0;
    self->runner_fd = -1;
    // The process itself was killed.
    const int outcome = WIFEXITED(status) ? WEXITSTATUS(status) : NOTIFY_FAILED;
    self->reported++;
    self->failed += outcome == NOTIFY_FAILED;
    self->timed_out += outcome == NOTIFY_TIMED_OUT;
    // If the commands were interrupted, the change must be reported again after the next start.
    if (!wait || outcome == NOTIFY_DONE)
        save_book(self);
}

std::string describe_counts(const notifier &self) {
    return std::to_string(self.reported) + " changes reported, " + std::to_string(self.failed) + " failed, " +
           std::to_string(self.timed_out) + " timed out, " + std::to_string(self.book.merged) +
           " replaced, " + std::to_string(self.book.dropped) + " dropped, " +
           std::to_string(self.book.waiting.size()) + " waiting";
}

void wait_for_news(notifier *self) {
    ctl_event event;
    std::string reason;
    if (self->session) {
        const int got = ctl_next_event(self->session.get(), LOOK_MS, &event, &reason, self->runner_fd);
        if (got < 0)
            lose_session(self, reason);
        else if (got > 0)
            take_event(self, event);
        return;
    }
    // The pidfd becomes readable when the runner exits; -1 is ignored.
    pollfd ended = {self->runner_fd, POLLIN, 0};
    poll(&ended, 1, static_cast<int>(LOOK_MS));
}

void serve_changes(notifier *self) {
    std::string counts;
    while (!ctl_stop_signal) {
        try_to_connect(self);
        if (self->session && lt_monotonic_ms() >= self->compare_at_ms)
            compare_states(self);
        finish_change(self, false);
        start_next_change(self);
        if (const std::string now = describe_counts(*self); now != counts) {
            counts = now;
            service_report(("STATUS=" + counts).c_str());
        }
        service_report("WATCHDOG=1");
        wait_for_news(self);
    }
    if (self->runner != 0)
        // The runner gives the present command a few seconds, and skips the others.
        kill(self->runner, SIGTERM);
    finish_change(self, true);
    log_line("ends: " + describe_counts(*self));
}

// --- The user

// Creates the directory of the file for this user if it is missing.
bool make_state_directory(const std::string &file, uid_t user, gid_t group) {
    const std::string directory = std::filesystem::path(file).parent_path();
    if (directory.empty() || access(directory.c_str(), F_OK) == 0)
        return true;
    return mkdir(directory.c_str(), 0700) == 0 && chown(directory.c_str(), user, group) == 0;
}

// Gives up root permanently. False with the reason.
bool become_user(const ctl_notify_options &how, std::string *out_reason) {
    const passwd *user = getpwnam(how.user.c_str());
    if (!user || user->pw_uid == 0) {
        *out_reason = user ? "commands are not run as root" : "there is no user " + how.user;
        return false;
    }
    // The directory first, while this is root; the groups before the user, because only root can change them.
    // The last call must fail, or root could be regained.
    if (make_state_directory(how.state_file, user->pw_uid, user->pw_gid) &&
        initgroups(how.user.c_str(), user->pw_gid) == 0 && setgid(user->pw_gid) == 0 &&
        setuid(user->pw_uid) == 0 && setuid(0) != 0)
        return true;
    *out_reason = "cannot run as " + how.user + ": " + strerror(errno);
    return false;
}

// --- The words

int run_notifier(const ctl_options &options, const ctl_notify_options &how) {
    std::string reason;
    if (geteuid() == 0 && how.user.empty())
        reason = "commands are not run as root: give --user NAME";
    else if (geteuid() == 0)
        (void)become_user(how, &reason);
    else if (!how.user.empty())
        reason = "only root can run as " + how.user;
    if (!reason.empty())
        return tell_failure(options, {CTL_USAGE, "", reason, "", 0});
    service_open();
    signal(SIGCHLD, SIG_DFL); // if it were ignored, the kernel would discard the outcome of the commands
    notifier self(options, how);
    if (!load_book(&self))
        return tell_failure(options, {CTL_USAGE, "", how.state_file + ": " + strerror(errno), "", 0});
    log_line("runs the commands of " + how.directory + ", " + std::to_string(find_commands(&self).size()) +
             " at present");
    service_report("READY=1");
    serve_changes(&self);
    return CTL_OK;
}

int list_commands(const ctl_options &options, const ctl_notify_options &how) {
    const notify_commands found = find_notify_commands(how.directory);
    if (options.json) {
        write_output(json_line({{"commands", found.paths}, {"refused", found.refused}}));
        return CTL_OK;
    }
    for (const std::string &path : found.paths)
        write_output(path + "\n");
    for (const std::string &line : found.refused)
        write_output("refused: " + line + "\n");
    if (found.paths.empty() && found.refused.empty())
        write_output("no command is in " + how.directory + "\n");
    return CTL_OK;
}

} // namespace

int ctl_notify(const ctl_options &options, const std::string &word, const ctl_notify_options &how) {
    if (word == "run")
        return run_notifier(options, how);
    if (word == "list")
        return list_commands(options, how);
    return tell_failure(options, {CTL_USAGE, "", unknown_word_text(word, {"run", "list"}), "", 0});
}
