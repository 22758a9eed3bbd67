// Bindings: nodes of the management tree with their typed attributes, their names and arrays of them.
//
// A name is parts separated by "/"; inside a part "/" and "\" are written with a leading "\". An array owns
// what it holds. _takeover operations move the caller's object in and clear the caller's variable; _const and
// _quick accessors give a pointer that lives as long as its owner. Nothing here is locked: a binding is used
// by one thread at a time.
#pragma once

#include <cstdint>

#include "mgmt/bnode_types.h"
#include "runtime/tstr_array.h"
#include "runtime/tstring.h"
#include "runtime/typed_arrays.h"

// An array whose index is the attribute id; slots may be empty, and then take no memory. The operations are
// those of typed_arrays.h.
struct bn_attrib_slot {
    uint32_t id;
    uint32_t placed; // the attribute's record isn't its own memory (bnode_block.h)
    bn_attrib *attrib;
};
struct bn_attrib_array {
    bn_attrib_slot *slots; // those that are filled, in order of id
    uint32_t length;       // the highest id so far, and 1
    uint32_t count;        // of slots
    uint32_t capacity;
    uint8_t placed_record; // not its own memory either
    uint8_t placed_slots;
};
lc_status bn_attrib_array_new(bn_attrib_array **out);
lc_status bn_attrib_array_new_full(bn_attrib_array **out, const array_options *options); // not looked at
lc_status bn_attrib_array_free(bn_attrib_array **inout);
void bn_attrib_array_release(bn_attrib_array *array);
lc_status bn_attrib_array_duplicate(const bn_attrib_array *array, bn_attrib_array **out);
uint32_t bn_attrib_array_length_quick(const bn_attrib_array *array);
lc_status bn_attrib_array_get(const bn_attrib_array *array, uint32_t id, bn_attrib **out);
bn_attrib *bn_attrib_array_get_quick(const bn_attrib_array *array, uint32_t id);
lc_status bn_attrib_array_set(bn_attrib_array *array, uint32_t id, const bn_attrib *attrib);
lc_status bn_attrib_array_set_takeover(bn_attrib_array *array, uint32_t id, bn_attrib **inout);

// Compares by name and does not sort by itself.
TYPED_ARRAY_DECLARE(bn_binding_array, bn_binding *)

struct bn_binding {
    tstring *name;
    tstr_array *parts;           // unescaped; null until asked for
    uint32_t absolute;           // the name begins with "/"
    uint32_t block_distance;     // from the block that the binding lies in (bnode_block.h); 0 for none
    bn_attrib_array *attributes; // or null
};

// ---- Attributes

lc_status bn_attrib_new(bn_attrib **out);
lc_status bn_attrib_free(bn_attrib **inout);
lc_status bn_attrib_free_value(bn_attrib *attrib);
lc_status bn_attrib_dup(const bn_attrib *attrib, bn_attrib **out);
lc_status bn_attrib_get_type(const bn_attrib *attrib, uint32_t *out_type, uint32_t *out_flags);
lc_status bn_attrib_compare(const bn_attrib *a, const bn_attrib *b, int *out_result);
// The conversion from text, for all types: the whole text, in range, else LC_BAD_TYPE without a line.
lc_status bn_attrib_set_str(bn_attrib *attrib, uint32_t id, uint32_t type, uint32_t flags, const char *text);
lc_status bn_attrib_new_str(bn_attrib **out, uint32_t id, uint32_t type, uint32_t flags, const char *text);
// To text, which is the caller's. Expected type 0 takes any; another than the attribute's is LC_ASSERTION.
lc_status bn_attrib_get_str(const bn_attrib *attrib, uint32_t *out_id, uint32_t expected_type,
                            uint32_t *out_type_and_flags, char **out_text);
lc_status bn_attrib_get_tstring_const(const bn_attrib *attrib, uint32_t *out_id, uint32_t *out_type_and_flags,
                                      const tstring **out);
lc_status bn_attrib_get_tbuf_const(const bn_attrib *attrib, uint32_t *out_id, uint32_t *out_type_and_flags,
                                   const tbuffer **out);

// ---- Bindings

lc_status bn_binding_new_named(bn_binding **out, const char *name);
lc_status bn_binding_new_components(bn_binding **out, const char *name, const bn_attrib_array *attributes);
// From a name, parts or both; what is missing is made from the other.
lc_status bn_binding_new_parts_components(bn_binding **out, const char *name, const tstr_array *parts,
                                          int absolute, const bn_attrib_array *attributes);
lc_status bn_binding_new_parts_components_takeover(bn_binding **out, tstring **inout_name,
                                                   tstr_array **inout_parts, int absolute,
                                                   bn_attrib_array **inout_attributes);
