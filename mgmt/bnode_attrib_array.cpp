// The attributes of a binding. The interface is that of an array indexed by attribute id, but only filled
// slots take memory, since a peer chooses the ids of a message, and most bindings have one attribute.
#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "mgmt/bnode.h"
#include "mgmt/bnode_block.h"
#include "runtime/guards.h"

namespace {

// The index of the first filled slot whose id is not less than `id`.
uint32_t find_slot_index(const bn_attrib_array *array, uint32_t id) {
    uint32_t at = 0;
    while (at < array->count && array->slots[at].id < id)
        at++;
    return at;
}
bn_attrib *find_attrib(const bn_attrib_array *array, uint32_t id) {
    const uint32_t at = find_slot_index(array, id);
    return at < array->count && array->slots[at].id == id ? array->slots[at].attrib : nullptr;
}
void free_attrib_slot(bn_attrib_slot *slot) {
    // The record of a placed attribute belongs to its block, but its value may have been replaced by one that
    // doesn't.
    if (slot->placed)
        (void)bn_attrib_free_value(slot->attrib);
    else
        (void)bn_attrib_free(&slot->attrib);
}

} // namespace

lc_status bn_attrib_array_new_full(bn_attrib_array **out, const array_options *) {
    CHECK_NULL(out);
    *out = static_cast<bn_attrib_array *>(calloc(1, sizeof(bn_attrib_array)));
    CHECK_NULL(*out);
    return LC_OK;
}
lc_status bn_attrib_array_new(bn_attrib_array **out) {
    return bn_attrib_array_new_full(out, nullptr);
}
lc_status bn_attrib_array_free(bn_attrib_array **inout) {
    CHECK_NULL(inout);
    bn_attrib_array *array = *inout;
    *inout = nullptr;
    if (!array)
        return LC_OK;
    for (uint32_t i = 0; i < array->count; i++)
        free_attrib_slot(&array->slots[i]);
    if (!array->placed_slots)
        free(array->slots);
    if (!array->placed_record)
        free(array);
    return LC_OK;
}
void bn_attrib_array_release(bn_attrib_array *array) {
    (void)bn_attrib_array_free(&array);
}

namespace {

lc_status reserve_attrib_slots(bn_attrib_array *array, uint32_t count) {
    if (count <= array->capacity)
        return LC_OK;
    const uint32_t capacity = std::max(count, array->capacity * 2);
    // Slots inside a block can't be reallocated; they are copied.
    auto *slots = static_cast<bn_attrib_slot *>(
        realloc(array->placed_slots ? nullptr : array->slots, capacity * sizeof(bn_attrib_slot)));
    CHECK_NULL(slots);
    if (array->placed_slots)
        memcpy(slots, array->slots, array->count * sizeof(bn_attrib_slot));
    array->placed_slots = 0;
    array->slots = slots;
    array->capacity = capacity;
    return LC_OK;
}

} // namespace

lc_status bn_attrib_array_duplicate(const bn_attrib_array *array, bn_attrib_array **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(array);
    owned<bn_attrib_array, bn_attrib_array_release> copy;
    CHECK_STATUS(bn_attrib_array_new(&copy.pointer));
    CHECK_STATUS(reserve_attrib_slots(copy.pointer, array->count));
    for (uint32_t i = 0; i < array->count; i++) {
        bn_attrib *attrib = nullptr;
        CHECK_STATUS(bn_attrib_dup(array->slots[i].attrib, &attrib));
        copy.pointer->slots[copy.pointer->count++] = {array->slots[i].id, false, attrib};
    }
    copy.pointer->length = array->length;
    *out = copy.take();
    return LC_OK;
}

uint32_t bn_attrib_array_length_quick(const bn_attrib_array *array) {
    return array ? array->length : 0;
}
bn_attrib *bn_attrib_array_get_quick(const bn_attrib_array *array, uint32_t id) {
    return array ? find_attrib(array, id) : nullptr;
}
lc_status bn_attrib_array_get(const bn_attrib_array *array, uint32_t id, bn_attrib **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(array);
    // An id past the end is a failure; an empty slot isn't.
    if (id >= array->length)
        return LC_NOT_FOUND;
    *out = find_attrib(array, id);
    return LC_OK;
}

namespace {

lc_status fill_slot(bn_attrib_array *array, uint32_t id, bn_attrib *attrib, bool placed) {
    CHECK_CONDITION(id <= array_size_max);
    const uint32_t at = find_slot_index(array, id);
    const bool filled = at < array->count && array->slots[at].id == id;
    bn_attrib_slot *end = array->slots + array->count;
    // The same object again: freeing the old one would free it.
    if (filled && array->slots[at].attrib == attrib)
        return LC_OK;
    if (filled)
        free_attrib_slot(&array->slots[at]);
    // A null empties the slot; the length stays, as in any array.
    if (filled && !attrib) {
        std::copy(array->slots + at + 1, end, array->slots + at);
        array->count--;
    } else if (attrib && !filled) {
        CHECK_STATUS(reserve_attrib_slots(array, array->count + 1));
        end = array->slots + array->count++;
        std::copy_backward(array->slots + at, end, end + 1);
    }
    if (attrib)
        array->slots[at] = {id, placed, attrib};
    array->length = std::max(array->length, id + 1);
    return LC_OK;
}

} // namespace

lc_status bn_attrib_array_set_takeover(bn_attrib_array *array, uint32_t id, bn_attrib **inout) {
    CHECK_NULL(array);
    CHECK_NULL(inout);
    CHECK_QUIET(fill_slot(array, id, *inout, false));
    *inout = nullptr;
    return LC_OK;
}
lc_status bn_attrib_array_set(bn_attrib_array *array, uint32_t id, const bn_attrib *attrib) {
    CHECK_NULL(array);
    owned<bn_attrib, bn_release_attrib> copy;
    if (attrib)
        CHECK_STATUS(bn_attrib_dup(attrib, &copy.pointer));
    return bn_attrib_array_set_takeover(array, id, &copy.pointer);
}
lc_status bn_attrib_array_put_placed(bn_attrib_array *array, uint32_t id, bn_attrib *attrib) {
    return fill_slot(array, id, attrib, true);
}
