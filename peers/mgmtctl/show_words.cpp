#include "peers/mgmtctl/show_words.h"

#include <algorithm>
#include <cinttypes>
#include <cstdio>

#include "peers/mgmtctl/show_draw.h"

std::string duration_text(uint64_t milliseconds) {
    const uint64_t seconds = milliseconds / 1000, days = seconds / 86400;
    char text[48];
    snprintf(text, sizeof text, "%" PRIu64 ":%02" PRIu64 ":%02" PRIu64, seconds / 3600 % 24,
             seconds / 60 % 60, seconds % 60);
    return (days ? std::to_string(days) + "d " : "") + text;
}

std::string plural_text(size_t count, const char *what) {
    return std::to_string(count) + " " + what + (count == 1 ? "" : "s");
}

char appliance_letter(int place) {
    return place < 0 ? '-' : static_cast<char>(place < 26 ? 'A' + place : 'a' + place - 26);
}

std::string share_words(const snapshot_appliance &one) {
    if (!one.reported)
        return "-";
    std::string text = std::to_string(one.least_percent);
    // Routers that give it different shares: "20-40%".
    if (one.most_percent != one.least_percent)
        text += "-" + std::to_string(one.most_percent);
    return text + "%";
}

const snapshot_appliance *own_appliance(const snapshot_group &group) {
    const auto self = std::find_if(group.appliances.begin(), group.appliances.end(),
                                   [](const snapshot_appliance &one) { return one.self; });
    return self == group.appliances.end() ? nullptr : &*self;
}

size_t connected_routers(const snapshot_group &group) {
    return static_cast<size_t>(std::count_if(group.routers.begin(), group.routers.end(),
                                             [](const auto &r) { return r.connection == "two-way"; }));
}

std::string group_counts(const snapshot &shown) {
    size_t active = shown.roles_active, backup = shown.roles_backup;
    // A brief snapshot may not have all groups; mgmtd knows all roles.
    if (!shown.brief) {
        active = backup = 0;
        for (const snapshot_group &group : shown.groups) {
            active += group.state == "ACTIVE";
            backup += group.state == "BACKUP";
        }
    }
    std::string text = shown.groups_total == 0 ? "no group" : plural_text(shown.groups_total, "group");
    if (shown.groups_total != 0 && shown.wccpd == wccpd_condition::running)
        text += ": " + std::to_string(active) + " active" +
                (backup ? ", " + std::to_string(backup) + " backup" : "");
    return text;
}

std::string alarm_cause(const snapshot_alarm &alarm, const std::vector<reason> &reasons) {
    static const struct {
        const char *name, *words;
    } known[] = {
        {"adjacency", "a router was not connected when it was checked last"},
        {"assignment", "a router does not share out the traffic as asked"},
    };
    const auto *row = std::find_if(std::begin(known), std::end(known),
                                   [&](const auto &each) { return alarm.name == each.name; });
    const reason *cause = alarm_reason(reasons, alarm.group, alarm.name, alarm.source);
    return cause ? cause->cause : row != std::end(known) ? row->words : alarm.text;
}

bool is_in_alarm(const snapshot &shown, const snapshot_group &group) {
    return std::any_of(shown.alarms.begin(), shown.alarms.end(),
                       [&](const snapshot_alarm &alarm) { return alarm.group == group.id; });
}

bool is_out_of_its_routers(const snapshot &shown, const snapshot_group &group) {
    return shown.traffic.left.contains(group.id) ||
           std::any_of(
               shown.traffic.drains.begin(), shown.traffic.drains.end(),
               [&](const traffic_drain &each) { return each.group == group.id && each.state != "draining"; });
}

std::pair<std::string, style> group_state_words(const snapshot &shown, const snapshot_group &group,
                                                bool troubled) {
    if (group.admin == "down")
        return {"admin down", style::dim};
    if (shown.traffic.left.contains(group.id))
        return {"left its routers", style::bad};
    if (!group.running)
        return {shown.wccpd == wccpd_condition::running ? "not taken by wccpd" : "configured", style::warn};
    std::string text = group.state + (group.designated ? ", designated" : "");
    if (!group.configured)
        text += ", not configured";
    const bool missing = std::any_of(group.reasons.begin(), group.reasons.end(),
                                     [](const auto &each) { return each.code == "interface-missing"; });
    if (missing)
        return {text + ", no interface", style::bad};
    if (group.link == "down")
        return {text + ", link down", style::bad};
    return {text, group.state == "INIT" || troubled ? style::warn : style::good};
}
