// The events in which the sessions learn of a commit.
#pragma once

#include <vector>

#include "peers/nodes/node_tree.h"

using change_list = std::vector<node_change>;

// wccpd follows an event that creates or deletes a group in that alone, and it cannot change the routers,
// interface, priority or protocol of a running group, nor do without a node that has no default. A commit
// therefore reaches it in up to three events: groups deleted, everything else, groups created. A group that
// could not follow is in the first and in the last, whole.
struct wccpd_plan {
    change_list events[3]; // in the order to send them; an empty one is left out
    std::vector<node_name> recreated;
};
wccpd_plan plan_for_wccpd(const node_tree &before, const node_tree &after, const commit_result &commit);

// One event holds so many bytes at most, and the rest of a group: groups are not cut.
constexpr size_t EVENT_BYTES = 1u << 20;
std::vector<std::vector<const node_change *>>
cut_into_events(const std::vector<const node_change *> &changes);
