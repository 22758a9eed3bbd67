// The wire form of attributes. All numbers are big-endian.
//
//   offset  size
//        0     4  kind: 1 number or address, 2 bytes of fixed size, 4 text or bytes with a length
//        4     4  attribute id
//        8     4  type
//       12     4  type flags, low 16 bits 0
//       16     4  size or length of the value, followed by the value
//
// Only ipaddr and ipprefix have no size: at offset 16 they have the family, in ipprefix the mask length, and
// the address. An address is sent as one number of 128 bits, that is with its bytes reversed.
//
// Bytes from a peer are checked before any memory is allocated for them: the id must be valid, the size that
// of the type, the length within the buffer, and a text must not contain a NUL. An attribute that is marked
// invalid or absent has no value; the bytes in its place are skipped.
#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "mgmt/bnode.h"
#include "mgmt/bnode_rows.h"
#include "runtime/byte_order.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

constexpr uint32_t HEADER_SIZE = 16, TYPE_OFFSET = 8;
constexpr uint32_t ADDRESS_SIZE = 16;

namespace {

constexpr uint32_t stored_address = offsetof(lc_ipaddr, address);
static_assert(stored_address == offsetof(lc_ipprefix, address));
static_assert(offsetof(lc_ipprefix, family) == 0 && offsetof(lc_ipprefix, mask_length) == 1);

bool has_value(uint32_t flags) {
    return !(flags & bn_flag_no_value);
}

// Converts between stored bytes (little-endian) and wire bytes by reversing them. The mask length that
// follows the address in an ipv6prefix stays in its place.
void reverse_value(const uint8_t *from, uint8_t *to, uint32_t size) {
    static_assert(std::endian::native == std::endian::little);
    const uint32_t turned = std::min(size, ADDRESS_SIZE);
    std::reverse_copy(from, from + turned, to);
    memcpy(to + turned, from + turned, size - turned);
}

// --- Writing

lc_status put_be32(tbuffer *buffer, uint32_t offset, uint32_t value) {
    return tb_put_uint32(buffer, offset, raw_word(to_be32(value)));
}
// This and put_value write to the buffer and return the number of bytes written in `out`.
lc_status put_sized(tbuffer *buffer, uint32_t offset, const void *bytes, uint32_t size, uint32_t *out) {
    CHECK_STATUS(put_be32(buffer, offset, size));
    CHECK_STATUS(tb_put_buf(buffer, offset + 4, bytes, size));
    *out = 4 + size;
    return LC_OK;
}
lc_status put_value(const bn_type_row *row, const bn_attrib *attrib, tbuffer *buffer, uint32_t offset,
                    uint32_t *out) {
    if (row->shape == value_shape::text) {
        // Null for an attribute without a value, which is sent with length 0.
        const tstring *text = attrib->value.string;
        const uint32_t length = text ? static_cast<uint32_t>(text->length) : 0;
        return put_sized(buffer, offset, ts_str_maybe(text), length, out);
    }
    if (row->shape == value_shape::binary) {
        const tbuffer *binary = attrib->value.binary;
        return put_sized(buffer, offset, tb_buf_maybe(binary), binary ? binary->length : 0, out);
    }
    uint8_t bytes[sizeof attrib->value.bytes];
    const uint32_t leading = row->wire.leading, size = attrib->value_size;
    if (leading) {
        // Family, and mask length of a prefix, then the address; the gap between them isn't sent.
        memcpy(bytes, attrib->value.bytes, leading);
        reverse_value(attrib->value.bytes + stored_address, bytes + leading, ADDRESS_SIZE);
        *out = leading + ADDRESS_SIZE;
        return tb_put_buf(buffer, offset, bytes, *out);
    }
    CHECK_CONDITION(size <= sizeof bytes);
    if (row->wire.kind == wire_kind_number)
        reverse_value(attrib->value.bytes, bytes, size);
    else
        memcpy(bytes, attrib->value.bytes, size);
    return put_sized(buffer, offset, bytes, size, out);
}

} // namespace

