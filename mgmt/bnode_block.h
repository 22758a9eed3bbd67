// The bindings of a message in one allocation, with their names, attributes and values.
//
// To make a block, add up the sizes of everything that goes into it, allocate it, then place exactly that. A
// placed binding is used and freed like any other, and whatever it holds can be replaced. The block counts
// its holders: its maker and each placed binding. The last one to let go frees the memory, so one binding
// kept from a large message keeps all of that message; copy it with bn_binding_dup if it has to last.
#pragma once

#include <cstddef>
#include <cstdint>

#include "mgmt/bnode.h"
#include "runtime/guards.h"

struct bn_block;
void bn_block_release(bn_block *block); // null is nothing
using owned_block = owned<bn_block, bn_block_release>;

// ---- Adding up, in bytes

struct bn_block_size {
    size_t records, texts;
    bool bare[2]; // "" and "/" occur as names
};
void bn_size_record(bn_block_size *size, size_t bytes);
void bn_size_text(bn_block_size *size, size_t length);
// `bare`: the name is "" or "/", as its length says. All bindings of the block with such a name share it,
// since they are the smallest that a peer can send.
void bn_size_binding(bn_block_size *size, size_t name_length, bool bare, uint32_t attributes);
void bn_size_copy(bn_block_size *size, const bn_binding *binding);

// ---- Placing. Null, or LC_NULL, for what was not counted.

struct bn_block_builder {
    bn_block *block = nullptr; // held by whoever makes it
    uint8_t *record = nullptr, *records_end = nullptr;
    char *text = nullptr, *texts_end = nullptr;
    tstring *bare[2] = {};
};
lc_status bn_block_new(const bn_block_size *size, bn_block_builder *out);
void *bn_place_record(bn_block_builder *builder, size_t bytes); // zero bytes, aligned to 8
// Room for `length` bytes and a NUL.
char *bn_place_text(bn_block_builder *builder, size_t length);
lc_status bn_place_string(bn_block_builder *builder, const char *bytes, size_t length, tstring **out);
// `out_name` is null for a bare name; otherwise it is room for the name, which the caller fills. The slots
// for the attributes are empty.
lc_status bn_place_binding(bn_block_builder *builder, size_t name_length, bool bare, bool absolute,
                           uint32_t attributes, bn_binding **out, char **out_name);
// Without the parts.
lc_status bn_place_copy(bn_block_builder *builder, const bn_binding *binding, bn_binding **out);

// Fills a slot with an attribute that isn't freed itself, only what it holds.
lc_status bn_attrib_array_put_placed(bn_attrib_array *array, uint32_t id, bn_attrib *attrib);
// Of a placed binding.
bn_block *bn_block_of(bn_binding *binding);
// An empty array with room for `count` bindings.
lc_status bn_binding_array_new_sized(bn_binding_array **out, uint32_t count);
