// The table of reasons, and the reasons that follow from the state of a group.
//
// wccpd's own reasons are taken as they are: it removes those that have ended. Other reasons follow from the
// state, where nothing was refused: a router does not answer, a table has not arrived yet, other appliances
// have the buckets. They are left out where one of wccpd's reasons explains the state.
#include "peers/mgmtctl/reasons.h"

#include <algorithm>
#include <functional>
#include <map>

#include "peers/mgmtctl/show_draw.h"
#include "peers/mgmtctl/show_words.h"

const std::vector<reason_text> &reason_texts() {
    static const std::vector<reason_text> texts = {
        // The programs.
        {"mgmtd-unreachable", true, "mgmtd does not answer: {offered}", "start mgmtd, or look at its log"},
        {"wccpd-absent", true, "wccpd is not running: the appliance is in no group",
         "start wccpd; its log has the reason why it ended"},
        {"wccpd-silent", true, "wccpd does not answer: the state of the groups is unknown",
         "look at its log; if this lasts, restart it"},
        {"tunneld-absent", true, "tunneld has no session with mgmtd: no tunnels, no traffic",
         "start tunneld; its log has the reason why it ended"},
        {"tunneld-silent", true, "tunneld does not answer", "look at its log; if this lasts, restart it"},
        {"restart-loop", true, "{who} ends again and again: {offered}",
         "its log has the reason (journalctl -u {who}); the alarm is cleared once it has run for 5 "
         "minutes"},
        // A group that cannot begin.
        {"disabled", false, "the group is disabled", "mgmtctl group set {group} admin up"},
        {"no-interface", true, "the group has no interface", "mgmtctl group set {group} interface NAME"},
        {"no-router", true, "the group has no router", "mgmtctl group set {group} router ADDRESS"},
        {"not-taken", true, "wccpd does not have the group",
         "its log has the reason; then mgmtctl group "
         "restart {group}"},
        {"not-configured", true, "wccpd runs the group although it is not configured",
         "restart wccpd; if the group comes back, report it"},
        {"left", true, "the group has left its routers: {offered}",
         "start the proxy, and the group returns; mgmtctl intercept show {group} shows its state"},
        {"drain", true, "the group is drained", "mgmtctl drain cancel {group} ends it"},
        {"interface-missing", true, "there is no interface {wanted}",
         "create it, or mgmtctl group set {group} interface NAME"},
        {"interface-down", true, "the interface {wanted} is down",
         "ip link set {wanted} up; check the cable"},
        {"interface-no-address", true, "the interface {wanted} has no IPv4 address",
         "ip address add ADDRESS/LENGTH dev {wanted}"},
        {"port-taken", true, "UDP port 2048 on {wanted} is taken: {offered}",
         "ss -lunp 'sport = 2048' shows by whom; stop that program"},
        {"socket-failed", true, "no socket can be opened on {wanted}: {offered}",
         "free what is lacking; wccpd tries again every 30 s"},
        {"join-failed", true, "the multicast group cannot be joined on {wanted}: {offered}",
         "sysctl net.ipv4.igmp_max_memberships; wccpd tries again every 30 s"},
        {"here-i-am-not-built", true, "no Here-I-Am can be built: {offered}", "report it with wccpd's log"},
        {"send-failed", true, "sending to {who} fails: {offered}",
         "check the route and the firewall towards {who}"},
        {"no-memory", true, "wccpd has no memory for {offered} ({who})",
         "give it more (limit of locked memory, mem.conf)"},
        // A router whose messages are refused.
        {"security-missing", true, "{who} does not sign its messages, but the group has a password",
         "set the password on the router, or mgmtctl group set {group} password default"},
        {"security-unwanted", true, "{who} signs its messages ({offered}), but the group has no password",
         "mgmtctl group set {group} password -, as on the router"},
        {"password-mismatch", true, "{who} signs its messages with another password",
         "set the same one on both: mgmtctl group set {group} password -"},
        {"message-version", true, "{who} speaks version {offered} of the protocol, not {wanted}",
         "set the router to version 2"},
        {"view-length", true, "the view of {who} has {offered}, but its content needs {wanted}",
         "set the router's kind: mgmtctl group set {group} compatibility ios or nexus"},
        {"message-length", true, "a message from {who} has {offered}, but {wanted}",
         "look for a path that truncates packets (MTU, firewall)"},
        {"message-malformed", true, "a message from {who} has {offered}; expected: {wanted}",
         "capture it (udp port 2048); the router or the path breaks it"},
        {"message-type", false, "{who} sends messages of {offered}, which are not for an appliance",
         "it is probably another appliance: give it the routers' addresses"},
        {"router-id-zero", true, "{who} calls itself 0.0.0.0", "give the router an id or a loopback address"},
        {"routers-exhausted", true, "{who} is one router too many; {wanted}",
         "spread the routers over several groups"},
        {"forwarding-not-offered", true, "{who} offers forwarding by {offered}, but {wanted} is wanted",
         "mgmtctl group set {group} encap either, or change the router or the first router's method"},
        {"assignment-not-offered", true, "{who} offers assignment by {offered}, but {wanted} is wanted",
         "mgmtctl group set {group} assign either, or change the router or the first router's method"},
        {"return-not-offered", true, "{who} offers return by {offered}, but {wanted} is wanted",
         "let the router offer {wanted}"},
        {"service-mismatch", true, "{who} defines the service with {offered}; here it has {wanted}",
         "make them equal: mgmtctl group set {group} priority, protocol, hash-..., or on the router"},
        {"group-unknown", true, "{who} asks for {offered}, which is not configured here",
         "add it (mgmtctl group add), or remove this appliance from it on the router"},
        {"group-disabled", false, "{who} still sends to the group, which is disabled",
         "nothing, or mgmtctl group set {group} admin up"},
        {"group-stopped", false, "{who} sends messages while the group cannot run",
         "see the other reasons of the group"},
        {"query-refused", false, "{who} sent {offered}",
         "nothing, unless it continues; then restart the group"},
        // Tunnels.
        {"mailbox-missing", true, "wccpd has no mailbox to tunneld: {who} gets no tunnel",
         "another wccpd owns it: stop that one, then restart wccpd"},
        {"tunnel-timeout", true, "tunneld did not answer in 2 s: {who} gets no tunnel",
         "look at tunneld's log; wccpd tries again with each message"},
        {"tunnel-refused", true, "tunneld refuses the tunnel to {who} ({offered} {wanted})",
         "its log has the reason; mgmtctl tunnel show"},
        {"tunnel-ids-exhausted", true, "all tunnel ids ({wanted}) are in use: {who} gets no tunnel",
         "let fewer routers forward or return by GRE"},
        // Routers and appliances that do not see each other.
        {"method-differs", true, "assignment is {offered}, but {wanted} here",
         "set the same assignment on all appliances (group set {group} assign), then group restart {group}"},
        {"not-in-view", true,
         "{who} answers, but does not list this appliance (it lists {offered}, not {wanted})",
         "wait 20 s; then check the router's list of appliances and its redirect ACL"},
        {"router-silent", true, "{who} has stopped answering: no I-See-You for 40 s",
         "check the router, its password for the group, and the path to it"},
        {"no-answer", true, "{who} does not answer ({offered})",
         "wait 20 s; then check address, service group, password and path (UDP 2048) on the router"},
        {"election-blocked", true,
         "no appliance can be designated: the routers list {who}, which is not two-way here: {offered}",
         "add {who} to the group (mgmtctl group set {group} router ...), or remove it on the routers"},
        // The table.
        {"mask-differs", true, "{who} uses the mask {offered}; here it is {wanted}",
         "set the same mask on all appliances"},
        {"appliance-left-out", true, "{who} gets no share: {offered} of {wanted} routers list it",
         "give {who} all routers of the group, and check the routers' lists of appliances"},
        {"table-not-built", true, "no table can be built: {offered}", "mgmtctl group restart {group}"},
        {"not-acknowledged", true, "{who} has not acknowledged the table ({offered}, wanted {wanted})",
         "wait 20 s; then look at the router's log for refused assignments"},
        {"assignment-differs", true, "{who} assigns {offered}; wanted: {wanted}",
         "compare the routers' tables: mgmtctl show; mgmtctl group restart {group} makes a new one"},
        {"assignment-unreadable", true, "the assignment of {who} cannot be read",
         "set the router's kind: mgmtctl group set {group} compatibility ios or nexus"},
        {"waiting-assignment", true, "the routers answer; no table is in force yet ({offered})",
         "wait: the designated appliance sends it 16 s after the last change"},
        {"restart-needed", true, "the group runs with {offered}, but is configured with {wanted}",
         "mgmtctl group restart {group}"},
        {"weight-zero", false, "this appliance has the weight 0: the routers redirect to {offered}",
         "mgmtctl group set {group} weight N"},
        {"redirected-elsewhere", true, "this appliance gets nothing: the routers redirect to {offered}",
         "check that the designated appliance lists this one and gives it a weight"},
        {"not-designated", false, "{who} is designated: it has the lowest address and makes the table",
         "nothing; if the table is wrong, examine that appliance"},
        // Traffic.
        {"lack", true, "all packets are returned: the kernel lacks features that sort them",
         "load the kernel's modules, or use --plane user; then restart tunneld"},
        {"failure", true, "the kernel is not as wanted: something in it could not be changed",
         "tunneld tries again; its log has the details"},
        {"proxy-down", true, "the proxy is down; the last check has the reason",
         "start the proxy; mgmtctl intercept show {group} shows its state"},
        {"overload", true, "the proxy has too many flows; new ones are returned",
         "more appliances, a larger limit, or less weight"},
        {"slow-start", false, "slow start: a part of the weight is announced",
         "nothing: the weight rises by itself"},
        {"standing-by", false, "not ACTIVE; new flows are returned",
         "nothing while it is a backup; mgmtctl explain {group} shows what it is waiting for"},
        {"own-traffic", true, "the router redirects this appliance's own traffic",
         "exclude this appliance's addresses from redirection on the router"},
        {"refused-source", true, "GRE comes from {who}, which is not one of our routers",
         "accept it when it is the router's: mgmtctl tunnel accept {who}"},
        {"fragments", true, "packets arrive in fragments, and the MSS of no flow has been clamped",
         "raise the MTU towards the routers, or let the MSS be clamped"},
        {"no-intercept", true, "the routers redirect, but no intercept takes the packets: all are returned",
         "mgmtctl intercept add {group} port 80 to PORT"},
        {"flows-unprotected", false, "flows of the former owner of a bucket are not protected",
         "mgmtctl intercept show {group}"},
    };
    return texts;
}

