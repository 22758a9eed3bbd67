#include "peers/tunneld/sorting_text.h"

#include "peers/tunneld/link_names.h"

#include <algorithm>
#include <cctype>
#include <cstdio>

#include "peers/tunneld/slot_owners.h"
#include "peers/tunneld/sorting_rules.h"

const char *const sorted_words[SORTED_WAYS] = {"in",        "to_proxy", "bypassed", "returned", "down",
                                               "forwarded", "dropped",  "own",      "passed",   "overload"};

namespace {

constexpr const char *JUST_SYN = "tcp flags & (fin | syn | rst | ack) == syn";
constexpr const char *NOT_JUST_SYN = "tcp flags & (fin | syn | rst | ack) != syn";

template <typename... T>
std::string format_text(const char *text, T... values) {
    char line[512];
    const int length = snprintf(line, sizeof(line), text, values...);
    return std::string(line, std::min<size_t>(static_cast<size_t>(length), sizeof(line) - 1));
}

std::string quote_name(const std::string &text) {
    return '"' + text + '"';
}

std::string interface_counter(const std::string &name, const char *way) {
    return "interface/" + name + "/" + way;
}

std::string group_counter(uint8_t group, sorted_as way) {
    return format_text("counter name \"group/%u/%s\"", group, sorted_words[way]);
}

std::string mark_as(uint32_t mark) {
    return format_text("meta mark set 0x%08x", mark);
}

std::string group_chain(uint8_t group) {
    return format_text("group/%u", group);
}

bool is_safe_name(const std::string &name) {
    return !name.empty() && name.size() < 16 && std::all_of(name.begin(), name.end(), [](unsigned char c) {
        return isalnum(c) || c == '.' || c == '-' || c == '_';
    });
}

// An interval set refuses a prefix that lies within another; such prefixes are left out.
std::set<std::string> merge_prefixes(std::vector<ip_prefix> prefixes) {
    const auto mask = [](uint8_t length) { return length == 0 ? 0 : ~0u << (32 - length); };
    for (ip_prefix &prefix : prefixes)
        prefix.address &= mask(prefix.length);
    // In this order a prefix comes directly before those that lie within it.
    std::sort(prefixes.begin(), prefixes.end(), [](const ip_prefix &a, const ip_prefix &b) {
        return a.address != b.address ? a.address < b.address : a.length < b.length;
    });
    std::set<std::string> merged;
    const ip_prefix *last = nullptr;
    for (const ip_prefix &prefix : prefixes) {
        if (last && (prefix.address & mask(last->length)) == last->address)
            continue;
        last = &prefix;
        merged.insert(address_text(prefix.address) + format_text("/%u", prefix.length));
    }
    return merged;
}

std::string join_with_commas(const std::set<std::string> &words) {
    std::string text;
    for (const std::string &word : words)
        text += (text.empty() ? "" : ", ") + word;
    return text;
}

bool wants_something(const sorted_group &group) {
    return group.rules.to != 0;
}

// Ranges of ports and the groups they belong to: the last port and the group, by the first port.
using taken_ports = std::map<uint32_t, std::pair<uint32_t, uint8_t>>;

// Gives the group those ports of the range that don't belong to another group yet.
void take_ports(taken_ports *taken, uint32_t first, uint32_t last, uint8_t group) {
    while (first <= last) {
        // Ranges that are taken do not overlap: only the one that begins last before `first` can contain it.
        const auto next = taken->upper_bound(first);
        if (next != taken->begin() && std::prev(next)->second.first >= first) {
            first = std::prev(next)->second.first + 1;
            continue;
        }
        // The gap ends where the next taken range begins.
        const uint32_t end = next == taken->end() ? last : std::min(last, next->first - 1);
        (*taken)[first] = {end, group};
        first = end + 1;
    }
}

std::string port_text(uint32_t first, uint32_t last) {
    return first == last ? format_text("%u", first) : format_text("%u-%u", first, last);
}

// What all functions that fill the content need.
struct content_maker {
    const wanted_sorting &wanted;
    nft_content &content;
    std::set<std::string> interfaces; // all whose packets are sorted

