// Blocks. The memory begins with the reference count, followed by the records, each aligned to 8 bytes, and
// then by the texts, which need no alignment. A placed binding finds its block by its distance from the
// start, in units of 8 bytes.
#include "mgmt/bnode_block.h"

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <new>

#include "mgmt/bnode_rows.h"

struct bn_block {
    std::atomic<uint32_t> holders;
};
constexpr size_t GRAIN = 8;
constexpr size_t in_grains(size_t bytes) {
    return (bytes + GRAIN - 1) / GRAIN * GRAIN;
}
constexpr size_t HEAD = in_grains(sizeof(bn_block));

void bn_block_release(bn_block *block) {
    // acq_rel: what the other holders have done with the block happens before it is freed.
    if (block && block->holders.fetch_sub(1, std::memory_order_acq_rel) == 1)
        free(block);
}

// --- Sizes

void bn_size_record(bn_block_size *size, size_t bytes) {
    size->records += in_grains(bytes);
}
void bn_size_text(bn_block_size *size, size_t length) {
    size->texts += length + 1;
}
void bn_size_binding(bn_block_size *size, size_t name_length, bool bare, uint32_t attributes) {
    bn_size_record(size, sizeof(bn_binding));
    // Only the first of the bindings with this bare name needs a string.
    if (!bare || !size->bare[name_length]) {
        bn_size_record(size, sizeof(tstring));
        bn_size_text(size, name_length);
    }
    if (bare)
        size->bare[name_length] = true;
    if (attributes) {
        bn_size_record(size, sizeof(bn_attrib_array));
        bn_size_record(size, attributes * sizeof(bn_attrib_slot));
        bn_size_record(size, attributes * sizeof(bn_attrib));
    }
}

namespace {

bool is_bare(const tstring *name) {
    return name->length == 0 || (name->length == 1 && name->buffer[0] == '/');
}
uint32_t count_attributes(const bn_binding *binding) {
    return binding->attributes ? binding->attributes->count : 0;
}
const tstring *string_value_of(const bn_attrib *attrib) {
    const bn_type_row *row = bn_type_find(attrib->type);
    return row && row->shape == value_shape::text ? attrib->value.string : nullptr;
}
const tbuffer *binary_value_of(const bn_attrib *attrib) {
    const bn_type_row *row = bn_type_find(attrib->type);
    return row && row->shape == value_shape::binary ? attrib->value.binary : nullptr;
}

} // namespace

void bn_size_copy(bn_block_size *size, const bn_binding *binding) {
    const uint32_t count = count_attributes(binding);
    bn_size_binding(size, static_cast<size_t>(binding->name->length), is_bare(binding->name), count);
    for (uint32_t i = 0; i < count; i++) {
        const bn_attrib *attrib = binding->attributes->slots[i].attrib;
        if (const tstring *text = string_value_of(attrib))
            bn_size_text(size, static_cast<size_t>(text->length));
        else if (const tbuffer *binary = binary_value_of(attrib))
            bn_size_text(size, binary->length);
    }
}

// --- Placing objects in the block

lc_status bn_block_new(const bn_block_size *size, bn_block_builder *out) {
    auto *memory = static_cast<uint8_t *>(malloc(HEAD + size->records + size->texts));
    CHECK_NULL(memory);
    out->block = new (memory) bn_block;
    out->block->holders.store(1, std::memory_order_relaxed);
    out->record = memory + HEAD;
    out->records_end = out->record + size->records;
    out->text = reinterpret_cast<char *>(out->records_end);
    out->texts_end = out->text + size->texts;
    return LC_OK;
}
void *bn_place_record(bn_block_builder *builder, size_t bytes) {
    uint8_t *record = builder->record;
    if (in_grains(bytes) > static_cast<size_t>(builder->records_end - record))
        return nullptr;
    builder->record += in_grains(bytes);
    return memset(record, 0, bytes);
}
char *bn_place_text(bn_block_builder *builder, size_t length) {
    char *text = builder->text;
    // ">=", since the NUL needs a byte too.
    if (length >= static_cast<size_t>(builder->texts_end - text))
        return nullptr;
    builder->text += length + 1;
    text[length] = 0;
    return text;
}
lc_status bn_place_string(bn_block_builder *builder, const char *bytes, size_t length, tstring **out) {
    *out = static_cast<tstring *>(bn_place_record(builder, sizeof(tstring)));
    CHECK_NULL(*out);
    char *text = bn_place_text(builder, length);
    CHECK_NULL(text);
    memcpy(text, bytes, length);
    ts_place(*out, text, static_cast<int32_t>(length));
    return LC_OK;
}

