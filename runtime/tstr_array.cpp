#include "runtime/tstr_array.h"

#include <cstring>

#include "runtime/guards.h"

namespace {

lc_status dup_for_array(const void *element, void **out_copy) {
    tstring *copy = nullptr;
    CHECK_STATUS(ts_dup(static_cast<const tstring *>(element), &copy));
    *out_copy = copy;
    return LC_OK;
}
void free_for_array(void *element) {
    ts_release(static_cast<tstring *>(element));
}
int compare_for_array(const void *a, const void *b) {
    return ts_cmp(*static_cast<const tstring *const *>(a), *static_cast<const tstring *const *>(b));
}
void string_options(array_options *options) {
    options->compare = compare_for_array;
    options->duplicate = dup_for_array;
    options->free = free_for_array;
}

} // namespace

TYPED_ARRAY_DEFINE(tstr_array, tstring *, string_options)

lc_status tstr_array_new(tstr_array **out, const tstr_array_options *options) {
    array_options all;
    CHECK_STATUS(array_options_get_defaults(&all));
    string_options(&all);
    if (options)
        all.duplicate_policy = options->duplicate_policy;
    return tstr_array_new_full(out, &all);
}

namespace {

// The start of the allocation of a packed array, followed by the slots, the string records and the texts. The
// family's record comes first: freeing it frees everything.
struct packed {
    tstr_array family;
    array list;
};

} // namespace

lc_status tstr_array_new_packed(tstr_array **out, uint32_t count, size_t text_bytes, tstring **out_records,
                                char **out_text) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_CONDITION(count > 0 && count <= array_size_max);
    array_options options;
    CHECK_STATUS(array_options_get_defaults(&options));
    string_options(&options);
    // Slots and records need the alignment of a pointer. The texts, which need none, come last.
    const size_t slots = sizeof(packed), records = slots + count * sizeof(void *);
    const size_t texts = records + count * sizeof(tstring);
    auto *memory = static_cast<uint8_t *>(malloc(texts + text_bytes));
    CHECK_NULL(memory);
    auto *head = reinterpret_cast<packed *>(memory);
    auto **elements = reinterpret_cast<void **>(memory + slots);
    *out_records = reinterpret_cast<tstring *>(memory + records);
    *out_text = reinterpret_cast<char *>(memory + texts);
    for (uint32_t i = 0; i < count; i++)
        elements[i] = *out_records + i;
    array_place(&head->list, &options, elements, count);
    head->family.list = &head->list;
    *out = &head->family;
    return LC_OK;
}

lc_status tstr_array_get_str(const tstr_array *array, uint32_t index, const char **out_text) {
    CHECK_NULL(out_text);
    *out_text = nullptr;
    tstring *string = nullptr;
    CHECK_QUIET(tstr_array_get(array, index, &string));
    *out_text = ts_str_maybe(string);
    return LC_OK;
}
const char *tstr_array_get_str_quick(const tstr_array *array, uint32_t index) {
    return ts_str_maybe(tstr_array_get_quick(array, index));
}
lc_status tstr_array_append_str(tstr_array *array, const char *text) {
    owned<tstring, ts_release> string;
    CHECK_STATUS(ts_new_str(&string.pointer, text));
    return tstr_array_append_takeover(array, &string.pointer);
}
lc_status tstr_array_append_str_takeover(tstr_array *array, char **inout_text) {
    CHECK_NULL(array);
    owned<tstring, ts_release> string;
    CHECK_STATUS(ts_new_str_takeover(&string.pointer, inout_text, -1, -1));
    const lc_status status = tstr_array_append_takeover(array, &string.pointer);
    if (status != LC_OK && string.pointer) // back to the caller
        LOG_STATUS(ts_detach(&string.pointer, inout_text, nullptr));
    return status;
}
lc_status tstr_array_insert_str(tstr_array *array, uint32_t index, const char *text) {
    owned<tstring, ts_release> string;
    CHECK_STATUS(ts_new_str(&string.pointer, text));
    return tstr_array_insert_takeover(array, index, &string.pointer);
}

lc_status tstr_array_wildcard_match(const tstr_array *pattern, const tstr_array *parts, int *out_matched) {
    CHECK_NULL(out_matched);
    *out_matched = 0;
    const uint32_t pattern_count = tstr_array_length_quick(pattern);
    const uint32_t count = tstr_array_length_quick(parts);
    if (pattern_count == 0 || count == 0) {
        *out_matched = pattern_count == count;
        return LC_OK;
    }
    // Even a final "**" needs at least one part.
    if (pattern_count > count)
        return LC_OK;
    for (uint32_t i = 0; i < pattern_count; i++) {
        const tstring *wanted = tstr_array_get_quick(pattern, i);
        if (ts_equal(wanted, tstr_array_get_quick(parts, i)) || ts_equal_str(wanted, "*", 0))
            continue;
        // "**" matches all parts from here on. What follows it in the pattern isn't compared any more.
        *out_matched = ts_equal_str(wanted, "**", 0);
        return LC_OK;
    }
    *out_matched = pattern_count == count;
    return LC_OK;
}