    std::vector<std::string> &rules(const std::string &chain) { return content.chains[chain].rules; }
    void add_counter(const std::string &name) { content.counters.insert(name); }
    nft_set &set(const std::string &name, const std::string &declaration) {
        content.sets[name].declaration = declaration;
        return content.sets[name];
    }
};

// A chain for each of sorted_words, which counts the packet by its interface and gives it its mark or
// verdict.
void add_way_chains(content_maker &maker) {
    for (const char *way : sorted_words) {
        nft_set &map = maker.set(format_text("count_%s", way), "map { type ifname : counter; }");
        for (const std::string &name : maker.interfaces) {
            maker.add_counter(interface_counter(name, way));
            map.elements[quote_name(name)] = quote_name(interface_counter(name, way));
        }
    }
    nft_set &marks = maker.set("give_back", "map { type ifname : mark; }");
    for (const auto &[name, mark] : maker.wanted.l2_into_gre)
        marks.elements[quote_name(name)] = format_text("0x%08x", mark);
    const auto count = [](const char *way) { return format_text("counter name iifname map @count_%s", way); };
    // A packet without a mark takes the way of its interface: out of a link it is returned through the link,
    // from an L2 interface it is forwarded. A packet that must be delivered to this host has a mark already
    // and keeps it.
    const std::string unmarked = format_text("meta mark != 0x%08x ", MARK_LOCAL);
    for (const char *way : {"returned", "bypassed", "own", "down", "overload"})
        maker.rules(way) = {count(way), unmarked + "meta mark set iifname map @give_back"};
    // The packets have a mark already, or came by a passing link, whose own table leads to the member.
    maker.rules("passed") = {count("passed")};
    maker.rules("to_proxy") = {mark_as(MARK_LOCAL), count("to_proxy")};
    maker.rules("forwarded") = {unmarked + mark_as(MARK_FORWARD), count("forwarded")};
    maker.rules("dropped") = {count("dropped"), "drop"};
    maker.rules("down_dropped") = {count("down"), "drop"};
}

// The fields that a mask can select, which become the key of a map. With an empty mask, there is only one
// slot.
struct mask_field {
    const char *name, *type;
    bool is_port;
    uint32_t (*of)(const slot_mask &mask);
};
constexpr mask_field mask_fields[] = {
    {"ip saddr", "ipv4_addr", false, [](const slot_mask &mask) { return mask.src_ip; }},
    {"ip daddr", "ipv4_addr", false, [](const slot_mask &mask) { return mask.dst_ip; }},
    {"tcp sport", "inet_service", true, [](const slot_mask &mask) { return uint32_t{mask.src_port}; }},
    {"tcp dport", "inet_service", true, [](const slot_mask &mask) { return uint32_t{mask.dst_port}; }},
};

std::string field_text(const mask_field &field, const slot_mask &of) {
    return field.is_port ? format_text("%u", field.of(of)) : address_text(field.of(of));
}

// The texts that `make` returns for the fields in the mask, as a concatenation of nftables.
template <typename F>
std::string join_fields(const slot_mask &mask, F make) {
    std::string text;
    for (const mask_field &field : mask_fields)
        if (field.of(mask) != 0)
            text += (text.empty() ? "" : " . ") + std::string(make(field));
    return text;
}

// The rule that passes on packets of other appliances' slots; the caller puts a match before it. "" when no
// packets are passed on.
std::string make_pass_rule(content_maker &maker, const sorted_group &group) {
    if (group.pass_marks.empty())
        return "";
    const std::string end = " " + group_counter(group.group, SORTED_PASSED) + " goto passed";
    if (slot_mask_bits(group.mask) == 0)
        return group.pass_marks[0] ? mark_as(group.pass_marks[0]) + end : "";
    const std::string name = format_text("pass/%u", group.group);
    nft_set &map = maker.set(name, "map { type " + join_fields(group.mask, [](const mask_field &field) {
                                       return field.type;
                                   }) + " : mark; }");
    // For a slot without an element, the look-up fails and the next rule is tried.
    for (uint32_t slot = 0; slot < group.pass_marks.size(); slot++)
        if (group.pass_marks[slot]) {
            const slot_mask value = slot_value(group.mask, slot);
            map.elements[join_fields(group.mask, [&](const mask_field &field) {
                return field_text(field, value);
            })] = format_text("0x%08x", group.pass_marks[slot]);
        }
    return "meta mark set " +
           join_fields(group.mask,
                       [&](const mask_field &field) {
                           return "(" + std::string(field.name) + " & " + field_text(field, group.mask) + ")";
                       }) +
           " map @" + name + end;
}

void add_group_counters(content_maker &maker, const sorted_group &group) {
    for (const sorted_as way : {SORTED_TO_PROXY, SORTED_BYPASSED, SORTED_RETURNED, SORTED_DOWN,
                                SORTED_FORWARDED, SORTED_DROPPED, SORTED_OVERLOAD, SORTED_PASSED})
        if (wants_something(group) || (way == SORTED_PASSED && !group.pass_marks.empty()))
            maker.add_counter(format_text("group/%u/%s", group.group, sorted_words[way]));
}

void add_group(content_maker &maker, const sorted_group &group) {
    std::vector<std::string> &rules = maker.rules(group_chain(group.group));
    const intercept &wish = group.rules;
    const auto ends_as = [&](sorted_as way, const char *chain) {
        return group_counter(group.group, way) + " goto " + chain;
    };
    if (!wish.bypass.empty())
        for (const char *end : {"saddr", "daddr"})
            rules.push_back(format_text("ip %s { ", end) + join_with_commas(merge_prefixes(wish.bypass)) +
                            " } " + ends_as(SORTED_BYPASSED, "bypassed"));
    // A packet that begins no flow and has no socket here belongs to another appliance's proxy, or to a flow
    // that is older than its redirection and stays with its server.
    const std::string pass = wish.protocol == 6 ? make_pass_rule(maker, group) : "";
    if (!pass.empty())
        rules.push_back(NOT_JUST_SYN + (" " + pass));
    if (wish.protocol == 6)
        rules.push_back(NOT_JUST_SYN + (" " + ends_as(SORTED_RETURNED, "returned")));
    const intercept_condition &now = group.condition;
    if (now.draining || !now.active || !now.proxy_up) {
        // `down drop` concerns the proxy: packets of an inactive group are returned all the same.
        const bool drop = (now.draining || now.active) && wish.drop_when_down;
        rules.push_back(ends_as(SORTED_DOWN, drop ? "down_dropped" : "down"));
        return;
    }
    if (now.overloaded) {
        rules.push_back(ends_as(SORTED_OVERLOAD, "overload"));
        return;
    }
    // The proxy may listen on any address, on one of the interface, or on 127.0.0.1. If there is no such
    // socket, `tproxy` ends the rule, and the next rule is tried.
    for (const char *address : {"", "127.0.0.1"})
        rules.push_back(format_text("meta l4proto %u tproxy to %s:%u ", wish.protocol, address, wish.to) +
                        ends_as(SORTED_TO_PROXY, "to_proxy"));
    rules.push_back(ends_as(SORTED_RETURNED, "returned"));
}

// The rule for packets of an interface that no group wants. They don't show for which group they were
// redirected. They are therefore forwarded or dropped only if all groups of the interface agree.
std::string make_rest_rule(const std::vector<const sorted_group *> &groups) {
    static constexpr struct {
        leftover rest;
        sorted_as way;
    } ways[] = {{leftover::give_back, SORTED_RETURNED},
                {leftover::forward, SORTED_FORWARDED},
                {leftover::drop, SORTED_DROPPED}};
    leftover rest = groups[0]->rules.rest;
    for (const sorted_group *group : groups)
        if (!wants_something(*group) || group->rules.rest != rest)
            rest = leftover::give_back;
    sorted_as way = SORTED_RETURNED;
    for (const auto &row : ways)
        if (row.rest == rest)
            way = row.way;
    // With several groups it is not known whose packet it is, and none of them counts it.
    std::string rule = std::string("goto ") + sorted_words[way];
    if (groups.size() == 1 && wants_something(*groups[0]))
        rule = group_counter(groups[0]->group, way) + " " + rule;
    return rule;
}

// Groups without an intercept carry the replies of servers to flows that other groups intercept.
void add_reply_rules(content_maker &maker, const std::vector<const sorted_group *> &groups,
                     std::vector<std::string> *out) {
    for (const sorted_group *group : groups) {
        const std::string pass = wants_something(*group) ? "" : make_pass_rule(maker, *group);
        if (pass.empty())
            continue;
        std::string ports;
        if (!group->pass_ports.empty()) {
            const std::string name = format_text("answers/%u", group->group);
            nft_set &set = maker.set(name, "set { type inet_service; flags interval; }");
            taken_ports taken;
            for (const port_range &range : group->pass_ports)
                take_ports(&taken, range.first, range.last, 0);
            for (const auto &[first, end] : taken)
                set.elements[port_text(first, end.first)] = "";
            ports = "tcp sport @" + name + " ";
        }
        std::string rule = NOT_JUST_SYN;
        rule.append(" ").append(ports).append(pass);
        out->push_back(std::move(rule));
    }
}

// A class is a chain for interfaces that have the same groups, named after the first of the interfaces.
void add_class(content_maker &maker, const std::string &name,
               const std::vector<const sorted_group *> &groups) {
    std::vector<std::string> &rules = maker.rules("class/" + name);
    for (const auto &[protocol, word] : {std::pair<uint8_t, const char *>{6, "tcp"}, {17, "udp"}}) {
        taken_ports taken;
        for (const sorted_group *group : groups) {
            if (!wants_something(*group) || group->rules.protocol != protocol)
                continue;
            // The groups are in ascending order: the lowest number gets a port that several of them want.
            for (const port_range &range : group->rules.ports)
                take_ports(&taken, range.first, range.last, group->group);
            if (group->rules.ports.empty())
                take_ports(&taken, 0, 65535, group->group);
        }
        if (taken.empty())
            continue;
        const std::string map_name = "ports/" + name + "/" + word;
        nft_set &map = maker.set(map_name, "map { type inet_service : verdict; flags interval; }");
        for (const auto &[first, end] : taken)
            map.elements[port_text(first, end.first)] = "goto " + group_chain(end.second);
        rules.push_back(std::string(word) + " dport vmap @" + map_name);
    }
    add_reply_rules(maker, groups, &rules);
    rules.push_back(make_rest_rule(groups));
}

void add_classes(content_maker &maker) {
    std::map<std::string, std::vector<const sorted_group *>> groups_of;
    for (const sorted_group &group : maker.wanted.groups)
        for (const std::string &name : group.interfaces)
            if (maker.interfaces.contains(name))
                groups_of[name].push_back(&group);
    nft_set &map = maker.set("classes", "map { type ifname : verdict; }");
    std::map<std::vector<const sorted_group *>, std::string> classes;
    for (const auto &[name, groups] : groups_of) {
        const auto [at, is_new] = classes.emplace(groups, name);
        if (is_new)
            add_class(maker, name, groups);
        map.elements[quote_name(name)] = "goto class/" + at->second;
    }
}

void add_arrival_chains(content_maker &maker) {
    nft_set &arrivals = maker.set("arrivals", "map { type ifname : verdict; }");
    for (const std::string &name : maker.wanted.l2_interfaces)
        arrivals.elements[quote_name(name)] = "goto arrived_l2";
    for (const std::string &name : maker.wanted.links)
        arrivals.elements[quote_name(name)] = "goto arrived";
    for (const std::string &name : maker.wanted.members)
        arrivals.elements[quote_name(name)] = "goto arrived_member";
    for (const std::string &name : maker.wanted.passing)
        arrivals.elements[quote_name(name)] = "goto arrived_passing";
    // A packet is passed on at most once: one from another appliance is not looked up in the maps of slots.
    for (const auto &[chain, nobodys] :
         {std::pair{"arrived_member", "goto returned"}, std::pair{"arrived_passing", "goto passed"}})
        maker.rules(chain) = {
            "counter name iifname map @count_in",
            "socket transparent 1 socket wildcard 0 goto to_proxy",
            std::string("socket wildcard 1 ") + nobodys,
            NOT_JUST_SYN + std::string(" socket transparent 1 goto to_proxy"),
            nobodys,
        };
    maker.content.chains["sort"] = {"type filter hook prerouting priority -150; policy accept;",
                                    {"iifname vmap @arrivals"}};
    // Here the interface's ordinary traffic arrives as well: packets to this host itself, and frames that are
    // not addressed to it.
    maker.rules("arrived_l2") = {"fib daddr type != unicast accept", "meta pkttype != host accept",
                                 "goto arrived"};
    nft_set &own = maker.set("own_addresses", "set { type ipv4_addr; }");
    for (const uint32_t address : maker.wanted.own_addresses)
        own.elements[address_text(address)] = "";
    for (const std::string &prefix : merge_prefixes(maker.wanted.bypasses))
        maker.set("bypasses", "set { type ipv4_addr; flags interval; }").elements[prefix] = "";
    maker.set("bypasses", "set { type ipv4_addr; flags interval; }");
    maker.rules("arrived") = {
        "counter name iifname map @count_in",
        "ip saddr @own_addresses goto own",
        JUST_SYN + std::string(" ip saddr . tcp sport . ip daddr . tcp dport @own_flows goto own"),
        "socket transparent 1 socket wildcard 0 goto to_proxy",
        // The others have no socket, a listening one (wildcard 1), or one in SYN_RECV or TIME_WAIT, for which
        // `wildcard` matches neither value. A SYN for the last kind begins a new flow, and TPROXY handles it.
        // If no intercept wants it, it still has to be delivered here: the kernel does not forward a packet
        // that has a socket.
        "socket wildcard 1 goto unclaimed",
        NOT_JUST_SYN + std::string(" socket transparent 1 goto to_proxy"),
        "socket transparent 1 " + mark_as(MARK_LOCAL),
        "goto unclaimed",
    };
    maker.rules("unclaimed") = {"ip saddr @bypasses goto bypassed", "ip daddr @bypasses goto bypassed",
                                "iifname vmap @classes", "goto returned"};
}

// Packets that this host sends. New flows from foreign addresses are remembered, so that they are recognised
// when a router redirects them back. SYN-ACKs sent in a server's name announce an MSS that fits into the
// tunnel.
void add_departure_chain(content_maker &maker) {
    nft_set &flows = maker.set("own_flows", "set { type ipv4_addr . inet_service . ipv4_addr . inet_service; "
                                            "flags dynamic, timeout; timeout 10s; size 65535; }");
    flows.filled_by_rules = true;
    maker.add_counter(CLAMPED_COUNTER);
    nft_chain &chain = maker.content.chains["sent"];
    chain.declaration = "type filter hook output priority -150; policy accept;";
    chain.rules = {
        JUST_SYN + std::string(" fib saddr type != local "
                               "update @own_flows { ip saddr . tcp sport . ip daddr . tcp dport }"),
    };
    if (maker.wanted.mss != 0)
        chain.rules.push_back(format_text("tcp flags & (fin | syn | rst | ack) == (syn | ack) "
                                          "fib saddr type != local tcp option maxseg size > %u "
                                          "tcp option maxseg size set %u counter name \"%s\"",
                                          maker.wanted.mss, maker.wanted.mss, CLAMPED_COUNTER));
}

// The chain that sees GRE packets with their outer headers.
void add_outer_chain(content_maker &maker) {
    nft_set &ends = maker.set(ENDS_SET, "set { type ipv4_addr . ipv4_addr; }");
    nft_set &locals = maker.set("local_ends", "set { type ipv4_addr; }");
    nft_set &fragments = maker.set("count_fragments", "map { type ipv4_addr . ipv4_addr : counter; }");
    maker.set(REFUSED_SET, "set { type ipv4_addr . ipv4_addr; flags dynamic; size 256; }").filled_by_rules =
        true;
    for (const tunnel_ends &pair : maker.wanted.ends) {
        const std::string local = address_text(pair.local), remote = address_text(pair.remote);
        const std::string counter = format_text("fragments/%s/%s", local.c_str(), remote.c_str());
        const std::string both = format_text("%s . %s", remote.c_str(), local.c_str());
        maker.add_counter(counter);
        fragments.elements[both] = quote_name(counter);
        ends.elements[both] = "";
        locals.elements[local] = "";
    }
    // Before -400, where the kernel reassembles fragments.
    nft_chain &chain = maker.content.chains["outer"];
    chain.declaration = "type filter hook prerouting priority -450; policy accept;";
    // GRE by number: nftables would look up its name in /etc/protocols, which not every system has.
    chain.rules = {"ip protocol != 47 accept",
                   "ip frag-off & 0x3fff != 0 counter name ip saddr . ip daddr map @count_fragments"};
    if (maker.wanted.drop_outer_gre) // the packet ring has its copy: drop before the kernel looks up a route
        chain.rules.push_back("ip daddr @local_ends drop");
    else // only with the plane `kernel`: `user` counts refused sources itself
        chain.rules.push_back(format_text("ip daddr @local_ends ip saddr . ip daddr != @%s "
                                          "add @%s { ip saddr . ip daddr counter }",
                                          ENDS_SET, REFUSED_SET));
}

bool check_sorting(const wanted_sorting &wanted, std::string *out_error) {
    std::vector<std::string> names = wanted.links;
    for (const auto *more : {&wanted.l2_interfaces, &wanted.members, &wanted.passing})
        names.insert(names.end(), more->begin(), more->end());
    for (const auto &[name, mark] : wanted.l2_into_gre)
        names.push_back(name);
    for (const std::string &name : names)
        if (!is_safe_name(name)) {
            *out_error = "interface name \"" + name + "\" cannot be used in rules";
            return false;
        }
    for (const sorted_group &group : wanted.groups) {
        bool good = group.rules.protocol == 6 || group.rules.protocol == 17;
        for (const port_range &range : group.rules.ports)
            good &= range.first <= range.last;
        for (const ip_prefix &prefix : group.rules.bypass)
            good &= prefix.length <= 32;
        for (const port_range &range : group.pass_ports)
            good &= range.first <= range.last;
        good &=
            group.pass_marks.empty() || (slot_mask_bits(group.mask) <= 7 &&
                                         group.pass_marks.size() == size_t{1} << slot_mask_bits(group.mask));
        if (!good) {
            *out_error = format_text("intercept of group %u: bad protocol, ports or prefix", group.group);
            return false;
        }
    }
    for (const ip_prefix &prefix : wanted.bypasses)
        if (prefix.length > 32) {
            *out_error = "bypass: bad prefix length";
            return false;
        }
    return true;
}

} // namespace

