// Events as mgmtd sends them, for "mgmtctl watch".
#pragma once

#include "peers/mgmtctl/render.h"

// The names of all events that can be watched.
std::vector<std::string> watched_events();
// A name without a wildcard stands for the node and all below it.
std::string watch_pattern(const std::string &name);
// One object, without its time. An event that isn't known has its bindings as they came.
ctl_json json_event(const ctl_event &event, bool secrets);
// Lines, without their time: one, or of a change one for each node.
std::vector<std::string> text_event(const ctl_event &event, bool secrets);
