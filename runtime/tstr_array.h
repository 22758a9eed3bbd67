// Arrays of strings. They own their strings and compare them with ts_cmp.
#pragma once

#include <cstdint>

#include "runtime/tstring.h"
#include "runtime/typed_arrays.h"

struct tstr_array_options {
    uint32_t duplicate_policy; // array_dup_...
};

TYPED_ARRAY_DECLARE(tstr_array, tstring *)
lc_status tstr_array_new(tstr_array **out, const tstr_array_options *options); // null: duplicates are allowed
// An array of `count` strings, at least one, in a single allocation with room for `text_bytes` bytes of text.
// The caller makes each of the `out_records` with ts_place, with a text that begins at or after `out_text`.
lc_status tstr_array_new_packed(tstr_array **out, uint32_t count, size_t text_bytes, tstring **out_records,
                                char **out_text);

// Texts live as long as the array holds them.
lc_status tstr_array_get_str(const tstr_array *array, uint32_t index, const char **out_text);
const char *tstr_array_get_str_quick(const tstr_array *array, uint32_t index); // null on a miss
lc_status tstr_array_append_str(tstr_array *array, const char *text);
lc_status tstr_array_append_str_takeover(tstr_array *array, char **inout_text); // a heap text
lc_status tstr_array_insert_str(tstr_array *array, uint32_t index, const char *text);

// "*" matches one whole part, "**" for one or more, and what follows it in the pattern doesn't count.
lc_status tstr_array_wildcard_match(const tstr_array *pattern, const tstr_array *parts, int *out_matched);
