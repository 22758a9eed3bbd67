// Values and changes as bindings, and the messages that mgmtd makes of them.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "mgmt/owners.h"
#include "platform/mgmtd/node_tree.h"

// Null when it can't be made.
bn_binding *make_binding(const std::string &name, const node_value &value);
// The value as text, "" without one; the type without its flags.
node_value value_of(const bn_binding *binding);
std::string name_of(const bn_binding *binding);

// An event; the fields are bindings in their order.
struct event_field {
    std::string name;
    node_value value;
};
bn_request_msg *make_event(const std::string &name, const std::vector<event_field> &fields);
std::vector<event_field> fields_of(const bn_request_msg *msg);
const std::string *find_field(const std::vector<event_field> &fields, const char *name);

// The event that tells of a commit: for each change an entry "/mgmtd/notification/dbchange/N", below it what
// kind of change, the node, and its value after and before. Null when there is nothing to tell.
extern const char *const CHANGE_EVENT;
bn_request_msg *make_change_event(const std::vector<const node_change *> &changes);

// Interest patterns: "*" is one part, "**" at the end is any number of them. Other than in a match of
// names, "/a/**" takes in "/a" itself: whoever follows what is below a node follows the node.
bool interest_matches(const std::string &pattern, const node_name &name);
