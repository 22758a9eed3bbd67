// Whether the packet filter lets the protocol's packets through, from a listing of its rules.
#pragma once

#include <string>

#include <nlohmann/json_fwd.hpp>

// A first packet between router and appliance: UDP from and to port 2048, or GRE.
struct filtered_packet {
    bool gre = false;
    bool outgoing = false;
    std::string interface; // empty: any, what depends on it is unclear
};
enum class filter_result { passes, unclear, drops };
struct filter_finding {
    filter_result result = filter_result::passes;
    std::string chain; // "inet filter input", that decides; empty when the packet passes
};
// `objects`: what is in "nftables" of "nft --json list ruleset". A rule with a condition that is not
// understood, or that depends on more than the packet above, makes the result unclear where it matters.
// tunneld's own table is left out.
filter_finding judge_packet(const nlohmann::json &objects, const filtered_packet &packet);
