// What the kernel should hold for the appliance as it is: interfaces, rules, routes, settings, and the rules
// that sort redirected packets. make_wanted_state() is a pure function; reconcile_kernel_state() is the one
// place that changes anything.
#pragma once

#include <compare>
#include <cstdint>
#include <string>
#include <vector>

#include "peers/tunneld/plane.h"
#include "peers/tunneld/view.h"

// Marks of ours.
constexpr uint8_t ROUTE_PROTOCOL = 204;       // of routes and rules
constexpr uint32_t MARK_LOCAL = 0x57430001;   // goes to a socket of this host
constexpr uint32_t MARK_FORWARD = 0x57430002; // routed by the main table
constexpr uint32_t MARK_RETURN = 0x57430100;  // plus the number of a link: from L2 back through that link
constexpr uint32_t MARK_PASS = 0x57450000;    // plus the number of a member's link: on by that link
constexpr uint32_t TABLE_LOCAL = 204800;      // its one route delivers everything locally
constexpr uint32_t TABLE_LINK_FIRST = 204801; // plus the number of a link
constexpr uint32_t TABLE_PASS_FIRST = TABLE_LINK_FIRST + 65536; // plus the number of a member's link
constexpr uint32_t RULE_PREFERENCE = 2048;                      // of the first of our rules
constexpr const char *RULES_TABLE = "tunneld";                  // of nftables, family ip

struct wanted_link {
    std::string name; // "wccp0" and so on, by the number of the link
    link_wish wish;
    bool operator==(const wanted_link &) const = default;
};
struct wanted_rule { // ip rule
    uint32_t preference;
    std::string in_interface; // "" for any
    uint32_t mark;            // 0 for any
    uint32_t table;
    auto operator<=>(const wanted_rule &) const = default;
};
struct wanted_route { // the default route of a table of ours
    uint32_t table;
    bool local;            // deliver here
    std::string interface; // otherwise: out there
    uint32_t via;          // next hop on that interface, host order; 0 for none
    auto operator<=>(const wanted_route &) const = default;
};
struct wanted_setting { // below /proc/sys/net/ipv4/conf
    std::string path;   // "wccp0/rp_filter"
    std::string value;
    bool restore; // what was there before comes back at an orderly end
    auto operator<=>(const wanted_setting &) const = default;
};

// Redirected packets of one group. A group without an intercept has `rules.to` 0: where it shares an
// interface with groups that forward or drop what nobody wants, that is returned after all.
struct sorted_group {
    uint8_t group;
    intercept rules;
    intercept_condition condition;
    std::vector<std::string> interfaces; // that its packets come in by: links of its tunnels, L2 interfaces
    slot_mask mask = {};                 // of its table, if that is by mask
    std::vector<port_range> pass_ports =
        {}; // without an intercept: source ports of what is passed; none: all
    std::vector<uint32_t> pass_marks =
        {}; // by slot: where unknown flows are passed on to, or 0; none: nowhere
    bool operator==(const sorted_group &) const = default;
};
struct wanted_sorting {
    std::vector<std::string> links;         // that carry redirected packets out of GRE
    std::vector<std::string> members;       // links by which other appliances pass packets on
    std::vector<std::string> passing;       // links whose packets are passed on unless they have a socket
    std::vector<std::string> l2_interfaces; // on which they arrive as they are
    // L2 interfaces from which packets are given back through GRE: the interface and the mark of the link.
    std::vector<std::pair<std::string, uint32_t>> l2_into_gre;
    std::vector<sorted_group> groups;
    std::vector<ip_prefix> bypasses;
    std::vector<uint32_t> own_addresses;
    std::vector<tunnel_ends> ends; // outer addresses that GRE is expected between
    uint16_t mss = 0;              // that SYN-ACKs of transparent sockets are clamped to; 0: not at all
    bool drop_outer_gre = false;   // user-space plane: the kernel has no use for its GRE packets
    bool operator==(const wanted_sorting &) const = default;
};

struct wanted_state {
    std::vector<wanted_link> links;
    std::vector<wanted_rule> rules;
    std::vector<wanted_route> routes;
    std::vector<wanted_setting> settings;
    wanted_sorting sorting;
    passing_table passing; // user-space plane
    bool operator==(const wanted_state &) const = default;
};

// Links keep their numbers: `before` is what was wanted last, or what was found at the start.
// `kept`: links to members that stay whatever the view says, while it isn't complete.
wanted_state make_wanted_state(const appliance_view &view, const std::vector<wanted_link> &before,
                               bool user_space, bool kept = false);
