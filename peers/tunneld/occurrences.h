// Times of events that an operator should know about: packets that a counter has counted, and lasting states.
//
// Counters are read every OCCURRENCE_LOOK_MS and at each query of the state, which limits the accuracy of the
// times. If nothing has occurred for OCCURRENCE_MS, the next occurrence counts as the first.
#pragma once

#include <cstdint>
#include <map>
#include <string>

constexpr int64_t OCCURRENCE_MS = 300000;
constexpr int64_t OCCURRENCE_LOOK_MS = 10000;

struct occurrence {
    uint64_t total = 0;                  // of the counter when it was last read
    int64_t first_ms = -1, last_ms = -1; // monotonic; -1: it has not occurred
};
using occurrences = std::map<std::string, occurrence>; // by the name of the event

// Records the present value of a counter.
void note_counter(occurrences *inout, const std::string &what, uint64_t total, int64_t now_ms);
// Records whether a state lasts; one that is over is forgotten.
void note_state(occurrences *inout, const std::string &what, bool lasts, int64_t now_ms);
