// Why something does not work, from a snapshot: reasons that wccpd noted, reasons that follow from the state,
// and reasons that tunneld gives for traffic. One table has the words for all of them.
#pragma once

#include <string>
#include <vector>

#include "peers/mgmtctl/show_model.h"

// The words of a code. "{who}", "{offered}", "{wanted}" and "{group}" are replaced by the values of a reason.
struct reason_text {
    const char *code;  // stable: in JSON, alarms and documents
    bool attention;    // somebody has to do something, or to wait for something
    const char *cause; // begins with a small letter or an address, and has no full stop
    const char *next;  // what to do
};
// Sorted: of several reasons, the one that comes first here is to be fixed first.
const std::vector<reason_text> &reason_texts();
const reason_text *find_reason_text(const std::string &code); // null: this program has no words for it

struct reason {
    std::string code;
    int group = -1; // -1: of the whole appliance
    std::string who, offered, wanted;
    uint64_t count = 0;                  // 0: a state, which is not counted
    bool lasts = false;                  // it has lasted since `first_ms`, however often it was noted
    int64_t first_ms = -1, last_ms = -1; // how long ago; -1: unknown
    bool harmless = false;               // it needs no attention, whatever the table says
    bool attention = true;
    std::string cause, next; // filled in
};
// Fills in the words of its code, from `texts` or else from the table above.
void fill_reason(const std::vector<reason_text> &texts, reason *inout);
// Those of the whole appliance first, then by group; within a group in the order of the table.
std::vector<reason> reasons_of(const snapshot &shown);
// Why messages of the group's router are refused, or null.
const snapshot_reason *router_reason(const snapshot &shown, const snapshot_group &group,
                                     const snapshot_router &router);
// The reason to be fixed first; null when nothing of the group needs attention.
const reason *main_reason(const std::vector<reason> &reasons, int group);
// The cause of an alarm, by its group (-1: none), name and source; null: unknown.
const reason *alarm_reason(const std::vector<reason> &reasons, int group, const std::string &alarm,
                           const std::string &source);
// "4 times, first 0:01:10 ago, last 0:00:03 ago", or "for 0:01:10"; "" where no time is known.
std::string reason_times(const reason &one);
// The table as rows of docs/operations.md.
std::string reason_table_markdown();