lc_status bn_binding_free(bn_binding **inout);
lc_status bn_binding_dup(const bn_binding *binding, bn_binding **out);
lc_status bn_binding_set_name(bn_binding *binding, const char *name); // forgets the parts
lc_status bn_binding_drop_name_parts(bn_binding *binding);
lc_status bn_binding_set_str(bn_binding *binding, uint32_t id, uint32_t type, uint32_t flags,
                             const char *text);
lc_status bn_binding_new_str(bn_binding **out, const char *name, uint32_t id, uint32_t type, uint32_t flags,
                             const char *text);
// A text that doesn't convert gives a binding with the invalid mark.
lc_status bn_binding_new_str_autoinval(bn_binding **out, const char *name, uint32_t id, uint32_t type,
                                       uint32_t flags, const char *text);
lc_status bn_binding_set_attrib_takeover(bn_binding *binding, bn_attrib **inout_attrib);

// An empty slot reads as 0 and null. The text is the caller's.
lc_status bn_binding_get_str(const bn_binding *binding, uint32_t id, uint32_t expected_type,
                             uint32_t *out_type_and_flags, char **out_text);
lc_status bn_binding_get_tstr(const bn_binding *binding, uint32_t id, uint32_t expected_type,
                              uint32_t *out_type_and_flags, tstring **out);
lc_status bn_binding_get_type(const bn_binding *binding, uint32_t id, uint32_t *out_type,
                              uint32_t *out_flags);
lc_status bn_binding_get_attrib(const bn_binding *binding, uint32_t id, const bn_attrib **out);
lc_status bn_binding_get_name(const bn_binding *binding, const tstring **out);
const char *bn_binding_get_name_quick(const bn_binding *binding);
lc_status bn_binding_get_name_parts_const(const bn_binding *binding, const tstr_array **out_parts,
                                          int *out_absolute); // null when none are kept
lc_status bn_binding_get_name_and_name_parts_const(const bn_binding *binding, const tstring **out_name,
                                                   const tstr_array **out_parts, int *out_absolute);
lc_status bn_binding_get_name_parts(const bn_binding *binding, tstr_array **out_parts); // a copy

// ---- Names

lc_status bn_binding_name_to_parts(const char *name, tstr_array **out_parts, int *out_absolute);
lc_status bn_binding_name_parts_to_name(const tstr_array *parts, int absolute, char **out_text);
lc_status bn_binding_name_parts_to_name_tstr(const tstr_array *parts, int absolute, tstring **out);
// 1 for a match, see tstr_array_wildcard_match; name and pattern must agree in being absolute.
int bn_binding_name_pattern_match(const char *name, const char *pattern);
int bn_binding_name_parts_pattern_match(const tstr_array *parts, int absolute, const char *pattern);

// ---- Arrays of bindings. A name that isn't there gives 0, with index -1 or null.

lc_status bn_binding_array_get_index_by_name(const bn_binding_array *array, const char *name,
                                             int32_t *out_index);
lc_status bn_binding_array_get_binding_by_name(const bn_binding_array *array, const char *name,
                                               const bn_binding **out);
lc_status bn_binding_array_get_binding_by_name_rel(const bn_binding_array *array, const char *prefix,
                                                   const char *relative, const bn_binding **out);
lc_status bn_binding_array_detach_binding_by_name(bn_binding_array *array, const char *name,
                                                  bn_binding **out);
lc_status bn_binding_array_get_value_tstr_by_name(const bn_binding_array *array, const char *name,
                                                  uint32_t *out_type_and_flags, tstring **out);
lc_status bn_binding_array_get_value_tstr_by_name_rel(const bn_binding_array *array, const char *prefix,
                                                      const char *relative, uint32_t *out_type_and_flags,
                                                      tstring **out);
// The first match at or after `start`; index -1 and null when there is none.
lc_status bn_binding_array_get_first_matching_binding(const bn_binding_array *array, const char *pattern,
                                                      uint32_t start, int32_t *out_index,
                                                      const bn_binding **out);
lc_status bn_binding_array_get_first_matching_value_tstr(const bn_binding_array *array, const char *pattern,
                                                         uint32_t start, int32_t *out_index,
                                                         tstring **out_name, tstring **out_value);
// Of every matching binding, in order, the part at `part_index`.
lc_status bn_binding_array_get_name_part_tstr_array(const bn_binding_array *array, const char *pattern,
                                                    uint32_t part_index, tstr_array **out);

// Owners for a scope.
inline void bn_release_attrib(bn_attrib *attrib) {
    (void)bn_attrib_free(&attrib);
}
inline void bn_release_binding(bn_binding *binding) {
    (void)bn_binding_free(&binding);
}
