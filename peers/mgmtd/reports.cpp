// Active alarms and roles of service groups, as daemons report them by events. Clients can read them as
// nodes:
//
//   /qv/alarms/state/raised/TYPE/SOURCE          the text of the alarm; below it name, since, reporter
//   /qv/alarms/state/role/GROUP                  the name of the role; below it code, since
//
// Other nodes below /qv/alarms/state are in left_groups.cpp, drains.cpp and processes.cpp.
//
// TYPE is the number of the alarm, SOURCE its subject. A repeated report replaces the one before. Daemons do
// not resend alarms and roles. When a session ends, those that it reported are forgotten, because nobody
// watches the condition any more: the alarm counts as cleared, and the role is UNKNOWN. Each report, and each
// that is forgotten, is sent as an event to the sessions with an interest in it.
#include <ctime>

#include "mgmt/node_paths.h"
#include "peers/mgmtd/server.h"
#include "peers/nodes/schema.h"
#include "runtime/ttime.h"

namespace {

// Texts of reports are cut to this many bytes, so that a walk of ALARMS_MAX alarms fits in one message.
constexpr size_t TEXT_MAX = 512, SOURCE_MAX = 128;
constexpr uint32_t OWN_REPORTS = 0; // instead of the id of a session: reports of mgmtd itself

} // namespace

node_value server_time_now() {
    owned_text text;
    const auto now = static_cast<lt_time_sec>(time(nullptr));
    if (lt_datetime_sec_to_str(now, 0, &text.pointer) != LC_OK || !text.pointer)
        return {bn_type_datetime_sec, "1970/01/01 00:00:00"};
    return {bn_type_datetime_sec, text.pointer};
}

void server_remove_report(server *self, const node_name &root) {
    self->alarm_owners.erase(root);
    self->state.erase(root);
    // In the order of the map, the nodes below a root follow it immediately.
    for (auto at = self->state.lower_bound(root); at != self->state.end() && at->first.is_under(root);)
        at = self->state.erase(at);
}

