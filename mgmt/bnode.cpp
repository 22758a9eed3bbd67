// Bindings: making, copying, changing and reading them. Their arrays are in bnode_array.cpp, attributes in
// bnode_attrib.cpp and names in bnode_names.cpp.
#include "mgmt/bnode.h"

#include <cstdlib>
#include <cstring>

#include "mgmt/bnode_block.h"
#include "mgmt/bnode_rows.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

// The number of calls of bn_binding_set_name, by which arrays of bindings detect that their name index may be
// outdated.
std::atomic<uint32_t> bn_binding_renames;

// --- Creation and release

lc_status bn_binding_free(bn_binding **inout) {
    CHECK_NULL(inout);
    if (bn_binding *binding = *inout) {
        (void)ts_free(&binding->name);
        (void)tstr_array_free(&binding->parts);
        (void)bn_attrib_array_free(&binding->attributes);
        // A binding inside a block is freed with the last reference to the block.
        if (binding->block_distance)
            bn_block_release(bn_block_of(binding));
        else
            free(binding);
    }
    *inout = nullptr;
    return LC_OK;
}
lc_status bn_binding_new_parts_components_takeover(bn_binding **out, tstring **inout_name,
                                                   tstr_array **inout_parts, int absolute,
                                                   bn_attrib_array **inout_attributes) {
    CHECK_NULL(out);
    *out = nullptr;
    owned<bn_binding, bn_release_binding> binding(static_cast<bn_binding *>(calloc(1, sizeof(bn_binding))));
    CHECK_NULL(binding.pointer);
    tstring *name = inout_name ? *inout_name : nullptr;
    tstr_array *parts = inout_parts ? *inout_parts : nullptr;
    bn_attrib_array *attributes = inout_attributes ? *inout_attributes : nullptr;
    owned<tstring, ts_release> made_name;
    owned<tstr_array, tstr_array_release> made_parts;
    owned<bn_attrib_array, bn_attrib_array_release> made_attributes;
    if (!name)
        CHECK_NULL(parts);
    // A name and attributes that are part of another binding's block can't leave it; they are copied.
    if (name && name->placed)
        CHECK_STATUS(ts_dup(name, &made_name.pointer));
    if (attributes && attributes->placed_record)
        CHECK_STATUS(bn_attrib_array_duplicate(attributes, &made_attributes.pointer));
    if (!name)
        CHECK_STATUS(bn_binding_name_parts_to_name_tstr(parts, absolute, &made_name.pointer));
    else if (!parts)
        CHECK_STATUS(bn_binding_name_to_parts(ts_str(name), &made_parts.pointer, &absolute));
    // Nothing can fail from here on; what was passed is taken over only now.
    if (made_name.pointer)
        ts_release(name);
    if (made_attributes.pointer)
        bn_attrib_array_release(attributes);
    binding.pointer->name = made_name.pointer ? made_name.take() : name;
    binding.pointer->parts = parts ? parts : made_parts.take();
    binding.pointer->absolute = absolute ? 1 : 0;
    binding.pointer->attributes = made_attributes.pointer ? made_attributes.take() : attributes;
    if (inout_attributes)
        *inout_attributes = nullptr;
    if (inout_name)
        *inout_name = nullptr;
    if (inout_parts)
        *inout_parts = nullptr;
    *out = binding.take();
    return LC_OK;
}
lc_status bn_binding_new_parts_components(bn_binding **out, const char *name, const tstr_array *parts,
                                          int absolute, const bn_attrib_array *attributes) {
    CHECK_NULL(out);
    *out = nullptr;
    owned<tstring, ts_release> name_copy;
    owned<tstr_array, tstr_array_release> parts_copy;
    owned<bn_attrib_array, bn_attrib_array_release> attributes_copy;
    if (name)
        CHECK_STATUS(ts_new_str(&name_copy.pointer, name));
    if (parts)
        CHECK_STATUS(tstr_array_duplicate(parts, &parts_copy.pointer));
    if (attributes)
        CHECK_STATUS(bn_attrib_array_duplicate(attributes, &attributes_copy.pointer));
    CHECK_STATUS(bn_binding_new_parts_components_takeover(out, &name_copy.pointer, &parts_copy.pointer,
                                                          absolute, &attributes_copy.pointer));
    return LC_OK;
}
lc_status bn_binding_new_components(bn_binding **out, const char *name, const bn_attrib_array *attributes) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(name);
    owned<bn_binding, bn_release_binding> binding(static_cast<bn_binding *>(calloc(1, sizeof(bn_binding))));
    CHECK_NULL(binding.pointer);
    CHECK_STATUS(ts_new_str(&binding.pointer->name, name));
    binding.pointer->absolute = name[0] == '/';
    if (attributes)
        CHECK_STATUS(bn_attrib_array_duplicate(attributes, &binding.pointer->attributes));
    *out = binding.take();
    return LC_OK;
}
lc_status bn_binding_new_named(bn_binding **out, const char *name) {
    return bn_binding_new_components(out, name, nullptr);
}
lc_status bn_binding_dup(const bn_binding *binding, bn_binding **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(binding);
    bn_block_size size{};
    bn_block_builder builder;
    owned<bn_binding, bn_release_binding> copy;
    bn_size_copy(&size, binding);
    CHECK_QUIET(bn_block_new(&size, &builder));
    // The maker's reference; the copy has one of its own.
    const owned_block held(builder.block);
    CHECK_STATUS(bn_place_copy(&builder, binding, &copy.pointer));
    if (binding->parts)
        CHECK_STATUS(tstr_array_duplicate(binding->parts, &copy.pointer->parts));
    *out = copy.take();
    return LC_OK;
}
lc_status bn_binding_set_name(bn_binding *binding, const char *name) {
    CHECK_NULL(binding);
    CHECK_NULL(name);
    owned<tstring, ts_release> made;
    CHECK_STATUS(ts_new_str(&made.pointer, name));
    (void)ts_free(&binding->name);
    binding->name = made.take();
    binding->absolute = ts_get_char(binding->name, 0) == '/';
    bn_binding_renames.fetch_add(1, std::memory_order_relaxed);
    return bn_binding_drop_name_parts(binding);
}
lc_status bn_binding_drop_name_parts(bn_binding *binding) {
    CHECK_NULL(binding);
    return tstr_array_free(&binding->parts);
}

