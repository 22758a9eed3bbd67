// Words that the screen and the page share. No text here needs more than ASCII.
#pragma once

#include <string>
#include <utility>
#include <vector>

#include "peers/mgmtctl/reasons.h"
#include "peers/mgmtctl/show_model.h"

enum class style { plain, bold, dim, good, warn, bad };

std::string plural_text(size_t count, const char *what); // "1 group", "2 groups"
// Of the appliance at this place of its group: A to Z, then a to f. "-" for a negative place, nobody.
char appliance_letter(int place);
// "25%", "20-25%" where routers differ, "-" where none has reported a share.
std::string share_words(const snapshot_appliance &one);
const snapshot_appliance *own_appliance(const snapshot_group &group); // null: not among the group's
size_t connected_routers(const snapshot_group &group);                // in both directions
std::string group_counts(const snapshot &shown);                      // "3 groups: 2 active, 1 backup"

// The state of a group and how good it is. `troubled`: one of its reasons needs attention.
std::pair<std::string, style> group_state_words(const snapshot &shown, const snapshot_group &group,
                                                bool troubled = false);
bool is_in_alarm(const snapshot &shown, const snapshot_group &group);
// Whether it has left its routers, drained or without a proxy: wccpd is given "down" for it then.
bool is_out_of_its_routers(const snapshot &shown, const snapshot_group &group);
// What an alarm is about: its cause, where one is known.
std::string alarm_cause(const snapshot_alarm &alarm, const std::vector<reason> &reasons);
