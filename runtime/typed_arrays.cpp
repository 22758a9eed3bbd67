// The arrays of numbers and of interest records.
#include "runtime/typed_arrays.h"

#include <cstdlib>
#include <cstring>

#include "runtime/fdintrcb.h"

namespace {

// Numbers are stored in the slots themselves and compared as numbers.
template <typename Number>
int compare_numbers(const void *a, const void *b) {
    const Number left = typed_element<Number>::from_slot(*static_cast<void *const *>(a));
    const Number right = typed_element<Number>::from_slot(*static_cast<void *const *>(b));
    return (left > right) - (left < right);
}
template <typename Number>
void number_options(array_options *options) {
    options->compare = compare_numbers<Number>;
    options->duplicate = array_std_assign_func;
}

} // namespace

#define DEFINE_NUMBER_ARRAY(family, number) TYPED_ARRAY_DEFINE(family, number, number_options<number>)
TYPED_NUMBER_ARRAYS(DEFINE_NUMBER_ARRAY)

namespace {

lc_status fdic_event_dup_for_array(const void *element, void **out_copy) {
    auto *copy = static_cast<fdic_event *>(malloc(sizeof(fdic_event)));
    CHECK_NULL(copy);
    memcpy(copy, element, sizeof *copy);
    *out_copy = copy;
    return LC_OK;
}
int compare_events(const void *a, const void *b) {
    const auto *left = *static_cast<const fdic_event *const *>(a);
    const auto *right = *static_cast<const fdic_event *const *>(b);
    if (!left || !right)
        return (left ? 0 : 1) - (right ? 0 : 1);
    return (left->id > right->id) - (left->id < right->id);
}
// A newer record replaces the one with its id.
void fdic_event_options(array_options *options) {
    options->compare = compare_events;
    options->duplicate = fdic_event_dup_for_array;
    options->free = free;
    options->duplicate_policy = array_dup_replace;
}

} // namespace

TYPED_ARRAY_DEFINE(fdic_event_array, fdic_event *, fdic_event_options)
