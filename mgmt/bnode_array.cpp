// Arrays of bindings, and searching them by name and by pattern.
//
// When wccpd starts, it reads thousands of bindings and looks most of them up by name, one by one for each
// field of each group. A sorted array is searched by bisection; a large unsorted one gets a hash index of the
// names (array_index.h) with the first search. A pattern usually begins with literal parts. Only names that
// begin with the same text are compared with the pattern; in a sorted array they are found by bisection, in
// an unsorted one the others cost one strncmp each.
#include <algorithm>
#include <cstring>

#include "mgmt/bnode.h"
#include "mgmt/bnode_block.h"
#include "mgmt/bnode_names.h"
#include "runtime/guards.h"
#include "runtime/hash_table.h"

namespace {

lc_status binding_dup_for_array(const void *element, void **out_copy) {
    bn_binding *copy = nullptr;
    CHECK_STATUS(bn_binding_dup(static_cast<const bn_binding *>(element), &copy));
    *out_copy = copy;
    return LC_OK;
}
void binding_free_for_array(void *element) {
    bn_release_binding(static_cast<bn_binding *>(element));
}
int compare_by_name(const void *a, const void *b) {
    const auto *left = *static_cast<const bn_binding *const *>(a);
    const auto *right = *static_cast<const bn_binding *const *>(b);
    return ts_cmp(left ? left->name : nullptr, right ? right->name : nullptr);
}
uint32_t hash_name(const void *element) {
    const tstring *name = static_cast<const bn_binding *>(element)->name;
    return ht_hash_string_func(name->buffer, static_cast<uint32_t>(name->length));
}
void binding_options(array_options *options) {
    options->compare = compare_by_name;
    options->duplicate = binding_dup_for_array;
    options->free = binding_free_for_array;
    options->hash = hash_name;
    options->key_changes = &bn_binding_renames;
}

} // namespace

TYPED_ARRAY_DEFINE(bn_binding_array, bn_binding *, binding_options)

lc_status bn_binding_array_new_sized(bn_binding_array **out, uint32_t count) {
    array_options options = {};
    CHECK_STATUS(array_options_get_defaults(&options));
    binding_options(&options);
    options.initial_size = count ? count : 1;
    return bn_binding_array_new_full(out, &options);
}

// --- By name

lc_status bn_binding_array_get_index_by_name(const bn_binding_array *array, const char *name,
                                             int32_t *out_index) {
    CHECK_NULL(out_index);
    *out_index = -1;
    CHECK_NULL(array);
    CHECK_NULL(name);
    // A key on the stack, so that nothing is allocated for a search.
    tstring key_name{};
    key_name.buffer = const_cast<char *>(name);
    key_name.length = key_name.characters = static_cast<int32_t>(strlen(name));
    bn_binding key{};
    key.name = &key_name;
    uint32_t index = 0;
    const lc_status status = bn_binding_array_best_search(array, &key, &index);
    if (status == LC_NOT_FOUND)
        return LC_OK;
    CHECK_STATUS(status);
    *out_index = static_cast<int32_t>(index);
    return LC_OK;
}
lc_status bn_binding_array_get_binding_by_name(const bn_binding_array *array, const char *name,
                                               const bn_binding **out) {
    CHECK_NULL(out);
    *out = nullptr;
    int32_t index = -1;
    CHECK_STATUS(bn_binding_array_get_index_by_name(array, name, &index));
    if (index >= 0)
        *out = bn_binding_array_get_quick(array, static_cast<uint32_t>(index));
    return LC_OK;
}
lc_status bn_binding_array_detach_binding_by_name(bn_binding_array *array, const char *name,
                                                  bn_binding **out) {
    CHECK_NULL(out);
    *out = nullptr;
    int32_t index = -1;
    CHECK_STATUS(bn_binding_array_get_index_by_name(array, name, &index));
    if (index >= 0)
        CHECK_STATUS(bn_binding_array_remove(array, static_cast<uint32_t>(index), out));
    return LC_OK;
}
lc_status bn_binding_array_get_value_tstr_by_name(const bn_binding_array *array, const char *name,
                                                  uint32_t *out_type_and_flags, tstring **out) {
    CHECK_NULL(out);
    *out = nullptr;
    if (out_type_and_flags)
        *out_type_and_flags = 0;
    const bn_binding *binding = nullptr;
    CHECK_STATUS(bn_binding_array_get_binding_by_name(array, name, &binding));
    if (binding)
        CHECK_STATUS(bn_binding_get_tstr(binding, bn_attrib_value, 0, out_type_and_flags, out));
    return LC_OK;
}

namespace {

// "prefix/relative", in a buffer on the stack if it fits. `text` is null without memory or with a null
// argument.
struct relative_name {
    char buffer[256];
    char *heap = nullptr;
    const char *text = nullptr;
    relative_name(const char *prefix, const char *relative) {
        if (!prefix || !relative)
            return;
        const int length = snprintf(buffer, sizeof buffer, "%s/%s", prefix, relative);
        if (length >= static_cast<int>(sizeof buffer))
            heap = smprintf("%s/%s", prefix, relative);
        text = length < static_cast<int>(sizeof buffer) ? buffer : heap;
    }
    relative_name(const relative_name &) = delete;
    relative_name &operator=(const relative_name &) = delete;
    ~relative_name() { free(heap); }
};

} // namespace

