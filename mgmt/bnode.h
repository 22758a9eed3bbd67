// Bindings: nodes of the management tree. A binding has a name, "/qv/wccpd/wccp/srv_grp/config/51/weight" for
// example, and typed attributes, usually just the one with the id "value".
//
// A name consists of parts separated by "/"; inside a part "/" is written "\/", and a "\" before one of these
// two characters "\\". An absolute name begins with "/".
//
// Ownership: arrays own their elements and bindings their attributes. The _takeover operations move the
// caller's object in and set the caller's variable to null; on failure it stays the caller's. The _const and
// _quick accessors return a pointer that is valid as long as its owner isn't changed. Other results are the
// caller's.
//
// Nothing here is locked: a binding is used by one thread at a time. Null arguments are LC_NULL.
#pragma once

#include <cstdint>

#include "mgmt/bnode_types.h"
#include "runtime/tstr_array.h"
#include "runtime/tstring.h"
#include "runtime/typed_arrays.h"

// An array whose index is the attribute id. Empty slots take no memory. The operations have the names and the
// meaning of those of typed_arrays.h.
struct bn_attrib_slot {
    uint32_t id;
    uint32_t placed; // the attribute's record is part of a block (bnode_block.h)
    bn_attrib *attrib;
};
struct bn_attrib_array {
    bn_attrib_slot *slots; // the filled ones, sorted by id
    uint32_t length;       // the highest id that was ever set, plus 1
    uint32_t count;        // number of filled slots
    uint32_t capacity;
    uint8_t placed_record; // part of a block
    uint8_t placed_slots;
};
lc_status bn_attrib_array_new(bn_attrib_array **out);
lc_status bn_attrib_array_new_full(bn_attrib_array **out,
                                   const array_options *options); // options are ignored
lc_status bn_attrib_array_free(bn_attrib_array **inout);
void bn_attrib_array_release(bn_attrib_array *array);
lc_status bn_attrib_array_duplicate(const bn_attrib_array *array, bn_attrib_array **out);
uint32_t bn_attrib_array_length_quick(const bn_attrib_array *array);
// An empty slot gives 0 and null, an id at or past the length LC_NOT_FOUND.
lc_status bn_attrib_array_get(const bn_attrib_array *array, uint32_t id, bn_attrib **out);
bn_attrib *bn_attrib_array_get_quick(const bn_attrib_array *array, uint32_t id);
lc_status bn_attrib_array_set(bn_attrib_array *array, uint32_t id, const bn_attrib *attrib);
lc_status bn_attrib_array_set_takeover(bn_attrib_array *array, uint32_t id, bn_attrib **inout);

// bn_binding_array_append and the others of typed_arrays.h. Ordered by name, but only sorted after
// bn_binding_array_sort.
TYPED_ARRAY_DECLARE(bn_binding_array, bn_binding *)

struct bn_binding {
    tstring *name;
    tstr_array *parts;           // the parts of the name, without escapes; null if they aren't kept
    uint32_t absolute;           // the name begins with "/"
    uint32_t block_distance;     // to the start of the block that it is part of (bnode_block.h); 0: of none
    bn_attrib_array *attributes; // or null
};

// --- Attributes

lc_status bn_attrib_new(bn_attrib **out);
lc_status bn_attrib_free(bn_attrib **inout);
lc_status bn_attrib_free_value(bn_attrib *attrib);
lc_status bn_attrib_dup(const bn_attrib *attrib, bn_attrib **out);
lc_status bn_attrib_get_type(const bn_attrib *attrib, uint32_t *out_type, uint32_t *out_flags);
lc_status bn_attrib_compare(const bn_attrib *a, const bn_attrib *b, int *out_result);
// Converts a text to a value of the type. LC_BAD_TYPE, not logged, if that isn't possible; the attribute then
// keeps its old value. With bn_flag_invalid or bn_flag_absent the text is ignored and there is no value.
lc_status bn_attrib_set_str(bn_attrib *attrib, uint32_t id, uint32_t type, uint32_t flags, const char *text);
lc_status bn_attrib_new_str(bn_attrib **out, uint32_t id, uint32_t type, uint32_t flags, const char *text);
// The value as text, which the caller frees with free(); "" without a value. An expected type that isn't 0
// and differs from the attribute's is LC_ASSERTION, not logged. The other outs may be null.
lc_status bn_attrib_get_str(const bn_attrib *attrib, uint32_t *out_id, uint32_t expected_type,
                            uint32_t *out_type_and_flags, char **out_text);
