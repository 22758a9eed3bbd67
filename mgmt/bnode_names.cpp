// Names and patterns. A search compares a pattern with each name of an array; therefore bn_pattern_matches
// works on the text of the name directly and allocates nothing. tstr_array_wildcard_match does the same on
// parts; the two must agree, which a test checks for all short names and patterns.
#include "mgmt/bnode_names.h"

#include <cstdlib>
#include <cstring>

#include "runtime/guards.h"

constexpr char SEPARATOR = '/', ESCAPE = '\\';

const char *bn_part_end(const char *part) {
    // An escaped character is skipped together with its backslash; it may be a separator.
    for (; *part && *part != SEPARATOR; part++)
        part += bn_escapes(part);
    return part;
}

namespace {

// Copies a part without its escapes, and adds a NUL. Returns the number of characters.
uint32_t copy_part(const char *part, const char *end, char *out) {
    char *at = out;
    for (; part < end; part++) {
        part += bn_escapes(part);
        *at++ = *part;
    }
    *at = 0;
    return static_cast<uint32_t>(at - out);
}
// The number of parts of a name, without a leading separator; at least 1.
uint32_t parts_from(const char *name) {
    uint32_t count = 1;
    for (name = bn_part_end(name); *name; name = bn_part_end(name + 1))
        count++;
    return count;
}

} // namespace

lc_status bn_binding_name_to_parts(const char *name, tstr_array **out_parts, int *out_absolute) {
    CHECK_NULL(out_parts);
    *out_parts = nullptr;
    CHECK_NULL(name);
    const bool absolute = name[0] == SEPARATOR;
    if (out_absolute)
        *out_absolute = absolute;
    const char *part = name + absolute;
    if (!*part)
        return tstr_array_new(out_parts, nullptr);
    // Each part takes its length and a NUL, where the name has its length and a separator: at most as much in
    // all.
    const size_t length = strlen(part);
    CHECK_CONDITION(length < ts_size_max);
    const uint32_t count = parts_from(part);
    tstring *records = nullptr;
    char *text = nullptr;
    CHECK_STATUS(tstr_array_new_packed(out_parts, count, length + 1, &records, &text));
    for (uint32_t i = 0; i < count; i++) {
        const char *end = bn_part_end(part);
        const uint32_t copied = copy_part(part, end, text);
        ts_place(&records[i], text, static_cast<int32_t>(copied));
        text += copied + 1;
        // After the last part this is past the NUL, and isn't used any more.
        part = end + 1;
    }
    return LC_OK;
}
lc_status bn_binding_name_parts_to_name_tstr(const tstr_array *parts, int absolute, tstring **out) {
    CHECK_STATUS(ts_join_tokens(parts, SEPARATOR, ESCAPE, 0, absolute ? uint32_t{ts_join_leading} : 0, out));
    return LC_OK;
}
lc_status bn_binding_name_parts_to_name(const tstr_array *parts, int absolute, char **out_text) {
    CHECK_NULL(out_text);
    *out_text = nullptr;
    tstring *name = nullptr;
    CHECK_STATUS(bn_binding_name_parts_to_name_tstr(parts, absolute, &name));
    CHECK_STATUS(ts_detach(&name, out_text, nullptr));
    return LC_OK;
}

// --- Patterns

lc_status bn_pattern_init(bn_pattern *pattern, const char *text) {
    CHECK_STATUS(bn_binding_name_to_parts(text, &pattern->parts, &pattern->absolute));
    return LC_OK;
}
bn_pattern::~bn_pattern() {
    (void)tstr_array_free(&parts);
}

namespace {

bool part_equals(const char *name, const char *end, const tstring *part) {
    const char *wanted = part->buffer;
    for (; name < end; name++, wanted++) {
        name += bn_escapes(name);
        if (*name != *wanted)
            return false;
    }
    return *wanted == 0;
}
bool is_text(const tstring *part, const char *text) {
    return strcmp(part->buffer, text) == 0;
}

} // namespace

bool bn_pattern_matches(const bn_pattern *pattern, const char *name) {
    const uint32_t wanted_count = tstr_array_length_quick(pattern->parts);
    if ((*name == SEPARATOR) != (pattern->absolute != 0))
        return false;
    name += *name == SEPARATOR;
    // Without parts on one side, both must be without.
    if (!*name || !wanted_count)
        return !*name && !wanted_count;
    for (uint32_t i = 0; i < wanted_count; i++) {
        const tstring *wanted = tstr_array_get_quick(pattern->parts, i);
        const char *end = bn_part_end(name);
        // "**" matches the rest, if that has at least as many parts as the rest of the pattern.
        if (!part_equals(name, end, wanted) && !is_text(wanted, "*"))
            return is_text(wanted, "**") && wanted_count - i <= parts_from(name);
        if (!*end)
            return i + 1 == wanted_count;
        name = end + 1;
    }
    return false;
}
bool bn_pattern_literal_start(const bn_pattern *pattern, tstring **out) {
    *out = nullptr;
    owned<tstring, ts_release> start;
    if (ts_new_str(&start.pointer, pattern->absolute ? "/" : "") != LC_OK)
        return false;
    for (uint32_t i = 0; i < tstr_array_length_quick(pattern->parts); i++) {
        const tstring *part = tstr_array_get_quick(pattern->parts, i);
        // A part with a wildcard, or one that is written with escapes in a name, ends the literal text.
        if (strpbrk(part->buffer, "*\\/"))
            break;
        if (i > 0 && ts_append_char(start.pointer, SEPARATOR) != LC_OK)
            return false;
        if (ts_append(start.pointer, part) != LC_OK)
            return false;
    }
    *out = start.take();
    return true;
}

int bn_binding_name_pattern_match(const char *name, const char *pattern) {
    bn_pattern made;
    if (!name || !pattern || bn_pattern_init(&made, pattern) != LC_OK)
        return 0;
    return bn_pattern_matches(&made, name);
}
int bn_binding_name_parts_pattern_match(const tstr_array *parts, int absolute, const char *pattern) {
    bn_pattern made;
    int matched = 0;
    if (!pattern || bn_pattern_init(&made, pattern) != LC_OK || !absolute != !made.absolute)
        return 0;
    return tstr_array_wildcard_match(made.parts, parts, &matched) == LC_OK && matched;
}
