// Computes the wanted state of the kernel. Nothing here reads or changes the kernel.
//
// The preferences of the rules order them: marked packets are delivered locally, or routed by the main table,
// or returned or passed on through a link; every other packet that came out of a link goes back into it. A
// rule whose table has no route is skipped, and the main table comes last: a missing route loses no packets.

#include "peers/tunneld/wanted_state.h"

#include <linux/rtnetlink.h>

#include <algorithm>
#include <map>
#include <optional>
#include <set>

#include "peers/tunneld/link_names.h"

namespace {

constexpr uint32_t PREFER_LOCAL = RULE_PREFERENCE, PREFER_FORWARD = RULE_PREFERENCE + 1,
                   PREFER_RETURN = RULE_PREFERENCE + 2, PREFER_LINK = RULE_PREFERENCE + 3;
// The largest TCP segment that fits into a GRE packet of 1500 bytes: without 28 bytes for the outer IP
// header, the GRE header and the redirect header, and 40 for the inner headers of IP and TCP.
constexpr uint16_t TUNNEL_MSS = 1500 - 28 - 40;

struct name_value {
    const char *name, *value;
};
// ignore_routes_with_linkdown: when the program that holds a TUN device is gone, the link is down, and
// packets are routed by the main table instead of being lost.
constexpr name_value LINK_SETTINGS[] = {{"rp_filter", "0"},
                                        {"accept_local", "1"},
                                        {"send_redirects", "0"},
                                        {"ignore_routes_with_linkdown", "1"},
                                        {"forwarding", "1"}};
constexpr name_value L2_SETTINGS[] = {{"accept_local", "1"}, {"send_redirects", "0"}, {"forwarding", "1"}};

// Link numbers by ends.
using numbers_by_ends = std::map<tunnel_ends, uint32_t>;
struct link_numbers {
    numbers_by_ends carrying, passing;
};

// Whether packets of the accepted source are treated like those of this tunnel.
bool is_accepted_beside(const accepted_source &source, const tunnel_ends &tunnel) {
    return !source.router || source.router == tunnel.remote;
}

// The ordered tunnels, followed by the deleted ones that linger.
std::vector<lingering_tunnel> all_tunnels(const appliance_view &view) {
    std::vector<lingering_tunnel> out;
    for (const auto &[id, ends] : view.tunnels)
        out.push_back({id, ends});
    out.insert(out.end(), view.lingering.begin(), view.lingering.end());
    return out;
}

numbers_by_ends &numbers_of(link_numbers *numbers, const link_wish &wish) {
    return wish.kind == link_kind::passing ? numbers->passing : numbers->carrying;
}

// Links that exist keep their numbers. The number of a link that is removed can be used again only the next
// time, when it is no longer in `before`.
link_numbers number_links(const std::vector<link_wish> &wishes, const std::vector<wanted_link> &before) {
    link_numbers old, numbers;
    std::set<uint32_t> used;
    for (const auto &link : before) {
        const auto number = link_number(link.name);
        if (number && used.insert(*number).second)
            numbers_of(&old, link.wish).insert({{link.wish.local, link.wish.remote}, *number});
    }
    uint32_t next = 0;
    for (const auto &wish : wishes) {
        const tunnel_ends ends = {wish.local, wish.remote};
        const numbers_by_ends &before_by_ends = numbers_of(&old, wish);
        const auto known = before_by_ends.find(ends);
        // insert() also takes the number, for the links that follow.
        if (known == before_by_ends.end())
            while (!used.insert(next).second)
                next++;
        numbers_of(&numbers, wish)[ends] = known == before_by_ends.end() ? next : known->second;
    }
    return numbers;
}

// Whether packets of the group come through this tunnel.
bool carries_group(const tunnel_ends &tunnel, const group_view &group) {
    if (group.local && group.local != tunnel.local)
        return false;
    // As long as no router has answered, every tunnel from the group's address may be that of its router.
    if (group.routers.empty())
        return group.local != 0;
    return std::any_of(group.routers.begin(), group.routers.end(),
                       [&](const group_router &router) { return router.id == tunnel.remote; });
}

bool redirects_by_l2(const group_view &group) {
    return is_interface_name(group.interface) &&
           std::any_of(group.routers.begin(), group.routers.end(),
                       [](const group_router &router) { return router.forward == travel::l2; });
}

bool has_tunnel(const appliance_view &view, const group_view &group) {
    const auto tunnels = all_tunnels(view);
    return std::any_of(tunnels.begin(), tunnels.end(),
                       [&](const lingering_tunnel &each) { return carries_group(each.ends, group); });
}

bool is_tunnel(const appliance_view &view, const tunnel_ends &ends) {
    const auto tunnels = all_tunnels(view);
    return std::any_of(tunnels.begin(), tunnels.end(),
                       [&](const lingering_tunnel &each) { return each.ends == ends; });
}

// The ends of the links to other appliances, of groups whose packets come here. There are none while nothing
// is intercepted, and none to an address to which there is a tunnel. Packets from a member must never be
// passed on again: if an address is also an accepted source, the member's link wins.
std::set<tunnel_ends> member_ends(const appliance_view &view) {
    std::set<tunnel_ends> all;
    for (const auto &[id, protection] : view.protections) {
        const auto group = view.groups.find(id);
        if (view.intercepts.empty() || group == view.groups.end() || !group->second.local ||
            (!redirects_by_l2(group->second) && !has_tunnel(view, group->second)))
            continue;
        for (const uint32_t member : protection.members)
            if (!is_tunnel(view, {group->second.local, member}))
                all.insert({group->second.local, member});
    }
    return all;
}

// The links of kind `passing`: only the plane `user` sees buckets, and only in GRE.
std::set<tunnel_ends> passing_ends(const appliance_view &view) {
    std::set<tunnel_ends> all;
    const std::set<tunnel_ends> members = member_ends(view);
    for (const auto &[id, protection] : view.protections)
        if (const auto group = view.groups.find(id);
            !protection.by_mask && group != view.groups.end() && has_tunnel(view, group->second))
            for (const uint32_t member : protection.members)
                if (members.contains({group->second.local, member}))
                    all.insert({group->second.local, member});
    return all;
}

std::vector<link_wish> wish_links(const appliance_view &view, bool user_space) {
    std::vector<link_wish> wishes;
    const auto tunnels = all_tunnels(view);
    // Members first: an accepted source that is also a member gets the member's link only.
    std::set<tunnel_ends> taken = member_ends(view);
    for (const auto &[id, ends] : tunnels)
        if (taken.insert(ends).second)
            wishes.push_back({id, ends.local, ends.remote, link_kind::tunnel});
    for (const auto &source : view.accepted)
        for (const auto &[id, ends] : tunnels)
            if (source.address && is_accepted_beside(source, ends) &&
                taken.insert({ends.local, source.address}).second)
                wishes.push_back({id, ends.local, source.address, link_kind::accepted});
    for (const tunnel_ends &ends : member_ends(view))
        wishes.push_back({0, ends.local, ends.remote, link_kind::member});
    if (user_space)
        for (const tunnel_ends &ends : passing_ends(view))
            wishes.push_back({0, ends.local, ends.remote, link_kind::passing});
    return wishes;
}

// Adds the links to members that an earlier tunneld has left.
void keep_member_links(const std::vector<wanted_link> &left, std::vector<link_wish> *inout) {
    for (const wanted_link &link : left)
        if ((link.wish.kind == link_kind::member || link.wish.kind == link_kind::passing) &&
            std::none_of(inout->begin(), inout->end(), [&](const link_wish &wish) {
                return wish.local == link.wish.local && wish.remote == link.wish.remote &&
                       (wish.kind == link_kind::passing) == (link.wish.kind == link_kind::passing);
            }))
            inout->push_back(link.wish);
}

// The ends of a group's links; for each the tunnel, which differs from it for an accepted source.
std::map<tunnel_ends, tunnel_ends> group_links(const appliance_view &view, const group_view &group,
                                               const std::vector<lingering_tunnel> &tunnels) {
    std::map<tunnel_ends, tunnel_ends> links;
    const std::set<tunnel_ends> members = member_ends(view);
    for (const auto &[id, tunnel] : tunnels) {
        if (!carries_group(tunnel, group))
            continue;
        links[tunnel] = tunnel;
        for (const auto &source : view.accepted)
            if (source.address && is_accepted_beside(source, tunnel) &&
                !members.contains({tunnel.local, source.address}))
                // An address that is a tunnel of its own keeps it: insert() does not replace.
                links.insert({{tunnel.local, source.address}, tunnel});
    }
    return links;
}

struct next_hop {
    std::string interface;
    uint32_t via;
};
// Where a link's packets are returned by L2. Groups can share a link. One that forces L2 decides for all of
// them. Otherwise all of them must have negotiated L2 with the router, since every router accepts GRE.
struct l2_choice {
    std::optional<next_hop> forced, agreed;
    bool gre = false;
};

void choose_return(const group_view &group, uint32_t router_id, l2_choice *choice) {
    for (const auto &router : group.routers) {
        // Packets of a router that redirects by L2 do not come by this link.
        if (router.id != router_id || router.forward == travel::l2)
            continue;
        const bool l2 = group.force_l2_return || router.give_back == travel::l2;
        if (!l2 || !router.address || !is_interface_name(group.interface)) {
            choice->gre = true;
            continue;
        }
        auto &hop = group.force_l2_return ? choice->forced : choice->agreed;
        if (!hop)
            hop = {group.interface, router.address};
    }
}

// Packets without a mark are routed by `table`.
void want_link_basics(const wanted_link &link, uint32_t table, wanted_state *out) {
    out->rules.push_back({PREFER_LOCAL, link.name, MARK_LOCAL, TABLE_LOCAL});
    out->rules.push_back({PREFER_LINK, link.name, 0, table});
    for (const auto &[name, value] : LINK_SETTINGS)
        out->settings.push_back({link.name + "/" + name, value, false});
}

void want_link(const wanted_link &link, uint32_t number, const l2_choice &choice, wanted_state *out) {
    const uint32_t table = TABLE_LINK_FIRST + number;
    want_link_basics(link, table, out);
    out->rules.push_back({PREFER_FORWARD, link.name, MARK_FORWARD, RT_TABLE_MAIN});
    wanted_route route = {table, false, link.name, 0};
    // By L2 the packets leave by the group's own interface, and the link is only their way in.
    if (choice.forced || (choice.agreed && !choice.gre)) {
        const next_hop &hop = choice.forced ? *choice.forced : *choice.agreed;
        route.interface = hop.interface;
        route.via = hop.via;
    }
    out->routes.push_back(route);
    out->sorting.links.push_back(link.name);
    out->sorting.ends.push_back({link.wish.local, link.wish.remote});
    out->sorting.mss = TUNNEL_MSS;
}

// The number of the link through which packets are returned that a router redirects by L2 and wants back by
// GRE.
std::optional<uint32_t> find_l2_return_link(const group_view &group, const link_numbers &numbers) {
    if (group.force_l2_return)
        return std::nullopt;
    for (const auto &router : group.routers)
        if (router.forward == travel::l2 && router.give_back == travel::gre)
            for (const auto &[ends, number] : numbers.carrying)
                if (ends.remote == router.id && (!group.local || group.local == ends.local))
                    return number;
    return std::nullopt;
}

void want_l2_interfaces(const appliance_view &view, const link_numbers &numbers, wanted_state *out) {
    std::map<std::string, std::optional<uint32_t>> interfaces; // and the link through which to return packets
    for (const auto &[id, group] : view.groups) {
        if (!redirects_by_l2(group))
            continue;
        auto &link = interfaces[group.interface];
        // Several groups can share the interface. The first one with a link decides.
        if (!link)
            link = find_l2_return_link(group, numbers);
    }
    for (const auto &[name, link] : interfaces) {
        out->sorting.l2_interfaces.push_back(name);
        out->rules.push_back({PREFER_LOCAL, name, MARK_LOCAL, TABLE_LOCAL});
        if (link) {
            out->sorting.l2_into_gre.push_back({name, MARK_RETURN + *link});
            out->rules.push_back({PREFER_RETURN, name, MARK_RETURN + *link, TABLE_LINK_FIRST + *link});
        }
        for (const auto &[key, value] : L2_SETTINGS)
            out->settings.push_back({name + "/" + key, value, true});
    }
}

// The interfaces at which a group's packets arrive.
std::vector<std::string> group_interfaces(const appliance_view &view, const group_view &group,
                                          const link_numbers &numbers) {
    std::vector<std::string> names;
    std::vector<lingering_tunnel> tunnels; // without lingering ones, which have no group: all is returned
    for (const auto &[id, ends] : view.tunnels)
        tunnels.push_back({id, ends});
    for (const auto &[ends, tunnel] : group_links(view, group, tunnels))
        names.push_back(link_name(numbers.carrying.at(ends)));
    if (redirects_by_l2(group))
        names.push_back(group.interface);
    return names;
}

// The TCP ports whose flows are protected in a group: the ports of its intercept. A group without an
// intercept carries the replies of servers: there it is the source ports, those of all intercepts. Empty: all
// ports. False: no TCP flow is protected.
bool find_protected_ports(const appliance_view &view, uint8_t id, bool *out_by_source,
                          std::vector<port_range> *out) {
    const auto own = view.intercepts.find(id);
    *out_by_source = own == view.intercepts.end();
    bool any = false, all = false;
    for (const auto &[group, rules] : view.intercepts) {
        if ((group != id && !*out_by_source) || rules.protocol != 6)
            continue;
        any = true;
        all |= rules.ports.empty();
        out->insert(out->end(), rules.ports.begin(), rules.ports.end());
    }
    // One intercept of all ports makes the ranges of the others meaningless.
    if (all)
        out->clear();
    return any;
}

// With mask assignment, the rules pass packets on.
void want_pass_marks(const appliance_view &view, const link_numbers &numbers, sorted_group *inout) {
    const auto protection = view.protections.find(inout->group);
    bool by_source = false;
    if (protection == view.protections.end() || !protection->second.by_mask ||
        !find_protected_ports(view, inout->group, &by_source, &inout->pass_ports))
        return;
    const std::set<tunnel_ends> members = member_ends(view);
    const uint32_t local = view.groups.at(inout->group).local;
    inout->mask = protection->second.mask;
    for (const uint32_t target : protection->second.targets)
        inout->pass_marks.push_back(
            members.contains({local, target}) ? MARK_PASS + numbers.carrying.at({local, target}) : 0);
}

// Groups with an intercept, groups without one that pass packets on, and those that share an interface with
// an intercept: see sorted_group.
void want_groups(const appliance_view &view, const link_numbers &numbers, std::vector<sorted_group> *out) {
    std::map<uint8_t, std::vector<std::string>> others;
    std::set<std::string> intercepted;
    for (const auto &[id, group] : view.groups) {
        const auto names = group_interfaces(view, group, numbers);
        const auto rules = view.intercepts.find(id);
        if (rules == view.intercepts.end() || names.empty()) {
            others[id] = names;
            continue;
        }
        const auto condition = view.conditions.find(id);
        sorted_group made = {id, rules->second,
                             condition == view.conditions.end() ? intercept_condition{} : condition->second,
                             names};
        want_pass_marks(view, numbers, &made);
        out->push_back(std::move(made));
        intercepted.insert(names.begin(), names.end());
    }
    // Only now is it known which interfaces have intercepted packets.
    for (const auto &[id, names] : others) {
        sorted_group made = {id, {}, {}, names};
        want_pass_marks(view, numbers, &made);
        if (!made.pass_marks.empty() || std::any_of(names.begin(), names.end(), [&](const std::string &name) {
                return intercepted.count(name) > 0;
            }))
            out->push_back(std::move(made));
    }
}

// The path of packets that a member has passed on and that have no socket here: to a router of a group that
// this appliance and the member belong to.
std::optional<wanted_route> find_member_return(const appliance_view &view, const link_numbers &numbers,
                                               const tunnel_ends &member, const wanted_state &made) {
    const auto route_of = [&](uint32_t number) -> std::optional<wanted_route> {
        for (const wanted_route &route : made.routes)
            if (route.table == TABLE_LINK_FIRST + number)
                return route;
        return std::nullopt;
    };
    for (const auto &[id, protection] : view.protections) {
        const auto group = view.groups.find(id);
        if (group == view.groups.end() || group->second.local != member.local ||
            std::find(protection.members.begin(), protection.members.end(), member.remote) ==
                protection.members.end())
            continue;
        // The ways in which the group's own packets are returned: from L2 into GRE, by L2, and through a
        // tunnel's link.
        if (const auto number = find_l2_return_link(group->second, numbers))
            return route_of(*number);
        for (const auto &router : group->second.routers)
            if (router.forward == travel::l2 && router.address && is_interface_name(group->second.interface))
                return wanted_route{0, false, group->second.interface, router.address};
        // A link of the tunnel itself, not of one of its accepted sources.
        for (const auto &[ends, tunnel] : group_links(view, group->second, all_tunnels(view)))
            if (ends == tunnel)
                return route_of(numbers.carrying.at(ends));
    }
    return std::nullopt;
}

void want_members(const appliance_view &view, const link_numbers &numbers, wanted_state *out) {
    for (size_t i = 0; i < out->links.size(); i++) {
        const wanted_link &link = out->links[i];
        const tunnel_ends ends = {link.wish.local, link.wish.remote};
        if (link.wish.kind != link_kind::member && link.wish.kind != link_kind::passing)
            continue;
        const auto number = numbers.carrying.find(ends);
        if (number == numbers.carrying.end())
            continue;
        // A passing link sends nothing itself: its packets leave by the member's link, whose number its table
        // has.
        const uint32_t table = TABLE_PASS_FIRST + number->second;
        if (link.wish.kind == link_kind::passing) {
            want_link_basics(link, table, out);
            out->sorting.passing.push_back(link.name);
            continue;
        }
        want_link_basics(link, TABLE_LINK_FIRST + number->second, out);
        out->rules.push_back({PREFER_RETURN, "", MARK_PASS + number->second, table});
        out->routes.push_back({table, false, link.name, 0});
        if (auto route = find_member_return(view, numbers, ends, *out)) {
            // The same path, in the table of the member's link.
            route->table = TABLE_LINK_FIRST + number->second;
            out->routes.push_back(*route);
        }
        out->sorting.members.push_back(link.name);
        out->sorting.ends.push_back(ends);
    }
}

// With hash assignment, the plane `user` passes packets on.
void want_passing(const appliance_view &view, const link_numbers &numbers, wanted_state *out) {
    for (const auto &[id, protection] : view.protections) {
        const auto group = view.groups.find(id);
        if (protection.by_mask || group == view.groups.end())
            continue;
        passing_group made;
        made.local = group->second.local;
        if (!find_protected_ports(view, id, &made.by_source_port, &made.ports))
            continue;
        // Without a link, packets of the slot are sorted like all others.
        for (const uint32_t target : protection.targets)
            made.members.push_back(numbers.passing.contains({made.local, target}) ? target : 0);
        if (std::any_of(made.members.begin(), made.members.end(), [](uint32_t one) { return one != 0; }))
            out->passing[id] = std::move(made);
    }
}

} // namespace

