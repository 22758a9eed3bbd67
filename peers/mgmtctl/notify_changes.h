// What "mgmtctl notify" reports: the role of each group, each alarm, and the health of each proxy. The states
// that commands have been run for are kept, so that a change is found whenever it happens, also while nobody
// was looking.
#pragma once

#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <string>

enum class notify_kind { role, alarm, health };

struct notify_subject {
    notify_kind kind;
    std::string name; // of a group its number; of an alarm its type, a blank and its source

    friend auto operator<=>(const notify_subject &, const notify_subject &) = default;
};
const char *notify_kind_word(notify_kind kind); // "role", "alarm", "health"
// The state of a subject of which nothing is known: "UNKNOWN", "cleared", "unknown".
const char *notify_first_state(notify_kind kind);

struct notify_change {
    notify_subject subject;
    std::string state, previous; // previous: the one that commands were last run for
    std::string detail;          // what the report said: the reason of a health check, the text of an alarm
    int64_t time = 0;            // seconds since 1970
    uint32_t merged = 0;         // earlier states that this one has replaced while it waited
};

// Of changes that wait; one for each subject. What comes beyond is dropped, and found again by the next
// comparison.
constexpr size_t NOTIFY_WAITING_MAX = 256;

struct notify_book {
    std::map<notify_subject, std::string> reported; // without the subjects that are in their first state
    std::deque<notify_change> waiting;              // in the order in which they are to be reported
    uint64_t merged = 0, dropped = 0;               // since the start
    std::function<void(const std::string &line)> say;
    std::function<int64_t()> clock_s; // since 1970
};

// The subject is in this state. A change waits for its turn; a newer state of a subject that waits already
// replaces the older one and keeps its place.
void notify_note(notify_book *book, const notify_subject &subject, const std::string &state,
                 const std::string &detail);
// These are all subjects of the kind, by their names, with their states. A role that is missing has become
// UNKNOWN and an alarm has been cleared; the health of a proxy that is missing is forgotten, for it is
// configured no more.
struct notify_state {
    std::string state, detail;
};
void notify_compare(notify_book *book, notify_kind kind, const std::map<std::string, notify_state> &present);
// Takes the next change out of those that wait, which counts as reported from now on. False: none waits.
bool notify_take(notify_book *book, notify_change *out);

// The reported states as text, a line for each: "STATE KIND NAME".
std::string notify_book_text(const notify_book &book);
// Lines that cannot be read are left out. Gives how many these are.
size_t notify_read_book(notify_book *book, const std::string &text);
