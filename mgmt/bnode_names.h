// Patterns split once and matched against many names.
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
// As splitting the name and tstr_array_wildcard_match.
bool bn_pattern_matches(const bn_pattern *pattern, const char *name);
// What every matching name begins with. False without memory.
bool bn_pattern_literal_start(const bn_pattern *pattern, tstring **out);

// The end of the part that begins at `part`: a separator or the end of the name.
const char *bn_part_end(const char *part);
// Whether a backslash here escapes the next character.
inline bool bn_escapes(const char *at) {
    return at[0] == '\\' && (at[1] == '\\' || at[1] == '/');
}

extern std::atomic<uint32_t> bn_binding_renames;
