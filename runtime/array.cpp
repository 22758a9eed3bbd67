// The generic array: all elements are in one block of slots.
//
// `sorted` means that the elements are known to be in order. An insertion keeps it if the new element fits
// between its neighbours, so that an array which is filled in order can be searched by bisection; array_set
// and the _no_shift operations clear it. A large unsorted array whose options have a hash function is
// searched through a hash index (array_index.cpp): a start of wccpd with ten thousand bindings would
// otherwise take quadratic time.
//
// The index holds positions. Every operation that moves, replaces or removes elements drops it, before it
// changes anything; appending need not, since the next search adds the new elements to the index.
//
// The copying operations, and those that apply a policy, are written in terms of the _takeover operations.
#include "runtime/array.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "runtime/array_index.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

int array_std_compare_func(const void *a, const void *b) {
    const auto left = *static_cast<const uintptr_t *>(a), right = *static_cast<const uintptr_t *>(b);
    // The difference of two user-space addresses fits in a signed word.
    const auto difference = static_cast<intptr_t>(left - right);
    return (difference > 0) - (difference < 0);
}
lc_status array_std_assign_func(const void *element, void **out_copy) {
    CHECK_NULL(out_copy);
    *out_copy = const_cast<void *>(element);
    return LC_OK;
}
lc_status array_std_takeover_func(void **inout_element, void **out_slot) {
    CHECK_NULL(inout_element);
    CHECK_NULL(out_slot);
    *out_slot = *inout_element;
    *inout_element = nullptr;
    return LC_OK;
}

namespace {

void free_nothing(void *) {}

} // namespace

// --- Options, creation and release

lc_status array_options_get_defaults(array_options *out) {
    CHECK_NULL(out);
    *out = array_options{};
    out->initial_size = 10;
    out->compare = array_std_compare_func;
    out->takeover = array_std_takeover_func;
    out->free = free_nothing;
    out->duplicate_policy = array_dup_allow;
    out->require_sorted = 1;
    return LC_OK;
}
lc_status array_options_get(const array *list, array_options *out) {
    CHECK_NULL(out);
    CHECK_NULL(list);
    *out = {list->initial_size,     list->compare,        list->duplicate, list->takeover,   list->free,
            list->duplicate_policy, list->require_sorted, list->hash,      list->key_changes};
    return LC_OK;
}
lc_status array_options_set(array *list, const array_options *options) {
    CHECK_NULL(list);
    CHECK_NULL(options);
    // Another order: what was sorted may not be.
    if (options->compare != list->compare && list->length > 1)
        list->sorted = 0;
    list->initial_size = std::max(options->initial_size, 1u);
    list->compare = options->compare;
    list->duplicate = options->duplicate;
    list->takeover = options->takeover ? options->takeover : array_std_takeover_func;
    list->free = options->free ? options->free : free_nothing;
    list->duplicate_policy = options->duplicate_policy;
    list->require_sorted = options->require_sorted;
    list->hash = options->hash;
    list->key_changes = options->key_changes;
    array_index_drop(list);
    return LC_OK;
}

namespace {

void free_array_record(array *list) {
    free(list);
}

} // namespace

lc_status array_new(array **out, const array_options *options) {
    CHECK_NULL(out);
    *out = nullptr;
    array_options defaults;
    CHECK_STATUS(array_options_get_defaults(&defaults));
    owned<array, free_array_record> list(static_cast<array *>(calloc(1, sizeof(array))));
    CHECK_NULL(list.pointer);
    (void)array_options_set(list.pointer, options ? options : &defaults);
    list.pointer->elements = static_cast<void **>(calloc(list.pointer->initial_size, sizeof(void *)));
    CHECK_NULL(list.pointer->elements);
    list.pointer->capacity = list.pointer->initial_size;
    list.pointer->sorted = 1;
    *out = list.take();
    return LC_OK;
}

void array_place(array *record, const array_options *options, void **elements, uint32_t count) {
    *record = array{};
    (void)array_options_set(record, options);
    record->elements = elements;
    record->initial_size = record->capacity = record->length = count;
    record->sorted = count == 1;
    record->placed_record = record->placed_elements = 1;
}