namespace {
size_t place_of(const std::string &code) {
    const std::vector<reason_text> &texts = reason_texts();
    const auto found =
        std::find_if(texts.begin(), texts.end(), [&](const reason_text &row) { return code == row.code; });
    // A code that is not in the table gets the place after its last row, and is sorted after all others.
    return static_cast<size_t>(found - texts.begin());
}
} // namespace

const reason_text *find_reason_text(const std::string &code) {
    const size_t place = place_of(code);
    return place < reason_texts().size() ? &reason_texts()[place] : nullptr;
}

namespace {
std::string fill_placeholders(std::string text, const reason &from) {
    const std::pair<const char *, std::string> values[] = {
        {"{who}", from.who.empty() ? "somebody" : from.who},
        {"{offered}", from.offered.empty() ? "nothing" : from.offered},
        {"{wanted}", from.wanted.empty() ? "something else" : from.wanted},
        {"{group}", from.group < 0 ? "GROUP" : std::to_string(from.group)},
    };
    for (const auto &[name, value] : values)
        // Continues after the inserted value: values come from the network, and one could contain its own
        // placeholder.
        for (size_t at = 0; (at = text.find(name, at)) != std::string::npos; at += value.size())
            text.replace(at, std::string(name).size(), value);
    return text;
}
} // namespace

