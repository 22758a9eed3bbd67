// Changes of groups and policy groups, independent of the session that carries the requests.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "peers/mgmtctl/link.h"

struct group_result {
    int exit = CTL_OK;
    std::string kind;  // "group" or "policy"
    long number = -1;  // -1: none was understood
    std::string done;  // "added", "changed", "recreated", "deleted", "unchanged"; empty: nothing
    int commits = 0;   // that were made
    uint32_t code = 0; // of mgmtd's refusal
    std::string error;
    std::string note;  // for a person, after what was done
    std::string wccpd; // "running", "absent", "silent"; empty where it doesn't matter
    bool runs = false; // wccpd has the group
    std::string state; // ACTIVE, BACKUP, INIT
    bool designated = false;
};

group_result group_command(const ctl_link &link, const std::vector<std::string> &words);
group_result policy_command(const ctl_link &link, const std::vector<std::string> &words);

// The nodes of a group that were set, by their names below the group's root, without those that have their
// default.
using group_nodes = std::map<std::string, std::string>;
std::vector<std::string> group_routers(const group_nodes &nodes); // their addresses, in their order

struct listed_group {
    std::string number;
    group_nodes nodes;
};
// All groups or policy groups below `above`.
group_result list_groups(const ctl_link &link, const std::string &above, std::vector<listed_group> *out);