namespace {

void free_element(array *list, void *element) {
    if (element)
        list->free(element);
}

} // namespace

lc_status array_free(array **inout) {
    CHECK_NULL(inout);
    array *list = *inout;
    *inout = nullptr;
    if (!list)
        return LC_OK;
    array_index_drop(list);
    while (list->length)
        free_element(list, list->elements[--list->length]);
    if (!list->placed_elements)
        free(list->elements);
    if (!list->placed_record)
        free(list);
    return LC_OK;
}
lc_status array_empty(array *list) {
    CHECK_NULL(list);
    array_index_drop(list);
    while (list->length)
        free_element(list, list->elements[--list->length]);
    list->sorted = 1;
    // Slots in a caller's memory never get here: they have the initial capacity, and growing replaces them.
    if (list->capacity != list->initial_size) {
        auto *smaller = static_cast<void **>(realloc(list->elements, list->initial_size * sizeof(void *)));
        if (smaller) {
            list->elements = smaller;
            list->capacity = list->initial_size;
        }
    }
    return LC_OK;
}

namespace {

lc_status reserve_slots(array *list, uint64_t length) {
    CHECK_CONDITION(length <= array_size_max);
    // Grows by ten slots or doubles, whichever is more; the limit above ends the loop.
    uint64_t capacity = list->capacity;
    while (capacity < length)
        capacity = std::min<uint64_t>(std::max(capacity + 10, capacity * 2), array_size_max);
    if (capacity == list->capacity)
        return LC_OK;
    // Slots in a caller's memory can't be reallocated. They are copied to new ones and left alone.
    auto *elements = static_cast<void **>(
        realloc(list->placed_elements ? nullptr : list->elements, capacity * sizeof(void *)));
    CHECK_NULL(elements);
    if (list->placed_elements)
        memcpy(elements, list->elements, list->length * sizeof(void *));
    list->placed_elements = 0;
    list->elements = elements;
    list->capacity = static_cast<uint32_t>(capacity);
    return LC_OK;
}

} // namespace

// --- Reading

lc_status array_length(const array *list, uint32_t *out_length) {
    CHECK_NULL(out_length);
    *out_length = 0;
    CHECK_NULL(list);
    *out_length = list->length;
    return LC_OK;
}
lc_status array_get(const array *list, uint32_t index, void **out_element) {
    CHECK_NULL(out_element);
    *out_element = nullptr;
    CHECK_NULL(list);
    if (index >= list->length)
        return LC_NOT_FOUND;
    *out_element = list->elements[index];
    return LC_OK;
}
lc_status array_peek(const array *list, void **out_element) {
    CHECK_NULL(out_element);
    *out_element = nullptr;
    CHECK_NULL(list);
    return list->length ? array_get(list, list->length - 1, out_element) : LC_NOT_FOUND;
}

// --- Insertion

namespace {

lc_status copy_element(const array *list, const void *element, void **out) {
    *out = nullptr;
    if (!element)
        return LC_OK;
    CHECK_CONDITION(list->duplicate);
    CHECK_STATUS(list->duplicate(element, out));
    return LC_OK;
}

// Runs a _takeover operation with a copy of the element, and frees the copy if the operation didn't take it.
template <typename Operation>
lc_status call_with_copy(array *list, const void *element, Operation operation) {
    CHECK_NULL(list);
    void *copy = nullptr;
    CHECK_QUIET(copy_element(list, element, &copy));
    const lc_status status = operation(&copy);
    free_element(list, copy);
    return status;
}

// Clears `sorted` if the new element at `index` is out of order with its neighbours. An array of one element
// is sorted; nulls never are.
void update_sorted(array *list, uint32_t index) {
    if (!list->sorted)
        return;
    void **at = &list->elements[index];
    if (!list->compare || !*at || (index > 0 && list->compare(at - 1, at) > 0) ||
        (index + 1 < list->length && list->compare(at, at + 1) > 0))
        list->sorted = list->length == 1 && *at;
}

} // namespace

