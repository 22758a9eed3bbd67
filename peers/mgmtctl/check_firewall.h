// Whether the packet filter lets the protocol's packets through, from a listing of its rules.
#pragma once

#include <string>

#include "peers/mgmtctl/ctl_json.h"

// A first packet between router and appliance: UDP from and to port 2048, or GRE.
struct filtered_packet {
    bool gre = false;
    bool outgoing = false;
    std::string interface; // empty: any; a condition on it is unclear then
};
enum class filter_result { passes, unclear, drops };
struct filter_finding {
    filter_result result = filter_result::passes;
    std::string chain; // "inet filter input", that decides; empty when the packet passes
};
// `objects`: the array "nftables" of "nft --json list ruleset". A condition that is not understood, or that
// depends on more than the packet above, makes the result unclear if it could change the verdict. tunneld's
// own table is left out.
filter_finding judge_packet(const ctl_json &objects, const filtered_packet &packet);
