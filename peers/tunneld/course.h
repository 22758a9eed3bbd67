// Decides what a group does about a slow start, a drain and the limit of its flows. Without side effects:
// called once a second with the facts, it returns the decisions.
#pragma once

#include <cstdint>
#include <optional>

// How long after a change of the weight the routers have the table that results from it: two announcements.
constexpr int64_t TABLE_CHANGE_MS = 20000;
// How long routers keep an appliance that sends nothing. A wccpd that is restarted within this time does not
// begin a slow start.
constexpr int64_t ROUTER_PATIENCE_MS = 30000;
constexpr uint32_t SLOW_START_STEPS = 5; // of equal size

struct course_facts {
    int64_t now_ms;                     // monotonic
    bool draining = false;              // requested by an operator
    bool left = false;                  // has left its routers, after a drain or because its proxy is down
    bool active = false, alone = false; // see group_view
    bool proxy_up = true;
    uint32_t flows = 0; // of the proxy
    uint32_t slow_start_s = 0, limit = 0;
};
struct course_decision {
    uint32_t weight_percent = 100; // of the configured weight, to be announced unless the group is drained
    bool overloaded = false;       // new flows are returned
    bool empty = false;            // draining: the group can leave its routers
    bool operator==(const course_decision &) const = default;
};
// What is kept of a group from one call to the next.
struct course {
    bool begun = false;                           // there was a call before
    int64_t draining_ms = -1, empty_ms = -1;      // since when; -1: not
    int64_t inactive_ms = -1, slow_start_ms = -1; // likewise
    bool cold = false;                            // the next slow start begins at the first step
    bool overloaded = false;
};
course_decision follow_course(course *self, const course_facts &facts);
