// The named tree. A node's children are an `array` that is sorted by name and owns them, so that freeing a
// node frees everything below it, by recursion. A caller that builds a tree from names of a peer must limit
// their depth.
#include "runtime/tree.h"

#include <cstdlib>
#include <cstring>

#include "runtime/guards.h"

namespace {

void free_no_value(void *) {}

void free_node(void *memory) {
    auto *node = static_cast<tree_node *>(memory);
    // Also frees a node that new_node could only make in part; each field may still be null.
    (void)array_free(&node->children);
    if (node->value)
        node->owner->options.free_value(node->value);
    free(node->name);
    free(node);
}
int compare_nodes(const void *a, const void *b) {
    return strcmp((*static_cast<const tree_node *const *>(a))->name,
                  (*static_cast<const tree_node *const *>(b))->name);
}

void release_node(tree_node *node) {
    free_node(node);
}
lc_status new_node(tree *whole, const char *name, tree_node **out) {
    *out = nullptr;
    owned<tree_node, release_node> node(static_cast<tree_node *>(calloc(1, sizeof(tree_node))));
    CHECK_NULL(node.pointer);
    node.pointer->owner = whole;
    node.pointer->name = strdup(name);
    CHECK_NULL(node.pointer->name);
    array_options options;
    CHECK_STATUS(array_options_get_defaults(&options));
    options.compare = compare_nodes;
    options.free = free_node;
    CHECK_STATUS(array_new(&node.pointer->children, &options));
    *out = node.take();
    return LC_OK;
}

} // namespace

lc_status tree_options_get_defaults(tree_options *out) {
    CHECK_NULL(out);
    *out = tree_options{};
    out->free_value = free_no_value;
    return LC_OK;
}
lc_status tree_new(tree **out, const tree_options *options) {
    CHECK_NULL(out);
    *out = nullptr;
    auto *whole = static_cast<tree *>(calloc(1, sizeof(tree)));
    CHECK_NULL(whole);
    if (options)
        whole->options = *options;
    if (!whole->options.free_value)
        whole->options.free_value = free_no_value;
    const lc_status status = new_node(whole, "", &whole->root);
    if (status != LC_OK)
        free(whole);
    CHECK_STATUS(status);
    *out = whole;
    return LC_OK;
}

namespace {

void drop_value(tree_node *node) {
    // Cleared first: the function that frees the value must not find it in the tree any more.
    void *value = node->value;
    node->value = nullptr;
    if (value)
        node->owner->options.free_value(value);
}

} // namespace

lc_status tree_empty(tree *whole) {
    CHECK_NULL(whole);
    drop_value(whole->root);
    return array_empty(whole->root->children);
}
lc_status tree_free(tree **inout) {
    CHECK_NULL(inout);
    if (*inout) {
        free_node((*inout)->root);
        free(*inout);
    }
    *inout = nullptr;
    return LC_OK;
}

namespace {

tree_node *find_child(const tree_node *node, const char *name) {
    // A key with nothing but the name; comparing looks at no other field.
    tree_node key{};
    key.name = const_cast<char *>(name);
    uint32_t index = 0;
    if (array_binary_search(node->children, &key, &index) != LC_OK)
        return nullptr;
    return static_cast<tree_node *>(array_get_quick(node->children, index));
}

lc_status make_child(tree_node *node, const char *name, tree_node **out) {
    tree_node *made = nullptr;
    CHECK_STATUS(new_node(node->owner, name, &made));
    void *slot = made;
    const lc_status status = array_insert_sorted_takeover(node->children, &slot);
    if (status != LC_OK)
        free_node(made);
    CHECK_STATUS(status);
    *out = made;
    return LC_OK;
}

} // namespace

lc_status tree_set_node_value_by_path_str(tree *whole, tree_node *start, const char *path, void *value,
                                          int create, tree_node **out_node) {
    if (out_node)
        *out_node = nullptr;
    CHECK_NULL(whole);
    CHECK_NULL(path);
    CHECK_NULL(whole->options.name_to_parts);
    owned<tstr_array, tstr_array_release> parts;
    int absolute = 0;
    CHECK_STATUS(whole->options.name_to_parts(path, &parts.pointer, &absolute));
    tree_node *node = start ? start : whole->root;
    for (uint32_t i = 0; i < tstr_array_length_quick(parts.pointer); i++) {
        const char *name = tstr_array_get_str_quick(parts.pointer, i);
        CHECK_NULL(name);
        tree_node *next = find_child(node, name);
        if (!next && !create)
            return LC_TREE_NO_PATH;
        if (!next)
            CHECK_STATUS(make_child(node, name, &next));
        node = next;
    }
    // Setting the value that the node has already must not free it.
    if (node->value != value)
        drop_value(node);
    node->value = value;
    if (out_node)
        *out_node = node;
    return LC_OK;
}
lc_status tree_get_node_by_path_wildcarded(const tree *whole, const tree_node *start, const tstr_array *parts,
                                           const char *wildcard, tree_node **out_node) {
    CHECK_NULL(out_node);
    *out_node = nullptr;
    CHECK_NULL(whole);
    CHECK_NULL(parts);
    auto *node = const_cast<tree_node *>(start ? start : whole->root);
    for (uint32_t i = 0; i < tstr_array_length_quick(parts); i++) {
        const char *name = tstr_array_get_str_quick(parts, i);
        CHECK_NULL(name);
        tree_node *next = find_child(node, name);
        // A child with the literal name is preferred, and the search never returns to the wildcard if it then
        // finds nothing below that child.
        if (!next && wildcard)
            next = find_child(node, wildcard);
        if (!next)
            return LC_NOT_FOUND;
        node = next;
    }
    *out_node = node;
    return LC_OK;
}
lc_status tree_node_get_value(const tree *whole, const tree_node *node, void **out_value) {
    CHECK_NULL(out_value);
    *out_value = nullptr;
    CHECK_NULL(whole);
    CHECK_NULL(node);
    *out_value = node->value;
    return LC_OK;
}
lc_status tree_node_get_num_children(const tree *whole, const tree_node *node, uint32_t *out_count) {
    CHECK_NULL(out_count);
    *out_count = 0;
    CHECK_NULL(whole);
    CHECK_NULL(node);
    return array_length(node->children, out_count);
}

namespace {

struct tree_walk {
    tree *whole;
    tree_foreach_function function;
    void *data;
};

lc_status visit_child(array *, uint32_t, void *element, void *data) {
    const auto *walk = static_cast<const tree_walk *>(data);
    auto *child = static_cast<tree_node *>(element);
    return walk->function(walk->whole, child, child->name, child->value, walk->data);
}

} // namespace

lc_status tree_foreach(tree *whole, tree_node *node, uint32_t flags, tree_foreach_function function,
                       void *data) {
    CHECK_NULL(whole);
    CHECK_NULL(function);
    if (flags != 0)
        FAIL_WITH(LC_NOT_IMPLEMENTED);
    tree_walk walk{whole, function, data};
    return array_foreach((node ? node : whole->root)->children, visit_child, &walk);
}