void fill_reason(const std::vector<reason_text> &texts, reason *inout) {
    const auto found = std::find_if(texts.begin(), texts.end(),
                                    [&](const reason_text &row) { return inout->code == row.code; });
    // A newer daemon may report a code for which this program has no words. It still needs attention.
    const reason_text *text = found != texts.end() ? &*found : find_reason_text(inout->code);
    // tunneld's reasons bring a finished text with values of their own.
    if (inout->cause.empty())
        inout->cause = text ? fill_placeholders(text->cause, *inout)
                            : inout->code + (inout->who.empty() ? "" : " of " + inout->who);
    inout->next = fill_placeholders(text ? text->next : "look at the log of wccpd and tunneld", *inout);
    inout->attention = (!text || text->attention) && !inout->harmless;
}

// --- Reasons that follow from the state

namespace {
struct reason_list {
    std::vector<reason> reasons;

    reason *add_reason(const char *code, int group) {
        reasons.emplace_back().code = code;
        reasons.back().group = group;
        return &reasons.back();
    }
    void add_state(const char *code, const snapshot_group &group, const std::string &who,
                   const std::string &offered, const std::string &wanted = "") {
        reason *made = add_reason(code, group.id);
        made->who = who;
        made->offered = offered;
        made->wanted = wanted;
        // The uptime begins when the role becomes ACTIVE or BACKUP, and is 0 before; then the state has
        // lasted since the group was started.
        if (group.running)
            made->first_ms = static_cast<int64_t>(group.uptime_ms ? group.uptime_ms : group.since_ms);
    }
};

bool has_reason(const snapshot_group &group, std::initializer_list<const char *> codes,
                const std::string &who = "") {
    return std::any_of(group.reasons.begin(), group.reasons.end(), [&](const snapshot_reason &each) {
        return (who.empty() || each.sender == who) &&
               std::any_of(codes.begin(), codes.end(), [&](const char *code) { return each.code == code; });
    });
}

bool is_about(const snapshot_reason &reason, const snapshot_router &router) {
    // A packet that is refused before its router identity is read is known only by its source address.
    return (!reason.sender.empty() && (reason.sender == router.address || reason.sender == router.id)) ||
           reason.source == router.address;
}

// The latest of them.
const snapshot_reason *last_reason(const std::vector<snapshot_reason> &reasons,
                                   const std::function<bool(const snapshot_reason &)> &wanted) {
    const snapshot_reason *found = nullptr;
    for (const snapshot_reason &each : reasons)
        // These times are ages: the smaller one is the later occurrence.
        if (wanted(each) && (!found || each.last_ms < found->last_ms))
            found = &each;
    return found;
}
} // namespace

