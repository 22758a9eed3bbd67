// Checks values that are addresses, prefixes, or lists of ports or prefixes. Each function brings the text
// into its canonical form and gives null, or gives the reason why it is refused, which continues a sentence
// that begins with the text.
#pragma once

#include <cstddef>
#include <string>

constexpr size_t LIST_MAX_ENTRIES = 64;     // of a list, after overlapping entries are merged
constexpr size_t REFUSED_SOURCES_MAX = 256; // addresses for which a data plane counts refused packets

// "all", or ports and ranges separated by blanks, "80 443 8000-8080". They are sorted, and ranges are merged.
const char *check_ports(std::string *inout);
// Prefixes separated by blanks; an address is a prefix of length 32. They are sorted, and those that are part
// of another one are removed.
const char *check_prefixes(std::string *inout);
// One prefix, with host bits of zero.
const char *check_prefix(std::string *inout);
// The address of a single host.
const char *check_host_address(std::string *inout);
// An address as above, or 0.0.0.0.
const char *check_host_address_or_none(std::string *inout);
