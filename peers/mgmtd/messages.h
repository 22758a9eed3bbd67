// The events that mgmtd makes, and which of them somebody wants.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "peers/nodes/binding_text.h"
#include "peers/nodes/node_tree.h"

// An event; the fields are bindings in their order.
bn_request_msg *make_event(const std::string &name, const std::vector<event_field> &fields);

// EVENT_CONFIG_CHANGE: for each change an entry "/mgmtd/notification/dbchange/N", and below it the kind of
// change, the node, and its value after and before. Null without changes.
bn_request_msg *make_change_event(const std::vector<const node_change *> &changes);

// Interest patterns: "*" is one part, "**" at the end is any number of them. Other than in a match of
// names, "/a/**" includes "/a" itself: whoever follows what is below a node follows the node.
bool interest_matches(const std::string &pattern, const node_name &name);
