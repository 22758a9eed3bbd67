// Reads tunneld's nodes into plain data, and finds the reasons that follow from them.
#include "peers/mgmtctl/traffic.h"

#include <algorithm>
#include <cinttypes>
#include <cstdio>
#include <ctime>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/show_draw.h"
#include "peers/mgmtctl/show_model.h"
#include "runtime/common.h"

namespace {
constexpr size_t ENTRIES_MAX = 256; // of any one kind
constexpr int64_t OVER_MS = 300000; // after the last packet the reason has ended

// How the value of a node is stored in its subject.
template <typename Subject>
struct state_row {
    const char *node;
    void (*take)(Subject *subject, const std::string &value);
};

uint64_t read_count(const std::string &text) {
    return number_of<uint64_t>(text, 0);
}

const state_row<traffic_tunnel> tunnel_rows[] = {
    {"local", [](traffic_tunnel *t, const std::string &v) { t->local = clean_text(v, 15); }},
    {"remote", [](traffic_tunnel *t, const std::string &v) { t->remote = clean_text(v, 15); }},
    {"interface", [](traffic_tunnel *t, const std::string &v) { t->interface = clean_text(v, 15); }},
    {"index", [](traffic_tunnel *t, const std::string &v) { t->index = number_of<uint32_t>(v, 0); }},
    {"packets_in", [](traffic_tunnel *t, const std::string &v) { t->in.packets = read_count(v); }},
    {"bytes_in", [](traffic_tunnel *t, const std::string &v) { t->in.bytes = read_count(v); }},
    {"packets_out", [](traffic_tunnel *t, const std::string &v) { t->out.packets = read_count(v); }},
    {"bytes_out", [](traffic_tunnel *t, const std::string &v) { t->out.bytes = read_count(v); }},
    {"fragments", [](traffic_tunnel *t, const std::string &v) { t->fragments = read_count(v); }},
};

const state_row<traffic_intercept> intercept_rows[] = {
    {"proxy", [](traffic_intercept *i, const std::string &v) { i->proxy = clean_text(v, 15); }},
    {"proxy_reason", [](traffic_intercept *i, const std::string &v) { i->proxy_reason = clean_text(v, 63); }},
    {"proxy_ms", [](traffic_intercept *i, const std::string &v) { i->proxy_ms = read_count(v); }},
    {"active", [](traffic_intercept *i, const std::string &v) { i->active = v != "false"; }},
    {"left", [](traffic_intercept *i, const std::string &v) { i->left = v == "true"; }},
    {"flows", [](traffic_intercept *i, const std::string &v) { i->flows = number_of<int64_t>(v, -1); }},
    {"overloaded", [](traffic_intercept *i, const std::string &v) { i->overloaded = v == "true"; }},
    {"weight_percent",
     [](traffic_intercept *i, const std::string &v) { i->weight_percent = number_of<uint32_t>(v, 100); }},
};

const state_row<protection_counts> protection_rows[] = {
    {"passed", [](protection_counts *p, const std::string &v) { p->passed = read_count(v); }},
    {"received", [](protection_counts *p, const std::string &v) { p->received = read_count(v); }},
    {"delivered", [](protection_counts *p, const std::string &v) { p->delivered = read_count(v); }},
    {"returned", [](protection_counts *p, const std::string &v) { p->returned = read_count(v); }},
};

const state_row<protected_group> protected_group_rows[] = {
    {"covered", [](protected_group *g, const std::string &v) { g->covered = v == "true"; }},
    {"reason", [](protected_group *g, const std::string &v) { g->reason = clean_text(v, 63); }},
    {"slots", [](protected_group *g, const std::string &v) { g->slots = number_of<uint32_t>(v, 0); }},
};

template <typename Subject, size_t COUNT>
void take_row(const state_row<Subject> (&rows)[COUNT], const std::string &node, const std::string &value,
              Subject *subject) {
    for (const auto &row : rows)
        if (node == row.node)
            row.take(subject, value);
}
} // namespace