// --- Attributes

lc_status bn_binding_set_attrib_takeover(bn_binding *binding, bn_attrib **inout_attrib) {
    CHECK_NULL(binding);
    CHECK_NULL(inout_attrib);
    CHECK_NULL(*inout_attrib);
    const uint32_t id = (*inout_attrib)->attribute_id;
    CHECK_CONDITION(bn_attrib_id_valid(id));
    if (!binding->attributes)
        CHECK_STATUS(bn_attrib_array_new(&binding->attributes));
    CHECK_STATUS(bn_attrib_array_set_takeover(binding->attributes, id, inout_attrib));
    return LC_OK;
}
lc_status bn_binding_set_str(bn_binding *binding, uint32_t id, uint32_t type, uint32_t flags,
                             const char *text) {
    CHECK_NULL(binding);
    owned<bn_attrib, bn_release_attrib> attrib;
    const lc_status status = bn_attrib_new_str(&attrib.pointer, id, type, flags, text);
    if (status == LC_BAD_TYPE)
        return status;
    CHECK_STATUS(status);
    return bn_binding_set_attrib_takeover(binding, &attrib.pointer);
}
lc_status bn_binding_new_str(bn_binding **out, const char *name, uint32_t id, uint32_t type, uint32_t flags,
                             const char *text) {
    CHECK_NULL(out);
    *out = nullptr;
    owned<bn_binding, bn_release_binding> binding;
    CHECK_STATUS(bn_binding_new_named(&binding.pointer, name));
    const lc_status status = bn_binding_set_str(binding.pointer, id, type, flags, text);
    if (status == LC_BAD_TYPE)
        return status;
    CHECK_STATUS(status);
    *out = binding.take();
    return LC_OK;
}
lc_status bn_binding_new_str_autoinval(bn_binding **out, const char *name, uint32_t id, uint32_t type,
                                       uint32_t flags, const char *text) {
    lc_status status = bn_binding_new_str(out, name, id, type, flags, text);
    if (status == LC_BAD_TYPE)
        // The type is kept, and the mark says that the text had no value in it.
        status = bn_binding_new_str(out, name, id, type, flags | bn_flag_invalid, text);
    CHECK_STATUS(status);
    return LC_OK;
}

// --- Reading

