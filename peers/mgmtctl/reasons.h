// Why something does not work, from a snapshot: what wccpd noted, what follows from the state, and what
// tunneld says about traffic. One table has the words for all of it.
#pragma once

#include <string>
#include <vector>

#include "peers/mgmtctl/show_model.h"

// What is known of a code. "{who}", "{offered}", "{wanted}", "{group}" and "{interface}" stand for the values
// of a reason.
struct reason_text {
    const char *code;  // stable: in JSON, alarms and documents
    bool attention;    // somebody should do something, or wait for something
    const char *cause; // begins with a small letter or an address, and has no full stop
    const char *next;  // what to do
};
// The most fundamental ones first: of several reasons the first is the one to begin with.
const std::vector<reason_text> &reason_texts();
const reason_text *find_reason_text(const std::string &code); // null: this program has no words for it

struct reason {
    std::string code;
    int group = -1; // -1: of the whole appliance
    std::string who, offered, wanted;
    uint64_t count = 0;                  // 0: a state, which is not counted
    int64_t first_ms = -1, last_ms = -1; // how long ago; -1: unknown
    bool attention = true;
    std::string cause, next; // filled in
};
// Fills in the words of its code, from `texts` or else from the table above.
void fill_reason(const std::vector<reason_text> &texts, reason *inout);
// In the order of their groups, those of the whole appliance first, and of the table.
std::vector<reason> reasons_of(const snapshot &shown);
// The one to begin with; null when nothing of the group needs attention.
const reason *main_reason(const std::vector<reason> &reasons, int group);
// What an alarm comes from, by its group (-1: none), name and source; null: unknown.
const reason *alarm_reason(const std::vector<reason> &reasons, int group, const std::string &alarm,
                           const std::string &source);
// "4 times, first 0:01:10 ago, last 0:00:03 ago", or since when; "" where no time is known.
std::string reason_times(const reason &one);
// The table as rows of docs/operations.md.
std::string reason_table_markdown();
