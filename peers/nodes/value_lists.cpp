#include "peers/nodes/value_lists.h"

#include <algorithm>
#include <cstdint>
#include <sstream>
#include <vector>

#include "mgmt/bnode_types.h"
#include "mgmt/owners.h"

namespace {

struct number_range { // inclusive
    uint32_t first, last;
    bool operator<(const number_range &other) const { return first < other.first; }
};

std::vector<std::string> split_words(const std::string &text) {
    std::istringstream in(text);
    std::vector<std::string> out;
    for (std::string word; in >> word;)
        out.push_back(word);
    return out;
}

std::string join_words(const std::vector<std::string> &words) {
    std::string out;
    for (const std::string &word : words)
        out += (out.empty() ? "" : " ") + word;
    return out;
}

// --- Ports

bool parse_port(const std::string &text, uint32_t *out) {
    // Five digits at most, so that stoul can't overflow.
    if (text.empty() || text.size() > 5 || text.find_first_not_of("0123456789") != std::string::npos)
        return false;
    *out = static_cast<uint32_t>(std::stoul(text));
    return *out >= 1 && *out <= UINT16_MAX;
}

bool parse_range(const std::string &word, number_range *out) {
    const size_t dash = word.find('-');
    if (!parse_port(word.substr(0, dash), &out->first))
        return false;
    out->last = out->first;
    return dash == std::string::npos || parse_port(word.substr(dash + 1), &out->last);
}

} // namespace

const char *check_ports(std::string *inout) {
    const std::vector<std::string> words = split_words(*inout);
    if (words.size() == 1 && words[0] == "all") {
        *inout = words[0];
        return nullptr;
    }
    std::vector<number_range> ranges, merged;
    for (const std::string &word : words) {
        number_range range = {};
        if (!parse_range(word, &range))
            return "is not a list of ports: write \"all\", or ports and ranges from 1 to 65535 such as 80 "
                   "8000-8080";
        // Not exchanged silently: it is more likely a mistyped number.
        if (range.first > range.last)
            return "has a range whose first port is greater than its last";
        ranges.push_back(range);
    }
    std::sort(ranges.begin(), ranges.end());
    for (const number_range &range : ranges)
        // Adjacent ranges are merged too. The numbers are 32 bits wide, and 65535 + 1 is no overflow.
        if (!merged.empty() && range.first <= merged.back().last + 1)
            merged.back().last = std::max(merged.back().last, range.last);
        else
            merged.push_back(range);
    // Counted after the merge: a long list may have few ranges.
    if (merged.size() > LIST_MAX_ENTRIES)
        return "has more than 64 ranges";
    std::vector<std::string> kept;
    kept.reserve(merged.size());
    for (const auto &[first, last] : merged)
        kept.push_back(std::to_string(first) + (last == first ? "" : "-" + std::to_string(last)));
    *inout = join_words(kept);
    return nullptr;
}

// --- Prefixes

namespace {

const char *const NO_PREFIX = "is no IPv4 prefix such as 10.0.0.0/8";
const char *const NO_PREFIXES = "is not a list of IPv4 prefixes such as 10.0.0.0/8 192.0.2.1/32";
const char *const HOST_BITS = "has host bits that are not zero; write the address of the network, "
                              "such as 10.0.0.0/8, or /32 for a host";

std::string format_prefix(const number_range &range) {
    owned_text out;
    // Exact because the range came from a prefix: its size is a power of two.
    const uint32_t mask = ~(range.last - range.first);
    // The library's prefix is the address in the upper and the mask in the lower 32 bits.
    return lc_ipv4prefix_to_str(uint64_t{range.first} << 32 | mask, &out.pointer) == LC_OK ? out.pointer : "";
}

const char *parse_prefix(const std::string &word, const char *otherwise, number_range *out) {
    uint64_t prefix = 0;
    if (lc_str_to_ipv4prefix(word.c_str(), &prefix) != LC_OK)
        return otherwise;
    const auto mask = static_cast<uint32_t>(prefix);
    out->first = static_cast<uint32_t>(prefix >> 32);
    out->last = out->first | ~mask;
    return (out->first & ~mask) == 0 ? nullptr : HOST_BITS;
}

} // namespace

const char *check_prefix(std::string *inout) {
    number_range range = {};
    if (const char *reason = parse_prefix(*inout, NO_PREFIX, &range))
        return reason;
    *inout = format_prefix(range);
    return nullptr;
}

const char *check_prefixes(std::string *inout) {
    std::vector<number_range> all;
    for (const std::string &word : split_words(*inout)) {
        number_range range = {};
        const bool bare = word.find('/') == std::string::npos;
        if (const char *reason = parse_prefix(bare ? word + "/32" : word, NO_PREFIXES, &range))
            return reason;
        all.push_back(range);
    }
    // Two prefixes never overlap in part: either they are disjoint, or one contains the other. Of two that
    // begin with the same address the wider one is sorted first.
    std::sort(all.begin(), all.end(), [](const number_range &a, const number_range &b) {
        return a.first != b.first ? a.first < b.first : a.last > b.last;
    });
    std::vector<std::string> kept;
    const number_range *outer = nullptr;
    for (const number_range &range : all) {
        if (outer && range.last <= outer->last)
            continue;
        kept.push_back(format_prefix(range));
        outer = &range;
    }
    if (kept.size() > LIST_MAX_ENTRIES)
        return "has more than 64 prefixes";
    *inout = join_words(kept);
    return nullptr;
}

// --- Addresses

const char *check_host_address(std::string *inout) {
    uint32_t address = 0;
    if (lc_str_to_ipv4addr(inout->c_str(), &address) != LC_OK)
        return "is no IPv4 address such as 10.0.0.1";
    const uint32_t first = address >> 24;
    // Unspecified, loopback, and from 224 multicast and reserved.
    return first == 0 || first == 127 || first >= 224 ? "is not the address of another host" : nullptr;
}

const char *check_host_address_or_none(std::string *inout) {
    return *inout == "0.0.0.0" ? nullptr : check_host_address(inout);
}
