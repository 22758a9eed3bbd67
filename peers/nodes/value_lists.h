// Texts of nodes that are more than one number or word: addresses, prefixes, and lists of ports and prefixes.
// Each function gives null and brings the text into its one form, or gives the reason why it is refused,
// which goes after the text.
#pragma once

#include <cstddef>
#include <string>

constexpr size_t LIST_MAX_ENTRIES = 64;     // of a list, once overlapping entries are merged
constexpr size_t REFUSED_SOURCES_MAX = 256; // addresses that a data plane counts refused packets by

// "all", or ports and ranges separated by blanks: "80 443 8000-8080". Kept sorted, with ranges merged.
const char *check_ports(std::string *inout);
// Prefixes separated by blanks; an address alone is one of length 32. Kept sorted, without those that are
// inside another.
const char *check_prefixes(std::string *inout);
// One prefix, whose host bits are zero.
const char *check_prefix(std::string *inout);
// The address of a single host.
const char *check_host_address(std::string *inout);
// The same, or 0.0.0.0.
const char *check_host_address_or_none(std::string *inout);
