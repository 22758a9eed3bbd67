// The processes of wccpd and tunneld, as their sessions show them:
//
//   /qv/alarms/state/process/NAME                "running" or "gone"; below it pid, since, restarts, and
//                                                silent_since, the time of the first query in a row that it
//                                                has not answered
//
// A daemon that has not been seen yet has no node. A session with another process id is a restart. With
// --supervise, the supervisor reports the restarts instead, because it also sees those of a program that
// never opens a session.
//
// RESTARTS_MAX restarts within RESTARTS_WITHIN_MS raise an alarm. Its text follows the number of restarts. It
// is cleared once the daemon has had a session for RESTARTS_WITHIN_MS without another restart.
#include "mgmt/node_paths.h"
#include "peers/mgmtd/server.h"
#include "runtime/logging.h"

namespace {

constexpr const char *DAEMONS[] = {"wccpd", "tunneld"};

// The daemon whose session this is, and its process id as text. Null: not a session of a daemon.
const char *find_daemon_of(const std::string &session, std::string *out_pid) {
    for (const char *daemon : DAEMONS)
        if (const std::string prefix = std::string(daemon) + "-";
            session.starts_with(prefix) &&
            canonical_text(bn_type_uint32, session.substr(prefix.size()), out_pid))
            return daemon;
    return nullptr;
}

bool has_session(const server *self, const std::string &name) {
    for (const auto &[id, who] : self->peers)
        if (who.name == name)
            return true;
    return false;
}

// The value of a node below the process's own; "" when there is none.
std::string read_process_node(const server *self, const node_name &node) {
    const auto found = self->state.find(node);
    return found == self->state.end() ? "" : found->second.text;
}

void count_restart(server *self, const node_name &root) {
    node_value &restarts = self->state[root.below("restarts")];
    // A new node has an empty text, which counts as 0.
    restarts = {bn_type_uint32, std::to_string(std::stoul("0" + restarts.text) + 1)};
}

std::vector<event_field> restart_alarm(const std::string &process, const std::string &text) {
    return {{"alarm_type", {bn_type_str, std::to_string(ALARM_TYPE_RESTARTS)}},
            {"param_1", {bn_type_str, "0"}},
            {"param_2", {bn_type_str, "0"}},
            {"param_3", {bn_type_str, process}},
            {"comment", {bn_type_str, text}}};
}

} // namespace

void server_note_process(server *self, const std::string &session) {
    std::string pid;
    const char *daemon = find_daemon_of(session, &pid);
    if (!daemon)
        return;
    const node_name root = parsed_name(NODE_PROCESSES).below(daemon);
    const std::string known_pid = read_process_node(self, root.below("pid"));
    const bool running = has_session(self, session);
    const bool same = known_pid == pid;
    if (!running && !same)
        return; // the late end of an earlier process
    if (running && same && self->state[root].text == "running")
        return; // one more session of the same process
    self->state[root] = {bn_type_str, running ? "running" : "gone"};
    self->state[root.below("pid")] = {bn_type_uint32, pid};
    self->state[root.below("since")] = server_time_now();
    // A process that has ended, or that has just started, has not failed to answer.
    self->state.erase(root.below("silent_since"));
    self->state.try_emplace(root.below("restarts"), node_value{bn_type_uint32, "0"});
    self->restarts[daemon].running_since_ms = running ? self->now_ms() : -1;
    // The first process is not a restart. Under --supervise the supervisor counts.
    if (running && !same && !known_pid.empty() && !self->supervises)
        server_note_restart(self, daemon, "");
}

void server_note_answer(server *self, const std::string &session, bool answered) {
    std::string pid;
    const char *daemon = find_daemon_of(session, &pid);
    if (!daemon)
        return;
    const node_name silent = parsed_name(NODE_PROCESSES).below(daemon).below("silent_since");
    if (answered)
        self->state.erase(silent);
    else
        // The time of the first query that was not answered stays.
        self->state.try_emplace(silent, server_time_now());
}

void server_note_restart(server *self, const std::string &process, const std::string &last_end) {
    const int64_t now = self->now_ms();
    const node_name root = parsed_name(NODE_PROCESSES).below(process);
    if (!self->state.contains(root)) { // it has never had a session
        self->state[root] = {bn_type_str, "gone"};
        self->state[root.below("since")] = server_time_now();
    }
    count_restart(self, root);
    restart_watch &watch = self->restarts[process];
    watch.at_ms.push_back(now);
    // Ends at the restart just added, at the latest.
    while (now - watch.at_ms.front() > RESTARTS_WITHIN_MS || watch.at_ms.size() > RESTARTS_KEPT)
        watch.at_ms.pop_front();
    // An active alarm follows every restart, even when fewer are left in the period.
    if (watch.at_ms.size() < RESTARTS_MAX && !watch.alarm)
        return;
    const std::string text = "restarted " + std::to_string(watch.at_ms.size()) + " times in " +
                             std::to_string((now - watch.at_ms.front()) / 1000) + " s" +
                             (last_end.empty() ? "" : "; the last one " + last_end);
    const bool is_news = !watch.alarm;
    watch.alarm = true;
    server_raise_own_alarm(self, restart_alarm(process, text), is_news);
    if (is_news)
        LC_LOG(LC_LOG_WARNING, "process %s: %s", process.c_str(), text.c_str());
}

int64_t server_clear_restart_alarms(server *self) {
    const int64_t now = self->now_ms();
    int64_t next = -1;
    for (auto &[process, watch] : self->restarts) {
        if (!watch.alarm || watch.running_since_ms < 0)
            continue;
        // `at_ms` isn't empty, because restarts have raised the alarm.
        const int64_t due = std::max(watch.running_since_ms, watch.at_ms.back()) + RESTARTS_WITHIN_MS;
        if (now >= due) {
            watch = {{}, watch.running_since_ms, false};
            server_clear_own_alarm(
                self, restart_alarm(process, "has run for " + std::to_string(RESTARTS_WITHIN_MS / 60000) +
                                                 " minutes without a restart"));
        } else if (next < 0 || due < next) {
            next = due;
        }
    }
    return next;
}
