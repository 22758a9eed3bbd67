// The configuration in memory, and the changes that a commit makes.
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
    std::map<node_name, std::string> set; // values that were set, as canonical text
    node_map nodes;                       // all values, defaults included
    uint32_t revision = 1;                // rises with each commit that changes something
};

// Makes `nodes` from `set`.
void tree_refresh(node_tree *tree);
// Checks that need more than one value. False with the reason.
bool tree_check(const node_tree &tree, std::string *out_reason);

struct tree_walk {
    bool subtree;      // all nodes below the root; otherwise only its direct children
    bool include_self; // the root as well
    bool leaves_only;  // only nodes without nodes below them
};
// Pointers into the map that was walked, in its order.
using node_list = std::vector<const node_map::value_type *>;
void collect_nodes(const node_map &nodes, const node_name &root, tree_walk walk, node_list *out);

enum class set_kind { create, modify, remove };
struct set_step {
    set_kind kind;
    std::string name;
    uint32_t type; // of the value in the request; a string is converted to the type of the node
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
    std::vector<node_name> renewed;   // instances that were removed and created again
};

std::vector<node_change> tree_difference(const node_map &before, const node_map &after);

// Applies the steps to a copy of the tree. If one of them is refused, none is applied.
commit_result tree_prepare(const node_tree &tree, const std::vector<set_step> &steps, node_tree *out_next);
// Checks that need the tree before the change. False with the reason.
bool tree_check_change(const node_tree &before, const node_tree &after, std::string *out_reason);

// The instances that the node belongs to, the outermost first; the last one is the node itself if it is an
// instance.
std::vector<node_name> instances_of(const node_name &name);
