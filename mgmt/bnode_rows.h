// The table of types, and the wire form of attributes, for mgmt/bnode_*.cpp only. Callers hold no lock.
#pragma once

#include <cstdint>
#include <type_traits>

#include "mgmt/bnode_types.h"

// The meaning of the bytes of a value.
enum class value_shape : uint8_t { none, natural, integer, real, bytes, ipaddr, ipprefix, text, binary };

// The families of the wire form (see the table in bnode_attrib_wire.cpp). `kind` is the first word of the
// attribute. A value of fixed size is preceded by its size, but one with `leading` bytes consists of these
// and then an address.
struct bn_wire_family {
    uint32_t kind;
    uint32_t leading;
};
enum : uint32_t { wire_kind_number = 1, wire_kind_stored = 2, wire_kind_counted = 4 };
inline constexpr bn_wire_family wire_number = {wire_kind_number, 0}, wire_bytes = {wire_kind_stored, 0},
                                wire_ipaddr = {wire_kind_number, 1}, wire_ipprefix = {wire_kind_number, 2},
                                wire_counted = {wire_kind_counted, 0};

struct bn_type_row;
// To text: in memory of malloc(). From text: into an attribute whose value is zero; LC_BAD_TYPE, not logged,
// for a text that can't be converted.
using bn_text_out = lc_status (*)(const bn_type_row *row, const bn_attrib *attrib, char **out);
using bn_text_in = lc_status (*)(const bn_type_row *row, const char *text, bn_attrib *attrib);

struct bn_type_row {
    uint32_t number;
    const char *name;
    uint8_t size; // of the value in bytes; 0 for one that is allocated
    value_shape shape;
    bool numeric;
    bn_text_out text_out;
    bn_text_in text_in;
    bn_wire_family wire; // kind 0: no wire form
    const void *form;    // data for text_out and text_in
};

// Null for an unknown type.
const bn_type_row *bn_type_find(uint32_t type_and_flags);
int bn_value_compare(const bn_type_row *row, const bn_attrib *a, const bn_attrib *b);

// The value as a number, for the shapes natural and integer.
uint64_t bn_value_natural(const bn_type_row *row, const bn_attrib *attrib);
int64_t bn_value_integer(const bn_type_row *row, const bn_attrib *attrib);

// Decimal numbers that take the whole text, in range; the second may have a sign. LC_BAD_TYPE, not logged.
lc_status bn_text_to_natural(const char *text, uint64_t limit, uint64_t *out);
lc_status bn_text_to_integer(const char *text, int64_t least, int64_t most, int64_t *out);

// Outputs a text in memory of malloc(), or returns LC_NULL, logged, if there was no memory for it.
inline lc_status bn_give_text(char *text, char **out) {
    CHECK_NULL(text);
    *out = text;
    return LC_OK;
}

// As lc_str_to_ipaddr and lc_str_to_ipprefix, but every failure is LC_BAD_TYPE and is not logged.
lc_status bn_text_to_ipaddr(const char *text, lc_ipaddr *out);
lc_status bn_text_to_ipprefix(const char *text, lc_ipprefix *out);

// --- The wire form

std::remove_pointer_t<decltype(bn_attrib_copy_func::write)> bn_wire_write;
std::remove_pointer_t<decltype(bn_attrib_copy_func::read)> bn_wire_read;

// An attribute in a buffer that has been checked.
struct bn_wire_attrib {
    const bn_type_row *row;
    uint32_t id, flags;
    const uint8_t *value; // points into the buffer
    uint32_t length;      // of the value, in bytes
    uint32_t used;        // by the whole attribute, in bytes
};
// LC_ASSERTION, logged, if the bytes contain a NUL: as a C string the text would end there.
lc_status bn_check_text(const uint8_t *bytes, uint32_t length);
// Checks the attribute at `offset`. `type` is the expected one, 0 for any. Allocates nothing.
lc_status bn_wire_locate(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_wire_attrib *out);
// Whether the value is a text or bytes, which need memory of their own.
bool bn_wire_has_text(const bn_wire_attrib *found);
// Fills a new attribute. `text` is a copy of the value followed by a NUL, if bn_wire_has_text; it has to
// outlive the attribute. Null: the caller sets the value.
void bn_wire_fill(const bn_wire_attrib *found, char *text, bn_attrib *out);
// Sets the value of a text or binary attribute to `length` bytes and a NUL in memory that outlives the
// attribute.
void bn_attrib_place_value(bn_attrib *attrib, char *text, uint32_t length);
