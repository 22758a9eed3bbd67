// mgmtd's events, for "mgmtctl watch".
#pragma once

#include "peers/mgmtctl/render.h"

// One object, without its time. An unknown event has its bindings as they arrived.
ctl_json json_event(const ctl_event &event, bool secrets);
// Lines, without their time: one, or for a change one for each node.
std::vector<std::string> text_event(const ctl_event &event, bool secrets);
