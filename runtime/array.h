// The generic array of the management code: word-sized elements, functions that compare, copy and free them,
// and a policy for duplicates. Most code uses it through the typed arrays of typed_arrays.h.
//
// An array owns its elements, which its free function frees. It tracks whether they are sorted: appending
// keeps an array sorted if the new element belongs at the end; array_set makes it unsorted; array_sort sorts
// it again.
//
// All operations return LC_NULL for a null array. Nothing is locked: an array is used under the lock of its
// owner.
#pragma once

#include <atomic>
#include <cstdint>

#include "runtime/common.h"

// Takes pointers to the two slots, as qsort does. Less than, equal to or greater than 0.
using array_compare_function = int (*)(const void *a, const void *b);
using array_duplicate_function = lc_status (*)(const void *element, void **out_copy);
using array_takeover_function = lc_status (*)(void **inout_element, void **out_slot);
using array_free_function = void (*)(void *element);
using array_hash_function = uint32_t (*)(const void *element);

// What happens to a new element that equals one in the array.
enum : uint32_t {
    array_dup_allow = 1,   // both stay
    array_dup_replace = 2, // the old one is freed
    array_dup_drop = 3,    // the new one is freed, with result 0
    array_dup_refuse = 4,  // LC_EXISTS; the new one stays the caller's
};
constexpr uint32_t array_size_max = 0x7ffffffe; // elements

struct array_options {
    uint32_t initial_size; // slots
    array_compare_function compare;
    array_duplicate_function duplicate; // null: elements can't be copied
    array_takeover_function takeover;
    array_free_function free;
    uint32_t duplicate_policy; // array_dup_...
    uint32_t require_sorted;   // binary search and sorted insertion refuse an unsorted array
    // Optional: a hash function that gives elements which compare equal the same value. array_best_search
    // then keeps a hash index of a large unsorted array. `key_changes`, optional as well, is increased
    // whenever the key of an element that may be in an array changes; it invalidates the index.
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
    mutable array_index *index; // null until a search builds it (array_index.h)
    uint8_t placed_record;      // the record is in memory of somebody else, see array_place
    uint8_t placed_elements;
};

lc_status array_options_get_defaults(array_options *out);
lc_status array_options_get(const array *list, array_options *out);
lc_status array_options_set(array *list, const array_options *options);
int array_std_compare_func(const void *a, const void *b);
lc_status array_std_assign_func(const void *element, void **out_copy);
lc_status array_std_takeover_func(void **inout_element, void **out_slot);

lc_status array_new(array **out, const array_options *options);
// Initialises an array of `count` slots (at least one, filled by the caller) in memory that the caller owns
// and that must outlive the array. All operations work on it: if it has to grow, it allocates slots of its
// own, and array_free frees only those.
void array_place(array *record, const array_options *options, void **elements, uint32_t count);
lc_status array_free(array **inout);
// Frees all elements and shrinks to the initial size.
lc_status array_empty(array *list);
lc_status array_length(const array *list, uint32_t *out_length);
inline uint32_t array_length_quick(const array *list) {
    return list ? list->length : 0;
}
lc_status array_get(const array *list, uint32_t index, void **out_element); // LC_NOT_FOUND past the end
inline void *array_get_quick(const array *list, uint32_t index) {
    return list && index < list->length ? list->elements[index] : nullptr;
}

// The forms without _takeover store a copy made by the duplicate function; without one, LC_ASSERTION. The
// _takeover forms store the caller's element and set the caller's variable to null; on failure the element
// stays the caller's. array_set extends the array with nulls up to `index`. The sorted forms need a sorted
// array (LC_ASSERTION otherwise, if the options require it). The hint is ignored.
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

// Remove gives the element to the caller, delete frees it. The _no_shift forms leave a null in its place.
lc_status array_remove(array *list, uint32_t index, void **out_element);
lc_status array_remove_no_shift(array *list, uint32_t index, void **out_element);
lc_status array_delete(array *list, uint32_t index);
lc_status array_delete_no_shift(array *list, uint32_t index);
lc_status array_pop(array *list, void **out_element);
lc_status array_peek(const array *list, void **out_element);

lc_status array_sort(array *list);
// `key` is an element that the others are compared with; `out_index` may be null. LC_NOT_FOUND if there is no
// match. Of several matches the binary and the linear search find the first. The best search uses the binary
// search on a sorted array, otherwise the hash index if there is one, otherwise the linear search.
lc_status array_binary_search(const array *list, const void *key, uint32_t *out_index);
lc_status array_linear_search(const array *list, const void *key, uint32_t start, uint32_t *out_index);
lc_status array_best_search(const array *list, const void *key, uint32_t *out_index);

lc_status array_duplicate(const array *list, array **out);
lc_status array_concat(array *list, array *moved); // moves all elements to the end of `list`
int array_equal(const array *a, const array *b);   // 1 or 0

// Calls the function for each element by index. Its result decides what follows: LC_FOREACH_DELETE deletes
// the element (array_foreach_delete only), LC_FOREACH_HALT_ERROR ends the walk with LC_GENERIC,
// LC_FOREACH_HALT_OK and LC_CANCELLED end it with 0. After any other failure the walk continues, and its
// result is LC_GENERIC.
using array_foreach_function = lc_status (*)(array *list, uint32_t index, void *element, void *data);
lc_status array_foreach(array *list, array_foreach_function function, void *data);
lc_status array_foreach_delete(array *list, array_foreach_function function, void *data);
