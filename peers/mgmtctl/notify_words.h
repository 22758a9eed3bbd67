// Translates for "mgmtctl notify": reports of mgmtd into states of subjects, and a change into the
// environment of the commands.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "peers/mgmtctl/notify_changes.h"
#include "peers/mgmtctl/reasons.h"
#include "peers/mgmtctl/session.h"

// Translates an event into the state of a subject; false: it is about something else, or invalid.
bool read_notify_event(const ctl_event &event, notify_subject *out_subject, notify_state *out_state);
// The node to walk for all subjects of a kind, and the states found by that walk.
const char *notify_node(notify_kind kind);
std::map<std::string, notify_state> read_notify_states(notify_kind kind, const ctl_reply &reply);

// The group that a subject belongs to; -1: none.
int notify_group(const notify_subject &subject);
// The variables of the commands, as "NAME=VALUE". Values are printable ASCII of at most 255 characters.
std::vector<std::string> notify_environment(const notify_change &change, const std::vector<reason> &reasons);
