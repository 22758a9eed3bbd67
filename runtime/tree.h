// A tree of named nodes with a value each; children are sorted by name.
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
    tree_node *root; // of the empty name
    tree_options options;
};

lc_status tree_options_get_defaults(tree_options *out);
lc_status tree_new(tree **out, const tree_options *options);
lc_status tree_empty(tree *whole);
lc_status tree_free(tree **inout);
// Walks the path from `start` (null: the root), making what is missing when `create` is set, else
// LC_TREE_NO_PATH. The value belongs to the tree when this succeeds; the old one is freed.
lc_status tree_set_node_value_by_path_str(tree *whole, tree_node *start, const char *path, void *value,
                                          int create, tree_node **out_node);
// Each part in turn: the child of that name, else the one named by `wildcard` (null: none), else
// LC_NOT_FOUND.
lc_status tree_get_node_by_path_wildcarded(const tree *whole, const tree_node *start, const tstr_array *parts,
                                           const char *wildcard, tree_node **out_node);
lc_status tree_node_get_value(const tree *whole, const tree_node *node, void **out_value);
lc_status tree_node_get_num_children(const tree *whole, const tree_node *node, uint32_t *out_count);
// Flags 0: each direct child, in name order, under the protocol of array_foreach.
using tree_foreach_function = lc_status (*)(tree *whole, tree_node *child, const char *name, void *value,
                                            void *data);
lc_status tree_foreach(tree *whole, tree_node *node, uint32_t flags, tree_foreach_function function,
                       void *data);
