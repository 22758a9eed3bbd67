// The rules that sort redirected packets: to the proxy, back to the router, to the main routing table, or
// dropped. They are one nftables table, which is changed by transactions: at each moment either all of the
// old rules or all of the new ones are in force.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "peers/tunneld/wanted_state.h"

struct packet_count {
    uint64_t packets = 0, bytes = 0;
};
// How redirected packets are sorted.
enum sorted_as : uint8_t {
    SORTED_IN,       // all that arrived at the interface
    SORTED_TO_PROXY, // to a transparent socket, or to the proxy as a new flow
    SORTED_BYPASSED,
    SORTED_RETURNED, // no intercept wants it
    SORTED_DOWN,     // wanted, but the proxy is down (returned or dropped) or the group not active (returned)
    SORTED_FORWARDED,
    SORTED_DROPPED,
    SORTED_OWN,      // sent by this appliance and redirected to it: returned
    SORTED_PASSED,   // passed on to another appliance, which may have the flow
    SORTED_OVERLOAD, // wanted, but the proxy has more flows than its limit: returned
    SORTED_WAYS
};
extern const char *const sorted_words[SORTED_WAYS]; // "in", "to_proxy", ...
struct sorting_counters {
    std::map<std::string, packet_count[SORTED_WAYS]> interfaces; // links and L2 interfaces
    // By group with an intercept: the packets that its own rules have sorted, SORTED_IN being their sum.
    // Packets of a flow that the proxy already has, and those that no group's rules see, are counted by
    // interface only.
    std::map<uint8_t, packet_count[SORTED_WAYS]> groups;
    std::map<tunnel_ends, uint64_t> fragments; // outer fragments
    std::map<uint32_t, uint64_t>
        refused_sources;  // with the plane `kernel`: GRE that is from no router, by source
    uint64_t clamped = 0; // SYN-ACKs whose MSS was reduced
};

// These functions are to be used by one thread only. Errors are one line.
//
// Brings the table to the wanted content. Counters that exist before and after keep their values. The first
// call of a process takes over the table of an earlier process. False: the old rules are still in force.
bool apply_sorting_rules(const wanted_sorting &wanted, std::string *out_error);
// True also when there is no table.
bool remove_sorting_rules(std::string *out_error);
// Takes up to 30 ms of processor time with 256 intercepts. Without a table the result is empty.
bool read_sorting_counters(sorting_counters *out, std::string *out_error);
// What the rules need and the kernel lacks, for the log, or "".
std::string probe_sorting_rules();
