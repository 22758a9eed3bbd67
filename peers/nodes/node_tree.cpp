// A commit works on a copy of the tree: the steps are applied one by one, and the result is checked as a
// whole. Its changes are the differences between the nodes of both trees, defaults included. A new group is
// therefore reported with its root and all its children, and deleting a node that has a default changes it to
// that default.
//
// Creating a child also creates the instances that it belongs to. Modifying a child of an instance that does
// not exist is refused, so that a mistyped number does not make a new group.
#include "peers/nodes/node_tree.h"

#include <algorithm>
#include <bit>
#include <set>

#include "mgmt/bnode_types.h"
#include "mgmt/node_paths.h"

namespace {

const node_name service_groups = parsed_name(NODE_GROUP_CONFIG);
const node_name policy_groups = parsed_name(NODE_POLICY_CONFIG);
const node_name intercepts = parsed_name(NODE_INTERCEPT_CONFIG);
const node_name policy_membership = parsed_name(NODE_GROUP_CONFIG "/*/policy_grp");

bool has_wildcard(const node_name &pattern) {
    for (const std::string &part : pattern.parts)
        if (part == "*")
            return true;
    return false;
}

} // namespace

std::vector<node_name> instances_of(const node_name &name) {
    std::vector<node_name> out;
    node_name above;
    for (const std::string &part : name.parts) {
        above.parts.push_back(part);
        const schema_row *row = find_schema_row(above);
        if (row && row->instance)
            out.push_back(above);
    }
    return out;
}

void tree_refresh(node_tree *tree) {
    tree->nodes.clear();
    std::vector<node_name> instances;
    for (const auto &[name, text] : tree->set) {
        const schema_row *row = find_schema_row(name);
        if (!row)
            continue;
        // Values that were set come first: emplace leaves them alone when the defaults follow.
        tree->nodes.emplace(name, node_value{row->type, text});
        if (row->instance)
            instances.push_back(name);
    }
    for (const schema_row &row : schema_rows()) {
        if (!row.fallback)
            continue;
        // A node that is part of no instance always exists.
        if (!has_wildcard(row.parts)) {
            tree->nodes.emplace(row.parts, node_value{row.type, row.fallback});
            continue;
        }
        node_name above = row.parts;
        const std::string last = above.parts.back();
        above.parts.pop_back();
        // Otherwise there is one for each instance that exists. Its pattern is that of the row without the
        // last part.
        for (const node_name &instance : instances)
            if (matches_pattern(above, instance))
                tree->nodes.emplace(instance.below(last), node_value{row.type, row.fallback});
    }
}

// --- Checks of the whole tree

namespace {

const std::string *find_text(const node_tree &tree, const node_name &name) {
    const auto found = tree.nodes.find(name);
    return found == tree.nodes.end() ? nullptr : &found->second.text;
}

bool check_routers(const node_tree &tree, const node_name &group, std::string *out_reason) {
    const node_name list = group.below("router");
    node_list entries;
    collect_nodes(tree.nodes, list, {false, false, false}, &entries);
    std::set<std::string> seen;
    uint32_t expected = 1;
    // In numerical order, so that a gap shows at the first number after it.
    for (const auto *entry : entries) {
        const auto &[name, value] = *entry;
        if (value.text != std::to_string(expected++)) {
            *out_reason = list.text() + ": entries are numbered from 1 without a gap, number " +
                          std::to_string(expected - 1) + " is missing";
            return false;
        }
        const std::string *address = find_text(tree, name.below("ipaddr"));
        if (!address) {
            *out_reason = name.text() + ": has no ipaddr";
            return false;
        }
        // Compared as text, which is canonical.
        if (*address == "0.0.0.0" || !seen.insert(*address).second) {
            *out_reason = name.text() + "/ipaddr: " + *address +
                          (*address == "0.0.0.0" ? " is not the address of a router" : " is given twice");
            return false;
        }
    }
    return true;
}

bool check_masks(const node_tree &tree, const node_name &group, std::string *out_reason) {
    int bits = 0;
    for (const char *mask : {"mask_src_ip", "mask_dst_ip", "mask_src_port", "mask_dst_port"})
        if (const std::string *text = find_text(tree, group.below(mask)))
            // The limit is on the sum: each bit doubles the number of values in an assignment.
            bits += std::popcount(std::stoull(*text));
    if (bits <= 7)
        return true;
    *out_reason =
        group.text() + ": the four masks have " + std::to_string(bits) + " bits set together, the most is 7";
    return false;
}

// Health checks of some kinds need an argument.
bool check_health_argument(const node_tree &tree, const node_name &intercept, std::string *out_reason) {
    const std::string *kind = find_text(tree, intercept.below("check"));
    const std::string *argument = find_text(tree, intercept.below("check_argument"));
    if (!kind || !argument || *kind == "tcp")
        return true;
    const bool http = *kind == "http";
    // A blank would end the path in the request line of HTTP.
    if (!argument->empty() && (!http || argument->find(' ') == std::string::npos))
        return true;
    *out_reason = intercept.below("check").text() + ": " + *kind + " needs " +
                  (http ? "the path of a page, without blanks," : "the file of a command") +
                  " in check_argument";
    return false;
}

} // namespace

bool tree_check(const node_tree &tree, std::string *out_reason) {
    node_list roots;
    collect_nodes(tree.nodes, service_groups, {false, false, false}, &roots);
    for (const auto *root : roots)
        if (!check_routers(tree, root->first, out_reason) || !check_masks(tree, root->first, out_reason))
            return false;
    roots.clear();
    collect_nodes(tree.nodes, intercepts, {false, false, false}, &roots);
    return std::all_of(roots.begin(), roots.end(), [&](const auto *root) {
        return check_health_argument(tree, root->first, out_reason);
    });
}

