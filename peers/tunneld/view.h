// What tunneld knows of the appliance: its tunnels, the groups and intercepts that are configured, the state
// of proxies and roles. Plain data: the session and the mailbox fill it in, make_wanted_state() reads it.
// Addresses are IPv4 in host order throughout.
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

// A tunnel that wccpd has ordered.
struct tunnel_ends {
    uint32_t local, remote;
    auto operator<=>(const tunnel_ends &) const = default;
};

// What happens to a redirected packet that nobody wants.
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
    uint16_t to = 0;               // the port that the proxy listens on
    std::vector<ip_prefix> bypass; // clients or servers that are left alone
    leftover rest = leftover::give_back;
    bool drop_when_down = false; // fail closed; otherwise flows are returned while the proxy is down
    health_check check;
    uint32_t leave_after_s = 30; // the proxy's being down, until the group leaves its routers; 0: never
    uint32_t limit = 0;          // flows, above which new ones are returned; 0: none
    uint32_t slow_start_s = 0;   // until the whole weight is announced, once there is a proxy; 0: at once
    bool operator==(const intercept &) const = default;
};
struct intercept_condition {
    bool proxy_up = false;
    bool active = true;      // a router assigns to this appliance, and the role of the policy group is ACTIVE
    bool draining = false;   // the group is being emptied, or out of its routers because of it
    bool overloaded = false; // there are more flows than the limit
    bool operator==(const intercept_condition &) const = default;
};

// How packets travel between a router and this appliance, as negotiated; unknown until wccpd says so.
enum class travel { unknown, gre, l2 };
struct group_router {
    uint32_t id;      // the router's end of the tunnel
    uint32_t address; // that it is spoken to at
    travel forward = travel::unknown, give_back = travel::unknown;
    bool operator==(const group_router &) const = default;
};
struct group_view {
    std::string interface;
    uint32_t local = 0;        // this appliance's address on the interface, 0 unknown
    uint16_t policy_group = 0; // 0 for none
    bool force_l2_return = false;
    std::vector<group_router> routers; // that have answered
    bool active = false;               // by wccpd's last answer a router assigns to this appliance
    bool alone = false;                // by the same answer there is no other appliance
    bool operator==(const group_view &) const = default;
};

struct bypass_entry {
    ip_prefix prefix;
    int64_t until; // seconds since 1970; 0 for ever
    bool operator==(const bypass_entry &) const = default;
};
// A further source of redirected packets: what comes from `address` is taken as if a router had sent it.
struct accepted_source {
    uint32_t address;
    uint32_t router; // only beside the tunnels to this router id; 0: beside all
    bool operator==(const accepted_source &) const = default;
};

// The fields of a packet that decide on its slot where routers assign by mask, or a value of them.
struct slot_mask {
    uint32_t src_ip = 0, dst_ip = 0;
    uint16_t src_port = 0, dst_port = 0;
    bool operator==(const slot_mask &) const = default;
};
// Whom the flows of a group belong to that this appliance doesn't know.
struct group_protection {
    bool by_mask = false;
    slot_mask mask;
    std::vector<uint32_t> members; // the other appliances of the group
    std::vector<uint32_t> targets; // by slot: a member, or 0 for nobody
    bool operator==(const group_protection &) const = default;
};
// A tunnel that wccpd has deleted. Its router may go on sending for a moment.
struct lingering_tunnel {
    uint16_t id;
    tunnel_ends ends;
    bool operator==(const lingering_tunnel &) const = default;
};

struct appliance_view {
    std::map<uint16_t, tunnel_ends> tunnels; // by tunnel id
    std::vector<lingering_tunnel> lingering; // new flows of these are returned
    std::map<uint8_t, group_view> groups;
    std::map<uint8_t, intercept> intercepts; // by group
    std::map<uint8_t, intercept_condition> conditions;
    std::vector<bypass_entry> bypasses; // without those whose time is over
    std::vector<accepted_source> accepted;
    std::map<uint8_t, group_protection> protections; // none while flows are not protected
    std::vector<uint32_t> own_addresses;             // of this host, without 127.0.0.0/8
};
