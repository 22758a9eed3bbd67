// The one sequence of the management code: word-sized elements with functions that compare, copy and free
// them, and a policy for duplicates. The typed arrays of typed_arrays.h are covers over it.
//
// An array knows whether its elements are in order: appending keeps that as long as the new element doesn't
// sort before the last, array_set gives it up, array_sort brings it back.
#pragma once

#include <atomic>
#include <cstdint>

#include "runtime/common.h"

using array_compare_function = int (*)(const void *a, const void *b); // pointers to the two slots
using array_duplicate_function = lc_status (*)(const void *element, void **out_copy);
using array_takeover_function = lc_status (*)(void **inout_element, void **out_slot);
using array_free_function = void (*)(void *element);
using array_hash_function = uint32_t (*)(const void *element);

enum : uint32_t {
    array_dup_allow = 1,
    array_dup_replace = 2, // the old one is deleted
    array_dup_drop = 3,    // the new one is freed, result 0
    array_dup_refuse = 4,  // LC_EXISTS
};
constexpr uint32_t array_size_max = 0x7ffffffe;

struct array_options {
    uint32_t initial_size;
    array_compare_function compare;
    array_duplicate_function duplicate; // null: elements can't be copied
    array_takeover_function takeover;
    array_free_function free;
    uint32_t duplicate_policy;
    uint32_t require_sorted;
    // Optional: a hash of what `compare` calls equal. array_best_search then answers on a large array that is
    // not sorted from an index that it keeps. `key_changes` counts changes of keys inside elements.
    array_hash_function hash;
    const std::atomic<uint32_t> *key_changes;
};

struct array_index;
struct array {
    uint32_t capacity;
    uint32_t initial_size;
    uint32_t length;
    uint32_t sorted;
    uint32_t require_sorted;
    uint32_t duplicate_policy;
    void **elements;
    array_compare_function compare;
    array_duplicate_function duplicate;
    array_takeover_function takeover;
    array_free_function free;
    array_hash_function hash;
    const std::atomic<uint32_t> *key_changes;
    mutable array_index *index; // null until a search needs it (array_index.h)
    uint8_t placed_record;      // lies in memory that isn't the array's own, see array_place
    uint8_t placed_elements;
};

lc_status array_options_get_defaults(array_options *out);
lc_status array_options_get(const array *list, array_options *out);
lc_status array_options_set(array *list, const array_options *options);
int array_std_compare_func(const void *a, const void *b);
lc_status array_std_assign_func(const void *element, void **out_copy);
lc_status array_std_takeover_func(void **inout_element, void **out_slot);

lc_status array_new(array **out, const array_options *options);
// Makes an array of `count` slots, at least one, in memory that belongs to something else and has to outlive
// the array. All operations work: an array that has to grow gets slots of its own, and freeing it frees those
// only. The slots are filled by the caller.
void array_place(array *record, const array_options *options, void **elements, uint32_t count);
lc_status array_free(array **inout);
lc_status array_empty(array *list);
lc_status array_length(const array *list, uint32_t *out_length);
inline uint32_t array_length_quick(const array *list) {
    return list ? list->length : 0;
}
lc_status array_get(const array *list, uint32_t index, void **out_element); // LC_NOT_FOUND past the end
inline void *array_get_quick(const array *list, uint32_t index) {
    return list && index < list->length ? list->elements[index] : nullptr;
}

// The _takeover forms clear the caller's variable when they succeed, and when a policy drops the element.
lc_status array_set(array *list, uint32_t index, const void *element);
lc_status array_set_takeover(array *list, uint32_t index, void **inout_element);
lc_status array_append(array *list, const void *element);
lc_status array_append_takeover(array *list, void **inout_element);
lc_status array_append_no_dup(array *list, const void *element);
lc_status array_append_no_dup_takeover(array *list, void **inout_element);
lc_status array_insert_takeover(array *list, uint32_t index, void **inout_element);
lc_status array_insert_sorted(array *list, const void *element);
lc_status array_insert_sorted_takeover(array *list, void **inout_element);
lc_status array_insert_sorted_hint(array *list, const void *element, uint32_t hint);
lc_status array_insert_sorted_hint_takeover(array *list, void **inout_element, uint32_t hint);
lc_status array_find_insertion_point_hint(const array *list, const void *element, uint32_t hint,
                                          uint32_t *out_index);

lc_status array_remove(array *list, uint32_t index, void **out_element);
lc_status array_remove_no_shift(array *list, uint32_t index, void **out_element);
lc_status array_delete(array *list, uint32_t index);
lc_status array_delete_no_shift(array *list, uint32_t index);
lc_status array_pop(array *list, void **out_element);
lc_status array_peek(const array *list, void **out_element);

lc_status array_sort(array *list);
// `key` is an element to compare with; `out_index` may be null. LC_NOT_FOUND for no match.
lc_status array_binary_search(const array *list, const void *key, uint32_t *out_index);
lc_status array_linear_search(const array *list, const void *key, uint32_t start, uint32_t *out_index);
lc_status array_best_search(const array *list, const void *key, uint32_t *out_index);

lc_status array_duplicate(const array *list, array **out);
lc_status array_concat(array *list, array *moved); // `moved` is empty afterwards
int array_equal(const array *a, const array *b);

// LC_FOREACH_DELETE, _HALT_ERROR and _HALT_OK from the function steer the walk; other failures are counted as
// one at the end and do not stop it.
using array_foreach_function = lc_status (*)(array *list, uint32_t index, void *element, void *data);
lc_status array_foreach(array *list, array_foreach_function function, void *data);
lc_status array_foreach_delete(array *list, array_foreach_function function, void *data);
