#include "peers/tunneld/occurrences.h"

void note_counter(occurrences *inout, const std::string &what, uint64_t total, int64_t now_ms) {
    if (total == 0)
        return;
    occurrence &known = (*inout)[what];
    if (total > known.total) {
        // After a long pause a new series begins.
        if (known.last_ms < 0 || now_ms - known.last_ms > OCCURRENCE_MS)
            known.first_ms = now_ms;
        known.last_ms = now_ms;
    }
    known.total = total; // less than before if the counter was reset
}

void note_state(occurrences *inout, const std::string &what, bool lasts, int64_t now_ms) {
    if (!lasts)
        inout->erase(what);
    else if (occurrence &known = (*inout)[what]; known.first_ms < 0)
        known.first_ms = now_ms;
}
