// Missing objects are added first: links, their settings, tables, rules, and then the rules that sort packets
// into them. Surplus objects are then removed in the opposite order. Therefore every rule leads to something
// that exists at each moment, and a program that is killed in between leaves no rule or route that swallows
// packets.
#include "peers/tunneld/kernel_state.h"

#include <net/if.h>

#include <algorithm>
#include <cstring>
#include <functional>
#include <set>

#include "peers/tunneld/kernel_links.h"
#include "peers/tunneld/kernel_routes.h"
#include "peers/tunneld/kernel_settings.h"
#include "peers/tunneld/link_names.h"
#include "peers/tunneld/sorting_rules.h"

namespace {

// Links that this process's data plane has made or taken over, by name. Others exist only in the kernel.
struct made_link {
    link_wish wish;
    uint32_t index;
};
std::map<std::string, made_link> made;

// Keeps the first failure, which is the one that is returned.
struct failure {
    std::string text;
    void note(const std::string &error) {
        if (text.empty())
            text = error;
    }
    void note(const std::string &what, int error) {
        if (error)
            note(what + ": " + strerror(error));
    }
    bool give(std::string *out_error) const {
        *out_error = text;
        return text.empty();
    }
};

bool same_ends(const link_wish &one, const link_wish &other) {
    // A passing link has the ends of the member's link.
    return one.local == other.local && one.remote == other.remote &&
           (one.kind == link_kind::passing) == (other.kind == link_kind::passing);
}

const wanted_link *find_wanted_link(const wanted_state &wanted, const std::string &name) {
    const auto found = std::find_if(wanted.links.begin(), wanted.links.end(),
                                    [&](const wanted_link &link) { return link.name == name; });
    return found == wanted.links.end() ? nullptr : &*found;
}

bool drop_made_link(const data_plane &plane, const std::string &name, failure *failed) {
    std::string error;
    if (!plane.drop_link(name, &error)) {
        failed->note(error);
        return false;
    }
    made.erase(name);
    return true;
}

// Removes the interface of this name if it is not the wanted link. False when it cannot be removed.
bool remove_other_link(const data_plane &plane, const wanted_link &link, found_link *found, failure *failed) {
    const auto known = made.find(link.name);
    if (known != made.end() && known->second.index != static_cast<uint32_t>(found->index)) {
        std::string error; // ignored: somebody else has removed the interface already
        plane.drop_link(link.name, &error);
        made.erase(known);
    } else if (known != made.end() && !same_ends(known->second.wish, link.wish)) {
        if (!drop_made_link(plane, link.name, failed))
            return false;
        *found = {};
    }
    const char *kind = &plane == &kernel_plane ? "gre" : "tun";
    if (found->index && found->kind != kind) { // left by a tunneld with the other data plane
        const int error = remove_link(found->index);
        failed->note("cannot remove link " + link.name, error);
        if (error)
            return false;
        *found = {};
    }
    return true;
}

// Makes the link and marks it, but does not bring it up. False when there is no such link then.
bool make_marked_link(const data_plane &plane, const wanted_link &link, found_link *found, failure *failed) {
    if (&plane != &table_plane && !remove_other_link(plane, link, found, failed))
        return false;
    const auto known = made.find(link.name);
    // Also when only the tunnel's id has changed: the plane keeps the link, and its alias is written again.
    if (known == made.end() || known->second.wish != link.wish) {
        uint32_t index = 0;
        std::string error;
        if (!plane.make_link(link.name, link.wish, &index, &error)) {
            failed->note(error);
            return false;
        }
        made[link.name] = {link.wish, index};
        // A new interface has nothing of what was found under its name.
        if (&plane != &table_plane && index != static_cast<uint32_t>(found->index)) {
            *found = {};
            found->index = static_cast<int>(index);
        }
    }
    if (&plane == &table_plane)
        return true;
    if (found->group == LINK_GROUP && found->mtu == LINK_MTU && found->wish == link.wish)
        return true;
    const int error = mark_link(found->index, link.wish);
    failed->note("cannot mark link " + link.name, error);
    return error == 0;
}

void bring_up(const wanted_link &link, const found_link &found, failure *failed) {
    if (found.is_up)
        return;
    // While the link is still down: the kernel sends its first packets as soon as it is up.
    disable_ipv6(link.name);
    failed->note("cannot bring link " + link.name + " up", bring_link_up(found.index));
}

void add_routes(const wanted_state &wanted, const std::vector<found_route> &found, failure *failed) {
    for (const auto &route : wanted.routes) {
        const bool is_there = std::any_of(found.begin(), found.end(), [&](const found_route &one) {
            return !one.odd && one.route == route;
        });
        if (!is_there)
            failed->note("cannot add " + route_text(route), put_route(route));
    }
}

void remove_routes(const wanted_state &wanted, const std::vector<found_route> &found, failure *failed) {
    for (const auto &one : found)
        if (one.odd ||
            std::find(wanted.routes.begin(), wanted.routes.end(), one.route) == wanted.routes.end())
            failed->note("cannot remove " + route_text(one.route), remove_route(one));
}

void add_rules(const wanted_state &wanted, const std::vector<found_rule> &found, failure *failed) {
    std::set<wanted_rule> there;
    for (const auto &one : found)
        if (!one.odd)
            there.insert(one.rule);
    for (const auto &rule : wanted.rules)
        if (!there.count(rule))
            failed->note("cannot add " + rule_text(rule), add_rule(rule));
}

void remove_rules(const wanted_state &wanted, const std::vector<found_rule> &found, failure *failed) {
    const std::set<wanted_rule> rules(wanted.rules.begin(), wanted.rules.end());
    for (const auto &one : found)
        if (one.odd || !rules.count(one.rule))
            failed->note("cannot remove " + rule_text(one.rule), remove_rule(one.rule));
}

void drop_unwanted_made_links(const data_plane &plane, const wanted_state &wanted, failure *failed) {
    // Collected first, since dropping a link changes the table.
    std::vector<std::string> names;
    for (const auto &[name, link] : made)
        if (!find_wanted_link(wanted, name))
            names.push_back(name);
    for (const auto &name : names)
        drop_made_link(plane, name, failed);
}

// All of tunneld's links, routes and rules that are in the kernel.
struct kernel_view {
    std::vector<found_link> links;
    std::vector<found_route> routes;
    std::vector<found_rule> rules;
};

void remove_unwanted_links(const data_plane &plane, const wanted_state &wanted, const kernel_view &there,
                           failure *failed) {
    drop_unwanted_made_links(plane, wanted, failed);
    for (const auto &link : there.links)
        if (!find_wanted_link(wanted, link.name) && !made.count(link.name))
            failed->note("cannot remove link " + link.name, remove_link(link.index));
}

void remove_unwanted(const data_plane &plane, const wanted_state &wanted, const kernel_view &there,
                     failure *failed) {
    remove_rules(wanted, there.rules, failed);
    remove_routes(wanted, there.routes, failed);
    std::string error;
    if (!restore_settings(wanted.settings, &error))
        failed->note(error);
    remove_unwanted_links(plane, wanted, there, failed);
}

bool reconcile_table(const wanted_state &wanted, std::map<std::string, uint32_t> *out_indices,
                     failure *failed) {
    for (const auto &link : wanted.links) {
        found_link none;
        if (make_marked_link(table_plane, link, &none, failed))
            (*out_indices)[link.name] = made.at(link.name).index;
    }
    drop_unwanted_made_links(table_plane, wanted, failed);
    return failed->text.empty();
}

bool reconcile_links(const data_plane &plane, const wanted_state &wanted, kernel_view *there,
                     std::map<std::string, uint32_t> *out_indices, failure *failed) {
    const int error = find_links(false, &there->links);
    failed->note("cannot list links", error);
    if (error)
        return false;
    std::map<std::string, found_link> found;
    // By name; a missing link gets an entry that is empty.
    for (const auto &link : there->links)
        found[link.name] = link;
    for (const auto &link : wanted.links)
        if (make_marked_link(plane, link, &found[link.name], failed))
            (*out_indices)[link.name] = static_cast<uint32_t>(found[link.name].index);
    std::string text;
    // After the links exist, and before they carry packets.
    if (!apply_settings(wanted.settings, &text))
        failed->note(text);
    for (const auto &link : wanted.links)
        if (out_indices->count(link.name))
            bring_up(link, found[link.name], failed);
    return true;
}

bool find_routes_and_rules(kernel_view *there, failure *failed) {
    const int routes = find_routes(&there->routes), rules = find_rules(&there->rules);
    failed->note("cannot list routes", routes);
    failed->note("cannot list rules", rules);
    return !routes && !rules;
}

} // namespace

