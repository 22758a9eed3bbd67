// The row of a type, for the files of the bindings only.
#pragma once

#include <cstdint>
#include <type_traits>

#include "mgmt/bnode_types.h"

// How the bytes of a value are to be read.
enum class value_shape : uint8_t { none, natural, integer, real, bytes, ipaddr, ipprefix, text, binary };

// The families of the wire form. A value in place has its size before it, or `leading` bytes of its record
// and then an address; a text or binary its length.
struct bn_wire_family {
    uint32_t kind;
    uint32_t leading;
};
enum : uint32_t { wire_kind_number = 1, wire_kind_stored = 2, wire_kind_counted = 4 };
inline constexpr bn_wire_family wire_number = {wire_kind_number, 0}, wire_bytes = {wire_kind_stored, 0},
                                wire_ipaddr = {wire_kind_number, 1}, wire_ipprefix = {wire_kind_number, 2},
                                wire_counted = {wire_kind_counted, 0};

struct bn_type_row;
// To text: a heap text. From text: into an attribute whose value is zero; LC_BAD_TYPE without a line.
using bn_text_out = lc_status (*)(const bn_type_row *row, const bn_attrib *attrib, char **out);
using bn_text_in = lc_status (*)(const bn_type_row *row, const char *text, bn_attrib *attrib);

struct bn_type_row {
    uint32_t number;
    const char *name;
    uint8_t size; // of a value in place; 0 for allocated ones
    value_shape shape;
    bool numeric;
    bn_text_out text_out;
    bn_text_in text_in;
    bn_wire_family wire; // kind 0: none
    const void *form;    // further data for the text functions
};

// Null for a number that is no type.
const bn_type_row *bn_type_find(uint32_t type_and_flags);
int bn_value_compare(const bn_type_row *row, const bn_attrib *a, const bn_attrib *b);

// A value in place as a number; natural and integer shapes.
uint64_t bn_value_natural(const bn_type_row *row, const bn_attrib *attrib);
int64_t bn_value_integer(const bn_type_row *row, const bn_attrib *attrib);

// Whole texts of decimal digits, with a sign only for the second; LC_BAD_TYPE without a line.
lc_status bn_text_to_natural(const char *text, uint64_t limit, uint64_t *out);
lc_status bn_text_to_integer(const char *text, int64_t least, int64_t most, int64_t *out);

// As the operations of bnode_types.h, but nothing is logged and every failure is LC_BAD_TYPE.
lc_status bn_text_to_ipaddr(const char *text, lc_ipaddr *out);
lc_status bn_text_to_ipprefix(const char *text, lc_ipprefix *out);

// ---- On the wire

std::remove_pointer_t<decltype(bn_attrib_copy_func::write)> bn_wire_write;
std::remove_pointer_t<decltype(bn_attrib_copy_func::read)> bn_wire_read;

// An attribute that was found well formed in the buffer.
struct bn_wire_attrib {
    const bn_type_row *row;
    uint32_t id, flags;
    const uint8_t *value; // in the buffer
    uint32_t length;      // of the value
    uint32_t used;        // of the whole
};
// LC_ASSERTION with a line for a NUL among the bytes, since what follows it would be lost.
lc_status bn_check_text(const uint8_t *bytes, uint32_t length);
// Type 0 takes the one that the bytes have. Nothing is allocated.
lc_status bn_wire_locate(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_wire_attrib *out);
// Whether its value is a string or bytes, which need memory besides the attribute.
bool bn_wire_has_text(const bn_wire_attrib *found);
// Fills a new attribute. `text`: a copy of the value followed by a NUL, if bn_wire_has_text.
void bn_wire_fill(const bn_wire_attrib *found, char *text, bn_attrib *out);
// The value of a text or binary, in memory that outlives the attribute: `length` bytes and a NUL.
void bn_attrib_place_value(bn_attrib *attrib, char *text, uint32_t length);