const std::vector<sorted_way> &sorted_ways() {
    static const std::vector<sorted_way> ways = {
        {"in", "in"},
        {"to_proxy", "to proxy"},
        {"returned", "returned"},
        {"bypassed", "bypassed"},
        {"down", "proxy down"},
        {"forwarded", "forwarded"},
        {"dropped", "dropped"},
        {"own", "own"},
        {"passed", "passed on"},
        {"overload", "overload"},
    };
    return ways;
}

namespace {
void take_sorted(const std::string &node, const std::string &value, sorted_counts *inout) {
    for (const sorted_way &way : sorted_ways()) {
        if (node == way.word)
            (*inout)[way.word].packets = read_count(value);
        else if (node == std::string(way.word) + "_bytes")
            (*inout)[way.word].bytes = read_count(value);
    }
}

void take_counted(const std::string &what, const std::string &value, std::map<std::string, uint64_t> *inout) {
    if (inout->size() < ENTRIES_MAX)
        (*inout)[clean_text(what, 31)] = read_count(value);
}

// --- Gathering

// The entry of this number; nodes arrive in the order of their numbers. Null: not a number, or too many
// entries.
template <typename Entry>
Entry *entry_of(std::vector<Entry> *inout, int Entry::*id, const std::string &part) {
    const int wanted = number_of(part, -1);
    if (wanted < 0)
        return nullptr;
    if (inout->empty() || inout->back().*id != wanted) {
        if (inout->size() >= ENTRIES_MAX)
            return nullptr;
        inout->emplace_back().*id = wanted;
    }
    return &inout->back();
}

// The parts after the first one name what has occurred.
void take_occurrence(const std::vector<std::string> &parts, const std::string &value,
                     std::map<std::string, int64_t> *inout) {
    std::string what = parts[1];
    // For example "refused_source/10.0.0.9"; other occurrences have one part.
    for (size_t i = 2; i < parts.size(); i++)
        what += "/" + parts[i];
    if (inout->size() < ENTRIES_MAX)
        (*inout)[clean_text(what, 31)] = number_of<int64_t>(value, -1);
}

void take_plane(const std::vector<std::string> &parts, const std::string &value, traffic_state *out) {
    if (parts.size() > 1 && (parts[0] == "first_ms" || parts[0] == "last_ms"))
        take_occurrence(parts, value, parts[0] == "first_ms" ? &out->first_ms : &out->last_ms);
    else if (parts.size() == 2 && parts[0] == "refused")
        take_counted(parts[1], value, &out->refused);
    else if (parts.size() == 2 && parts[0] == "refused_source")
        take_counted(parts[1], value, &out->refused_sources);
    else if (parts[0] == "name")
        out->plane = clean_text(value, 15);
    else if (parts[0] == "reason")
        out->plane_reason = clean_text(value, 127);
    else if (parts[0] == "lack")
        out->lack = clean_text(value, 255);
    else if (parts[0] == "failure")
        out->failure = clean_text(value, 255);
    else if (parts[0] == "own")
        out->own = read_count(value);
    else if (parts[0] == "clamped")
        out->clamped = read_count(value);
}

void take_tunnel(const std::vector<std::string> &parts, const std::string &value, traffic_state *out) {
    traffic_tunnel *tunnel = entry_of(&out->tunnels, &traffic_tunnel::id, parts[0]);
    if (tunnel && parts.size() == 3 && parts[1] == "refused")
        take_counted(parts[2], value, &tunnel->refused);
    if (!tunnel || parts.size() != 2)
        return;
    take_row(tunnel_rows, parts[1], value, tunnel);
    take_sorted(parts[1], value, &tunnel->sorted);
}

void take_intercept(const std::vector<std::string> &parts, const std::string &value, traffic_state *out) {
    traffic_intercept *intercept = entry_of(&out->intercepts, &traffic_intercept::group, parts[0]);
    if (!intercept || parts.size() != 2)
        return;
    take_row(intercept_rows, parts[1], value, intercept);
    take_sorted(parts[1], value, &intercept->sorted);
}

void take_protection(const std::vector<std::string> &parts, const std::string &value, traffic_state *out) {
    protection_state *const all = &out->protection;
    if (parts.size() == 1 && parts[0] == "time")
        all->time = number_of<uint32_t>(value, 0);
    else if (parts.size() == 1)
        take_row(protection_rows, parts[0], value, &all->sum);
    else if (parts.size() == 3 && parts[0] == "group") {
        if (protected_group *group = entry_of(&all->groups, &protected_group::group, parts[1]))
            take_row(protected_group_rows, parts[2], value, group);
    } else if (parts.size() == 3 && parts[0] == "member" && all->members.size() < ENTRIES_MAX)
        take_row(protection_rows, parts[2], value, &all->members[clean_text(parts[1], 15)]);
}

void take_accepted(const std::vector<std::string> &parts, const std::string &value, traffic_state *out) {
    if (out->accepted.size() >= ENTRIES_MAX)
        return;
    std::string *router = &out->accepted[clean_text(parts[0], 15)];
    // The default 0.0.0.0 means beside any router.
    if (parts.size() == 2 && parts[1] == "router" && value != "0.0.0.0")
        *router = clean_text(value, 15);
}

void take_left(const std::vector<std::string> &parts, const std::string &value, traffic_state *out) {
    const int group = number_of(parts[0], -1);
    if (group < 0 || group > 255)
        return;
    if (parts.size() == 1)
        out->left[group] = clean_text(value, 63);
    else if (parts[1] == "since")
        out->left_since[group] = clean_text(value, 31);
}
} // namespace

