#include "peers/mgmtctl/traffic_json.h"

namespace {
ctl_json packets_json(const std::map<std::string, uint64_t> &packets) {
    ctl_json out = ctl_json::object();
    for (const auto &[name, count] : packets)
        out[name] = count;
    return out;
}

ctl_json count_json(const traffic_count &count) {
    return {{"packets", count.packets}, {"bytes", count.bytes}};
}

ctl_json sorted_json(const sorted_counts &counts) {
    ctl_json out = ctl_json::object();
    for (const sorted_way &way : sorted_ways())
        if (const auto found = counts.find(way.word); found != counts.end())
            out[way.word] = count_json(found->second);
    return out;
}

ctl_json tunnel_json(const traffic_tunnel &tunnel) {
    return {{"id", tunnel.id},
            {"local", tunnel.local},
            {"remote", tunnel.remote},
            {"interface", text_or_null(tunnel.interface)},
            {"index", tunnel.index},
            {"in", count_json(tunnel.in)},
            {"out", count_json(tunnel.out)},
            {"fragments", tunnel.fragments},
            {"refused", packets_json(tunnel.refused)},
            {"sorted", sorted_json(tunnel.sorted)}};
}
} // namespace

ctl_json intercept_state_json(const traffic_intercept *intercept) {
    ctl_json out = {{"proxy", nullptr},      {"proxy_reason", nullptr},   {"proxy_ms", nullptr},
                    {"active", nullptr},     {"left", nullptr},           {"flows", nullptr},
                    {"overloaded", nullptr}, {"weight_percent", nullptr}, {"sorted", nullptr}};
    if (!intercept)
        return out;
    out["proxy"] = text_or_null(intercept->proxy);
    out["proxy_reason"] = text_or_null(intercept->proxy_reason);
    out["proxy_ms"] = intercept->proxy_ms;
    out["active"] = intercept->active;
    out["left"] = intercept->left;
    out["flows"] = intercept->flows < 0 ? ctl_json(nullptr) : ctl_json(intercept->flows);
    out["overloaded"] = intercept->overloaded;
    out["weight_percent"] = intercept->weight_percent;
    out["sorted"] = sorted_json(intercept->sorted);
    return out;
}

ctl_json drains_json(const std::vector<traffic_drain> &drains) {
    ctl_json out = ctl_json::array();
    for (const traffic_drain &drain : drains)
        out.push_back({{"group", drain.group},
                       {"state", drain.state},
                       {"flows", drain.flows < 0 ? ctl_json(nullptr) : ctl_json(drain.flows)},
                       {"until", drain.until}});
    return out;
}

namespace {
ctl_json protection_counts_json(const protection_counts &counts) {
    return {{"passed", counts.passed},
            {"received", counts.received},
            {"delivered", counts.delivered},
            {"returned", counts.returned}};
}
} // namespace

ctl_json protection_json(const protection_state &state) {
    ctl_json out = protection_counts_json(state.sum);
    out["time"] = state.time;
    out["groups"] = ctl_json::array();
    for (const protected_group &each : state.groups)
        out["groups"].push_back({{"group", each.group},
                                 {"covered", each.covered},
                                 {"reason", text_or_null(each.reason)},
                                 {"slots", each.slots}});
    out["members"] = ctl_json::array();
    for (const auto &[address, counts] : state.members) {
        out["members"].push_back(protection_counts_json(counts));
        out["members"].items.back()["address"] = address;
    }
    return out;
}

ctl_json traffic_json(const traffic_state &state) {
    const bool running = state.tunneld == tunneld_condition::running;
    ctl_json out = {{"tunneld", tunneld_word(state.tunneld)},
                    {"plane", text_or_null(state.plane)},
                    {"plane_reason", text_or_null(state.plane_reason)},
                    {"lack", text_or_null(state.lack)},
                    {"failure", text_or_null(state.failure)},
                    {"clamped", running ? ctl_json(state.clamped) : ctl_json(nullptr)},
                    {"refused", packets_json(state.refused)},
                    {"refused_sources", packets_json(state.refused_sources)},
                    {"tunnels", ctl_json::array()},
                    {"intercepts", ctl_json::array()},
                    {"protection", running ? protection_json(state.protection) : ctl_json(nullptr)},
                    {"left", ctl_json::array()},
                    {"drains", drains_json(state.drains)},
                    {"reasons", ctl_json::array()}};
    for (const traffic_tunnel &tunnel : state.tunnels)
        out["tunnels"].push_back(tunnel_json(tunnel));
    for (const traffic_intercept &intercept : state.intercepts) {
        ctl_json one = {{"group", intercept.group}};
        one.update(intercept_state_json(&intercept));
        out["intercepts"].push_back(one);
    }
    for (const auto &[group, reason] : state.left)
        out["left"].push_back({{"group", group}, {"reason", text_or_null(reason)}});
    for (const traffic_reason &reason : traffic_reasons(state))
        out["reasons"].push_back({{"reason", reason.word},
                                  {"group", reason.group < 0 ? ctl_json(nullptr) : ctl_json(reason.group)},
                                  {"text", reason.text}});
    return out;
}
