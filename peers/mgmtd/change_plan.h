// How the changes of a commit are divided into change events.
#pragma once

#include <vector>

#include "peers/nodes/node_tree.h"

using change_list = std::vector<node_change>;

// If an event creates or deletes a group, wccpd applies nothing else of that event. A running group cannot
// follow a change of its routers, interface, priority or protocol, nor the deletion of a node that has no
// default. wccpd therefore gets a commit in up to three events: deleted groups, everything else, created
// groups. A group that cannot follow is in the first and the last with all its nodes.
struct wccpd_plan {
    change_list events[3];            // in the order of sending; empty ones are not sent
    std::vector<node_name> recreated; // groups that are deleted and created again
};
wccpd_plan plan_for_wccpd(const node_tree &before, const node_tree &after, const commit_result &commit);

// An event has about this many bytes at most. It is larger when a single group is, because groups are not
// divided.
constexpr size_t EVENT_BYTES = 1u << 20;
std::vector<std::vector<const node_change *>>
cut_into_events(const std::vector<const node_change *> &changes);
