// Everything tunneld knows about the appliance: its tunnels, the configured groups and intercepts, the health
// of the proxies, the roles. Plain data, filled in by the session and the mailbox and read by
// make_wanted_state(). All addresses are IPv4 in host order.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

struct ip_prefix {
    uint32_t address;
    uint8_t length; // 0 to 32
    bool operator==(const ip_prefix &) const = default;
};
struct port_range {
    uint16_t first, last; // inclusive
    bool operator==(const port_range &) const = default;
};

// The two ends of a tunnel that wccpd has ordered.
struct tunnel_ends {
    uint32_t local, remote;
    auto operator<=>(const tunnel_ends &) const = default;
};

// What is done with a redirected packet that no intercept wants. `give_back` is the configuration's "return".
enum class leftover { give_back, forward, drop };
enum class check_kind { tcp, http, command };
struct health_check {
    check_kind kind = check_kind::tcp;
    std::string argument; // the path of http, the file of command
    uint32_t interval_s = 5, rise = 2, fall = 3;
    bool operator==(const health_check &) const = default;
};
struct intercept {
    uint8_t protocol = 6;          // TCP, or 17 for UDP
    std::vector<port_range> ports; // none: all
    uint16_t to = 0;               // the proxy's listening port
    std::vector<ip_prefix> bypass; // clients and servers whose packets are returned
    leftover rest = leftover::give_back;
    bool drop_when_down = false; // fail closed; otherwise flows are returned while the proxy is down
    health_check check;
    uint32_t leave_after_s = 30; // how long the proxy is down before the group leaves its routers; 0: never
    uint32_t limit = 0;          // of the proxy's flows: above it new ones are returned; 0: no limit
    uint32_t slow_start_s = 0;   // how long the announced weight takes to rise to its full value; 0: no time
    bool operator==(const intercept &) const = default;
};
struct intercept_condition {
    bool proxy_up = false;
    bool active = true;      // see is_active_group()
    bool draining = false;   // an operator drains the group, or it has left its routers after a drain
    bool overloaded = false; // the proxy has more flows than `intercept::limit`
    bool operator==(const intercept_condition &) const = default;
};

// How packets travel between a router and this appliance, as negotiated; unknown until wccpd reports it.
enum class travel { unknown, gre, l2 };
struct group_router {
    uint32_t id;      // router id: the router's end of the tunnel
    uint32_t address; // to which protocol messages are sent
    travel forward = travel::unknown, give_back = travel::unknown;
    bool operator==(const group_router &) const = default;
};
struct group_view {
    std::string interface;
    uint32_t local = 0;        // this appliance's address on the interface; 0: unknown
    uint16_t policy_group = 0; // 0 for none
    bool force_l2_return = false;
    std::vector<group_router> routers; // that have answered wccpd
    bool active = false;               // wccpd's last answer: a router assigns packets to this appliance
    bool alone = false;                // the same answer: no other appliance is in the group
    bool operator==(const group_view &) const = default;
};

struct bypass_entry {
    ip_prefix prefix;
    int64_t until; // seconds since 1970; 0: no end
    bool operator==(const bypass_entry &) const = default;
};
// A further source of redirected packets: GRE from `address` is accepted as if a router had sent it.
struct accepted_source {
    uint32_t address;
    uint32_t router; // for the tunnels to this router id; 0: for all tunnels
    bool operator==(const accepted_source &) const = default;
};

// With mask assignment: the bits of a packet that select its slot, or one value of these bits.
struct slot_mask {
    uint32_t src_ip = 0, dst_ip = 0;
    uint16_t src_port = 0, dst_port = 0;
    bool operator==(const slot_mask &) const = default;
};
// Flow protection of a group: where packets of a flow that this host has no socket for are passed on to.
struct group_protection {
    bool by_mask = false; // otherwise by hash: slots are buckets
    slot_mask mask;
    std::vector<uint32_t> members; // addresses of the other appliances of the group
    std::vector<uint32_t> targets; // by slot: one of `members`, or 0: not passed on
    bool operator==(const group_protection &) const = default;
};
// A tunnel that wccpd has deleted a moment ago. Its router may still send.
struct lingering_tunnel {
    uint16_t id;
    tunnel_ends ends;
    bool operator==(const lingering_tunnel &) const = default;
};

struct appliance_view {
    std::map<uint16_t, tunnel_ends> tunnels; // by tunnel id
    std::vector<lingering_tunnel> lingering; // whose new flows are returned
    std::map<uint8_t, group_view> groups;
    std::map<uint8_t, intercept> intercepts; // by group
    std::map<uint8_t, intercept_condition> conditions;
    std::vector<bypass_entry> bypasses; // without expired ones
    std::vector<accepted_source> accepted;
    std::map<uint8_t, group_protection> protections; // empty while flow protection is off
    std::vector<uint32_t> own_addresses;             // of this host, without loopback interfaces
};
