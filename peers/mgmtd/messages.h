// Makes the events of mgmtd, and matches them with the patterns of interests.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "peers/nodes/binding_text.h"
#include "peers/nodes/node_tree.h"

// An event with the fields as its bindings, in this order. Null when there is no memory.
bn_request_msg *make_event(const std::string &name, const std::vector<event_field> &fields);

// EVENT_CONFIG_CHANGE: for each change an entry "/mgmtd/notification/dbchange/N", and below it the kind of
// change, the node, and its value after and before. Null without changes.
bn_request_msg *make_change_event(const std::vector<const node_change *> &changes);

// In a pattern "*" is one part of a name, and "**" at the end is any number of parts, none included: "/a/**"
// matches "/a" as well, because an interest in the nodes below a node includes that node.
bool interest_matches(const std::string &pattern, const node_name &name);