lc_status array_set_takeover(array *list, uint32_t index, void **inout_element) {
    CHECK_NULL(list);
    CHECK_NULL(inout_element);
    CHECK_STATUS(reserve_slots(list, uint64_t{index} + 1));
    array_index_drop(list);
    while (list->length <= index)
        list->elements[list->length++] = nullptr;
    list->sorted = 0;
    void *old = list->elements[index];
    if (old == *inout_element) {
        // The caller passes the element that is already in the slot: freeing "the old one" would free it.
        *inout_element = nullptr;
        return LC_OK;
    }
    CHECK_STATUS(list->takeover(inout_element, &list->elements[index]));
    free_element(list, old);
    return LC_OK;
}
lc_status array_set(array *list, uint32_t index, const void *element) {
    return call_with_copy(list, element, [&](void **copy) { return array_set_takeover(list, index, copy); });
}

lc_status array_insert_takeover(array *list, uint32_t index, void **inout_element) {
    CHECK_NULL(list);
    CHECK_NULL(inout_element);
    if (index > list->length) // nothing to move up; array_set fills the gap with nulls
        return array_set_takeover(list, index, inout_element);
    CHECK_STATUS(reserve_slots(list, uint64_t{list->length} + 1));
    if (index < list->length)
        array_index_drop(list);
    // Into a variable first: if the takeover fails, no element has been moved yet.
    void *slot = nullptr;
    CHECK_STATUS(list->takeover(inout_element, &slot));
    memmove(list->elements + index + 1, list->elements + index, (list->length - index) * sizeof(void *));
    list->elements[index] = slot;
    list->length++;
    update_sorted(list, index);
    return LC_OK;
}

namespace {

// Applies the policy to a new element that equals the one at `index`. `out_done`: the new one isn't to be
// inserted.
lc_status apply_duplicate_policy(array *list, uint32_t index, void **inout_element, bool *out_done) {
    *out_done = true;
    if (list->duplicate_policy == array_dup_refuse)
        return LC_EXISTS;
    if (list->duplicate_policy == array_dup_drop) {
        free_element(list, *inout_element);
        *inout_element = nullptr;
        return LC_OK;
    }
    *out_done = false;
    return array_delete(list, index);
}

} // namespace

lc_status array_append_no_dup_takeover(array *list, void **inout_element) {
    CHECK_NULL(list);
    CHECK_NULL(inout_element);
    uint32_t index = 0;
    // Before the old element may be deleted, so that the new one cannot fail for lack of memory after that.
    CHECK_STATUS(reserve_slots(list, uint64_t{list->length} + 1));
    if (list->duplicate_policy != array_dup_allow &&
        array_linear_search(list, *inout_element, 0, &index) == LC_OK) {
        bool done = false;
        CHECK_QUIET(apply_duplicate_policy(list, index, inout_element, &done));
        if (done)
            return LC_OK;
    }
    return array_insert_takeover(list, list->length, inout_element);
}
lc_status array_append_no_dup(array *list, const void *element) {
    return call_with_copy(list, element,
                          [&](void **copy) { return array_append_no_dup_takeover(list, copy); });
}
lc_status array_append(array *list, const void *element) {
    return array_append_no_dup(list, element);
}
lc_status array_append_takeover(array *list, void **inout_element) {
    return array_append_no_dup_takeover(list, inout_element);
}