void collect_nodes(const node_map &nodes, const node_name &root, tree_walk walk, node_list *out) {
    // A root and all nodes below it are adjacent in the map, the root first.
    for (auto at = nodes.lower_bound(root); at != nodes.end(); ++at) {
        const bool self = at->first == root;
        if (!self && !at->first.is_under(root))
            break;
        if (self && !walk.include_self)
            continue;
        if (!self && !walk.subtree && at->first.parts.size() != root.parts.size() + 1)
            continue;
        const auto next = std::next(at);
        // The first node below another one follows it immediately.
        if (walk.leaves_only && next != nodes.end() && next->first.is_under(at->first))
            continue;
        out->push_back(&*at);
    }
}

// --- Commits

namespace {

commit_result refuse_step(uint32_t code, const std::string &name, const std::string &reason) {
    return {code, shown_text(name) + ": " + reason, {}, {}};
}

commit_result remove_step(node_tree *tree, const set_step &step, const node_name &name) {
    const bool instance = find_schema_row(name)->instance;
    // The root itself need not exist: below a list there may be entries.
    bool found = tree->set.erase(name) > 0;
    for (auto at = tree->set.lower_bound(name); at != tree->set.end() && at->first.is_under(name);) {
        found = true;
        at = tree->set.erase(at);
    }
    // A value that is not set has its default already; deleting it changes nothing.
    if (!found && instance)
        return refuse_step(LC_NOT_FOUND, step.name, "does not exist");
    return {};
}

commit_result value_step(node_tree *tree, const set_step &step, const node_name &name,
                         const schema_row &row) {
    // A value may be sent as a text, whatever the type of the node. An instance may come without one.
    const bool as_text = step.type == bn_type_str || (row.instance && step.type == bn_type_none);
    if (step.type != row.type && !as_text)
        return refuse_step(LC_BAD_TYPE, step.name,
                           std::string("is of type ") + type_name(row.type) + ", not " +
                               type_name(step.type));
    std::string text, reason;
    if (!check_value(row, name, step.text, &text, &reason))
        return refuse_step(LC_BAD_ARGUMENT, step.name, reason);
    // Outermost first, and the node itself last if it is an instance.
    for (const node_name &instance : instances_of(name)) {
        if (tree->set.contains(instance))
            continue;
        if (step.kind == set_kind::modify)
            return refuse_step(LC_NOT_FOUND, step.name, instance.text() + " does not exist");
        tree->set[instance] = instance.parts.back();
    }
    tree->set[name] = text;
    return {};
}

} // namespace

std::vector<node_change> tree_difference(const node_map &before, const node_map &after) {
    std::vector<node_change> changes;
    // Merges both maps, which have the same order: the smaller name is only in one of them.
    auto a = before.begin();
    auto b = after.begin();
    while (a != before.end() || b != after.end()) {
        const bool take_a = b == after.end() || (a != before.end() && a->first <= b->first);
        const bool take_b = a == before.end() || (b != after.end() && b->first <= a->first);
        if (!take_a || !take_b || a->second != b->second) {
            node_change change;
            change.name = take_a ? a->first : b->first;
            if (take_a)
                change.before = a->second;
            if (take_b)
                change.after = b->second;
            changes.push_back(std::move(change));
        }
        if (take_a)
            ++a;
        if (take_b)
            ++b;
    }
    return changes;
}

namespace {

std::vector<node_name> find_renewed(const node_tree &before, const std::vector<set_step> &steps,
                                    const node_tree &after) {
    std::vector<node_name> out;
    for (const set_step &step : steps) {
        node_name name;
        // The rows exist, because the steps have been applied already.
        if (step.kind == set_kind::remove && parse_node_name(step.name, &name) &&
            find_schema_row(name)->instance && before.nodes.contains(name) && after.nodes.contains(name))
            out.push_back(name);
    }
    return out;
}

} // namespace

commit_result tree_prepare(const node_tree &tree, const std::vector<set_step> &steps, node_tree *out_next) {
    // Only what was set is copied; the rest follows from it.
    out_next->set = tree.set;
    out_next->revision = tree.revision + 1;
    for (const set_step &step : steps) {
        node_name name;
        if (!parse_node_name(step.name, &name))
            return refuse_step(LC_BAD_PATH, step.name, "is not an absolute node name");
        const schema_row *row = find_schema_row(name);
        if (!row)
            return refuse_step(LC_NOT_FOUND, step.name, "there is no such node in the configuration");
        commit_result result = step.kind == set_kind::remove ? remove_step(out_next, step, name)
                                                             : value_step(out_next, step, name, *row);
        if (result.code != 0)
            return result;
    }
    tree_refresh(out_next);
    std::string reason;
    if (!tree_check(*out_next, &reason))
        return {LC_ASSERTION, reason, {}, {}};
    return {0, "", tree_difference(tree.nodes, out_next->nodes), find_renewed(tree, steps, *out_next)};
}

bool tree_check_change(const node_tree &before, const node_tree &after, std::string *out_reason) {
    for (const auto &[name, value] : after.nodes) {
        if (!matches_pattern(policy_membership, name))
            continue;
        const node_name policy = policy_groups.below(value.text);
        // A policy group that has never existed may be named: only the loss of one that is in use is refused.
        if (!before.nodes.contains(policy) || after.nodes.contains(policy))
            continue;
        *out_reason = name.text() + ": policy group " + value.text +
                      " is in use here and can't be deleted; change or delete this node first, or with it";
        return false;
    }
    return true;
}
