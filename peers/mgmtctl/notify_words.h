// The words of "mgmtctl notify": what mgmtd reports, as states of subjects, and what the commands get to know
// of a change.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "peers/mgmtctl/notify_changes.h"
#include "peers/mgmtctl/reasons.h"
#include "peers/mgmtctl/session.h"

// The event as the state of a subject; false: it is about something else, or cannot be read.
bool read_notify_event(const ctl_event &event, notify_subject *out_subject, notify_state *out_state);
// All subjects of the kind, from a walk of the node that has them.
const char *notify_node(notify_kind kind);
std::map<std::string, notify_state> read_notify_states(notify_kind kind, const ctl_reply &reply);

// The group that a subject belongs to; -1: none.
int notify_group(const notify_subject &subject);
// What the commands get to know, as "NAME=VALUE". Values are printable ASCII of at most 255 characters.
std::vector<std::string> notify_environment(const notify_change &change, const std::vector<reason> &reasons);
