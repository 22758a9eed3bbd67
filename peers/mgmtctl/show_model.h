// The state of the appliance at one moment, as "mgmtctl show" gathers it (show_gather.h) and draws it
// (show_draw.h).
#pragma once

#include <charconv>
#include <cstddef>
#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "peers/mgmtctl/traffic.h"

// All texts are cleaned: printable ASCII of bounded length.
struct snapshot_load {
    std::string appliance;
    uint32_t percent = 0; // of the router's assignment
};
struct snapshot_router {
    std::string address; // the source of its messages, or the configured one
    std::string id;
    bool configured = false;
    std::string connection; // "two-way", "one-way", "unknown"; "none": nothing is heard
    uint64_t connected_ms = 0;
    std::string forward, assign, back; // "gre", "l2", "hash", "mask"; empty as long as nothing is agreed
    std::vector<snapshot_load> loads;
};
struct snapshot_appliance {
    std::string address;
    bool self = false;
    int64_t weight = -1;                          // -1: unknown
    int asked_percent = -1;                       // its share by the weights, or by the designated appliance
    bool reported = false;                        // by a router, its share
    uint32_t least_percent = 0, most_percent = 0; // over the routers
};
// Which appliance has which bucket or mask value, as routers report it.
struct snapshot_table {
    bool mask = false;
    std::vector<std::string> routers; // that report this very table, by their ids
    std::vector<int> owners; // places in the group's appliances, -1 for nobody; a power of two of them
};
struct snapshot_alarm {
    long type = 0;
    std::string name; // "adjacency", "assignment"
    std::string source, text, since, reporter;
    int group = -1;
};
// Why something does not work, as wccpd noted it; wccpd's codes are in the table of reasons.h.
struct snapshot_reason {
    std::string code, sender; // the sender is empty where there is none
    std::string source;       // of the packet that gave the reason; empty for none
    std::string offered, wanted;
    uint64_t count = 0;
    int64_t first_ms = 0, last_ms = 0; // how long ago
};
struct snapshot_group {
    int id = 0;
    // What is configured.
    bool configured = false;
    std::string interface, admin, protocol, encap, assign_method;
    bool authenticated = false, interface_set = false;
    int64_t weight = -1, priority = -1, policy = -1;
    // What wccpd has.
    bool running = false;
    std::string state; // "ACTIVE", "BACKUP", "INIT"
    bool designated = false;
    uint64_t uptime_ms = 0;
    uint64_t since_ms = 0;   // since it was started or stopped
    uint64_t here_i_ams = 0; // sent; known where a router is silent
    std::vector<snapshot_reason> reasons;
    std::string address; // of this appliance in the group
    std::string link;    // of its first interface: "up", "down"; empty: unknown
    size_t routers_configured = 0, routers_heard = 0;
    std::vector<snapshot_router> routers;
    std::vector<snapshot_appliance> appliances;
    std::vector<snapshot_table> tables;
    snapshot_table wanted; // sent by this appliance as the designated one; without owners: unknown
};
struct snapshot_process {
    bool running = false;
    std::string since;        // it runs, or is gone
    std::string silent_since; // it has answered no query; empty: it answers, or has not been asked
    uint64_t restarts = 0;
};
enum class wccpd_condition { running, silent, absent };
struct snapshot {
    std::string unreachable; // why there is nothing of mgmtd; the rest is empty then
    wccpd_condition wccpd = wccpd_condition::absent;
    std::string status, version, mode; // of the daemon, twice; of the system
    std::vector<snapshot_group> groups;
    size_t groups_total = 0;
    bool brief = false; // groups without routers, weights, tables and link, and with the own share alone
    size_t roles_active = 0, roles_backup = 0;
    std::vector<snapshot_alarm> alarms;
    size_t alarms_total = 0;
    std::map<std::string, snapshot_process> processes; // that mgmtd has seen
    std::vector<snapshot_reason> reasons;              // of packets that belong to no group
    traffic_state traffic;
};

// How long ago a time of a node ("2026/01/31 12:05:31") is; -1 when it is none, or in the future.
int64_t ms_since(const std::string &time_text);
// The number that the text begins with.
template <typename Number>
Number number_of(const std::string &text, Number otherwise) {
    Number out = otherwise;
    (void)std::from_chars(text.data(), text.data() + text.size(), out);
    return out;
}
// The parts of a name below `root`; none for a name that isn't below it.
std::vector<std::string> parts_below(const std::string &root, const std::string &name);
// The text cut to `most` characters, everything but printable ASCII replaced.
std::string clean_text(const std::string &text, size_t most);
// The place of the appliance, which is added when it is new; -1 when there are too many.
int place_of_appliance(snapshot_group *inout, const std::string &address);
