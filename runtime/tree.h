// A tree of named nodes, each with an optional value; children are sorted by name. The tree owns its nodes
// and values. Not locked: the owner's lock guards it.
#pragma once

#include <cstdint>

#include "runtime/array.h"
#include "runtime/tstr_array.h"

struct tree;
struct tree_node {
    tree *owner;
    char *name;
    void *value;
    array *children; // of tree_node
};
using tree_value_free_function = void (*)(void *value);
using tree_name_to_parts_function = lc_status (*)(const char *name, tstr_array **out_parts,
                                                  int *out_absolute);
using tree_parts_to_name_function = lc_status (*)(const tstr_array *parts, int absolute, char **out_name);
struct tree_options {
    tree_value_free_function free_value; // default: frees nothing
    tree_name_to_parts_function name_to_parts;
    tree_parts_to_name_function parts_to_name;
};
struct tree {
    tree_node *root; // its name is empty
    tree_options options;
};

lc_status tree_options_get_defaults(tree_options *out);
lc_status tree_new(tree **out, const tree_options *options);
lc_status tree_empty(tree *whole);
lc_status tree_free(tree **inout);
// Follows the path from `start` (null: the root) and sets the value of the node at its end. Missing nodes are
// created if `create` is set, otherwise the result is LC_TREE_NO_PATH. On success the tree owns the value,
// and the old one has been freed; on failure it stays the caller's. `out_node` may be null.
lc_status tree_set_node_value_by_path_str(tree *whole, tree_node *start, const char *path, void *value,
                                          int create, tree_node **out_node);
// Follows the parts from `start` (null: the root): for each part the child of that name, or else the child
// whose name is `wildcard` (null: none), or else LC_NOT_FOUND. There is no backtracking.
lc_status tree_get_node_by_path_wildcarded(const tree *whole, const tree_node *start, const tstr_array *parts,
                                           const char *wildcard, tree_node **out_node);
lc_status tree_node_get_value(const tree *whole, const tree_node *node, void **out_value);
lc_status tree_node_get_num_children(const tree *whole, const tree_node *node, uint32_t *out_count);
// Calls the function for each direct child in the order of names; its result has the meaning that it has in
// array_foreach. `flags` must be 0, else LC_NOT_IMPLEMENTED. `node` null: the root.
using tree_foreach_function = lc_status (*)(tree *whole, tree_node *child, const char *name, void *value,
                                            void *data);
lc_status tree_foreach(tree *whole, tree_node *node, uint32_t flags, tree_foreach_function function,
                       void *data);
