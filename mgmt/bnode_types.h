// Attributes and the types of their values: the numbers of the types, conversion from and to text, order, and
// wire form. All that depends on the type is in one table (bnode_types.cpp).
#pragma once

#include <cstdint>

#include "runtime/common.h"
#include "runtime/tbuffer.h"
#include "runtime/tstring.h"
#include "runtime/ttime.h"

// Type numbers, as on the wire. A type word is a type, in the low 16 bits, or'ed with flags.
enum : uint32_t {
    bn_type_uint8 = 1,
    bn_type_int8 = 2,
    bn_type_uint16 = 3,
    bn_type_int16 = 4,
    bn_type_uint32 = 5,
    bn_type_int32 = 6,
    bn_type_uint64 = 7,
    bn_type_int64 = 8,
    bn_type_bool = 9,
    bn_type_float32 = 20,
    bn_type_float64 = 21,
    bn_type_char = 40,
    bn_type_ipaddr = 50,
    bn_type_ipprefix = 51,
    bn_type_ipv4addr = 60,
    bn_type_ipv4prefix = 61,
    bn_type_macaddr802 = 62,
    bn_type_ipv6addr = 63,
    bn_type_ipv6prefix = 64,
    bn_type_date = 70,
    bn_type_time_sec = 71,
    bn_type_time_ms = 72,
    bn_type_time_us = 73,
    bn_type_datetime_sec = 74,
    bn_type_datetime_ms = 75,
    bn_type_datetime_us = 76,
    bn_type_duration_sec = 77,
    bn_type_duration_ms = 78,
    bn_type_duration_us = 79,
    bn_type_none = 90,
    bn_type_any = 91, // in queries and tests only; no attribute has it
    bn_type_btype = 92,
    bn_type_attribute = 93,
    bn_type_str = 101, // "string"
    bn_type_utf8_string = 102,
    bn_type_binary = 103,
    bn_type_oid = 105,
    bn_type_link = 120,
    bn_type_name = 121,
    bn_type_hostname = 130,
    bn_type_uri = 131,
    bn_type_charlist = 132,
    bn_type_regex = 133,
    bn_type_globpattern = 134,
};
constexpr uint32_t BN_TYPE_LAST = 134;
constexpr uint32_t BN_TYPE_MASK = 0xffff;
constexpr uint32_t bn_flag_display = 0x10000; // durations: the text is "1.500000 seconds", not a plain number
constexpr uint32_t bn_flag_invalid = 0x40000; // no value: its text could not be converted
constexpr uint32_t bn_flag_deleted = 0x80000; // the node was deleted
constexpr uint32_t bn_flag_absent = 0x100000; // no value, only a type
constexpr uint32_t bn_flag_no_value = bn_flag_invalid | bn_flag_absent;

// Attribute ids, as on the wire; also the index in a bn_attrib_array.
enum : uint32_t {
    bn_attrib_value = 1,
    bn_attrib_none = 4,
    bn_attrib_product_name = 65,
    bn_attrib_module_name = 66,
    bn_attrib_module_version = 67,
    bn_attrib_node_info = 68,
    bn_attrib_capability_mask = 69,
    bn_attrib_revision_id = 129,
    bn_attrib_node_count = 130,
};
constexpr uint32_t BN_ATTRIB_LAST = 130;
inline bool bn_attrib_id_valid(uint32_t id) {
    return id >= 1 && id <= BN_ATTRIB_LAST && id != bn_attrib_none;
}

extern const lc_enum_entry *const bn_type_table;
extern const lc_enum_entry bn_attribute_id_table[];

// Predicates on a type word; false, and 0, with the invalid or the absent flag.
bool bn_type_numeric(uint32_t type_and_flags);
bool bn_type_string(uint32_t type_and_flags);
bool bn_type_tbuf(uint32_t type_and_flags);
bool bn_type_allocs(uint32_t type_and_flags);         // strings and `binary`
uint32_t bn_type_fixed_size(uint32_t type_and_flags); // in bytes; 0 for allocated types

// The address is in network byte order, as inet_pton writes it; that of an IPv4 address takes the first 4
// bytes, and the rest is zero.
struct lc_ipaddr {
    uint8_t family; // 4 or 6
    uint8_t reserved[15];
    uint8_t address[16];
};
struct lc_ipprefix {
    uint8_t family;
    uint8_t mask_length;
    uint8_t reserved[14];
    uint8_t address[16];
};
struct lc_macaddr802 {
    uint8_t bytes[6];
};
struct lc_ipv6addr {
    uint8_t bytes[16];
};
struct lc_ipv6prefix {
    uint8_t address[16];
    uint8_t mask_length;
};
static_assert(sizeof(lc_ipaddr) == 32 && sizeof(lc_ipprefix) == 32 && sizeof(lc_ipv6prefix) == 17);

