// tunneld's nodes read into plain data, and the reasons that follow from them.
#include "peers/mgmtctl/traffic.h"

#include <algorithm>
#include <cinttypes>
#include <cstdio>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/show_draw.h"
#include "peers/mgmtctl/show_model.h"
#include "runtime/common.h"

static constexpr size_t ENTRIES_MAX = 256; // of any one kind
static constexpr size_t REASON_MAX = 76;   // characters of a reason's line

namespace {
// What a node says of its subject. The way down to it is given with the text, for nodes that are many.
template <typename Subject>
struct state_row {
    const char *node;
    void (*take)(Subject *subject, const std::string &value);
};
} // namespace

static uint64_t number(const std::string &text) {
    return number_of<uint64_t>(text, 0);
}

static const state_row<traffic_tunnel> tunnel_rows[] = {
    {"local", [](traffic_tunnel *t, const std::string &v) { t->local = clean_text(v, 15); }},
    {"remote", [](traffic_tunnel *t, const std::string &v) { t->remote = clean_text(v, 15); }},
    {"interface", [](traffic_tunnel *t, const std::string &v) { t->interface = clean_text(v, 15); }},
    {"index", [](traffic_tunnel *t, const std::string &v) { t->index = number_of<uint32_t>(v, 0); }},
    {"packets_in", [](traffic_tunnel *t, const std::string &v) { t->in.packets = number(v); }},
    {"bytes_in", [](traffic_tunnel *t, const std::string &v) { t->in.bytes = number(v); }},
    {"packets_out", [](traffic_tunnel *t, const std::string &v) { t->out.packets = number(v); }},
    {"bytes_out", [](traffic_tunnel *t, const std::string &v) { t->out.bytes = number(v); }},
    {"fragments", [](traffic_tunnel *t, const std::string &v) { t->fragments = number(v); }},
};

static const state_row<traffic_intercept> intercept_rows[] = {
    {"proxy", [](traffic_intercept *i, const std::string &v) { i->proxy = clean_text(v, 15); }},
    {"proxy_reason", [](traffic_intercept *i, const std::string &v) { i->proxy_reason = clean_text(v, 63); }},
    {"proxy_ms", [](traffic_intercept *i, const std::string &v) { i->proxy_ms = number(v); }},
    {"active", [](traffic_intercept *i, const std::string &v) { i->active = v != "false"; }},
    {"left", [](traffic_intercept *i, const std::string &v) { i->left = v == "true"; }},
    {"flows", [](traffic_intercept *i, const std::string &v) { i->flows = number_of<int64_t>(v, -1); }},
    {"overloaded", [](traffic_intercept *i, const std::string &v) { i->overloaded = v == "true"; }},
    {"weight_percent",
     [](traffic_intercept *i, const std::string &v) { i->weight_percent = number_of<uint32_t>(v, 100); }},
};

static const state_row<protection_counts> protection_rows[] = {
    {"passed", [](protection_counts *p, const std::string &v) { p->passed = number(v); }},
    {"received", [](protection_counts *p, const std::string &v) { p->received = number(v); }},
    {"delivered", [](protection_counts *p, const std::string &v) { p->delivered = number(v); }},
    {"returned", [](protection_counts *p, const std::string &v) { p->returned = number(v); }},
};

static const state_row<protected_group> protected_group_rows[] = {
    {"covered", [](protected_group *g, const std::string &v) { g->covered = v == "true"; }},
    {"reason", [](protected_group *g, const std::string &v) { g->reason = clean_text(v, 63); }},
    {"slots", [](protected_group *g, const std::string &v) { g->slots = number_of<uint32_t>(v, 0); }},
};

template <typename Subject, size_t COUNT>
static void take_row(const state_row<Subject> (&rows)[COUNT], const std::string &node,
                     const std::string &value, Subject *subject) {
    for (const auto &row : rows)
        if (node == row.node)
            row.take(subject, value);
}

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

static void take_sorted(const std::string &node, const std::string &value, sorted_counts *inout) {
    for (const sorted_way &way : sorted_ways()) {
        if (node == way.word)
            (*inout)[way.word].packets = number(value);
        else if (node == std::string(way.word) + "_bytes")
            (*inout)[way.word].bytes = number(value);
    }
}

