// The daemons as their sessions show them, whoever starts them:
//
//   /qv/alarms/state/process/NAME                "running" or "gone"; below it pid, since, restarts
//
// A session of another process id is a restart. A daemon that has not been seen yet has no node.
#include "mgmt/node_paths.h"
#include "peers/mgmtd/server.h"

static constexpr const char *daemons[] = {"wccpd", "tunneld"};

// The daemon whose session this is, and its process id as text. Null: nobody's.
static const char *daemon_of(const std::string &session, std::string *out_pid) {
    for (const char *daemon : daemons)
        if (const std::string prefix = std::string(daemon) + "-";
            session.starts_with(prefix) &&
            canonical_text(bn_type_uint32, session.substr(prefix.size()), out_pid))
            return daemon;
    return nullptr;
}

static bool has_session(const server *self, const std::string &name) {
    for (const auto &[id, who] : self->peers)
        if (who.name == name)
            return true;
    return false;
}

void server_note_process(server *self, const std::string &session) {
    std::string pid;
    const char *daemon = daemon_of(session, &pid);
    if (!daemon)
        return;
    const node_name root = parsed_name(NODE_PROCESSES).below(daemon);
    const bool known = self->state.contains(root);
    const bool running = has_session(self, session);
    const bool same = known && self->state[root.below("pid")].text == pid;
    if (!running && !same)
        return; // the late end of an earlier one
    if (running && same && self->state[root].text == "running")
        return; // another session of it
    unsigned long restarts = known ? std::stoul(self->state[root.below("restarts")].text) : 0;
    if (running && known && !same)
        restarts++;
    self->state[root] = {bn_type_str, running ? "running" : "gone"};
    self->state[root.below("pid")] = {bn_type_uint32, pid};
    self->state[root.below("since")] = server_time_now();
    self->state[root.below("restarts")] = {bn_type_uint32, std::to_string(restarts)};
}