bool make_sorting_content(const wanted_sorting &wanted, nft_content *out, std::string *out_error) {
    *out = {};
    if (!check_sorting(wanted, out_error))
        return false;
    // The empty content means that there is no table.
    if (wanted.links.empty() && wanted.l2_interfaces.empty() && wanted.groups.empty() && wanted.ends.empty())
        return true;
    content_maker maker{wanted, *out, {}};
    maker.interfaces.insert(wanted.links.begin(), wanted.links.end());
    for (const auto *more : {&wanted.l2_interfaces, &wanted.members, &wanted.passing})
        maker.interfaces.insert(more->begin(), more->end());
    add_way_chains(maker);
    for (const sorted_group &group : wanted.groups) {
        add_group_counters(maker, group);
        if (wants_something(group))
            add_group(maker, group);
    }
    add_classes(maker);
    add_arrival_chains(maker);
    add_departure_chain(maker);
    add_outer_chain(maker);
    return true;
}

namespace {

struct transaction {
    std::string text;
    void add(const char *what, const std::string &name, const std::string &more = "") {
        text +=
            std::string(what) + " ip " + RULES_TABLE + " " + name + (more.empty() ? "" : " ") + more + "\n";
    }
};

std::string kind_of(const nft_set &set) {
    return set.declaration.substr(0, set.declaration.find(' '));
}

void change_elements(transaction &change, const char *verb, const std::string &name,
                     const std::map<std::string, std::string> &elements) {
    if (elements.empty())
        return;
    std::string list;
    for (const auto &[key, value] : elements)
        list += (list.empty() ? "{ " : ", ") + key + (value.empty() ? "" : " : " + value);
    change.add(verb, name, list + " }");
}

// Elements of `before` that are not the same in `after`.
std::map<std::string, std::string> missing_elements(const nft_set &before, const nft_set &after) {
    std::map<std::string, std::string> missing;
    for (const auto &element : before.elements) {
        const auto at = after.elements.find(element.first);
        if (at == after.elements.end() || at->second != element.second)
            missing.insert(element);
    }
    return missing;
}

// Deletes elements before it adds new ones, whose keys may be the same. Packets see the set only as it is
// after the transaction.
void change_set(transaction &change, const std::string &name, const nft_set *before, const nft_set &after,
                bool known) {
    if (after.filled_by_rules)
        return;
    if (!before) {
        change_elements(change, "add element", name, after.elements);
        return;
    }
    if (!known) {
        change.add(("flush " + kind_of(after)).c_str(), name);
        change_elements(change, "add element", name, after.elements);
        return;
    }
    change_elements(change, "delete element", name, missing_elements(*before, after));
    change_elements(change, "add element", name, missing_elements(after, *before));
}

template <typename V>
const V *find_in(const std::map<std::string, V> &map, const std::string &name) {
    const auto at = map.find(name);
    return at == map.end() ? nullptr : &at->second;
}

} // namespace