std::vector<wanted_link> find_own_links() {
    std::vector<found_link> found;
    std::vector<wanted_link> links;
    if (find_links(false, &found))
        return links;
    for (const auto &link : found) {
        // Of two links with the same ends only the first is taken over.
        const bool is_known = link.wish && link_number(link.name) &&
                              std::none_of(links.begin(), links.end(), [&](const wanted_link &other) {
                                  return same_ends(other.wish, *link.wish);
                              });
        if (is_known)
            links.push_back({link.name, *link.wish});
    }
    return links;
}

bool reconcile_kernel_state(const data_plane &plane, const wanted_state &wanted,
                            std::map<std::string, uint32_t> *out_indices, std::string *out_error) {
    failure failed;
    out_indices->clear();
    if (&plane == &table_plane)
        return reconcile_table(wanted, out_indices, &failed) && failed.give(out_error);
    kernel_view there;
    if (!reconcile_links(plane, wanted, &there, out_indices, &failed))
        return failed.give(out_error);
    // Only after the links have changed: the routes of a link that was replaced are gone with it.
    if (!find_routes_and_rules(&there, &failed))
        return failed.give(out_error);
    add_routes(wanted, there.routes, &failed);
    add_rules(wanted, there.rules, &failed);
    std::string error;
    if (!apply_sorting_rules(wanted.sorting, &error))
        failed.note(error);
    // From now on the plane passes packets on, for which the rules and routes are ready.
    if (plane.set_passing)
        plane.set_passing(wanted.passing);
    remove_unwanted(plane, wanted, there, &failed);
    return failed.give(out_error);
}