lc_status array_find_insertion_point_hint(const array *list, const void *element, uint32_t,
                                          uint32_t *out_index) {
    CHECK_NULL(out_index);
    *out_index = 0;
    CHECK_NULL(list);
    CHECK_CONDITION(list->compare);
    // A linear scan gives a defined result for an unsorted array as well, which the options may allow. Sorted
    // insertion is used for short arrays only.
    while (*out_index < list->length && list->compare(&list->elements[*out_index], &element) <= 0)
        ++*out_index;
    return LC_OK;
}
lc_status array_insert_sorted_hint_takeover(array *list, void **inout_element, uint32_t hint) {
    CHECK_NULL(list);
    CHECK_NULL(inout_element);
    CHECK_CONDITION(list->sorted || !list->require_sorted);
    uint32_t index = 0;
    CHECK_STATUS(reserve_slots(list, uint64_t{list->length} + 1));
    CHECK_STATUS(array_find_insertion_point_hint(list, *inout_element, hint, &index));
    // Equal elements are just before the insertion point.
    if (index > 0 && list->duplicate_policy != array_dup_allow &&
        list->compare(&list->elements[index - 1], inout_element) == 0) {
        bool done = false;
        CHECK_QUIET(apply_duplicate_policy(list, --index, inout_element, &done));
        if (done)
            return LC_OK;
    }
    CHECK_STATUS(array_insert_takeover(list, index, inout_element));
    list->sorted = 1;
    return LC_OK;
}
lc_status array_insert_sorted_takeover(array *list, void **inout_element) {
    return array_insert_sorted_hint_takeover(list, inout_element, 0);
}
lc_status array_insert_sorted_hint(array *list, const void *element, uint32_t hint) {
    return call_with_copy(list, element,
                          [&](void **copy) { return array_insert_sorted_hint_takeover(list, copy, hint); });
}
lc_status array_insert_sorted(array *list, const void *element) {
    return array_insert_sorted_hint(list, element, 0);
}

// --- Removal

lc_status array_remove_no_shift(array *list, uint32_t index, void **out_element) {
    CHECK_NULL(out_element);
    CHECK_QUIET(array_get(list, index, out_element));
    array_index_drop(list);
    list->elements[index] = nullptr;
    list->sorted = 0;
    return LC_OK;
}
lc_status array_remove(array *list, uint32_t index, void **out_element) {
    CHECK_NULL(out_element);
    CHECK_QUIET(array_get(list, index, out_element));
    array_index_drop(list);
    // Removing an element leaves the others in order; `sorted` is unchanged.
    list->length--;
    memmove(list->elements + index, list->elements + index + 1, (list->length - index) * sizeof(void *));
    return LC_OK;
}
lc_status array_delete(array *list, uint32_t index) {
    void *element = nullptr;
    CHECK_QUIET(array_remove(list, index, &element));
    free_element(list, element);
    return LC_OK;
}
lc_status array_delete_no_shift(array *list, uint32_t index) {
    void *element = nullptr;
    CHECK_QUIET(array_remove_no_shift(list, index, &element));
    free_element(list, element);
    return LC_OK;
}
lc_status array_pop(array *list, void **out_element) {
    CHECK_NULL(out_element);
    *out_element = nullptr;
    CHECK_NULL(list);
    return list->length ? array_remove(list, list->length - 1, out_element) : LC_NOT_FOUND;
}

// --- Order and search

lc_status array_sort(array *list) {
    CHECK_NULL(list);
    CHECK_CONDITION(list->compare);
    if (list->sorted)
        LC_LOG(LC_LOG_DEBUG, "Sorting an already-sorted array.");
    array_index_drop(list);
    if (list->length > 1)
        qsort(list->elements, list->length, sizeof(void *), list->compare);
    list->sorted = 1;
    return LC_OK;
}

namespace {

lc_status set_out_index(uint32_t index, uint32_t *out_index) {
    if (out_index)
        *out_index = index;
    return LC_OK;
}

} // namespace

lc_status array_binary_search(const array *list, const void *key, uint32_t *out_index) {
    CHECK_NULL(list);
    CHECK_CONDITION(list->sorted || !list->require_sorted);
    CHECK_CONDITION(list->compare);
    // Finds the first element that is not less than the key, and therefore the first of several equal ones.
    uint32_t low = 0, high = list->length;
    while (low < high) {
        const uint32_t middle = low + (high - low) / 2;
        if (list->compare(&list->elements[middle], &key) < 0)
            low = middle + 1;
        else
            high = middle;
    }
    if (low == list->length || list->compare(&list->elements[low], &key) != 0)
        return LC_NOT_FOUND;
    return set_out_index(low, out_index);
}
lc_status array_linear_search(const array *list, const void *key, uint32_t start, uint32_t *out_index) {
    CHECK_NULL(list);
    CHECK_CONDITION(list->compare);
    for (uint32_t i = start; i < list->length; i++)
        if (list->compare(&list->elements[i], &key) == 0)
            return set_out_index(i, out_index);
    return LC_NOT_FOUND;
}
lc_status array_best_search(const array *list, const void *key, uint32_t *out_index) {
    CHECK_NULL(list);
    CHECK_CONDITION(list->compare);
    if (list->sorted)
        return array_binary_search(list, key, out_index);
    uint32_t index = 0;
    bool found = false;
    if (!array_index_find(list, key, &index, &found))
        return array_linear_search(list, key, 0, out_index);
    return found ? set_out_index(index, out_index) : LC_NOT_FOUND;
}

