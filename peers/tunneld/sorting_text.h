// The sorting rules as text for nftables: what the table should hold, and the transaction that takes it from
// one content to another. Nothing here speaks to the kernel.
#pragma once

#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "peers/tunneld/wanted_state.h"

// A set, or a map when its elements have values. Elements by key, both as nftables reads them.
struct nft_set {
    std::string declaration;
    std::map<std::string, std::string> elements;
    bool filled_by_rules = false; // at run time: its elements are left alone
    bool operator==(const nft_set &) const = default;
};
struct nft_chain {
    std::string declaration; // "" for a chain without a hook
    std::vector<std::string> rules;
    bool operator==(const nft_chain &) const = default;
};
// Content of the table. Empty: there is no table.
struct nft_content {
    bool known = true; // false: only the names are known, of what an earlier tunneld has left
    std::set<std::string> counters;
    std::map<std::string, nft_chain> chains;
    std::map<std::string, nft_set> sets;
    bool operator==(const nft_content &) const = default;
    bool empty() const { return counters.empty() && chains.empty() && sets.empty(); }
};

// Names of counters: "interface/NAME/WAY", "group/NUMBER/WAY", "fragments/LOCAL/REMOTE", and this one.
inline constexpr const char *CLAMPED_COUNTER = "clamped";
// Sets that are read as well: pairs of source and destination.
inline constexpr const char *REFUSED_SET = "refused_sources"; // filled by a rule
inline constexpr const char *ENDS_SET = "ends";               // elements "REMOTE . LOCAL"

// False: a name or a number that must not reach nftables.
bool make_sorting_content(const wanted_sorting &wanted, nft_content *out, std::string *out_error);
// "" when there is no difference. Counters that are in both keep their values.
std::string make_sorting_transaction(const nft_content &before, const nft_content &after);
