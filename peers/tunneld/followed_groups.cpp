// Once a second, for each group that has an intercept or is being drained: collects the facts for course.h
// and reports the decisions that have changed to mgmtd. A new session with mgmtd gets all of them.
#include <algorithm>

#include "peers/tunneld/flow_count.h"
#include "peers/tunneld/tunneld.h"
#include "runtime/logging.h"
#include "runtime/ttime.h"

namespace {

bool needs_flows(const tunneld &daemon) {
    return !daemon.configured.drains.empty() ||
           std::any_of(daemon.configured.intercepts.begin(), daemon.configured.intercepts.end(),
                       [](const auto &each) { return each.second.limit > 0; });
}

// If the count fails, the last one stays, but at least one flow is assumed: an unknown number must not end a
// drain.
void count_all_flows(tunneld *daemon) {
    std::vector<flow_ends> flows;
    std::string error;
    const bool good = read_transparent_flows(daemon->own_addresses, &flows, &error);
    // The same failure is logged once, not every second.
    if (error != daemon->uncounted && !good)
        LC_LOG(LC_LOG_ERR, "Flows are not counted: %s", error.c_str());
    daemon->uncounted = error;
    const auto counts = count_flows(flows, daemon->configured.intercepts);
    for (auto &[id, group] : daemon->followed) {
        const auto found = counts.find(id);
        group.flows = !good ? std::max(group.flows, 1u) : found == counts.end() ? 0 : found->second;
    }
}

course_facts collect_facts(const tunneld &daemon, uint8_t id, const group_view &view, int64_t now) {
    course_facts facts{};
    facts.now_ms = now;
    const auto drain = daemon.configured.drains.find(id);
    const auto outage = daemon.outages.find(id);
    facts.draining = drain != daemon.configured.drains.end();
    facts.left = (facts.draining && drain->second) || (outage != daemon.outages.end() && outage->second.left);
    facts.active = view.active;
    facts.alone = view.alone;
    facts.flows = daemon.followed.at(id).flows;
    if (const auto rules = daemon.configured.intercepts.find(id);
        rules != daemon.configured.intercepts.end()) {
        facts.proxy_up = is_proxy_up(daemon, id, rules->second);
        facts.slow_start_s = rules->second.slow_start_s;
        facts.limit = rules->second.limit;
    }
    return facts;
}

void report_overload(tunneld *daemon, uint8_t id, followed_group *group, uint32_t limit) {
    if (group->reported_overload == group->decided.overloaded)
        return;
    group->reported_overload = group->decided.overloaded;
    const std::string text = "group " + std::to_string(id) + ": " + std::to_string(group->flows) +
                             " flows, the limit is " + std::to_string(limit);
    LC_LOG(LC_LOG_NOTICE, "New flows are %s: %s", group->decided.overloaded ? "returned" : "accepted again",
           text.c_str());
    mgmt_link_overload(daemon->management, id, group->decided.overloaded, text);
}

void report_decisions(tunneld *daemon, uint8_t id, followed_group *group) {
    const course_decision &decided = group->decided;
    if (decided.weight_percent != group->reported_percent) {
        group->reported_percent = decided.weight_percent;
        mgmt_link_weight_changed(daemon->management, id, decided.weight_percent);
    }
    const auto rules = daemon->configured.intercepts.find(id);
    report_overload(daemon, id, group,
                    rules == daemon->configured.intercepts.end() ? 0 : rules->second.limit);
    const std::pair<uint32_t, bool> progress = {group->flows, decided.empty};
    if (!daemon->configured.drains.contains(id))
        group->reported_progress.reset();
    else if (group->reported_progress != progress) {
        group->reported_progress = progress;
        mgmt_link_drain_progress(daemon->management, id, progress.first, progress.second);
    }
}

// Adds and drops groups as the configuration changes. What was reported for a dropped group is withdrawn.
void update_followed_groups(tunneld *daemon) {
    const configured_view &view = daemon->configured;
    for (auto at = daemon->followed.begin(); at != daemon->followed.end();) {
        auto &[id, group] = *at;
        if (view.groups.contains(id) && (view.intercepts.contains(id) || view.drains.contains(id))) {
            ++at;
            continue;
        }
        // The defaults: the full weight and no overload.
        group.decided = {};
        report_decisions(daemon, id, &group);
        at = daemon->followed.erase(at);
    }
    for (const auto &[id, group] : view.groups)
        if (view.intercepts.contains(id) || view.drains.contains(id))
            daemon->followed.try_emplace(id);
}

} // namespace

void follow_groups(tunneld *daemon) {
    // While an earlier tunneld's rules are in place, it isn't known yet whether a group is active.
    if (!daemon->management || daemon->configured_ms < 0 || daemon->takes_over)
        return;
    if (const uint32_t session = mgmt_link_session(daemon->management); session != daemon->reported_session) {
        // mgmtd has forgotten these reports with the old session, or still has those of an earlier tunneld.
        daemon->reported_session = session;
        for (auto &[id, group] : daemon->followed) {
            group.reported_percent = 0;
            group.reported_overload = false;
            group.reported_progress.reset();
        }
    }
    update_followed_groups(daemon);
    // Listing the sockets of a busy host takes milliseconds, and is saved where no decision depends on it.
    if (needs_flows(*daemon))
        count_all_flows(daemon);
    const int64_t now = lt_monotonic_ms();
    for (auto &[id, group] : daemon->followed) {
        const course_facts facts = collect_facts(*daemon, id, daemon->configured.groups.at(id), now);
        group.decided = follow_course(&group.memory, facts);
        report_decisions(daemon, id, &group);
    }
}
