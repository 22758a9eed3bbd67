// The state that the kernel should be in: interfaces, rules, routes, settings, and the rules that sort
// redirected packets. make_wanted_state() computes it without side effects. Only kernel_state.cpp changes the
// kernel.
#pragma once

#include <compare>
#include <cstdint>
#include <string>
#include <vector>

#include "peers/tunneld/plane.h"
#include "peers/tunneld/view.h"

// The protocol number by which tunneld's routes and rules are recognised, packet marks, and table numbers.
constexpr uint8_t ROUTE_PROTOCOL = 204;
constexpr uint32_t MARK_LOCAL = 0x57430001;   // delivered to a socket of this host
constexpr uint32_t MARK_FORWARD = 0x57430002; // routed by the main table
constexpr uint32_t MARK_RETURN = 0x57430100;  // plus a link's number: came by L2, returned through the link
constexpr uint32_t MARK_PASS = 0x57450000; // plus a link's number: passed on to the member through the link
constexpr uint32_t TABLE_LOCAL = 204800;   // its only route delivers everything locally
constexpr uint32_t TABLE_LINK_FIRST = 204801;                   // plus the number of a link
constexpr uint32_t TABLE_PASS_FIRST = TABLE_LINK_FIRST + 65536; // plus the number of a member's link
constexpr uint32_t RULE_PREFERENCE = 2048;                      // of tunneld's first rule
constexpr const char *RULES_TABLE = "tunneld";                  // the nftables table, family ip

struct wanted_link {
    std::string name; // "wccp0" and so on
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
struct wanted_route { // the default route of one of tunneld's tables
    uint32_t table;
    bool local;            // delivers to this host
    std::string interface; // otherwise: leads out of this interface
    uint32_t via;          // next hop on the interface, host order; 0: none
    auto operator<=>(const wanted_route &) const = default;
};
struct wanted_setting { // below /proc/sys/net/ipv4/conf
    std::string path;   // "wccp0/rp_filter"
    std::string value;
    bool restore; // the old value is restored at an orderly end
    auto operator<=>(const wanted_setting &) const = default;
};

// How redirected packets of one group are sorted. `rules.to` is 0 for a group without an intercept. Such a
// group matters on an interface that it shares with groups that forward or drop unwanted packets: there, they
// are returned instead.
struct sorted_group {
    uint8_t group;
    intercept rules;
    intercept_condition condition;
    std::vector<std::string> interfaces; // where its packets arrive: links of its tunnels, L2 interfaces
    slot_mask mask = {};                 // with mask assignment
    // For a group without an intercept: packets from these source ports are passed on. Empty: from all ports.
    std::vector<port_range> pass_ports = {};
    // By slot: the mark of packets of unknown flows, which passes them on, or 0. Empty: nothing is passed on.
    std::vector<uint32_t> pass_marks = {};
    bool operator==(const sorted_group &) const = default;
};
struct wanted_sorting {
    std::vector<std::string> links;   // by which redirected packets arrive out of GRE
    std::vector<std::string> members; // links from other appliances, which pass packets on
    std::vector<std::string> passing; // links whose packets are passed on unless they have a socket here
    std::vector<std::string> l2_interfaces; // on which redirected packets arrive without GRE
    // L2 interfaces whose packets are returned through GRE: the interface, and the mark for the link.
    std::vector<std::pair<std::string, uint32_t>> l2_into_gre;
    std::vector<sorted_group> groups;
    std::vector<ip_prefix> bypasses;
    std::vector<uint32_t> own_addresses;
    std::vector<tunnel_ends> ends; // outer addresses between which GRE is expected
    uint16_t mss = 0;              // SYN-ACKs of transparent sockets announce at most this; 0: unchanged
    bool drop_outer_gre = false;   // with the plane `user`, whose ring has the packets already
    bool operator==(const wanted_sorting &) const = default;
};

struct wanted_state {
    std::vector<wanted_link> links;
    std::vector<wanted_rule> rules;
    std::vector<wanted_route> routes;
    std::vector<wanted_setting> settings;
    wanted_sorting sorting;
    passing_table passing; // for the plane `user`
    bool operator==(const wanted_state &) const = default;
};

// `before`: the links that were wanted last, or found at the start, whose numbers are kept. `user_space`: for
// the plane `user`. `keep_members`: the view is not complete yet; links to other appliances that are missing
// from it stay.
wanted_state make_wanted_state(const appliance_view &view, const std::vector<wanted_link> &before,
                               bool user_space, bool keep_members = false);
