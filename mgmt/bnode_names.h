// Patterns that are split once and matched with many names. For mgmt/bnode_*.cpp only.
#pragma once

#include "mgmt/bnode.h"

struct bn_pattern {
    tstr_array *parts = nullptr;
    int absolute = 0;
    bn_pattern() = default;
    bn_pattern(const bn_pattern &) = delete;
    bn_pattern &operator=(const bn_pattern &) = delete;
    ~bn_pattern();
};
lc_status bn_pattern_init(bn_pattern *pattern, const char *text);
// The same result as splitting the name and calling tstr_array_wildcard_match, but without allocating
// anything.
bool bn_pattern_matches(const bn_pattern *pattern, const char *name);
// The literal text that every matching name begins with, for the caller to free. False if there is no memory
// for it.
bool bn_pattern_literal_start(const bn_pattern *pattern, tstring **out);

// The separator that ends the part which begins at `part`, or the end of the name.
const char *bn_part_end(const char *part);
// Whether `at` is a backslash that escapes the next character.
inline bool bn_escapes(const char *at) {
    return at[0] == '\\' && (at[1] == '\\' || at[1] == '/');
}

// The number of calls of bn_binding_set_name, see bnode.cpp.
extern std::atomic<uint32_t> bn_binding_renames;