bool reconcile_kernel_links(const data_plane &plane, const wanted_state &wanted,
                            std::map<std::string, uint32_t> *out_indices, std::string *out_error) {
    failure failed;
    out_indices->clear();
    kernel_view there;
    if (!reconcile_links(plane, wanted, &there, out_indices, &failed) ||
        !find_routes_and_rules(&there, &failed))
        return failed.give(out_error);
    // A route that the earlier tunneld has left stays even if it differs: how packets are to be returned is
    // not known yet.
    wanted_state missing = wanted;
    std::erase_if(missing.routes, [&](const wanted_route &route) {
        return std::any_of(there.routes.begin(), there.routes.end(), [&](const found_route &one) {
            return !one.odd && one.route.table == route.table;
        });
    });
    add_routes(missing, there.routes, &failed);
    add_rules(wanted, there.rules, &failed);
    // The number of a removed link, and with it its table, can soon belong to another link.
    const auto is_of_link = [&](uint32_t table) {
        return std::any_of(wanted.links.begin(), wanted.links.end(), [&](const wanted_link &link) {
            return table == TABLE_LINK_FIRST + link_number(link.name).value_or(0);
        });
    };
    for (const auto &one : there.routes)
        if (one.route.table != TABLE_LOCAL && !is_of_link(one.route.table) &&
            std::none_of(wanted.routes.begin(), wanted.routes.end(),
                         [&](const wanted_route &route) { return route.table == one.route.table; }))
            failed.note("cannot remove " + route_text(one.route), remove_route(one));
    remove_unwanted_links(plane, wanted, there, &failed);
    return failed.give(out_error);
}

bool is_kernel_state_left() {
    std::vector<found_rule> rules;
    return find_rules(&rules) == 0 && !rules.empty();
}

bool remove_kernel_state(const data_plane &plane, std::string *out_error) {
    failure failed;
    const wanted_state nothing;
    if (&plane == &table_plane) {
        drop_unwanted_made_links(plane, nothing, &failed);
        return failed.give(out_error);
    }
    std::string error;
    // First of all the rules that lead packets into the rest.
    if (!remove_sorting_rules(&error))
        failed.note(error);
    kernel_view there;
    failed.note("cannot list links", find_links(false, &there.links));
    find_routes_and_rules(&there, &failed);
    remove_unwanted(plane, nothing, there, &failed);
    return failed.give(out_error);
}
