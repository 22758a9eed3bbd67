// The rules that sort redirected packets: to the proxy, back to the router, on by the routing table, or
// nowhere. One nftables table of ours, changed by transactions: at each moment either the old rules hold or
// the new ones.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "peers/tunneld/wanted_state.h"

struct packet_count {
    uint64_t packets = 0, bytes = 0;
};
// What became of redirected packets.
enum sorted_as : uint8_t {
    SORTED_IN,       // all that came in by the interface
    SORTED_TO_PROXY, // to a transparent socket, or handed to the proxy as a new flow
    SORTED_BYPASSED,
    SORTED_RETURNED, // nobody wanted it
    SORTED_DOWN,     // wanted, but the proxy is down (by the intercept's `down`) or the group not active
                     // (returned)
    SORTED_FORWARDED,
    SORTED_DROPPED,
    SORTED_OWN,      // the appliance's own traffic, redirected to itself
    SORTED_PASSED,   // of a flow that another appliance has
    SORTED_OVERLOAD, // wanted, but the proxy has as many flows as it may have: returned
    SORTED_WAYS
};
extern const char *const sorted_words[SORTED_WAYS]; // "in", "to_proxy", ...
struct sorting_counters {
    std::map<std::string, packet_count[SORTED_WAYS]> interfaces; // links and L2 interfaces
    // With an intercept: what its rules have decided. Packets of a flow that the proxy already has, and
    // those that only the interface is known of, are counted by the interface alone. `in` is the sum.
    std::map<uint8_t, packet_count[SORTED_WAYS]> groups;
    std::map<tunnel_ends, uint64_t> fragments; // outer fragments by their ends
    std::map<uint32_t, uint64_t>
        refused_sources;  // GRE to one of our ends from no router of ours (kernel plane)
    uint64_t clamped = 0; // SYN-ACKs
};

// Counters of objects that stay keep their values. The first call of a process takes over what an earlier one
// has left. False: the old rules hold, and the error is one line. None of these is for several threads.
bool apply_sorting_rules(const wanted_sorting &wanted, std::string *out_error);
// Nothing left to do is no error.
bool remove_sorting_rules(std::string *out_error);
// Costs about as much as 30 ms of processor time with 256 intercepts. Without a table there are no counters.
bool read_sorting_counters(sorting_counters *out, std::string *out_error);
// What a kernel lacks for the rules, or "".
std::string probe_sorting_rules();
