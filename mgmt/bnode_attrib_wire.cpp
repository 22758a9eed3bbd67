// The bytes of an attribute on the wire: 16 bytes of kind, id, type and flags, then what the type's family
// says. All numbers are big-endian; an address counts as one number of 128 bits, so its bytes stand reversed.
//
// What comes from a peer is bounded here: an id is a place in an array and has to be a valid one, a size has
// to be the type's, a length has to lie within the buffer. An attribute marked invalid or absent has no value
// to take; whatever stands in its place is passed over.
#include <algorithm>
#include <cstring>

#include "mgmt/bnode.h"
#include "mgmt/bnode_rows.h"
#include "runtime/byte_order.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

enum : uint32_t { kind_wire_order = 1, kind_stored_order = 2, kind_counted = 4 };
constexpr uint32_t HEADER_SIZE = 16, TYPE_OFFSET = 8, VALUE_OFFSET = 20;
constexpr uint32_t ADDRESS_SIZE = 16;

static lc_status put_number(tbuffer *buffer, uint32_t offset, uint32_t value) {
    return tb_put_uint32(buffer, offset, raw_word(to_be32(value)));
}
static lc_status get_number(const tbuffer *buffer, uint32_t offset, uint32_t *out) {
    CHECK_STATUS(tb_get_uint32(buffer, offset, out));
    *out = to_host(from_raw_word(*out));
    return LC_OK;
}

// Stored bytes to wire bytes and back: numbers and addresses are turned around, a mask length behind an
// address keeps its place.
static void turn(const uint8_t *from, uint8_t *to, uint32_t size) {
    static_assert(std::endian::native == std::endian::little);
    const uint32_t turned = std::min(size, ADDRESS_SIZE);
    std::reverse_copy(from, from + turned, to);
    memcpy(to + turned, from + turned, size - turned);
}

static lc_status put_header(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset, uint32_t kind) {
    CHECK_NULL(attrib);
    CHECK_STATUS(put_number(buffer, offset, kind));
    CHECK_STATUS(put_number(buffer, offset + 4, attrib->attribute_id));
    CHECK_STATUS(put_number(buffer, offset + TYPE_OFFSET, attrib->type));
    CHECK_STATUS(put_number(buffer, offset + 12, attrib->type_flags));
    return LC_OK;
}

// A new attribute with what the header says of it. On failure `out` is freed by its owner.
static lc_status get_header(const tbuffer *buffer, uint32_t offset, uint32_t type, uint32_t kind,
                            bn_attrib **out) {
    CHECK_STATUS(bn_attrib_new(out));
    bn_attrib *attrib = *out;
    uint32_t kind_read = 0, type_read = 0, flags = 0;
    CHECK_STATUS(get_number(buffer, offset, &kind_read));
    CHECK_STATUS(get_number(buffer, offset + 4, &attrib->attribute_id));
    CHECK_STATUS(get_number(buffer, offset + TYPE_OFFSET, &type_read));
    CHECK_STATUS(get_number(buffer, offset + 12, &flags));
    if (kind_read != kind)
        FAIL_WITH(LC_GENERIC);
    if (type_read != type && type_read != 0) {
        LC_LOG(LC_LOG_ERR, "Attribute of type %s, expected %s",
               lc_enum_to_string_quiet(bn_type_table, static_cast<int32_t>(type_read)),
               lc_enum_to_string_quiet(bn_type_table, static_cast<int32_t>(type)));
        return LC_GENERIC;
    }
    CHECK_CONDITION(bn_attrib_id_valid(attrib->attribute_id));
    attrib->type = type;
    attrib->type_flags = flags & ~BN_TYPE_MASK;
    return LC_OK;
}

static bool has_value(const bn_attrib *attrib) {
    return !(attrib->type_flags & bn_flag_no_value);
}

// ---- Values in place behind a size

static lc_status write_sized(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset, uint32_t kind,
                             uint32_t *out_written) {
    CHECK_STATUS(put_header(attrib, buffer, offset, kind));
    const uint32_t size = attrib->value_size;
    uint8_t bytes[sizeof attrib->value.bytes];
    CHECK_CONDITION(size <= sizeof bytes);
    if (kind == kind_wire_order)
        turn(attrib->value.bytes, bytes, size);
    else
        memcpy(bytes, attrib->value.bytes, size);
    CHECK_STATUS(put_number(buffer, offset + HEADER_SIZE, size));
    CHECK_STATUS(tb_put_buf(buffer, offset + VALUE_OFFSET, bytes, size));
    if (out_written)
        *out_written = VALUE_OFFSET + size;
    return LC_OK;
}