namespace {

lc_status find_attribute_or_log(const bn_binding *binding, uint32_t id, const bn_attrib **out) {
    bn_attrib *attrib = nullptr;
    const lc_status status =
        binding->attributes ? bn_attrib_array_get(binding->attributes, id, &attrib) : LC_NULL;
    *out = attrib;
    if (status != LC_OK) {
        char number[16];
        const char *id_name = lc_enum_to_string_quiet_null(bn_attribute_id_table, static_cast<int32_t>(id));
        (void)snprintf(number, sizeof number, "%u", id);
        LC_LOG(LC_LOG_ERR, "Can't get attribute %s of binding %s", id_name ? id_name : number,
               ts_str(binding->name));
    }
    return status;
}

} // namespace

lc_status bn_binding_get_str(const bn_binding *binding, uint32_t id, uint32_t expected_type,
                             uint32_t *out_type_and_flags, char **out_text) {
    CHECK_NULL(out_text);
    *out_text = nullptr;
    if (out_type_and_flags)
        *out_type_and_flags = 0;
    CHECK_NULL(binding);
    const bn_attrib *attrib = nullptr;
    CHECK_QUIET(find_attribute_or_log(binding, id, &attrib));
    if (attrib)
        CHECK_STATUS(bn_attrib_get_str(attrib, nullptr, expected_type, out_type_and_flags, out_text));
    return LC_OK;
}
lc_status bn_binding_get_tstr(const bn_binding *binding, uint32_t id, uint32_t expected_type,
                              uint32_t *out_type_and_flags, tstring **out) {
    CHECK_NULL(out);
    *out = nullptr;
    owned_text text;
    CHECK_STATUS(bn_binding_get_str(binding, id, expected_type, out_type_and_flags, &text.pointer));
    if (text.pointer)
        CHECK_STATUS(ts_new_str_takeover(out, &text.pointer, -1, -1));
    return LC_OK;
}
lc_status bn_binding_get_type(const bn_binding *binding, uint32_t id, uint32_t *out_type,
                              uint32_t *out_flags) {
    if (out_type)
        *out_type = 0;
    if (out_flags)
        *out_flags = 0;
    CHECK_NULL(binding);
    CHECK_NULL(binding->attributes);
    bn_attrib *attrib = nullptr;
    CHECK_STATUS(bn_attrib_array_get(binding->attributes, id, &attrib));
    return attrib ? bn_attrib_get_type(attrib, out_type, out_flags) : LC_OK;
}
lc_status bn_binding_get_attrib(const bn_binding *binding, uint32_t id, const bn_attrib **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(binding);
    *out = bn_attrib_array_get_quick(binding->attributes, id);
    return LC_OK;
}
lc_status bn_binding_get_name(const bn_binding *binding, const tstring **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(binding);
    *out = binding->name;
    return LC_OK;
}
const char *bn_binding_get_name_quick(const bn_binding *binding) {
    return binding ? ts_str_maybe(binding->name) : nullptr;
}
lc_status bn_binding_get_name_and_name_parts_const(const bn_binding *binding, const tstring **out_name,
                                                   const tstr_array **out_parts, int *out_absolute) {
    if (out_name)
        *out_name = nullptr;
    if (out_parts)
        *out_parts = nullptr;
    if (out_absolute)
        *out_absolute = 0;
    CHECK_NULL(binding);
    if (out_name)
        *out_name = binding->name;
    if (out_parts)
        *out_parts = binding->parts;
    if (out_absolute)
        *out_absolute = static_cast<int>(binding->absolute);
    return LC_OK;
}
lc_status bn_binding_get_name_parts_const(const bn_binding *binding, const tstr_array **out_parts,
                                          int *out_absolute) {
    return bn_binding_get_name_and_name_parts_const(binding, nullptr, out_parts, out_absolute);
}
lc_status bn_binding_get_name_parts(const bn_binding *binding, tstr_array **out_parts) {
    CHECK_NULL(out_parts);
    *out_parts = nullptr;
    CHECK_NULL(binding);
    if (binding->parts)
        return tstr_array_duplicate(binding->parts, out_parts);
    int absolute = 0;
    owned<tstr_array, tstr_array_release> parts;
    CHECK_STATUS(bn_binding_name_to_parts(ts_str(binding->name), &parts.pointer, &absolute));
    // The caller gets the parts without this flag, and takes them for those of an absolute name.
    CHECK_CONDITION(absolute);
    *out_parts = parts.take();
    return LC_OK;
}
