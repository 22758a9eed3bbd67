// The sorting rules as text for nftables: the content of the table, and the transaction that changes one
// content into another. Nothing here talks to the kernel.
#pragma once

#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "peers/tunneld/wanted_state.h"

// A set, or a map if its elements have values. Declaration, keys and values are in the syntax of nftables.
struct nft_set {
    std::string declaration;
    std::map<std::string, std::string> elements;
    bool filled_by_rules = false; // at run time: transactions don't touch its elements
    bool operator==(const nft_set &) const = default;
};
struct nft_chain {
    std::string declaration; // "" for a chain without a hook
    std::vector<std::string> rules;
    bool operator==(const nft_chain &) const = default;
};
// The content of the table. An empty one means that there is no table.
struct nft_content {
    bool known = true; // false: left by an earlier tunneld; only names and types are known
    std::set<std::string> counters;
    std::map<std::string, nft_chain> chains;
    std::map<std::string, nft_set> sets;
    bool operator==(const nft_content &) const = default;
    bool empty() const { return counters.empty() && chains.empty() && sets.empty(); }
};

// Names of counters are "interface/wccp0/returned", "group/51/to_proxy", "fragments/10.0.0.101/10.0.0.1"
// (local and remote end), and this one.
inline constexpr const char *CLAMPED_COUNTER = "clamped";
// Sets that are read back: pairs of source and destination.
inline constexpr const char *REFUSED_SET = "refused_sources"; // filled by a rule
inline constexpr const char *ENDS_SET = "ends";               // elements "REMOTE . LOCAL"

// False when a name or number is not safe to be part of a command.
bool make_sorting_content(const wanted_sorting &wanted, nft_content *out, std::string *out_error);
// "" when there is no difference. Counters in both contents keep their values.
std::string make_sorting_transaction(const nft_content &before, const nft_content &after);
