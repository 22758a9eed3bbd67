// Typed arrays over `array`. A family is a record that holds an array, and the operations below under the
// family's name, each of which calls the array operation of that name; array.h documents them:
//
//   TYPED_ARRAY_DECLARE(tstr_array, tstring *)        in a header
//   TYPED_ARRAY_DEFINE(tstr_array, tstring *, fill)   in one source; fill(array_options *) sets the functions
//
// These make tstr_array_append_takeover(tstr_array *list, tstring **inout) for example, whose definition is
// the line F##_append_takeover below.
//
// An element is a pointer, or a number of at most a word. The _quick forms return the value itself, and 0 or
// null if there is none. The _takeover forms set the caller's variable to null.
#pragma once

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <type_traits>

#include "runtime/array.h"

// Converts an element to and from the word that a slot holds. `given` is the type in which operations take an
// element that they copy.
template <typename Element>
struct typed_element {
    using given = Element;
    static void *to_slot(Element value) {
        void *slot = nullptr;
        memcpy(&slot, &value, sizeof value);
        return slot;
    }
    static Element from_slot(void *slot) {
        Element value;
        memcpy(&value, &slot, sizeof value);
        return value;
    }
    static_assert(sizeof(Element) <= sizeof(void *));
};
template <typename Target>
struct typed_element<Target *> {
    using given = const Target *;
    static void *to_slot(const Target *value) { return const_cast<Target *>(value); }
    static Target *from_slot(void *slot) { return static_cast<Target *>(slot); }
};
// Calls an array operation that gives an element, by a slot of its own.
template <typename Element, typename Call>
lc_status typed_out(Element *out, Call call) {
    CHECK_NULL(out);
    void *slot = nullptr;
    const lc_status status = call(&slot);
    *out = typed_element<Element>::from_slot(slot);
    return status;
}
// Calls an array operation that takes an element over, by a slot of its own; the caller's variable gets what
// is left in the slot, null after a success.
template <typename Element, typename Call>
lc_status typed_takeover(Element *inout, Call call) {
    CHECK_NULL(inout);
    void *slot = typed_element<Element>::to_slot(*inout);
    const lc_status status = call(&slot);
    *inout = typed_element<Element>::from_slot(slot);
    return status;
}
template <typename Family, typename Element>
using typed_foreach_function = lc_status (*)(Family *list, uint32_t index, Element element, void *data);
// A foreach function of a family with its arguments, as the user data of the array's foreach.
template <typename Family, typename Element>
struct typed_walk {
    typed_foreach_function<Family, Element> function;
    Family *list;
    void *data;
    static lc_status step(array *, uint32_t index, void *element, void *data) {
        const auto *walk = static_cast<const typed_walk *>(data);
        return walk->function(walk->list, index, typed_element<Element>::from_slot(element), walk->data);
    }
};
// What _new, _free and _duplicate have in common.
template <typename Family>
lc_status typed_new(Family **out, const array_options *options) {
    CHECK_NULL(out);
    *out = nullptr;
    auto *made = static_cast<Family *>(calloc(1, sizeof(Family)));
    CHECK_NULL(made);
    const lc_status status = array_new(&made->list, options);
    if (status != LC_OK)
        free(made);
    CHECK_STATUS(status);
    *out = made;
    return LC_OK;
}
template <typename Family>
lc_status typed_free(Family **inout) {
    CHECK_NULL(inout);
    Family *list = *inout;
    *inout = nullptr;
    if (!list)
        return LC_OK;
    const lc_status status = array_free(&list->list);
    free(list);
    return status;
}
template <typename Family>
array *typed_list(const Family *list) {
    return list ? list->list : nullptr;
}
template <typename Family>
lc_status typed_duplicate(const Family *list, Family **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(list);
    auto *made = static_cast<Family *>(calloc(1, sizeof(Family)));
    CHECK_NULL(made);
    const lc_status status = array_duplicate(list->list, &made->list);
    if (status != LC_OK)
        free(made);
    CHECK_STATUS(status);
    *out = made;
    return LC_OK;
}
template <typename Family, typename Element>
lc_status typed_foreach(Family *list, typed_foreach_function<Family, Element> function, void *data,
                        lc_status (*walk_array)(array *, array_foreach_function, void *)) {
    CHECK_NULL(list);
    CHECK_NULL(function);
    typed_walk<Family, Element> walk{function, list, data};
    return walk_array(list->list, typed_walk<Family, Element>::step, &walk);
}

