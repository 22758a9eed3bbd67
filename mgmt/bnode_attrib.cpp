// Attributes: one typed value each. Everything that depends on the type is looked up in the type's row
// (bnode_rows.h).
#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "mgmt/bnode.h"
#include "mgmt/bnode_rows.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

lc_status bn_attrib_new(bn_attrib **out) {
    CHECK_NULL(out);
    *out = static_cast<bn_attrib *>(calloc(1, sizeof(bn_attrib)));
    CHECK_NULL(*out);
    (*out)->type = bn_type_none;
    (*out)->attribute_id = bn_attrib_none;
    return LC_OK;
}

namespace {

bool owns_text(const bn_attrib *attrib) {
    const bn_type_row *row = bn_type_find(attrib->type);
    return row && row->shape == value_shape::text;
}
bool owns_binary(const bn_attrib *attrib) {
    const bn_type_row *row = bn_type_find(attrib->type);
    return row && row->shape == value_shape::binary;
}

} // namespace

lc_status bn_attrib_free_value(bn_attrib *attrib) {
    CHECK_NULL(attrib);
    if (owns_text(attrib))
        (void)ts_free(&attrib->value.string);
    if (owns_binary(attrib))
        (void)tb_free(&attrib->value.binary);
    // Also clears the freed pointer: freeing the value again does nothing.
    memset(attrib->value.bytes, 0, sizeof attrib->value.bytes);
    attrib->value_size = 0;
    return LC_OK;
}
lc_status bn_attrib_free(bn_attrib **inout) {
    CHECK_NULL(inout);
    if (*inout) {
        (void)bn_attrib_free_value(*inout);
        free(*inout);
    }
    *inout = nullptr;
    return LC_OK;
}
lc_status bn_attrib_dup(const bn_attrib *attrib, bn_attrib **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(attrib);
    owned<bn_attrib, bn_release_attrib> copy;
    CHECK_STATUS(bn_attrib_new(&copy.pointer));
    // This copies a pointer as well; it is cleared below before anything can fail.
    *copy.pointer = *attrib;
    if (owns_text(attrib)) {
        memset(&copy.pointer->value, 0, sizeof copy.pointer->value);
        if (attrib->value.string)
            CHECK_STATUS(ts_dup(attrib->value.string, &copy.pointer->value.string));
    } else if (owns_binary(attrib)) {
        memset(&copy.pointer->value, 0, sizeof copy.pointer->value);
        if (attrib->value.binary)
            CHECK_STATUS(tb_dup(attrib->value.binary, &copy.pointer->value.binary));
    }
    *out = copy.take();
    return LC_OK;
}
void bn_attrib_place_value(bn_attrib *attrib, char *text, uint32_t length) {
    if (owns_text(attrib)) {
        auto *placed = &attrib->value.placed_string;
        ts_place(&placed->record, text, static_cast<int32_t>(length));
        // From here on the attribute points into itself, and must not be moved.
        placed->string = &placed->record;
    } else {
        auto *placed = &attrib->value.placed_binary;
        tb_place(&placed->record, reinterpret_cast<uint8_t *>(text), length);
        placed->binary = &placed->record;
    }
    attrib->value_size = length;
}
lc_status bn_attrib_get_type(const bn_attrib *attrib, uint32_t *out_type, uint32_t *out_flags) {
    CHECK_NULL(attrib);
    if (out_type)
        *out_type = attrib->type;
    if (out_flags)
        *out_flags = attrib->type_flags;
    return LC_OK;
}

namespace {

int compare_attributes(const bn_attrib *a, const bn_attrib *b) {
    if (!a || !b)
        return (a ? 0 : 1) - (b ? 0 : 1);
    const bool a_invalid = a->type_flags & bn_flag_invalid, b_invalid = b->type_flags & bn_flag_invalid;
    // A valid attribute sorts before an invalid one; two invalid ones are equal.
    if (a_invalid || b_invalid)
        return a_invalid - b_invalid;
    if (a->type != b->type)
        return static_cast<int>(a->type) - static_cast<int>(b->type);
    const bn_type_row *row = bn_type_find(a->type);
    return row ? bn_value_compare(row, a, b) : 0;
}

} // namespace

lc_status bn_attrib_compare(const bn_attrib *a, const bn_attrib *b, int *out_result) {
    CHECK_NULL(out_result);
    *out_result = compare_attributes(a, b);
    return LC_OK;
}

// --- Setting

namespace {

// Frees the old value and sets everything but the new one.
void reset_attribute(bn_attrib *attrib, uint32_t id, uint32_t type, uint32_t flags) {
    (void)bn_attrib_free_value(attrib);
    attrib->attribute_id = id;
    attrib->type = type;
    attrib->type_flags = flags & ~BN_TYPE_MASK;
}
lc_status set_fixed(bn_attrib *attrib, uint32_t id, uint32_t type, uint32_t flags, const void *value,
                    uint32_t size) {
    CHECK_NULL(attrib);
    CHECK_NULL(value);
    CHECK_CONDITION(bn_attrib_id_valid(id));
    CHECK_CONDITION(bn_type_find(type) && bn_type_find(type)->size == size);
    reset_attribute(attrib, id, type, flags);
    memcpy(attrib->value.bytes, value, size);
    attrib->value_size = size;
    return LC_OK;
}

} // namespace