lc_status bn_binding_array_get_binding_by_name_rel(const bn_binding_array *array, const char *prefix,
                                                   const char *relative, const bn_binding **out) {
    CHECK_NULL(out);
    *out = nullptr;
    const relative_name name(prefix, relative);
    CHECK_NULL(name.text);
    return bn_binding_array_get_binding_by_name(array, name.text, out);
}
lc_status bn_binding_array_get_value_tstr_by_name_rel(const bn_binding_array *array, const char *prefix,
                                                      const char *relative, uint32_t *out_type_and_flags,
                                                      tstring **out) {
    CHECK_NULL(out);
    *out = nullptr;
    const relative_name name(prefix, relative);
    CHECK_NULL(name.text);
    return bn_binding_array_get_value_tstr_by_name(array, name.text, out_type_and_flags, out);
}

// --- By pattern

namespace {

// The state of a search for the names that match a pattern, in the order of the array.
struct pattern_walk {
    const bn_binding_array *array = nullptr;
    bn_pattern pattern;
    owned<tstring, ts_release> start;
    uint32_t next = 0;
    bool in_order = false;
};

lc_status begin_walk(pattern_walk *walk, const bn_binding_array *array, const char *pattern, uint32_t first) {
    CHECK_NULL(array);
    CHECK_NULL(pattern);
    CHECK_STATUS(bn_pattern_init(&walk->pattern, pattern));
    walk->array = array;
    walk->next = first;
    // Without memory for the literal text every name is compared with the pattern.
    const bool narrowed = bn_pattern_literal_start(&walk->pattern, &walk->start.pointer);
    walk->in_order = narrowed && array->list->sorted;
    if (!walk->in_order)
        return LC_OK;
    // Searches for the first name that isn't less than the literal text.
    uint32_t low = 0, high = array->list->length;
    while (low < high) {
        const uint32_t middle = low + (high - low) / 2;
        const bn_binding *binding = bn_binding_array_get_quick(array, middle);
        if (binding && ts_cmp(binding->name, walk->start.pointer) < 0)
            low = middle + 1;
        else
            high = middle;
    }
    walk->next = std::max(first, low);
    return LC_OK;
}

const bn_binding *next_match(pattern_walk *walk, uint32_t *out_index) {
    while (walk->next < walk->array->list->length) {
        const uint32_t index = walk->next++;
        const bn_binding *binding = bn_binding_array_get_quick(walk->array, index);
        if (!binding)
            continue;
        const char *name = binding->name->buffer;
        // Less than, equal to or greater than 0: how the start of the name compares with the literal text.
        const int beside = walk->start.pointer ? strncmp(name, walk->start.pointer->buffer,
                                                         static_cast<size_t>(walk->start.pointer->length))
                                               : 0;
        if (walk->in_order && beside > 0)
            return nullptr; // all further names are greater as well
        if (beside != 0)
            continue;
        if (!bn_pattern_matches(&walk->pattern, name))
            continue;
        *out_index = index;
        return binding;
    }
    return nullptr;
}

} // namespace

lc_status bn_binding_array_get_first_matching_binding(const bn_binding_array *array, const char *pattern,
                                                      uint32_t start, int32_t *out_index,
                                                      const bn_binding **out) {
    if (out_index)
        *out_index = -1;
    CHECK_NULL(out);
    *out = nullptr;
    pattern_walk walk;
    uint32_t index = 0;
    CHECK_STATUS(begin_walk(&walk, array, pattern, start));
    *out = next_match(&walk, &index);
    if (*out && out_index)
        *out_index = static_cast<int32_t>(index);
    return LC_OK;
}
lc_status bn_binding_array_get_first_matching_value_tstr(const bn_binding_array *array, const char *pattern,
                                                         uint32_t start, int32_t *out_index,
                                                         tstring **out_name, tstring **out_value) {
    if (out_name)
        *out_name = nullptr;
    if (out_value)
        *out_value = nullptr;
    const bn_binding *binding = nullptr;
    CHECK_STATUS(bn_binding_array_get_first_matching_binding(array, pattern, start, out_index, &binding));
    // Copies are made before any out is set, so that a failure leaves all of them null.
    owned<tstring, ts_release> name, value;
    if (binding && out_name)
        CHECK_STATUS(ts_dup(binding->name, &name.pointer));
    if (binding && out_value)
        CHECK_STATUS(bn_binding_get_tstr(binding, bn_attrib_value, 0, nullptr, &value.pointer));
    if (out_name)
        *out_name = name.take();
    if (out_value)
        *out_value = value.take();
    return LC_OK;
}
lc_status bn_binding_array_get_name_part_tstr_array(const bn_binding_array *array, const char *pattern,
                                                    uint32_t part_index, tstr_array **out) {
    CHECK_NULL(out);
    *out = nullptr;
    owned<tstr_array, tstr_array_release> names;
    pattern_walk walk;
    uint32_t index = 0;
    CHECK_STATUS(tstr_array_new(&names.pointer, nullptr));
    CHECK_STATUS(begin_walk(&walk, array, pattern, 0));
    while (const bn_binding *binding = next_match(&walk, &index)) {
        owned<tstr_array, tstr_array_release> split;
        const tstr_array *parts = binding->parts;
        if (!parts) {
            CHECK_STATUS(bn_binding_name_to_parts(binding->name->buffer, &split.pointer, nullptr));
            parts = split.pointer;
        }
        tstring *part = nullptr;
        CHECK_STATUS(tstr_array_get(parts, part_index, &part));
        CHECK_STATUS(tstr_array_append(names.pointer, part));
    }
    *out = names.take();
    return LC_OK;
}
