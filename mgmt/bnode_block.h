// Blocks: the bindings of a message in one allocation, together with their names, attributes and values. A
// large message would otherwise take a dozen allocations per node.
//
// To make a block, add up the sizes of everything that it will contain (bn_size_...), allocate it, and place
// exactly that in it (bn_place_...). A placed binding is used and freed like any other, and what it contains
// can be replaced. The block has a reference count, with one reference for its maker and one for each placed
// binding; the last release frees it. A binding that is kept from a large message therefore keeps the memory
// of the whole message; to keep it for long, copy it with bn_binding_dup.
//
// The reference count is atomic; apart from that a block is used by one thread at a time.
#pragma once

#include <cstddef>
#include <cstdint>

#include "mgmt/bnode.h"
#include "runtime/guards.h"

struct bn_block;
void bn_block_release(bn_block *block); // accepts null
using owned_block = owned<bn_block, bn_block_release>;

// --- Sizes, in bytes

struct bn_block_size {
    size_t records, texts;
    bool bare[2]; // a binding is named "", and one is named "/"
};
void bn_size_record(bn_block_size *size, size_t bytes);
void bn_size_text(bn_block_size *size, size_t length);
// `bare`: the name is "" or "/" (by its length). All bindings of a block that have such a name share one
// string: these are the smallest nodes that a peer can send, and the memory that they take has to be in
// proportion.
void bn_size_binding(bn_block_size *size, size_t name_length, bool bare, uint32_t attributes);
void bn_size_copy(bn_block_size *size, const bn_binding *binding);

// --- Placing. What was not added up before gives null or LC_NULL.

struct bn_block_builder {
    bn_block *block = nullptr; // the maker's reference
    uint8_t *record = nullptr, *records_end = nullptr;
    char *text = nullptr, *texts_end = nullptr;
    tstring *bare[2] = {};
};
lc_status bn_block_new(const bn_block_size *size, bn_block_builder *out);
void *bn_place_record(bn_block_builder *builder, size_t bytes); // zero bytes, aligned to 8
// Room for `length` bytes; the NUL after them is set.
char *bn_place_text(bn_block_builder *builder, size_t length);
lc_status bn_place_string(bn_block_builder *builder, const char *bytes, size_t length, tstring **out);
// The caller fills the name at `out_name`, which is null for a bare one, and the attributes' slots, which are
// empty.
lc_status bn_place_binding(bn_block_builder *builder, size_t name_length, bool bare, bool absolute,
                           uint32_t attributes, bn_binding **out, char **out_name);
// A copy of a binding, without the kept parts of its name.
lc_status bn_place_copy(bn_block_builder *builder, const bn_binding *binding, bn_binding **out);

// Fills a slot with an attribute whose record is part of a block: only its value will be freed.
lc_status bn_attrib_array_put_placed(bn_attrib_array *array, uint32_t id, bn_attrib *attrib);
// The block of a binding whose block_distance isn't 0.
bn_block *bn_block_of(bn_binding *binding);
// An empty array with room for `count` bindings.
lc_status bn_binding_array_new_sized(bn_binding_array **out, uint32_t count);
