// The row of a type, for the files of the bindings only.
#pragma once

#include <cstdint>

#include "mgmt/bnode_types.h"

// How the bytes of a value are to be read.
enum class value_shape : uint8_t { none, natural, integer, real, bytes, ipaddr, ipprefix, text, binary };

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
    decltype(bn_attrib_copy_func::write) write;
    decltype(bn_attrib_copy_func::read) read;
    const void *form; // what a text function needs beside the type
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

// The families of the wire form.
using bn_wire_writer = lc_status(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset,
                                 uint32_t *out_written);
using bn_wire_reader = lc_status(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_attrib **out,
                                 uint32_t *out_used);
bn_wire_writer bn_wire_write_number, bn_wire_write_bytes, bn_wire_write_ipaddr, bn_wire_write_ipprefix,
    bn_wire_write_text, bn_wire_write_binary;
bn_wire_reader bn_wire_read_number, bn_wire_read_bytes, bn_wire_read_ipaddr, bn_wire_read_ipprefix,
    bn_wire_read_text, bn_wire_read_binary;
