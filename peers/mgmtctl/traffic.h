// tunneld's answers about redirected traffic, for "mgmtctl intercept show", "tunnel show" and "show".
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "peers/mgmtctl/nodes.h"

struct traffic_count {
    uint64_t packets = 0, bytes = 0;
};
// Redirected packets by what became of them: "in", "to_proxy", ...
using sorted_counts = std::map<std::string, traffic_count>;
using refused_counts = std::map<std::string, uint64_t>; // packets by the reason

// All texts are cleaned: printable ASCII of bounded length.
struct traffic_tunnel {
    int id = 0;
    std::string local, remote, interface;
    uint32_t index = 0;
    traffic_count in, out;
    uint64_t fragments = 0;
    refused_counts refused;
    sorted_counts sorted;
};
struct traffic_intercept {
    int group = 0;
    std::string proxy, proxy_reason; // "up", "down", "unknown"; of the last failed check
    uint64_t proxy_ms = 0;           // how long it has been in this state
    bool active = true;              // no role keeps new flows from the proxy
    bool left = false;               // the group is out of its routers
    int64_t flows = -1;              // of the proxy; -1 unknown
    bool overloaded = false;         // new flows are returned for that
    uint32_t weight_percent = 100;   // announced; less during a slow start
    sorted_counts sorted;
};
// A group that is being emptied, or has been, at an operator's request.
struct traffic_drain {
    int group = 0;
    std::string state;  // "draining", "drained", "over": it has left with flows
    int64_t flows = -1; // still open; -1 unknown
    int64_t until = 0;  // seconds since 1970
    std::string since;  // a time
};
// Packets of flows that other appliances have: passed on to them, or received from them.
struct protection_counts {
    uint64_t passed = 0, received = 0, delivered = 0, returned = 0; // packets
};
struct protected_group {
    int group = 0;
    bool covered = false;
    std::string reason; // why it isn't
    uint32_t slots = 0; // whose packets are passed on
};
struct protection_state {
    uint32_t time = 0; // seconds, 0: switched off
    protection_counts sum;
    std::vector<protected_group> groups;              // by group
    std::map<std::string, protection_counts> members; // by address
};
enum class tunneld_condition { running, silent, absent };
struct traffic_state {
    tunneld_condition tunneld = tunneld_condition::absent; // the rest of its answers is empty unless running
    std::string plane, plane_reason;
    std::string lack, failure; // why packets cannot be sorted; what could not be changed in the kernel
    uint64_t own = 0;          // redirected packets of this appliance itself
    uint64_t clamped = 0;      // SYN-ACKs
    refused_counts refused;
    std::map<std::string, uint64_t> refused_sources;  // packets by address, REFUSED_SOURCES_MAX at most
    std::map<std::string, int64_t> first_ms, last_ms; // how long ago something has occurred, by what
    std::vector<traffic_tunnel> tunnels;              // by id
    std::vector<traffic_intercept> intercepts;        // by group
    protection_state protection;
    // From mgmtd, without tunneld as well:
    std::map<std::string, std::string>
        accepted;                    // sources beside the routers; only beside this one, "" for all
    std::map<int, std::string> left; // why a group is out of its routers, by group
    std::map<int, std::string> left_since;
    std::vector<traffic_drain> drains; // by group
};

// Reads a node below NODE_DRAINS; `parts` are those of its name below.
void take_drain(const std::vector<std::string> &parts, const std::string &value,
                std::vector<traffic_drain> *inout);
// False: no answer.
bool gather_traffic(const ctl_ask &ask, traffic_state *out);

// What can become of a packet, in the order in which it is shown.
struct sorted_way {
    const char *word, *shown;
};
const std::vector<sorted_way> &sorted_ways();
// "in 120  to proxy 100  ...": packets; those that are zero are left out, except for the first three.
std::string sorted_text(const sorted_counts &counts);
std::string proxy_text(const traffic_intercept &intercept);   // "proxy up 0:10:40"
std::string protection_text(const protection_counts &counts); // "passed on 12  received 3  ..."
const char *tunneld_word(tunneld_condition condition);        // "running", "silent", "absent"

std::string drain_text(const traffic_drain &drain, int64_t now); // "draining, 12 flows left, ..."

// Why traffic does not go where an operator expects it.
struct traffic_reason {
    std::string word;                    // "own-traffic", "refused-source", ...: a code of reasons.h
    int group;                           // -1: of the whole appliance
    std::string text;                    // one line, without counts
    std::string who = {}, detail = {};   // the address in the text; values that change all the time
    uint64_t count = 0;                  // packets; 0: a state
    int64_t first_ms = -1, last_ms = -1; // how long ago; -1: unknown
};
std::vector<traffic_reason> traffic_reasons(const traffic_state &state);

// 12345 as "12345", from 100000 on as "123k", "4.5M".
std::string count_text(uint64_t count);
