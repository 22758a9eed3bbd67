// Groups that are out of their routers because tunneld reports that their proxy is down. This is an
// operational state: it changes what wccpd is given (overlays.cpp), not the configuration.
//
//   /qv/alarms/state/left/GROUP                  the reason; below it since
//
// The state ends with a report of tunneld, or when the group is deleted. When tunneld has lost its session,
// it also ends if the intercept is deleted, or if no tunneld has had a session for LEFT_KEEP_MS. Until then a
// restarted tunneld can take over; it reports the state of all proxies again.
#include "mgmt/node_paths.h"
#include "peers/mgmtd/server.h"
#include "peers/nodes/schema.h"

namespace {

constexpr size_t REASON_MAX = 256;

} // namespace

bool server_runs_groups(const peer &who) {
    return who.name.starts_with("wccpd-");
}

bool server_is_tunneld(const peer &who) {
    return who.name.starts_with("tunneld-");
}

bool server_has_tunneld(const server *self) {
    for (const auto &[id, who] : self->peers)
        if (server_is_tunneld(who))
            return true;
    return false;
}

namespace {

node_name name_leave_report(uint8_t group) {
    return parsed_name(NODE_LEFT_GROUPS).below(std::to_string(group));
}

bool has_group_node(const server *self, const char *root, uint8_t group) {
    return self->tree.nodes.contains(parsed_name(root).below(std::to_string(group)));
}

} // namespace

// --- Reports

bool server_read_reported_group(const server *self, uint32_t peer_id, const std::vector<event_field> &fields,
                                uint8_t *out_group) {
    const std::string *group = find_field(fields, "group");
    std::string text;
    if (!server_is_tunneld(self->peers.at(peer_id)) || !group ||
        !canonical_text(bn_type_uint8, *group, &text))
        return false;
    *out_group = static_cast<uint8_t>(std::stoi(text));
    return true;
}

namespace {

std::string read_leave_reason(const std::vector<event_field> &fields) {
    const std::string *reason = find_field(fields, "reason");
    return reason ? shown_text(reason->substr(0, REASON_MAX)) : "";
}

void end_leave(server *self, uint8_t group, const std::string &why) {
    // Read before the erase, so that wccpd gets only the difference.
    const group_overlay before = server_overlay_of(self, group);
    if (self->left.erase(group) == 0)
        return;
    server_remove_report(self, name_leave_report(group));
    self->say("group " + std::to_string(group) + " joins its routers again: " + why);
    server_send_event(self, EVENT_GROUP_JOIN, {{"group", {bn_type_uint8, std::to_string(group)}}});
    server_send_overlay(self, group, before);
}

} // namespace

void server_take_leave(server *self, uint32_t peer_id, const std::vector<event_field> &fields) {
    uint8_t group = 0;
    if (!server_read_reported_group(self, peer_id, fields, &group) ||
        !has_group_node(self, NODE_GROUP_CONFIG, group))
        return;
    const group_overlay before = server_overlay_of(self, group);
    // tunneld repeats its reports. The record is renewed each time, because the reporter may be a new session
    // and the reason another one.
    const bool first = !self->left.contains(group);
    self->left[group] = {peer_id, 0};
    const node_name report = name_leave_report(group);
    self->state[report] = {bn_type_str, read_leave_reason(fields)};
    if (!first)
        return;
    self->state[report.below("since")] = server_time_now();
    self->say("group " + std::to_string(group) + " leaves its routers: " + self->state[report].text);
    server_send_event(self, EVENT_GROUP_LEAVE, fields);
    server_send_overlay(self, group, before);
}

void server_take_join(server *self, uint32_t peer_id, const std::vector<event_field> &fields) {
    uint8_t group = 0;
    if (server_read_reported_group(self, peer_id, fields, &group))
        end_leave(self, group, "reported by tunneld");
}

// A restarted tunneld does not know which groups its predecessor has taken out, and therefore reports no join
// for them. A proxy that is up means the same.
void server_take_proxy_change(server *self, uint32_t peer_id, const std::vector<event_field> &fields) {
    uint8_t group = 0;
    const std::string *up = find_field(fields, "up");
    if (!server_read_reported_group(self, peer_id, fields, &group) || !up)
        return;
    self->say("proxy of group " + std::to_string(group) +
              (*up == "true" ? ": up" : ": down, " + read_leave_reason(fields)));
    if (*up == "true")
        end_leave(self, group, "its proxy is up");
}

// --- Groups that return without a report

void server_orphan_left_groups(server *self, uint32_t peer_id) {
    for (auto &[group, left] : self->left)
        if (left.reporter == peer_id)
            left = {0, self->now_ms()};
}

void server_forget_deleted_groups(server *self) {
    for (auto at = self->left.begin(); at != self->left.end();) {
        // The iterator advances before the element is erased.
        const auto [group, left] = *at++;
        if (has_group_node(self, NODE_GROUP_CONFIG, group))
            continue;
        self->left.erase(group);
        server_remove_report(self, name_leave_report(group));
    }
}

int64_t server_drop_left_groups(server *self) {
    const int64_t now = self->now_ms();
    const bool followed = server_has_tunneld(self);
    int64_t next = -1;
    for (auto at = self->left.begin(); at != self->left.end();) {
        const auto [group, left] = *at++;
        const int64_t due = left.orphaned_ms + LEFT_KEEP_MS;
        if (left.reporter != 0)
            continue;
        if (!has_group_node(self, NODE_INTERCEPT_CONFIG, group))
            end_leave(self, group, "it has no intercept any more");
        else if (!followed && now >= due)
            end_leave(self, group, "tunneld is gone");
        else if (!followed && (next < 0 || due < next))
            next = due;
    }
    return next;
}