const snapshot_reason *router_reason(const snapshot &shown, const snapshot_group &group,
                                     const snapshot_router &router) {
    // One that needs attention, rather than a later one that does not.
    const snapshot_reason *of_group = last_reason(group.reasons, [&](const snapshot_reason &each) {
        const reason_text *text = find_reason_text(each.code);
        return is_about(each, router) && (!text || text->attention);
    });
    if (!of_group)
        of_group =
            last_reason(group.reasons, [&](const snapshot_reason &each) { return is_about(each, router); });
    // A packet that is refused before its group is known may have been for any group of its sender. One for a
    // group that is not configured may have been meant for a group that hears nothing.
    const snapshot_reason *of_none = last_reason(shown.reasons, [&](const snapshot_reason &each) {
        return is_about(each, router) && (each.code.starts_with("message-") ||
                                          (each.code == "group-unknown" && router.connection == "none"));
    });
    return !of_none || (of_group && of_group->last_ms <= of_none->last_ms) ? of_group : of_none;
}

namespace {
// Reasons that are states: they last until they end, and their count means nothing.
bool is_lasting(const std::string &code) {
    static const char *const codes[] = {"interface-missing", "interface-down",     "interface-no-address",
                                        "port-taken",        "socket-failed",      "join-failed",
                                        "router-silent",     "election-blocked",   "assignment-differs",
                                        "not-acknowledged",  "appliance-left-out", "mailbox-missing",
                                        "restart-needed"};
    return std::any_of(std::begin(codes), std::end(codes), [&](const char *each) { return code == each; });
}

void add_noted(const std::vector<snapshot_reason> &noted, int group, reason_list *list) {
    // A router that does not list this appliance cannot be two-way, and blocks the election for that reason.
    const auto is_unlisted = [&](const std::string &router) {
        return std::any_of(noted.begin(), noted.end(), [&](const snapshot_reason &each) {
            return each.code == "not-in-view" && each.sender == router;
        });
    };
    for (const snapshot_reason &each : noted) {
        if (each.code == "interface-missing" && each.wanted.empty())
            continue; // the group has no interface: "no-interface" reports it
        if (each.code == "election-blocked" && is_unlisted(each.sender))
            continue; // follows from "not-in-view"
        reason *made = list->add_reason(each.code.c_str(), group);
        made->who = each.sender.empty() ? each.source : each.sender;
        made->offered = each.offered;
        made->wanted = each.wanted;
        made->count = each.count;
        made->lasts = is_lasting(each.code);
        made->first_ms = each.first_ms;
        made->last_ms = each.last_ms;
    }
}

void add_unheard_routers(const snapshot &shown, const snapshot_group &group, reason_list *list) {
    // Without a working interface no router can answer. The group has the reason for that already.
    if (has_reason(group, {"interface-missing", "interface-down", "interface-no-address", "port-taken",
                           "socket-failed", "join-failed"}))
        return;
    for (const snapshot_router &router : group.routers) {
        if (router.connection != "none" || router_reason(shown, group, router))
            continue;
        list->add_state("no-answer", group, router.address,
                        std::to_string(group.here_i_ams) + " Here-I-Am sent");
        // Not since the group became ACTIVE with other routers: this one has been silent since the start.
        list->reasons.back().first_ms = static_cast<int64_t>(group.since_ms);
    }
}

std::string lowest_appliance(const snapshot_group &group) {
    return group.appliances.empty() ? "" : group.appliances.front().address; // sorted by address
}

void add_missing_traffic(const snapshot_group &group, reason_list *list) {
    const bool two_way = std::any_of(group.routers.begin(), group.routers.end(),
                                     [](const auto &router) { return router.connection == "two-way"; });
    std::string others;
    for (const snapshot_appliance &one : group.appliances)
        if (!one.self && one.most_percent > 0)
            others +=
                (others.empty() ? "" : ", ") + one.address + " " + std::to_string(one.most_percent) + "%";
    // BACKUP: the routers use a table that gives this appliance nothing, as intended with the weight 0.
    if (group.state == "BACKUP")
        list->add_state(group.weight == 0 ? "weight-zero" : "redirected-elsewhere", group, "",
                        others.empty() ? "nobody" : others);
    // INIT although routers answer: no table has arrived. Nobody sends one in the two excluded cases, which
    // have reasons of their own.
    else if (group.state == "INIT" && two_way && !has_reason(group, {"election-blocked", "table-not-built"}))
        list->add_state("waiting-assignment", group, "",
                        (group.designated ? "this appliance" : lowest_appliance(group)) + " is designated");
    // In INIT, "waiting-assignment" names the designated appliance already.
    if (group.state != "INIT" && !group.designated && !lowest_appliance(group).empty() &&
        lowest_appliance(group) != group.address)
        list->add_state("not-designated", group, lowest_appliance(group), "");
}

void add_group_reasons(const snapshot &shown, const snapshot_group &group, reason_list *list) {
    // Nothing follows from the state of a disabled group. What wccpd noted is listed all the same, for
    // example a router that still sends to it.
    if (group.admin == "down") {
        list->add_state("disabled", group, "", "");
        add_noted(group.reasons, group.id, list);
        return;
    }
    if (group.configured && !group.interface_set)
        list->add_state("no-interface", group, "", "");
    else if (group.configured && group.routers_configured == 0)
        list->add_state("no-router", group, "", "");
    // Without an answer of wccpd it is unknown which groups it has. A group that has left has the reason
    // "left".
    else if (!group.running && shown.wccpd == wccpd_condition::running &&
             !shown.traffic.left.contains(group.id))
        list->add_state("not-taken", group, "", "");
    if (!group.running)
        return;
    if (!group.configured)
        list->add_state("not-configured", group, "", "");
    // mgmtd has wccpd disable a group that is out of its routers. "left" or "drain" explains that better than
    // "group-disabled".
    std::vector<snapshot_reason> noted = group.reasons;
    const bool out = is_out_of_its_routers(shown, group);
    if (out)
        std::erase_if(noted, [](const snapshot_reason &each) { return each.code == "group-disabled"; });
    add_noted(noted, group.id, list);
    for (const snapshot_router &router : group.routers)
        // Refusals of packets whose group was not known yet count for the groups of the sender. Those of the
        // group itself have just been added.
        if (const snapshot_reason *each = router_reason(shown, group, router);
            each && std::none_of(group.reasons.begin(), group.reasons.end(),
                                 [&](const snapshot_reason &own) { return &own == each; }))
            add_noted({*each}, group.id, list);
    // A brief snapshot has no routers and appliances from which anything could follow.
    if (shown.brief)
        return;
    if (!out)
        add_unheard_routers(shown, group, list);
    add_missing_traffic(group, list);
    // The data plane "table" carries no packets, and needs no intercepts.
    const bool sorts = shown.traffic.tunneld == tunneld_condition::running && shown.traffic.plane != "table";
    const bool intercepted =
        std::any_of(shown.traffic.intercepts.begin(), shown.traffic.intercepts.end(),
                    [&](const traffic_intercept &each) { return each.group == group.id; });
    if (sorts && !intercepted && group.state == "ACTIVE") {
        list->add_state("no-intercept", group, "", "");
        // It may be the group for servers' replies to the proxies of another group.
        list->reasons.back().harmless = !shown.traffic.intercepts.empty();
    }
}

void add_traffic_reasons(const snapshot &shown, reason_list *list) {
    for (const traffic_reason &each : traffic_reasons(shown.traffic)) {
        reason *made = list->add_reason(each.word.c_str(), each.group);
        made->who = each.who;
        made->count = each.count;
        made->first_ms = each.first_ms;
        made->last_ms = each.last_ms;
        for (const snapshot_group &group : shown.groups)
            // tunneld does not know since when the group has not been ACTIVE; wccpd does.
            if (each.word == "standing-by" && group.id == each.group && group.running)
                made->first_ms = static_cast<int64_t>(group.uptime_ms ? group.uptime_ms : group.since_ms);
        if (!each.who.empty())
            continue; // the cause comes from the table
        made->cause = each.text + (each.detail.empty() ? "" : " (" + each.detail + ")");
        for (const char *end : {": ", " "}) // the heading names the group
            if (const std::string own = "group " + std::to_string(each.group) + end;
                made->cause.starts_with(own))
                made->cause.erase(0, own.size());
    }
}

void add_process_reason(const snapshot &shown, const std::string &name, bool absent, reason_list *list) {
    reason *made = list->add_reason((name + (absent ? "-absent" : "-silent")).c_str(), -1);
    const auto known = shown.processes.find(name);
    // mgmtd's entry was read at another moment than the failed query. Its time counts only if both agree.
    if (known != shown.processes.end() && known->second.running != absent)
        made->first_ms = ms_since(absent ? known->second.since : known->second.silent_since);
}

void add_restart_loops(const snapshot &shown, reason_list *list) {
    for (const snapshot_alarm &alarm : shown.alarms) {
        if (alarm.name != "restart-loop")
            continue;
        reason *made = list->add_reason("restart-loop", -1);
        made->who = alarm.source;
        made->offered = alarm.text;
        made->first_ms = ms_since(alarm.since);
    }
}
} // namespace

