// A drain empties a group, so that the appliance can be stopped without breaking connections. wccpd announces
// the weight 0, which moves the group's buckets to other appliances. tunneld keeps new flows from the proxy
// and counts those that are left. After the last one has ended, or when the time is over, the group leaves
// its routers. It stays out until the drain is cancelled or the group deleted. The time is kept here because
// it has to end without tunneld as well.
//
//   /qv/alarms/state/drain/GROUP    "draining", "drained", or "over" if it has left with flows
//                                   below it: since, until (seconds since 1970), and flows, once counted
//
// Also here: groups that announce a part of their weight during a slow start, which tunneld controls.
#include "mgmt/node_paths.h"
#include "peers/mgmtd/server.h"

namespace {

node_name name_drain_report(uint8_t group) {
    return parsed_name(NODE_DRAINS).below(std::to_string(group));
}

std::string describe_group(uint8_t group) {
    return "group " + std::to_string(group);
}

const std::string *find_configured_admin(const server *self, uint8_t group) {
    const auto found =
        self->tree.nodes.find(parsed_name(NODE_GROUP_CONFIG).below(std::to_string(group)).below("admin"));
    return found == self->tree.nodes.end() ? nullptr : &found->second.text;
}

bool read_number_field(const std::vector<event_field> &fields, const char *name, uint32_t type,
                       uint32_t *out) {
    const std::string *field = find_field(fields, name);
    std::string text;
    if (!field || !canonical_text(type, *field, &text))
        return false;
    *out = static_cast<uint32_t>(std::stoul(text));
    return true;
}

// --- The state of a drain

void report_drain(server *self, uint8_t group, const std::string &state) {
    node_value &report = self->state[name_drain_report(group)];
    // The action may be repeated to change the time. Watchers get the event again, the log one line.
    if (report.text != state)
        self->say(describe_group(group) + ": " + state);
    report = {bn_type_str, state};
    const int64_t flows = self->drains[group].flows;
    std::vector<event_field> fields = {{"group", {bn_type_uint8, std::to_string(group)}},
                                       {"state", {bn_type_str, state}}};
    if (flows >= 0)
        fields.push_back({"flows", {bn_type_uint32, std::to_string(flows)}});
    server_send_event(self, EVENT_DRAIN, fields);
}

void leave_routers(server *self, uint8_t group, const char *state) {
    // Read before the change, so that wccpd gets only the difference.
    const group_overlay before = server_overlay_of(self, group);
    self->drains[group].left = true;
    server_send_overlay(self, group, before);
    report_drain(self, group, state);
}

void forget_drain(server *self, uint8_t group) {
    self->drains.erase(group);
    server_remove_report(self, name_drain_report(group));
}

// --- Actions

void begin_drain(server *self, uint8_t group, uint32_t seconds) {
    // Read before the drain exists, because the overlay depends on it.
    const group_overlay before = server_overlay_of(self, group);
    const bool fresh = !self->drains.contains(group);
    drain_request &drain = self->drains[group];
    // The group has left already; a new time would have no effect.
    if (drain.left)
        return;
    drain.until_ms = self->now_ms() + int64_t{seconds} * 1000;
    const node_name report = name_drain_report(group);
    if (fresh)
        self->state[report.below("since")] = server_time_now();
    self->state[report.below("until")] = {bn_type_uint32, std::to_string(self->clock_s() + seconds)};
    self->say(describe_group(group) + " is to be empty within " + std::to_string(seconds) + " s");
    report_drain(self, group, "draining");
    server_send_overlay(self, group, before);
}

// The groups of an action: the one that it names, or all that are up. Returns a status code.
uint32_t find_drain_groups(const server *self, const std::vector<event_field> &fields,
                           std::vector<uint8_t> *out, std::string *out_message) {
    uint32_t group = 0;
    if (!find_field(fields, "group")) {
        // Groups that are down have no flows to wait for.
        for (uint32_t each = 0; each < 256; each++)
            if (const std::string *admin = find_configured_admin(self, static_cast<uint8_t>(each));
                admin && *admin == "up")
                out->push_back(static_cast<uint8_t>(each));
        return LC_OK;
    }
    if (!read_number_field(fields, "group", bn_type_uint8, &group)) {
        *out_message = "group is not a number between 0 and 255";
        return LC_BAD_ARGUMENT;
    }
    const std::string *admin = find_configured_admin(self, static_cast<uint8_t>(group));
    if (!admin) {
        *out_message = "There is no group " + std::to_string(group);
        return LC_NOT_FOUND;
    }
    out->push_back(static_cast<uint8_t>(group));
    return LC_OK;
}

} // namespace

uint32_t server_begin_drain(server *self, const std::vector<event_field> &fields, std::string *out_message) {
    static constexpr uint32_t SECONDS_MAX = 86400;
    std::vector<uint8_t> groups;
    if (const uint32_t code = find_drain_groups(self, fields, &groups, out_message))
        return code;
    uint32_t seconds = 0;
    if (!find_field(fields, "seconds")) {
        seconds = static_cast<uint32_t>(std::stoul(self->tree.nodes.at(parsed_name(NODE_DRAIN_TIME)).text));
    } else if (!read_number_field(fields, "seconds", bn_type_uint32, &seconds) || seconds > SECONDS_MAX) {
        *out_message = "seconds is not a number between 0 and " + std::to_string(SECONDS_MAX);
        return LC_BAD_ARGUMENT;
    }
    // Only a group that was named can be down here. An appliance without groups has nothing to drain, and
    // that is not an error.
    if (groups.size() == 1 && *find_configured_admin(self, groups[0]) != "up") {
        *out_message = "Group " + std::to_string(groups[0]) + " is down, there is nothing to drain";
        return LC_BAD_ARGUMENT;
    }
    for (const uint8_t group : groups)
        begin_drain(self, group, seconds);
    (void)server_end_drains(self); // with a time of 0 they end at once
    return LC_OK;
}

