// What a group's proxy and its routers are in for: normal work, a slow start, a drain, too many flows. Pure:
// facts go in once a second, decisions come out.
#pragma once

#include <cstdint>
#include <optional>

// After a change of weight, until the routers have the table that follows from it: two announcements.
constexpr int64_t TABLE_CHANGE_MS = 20000;
// That routers keep an appliance which they don't hear of: a wccpd that is started anew meanwhile is no start
// of the proxy.
constexpr int64_t ROUTER_PATIENCE_MS = 30000;
constexpr uint32_t SLOW_START_STEPS = 5; // of the same size

struct course_facts {
    int64_t now_ms;                      // monotonic
    bool draining = false, left = false; // by an operator's request; left: also for a proxy that is down
    bool active = false, alone = false;  // as the group's view has it
    bool proxy_up = true;
    uint32_t flows = 0; // of the proxy
    uint32_t slow_start_s = 0, limit = 0;
};
struct course_decision {
    uint32_t weight_percent = 100; // to announce, of the configured weight, apart from a drain
    bool overloaded = false;       // new flows are returned
    bool empty = false;            // draining: the group can leave its routers
    bool operator==(const course_decision &) const = default;
};
// What is remembered of a group from one second to the next.
struct course {
    bool begun = false;
    int64_t draining_ms = -1, empty_ms = -1; // since when, -1: not
    int64_t inactive_ms = -1, slow_start_ms = -1;
    bool cold = false, overloaded = false;
};
course_decision follow_course(course *self, const course_facts &facts);