std::vector<reason> reasons_of(const snapshot &shown) {
    reason_list list;
    if (!shown.unreachable.empty()) {
        list.add_reason("mgmtd-unreachable", -1)->offered = shown.unreachable;
    } else {
        if (shown.wccpd != wccpd_condition::running)
            add_process_reason(shown, "wccpd", shown.wccpd == wccpd_condition::absent, &list);
        if (shown.traffic.tunneld != tunneld_condition::running)
            add_process_reason(shown, "tunneld", shown.traffic.tunneld == tunneld_condition::absent, &list);
        add_restart_loops(shown, &list);
        add_noted(shown.reasons, -1, &list);
        for (const snapshot_group &group : shown.groups)
            add_group_reasons(shown, group, &list);
        add_traffic_reasons(shown, &list);
    }
    for (reason &each : list.reasons) {
        fill_reason(reason_texts(), &each);
    }
    // Reasons of the whole appliance have the group -1 and come first. Several of one code stay in the order
    // in which they were found.
    std::stable_sort(list.reasons.begin(), list.reasons.end(), [](const reason &a, const reason &b) {
        return a.group != b.group ? a.group < b.group : place_of(a.code) < place_of(b.code);
    });
    return std::move(list.reasons);
}

const reason *main_reason(const std::vector<reason> &reasons, int group) {
    const auto found = std::find_if(reasons.begin(), reasons.end(), [&](const reason &each) {
        return each.group == group && each.attention;
    });
    return found == reasons.end() ? nullptr : &*found;
}

