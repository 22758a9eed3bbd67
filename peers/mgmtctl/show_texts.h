// What only wccpd's text dumps contain, read into a snapshot.
#pragma once

#include "peers/mgmtctl/show_model.h"

// The assignment text of a group: which tables its routers report, which one the designated appliance wants,
// and what it allots. Unknown rows are skipped; appliances that only the text names are added to the group.
void take_assignment_text(const std::string &text, snapshot_group *inout);
// The first interface of a group and its link, from the group's text.
void take_group_text(const std::string &text, snapshot_group *inout);
