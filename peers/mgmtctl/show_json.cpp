// A snapshot for scripts. The keys are documented (docs/mgmtctl.md) and stay; what isn't known is null.
#include "peers/mgmtctl/show_json.h"

#include "peers/mgmtctl/reasons.h"
#include "peers/mgmtctl/show_draw.h"
#include "peers/mgmtctl/traffic_json.h"

namespace {

ctl_json number_or_null(int64_t number) {
    return number < 0 ? ctl_json(nullptr) : ctl_json(number);
}

ctl_json router_json(const snapshot_router &router) {
    ctl_json shares = ctl_json::object();
    for (const snapshot_load &load : router.loads)
        shares[load.appliance] = load.percent;
    return {{"address", router.address},
            {"id", router.id},
            {"configured", router.configured},
            {"connection", router.connection},
            {"connected_ms", router.connected_ms},
            {"forward", text_or_null(router.forward)},
            {"assign", text_or_null(router.assign)},
            {"return", text_or_null(router.back)},
            {"shares", shares}};
}

ctl_json appliance_json(const snapshot_appliance &one) {
    ctl_json out = {{"address", one.address},
                    {"self", one.self},
                    {"weight", number_or_null(one.weight)},
                    {"asked_percent", number_or_null(one.asked_percent)}};
    out["share_percent"] = one.reported ? ctl_json(one.least_percent) : ctl_json(nullptr);
    out["share_percent_most"] = one.reported ? ctl_json(one.most_percent) : ctl_json(nullptr);
    return out;
}

// Buckets that follow one another and have one owner are one entry.
ctl_json table_json(const snapshot_group &group, const snapshot_table &table) {
    ctl_json runs = ctl_json::array();
    for (size_t i = 0; i < table.owners.size(); i++) {
        const int owner = table.owners[i];
        if (i == 0 || owner != table.owners[i - 1])
            runs.push_back(
                {{"first", i},
                 {"last", i},
                 {"appliance", owner < 0 ? ctl_json(nullptr)
                                         : ctl_json(group.appliances[static_cast<size_t>(owner)].address)}});
        runs.items.back()["last"] = i;
    }
    return {{"kind", table.mask ? "mask" : "hash"}, {"routers", table.routers}, {"buckets", runs}};
}

} // namespace

ctl_json reason_json(const reason &one) {
    return {{"reason", one.code},
            {"group", number_or_null(one.group)},
            {"attention", one.attention},
            {"who", text_or_null(one.who)},
            {"offered", text_or_null(one.offered)},
            {"wanted", text_or_null(one.wanted)},
            {"count", one.count},
            {"first_ms", number_or_null(one.first_ms)},
            {"last_ms", number_or_null(one.last_ms)},
            {"cause", one.cause},
            {"next", one.next}};
}

namespace {

ctl_json group_json(const snapshot_group &group) {
    ctl_json out = {{"id", group.id},
                    {"configured", group.configured},
                    {"admin", text_or_null(group.admin)},
                    {"interface", text_or_null(group.interface)},
                    {"protocol", text_or_null(group.protocol)},
                    {"priority", number_or_null(group.priority)},
                    {"weight", number_or_null(group.weight)},
                    {"encap", text_or_null(group.encap)},
                    {"assign_method", text_or_null(group.assign_method)},
                    {"policy", number_or_null(group.policy)},
                    {"password", group.authenticated},
                    {"running", group.running},
                    {"state", text_or_null(group.state)},
                    {"designated", group.designated},
                    {"uptime_ms", group.uptime_ms},
                    {"address", text_or_null(group.address)},
                    {"link", text_or_null(group.link)}};
    out["routers"] = ctl_json::array();
    for (const snapshot_router &router : group.routers)
        out["routers"].push_back(router_json(router));
    out["appliances"] = ctl_json::array();
    for (const snapshot_appliance &one : group.appliances)
        out["appliances"].push_back(appliance_json(one));
    out["tables"] = ctl_json::array();
    for (const snapshot_table &table : group.tables)
        out["tables"].push_back(table_json(group, table));
    out["wanted_table"] = group.wanted.owners.empty() ? ctl_json(nullptr) : table_json(group, group.wanted);
    return out;
}

} // namespace

std::string draw_json(const snapshot &shown) {
    static const char *const conditions[] = {"running", "silent", "absent"};
    ctl_json out = {{"mgmtd", shown.unreachable.empty() ? "running" : "unreachable"}};
    if (!shown.unreachable.empty()) {
        out["reason"] = shown.unreachable;
        return json_text(out);
    }
    out["wccpd"] = conditions[static_cast<int>(shown.wccpd)];
    out["status"] = text_or_null(shown.status);
    out["version"] = text_or_null(shown.version);
    out["mode"] = text_or_null(shown.mode);
    out["groups_total"] = shown.groups_total;
    out["groups"] = ctl_json::array();
    for (const snapshot_group &group : shown.groups)
        out["groups"].push_back(group_json(group));
    out["traffic"] = traffic_json(shown.traffic);
    const std::vector<reason> reasons = reasons_of(shown);
    out["reasons"] = ctl_json::array();
    for (const reason &each : reasons)
        out["reasons"].push_back(reason_json(each));
    const bool known = shown.alarms_total > 0 || shown.wccpd == wccpd_condition::running;
    out["alarms_total"] = known ? ctl_json(shown.alarms_total) : ctl_json(nullptr);
    out["alarms"] = ctl_json::array();
    for (const snapshot_alarm &alarm : shown.alarms) {
        const reason *cause = alarm_reason(reasons, alarm.group, alarm.name, alarm.source);
        out["alarms"].push_back({{"type", alarm.type},
                                 {"name", alarm.name},
                                 {"group", number_or_null(alarm.group)},
                                 {"source", alarm.source},
                                 {"text", alarm.text},
                                 {"since", text_or_null(alarm.since)},
                                 {"reporter", text_or_null(alarm.reporter)},
                                 {"reason", cause ? ctl_json(cause->code) : ctl_json(nullptr)},
                                 {"cause", cause ? ctl_json(cause->cause) : ctl_json(nullptr)}});
    }
    return json_text(out);
}