// Addresses from and to text, which the caller frees with free(). A text that can't be parsed is LC_BAD_TYPE,
// not logged; for lc_str_to_ipaddr and lc_str_to_ipprefix it is LC_ASSERTION, which is logged. An IPv4
// address as a number is in host order; an IPv4 prefix has the address in the upper and the mask in the lower
// 32 bits. The comparisons return less than, equal to or greater than 0.
lc_status lc_str_to_ipaddr(const char *text, lc_ipaddr *out);
lc_status lc_ipaddr_to_str(const lc_ipaddr *value, char **out);
int lc_ipaddr_compare(const lc_ipaddr *a, const lc_ipaddr *b);
lc_status lc_str_to_ipprefix(const char *text, lc_ipprefix *out);
lc_status lc_ipprefix_to_str(const lc_ipprefix *value, char **out);
int lc_ipprefix_compare(const lc_ipprefix *a, const lc_ipprefix *b);
lc_status lc_str_to_ipv4addr(const char *text, uint32_t *out);
lc_status lc_ipv4addr_to_str(uint32_t value, char **out);
lc_status lc_str_to_ipv4prefix(const char *text, uint64_t *out);
lc_status lc_ipv4prefix_to_str(uint64_t value, char **out);
lc_status lc_str_to_macaddr802(const char *text, lc_macaddr802 *out);
lc_status lc_macaddr802_to_str(const lc_macaddr802 *value, char **out);

struct bn_attrib {
    uint32_t type;
    uint32_t type_flags; // low 16 bits always 0
    uint32_t attribute_id;
    uint32_t value_size; // in bytes: the fixed size of the type, or the length of the text or bytes
    union {
        alignas(8) uint8_t bytes[32];
        tstring *string; // owned
        tbuffer *binary; // owned
        // If the attribute is part of a block (bnode_block.h), the record that the pointer points to follows
        // it.
        struct {
            tstring *string;
            tstring record;
        } placed_string;
        struct {
            tbuffer *binary;
            tbuffer record;
        } placed_binary;
    } value;
};
static_assert(sizeof(bn_attrib) == 48);
struct bn_binding;

// The wire form of attributes, indexed by type. The functions are null for a number without a wire form.
// `read` makes a new attribute of `type`, and `write` overwrites or extends the buffer from `offset` on; the
// last out, which may be null, gets the number of bytes.
struct bn_attrib_copy_func {
    lc_status (*write)(const bn_attrib *attrib, tbuffer *buffer, uint32_t offset, uint32_t *out_written);
    lc_status (*read)(const tbuffer *buffer, uint32_t offset, uint32_t type, bn_attrib **out,
                      uint32_t *out_used);
};
extern const bn_attrib_copy_func *const bn_attrib_copy_funcs; // rows 0 to BN_TYPE_LAST
// Write and read an attribute by its entry in the table. A type outside 1 to 134 is LC_ASSERTION, one without
// a wire form LC_NULL. An attribute that is read has a valid id. Received bytes are checked completely before
// anything is allocated.
lc_status bn_attrib_append_wire(const bn_attrib *attrib, tbuffer *buffer);
lc_status bn_attrib_read_wire(const tbuffer *buffer, uint32_t offset, bn_attrib **out, uint32_t *out_used);

// A row for each value type: its name in function names, the type number, the C++ type of the value, the
// parameters of a setter, a pointer to the value that they give, the parameters of a getter, and the
// statement that fills these from `stored`. The functions, bn_binding_get_uint32 for example, are declared at
// the end of this file and defined in bnode_attrib.cpp.
#define BN_PLAIN_VALUE(X, name, number, type)                                                                \
    X(name, number, type, (type value), bn_at(value), (type * out_value), bn_give_plain(out_value, stored))