// The conversion writes to a temporary attribute, so that the old value survives a text that can't be
// converted.
lc_status bn_attrib_set_str(bn_attrib *attrib, uint32_t id, uint32_t type, uint32_t flags, const char *text) {
    CHECK_NULL(attrib);
    CHECK_CONDITION(bn_attrib_id_valid(id));
    const bn_type_row *row = bn_type_find(type);
    CHECK_CONDITION(row && type <= BN_TYPE_LAST);
    // The absent mark leaves the size at 0; for the invalid mark it is the type's.
    if ((flags & bn_flag_no_value) || type == bn_type_none) {
        reset_attribute(attrib, id, type, flags);
        if (!(flags & bn_flag_absent))
            attrib->value_size = row->size;
        return LC_OK;
    }
    CHECK_NULL(text);
    // Only the allocated types have an empty text as a value.
    if (!*text && type < bn_type_str)
        return LC_BAD_TYPE;
    bn_attrib made{};
    made.attribute_id = id;
    made.type = type;
    made.type_flags = flags & ~BN_TYPE_MASK;
    made.value_size = row->size;
    const lc_status status = row->text_in(row, text, &made);
    if (status != LC_OK) {
        (void)bn_attrib_free_value(&made);
        return status;
    }
    (void)bn_attrib_free_value(attrib);
    *attrib = made;
    return LC_OK;
}
lc_status bn_attrib_new_str(bn_attrib **out, uint32_t id, uint32_t type, uint32_t flags, const char *text) {
    CHECK_NULL(out);
    *out = nullptr;
    owned<bn_attrib, bn_release_attrib> attrib;
    CHECK_STATUS(bn_attrib_new(&attrib.pointer));
    const lc_status status = bn_attrib_set_str(attrib.pointer, id, type, flags, text);
    // The caller reports bad input; it isn't logged on the way.
    if (status == LC_BAD_TYPE)
        return status;
    CHECK_STATUS(status);
    *out = attrib.take();
    return LC_OK;
}

// --- Getting

namespace {

void get_id_and_type(const bn_attrib *attrib, uint32_t *out_id, uint32_t *out_type_and_flags) {
    if (out_id)
        *out_id = attrib->attribute_id;
    if (out_type_and_flags)
        *out_type_and_flags = attrib->type | attrib->type_flags;
}

} // namespace

lc_status bn_attrib_get_str(const bn_attrib *attrib, uint32_t *out_id, uint32_t expected_type,
                            uint32_t *out_type_and_flags, char **out_text) {
    CHECK_NULL(out_text);
    *out_text = nullptr;
    CHECK_NULL(attrib);
    get_id_and_type(attrib, out_id, out_type_and_flags);
    if (expected_type && expected_type != attrib->type)
        return LC_ASSERTION;
    // The bytes of such a value have no meaning, and its type may have no text for them.
    if (attrib->type_flags & bn_flag_no_value) {
        *out_text = safe_strdup("");
        CHECK_NULL(*out_text);
        return LC_OK;
    }
    const bn_type_row *row = bn_type_find(attrib->type);
    CHECK_NULL(row);
    CHECK_STATUS(row->text_out(row, attrib, out_text));
    return LC_OK;
}
lc_status bn_attrib_get_tstring_const(const bn_attrib *attrib, uint32_t *out_id, uint32_t *out_type_and_flags,
                                      const tstring **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(attrib);
    CHECK_CONDITION(owns_text(attrib));
    get_id_and_type(attrib, out_id, out_type_and_flags);
    *out = attrib->value.string;
    return LC_OK;
}
lc_status bn_attrib_get_tbuf_const(const bn_attrib *attrib, uint32_t *out_id, uint32_t *out_type_and_flags,
                                   const tbuffer **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(attrib);
    CHECK_CONDITION(owns_binary(attrib));
    get_id_and_type(attrib, out_id, out_type_and_flags);
    *out = attrib->value.binary;
    return LC_OK;
}

// --- The typed operations

