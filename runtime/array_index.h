// A hash from what an array's compare function calls equal to the first place of it. An array that is not
// sorted keeps one from its first larger search on; appending adds to it, every other change drops it.
#pragma once

#include <cstdint>

#include "runtime/array.h"

void array_index_drop(const array *list);
// False when the array has no use for an index or no memory is left for it: search in another way.
bool array_index_find(const array *list, const void *key, uint32_t *out_position, bool *out_found);
