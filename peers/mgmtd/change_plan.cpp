#include "peers/mgmtd/change_plan.h"

#include <set>

#include "mgmt/node_paths.h"

namespace {

// The root of the service group that the node belongs to, or the node itself.
node_name find_unit(const node_name &name) {
    static const node_name groups = parsed_name(NODE_GROUP_CONFIG);
    if (!name.is_under(groups))
        return name;
    return groups.below(name.parts[groups.parts.size()]);
}

bool is_group(const node_name &name) {
    static const node_name pattern = parsed_name(NODE_GROUP_CONFIG "/*");
    return matches_pattern(pattern, name);
}

// Whether a running group, which exists before and after, applies the change.
bool can_follow(const node_change &change) {
    const schema_row *row = find_schema_row(change.name);
    return change.after && row && !row->recreates;
}

void append_group(const node_map &nodes, const node_name &root, bool created, change_list *out) {
    node_list found;
    collect_nodes(nodes, root, {true, true, false}, &found);
    for (const auto *node : found) {
        node_change change{node->first, {}, {}};
        (created ? change.after : change.before) = node->second;
        out->push_back(std::move(change));
    }
}

} // namespace

wccpd_plan plan_for_wccpd(const node_tree &before, const node_tree &after, const commit_result &commit) {
    std::set<node_name> whole; // groups that are deleted, created, or both, with all their nodes
    for (const node_name &name : commit.renewed)
        if (is_group(name))
            whole.insert(name);
    for (const node_change &change : commit.changes)
        if (const node_name unit = find_unit(change.name); is_group(unit))
            // The root changes only when the group is created or deleted.
            if (change.name == unit || !can_follow(change))
                whole.insert(unit);
    wccpd_plan plan;
    for (const node_name &root : whole) {
        // A new group has no nodes in `before`, and a deleted one has none in `after`.
        append_group(before.nodes, root, false, &plan.events[0]);
        append_group(after.nodes, root, true, &plan.events[2]);
        if (before.nodes.contains(root) && after.nodes.contains(root))
            plan.recreated.push_back(root);
    }
    for (const node_change &change : commit.changes)
        // Changes outside groups are always here: their unit is the node itself.
        if (!whole.contains(find_unit(change.name)))
            plan.events[1].push_back(change);
    return plan;
}

namespace {

// An upper estimate of the bytes in an event. A change has up to five bindings, each with the name of its
// entry.
size_t estimate_event_bytes(const node_change &change) {
    return 1000 + change.name.text().size() + (change.before ? change.before->text.size() : 0) +
           (change.after ? change.after->text.size() : 0);
}

} // namespace

std::vector<std::vector<const node_change *>>
cut_into_events(const std::vector<const node_change *> &changes) {
    std::vector<std::vector<const node_change *>> out;
    size_t size = 0;
    node_name unit;
    for (const node_change *change : changes) {
        const node_name next = find_unit(change->name);
        // The nodes of a group are adjacent, because the changes are in the order of the tree.
        if (out.empty() || (size >= EVENT_BYTES && next != unit)) {
            out.emplace_back();
            size = 0;
        }
        unit = next;
        size += estimate_event_bytes(*change);
        out.back().push_back(change);
    }
    return out;
}