// The value of a string type, and of `binary`; LC_ASSERTION for another type.
lc_status bn_attrib_get_tstring_const(const bn_attrib *attrib, uint32_t *out_id, uint32_t *out_type_and_flags,
                                      const tstring **out);
lc_status bn_attrib_get_tbuf_const(const bn_attrib *attrib, uint32_t *out_id, uint32_t *out_type_and_flags,
                                   const tbuffer **out);

// --- Bindings

lc_status bn_binding_new_named(bn_binding **out, const char *name);
lc_status bn_binding_new_components(bn_binding **out, const char *name, const bn_attrib_array *attributes);
// From a name, its parts or both; the one that is missing is made from the other. `absolute` counts only
// without a name or with both. Attributes may be null.
lc_status bn_binding_new_parts_components(bn_binding **out, const char *name, const tstr_array *parts,
                                          int absolute, const bn_attrib_array *attributes);
lc_status bn_binding_new_parts_components_takeover(bn_binding **out, tstring **inout_name,
                                                   tstr_array **inout_parts, int absolute,
                                                   bn_attrib_array **inout_attributes);
lc_status bn_binding_free(bn_binding **inout);
lc_status bn_binding_dup(const bn_binding *binding, bn_binding **out);
lc_status bn_binding_set_name(bn_binding *binding, const char *name); // drops the kept parts
lc_status bn_binding_drop_name_parts(bn_binding *binding);
lc_status bn_binding_set_str(bn_binding *binding, uint32_t id, uint32_t type, uint32_t flags,
                             const char *text);
lc_status bn_binding_new_str(bn_binding **out, const char *name, uint32_t id, uint32_t type, uint32_t flags,
                             const char *text);
// If the text can't be converted, the binding is made without a value and with bn_flag_invalid.
lc_status bn_binding_new_str_autoinval(bn_binding **out, const char *name, uint32_t id, uint32_t type,
                                       uint32_t flags, const char *text);
lc_status bn_binding_set_attrib_takeover(bn_binding *binding, bn_attrib **inout_attrib);

// An empty slot gives 0 and null. An id past the attributes is LC_NOT_FOUND, and no attributes at all
// LC_NULL; both are logged. Only bn_binding_get_attrib gives 0 and null for these as well. For texts see
// bn_attrib_get_str.
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
                                          int *out_absolute); // null if none are kept
lc_status bn_binding_get_name_and_name_parts_const(const bn_binding *binding, const tstring **out_name,
                                                   const tstr_array **out_parts, int *out_absolute);
// A copy of the parts. LC_ASSERTION for a relative name whose parts aren't kept.
lc_status bn_binding_get_name_parts(const bn_binding *binding, tstr_array **out_parts);

// --- Names

// "/a/b" and "a/b" have the parts "a" and "b", "a//b" also an empty one between them; "/" and "" have none.
lc_status bn_binding_name_to_parts(const char *name, tstr_array **out_parts, int *out_absolute);
lc_status bn_binding_name_parts_to_name(const tstr_array *parts, int absolute, char **out_text);
lc_status bn_binding_name_parts_to_name_tstr(const tstr_array *parts, int absolute, tstring **out);
// 1 or 0, see tstr_array_wildcard_match. A relative name doesn't match an absolute pattern, nor the other way
// round.
int bn_binding_name_pattern_match(const char *name, const char *pattern);
int bn_binding_name_parts_pattern_match(const tstr_array *parts, int absolute, const char *pattern);

// --- Arrays of bindings. A name that isn't found is not a failure: the index is then -1, or the result null.
// The _rel forms look for the name "prefix/relative".

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
// The first match at or after the index `start`; -1 and null if there is none. The outs of the second may be
// null.
lc_status bn_binding_array_get_first_matching_binding(const bn_binding_array *array, const char *pattern,
                                                      uint32_t start, int32_t *out_index,
                                                      const bn_binding **out);
lc_status bn_binding_array_get_first_matching_value_tstr(const bn_binding_array *array, const char *pattern,
                                                         uint32_t start, int32_t *out_index,
                                                         tstring **out_name, tstring **out_value);
// The part at `part_index` of the name of each matching binding, in the order of the array. LC_NOT_FOUND if a
// name has no such part.
lc_status bn_binding_array_get_name_part_tstr_array(const bn_binding_array *array, const char *pattern,
                                                    uint32_t part_index, tstr_array **out);

// For scope guards: owned<bn_binding, bn_release_binding>. mgmt/owners.h has names for these.
inline void bn_release_attrib(bn_attrib *attrib) {
    (void)bn_attrib_free(&attrib);
}
inline void bn_release_binding(bn_binding *binding) {
    (void)bn_binding_free(&binding);
}
