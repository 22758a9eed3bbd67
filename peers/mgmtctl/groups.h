// The words of "mgmtctl group" and "mgmtctl policy", apart from the session that carries them.
#pragma once

#include <functional>
#include <map>
#include <string>
#include <vector>

#include "peers/mgmtctl/commands.h"

struct group_word {
    const char *word;
    const char *node; // below the group's root; "router" stands for the list of its entries
    const char *hint; // of its values; null: as the schema has them
    bool whole;       // wccpd takes a change only with the group as a whole
    bool free_text;   // any text is a value, "default" too
};
const std::vector<group_word> &group_words();

// Two requests of a session, so that a test can answer them.
struct group_link {
    std::function<bool(ctl_walk walk, const std::string &name, ctl_reply *out, std::string *out_reason)>
        query;
    std::function<bool(const std::vector<ctl_change_item> &items, ctl_reply *out, std::string *out_reason)>
        set;
    int64_t settle_ms = 5000; // how long wccpd may take to follow
};

struct group_result {
    int exit = CTL_OK;
    std::string kind;  // "group" or "policy"
    long number = -1;  // -1: none was understood
    std::string done;  // "added", "changed", "recreated", "deleted", "unchanged", "restored"; empty: nothing
    int commits = 0;   // that were made
    uint32_t code = 0; // of mgmtd's refusal
    std::string error;
    std::string note;  // for a person, behind what was done
    std::string wccpd; // "running", "absent", "silent"; empty where it doesn't matter
    bool runs = false; // wccpd has the group
    std::string state; // ACTIVE, BACKUP, INIT
    bool designated = false;
};

group_result group_command(const group_link &link, const std::vector<std::string> &words);
group_result policy_command(const group_link &link, const std::vector<std::string> &words);