// `push` is another name of `append`. `release` is `free` without a status, for scope guards:
// owned<tstr_array, tstr_array_release>.
#define TYPED_ARRAY_DECLARE(F, E)                                                                            \
    struct F {                                                                                               \
        array *list;                                                                                         \
    };                                                                                                       \
    lc_status F##_new_full(F **out, const array_options *options);                                           \
    lc_status F##_new(F **out);                                                                              \
    lc_status F##_free(F **inout);                                                                           \
    lc_status F##_duplicate(const F *list, F **out);                                                         \
    lc_status F##_concat(F *list, F *moved);                                                                 \
    int F##_equal(const F *a, const F *b);                                                                   \
    lc_status F##_empty(F *list);                                                                            \
    lc_status F##_sort(F *list);                                                                             \
    lc_status F##_length(const F *list, uint32_t *out_length);                                               \
    uint32_t F##_length_quick(const F *list);                                                                \
    E F##_get_quick(const F *list, uint32_t index);                                                          \
    lc_status F##_delete(F *list, uint32_t index);                                                           \
    lc_status F##_delete_no_shift(F *list, uint32_t index);                                                  \
    lc_status F##_append(F *list, typed_element<E>::given value);                                            \
    lc_status F##_append_no_dup(F *list, typed_element<E>::given value);                                     \
    lc_status F##_push(F *list, typed_element<E>::given value);                                              \
    lc_status F##_insert_sorted(F *list, typed_element<E>::given value);                                     \
    lc_status F##_set(F *list, uint32_t index, typed_element<E>::given value);                               \
    lc_status F##_insert_sorted_hint(F *list, typed_element<E>::given value, uint32_t hint);                 \
    lc_status F##_append_takeover(F *list, E *inout);                                                        \
    lc_status F##_append_no_dup_takeover(F *list, E *inout);                                                 \
    lc_status F##_insert_sorted_takeover(F *list, E *inout);                                                 \
    lc_status F##_set_takeover(F *list, uint32_t index, E *inout);                                           \
    lc_status F##_insert_takeover(F *list, uint32_t index, E *inout);                                        \
    lc_status F##_insert_sorted_hint_takeover(F *list, E *inout, uint32_t hint);                             \
    lc_status F##_get(const F *list, uint32_t index, E *out);                                                \
    lc_status F##_remove(F *list, uint32_t index, E *out);                                                   \
    lc_status F##_remove_no_shift(F *list, uint32_t index, E *out);                                          \
    lc_status F##_peek(const F *list, E *out);                                                               \
    lc_status F##_pop(F *list, E *out);                                                                      \
    lc_status F##_binary_search(const F *list, typed_element<E>::given key, uint32_t *out_index);            \
    lc_status F##_best_search(const F *list, typed_element<E>::given key, uint32_t *out_index);              \
    lc_status F##_linear_search(const F *list, typed_element<E>::given key, uint32_t start,                  \
                                uint32_t *out_index);                                                        \
    lc_status F##_foreach(F *list, typed_foreach_function<F, E> function, void *data);                       \
    lc_status F##_foreach_delete(F *list, typed_foreach_function<F, E> function, void *data);                \
    void F##_release(F *list);