lc_status bn_wire_write(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset, uint32_t *out_written) {
    CHECK_NULL(attrib);
    CHECK_NULL(buffer);
    const bn_type_row *row = bn_type_find(attrib->type);
    CHECK_CONDITION(row && row->wire.kind);
    const be32 header[] = {to_be32(row->wire.kind), to_be32(attrib->attribute_id), to_be32(attrib->type),
                           to_be32(attrib->type_flags)};
    static_assert(sizeof header == HEADER_SIZE);
    uint32_t written = 0;
    CHECK_STATUS(tb_put_buf(buffer, offset, header, sizeof header));
    CHECK_STATUS(put_value(row, attrib, buffer, offset + HEADER_SIZE, &written));
    if (out_written)
        *out_written = HEADER_SIZE + written;
    return LC_OK;
}
lc_status bn_attrib_append_wire(const bn_attrib *attrib, tbuffer *buffer) {
    CHECK_NULL(attrib);
    CHECK_NULL(buffer);
    CHECK_CONDITION(attrib->type >= 1 && attrib->type <= BN_TYPE_LAST);
    const bn_attrib_copy_func *row = &bn_attrib_copy_funcs[attrib->type];
    if (!row->write) {
        LC_LOG(LC_LOG_ERR, "Couldn't get attrib copy out func for type %s",
               lc_enum_to_string_quiet(bn_type_table, static_cast<int32_t>(attrib->type)));
        return LC_NULL;
    }
    CHECK_STATUS(row->write(attrib, buffer, buffer->length, nullptr));
    return LC_OK;
}

// --- Reading

namespace {

uint32_t load_be32(const uint8_t *bytes) {
    be32 wire;
    memcpy(wire.bytes, bytes, sizeof wire);
    return to_host(wire);
}

} // namespace

lc_status bn_check_text(const uint8_t *bytes, uint32_t length) {
    const void *nul = length ? memchr(bytes, 0, length) : nullptr;
    if (!nul)
        return LC_OK;
    LC_LOG(LC_LOG_ERR, "Received string of %u bytes contains a NUL at offset %u", length,
           static_cast<uint32_t>(static_cast<const uint8_t *>(nul) - bytes));
    return LC_ASSERTION;
}

namespace {

lc_status check_type(uint32_t found, uint32_t expected) {
    // 0 leaves the type to the receiver that expects a certain one.
    if (found == expected || found == 0)
        return LC_OK;
    LC_LOG(LC_LOG_ERR, "Attribute of type %s, expected %s",
           lc_enum_to_string_quiet(bn_type_table, static_cast<int32_t>(found)),
           lc_enum_to_string_quiet(bn_type_table, static_cast<int32_t>(expected)));
    return LC_GENERIC;
}
// Locates the value. `at` is what follows the 16 bytes of the head, and `rest` the number of bytes from there
// to the end of the buffer.
lc_status locate_value(bn_wire_attrib *out, const uint8_t *at, uint32_t rest) {
    const bn_type_row *row = out->row;
    if (row->wire.leading) {
        out->value = at;
        out->length = row->wire.leading + ADDRESS_SIZE;
        CHECK_CONDITION(out->length <= rest);
        return LC_OK;
    }
    CHECK_CONDITION(rest >= 4);
    out->value = at + 4;
    out->length = load_be32(at);
    rest -= 4;
    if (row->wire.kind == wire_kind_counted) {
        if (out->length > rest)
            FAIL_WITH(LC_NO_BUFFER_SPACE);
        if (row->shape == value_shape::text)
            CHECK_QUIET(bn_check_text(out->value, out->length));
        return LC_OK;
    }
    // An absent value may have its fixed size or none.
    if (out->length != row->size && !(out->length == 0 && (out->flags & bn_flag_absent)))
        FAIL_WITH(LC_GENERIC);
    CHECK_CONDITION(out->length <= rest);
    return LC_OK;
}

} // namespace