namespace {
// The first reason that can have caused the alarm, or else the main one.
const reason *group_alarm_reason(const std::vector<reason> &reasons, int group, bool adjacency) {
    // The table's order also tells what a reason can break. All up to the assignment table can keep routers
    // from becoming two-way; those from "election-blocked" up to traffic can spoil an assignment. A service
    // mismatch is only noted: wccpd accepts that router.
    const size_t last = place_of("election-blocked"), table = place_of("mask-differs"),
                 end = place_of("lack");
    for (const reason &each : reasons) {
        const size_t place = place_of(each.code);
        if (each.group == group && each.attention && each.code != "service-mismatch" &&
            (adjacency ? place < table : place >= last && place < end))
            return &each;
    }
    return main_reason(reasons, group);
}
} // namespace

const reason *alarm_reason(const std::vector<reason> &reasons, int group, const std::string &alarm,
                           const std::string &source) {
    if (group >= 0 && (alarm == "adjacency" || alarm == "assignment"))
        return group_alarm_reason(reasons, group, alarm == "adjacency");
    // Other alarms have the name of their reason. Reasons of the whole appliance differ by their subject,
    // which is the alarm's source.
    const auto found = std::find_if(reasons.begin(), reasons.end(), [&](const reason &each) {
        return each.group == group && each.code == alarm && (group >= 0 || each.who == source);
    });
    const bool other =
        found != reasons.end() && std::any_of(found + 1, reasons.end(), [&](const reason &each) {
            return each.group == group && each.code == alarm; // it is not known which of them
        });
    return found == reasons.end() || other ? nullptr : &*found;
}

