// The book of "mgmtctl notify": roles of groups, alarms, and the health of proxies. It keeps the states for
// which commands have been run; comparing them with the current states also finds changes that happened while
// the service was not running.
#pragma once

#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <string>

enum class notify_kind { role, alarm, health };

struct notify_subject {
    notify_kind kind;
    std::string name; // the number of the group, or the alarm's type, a blank and its source

    friend auto operator<=>(const notify_subject &, const notify_subject &) = default;
};
const char *notify_kind_word(notify_kind kind); // "role", "alarm", "health"
// The state of a subject before its first report: "UNKNOWN", "cleared", "unknown".
const char *notify_first_state(notify_kind kind);

struct notify_change {
    notify_subject subject;
    std::string state, previous; // previous: the state for which commands were last run
    std::string detail;          // from the report: the reason of a health check, the text of an alarm
    int64_t time = 0;            // seconds since 1970
    uint32_t merged = 0;         // earlier states that this one has replaced in the queue
};

// Length of the queue, which has one change for each subject. Further changes are dropped, and found again by
// the next comparison.
constexpr size_t NOTIFY_WAITING_MAX = 256;
// Length of a state, in characters.
constexpr size_t STATE_MAX = 15;

struct notify_book {
    std::map<notify_subject, std::string> reported; // except subjects in their first state
    std::deque<notify_change> waiting;              // the queue; the first is reported next
    uint64_t merged = 0, dropped = 0;               // since the start
    std::function<void(const std::string &line)> say;
    std::function<int64_t()> clock_s; // since 1970
};

// Notes the state of a subject. A change is queued; if the subject is in the queue already, the newer state
// replaces the older one in its place.
void notify_note(notify_book *book, const notify_subject &subject, const std::string &state,
                 const std::string &detail);
// Notes the states of all subjects of a kind, by name. A missing role has become UNKNOWN, a missing alarm has
// been cleared, and a missing proxy is forgotten, because it is no longer configured.
struct notify_state {
    std::string state, detail;
};
void notify_compare(notify_book *book, notify_kind kind, const std::map<std::string, notify_state> &present);
// Takes the next change from the queue; it counts as reported from now on. False: the queue is empty.
bool notify_take(notify_book *book, notify_change *out);

// Prints the reported states as text, one line each: "STATE KIND NAME".
std::string notify_book_text(const notify_book &book);
// Reads that text. Skips invalid lines and returns their number.
size_t notify_read_book(notify_book *book, const std::string &text);