static void take_counted(const std::string &what, const std::string &value,
                         std::map<std::string, uint64_t> *inout) {
    if (inout->size() < ENTRIES_MAX)
        (*inout)[clean_text(what, 31)] = number(value);
}

// --- Gathering

// The entry that a number names; they come in the order of their numbers. Null: no number, or too many.
template <typename Entry>
static Entry *entry_of(std::vector<Entry> *inout, int Entry::*id, const std::string &part) {
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

static void take_plane(const std::vector<std::string> &parts, const std::string &value, traffic_state *out) {
    if (parts.size() == 2 && parts[0] == "refused")
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
        out->own = number(value);
    else if (parts[0] == "clamped")
        out->clamped = number(value);
}

static void take_tunnel(const std::vector<std::string> &parts, const std::string &value, traffic_state *out) {
    traffic_tunnel *tunnel = entry_of(&out->tunnels, &traffic_tunnel::id, parts[0]);
    if (tunnel && parts.size() == 3 && parts[1] == "refused")
        take_counted(parts[2], value, &tunnel->refused);
    if (!tunnel || parts.size() != 2)
        return;
    take_row(tunnel_rows, parts[1], value, tunnel);
    take_sorted(parts[1], value, &tunnel->sorted);
}

static void take_intercept(const std::vector<std::string> &parts, const std::string &value,
                           traffic_state *out) {
    traffic_intercept *intercept = entry_of(&out->intercepts, &traffic_intercept::group, parts[0]);
    if (!intercept || parts.size() != 2)
        return;
    take_row(intercept_rows, parts[1], value, intercept);
    take_sorted(parts[1], value, &intercept->sorted);
}

static void take_protection(const std::vector<std::string> &parts, const std::string &value,
                            traffic_state *out) {
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

static void take_accepted(const std::vector<std::string> &parts, const std::string &value,
                          traffic_state *out) {
    if (out->accepted.size() >= ENTRIES_MAX)
        return;
    std::string *router = &out->accepted[clean_text(parts[0], 15)];
    if (parts.size() == 2 && parts[1] == "router" && value != "0.0.0.0")
        *router = clean_text(value, 15);
}

static void take_left(const std::vector<std::string> &parts, const std::string &value, traffic_state *out) {
    if (const int group = number_of(parts[0], -1); group >= 0 && group <= 255 && parts.size() == 1)
        out->left[group] = clean_text(value, 63);
}

void take_drain(const std::vector<std::string> &parts, const std::string &value,
                std::vector<traffic_drain> *inout) {
    traffic_drain *drain = entry_of(inout, &traffic_drain::group, parts[0]);
    if (drain && parts.size() == 1)
        drain->state = clean_text(value, 15);
    else if (drain && parts[1] == "flows")
        drain->flows = number_of<int64_t>(value, -1);
    else if (drain && parts[1] == "until")
        drain->until = number_of<int64_t>(value, 0);
}

static void take_drained(const std::vector<std::string> &parts, const std::string &value,
                         traffic_state *out) {
    take_drain(parts, value, &out->drains);
}

bool gather_traffic(const ctl_ask &ask, traffic_state *out) {
    static const struct {
        const char *root;
        bool of_tunneld;
        void (*take)(const std::vector<std::string> &parts, const std::string &value, traffic_state *out);
    } walks[] = {
        {NODE_PLANE_STATE, true, take_plane},
        {NODE_TUNNEL_STATE, true, take_tunnel},
        {NODE_INTERCEPT_STATE, true, take_intercept},
        {NODE_ACCEPT_CONFIG, false, take_accepted},
        {NODE_PROTECTION_STATE, true, take_protection},
        {NODE_LEFT_GROUPS, false, take_left},
        {NODE_DRAINS, false, take_drained},
    };
    *out = {};
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
        // A tunneld that runs has a data plane.
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
    for (shown /= 1000; shown >= 999.5; shown /= 1000)
        unit++;
    char text[16];
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
        out += " by its time"; // nobody has counted
    if (drain.state == "draining")
        out += ", at most " + std::to_string(std::max<int64_t>(drain.until - now, 0)) + " s more";
    return out;
}

// --- Reasons

namespace {
struct reason_list {
    const char *word;
    std::vector<traffic_reason> *out;
    void add(const std::string &text, int group = -1) const {
        out->push_back({word, group, text.substr(0, REASON_MAX)});
    }
};
} // namespace

static void own_traffic(const traffic_state &state, const reason_list &list) {
    if (state.own > 0)
        list.add("the router redirects this appliance's own traffic");
}

static void refused_sources(const traffic_state &state, const reason_list &list) {
    for (const auto &[address, packets] : state.refused_sources)
        if (packets > 0 && !state.accepted.contains(address))
            list.add("refused source " + address + ": mgmtctl tunnel accept " + address);
}

static void fragments(const traffic_state &state, const reason_list &list) {
    uint64_t packets = 0;
    for (const traffic_tunnel &tunnel : state.tunnels)
        packets += tunnel.fragments;
    if (packets > 0 && state.clamped == 0)
        list.add("packets come in fragments, and the MSS of no flow has been clamped");
}

static void lacking_kernel(const traffic_state &state, const reason_list &list) {
    if (!state.lack.empty())
        list.add("all packets are returned: " + state.lack);
}

static void failing_kernel(const traffic_state &state, const reason_list &list) {
    if (!state.failure.empty())
        list.add("the kernel is not as wanted: " + state.failure);
}

static void left_groups(const traffic_state &state, const reason_list &list) {
    for (const auto &[group, reason] : state.left)
        list.add("group " + std::to_string(group) + " has left its routers" + (reason.empty() ? "" : ": ") +
                     reason,
                 group);
}

static void drains(const traffic_state &state, const reason_list &list) {
    for (const traffic_drain &each : state.drains)
        list.add("group " + std::to_string(each.group) +
                     (each.state == "draining" ? ": is drained; new flows don't go to the proxy"
                                               : ": drained, and out of its routers until \"drain cancel\""),
                 each.group);
}

static void overloads(const traffic_state &state, const reason_list &list) {
    for (const traffic_intercept &each : state.intercepts)
        if (each.overloaded)
            list.add("group " + std::to_string(each.group) +
                         ": the proxy has too many flows; new ones are returned",
                     each.group);
}

static void slow_starts(const traffic_state &state, const reason_list &list) {
    for (const traffic_intercept &each : state.intercepts)
        if (each.weight_percent < 100)
            list.add("group " + std::to_string(each.group) +
                         ": slow start; a part of the weight is announced",
                     each.group);
}

static void proxies_down(const traffic_state &state, const reason_list &list) {
    for (const traffic_intercept &each : state.intercepts)
        if (each.proxy == "down" && !state.left.contains(each.group))
            list.add("group " + std::to_string(each.group) + ": the proxy is down" +
                         (each.proxy_reason.empty() ? "" : ": ") + each.proxy_reason,
                     each.group);
}

static void standing_by(const traffic_state &state, const reason_list &list) {
    for (const traffic_intercept &each : state.intercepts)
        if (!each.active)
            list.add("group " + std::to_string(each.group) + ": not ACTIVE; new flows are returned",
                     each.group);
}

static void unprotected(const traffic_state &state, const reason_list &list) {
    for (const protected_group &each : state.protection.groups)
        if (!each.covered && state.protection.time != 0)
            list.add("group " + std::to_string(each.group) + " is unprotected: " + each.reason, each.group);
}

std::vector<traffic_reason> traffic_reasons(const traffic_state &state) {
    static const struct {
        const char *word;
        void (*look)(const traffic_state &state, const reason_list &list);
    } rows[] = {
        {"lack", lacking_kernel},
        {"failure", failing_kernel},
        {"left", left_groups},
        {"proxy_down", proxies_down},
        {"drain", drains},
        {"overload", overloads},
        {"slow_start", slow_starts},
        {"standing_by", standing_by},
        {"unprotected", unprotected},
        {"own_traffic", own_traffic},
        {"refused_source", refused_sources},
        {"fragments", fragments},
    };
    std::vector<traffic_reason> out;
    for (const auto &row : rows)
        row.look(state, {row.word, &out});
    for (traffic_reason &each : out) // the words of all reasons are written so
        std::replace(each.word.begin(), each.word.end(), '_', '-');
    return out;
}