lc_status bn_wire_locate(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_wire_attrib *out) {
    CHECK_NULL(buffer);
    CHECK_CONDITION(offset <= buffer->length && HEADER_SIZE <= buffer->length - offset);
    const uint8_t *at = buffer->buffer + offset;
    const uint32_t type_found = load_be32(at + TYPE_OFFSET);
    if (!type)
        type = type_found;
    CHECK_CONDITION(type >= 1 && type <= BN_TYPE_LAST);
    const bn_type_row *row = bn_type_find(type);
    CHECK_NULL(row);
    CHECK_NULL(bn_attrib_copy_funcs[type].read);
    // The kind is checked before the value, whose layout depends on it.
    if (load_be32(at) != row->wire.kind)
        FAIL_WITH(LC_GENERIC);
    CHECK_QUIET(check_type(type_found, type));
    // Flags in the low 16 bits, where the type is in a type word, are dropped.
    *out = {row, load_be32(at + 4), load_be32(at + 12) & ~BN_TYPE_MASK, nullptr, 0, 0};
    CHECK_CONDITION(bn_attrib_id_valid(out->id));
    CHECK_QUIET(locate_value(out, at + HEADER_SIZE, buffer->length - offset - HEADER_SIZE));
    out->used = static_cast<uint32_t>(out->value - at) + out->length;
    return LC_OK;
}

bool bn_wire_has_text(const bn_wire_attrib *found) {
    return found->row->wire.kind == wire_kind_counted && has_value(found->flags);
}

namespace {

void fill_in_place(const bn_wire_attrib *found, bn_attrib *out) {
    const uint32_t leading = found->row->wire.leading;
    // An invalid attribute keeps the size of its type, an absent one has the size 0.
    if (!(found->flags & bn_flag_absent))
        out->value_size = found->row->size;
    if (!has_value(found->flags))
        return;
    if (leading) {
        memcpy(out->value.bytes, found->value, leading);
        reverse_value(found->value + leading, out->value.bytes + stored_address, ADDRESS_SIZE);
    } else if (found->row->wire.kind == wire_kind_number) {
        reverse_value(found->value, out->value.bytes, found->length);
    } else {
        memcpy(out->value.bytes, found->value, found->length);
    }
}
// A text of type utf8_string that isn't valid UTF-8 is logged and kept, without the mark.
void mark_utf8(bn_attrib *attrib) {
    if (attrib->type == bn_type_utf8_string)
        LOG_STATUS(ts_set_utf8(attrib->value.string, 1));
}

} // namespace

void bn_wire_fill(const bn_wire_attrib *found, char *text, bn_attrib *out) {
    out->attribute_id = found->id;
    out->type = found->row->number;
    out->type_flags = found->flags;
    if (found->row->wire.kind != wire_kind_counted) {
        fill_in_place(found, out);
    } else if (text) {
        bn_attrib_place_value(out, text, found->length);
        mark_utf8(out);
    }
}

namespace {

lc_status copy_value(const bn_wire_attrib *found, bn_attrib *attrib) {
    owned_text bytes(static_cast<char *>(malloc(size_t{found->length} + 1)));
    CHECK_NULL(bytes.pointer);
    memcpy(bytes.pointer, found->value, found->length);
    bytes.pointer[found->length] = 0;
    attrib->value_size = found->length;
    if (found->row->shape == value_shape::text) {
        CHECK_STATUS(ts_new_str_takeover(&attrib->value.string, &bytes.pointer,
                                         static_cast<int32_t>(found->length), -1));
        mark_utf8(attrib);
        return LC_OK;
    }
    // tb_new_takeover may enlarge the memory, which is why it is freed here only after a failure.
    auto *taken = reinterpret_cast<uint8_t *>(bytes.take());
    const lc_status status = tb_new_takeover(&attrib->value.binary, &taken, found->length, found->length);
    free(taken);
    return status;
}

} // namespace

lc_status bn_wire_read(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_attrib **out,
                       uint32_t *out_used) {
    CHECK_NULL(out);
    *out = nullptr;
    bn_wire_attrib found{};
    CHECK_QUIET(bn_wire_locate(buffer, offset, type, &found));
    owned<bn_attrib, bn_release_attrib> attrib;
    CHECK_STATUS(bn_attrib_new(&attrib.pointer));
    bn_wire_fill(&found, nullptr, attrib.pointer);
    if (bn_wire_has_text(&found))
        CHECK_STATUS(copy_value(&found, attrib.pointer));
    *out = attrib.take();
    if (out_used)
        *out_used = found.used;
    return LC_OK;
}
lc_status bn_attrib_read_wire(const tbuffer *buffer, uint32_t offset, bn_attrib **out, uint32_t *out_used) {
    return bn_wire_read(buffer, offset, 0, out, out_used);
}