namespace {

bool claim_report(server *self, uint32_t peer_id, const node_name &root) {
    // A repeated report needs no further place.
    if (!self->alarm_owners.contains(root) && self->alarm_owners.size() >= ALARMS_MAX)
        return false;
    // The last reporter counts: a restarted daemon may report before the end of the old session is noticed.
    self->alarm_owners[root] = peer_id;
    return true;
}

std::string read_text_field(const std::vector<event_field> &fields, const char *name, const char *otherwise,
                            size_t most = SOURCE_MAX) {
    const std::string *text = find_field(fields, name);
    return text && !text->empty() ? text->substr(0, most) : otherwise;
}

node_name find_alarm_root(const std::vector<event_field> &fields) {
    return parsed_name(NODE_ALARMS_RAISED)
        .below(read_text_field(fields, "alarm_type", "0"))
        .below(read_text_field(fields, "param_3", "-"));
}

void keep_alarm(server *self, uint32_t peer_id, const std::string &reporter,
                const std::vector<event_field> &fields) {
    const node_name root = find_alarm_root(fields);
    if (!claim_report(self, peer_id, root)) {
        self->say("alarm lost, too many are active: " + root.text());
        return;
    }
    const std::string comment = read_text_field(fields, "comment", "", TEXT_MAX);
    self->state[root] = {bn_type_str, comment};
    self->state[root.below("name")] = {bn_type_str, alarm_name(root.parts[root.parts.size() - 2])};
    self->state[root.below("since")] = server_time_now();
    self->state[root.below("reporter")] = {bn_type_str, reporter};
    self->say("alarm raised: " + root.parts.back() + " " + comment);
}

void take_raised_alarm(server *self, uint32_t peer_id, const std::vector<event_field> &fields) {
    keep_alarm(self, peer_id, self->peers[peer_id].name, fields);
}

void take_cleared_alarm(server *self, uint32_t, const std::vector<event_field> &fields) {
    const node_name root = find_alarm_root(fields);
    server_remove_report(self, root);
    self->say("alarm cleared: " + root.parts.back() + " " + read_text_field(fields, "comment", "", TEXT_MAX));
}

void take_role(server *self, uint32_t peer_id, const std::vector<event_field> &fields) {
    const node_name root = parsed_name(NODE_ROLES).below(read_text_field(fields, "group", "-"));
    if (!claim_report(self, peer_id, root))
        return;
    const char *role = role_name(read_text_field(fields, "role", ""));
    std::string code;
    if (!canonical_text(bn_type_uint32, read_text_field(fields, "code", "0"), &code))
        code = "0";
    self->state[root] = {bn_type_str, role};
    self->state[root.below("code")] = {bn_type_uint32, code};
    self->state[root.below("since")] = server_time_now();
    self->say("role of group " + root.parts.back() + ": " + role);
}

const struct {
    const char *event;
    void (*take)(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
    bool repeated = false; // tunneld repeats it: `take` passes it on when it changes something
} reports[] = {
    {EVENT_RAISE_ALARM, take_raised_alarm},
    {EVENT_CLEAR_ALARM, take_cleared_alarm},
    {EVENT_ROLE_CHANGE, take_role},
    {EVENT_GROUP_LEAVE, server_take_leave, true},
    {EVENT_GROUP_JOIN, server_take_join, true},
    {EVENT_PROXY_CHANGE, server_take_proxy_change},
    {EVENT_GROUP_WEIGHT, server_take_weight, true},
    {EVENT_DRAIN_PROGRESS, server_take_drain_progress, true},
};

} // namespace

void server_take_event(server *self, uint32_t peer_id, const std::string &event,
                       const std::vector<event_field> &fields) {
    for (const auto &report : reports)
        if (event == report.event) {
            report.take(self, peer_id, fields);
            if (!report.repeated)
                server_send_event(self, event, fields);
            return;
        }
    self->say("event of " + self->peers[peer_id].name + " ignored: " + event);
}

void server_raise_own_alarm(server *self, const std::vector<event_field> &fields, bool is_news) {
    if (!is_news) {
        self->state[find_alarm_root(fields)] = {bn_type_str,
                                                read_text_field(fields, "comment", "", TEXT_MAX)};
        return;
    }
    keep_alarm(self, OWN_REPORTS, "mgmtd", fields);
    server_send_event(self, EVENT_RAISE_ALARM, fields);
}

void server_clear_own_alarm(server *self, const std::vector<event_field> &fields) {
    take_cleared_alarm(self, OWN_REPORTS, fields);
    server_send_event(self, EVENT_CLEAR_ALARM, fields);
}

namespace {

// Sends watchers the event that the daemon can no longer send.
void report_forgotten(server *self, const node_name &root) {
    const std::string &last = root.parts.back();
    if (root.is_under(parsed_name(NODE_ROLES)))
        server_send_event(self, EVENT_ROLE_CHANGE,
                          {{"group", {bn_type_str, last}},
                           // 2 is UNKNOWN.
                           {"role", {bn_type_uint32, "2"}},
                           {"code", {bn_type_uint32, "0"}}});
    else
        server_send_event(self, EVENT_CLEAR_ALARM,
                          {{"alarm_type", {bn_type_str, root.parts[root.parts.size() - 2]}},
                           {"param_1", {bn_type_str, "0"}},
                           {"param_2", {bn_type_str, "0"}},
                           {"param_3", {bn_type_str, last}},
                           {"comment", {bn_type_str, "forgotten with the session of its reporter"}}});
}

} // namespace

void server_forget_reports(server *self, uint32_t peer_id) {
    std::vector<node_name> gone;
    for (const auto &[root, owner] : self->alarm_owners)
        // mgmtd's own alarms are never among them: sessions are numbered from 1.
        if (owner == peer_id)
            gone.push_back(root);
    for (const node_name &root : gone) {
        server_remove_report(self, root);
        self->say("forgotten with its session: " + root.text());
        report_forgotten(self, root);
    }
}