static lc_status read_sized(const tbuffer *buffer, uint32_t offset, uint32_t type, uint32_t kind,
                            bn_attrib **out, uint32_t *out_used) {
    CHECK_NULL(out);
    *out = nullptr;
    owned<bn_attrib, bn_release_attrib> attrib;
    CHECK_STATUS(get_header(buffer, offset, type, kind, &attrib.pointer));
    const bn_type_row *row = bn_type_find(type);
    CHECK_NULL(row);
    uint32_t size = 0;
    CHECK_STATUS(get_number(buffer, offset + HEADER_SIZE, &size));
    const bool empty = size == 0 && (attrib.pointer->type_flags & bn_flag_absent);
    if (size != row->size && !empty)
        FAIL_WITH(LC_GENERIC);
    const uint32_t at = offset + VALUE_OFFSET;
    CHECK_CONDITION(at <= buffer->length && size <= buffer->length - at);
    if (has_value(attrib.pointer) && kind == kind_wire_order)
        turn(buffer->buffer + at, attrib.pointer->value.bytes, size);
    else if (has_value(attrib.pointer))
        memcpy(attrib.pointer->value.bytes, buffer->buffer + at, size);
    if (!(attrib.pointer->type_flags & bn_flag_absent))
        attrib.pointer->value_size = size;
    *out = attrib.take();
    if (out_used)
        *out_used = VALUE_OFFSET + size;
    return LC_OK;
}
lc_status bn_wire_write_number(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset,
                               uint32_t *out_written) {
    return write_sized(attrib, buffer, offset, kind_wire_order, out_written);
}
lc_status bn_wire_read_number(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_attrib **out,
                              uint32_t *out_used) {
    return read_sized(buffer, offset, type, kind_wire_order, out, out_used);
}
lc_status bn_wire_write_bytes(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset,
                              uint32_t *out_written) {
    return write_sized(attrib, buffer, offset, kind_stored_order, out_written);
}
lc_status bn_wire_read_bytes(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_attrib **out,
                             uint32_t *out_used) {
    return read_sized(buffer, offset, type, kind_stored_order, out, out_used);
}

// ---- Addresses: one or two leading bytes of the stored record, then the address

static constexpr uint32_t stored_address = offsetof(lc_ipaddr, address);
static_assert(stored_address == offsetof(lc_ipprefix, address));
static_assert(offsetof(lc_ipprefix, family) == 0 && offsetof(lc_ipprefix, mask_length) == 1);

static lc_status write_address(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset, uint32_t leading,
                               uint32_t *out_written) {
    CHECK_STATUS(put_header(attrib, buffer, offset, kind_wire_order));
    uint8_t address[ADDRESS_SIZE];
    turn(attrib->value.bytes + stored_address, address, ADDRESS_SIZE);
    CHECK_STATUS(tb_put_buf(buffer, offset + HEADER_SIZE, attrib->value.bytes, leading));
    CHECK_STATUS(tb_put_buf(buffer, offset + HEADER_SIZE + leading, address, ADDRESS_SIZE));
    if (out_written)
        *out_written = HEADER_SIZE + leading + ADDRESS_SIZE;
    return LC_OK;
}
static lc_status read_address(const tbuffer *buffer, uint32_t offset, uint32_t type, uint32_t leading,
                              bn_attrib **out, uint32_t *out_used) {
    CHECK_NULL(out);
    *out = nullptr;
    owned<bn_attrib, bn_release_attrib> attrib;
    CHECK_STATUS(get_header(buffer, offset, type, kind_wire_order, &attrib.pointer));
    uint8_t address[ADDRESS_SIZE];
    CHECK_STATUS(tb_get_uint128(buffer, offset + HEADER_SIZE + leading, address));
    if (has_value(attrib.pointer)) {
        memcpy(attrib.pointer->value.bytes, buffer->buffer + offset + HEADER_SIZE, leading);
        turn(address, attrib.pointer->value.bytes + stored_address, ADDRESS_SIZE);
    }
    if (!(attrib.pointer->type_flags & bn_flag_absent))
        attrib.pointer->value_size = sizeof(lc_ipaddr);
    *out = attrib.take();
    if (out_used)
        *out_used = HEADER_SIZE + leading + ADDRESS_SIZE;
    return LC_OK;
}
lc_status bn_wire_write_ipaddr(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset,
                               uint32_t *out_written) {
    return write_address(attrib, buffer, offset, 1, out_written);
}
lc_status bn_wire_read_ipaddr(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_attrib **out,
                              uint32_t *out_used) {
    return read_address(buffer, offset, type, 1, out, out_used);
}
lc_status bn_wire_write_ipprefix(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset,
                                 uint32_t *out_written) {
    return write_address(attrib, buffer, offset, 2, out_written);
}
lc_status bn_wire_read_ipprefix(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_attrib **out,
                                uint32_t *out_used) {
    return read_address(buffer, offset, type, 2, out, out_used);
}

