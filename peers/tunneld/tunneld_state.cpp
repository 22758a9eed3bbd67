// Makes the state nodes of tunneld.
#include <algorithm>

#include "mgmt/bnode_types.h"
#include "mgmt/node_paths.h"
#include "peers/tunneld/flow_count.h"
#include "peers/tunneld/link_names.h"
#include "peers/tunneld/protection.h"
#include "peers/tunneld/tunneld.h"
#include "runtime/ttime.h"

namespace {

struct node_writer {
    std::vector<state_node> *out;
    std::string above;
    void add(const std::string &name, uint32_t type, const std::string &text) {
        out->push_back({above + "/" + name, type, text});
    }
    void add_count(const std::string &name, uint64_t value) {
        add(name, bn_type_uint64, std::to_string(value));
    }
};

void add_sorted(node_writer *writer, const packet_count *ways) {
    for (size_t way = 0; way < SORTED_WAYS; way++) {
        writer->add_count(sorted_words[way], ways[way].packets);
        writer->add_count(std::string(sorted_words[way]) + "_bytes", ways[way].bytes);
    }
}

void add_refused(node_writer *writer, const uint64_t *refused) {
    for (size_t reason = 0; reason < REFUSALS; reason++)
        writer->add_count(std::string("refused/") + refusal_words[reason], refused[reason]);
}

void add_tunnels(const tunneld &daemon, const plane_counters &plane, const sorting_counters &sorting,
                 std::vector<state_node> *out) {
    for (const wanted_link &link : daemon.links) {
        const auto index = daemon.indices.find(link.name);
        const auto ordered = daemon.desk.tunnels.find(link.wish.tunnel_id);
        // Links of deleted tunnels may linger. They are no longer shown.
        if (link.wish.kind != link_kind::tunnel || index == daemon.indices.end() ||
            ordered == daemon.desk.tunnels.end() || ordered->second.local != link.wish.local ||
            ordered->second.remote != link.wish.remote)
            continue;
        const std::string id = std::to_string(link.wish.tunnel_id);
        node_writer writer = {out, std::string(NODE_TUNNEL_STATE) + "/" + id};
        out->push_back({writer.above, bn_type_uint16, id});
        writer.add("local", bn_type_ipv4addr, address_text(link.wish.local));
        writer.add("remote", bn_type_ipv4addr, address_text(link.wish.remote));
        writer.add("interface", bn_type_str, link.name);
        writer.add("index", bn_type_uint32, std::to_string(index->second));
        // The packets of an accepted source count with its tunnel.
        link_counters sum;
        packet_count ways[SORTED_WAYS];
        uint64_t fragments = 0;
        for (const wanted_link &each : daemon.links) {
            // The links of other kinds have the id 0, which a tunnel can have as well.
            if (each.wish.tunnel_id != link.wish.tunnel_id || each.wish.kind > link_kind::accepted)
                continue;
            if (const auto found = plane.links.find(each.name); found != plane.links.end()) {
                sum.packets_in += found->second.packets_in;
                sum.bytes_in += found->second.bytes_in;
                sum.packets_out += found->second.packets_out;
                sum.bytes_out += found->second.bytes_out;
                for (size_t i = 0; i < REFUSALS; i++)
                    sum.refused[i] += found->second.refused[i];
            }
            if (const auto found = sorting.interfaces.find(each.name); found != sorting.interfaces.end())
                for (size_t i = 0; i < SORTED_WAYS; i++) {
                    ways[i].packets += found->second[i].packets;
                    ways[i].bytes += found->second[i].bytes;
                }
            if (const auto found = sorting.fragments.find({each.wish.local, each.wish.remote});
                found != sorting.fragments.end())
                fragments += found->second;
        }
        writer.add_count("packets_in", sum.packets_in);
        writer.add_count("bytes_in", sum.bytes_in);
        writer.add_count("packets_out", sum.packets_out);
        writer.add_count("bytes_out", sum.bytes_out);
        writer.add_count("fragments", fragments);
        add_refused(&writer, sum.refused);
        add_sorted(&writer, ways);
    }
}

void add_intercepts(const tunneld &daemon, const sorting_counters &sorting, std::vector<state_node> *out) {
    static const char *const words[] = {"unknown", "up", "down"};
    const auto &states = health_states(daemon.health);
    const int64_t now = lt_monotonic_ms();
    std::vector<flow_ends> flows;
    std::string error;
    // Counted anew: the counts of every second are only taken for groups with a limit or a drain.
    const bool counted = read_transparent_flows(daemon.own_addresses, &flows, &error);
    const auto counts = count_flows(flows, daemon.configured.intercepts);
    for (const auto &[group, rules] : daemon.configured.intercepts) {
        const std::string number = std::to_string(group);
        node_writer writer = {out, std::string(NODE_INTERCEPT_STATE) + "/" + number};
        out->push_back({writer.above, bn_type_uint8, number});
        const auto state = states.find(group);
        const bool known = state != states.end();
        writer.add("proxy", bn_type_str, words[known ? state->second.state : proxy_health::unknown]);
        writer.add("proxy_reason", bn_type_str, known ? state->second.reason : "");
        writer.add_count("proxy_ms", known ? static_cast<uint64_t>(now - state->second.since_ms) : 0);
        writer.add("active", bn_type_bool, is_active_group(daemon, group) ? "true" : "false");
        const auto outage = daemon.outages.find(group);
        writer.add("left", bn_type_bool,
                   outage != daemon.outages.end() && outage->second.left ? "true" : "false");
        if (const auto count = counts.find(group); counted && count != counts.end())
            writer.add_count("flows", count->second);
        const auto followed = daemon.followed.find(group);
        const course_decision decided =
            followed == daemon.followed.end() ? course_decision{} : followed->second.decided;
        writer.add("overloaded", bn_type_bool, decided.overloaded ? "true" : "false");
        writer.add("weight_percent", bn_type_uint32, std::to_string(decided.weight_percent));
        static const packet_count none[SORTED_WAYS] = {};
        const auto ways = sorting.groups.find(group);
        add_sorted(&writer, ways == sorting.groups.end() ? none : ways->second);
    }
}

// The packets exchanged with another appliance.
struct member_counts {
    std::string interface;
    uint64_t passed = 0, received = 0, delivered = 0, returned = 0;
};

std::map<uint32_t, member_counts> count_members(const tunneld &daemon, const plane_counters &plane,
                                                const sorting_counters &sorting) {
    std::map<uint32_t, member_counts> members;
    for (const wanted_link &link : daemon.links) {
        if (link.wish.kind != link_kind::member)
            continue;
        // What the link has sent was passed on to the member. What has arrived by it was passed on by the
        // member.
        member_counts &counts = members[link.wish.remote];
        counts.interface = link.name;
        if (const auto found = plane.links.find(link.name); found != plane.links.end())
            counts.passed += found->second.packets_out;
        if (const auto found = sorting.interfaces.find(link.name); found != sorting.interfaces.end()) {
            counts.received += found->second[SORTED_IN].packets;
            counts.delivered += found->second[SORTED_TO_PROXY].packets;
            counts.returned += found->second[SORTED_RETURNED].packets;
        }
    }
    return members;
}

void add_protection(const tunneld &daemon, const plane_counters &plane, const sorting_counters &sorting,
                    std::vector<state_node> *out) {
    const auto members = count_members(daemon, plane, sorting);
    member_counts sum;
    for (const auto &[address, counts] : members) {
        sum.passed += counts.passed;
        sum.received += counts.received;
        sum.delivered += counts.delivered;
        sum.returned += counts.returned;
    }
    const auto add_counts = [](node_writer *writer, const member_counts &counts) {
        writer->add_count("passed", counts.passed);
        writer->add_count("received", counts.received);
        writer->add_count("delivered", counts.delivered);
        writer->add_count("returned", counts.returned);
    };
    node_writer writer = {out, NODE_PROTECTION_STATE};
    writer.add("time", bn_type_uint32, std::to_string(daemon.configured.protection_s));
    add_counts(&writer, sum);
    for (const auto &[number, cover] : protection_cover(daemon, plane)) {
        writer.above = std::string(NODE_PROTECTION_STATE) + "/group/" + std::to_string(number);
        out->push_back({writer.above, bn_type_uint8, std::to_string(number)});
        writer.add("covered", bn_type_bool, cover.reason.empty() ? "true" : "false");
        writer.add("reason", bn_type_str, cover.reason);
        writer.add("slots", bn_type_uint32, std::to_string(cover.slots));
    }
    for (const auto &[address, counts] : members) {
        writer.above = std::string(NODE_PROTECTION_STATE) + "/member/" + address_text(address);
        out->push_back({writer.above, bn_type_ipv4addr, address_text(address)});
        writer.add("interface", bn_type_str, counts.interface);
        add_counts(&writer, counts);
    }
}

// How long ago each began, and how long ago it occurred last.
void add_occurrences(const occurrences &occurred, node_writer *writer) {
    const int64_t now = lt_monotonic_ms();
    for (const auto &[what, when] : occurred) {
        writer->add_count("first_ms/" + what, static_cast<uint64_t>(now - when.first_ms));
        if (when.last_ms >= 0)
            writer->add_count("last_ms/" + what, static_cast<uint64_t>(now - when.last_ms));
    }
}

void note_counters(tunneld *daemon, const plane_counters &plane, const sorting_counters &sorting) {
    const int64_t now = lt_monotonic_ms();
    uint64_t own = 0, fragments = 0;
    for (const auto &[name, ways] : sorting.interfaces)
        own += ways[SORTED_OWN].packets;
    for (const auto &[ends, packets] : sorting.fragments)
        fragments += packets;
    note_counter(&daemon->occurred, "own", own, now);
    note_counter(&daemon->occurred, "fragments", fragments, now);
    for (const auto *sources : {&plane.refused_sources, &sorting.refused_sources})
        for (const auto &[address, packets] : *sources)
            note_counter(&daemon->occurred, "refused_source/" + address_text(address), packets, now);
    note_state(&daemon->occurred, "lack", !daemon->lack.empty(), now);
    note_state(&daemon->occurred, "failure", !daemon->failure.empty(), now);
    for (const auto &[group, followed] : daemon->followed)
        note_state(&daemon->occurred, "overload/" + std::to_string(group), followed.decided.overloaded, now);
    for (const auto &[group, cover] : protection_cover(*daemon, plane))
        note_state(&daemon->occurred, "unprotected/" + std::to_string(group), !cover.reason.empty(), now);
}

void read_counters(const tunneld &daemon, plane_counters *plane, sorting_counters *sorting) {
    std::string error;
    daemon.plane->read_counters(plane);
    if (daemon.plane != &table_plane)
        (void)read_sorting_counters(sorting, &error);
}

} // namespace