namespace {

lc_status read_fixed(const bn_attrib *attrib, uint32_t type, uint32_t *out_id, uint32_t *out_type_and_flags,
                     void *value, uint32_t size) {
    CHECK_NULL(attrib);
    if (attrib->type != type) {
        LC_LOG(LC_LOG_ERR, "Tried to get a %s attribute as a %s",
               lc_enum_to_string_quiet(bn_type_table, static_cast<int32_t>(attrib->type)),
               lc_enum_to_string_quiet(bn_type_table, static_cast<int32_t>(type)));
        return LC_ASSERTION;
    }
    get_id_and_type(attrib, out_id, out_type_and_flags);
    memcpy(value, attrib->value.bytes, size);
    return LC_OK;
}

// The attribute in a slot of a binding; null if the slot is empty.
lc_status find_slot(const bn_binding *binding, uint32_t id, uint32_t *out_type_and_flags, bn_attrib **out) {
    *out = nullptr;
    if (out_type_and_flags)
        *out_type_and_flags = 0;
    if (!binding) {
        LC_LOG(LC_LOG_ERR, "NULL binding passed");
        return LC_NULL;
    }
    CHECK_STATUS(bn_attrib_array_get(binding->attributes, id, out));
    return LC_OK;
}
lc_status new_fixed(bn_attrib **out, uint32_t id, uint32_t type, uint32_t flags, const void *value,
                    uint32_t size) {
    CHECK_NULL(out);
    *out = nullptr;
    owned<bn_attrib, bn_release_attrib> attrib;
    CHECK_STATUS(bn_attrib_new(&attrib.pointer));
    CHECK_STATUS(set_fixed(attrib.pointer, id, type, flags, value, size));
    *out = attrib.take();
    return LC_OK;
}
lc_status set_binding_fixed(bn_binding *binding, uint32_t id, uint32_t type, uint32_t flags,
                            const void *value, uint32_t size) {
    owned<bn_attrib, bn_release_attrib> attrib;
    CHECK_STATUS(new_fixed(&attrib.pointer, id, type, flags, value, size));
    CHECK_STATUS(bn_binding_set_attrib_takeover(binding, &attrib.pointer));
    return LC_OK;
}
lc_status new_binding_fixed(bn_binding **out, const char *name, uint32_t id, uint32_t type, uint32_t flags,
                            const void *value, uint32_t size) {
    CHECK_NULL(out);
    *out = nullptr;
    owned<bn_binding, bn_release_binding> binding;
    CHECK_STATUS(bn_binding_new_named(&binding.pointer, name));
    CHECK_STATUS(set_binding_fixed(binding.pointer, id, type, flags, value, size));
    *out = binding.take();
    return LC_OK;
}

lc_ipv6addr bn_join_halves(uint64_t first, uint64_t last) {
    lc_ipv6addr joined;
    memcpy(joined.bytes, &first, sizeof first);
    memcpy(joined.bytes + sizeof first, &last, sizeof last);
    return joined;
}
template <typename Value>
void bn_give_plain(Value *out, const Value &stored) {
    if (out)
        *out = stored;
}
void bn_give_halves(uint64_t *out_first, uint64_t *out_last, const lc_ipv6addr &stored) {
    if (out_first)
        memcpy(out_first, stored.bytes, sizeof *out_first);
    if (out_last)
        memcpy(out_last, stored.bytes + sizeof *out_first, sizeof *out_last);
}
template <typename Value>
const Value *bn_at(const Value &value) {
    return &value;
}

} // namespace

// Defines bn_attrib_set_uint32, bn_attrib_new_uint32, bn_attrib_get_uint32, bn_binding_set_uint32,
// bn_binding_new_uint32 and bn_binding_get_uint32, and the same for the other types of BN_VALUE_TYPES. The
// arguments are a row of that table.
#define BN_DEFINE_TYPED(name, number, type, in, in_place, outs, give)                                        \
    lc_status bn_attrib_set_##name(bn_attrib *attrib, uint32_t id, uint32_t flags, BN_UNPAREN in) {          \
        return set_fixed(attrib, id, number, flags, in_place, sizeof(type));                                 \
    }                                                                                                        \
    lc_status bn_attrib_new_##name(bn_attrib **out, uint32_t id, uint32_t flags, BN_UNPAREN in) {            \
        return new_fixed(out, id, number, flags, in_place, sizeof(type));                                    \
    }                                                                                                        \
    lc_status bn_attrib_get_##name(const bn_attrib *attrib, uint32_t *out_id, uint32_t *out_type_and_flags,  \
                                   BN_UNPAREN outs) {                                                        \
        type stored{};                                                                                       \
        CHECK_QUIET(read_fixed(attrib, number, out_id, out_type_and_flags, &stored, sizeof stored));         \
        give;                                                                                                \
        return LC_OK;                                                                                        \
    }                                                                                                        \
    lc_status bn_binding_set_##name(bn_binding *binding, uint32_t id, uint32_t flags, BN_UNPAREN in) {       \
        return set_binding_fixed(binding, id, number, flags, in_place, sizeof(type));                        \
    }                                                                                                        \
    lc_status bn_binding_new_##name(bn_binding **out, const char *name_text, uint32_t id, uint32_t flags,    \
                                    BN_UNPAREN in) {                                                         \
        return new_binding_fixed(out, name_text, id, number, flags, in_place, sizeof(type));                 \
    }                                                                                                        \
    lc_status bn_binding_get_##name(const bn_binding *binding, uint32_t id, uint32_t *out_type_and_flags,    \
                                    BN_UNPAREN outs) {                                                       \
        bn_attrib *attrib = nullptr;                                                                         \
        CHECK_QUIET(find_slot(binding, id, out_type_and_flags, &attrib));                                    \
        if (!attrib)                                                                                         \
            return LC_OK;                                                                                    \
        type stored{};                                                                                       \
        CHECK_QUIET(read_fixed(attrib, number, nullptr, out_type_and_flags, &stored, sizeof stored));        \
        give;                                                                                                \
        return LC_OK;                                                                                        \
    }
BN_VALUE_TYPES(BN_DEFINE_TYPED)
