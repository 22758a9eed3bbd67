#include "runtime/array_index.h"

#include <cstdlib>

// Open addressing with linear probing. A slot holds a position plus 1, or 0 when it is free. There are always
// at least twice as many slots as elements; therefore every probe ends. Nothing is ever removed: a change
// that would need it drops the whole index.
struct array_index {
    uint32_t slot_count; // a power of two
    uint32_t indexed;    // number of elements, from the start, that have been entered
    uint32_t key_changes;
    uint32_t slots[];
};

constexpr uint32_t INDEX_MIN_LENGTH = 16;

namespace {

uint32_t count_key_changes(const array *list) {
    return list->key_changes ? list->key_changes->load(std::memory_order_relaxed) : 0;
}

} // namespace

void array_index_drop(const array *list) {
    free(list->index);
    list->index = nullptr;
}

namespace {

// The slot of an equal element, or else the free slot where the key belongs.
uint32_t *find_index_slot(const array *list, const void *key) {
    const uint32_t mask = list->index->slot_count - 1;
    uint32_t at = list->hash(key) & mask;
    while (list->index->slots[at]) {
        void *const *element = &list->elements[list->index->slots[at] - 1];
        if (list->compare(&key, element) == 0)
            break;
        at = (at + 1) & mask;
    }
    return &list->index->slots[at];
}

bool make_index(const array *list) {
    // At most a third full at first. It is made anew when appended elements have filled half of it.
    uint32_t count = 64;
    while (count < 3 * uint64_t{list->length} && count < 0x40000000)
        count *= 2;
    // No index for an array so long that the table would be half full.
    if (list->length >= count / 2)
        return false;
    list->index =
        static_cast<array_index *>(calloc(1, sizeof(array_index) + sizeof(uint32_t) * size_t{count}));
    if (!list->index)
        return false;
    list->index->slot_count = count;
    list->index->key_changes = count_key_changes(list);
    return true;
}

bool update_index(const array *list) {
    // A key that has changed inside an element makes its entry wrong, as does an array that got shorter.
    if (list->index &&
        (list->index->key_changes != count_key_changes(list) || list->index->indexed > list->length ||
         2 * uint64_t{list->length} > list->index->slot_count))
        array_index_drop(list);
    if (!list->index && !make_index(list))
        return false;
    while (list->index->indexed < list->length) {
        const uint32_t position = list->index->indexed++;
        // A null element can't be hashed, and no key equals it.
        if (!list->elements[position])
            continue;
        uint32_t *slot = find_index_slot(list, list->elements[position]);
        // The first of several equal elements keeps the slot, as a search from the start would find it.
        if (!*slot)
            *slot = position + 1;
    }
    return true;
}

} // namespace

bool array_index_find(const array *list, const void *key, uint32_t *out_position, bool *out_found) {
    if (!list->hash || !key || list->length < INDEX_MIN_LENGTH || !update_index(list))
        return false;
    const uint32_t found = *find_index_slot(list, key);
    *out_found = found != 0;
    *out_position = found - 1;
    return true;
}
