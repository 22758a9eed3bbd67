// The configuration in memory: what was set, what holds with the defaults in it, and commits.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "peers/nodes/binding_text.h"
#include "peers/nodes/schema.h"

using node_map = std::map<node_name, node_value>;

struct node_tree {
    std::map<node_name, std::string> set; // what was set, in canonical text
    node_map nodes;                       // what holds
    uint32_t revision = 1;                // goes up with each commit that changes something
};

// Makes `nodes` from `set`.
void tree_refresh(node_tree *tree);
// What no single value shows: false with the reason.
bool tree_check(const node_tree &tree, std::string *out_reason);

// The nodes below `root`: the direct children or the whole subtree, with the root itself or without.
struct tree_walk {
    bool subtree, include_self, leaves_only;
};
// They are those of `nodes`, in its order.
using node_list = std::vector<const node_map::value_type *>;
void collect_nodes(const node_map &nodes, const node_name &root, tree_walk walk, node_list *out);

enum class set_kind { create, modify, remove };
struct set_step {
    set_kind kind;
    std::string name;
    uint32_t type; // of the value as it came; a string converts to the node's own type
    std::string text;
};
struct node_change {
    node_name name;
    std::optional<node_value> before, after;
};
struct commit_result {
    uint32_t code; // 0, or a status code
    std::string message;
    std::vector<node_change> changes; // in the order of the tree
    std::vector<node_name> renewed;   // instances that the steps removed and created again
};

std::vector<node_change> tree_difference(const node_map &before, const node_map &after);

// The tree as it would be after all of the steps; or why not one of them can be taken.
commit_result tree_prepare(const node_tree &tree, const std::vector<set_step> &steps, node_tree *out_next);
// What only a change shows, as opposed to the tree that it leads to: false with the reason.
bool tree_check_change(const node_tree &before, const node_tree &after, std::string *out_reason);

// The instances that the node belongs to, from the top, itself included when it is one.
std::vector<node_name> instances_of(const node_name &name);