void take_drain(const std::vector<std::string> &parts, const std::string &value,
                std::vector<traffic_drain> *inout) {
    traffic_drain *drain = entry_of(inout, &traffic_drain::group, parts[0]);
    if (drain && parts.size() == 1)
        drain->state = clean_text(value, 15);
    else if (drain && parts[1] == "flows")
        drain->flows = number_of<int64_t>(value, -1);
    else if (drain && parts[1] == "since")
        drain->since = clean_text(value, 31);
    else if (drain && parts[1] == "until")
        drain->until = number_of<int64_t>(value, 0);
}

namespace {
void take_drained(const std::vector<std::string> &parts, const std::string &value, traffic_state *out) {
    take_drain(parts, value, &out->drains);
}
} // namespace

bool gather_traffic(const ctl_ask &ask, traffic_state *out) {
    static const struct {
        const char *root;
        bool of_tunneld;
        void (*take)(const std::vector<std::string> &parts, const std::string &value, traffic_state *out);
    } walks[] = {
        // First, because the other walks of tunneld are skipped when this one shows that it is not running.
        {NODE_PLANE_STATE, true, take_plane},
        {NODE_TUNNEL_STATE, true, take_tunnel},
        {NODE_INTERCEPT_STATE, true, take_intercept},
        {NODE_ACCEPT_CONFIG, false, take_accepted},
        {NODE_PROTECTION_STATE, true, take_protection},
        {NODE_LEFT_GROUPS, false, take_left},
        {NODE_DRAINS, false, take_drained},
    };
    *out = {};
    // Assumed until an answer of tunneld is missing.
    out->tunneld = tunneld_condition::running;
    for (const auto &walk : walks) {
        ctl_reply reply;
        if (walk.of_tunneld && out->tunneld != tunneld_condition::running)
            continue;
        if (!ask(ctl_walk::subtree, walk.root, &reply))
            return false;
        for (const ctl_binding &binding : reply.bindings)
            if (const std::vector<std::string> parts = parts_below(walk.root, binding.name); !parts.empty())
                walk.take(parts, binding.value, out);
        // A running tunneld always has a data plane.
        if (walk.of_tunneld && (reply.code != LC_OK || out->plane.empty()))
            out->tunneld =
                reply.code == LC_IO_TIMED_OUT ? tunneld_condition::silent : tunneld_condition::absent;
    }
    return true;
}

// --- Words

const char *tunneld_word(tunneld_condition condition) {
    static const char *const words[] = {"running", "silent", "absent"};
    return words[static_cast<size_t>(condition)];
}

