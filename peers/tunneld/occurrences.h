// When things occurred that an operator should know of: packets that a counter has counted, and states that
// last.
//
// Counters are looked at now and then, and whenever somebody asks for the state; the times are as exact as
// that. What has not occurred again for OCCURRENCE_MS begins anew when it does.
#pragma once

#include <cstdint>
#include <map>
#include <string>

constexpr int64_t OCCURRENCE_MS = 300000;
constexpr int64_t OCCURRENCE_LOOK_MS = 10000; // between looks at the counters

struct occurrence {
    uint64_t total = 0;                  // of the counter when it was looked at last
    int64_t first_ms = -1, last_ms = -1; // monotonic; -1: it has not occurred
};
using occurrences = std::map<std::string, occurrence>; // by what has occurred

// The counter has this value now.
void note_counter(occurrences *inout, const std::string &what, uint64_t total, int64_t now_ms);
// The state lasts, or is over.
void note_state(occurrences *inout, const std::string &what, bool lasts, int64_t now_ms);