std::string reason_times(const reason &one) {
    const auto ago = [](int64_t ms) { return duration_text(static_cast<uint64_t>(ms)) + " ago"; };
    if (one.count == 0 || one.lasts)
        return one.first_ms < 0 ? "" : "for " + duration_text(static_cast<uint64_t>(one.first_ms));
    if (one.count == 1)
        return one.last_ms < 0 ? "" : "once, " + ago(one.last_ms);
    return std::to_string(one.count) + " times, first " + ago(std::max<int64_t>(one.first_ms, 0)) +
           ", last " + ago(std::max<int64_t>(one.last_ms, 0));
}

std::string reason_table_markdown() {
    std::string out = "| reason | cause | cure |\n|---|---|---|\n";
    const std::map<std::string, std::string> words = {
        {"{who}", "ADDRESS"}, {"{offered}", "VALUE"}, {"{wanted}", "VALUE"}, {"{group}", "GROUP"}};
    for (const reason_text &row : reason_texts()) {
        std::string line = std::string("| `") + row.code + "`" + (row.attention ? "" : " (no fault)") +
                           " | " + row.cause + " | " + row.next + " |\n";
        for (const auto &[name, word] : words)
            for (size_t at = 0; (at = line.find(name, at)) != std::string::npos; at += word.size())
                line.replace(at, name.size(), word);
        out += line;
    }
    return out;
}
