// Arrays of strings. An array owns its strings; ts_cmp orders them.
#pragma once

#include <cstdint>

#include "runtime/tstring.h"
#include "runtime/typed_arrays.h"

struct tstr_array_options {
    uint32_t duplicate_policy; // array_dup_...
};

TYPED_ARRAY_DECLARE(tstr_array, tstring *)
lc_status tstr_array_new(tstr_array **out, const tstr_array_options *options); // null: duplicates are allowed
// An array of `count` strings, at least one, in a single allocation that has room for `text_bytes` bytes of
// text as well. The caller fills each of the `count` records at `out_records` with ts_place, with text in the
// bytes at `out_text`.
lc_status tstr_array_new_packed(tstr_array **out, uint32_t count, size_t text_bytes, tstring **out_records,
                                char **out_text);

// The array keeps the text: it is valid until the string is changed or removed.
lc_status tstr_array_get_str(const tstr_array *array, uint32_t index, const char **out_text);
const char *tstr_array_get_str_quick(const tstr_array *array, uint32_t index); // null on a miss
lc_status tstr_array_append_str(tstr_array *array, const char *text);
// Takes over a text in memory of malloc(); on failure it stays the caller's.
lc_status tstr_array_append_str_takeover(tstr_array *array, char **inout_text);
lc_status tstr_array_insert_str(tstr_array *array, uint32_t index, const char *text);

// Matches the parts of a name with those of a pattern. "*" matches exactly one part of any content. "**"
// matches one or more parts and ends the comparison: what follows it in the pattern only counts as parts that
// the name must have at least; therefore "/a/**/b" matches "/a/x/y". "*" as a piece of a longer part is an
// ordinary character.
lc_status tstr_array_wildcard_match(const tstr_array *pattern, const tstr_array *parts, int *out_matched);