wanted_state make_wanted_state(const appliance_view &view, const std::vector<wanted_link> &before,
                               bool user_space, bool keep_members) {
    wanted_state wanted;
    auto wishes = wish_links(view, user_space);
    if (keep_members)
        keep_member_links(before, &wishes);
    link_numbers numbers = number_links(wishes, before);
    // Every group has a say in how the packets of its links are returned.
    std::map<tunnel_ends, l2_choice> choices;
    for (const auto &[id, group] : view.groups)
        for (const auto &[ends, tunnel] : group_links(view, group, all_tunnels(view)))
            choose_return(group, tunnel.remote, &choices[ends]);
    // In the order of the numbers, which does not change when a link is added: the states can be compared.
    std::map<uint32_t, link_wish> by_number;
    for (const auto &wish : wishes)
        by_number[numbers_of(&numbers, wish).at({wish.local, wish.remote})] = wish;
    for (const auto &[number, wish] : by_number) {
        wanted.links.push_back({link_name(number), wish});
        if (wish.kind == link_kind::tunnel || wish.kind == link_kind::accepted)
            want_link(wanted.links.back(), number, choices[{wish.local, wish.remote}], &wanted);
    }
    // After the tunnels, whose routes those of the members are copied from.
    want_members(view, numbers, &wanted);
    want_l2_interfaces(view, numbers, &wanted);
    if (!wanted.rules.empty()) {
        wanted.routes.insert(wanted.routes.begin(), {TABLE_LOCAL, true, "", 0});
        // For rp_filter the larger of the interface's value and that of `all` counts, and redirects are sent
        // if either of the two allows them.
        if (!wanted.links.empty())
            wanted.settings.push_back({"all/rp_filter", "0", true});
        wanted.settings.push_back({"all/send_redirects", "0", true});
    }
    std::sort(wanted.rules.begin(), wanted.rules.end());
    want_groups(view, numbers, &wanted.sorting.groups);
    if (user_space)
        want_passing(view, numbers, &wanted);
    for (const auto &entry : view.bypasses)
        wanted.sorting.bypasses.push_back(entry.prefix);
    wanted.sorting.own_addresses = view.own_addresses;
    wanted.sorting.drop_outer_gre = user_space;
    return wanted;
}