// --- Whole arrays

lc_status array_duplicate(const array *list, array **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(list);
    array_options options;
    CHECK_STATUS(array_options_get(list, &options));
    array *copy = nullptr;
    CHECK_STATUS(array_new(&copy, &options));
    lc_status status = reserve_slots(copy, list->length);
    // The copy's length grows with each element, so that array_free frees exactly those that were copied.
    for (uint32_t i = 0; i < list->length && status == LC_OK; i++) {
        status = copy_element(list, list->elements[i], &copy->elements[i]);
        if (status == LC_OK)
            copy->length = i + 1;
    }
    copy->sorted = list->sorted;
    if (status != LC_OK)
        (void)array_free(&copy);
    CHECK_STATUS(status);
    *out = copy;
    return LC_OK;
}
lc_status array_concat(array *list, array *moved) {
    CHECK_NULL(list);
    CHECK_NULL(moved);
    CHECK_CONDITION(list != moved);
    const uint64_t length = uint64_t{list->length} + moved->length;
    CHECK_STATUS(reserve_slots(list, length));
    // Cannot fail from here on, so that no element is in both arrays or in neither.
    array_index_drop(moved);
    for (uint32_t i = 0; i < moved->length; i++) {
        list->elements[list->length++] = moved->elements[i];
        update_sorted(list, list->length - 1);
    }
    // Its elements belong to the other array now; array_empty only gives memory back.
    moved->length = 0;
    return array_empty(moved);
}
int array_equal(const array *a, const array *b) {
    if (!a || !b)
        return a == b;
    if (a->length != b->length || !a->compare)
        return 0;
    for (uint32_t i = 0; i < a->length; i++)
        if (a->compare(&a->elements[i], &b->elements[i]) != 0)
            return 0;
    return 1;
}

namespace {

lc_status visit_elements(array *list, array_foreach_function function, void *data, bool deletes) {
    CHECK_NULL(list);
    CHECK_NULL(function);
    lc_status result = LC_OK;
    for (uint32_t i = 0; i < list->length;) {
        const lc_status status = function(list, i, list->elements[i], data);
        switch (status) {
        case LC_OK:
            break;
        case LC_FOREACH_DELETE:
            if (!deletes) {
                LC_LOG(LC_LOG_ERR,
                       "Array foreach callback returned lc_err_foreach_delete to delete element #%d, but "
                       "array_foreach_delete() was not called",
                       static_cast<int32_t>(i));
                return LC_ASSERTION;
            }
            CHECK_STATUS(array_delete(list, i));
            continue; // the next element is at the same index now
        case LC_FOREACH_HALT_ERROR:
            LC_LOG(LC_LOG_ERR, "Array element %d halted iteration with an error", static_cast<int32_t>(i));
            return LC_GENERIC;
        case LC_FOREACH_HALT_OK:
        case LC_CANCELLED:
            return LC_OK;
        default:
            LC_LOG(LC_LOG_WARNING, "Got return code %d from foreach function", status);
            // The walk continues: one element that fails doesn't keep the others from being visited.
            result = LC_GENERIC;
        }
        i++;
    }
    return result;
}

} // namespace

lc_status array_foreach(array *list, array_foreach_function function, void *data) {
    return visit_elements(list, function, data, false);
}
lc_status array_foreach_delete(array *list, array_foreach_function function, void *data) {
    return visit_elements(list, function, data, true);
}