void note_occurrences(tunneld *daemon) {
    plane_counters plane;
    sorting_counters sorting;
    read_counters(*daemon, &plane, &sorting);
    note_counters(daemon, plane, sorting);
}

std::vector<state_node> tunneld_state(tunneld *daemon_now) {
    std::vector<state_node> out;
    plane_counters plane;
    sorting_counters sorting;
    read_counters(*daemon_now, &plane, &sorting);
    note_counters(daemon_now, plane, sorting);
    const tunneld &daemon = *daemon_now;

    node_writer writer = {&out, NODE_PLANE_STATE};
    writer.add("name", bn_type_str, daemon.plane->name);
    writer.add("reason", bn_type_str, daemon.plane_reason);
    writer.add("lack", bn_type_str, daemon.lack);
    writer.add("failure", bn_type_str, daemon.failure);
    uint64_t own = 0;
    for (const auto &[name, ways] : sorting.interfaces)
        own += ways[SORTED_OWN].packets;
    writer.add_count("own", own);
    writer.add_count("clamped", sorting.clamped);
    add_refused(&writer, plane.refused);
    std::map<uint32_t, uint64_t> sources = plane.refused_sources;
    // Only one of the two has any, depending on the plane.
    sources.insert(sorting.refused_sources.begin(), sorting.refused_sources.end());
    for (const auto &[address, packets] : sources)
        writer.add_count("refused_source/" + address_text(address), packets);
    add_occurrences(daemon.occurred, &writer);

    add_tunnels(daemon, plane, sorting, &out);
    add_intercepts(daemon, sorting, &out);
    add_protection(daemon, plane, sorting, &out);
    return out;
}