#define BN_VALUE_TYPES(X)                                                                                    \
    BN_PLAIN_VALUE(X, uint8, bn_type_uint8, uint8_t)                                                         \
    BN_PLAIN_VALUE(X, int8, bn_type_int8, int8_t)                                                            \
    BN_PLAIN_VALUE(X, uint16, bn_type_uint16, uint16_t)                                                      \
    BN_PLAIN_VALUE(X, int16, bn_type_int16, int16_t)                                                         \
    BN_PLAIN_VALUE(X, uint32, bn_type_uint32, uint32_t)                                                      \
    BN_PLAIN_VALUE(X, int32, bn_type_int32, int32_t)                                                         \
    BN_PLAIN_VALUE(X, uint64, bn_type_uint64, uint64_t)                                                      \
    BN_PLAIN_VALUE(X, int64, bn_type_int64, int64_t)                                                         \
    BN_PLAIN_VALUE(X, tbool, bn_type_bool, uint32_t)                                                         \
    BN_PLAIN_VALUE(X, float32, bn_type_float32, float)                                                       \
    BN_PLAIN_VALUE(X, float64, bn_type_float64, double)                                                      \
    BN_PLAIN_VALUE(X, char, bn_type_char, char)                                                              \
    BN_PLAIN_VALUE(X, ipaddr, bn_type_ipaddr, lc_ipaddr)                                                     \
    BN_PLAIN_VALUE(X, ipprefix, bn_type_ipprefix, lc_ipprefix)                                               \
    BN_PLAIN_VALUE(X, ipv4addr, bn_type_ipv4addr, uint32_t)                                                  \
    BN_PLAIN_VALUE(X, ipv4prefix, bn_type_ipv4prefix, uint64_t)                                              \
    X(macaddr802, bn_type_macaddr802, lc_macaddr802, (const lc_macaddr802 *value), value,                    \
      (lc_macaddr802 * out_value), bn_give_plain(out_value, stored))                                         \
    X(ipv6addr, bn_type_ipv6addr, lc_ipv6addr, (uint64_t first, uint64_t last),                              \
      bn_at(bn_join_halves(first, last)), (uint64_t * out_first, uint64_t * out_last),                       \
      bn_give_halves(out_first, out_last, stored))                                                           \
    BN_PLAIN_VALUE(X, ipv6prefix, bn_type_ipv6prefix, lc_ipv6prefix)                                         \
    BN_PLAIN_VALUE(X, date, bn_type_date, lt_date)                                                           \
    BN_PLAIN_VALUE(X, time_sec, bn_type_time_sec, uint32_t)                                                  \
    BN_PLAIN_VALUE(X, time_ms, bn_type_time_ms, lt_time_ms)                                                  \
    BN_PLAIN_VALUE(X, time_us, bn_type_time_us, lt_time_us)                                                  \
    BN_PLAIN_VALUE(X, datetime_sec, bn_type_datetime_sec, uint32_t)                                          \
    BN_PLAIN_VALUE(X, datetime_ms, bn_type_datetime_ms, lt_time_ms)                                          \
    BN_PLAIN_VALUE(X, datetime_us, bn_type_datetime_us, lt_time_us)                                          \
    BN_PLAIN_VALUE(X, duration_sec, bn_type_duration_sec, uint32_t)                                          \
    BN_PLAIN_VALUE(X, duration_ms, bn_type_duration_ms, lt_dur_ms)                                           \
    BN_PLAIN_VALUE(X, duration_us, bn_type_duration_us, lt_dur_us)                                           \
    BN_PLAIN_VALUE(X, btype, bn_type_btype, uint32_t)                                                        \
    BN_PLAIN_VALUE(X, attribute, bn_type_attribute, uint32_t)

// bn_attrib_set_uint32, bn_attrib_new_uint32, bn_attrib_get_uint32, bn_binding_set_uint32,
// bn_binding_new_uint32 and bn_binding_get_uint32, and the same for each of the types above.
//
// Setters replace the old value; an attribute id outside 1 to 130, and 4, is LC_ASSERTION. The outs of
// getters may be null; an attribute of another type is LC_ASSERTION, logged. For an empty slot of a binding
// bn_binding_get_uint32 returns 0 and doesn't change the value; an id past its attributes is LC_NOT_FOUND,
// and no attributes at all LC_NULL.
//
// The two halves of an IPv6 address are its first and its last eight bytes, copied without a conversion.
#define BN_UNPAREN(...) __VA_ARGS__
#define BN_DECLARE_TYPED(name, number, type, in, in_value, outs, give)                                       \
    lc_status bn_attrib_set_##name(bn_attrib *attrib, uint32_t id, uint32_t flags, BN_UNPAREN in);           \
    lc_status bn_attrib_new_##name(bn_attrib **out, uint32_t id, uint32_t flags, BN_UNPAREN in);             \
    lc_status bn_attrib_get_##name(const bn_attrib *attrib, uint32_t *out_id, uint32_t *out_type_and_flags,  \
                                   BN_UNPAREN outs);                                                         \
    lc_status bn_binding_set_##name(bn_binding *binding, uint32_t id, uint32_t flags, BN_UNPAREN in);        \
    lc_status bn_binding_new_##name(bn_binding **out, const char *name_text, uint32_t id, uint32_t flags,    \
                                    BN_UNPAREN in);                                                          \
    lc_status bn_binding_get_##name(const bn_binding *binding, uint32_t id, uint32_t *out_type_and_flags,    \
                                    BN_UNPAREN outs);
BN_VALUE_TYPES(BN_DECLARE_TYPED)