namespace {

lc_status place_bare(bn_block_builder *builder, size_t length, tstring **out) {
    // All bindings with this name share the string, since names are replaced, never changed in place.
    tstring **shared = &builder->bare[length];
    if (!*shared)
        // Of length 0 or 1.
        CHECK_QUIET(bn_place_string(builder, "/", length, shared));
    *out = *shared;
    return LC_OK;
}
lc_status place_name(bn_block_builder *builder, size_t length, tstring **out, char **out_text) {
    *out = static_cast<tstring *>(bn_place_record(builder, sizeof(tstring)));
    CHECK_NULL(*out);
    *out_text = bn_place_text(builder, length);
    CHECK_NULL(*out_text);
    ts_place(*out, *out_text, static_cast<int32_t>(length));
    return LC_OK;
}
lc_status place_attributes(bn_block_builder *builder, uint32_t count, bn_attrib_array **out) {
    auto *array = static_cast<bn_attrib_array *>(bn_place_record(builder, sizeof(bn_attrib_array)));
    CHECK_NULL(array);
    array->slots = static_cast<bn_attrib_slot *>(bn_place_record(builder, count * sizeof(bn_attrib_slot)));
    CHECK_NULL(array->slots);
    array->capacity = count;
    array->placed_record = array->placed_slots = true;
    *out = array;
    return LC_OK;
}

} // namespace

lc_status bn_place_binding(bn_block_builder *builder, size_t name_length, bool bare, bool absolute,
                           uint32_t attributes, bn_binding **out, char **out_name) {
    *out = nullptr;
    *out_name = nullptr;
    bn_block *block = builder->block;
    auto *binding = static_cast<bn_binding *>(bn_place_record(builder, sizeof(bn_binding)));
    CHECK_NULL(binding);
    binding->absolute = absolute;
    if (bare)
        CHECK_QUIET(place_bare(builder, name_length, &binding->name));
    else
        CHECK_QUIET(place_name(builder, name_length, &binding->name, out_name));
    if (attributes)
        CHECK_QUIET(place_attributes(builder, attributes, &binding->attributes));
    const ptrdiff_t distance = reinterpret_cast<uint8_t *>(binding) - reinterpret_cast<uint8_t *>(block);
    binding->block_distance = static_cast<uint32_t>(static_cast<size_t>(distance) / GRAIN);
    const uint32_t holders = block->holders.load(std::memory_order_relaxed);
    block->holders.store(holders + 1, std::memory_order_relaxed); // only its maker has the block so far
    *out = binding;
    return LC_OK;
}
bn_block *bn_block_of(bn_binding *binding) {
    return reinterpret_cast<bn_block *>(reinterpret_cast<uint8_t *>(binding) -
                                        binding->block_distance * GRAIN);
}

namespace {

lc_status place_value(bn_block_builder *builder, const bn_attrib *from, bn_attrib *to) {
    const tstring *string = string_value_of(from);
    const tbuffer *binary = binary_value_of(from);
    if (!string && !binary) {
        // A value in place, or none; copying the record is enough.
        *to = *from;
        return LC_OK;
    }
    const size_t length = string ? static_cast<size_t>(string->length) : binary->length;
    char *text = bn_place_text(builder, length);
    CHECK_NULL(text);
    memcpy(text, string ? string->buffer : reinterpret_cast<const char *>(binary->buffer), length);
    to->type = from->type;
    to->type_flags = from->type_flags;
    to->attribute_id = from->attribute_id;
    bn_attrib_place_value(to, text, static_cast<uint32_t>(length));
    if (string) {
        to->value.string->utf8 = string->utf8;
        to->value.string->characters = string->characters;
    }
    return LC_OK;
}

} // namespace

lc_status bn_place_copy(bn_block_builder *builder, const bn_binding *binding, bn_binding **out) {
    const uint32_t count = count_attributes(binding);
    const tstring *name = binding->name;
    owned<bn_binding, bn_release_binding> copy;
    char *text = nullptr;
    CHECK_QUIET(bn_place_binding(builder, static_cast<size_t>(name->length), is_bare(name),
                                 binding->absolute != 0, count, &copy.pointer, &text));
    if (text)
        memcpy(text, name->buffer, static_cast<size_t>(name->length));
    // Without attributes this takes no room, but isn't null either.
    auto *attribs = static_cast<bn_attrib *>(bn_place_record(builder, count * sizeof(bn_attrib)));
    CHECK_NULL(attribs);
    for (uint32_t i = 0; i < count; i++) {
        CHECK_QUIET(place_value(builder, binding->attributes->slots[i].attrib, &attribs[i]));
        CHECK_QUIET(bn_attrib_array_put_placed(copy.pointer->attributes, binding->attributes->slots[i].id,
                                               &attribs[i]));
    }
    // The highest id may be greater than the last filled slot, if that has been emptied.
    if (count)
        copy.pointer->attributes->length = binding->attributes->length;
    else if (binding->attributes)
        CHECK_QUIET(bn_attrib_array_duplicate(binding->attributes, &copy.pointer->attributes));
    *out = copy.take();
    return LC_OK;
}