uint32_t server_cancel_drain(server *self, const std::vector<event_field> &fields, std::string *out_message) {
    std::vector<uint8_t> groups;
    if (const uint32_t code = find_drain_groups(self, fields, &groups, out_message))
        return code;
    if (!find_field(fields, "group")) { // all drains, also of groups that are no longer up
        groups.clear();
        for (const auto &[group, drain] : self->drains)
            groups.push_back(group);
    }
    size_t cancelled = 0;
    for (const uint8_t group : groups) {
        const group_overlay before = server_overlay_of(self, group);
        if (!self->drains.contains(group))
            continue;
        report_drain(self, group, "cancelled");
        forget_drain(self, group);
        server_send_overlay(self, group, before);
        cancelled++;
    }
    if (cancelled > 0)
        return LC_OK;
    *out_message = "There is no drain";
    return LC_NOT_FOUND;
}

// --- Reports of tunneld

void server_take_drain_progress(server *self, uint32_t peer_id, const std::vector<event_field> &fields) {
    uint8_t group = 0;
    uint32_t flows = 0;
    const std::string *empty = find_field(fields, "empty");
    if (!server_read_reported_group(self, peer_id, fields, &group) ||
        !read_number_field(fields, "flows", bn_type_uint32, &flows) || !empty)
        return;
    // tunneld's report may cross the cancellation of the drain.
    const auto drain = self->drains.find(group);
    if (drain == self->drains.end())
        return;
    drain->second.flows = flows;
    self->state[name_drain_report(group).below("flows")] = {bn_type_uint32, std::to_string(flows)};
    // A group that has left with flows is still counted, and becomes "drained" when the last one ends.
    if (*empty == "true" && (!drain->second.left || self->state[name_drain_report(group)].text == "over"))
        leave_routers(self, group, "drained");
}

void server_take_weight(server *self, uint32_t peer_id, const std::vector<event_field> &fields) {
    uint8_t group = 0;
    uint32_t percent = 0;
    if (!server_read_reported_group(self, peer_id, fields, &group) || !find_configured_admin(self, group) ||
        !read_number_field(fields, "percent", bn_type_uint32, &percent) || percent == 0 || percent > 100)
        return;
    const group_overlay before = server_overlay_of(self, group);
    // The record is updated even if the percentage is the same: after a restart of tunneld the reporter
    // differs.
    const auto known = self->slowed.find(group);
    const uint32_t last = known == self->slowed.end() ? 100 : known->second.percent;
    if (percent < 100)
        self->slowed[group] = {percent, peer_id, 0};
    else
        self->slowed.erase(group);
    // tunneld repeats its reports with each configuration.
    if (percent == last)
        return;
    self->say(describe_group(group) + " announces " + std::to_string(percent) + " % of its weight");
    server_send_event(self, EVENT_GROUP_WEIGHT, fields);
    server_send_overlay(self, group, before);
}

// --- What ends without a report

void server_orphan_weights(server *self, uint32_t peer_id) {
    for (auto &[group, slowed] : self->slowed)
        if (slowed.reporter == peer_id)
            slowed = {slowed.percent, 0, self->now_ms()};
}

void server_forget_deleted_drains(server *self) {
    std::erase_if(self->slowed, [&](const auto &each) { return !find_configured_admin(self, each.first); });
    // The iterator advances first, because forgetting a drain erases its element.
    for (auto at = self->drains.begin(); at != self->drains.end();) {
        const uint8_t group = (at++)->first;
        if (!find_configured_admin(self, group))
            forget_drain(self, group);
    }
}

int64_t server_end_drains(server *self) {
    const int64_t now = self->now_ms();
    int64_t next = -1;
    for (const auto &[group, drain] : self->drains) {
        if (!drain.left && now >= drain.until_ms)
            // If tunneld has never counted the flows, they are taken to exist.
            leave_routers(self, group, drain.flows == 0 ? "drained" : "over");
        else if (!drain.left)
            keep_earlier(&next, drain.until_ms);
    }
    const bool followed = server_has_tunneld(self);
    for (auto at = self->slowed.begin(); at != self->slowed.end();) {
        const auto [group, slowed] = *at++;
        const int64_t due = slowed.orphaned_ms + LEFT_KEEP_MS;
        const bool wanted =
            self->tree.nodes.contains(parsed_name(NODE_INTERCEPT_CONFIG).below(std::to_string(group)));
        // A tunneld that has a session again reports the weight itself.
        if (slowed.reporter != 0 || (followed && wanted))
            continue;
        if (wanted && now < due) {
            keep_earlier(&next, due);
            continue;
        }
        const group_overlay before = server_overlay_of(self, group);
        self->slowed.erase(group);
        self->say(describe_group(group) + " announces its full weight again: no tunneld reports");
        server_send_overlay(self, group, before);
    }
    return next;
}