// ---- Counted values

static lc_status write_counted(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset, const void *bytes,
                               uint32_t length, uint32_t *out_written) {
    CHECK_STATUS(put_header(attrib, buffer, offset, kind_counted));
    CHECK_STATUS(put_number(buffer, offset + HEADER_SIZE, length));
    CHECK_STATUS(tb_put_buf(buffer, offset + VALUE_OFFSET, bytes, length));
    if (out_written)
        *out_written = VALUE_OFFSET + length;
    return LC_OK;
}
lc_status bn_wire_write_text(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset,
                             uint32_t *out_written) {
    CHECK_NULL(attrib);
    const tstring *text = attrib->value.string;
    return write_counted(attrib, buffer, offset, ts_str_maybe(text),
                         text ? static_cast<uint32_t>(text->length) : 0, out_written);
}
lc_status bn_wire_write_binary(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset,
                               uint32_t *out_written) {
    CHECK_NULL(attrib);
    const tbuffer *bytes = attrib->value.binary;
    return write_counted(attrib, buffer, offset, tb_buf_maybe(bytes), bytes ? bytes->length : 0, out_written);
}

static lc_status take_text(bn_attrib *attrib, char **inout_bytes, uint32_t length) {
    CHECK_STATUS(ts_new_str_takeover(&attrib->value.string, inout_bytes, static_cast<int32_t>(length), -1));
    // A peer's text that isn't UTF-8 after all is told in the log and stays a plain text.
    if (attrib->type == bn_type_utf8_string)
        LOG_STATUS(ts_set_utf8(attrib->value.string, 1));
    return LC_OK;
}
static lc_status take_binary(bn_attrib *attrib, char **inout_bytes, uint32_t length) {
    auto *bytes = reinterpret_cast<uint8_t *>(*inout_bytes);
    const lc_status status = tb_new_takeover(&attrib->value.binary, &bytes, length, length);
    *inout_bytes = reinterpret_cast<char *>(bytes);
    return status;
}
static lc_status read_counted(const tbuffer *buffer, uint32_t offset, uint32_t type,
                              lc_status (*take)(bn_attrib *, char **, uint32_t), bn_attrib **out,
                              uint32_t *out_used) {
    CHECK_NULL(out);
    *out = nullptr;
    owned<bn_attrib, bn_release_attrib> attrib;
    owned_text bytes;
    uint32_t length = 0, used = 0;
    CHECK_STATUS(get_header(buffer, offset, type, kind_counted, &attrib.pointer));
    CHECK_STATUS(tb_get_str(buffer, offset + HEADER_SIZE, -1, 0, 1, 1, &bytes.pointer, &length, &used));
    if (has_value(attrib.pointer)) {
        CHECK_STATUS(take(attrib.pointer, &bytes.pointer, length));
        attrib.pointer->value_size = length;
    }
    *out = attrib.take();
    if (out_used)
        *out_used = HEADER_SIZE + used;
    return LC_OK;
}
lc_status bn_wire_read_text(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_attrib **out,
                            uint32_t *out_used) {
    return read_counted(buffer, offset, type, take_text, out, out_used);
}
lc_status bn_wire_read_binary(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_attrib **out,
                              uint32_t *out_used) {
    return read_counted(buffer, offset, type, take_binary, out, out_used);
}

// ---- Through the table

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
lc_status bn_attrib_read_wire(const tbuffer *buffer, uint32_t offset, bn_attrib **out, uint32_t *out_used) {
    CHECK_NULL(out);
    *out = nullptr;
    uint32_t type = 0;
    CHECK_CONDITION(offset <= tb_size_max);
    CHECK_STATUS(get_number(buffer, offset + TYPE_OFFSET, &type));
    CHECK_CONDITION(type >= 1 && type <= BN_TYPE_LAST);
    CHECK_NULL(bn_attrib_copy_funcs[type].read);
    CHECK_STATUS(bn_attrib_copy_funcs[type].read(buffer, offset, type, out, out_used));
    return LC_OK;
}
