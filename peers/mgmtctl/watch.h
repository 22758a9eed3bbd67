// Events as mgmtd sends them, for "mgmtctl watch".
#pragma once

#include "peers/mgmtctl/render.h"

// One object, without its time. An event that isn't known has its bindings as they came.
ctl_json json_event(const ctl_event &event, bool secrets);
// Lines, without their time: one, or of a change one for each node.
std::vector<std::string> text_event(const ctl_event &event, bool secrets);
