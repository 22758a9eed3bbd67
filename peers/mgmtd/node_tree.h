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

// `nodes` made anew of `set`.
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
};
// All of the steps or none of them. The tree changes only when `keep`, given the tree as it would be, agrees.
template <typename Keep>
commit_result tree_commit(node_tree *tree, const std::vector<set_step> &steps, Keep keep);

std::vector<node_change> tree_difference(const node_map &before, const node_map &after);

// The halves of a commit.
commit_result tree_prepare(const node_tree &tree, const std::vector<set_step> &steps, node_tree *out_next);

template <typename Keep>
commit_result tree_commit(node_tree *tree, const std::vector<set_step> &steps, Keep keep) {
    node_tree next;
    commit_result result = tree_prepare(*tree, steps, &next);
    if (result.code != 0 || (result.changes.empty() && next.set == tree->set))
        return result;
    if (!keep(next, &result))
        return result;
    *tree = std::move(next);
    return result;
}