// An object is added before the objects that refer to it, and deleted after them.
std::string make_sorting_transaction(const nft_content &before, const nft_content &after) {
    if (before == after)
        return "";
    transaction change;
    if (after.empty()) {
        change.text = std::string("delete table ip ") + RULES_TABLE + "\n";
        return change.text;
    }
    if (before.empty())
        change.text = std::string("add table ip ") + RULES_TABLE + "\n";
    // Counters and chains first: the elements of maps refer to them.
    for (const std::string &name : after.counters)
        if (!before.counters.contains(name))
            change.add("add counter", name);
    for (const auto &[name, chain] : after.chains)
        if (!before.chains.contains(name))
            change.add("add chain", name, chain.declaration.empty() ? "" : "{ " + chain.declaration + " }");
    for (const auto &[name, chain] : before.chains) {
        // Rules that are gone or change: they would keep sets from being deleted. Those of an earlier tunneld
        // are not known, and are all written anew.
        const nft_chain *wanted = find_in(after.chains, name);
        if (!before.known || !wanted || wanted->rules != chain.rules)
            change.add("flush chain", name);
    }
    // A map whose type changes, as with another mask, is replaced. The rules that use it change as well and
    // have been flushed. The types that an earlier tunneld has left were compared before the call.
    const auto kept_set = [&before](const std::string &name, const nft_set &wanted) {
        const nft_set *old = find_in(before.sets, name);
        return old && (!before.known || old->declaration == wanted.declaration) ? old : nullptr;
    };
    for (const auto &[name, set] : after.sets)
        if (!kept_set(name, set)) {
            if (const nft_set *old = find_in(before.sets, name))
                change.add(("delete " + kind_of(*old)).c_str(), name);
            const size_t body = set.declaration.find(' ');
            change.add(("add " + kind_of(set)).c_str(), name, set.declaration.substr(body + 1));
        }
    // Elements of a set that will be deleted may refer to a chain or a counter that is deleted as well.
    for (const auto &[name, set] : before.sets)
        if (!after.sets.contains(name) && !set.filled_by_rules)
            change.add(("flush " + kind_of(set)).c_str(), name);
    for (const auto &[name, set] : after.sets)
        change_set(change, name, kept_set(name, set), set, before.known);
    for (const auto &[name, chain] : after.chains) {
        const nft_chain *old = find_in(before.chains, name);
        if (!before.known || !old || old->rules != chain.rules)
            for (const std::string &rule : chain.rules)
                change.add("add rule", name, rule);
    }
    for (const auto &[name, chain] : before.chains)
        if (!after.chains.contains(name))
            change.add("delete chain", name);
    for (const auto &[name, set] : before.sets)
        if (!after.sets.contains(name))
            change.add(("delete " + kind_of(set)).c_str(), name);
    for (const std::string &name : before.counters)
        if (!after.counters.contains(name))
            change.add("delete counter", name);
    return change.text;
}
