// The hash index of an unsorted array: from a key to the first position of an equal element. It is built by
// the first array_best_search on an array of at least 16 elements. Appended elements are added at the next
// search; every other change drops it.
#pragma once

#include <cstdint>

#include "runtime/array.h"

void array_index_drop(const array *list);
// False when the array is too short for an index, has no hash function, or memory has run out: the caller
// searches the array instead. Otherwise `out_found` says whether there is an equal element, and
// `out_position` where the first is.
bool array_index_find(const array *list, const void *key, uint32_t *out_position, bool *out_found);