std::string count_text(uint64_t count) {
    static const char units[] = "kMGTPE";
    if (count < 100'000)
        return std::to_string(count);
    auto shown = static_cast<double>(count);
    size_t unit = 0;
    // From 999.5 on, "%.0f" would print 1000 of this unit.
    for (shown /= 1000; shown >= 999.5; shown /= 1000)
        unit++;
    char text[16];
    // From 9.95 on, "%.1f" would print 10.0.
    snprintf(text, sizeof text, shown < 9.95 ? "%.1f%c" : "%.0f%c", shown, units[unit]);
    return text;
}

std::string sorted_text(const sorted_counts &counts) {
    std::string out;
    for (size_t i = 0; i < sorted_ways().size(); i++) {
        const sorted_way &way = sorted_ways()[i];
        const auto found = counts.find(way.word);
        const uint64_t packets = found == counts.end() ? 0 : found->second.packets;
        if (i < 3 || packets > 0)
            out += (out.empty() ? "" : "  ") + std::string(way.shown) + " " + count_text(packets);
    }
    return out;
}

std::string protection_text(const protection_counts &counts) {
    return "passed on " + count_text(counts.passed) + "  received " + count_text(counts.received) +
           "  delivered " + count_text(counts.delivered) + "  returned " + count_text(counts.returned);
}

std::string proxy_text(const traffic_intercept &intercept) {
    std::string out = "proxy " + (intercept.proxy.empty() ? "unknown" : intercept.proxy);
    if (intercept.proxy_ms > 0)
        out += " " + duration_text(intercept.proxy_ms);
    if (intercept.flows >= 0)
        out += ", " + std::to_string(intercept.flows) + " flows";
    return out;
}

std::string drain_text(const traffic_drain &drain, int64_t now) {
    std::string out = drain.state == "over" ? "has left" : drain.state;
    if (drain.flows > 0 || (drain.flows == 0 && drain.state == "draining"))
        out += (drain.state == "over" ? " with " : ", ") + std::to_string(drain.flows) +
               (drain.flows == 1 ? " flow" : " flows") + (drain.state == "over" ? "" : " left");
    else if (drain.state == "over")
        out += " by its time"; // the flows were not counted
    if (drain.state == "draining")
        out += ", at most " + std::to_string(std::max<int64_t>(drain.until - now, 0)) + " s more";
    return out;
}

// --- Reasons

namespace {
struct reason_list {
    const char *word;
    std::vector<traffic_reason> *out;
    traffic_reason *add_reason(const std::string &text, int group = -1) const {
        out->push_back({word, group, text});
        return &out->back();
    }
};

int64_t age_of(const std::map<std::string, int64_t> &ages, const std::string &what) {
    const auto found = ages.find(what);
    return found == ages.end() ? -1 : found->second;
}

// The reason for packets that a counter has counted, unless the last one was too long ago.
void add_counted(const traffic_state &state, const reason_list &list, const std::string &what,
                 uint64_t packets, const std::string &text, const std::string &who = "") {
    const int64_t last = age_of(state.last_ms, what);
    // A counter keeps its value. Only the age of the last packet tells whether the cause still exists.
    if (packets == 0 || last > OVER_MS)
        return;
    traffic_reason *made = list.add_reason(text);
    made->who = who;
    made->count = packets;
    made->first_ms = age_of(state.first_ms, what);
    made->last_ms = last;
}

void find_own_traffic(const traffic_state &state, const reason_list &list) {
    add_counted(state, list, "own", state.own, "the router redirects this appliance's own traffic");
}

void find_refused_sources(const traffic_state &state, const reason_list &list) {
    for (const auto &[address, packets] : state.refused_sources)
        // Its packets were counted before it was accepted.
        if (!state.accepted.contains(address))
            add_counted(state, list, "refused_source/" + address, packets,
                        "refused source " + address + ": mgmtctl tunnel accept " + address, address);
}

void find_fragments(const traffic_state &state, const reason_list &list) {
    uint64_t packets = 0;
    for (const traffic_tunnel &tunnel : state.tunnels)
        packets += tunnel.fragments;
    if (state.clamped == 0)
        add_counted(state, list, "fragments", packets,
                    "packets arrive in fragments, and the MSS of no flow has been clamped");
}

void find_lacking_kernel(const traffic_state &state, const reason_list &list) {
    if (!state.lack.empty())
        list.add_reason("all packets are returned: " + state.lack)->first_ms = age_of(state.first_ms, "lack");
}

void find_failing_kernel(const traffic_state &state, const reason_list &list) {
    if (!state.failure.empty())
        list.add_reason("the kernel is not as wanted: " + state.failure)->first_ms =
            age_of(state.first_ms, "failure");
}

void find_left_groups(const traffic_state &state, const reason_list &list) {
    for (const auto &[group, reason] : state.left) {
        traffic_reason *made = list.add_reason("group " + std::to_string(group) + " has left its routers" +
                                                   (reason.empty() ? "" : ": ") + reason,
                                               group);
        if (const auto since = state.left_since.find(group); since != state.left_since.end())
            made->first_ms = ms_since(since->second);
    }
}

void find_drains(const traffic_state &state, const reason_list &list) {
    for (const traffic_drain &each : state.drains) {
        const bool draining = each.state == "draining";
        traffic_reason *made =
            list.add_reason("group " + std::to_string(each.group) +
                                (draining ? ": is drained; new flows don't go to the proxy"
                                          : ": drained, and out of its routers until \"drain cancel\""),
                            each.group);
        made->detail = draining ? drain_text(each, time(nullptr)) : "";
        made->first_ms = ms_since(each.since);
    }
}

void find_overloads(const traffic_state &state, const reason_list &list) {
    for (const traffic_intercept &each : state.intercepts) {
        const std::string number = std::to_string(each.group);
        if (!each.overloaded)
            continue;
        traffic_reason *made = list.add_reason(
            "group " + number + ": the proxy has too many flows; new ones are returned", each.group);
        made->detail = each.flows < 0 ? "" : std::to_string(each.flows) + " flows";
        made->first_ms = age_of(state.first_ms, "overload/" + number);
    }
}

void find_slow_starts(const traffic_state &state, const reason_list &list) {
    for (const traffic_intercept &each : state.intercepts) {
        if (each.weight_percent >= 100)
            continue;
        traffic_reason *made = list.add_reason("group " + std::to_string(each.group) +
                                                   ": slow start; a part of the weight is announced",
                                               each.group);
        made->detail = std::to_string(each.weight_percent) + "%";
        made->first_ms = static_cast<int64_t>(each.proxy_ms); // it began when the proxy came up
    }
}

void find_proxies_down(const traffic_state &state, const reason_list &list) {
    for (const traffic_intercept &each : state.intercepts)
        // A group that has left because of its proxy has that in its reason "left".
        if (each.proxy == "down" && !state.left.contains(each.group))
            list.add_reason("group " + std::to_string(each.group) + ": the proxy is down" +
                                (each.proxy_reason.empty() ? "" : ": ") + each.proxy_reason,
                            each.group)
                ->first_ms = static_cast<int64_t>(each.proxy_ms);
}

void find_standing_by(const traffic_state &state, const reason_list &list) {
    for (const traffic_intercept &each : state.intercepts)
        if (!each.active)
            list.add_reason("group " + std::to_string(each.group) + ": not ACTIVE; new flows are returned",
                            each.group);
}

void find_unprotected(const traffic_state &state, const reason_list &list) {
    for (const protected_group &each : state.protection.groups)
        // With the time 0 protection is switched off on purpose.
        if (!each.covered && state.protection.time != 0)
            list.add_reason("group " + std::to_string(each.group) + " is unprotected: " + each.reason,
                            each.group)
                ->first_ms = age_of(state.first_ms, "unprotected/" + std::to_string(each.group));
}
} // namespace

std::vector<traffic_reason> traffic_reasons(const traffic_state &state) {
    static const struct {
        const char *word;
        void (*find)(const traffic_state &state, const reason_list &list);
    } rows[] = {
        {"lack", find_lacking_kernel},
        {"failure", find_failing_kernel},
        {"left", find_left_groups},
        {"proxy_down", find_proxies_down},
        {"drain", find_drains},
        {"overload", find_overloads},
        {"slow_start", find_slow_starts},
        {"standing_by", find_standing_by},
        {"flows_unprotected", find_unprotected},
        {"own_traffic", find_own_traffic},
        {"refused_source", find_refused_sources},
        {"fragments", find_fragments},
    };
    std::vector<traffic_reason> out;
    for (const auto &row : rows)
        // In the order of the rows, which is the order of the output.
        row.find(state, {row.word, &out});
    for (traffic_reason &each : out) // the codes of reasons have hyphens
        std::replace(each.word.begin(), each.word.end(), '_', '-');
    return out;
}