#define TYPED_ARRAY_DEFINE(F, E, fill)                                                                       \
    lc_status F##_new_full(F **out, const array_options *options) {                                          \
        return typed_new(out, options);                                                                      \
    }                                                                                                        \
    lc_status F##_new(F **out) {                                                                             \
        array_options options;                                                                               \
        CHECK_STATUS(array_options_get_defaults(&options));                                                  \
        fill(&options);                                                                                      \
        return typed_new(out, &options);                                                                     \
    }                                                                                                        \
    lc_status F##_free(F **inout) {                                                                          \
        return typed_free(inout);                                                                            \
    }                                                                                                        \
    lc_status F##_duplicate(const F *list, F **out) {                                                        \
        return typed_duplicate(list, out);                                                                   \
    }                                                                                                        \
    lc_status F##_concat(F *list, F *moved) {                                                                \
        return array_concat(typed_list(list), typed_list(moved));                                            \
    }                                                                                                        \
    int F##_equal(const F *a, const F *b) {                                                                  \
        return array_equal(typed_list(a), typed_list(b));                                                    \
    }                                                                                                        \
    lc_status F##_empty(F *list) {                                                                           \
        return array_empty(typed_list(list));                                                                \
    }                                                                                                        \
    lc_status F##_sort(F *list) {                                                                            \
        return array_sort(typed_list(list));                                                                 \
    }                                                                                                        \
    lc_status F##_length(const F *list, uint32_t *out_length) {                                              \
        return array_length(typed_list(list), out_length);                                                   \
    }                                                                                                        \
    uint32_t F##_length_quick(const F *list) {                                                               \
        return array_length_quick(typed_list(list));                                                         \
    }                                                                                                        \
    E F##_get_quick(const F *list, uint32_t index) {                                                         \
        return typed_element<E>::from_slot(array_get_quick(typed_list(list), index));                        \
    }                                                                                                        \
    lc_status F##_delete(F *list, uint32_t index) {                                                          \
        return array_delete(typed_list(list), index);                                                        \
    }                                                                                                        \
    lc_status F##_delete_no_shift(F *list, uint32_t index) {                                                 \
        return array_delete_no_shift(typed_list(list), index);                                               \
    }                                                                                                        \
    lc_status F##_append(F *list, typed_element<E>::given value) {                                           \
        return array_append(typed_list(list), typed_element<E>::to_slot(value));                             \
    }                                                                                                        \
    lc_status F##_append_no_dup(F *list, typed_element<E>::given value) {                                    \
        return array_append_no_dup(typed_list(list), typed_element<E>::to_slot(value));                      \
    }                                                                                                        \
    lc_status F##_push(F *list, typed_element<E>::given value) {                                             \
        return array_append(typed_list(list), typed_element<E>::to_slot(value));                             \
    }                                                                                                        \
    lc_status F##_insert_sorted(F *list, typed_element<E>::given value) {                                    \
        return array_insert_sorted(typed_list(list), typed_element<E>::to_slot(value));                      \
    }                                                                                                        \
    lc_status F##_set(F *list, uint32_t index, typed_element<E>::given value) {                              \
        return array_set(typed_list(list), index, typed_element<E>::to_slot(value));                         \
    }                                                                                                        \
    lc_status F##_insert_sorted_hint(F *list, typed_element<E>::given value, uint32_t hint) {                \
        return array_insert_sorted_hint(typed_list(list), typed_element<E>::to_slot(value), hint);           \
    }                                                                                                        \
    lc_status F##_append_takeover(F *list, E *inout) {                                                       \
        return typed_takeover<E>(                                                                            \
            inout, [&](void **slot) { return array_append_takeover(typed_list(list), slot); });              \
    }                                                                                                        \
    lc_status F##_append_no_dup_takeover(F *list, E *inout) {                                                \
        return typed_takeover<E>(                                                                            \
            inout, [&](void **slot) { return array_append_no_dup_takeover(typed_list(list), slot); });       \
    }                                                                                                        \
    lc_status F##_insert_sorted_takeover(F *list, E *inout) {                                                \
        return typed_takeover<E>(                                                                            \
            inout, [&](void **slot) { return array_insert_sorted_takeover(typed_list(list), slot); });       \
    }                                                                                                        \
    lc_status F##_set_takeover(F *list, uint32_t index, E *inout) {                                          \
        return typed_takeover<E>(                                                                            \
            inout, [&](void **slot) { return array_set_takeover(typed_list(list), index, slot); });          \
    }                                                                                                        \
    lc_status F##_insert_takeover(F *list, uint32_t index, E *inout) {                                       \
        return typed_takeover<E>(                                                                            \
            inout, [&](void **slot) { return array_insert_takeover(typed_list(list), index, slot); });       \
    }                                                                                                        \
    lc_status F##_insert_sorted_hint_takeover(F *list, E *inout, uint32_t hint) {                            \
        return typed_takeover<E>(inout, [&](void **slot) {                                                   \
            return array_insert_sorted_hint_takeover(typed_list(list), slot, hint);                          \
        });                                                                                                  \
    }                                                                                                        \
    lc_status F##_get(const F *list, uint32_t index, E *out) {                                               \
        return typed_out<E>(out, [&](void **slot) { return array_get(typed_list(list), index, slot); });     \
    }                                                                                                        \
    lc_status F##_remove(F *list, uint32_t index, E *out) {                                                  \
        return typed_out<E>(out, [&](void **slot) { return array_remove(typed_list(list), index, slot); });  \
    }                                                                                                        \
    lc_status F##_remove_no_shift(F *list, uint32_t index, E *out) {                                         \
        return typed_out<E>(                                                                                 \
            out, [&](void **slot) { return array_remove_no_shift(typed_list(list), index, slot); });         \
    }                                                                                                        \
    lc_status F##_peek(const F *list, E *out) {                                                              \
        return typed_out<E>(out, [&](void **slot) { return array_peek(typed_list(list), slot); });           \
    }                                                                                                        \
    lc_status F##_pop(F *list, E *out) {                                                                     \
        return typed_out<E>(out, [&](void **slot) { return array_pop(typed_list(list), slot); });            \
    }                                                                                                        \
    lc_status F##_binary_search(const F *list, typed_element<E>::given key, uint32_t *out_index) {           \
        return array_binary_search(typed_list(list), typed_element<E>::to_slot(key), out_index);             \
    }                                                                                                        \
    lc_status F##_best_search(const F *list, typed_element<E>::given key, uint32_t *out_index) {             \
        return array_best_search(typed_list(list), typed_element<E>::to_slot(key), out_index);               \
    }                                                                                                        \
    lc_status F##_linear_search(const F *list, typed_element<E>::given key, uint32_t start,                  \
                                uint32_t *out_index) {                                                       \
        return array_linear_search(typed_list(list), typed_element<E>::to_slot(key), start, out_index);      \
    }                                                                                                        \
    lc_status F##_foreach(F *list, typed_foreach_function<F, E> function, void *data) {                      \
        return typed_foreach(list, function, data, array_foreach);                                           \
    }                                                                                                        \
    lc_status F##_foreach_delete(F *list, typed_foreach_function<F, E> function, void *data) {               \
        return typed_foreach(list, function, data, array_foreach_delete);                                    \
    }                                                                                                        \
    void F##_release(F *list) {                                                                              \
        (void)F##_free(&list);                                                                               \
    }

// The families of plain numbers, uint32_array for example. The numbers are stored in the slots and compared
// as numbers.
#define TYPED_NUMBER_ARRAYS(X)                                                                               \
    X(uint32_array, uint32_t)                                                                                \
    X(uint64_array, uint64_t)                                                                                \
    X(int64_array, int64_t)                                                                                  \
    X(float32_array, float)                                                                                  \
    X(tbool_array, bool)
TYPED_NUMBER_ARRAYS(TYPED_ARRAY_DECLARE)

struct fdic_event;
TYPED_ARRAY_DECLARE(fdic_event_array, fdic_event *)
