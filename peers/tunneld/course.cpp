#include "peers/tunneld/course.h"

#include <algorithm>

namespace {

constexpr int64_t SECOND_LOOK_MS = 1000;

// Empty means no flow at two counts a second apart: a connection that was being accepted during the first
// count is seen by the second.
bool is_group_empty(course *self, const course_facts &facts) {
    if (!facts.draining) {
        self->draining_ms = self->empty_ms = -1;
        return false;
    }
    if (self->draining_ms < 0)
        self->draining_ms = facts.now_ms;
    // Until the routers have the table without this appliance, new flows still arrive. Without other
    // appliances the table does not change.
    const bool moved =
        facts.left || facts.alone || !facts.active || facts.now_ms - self->draining_ms >= TABLE_CHANGE_MS;
    // A flow that is seen in between starts the two counts again.
    if (facts.flows > 0 || !moved)
        self->empty_ms = -1;
    else if (self->empty_ms < 0)
        self->empty_ms = facts.now_ms;
    return self->empty_ms >= 0 && facts.now_ms - self->empty_ms >= SECOND_LOOK_MS;
}

bool is_overloaded(course *self, const course_facts &facts) {
    // The overload ends only below 90 % of the limit, so that it does not come and go with single flows.
    const uint64_t flows = facts.flows, limit = facts.limit;
    self->overloaded = limit != 0 && (self->overloaded ? flows * 10 >= limit * 9 : flows > limit);
    return self->overloaded;
}

// While the group cannot serve flows, the first step is announced, so that the routers already have it when
// the slow start begins. A group that is active when tunneld starts is not slowed down.
uint32_t find_weight_percent(course *self, const course_facts &facts) {
    if (facts.active)
        self->inactive_ms = -1;
    else if (self->inactive_ms < 0)
        self->inactive_ms = facts.now_ms;
    // A restart of wccpd is waited for, except at the first call, when nothing is known to have been active.
    const bool lost =
        self->inactive_ms >= 0 && (!self->begun || facts.now_ms - self->inactive_ms >= ROUTER_PATIENCE_MS);
    self->begun = true;
    // The slow start itself begins once the group is ACTIVE with a proxy that is up.
    if (facts.draining || facts.left || !facts.proxy_up || lost)
        self->cold = true;
    else if (self->cold && facts.active) {
        self->cold = false;
        self->slow_start_ms = facts.now_ms;
    }
    if (facts.slow_start_s == 0)
        self->slow_start_ms = -1;
    const int64_t whole_ms = int64_t{facts.slow_start_s} * 1000;
    uint32_t step = SLOW_START_STEPS;
    if (whole_ms != 0 && self->cold)
        step = 1;
    else if (self->slow_start_ms >= 0)
        // The first step has been announced already. The others follow at equal intervals, the last one at
        // the end.
        step = static_cast<uint32_t>(std::min<int64_t>(
            (facts.now_ms - self->slow_start_ms) * (SLOW_START_STEPS - 1) / whole_ms + 1, SLOW_START_STEPS));
    return step * 100 / SLOW_START_STEPS;
}

} // namespace

course_decision follow_course(course *self, const course_facts &facts) {
    course_decision out;
    out.weight_percent = find_weight_percent(self, facts);
    out.overloaded = is_overloaded(self, facts);
    out.empty = is_group_empty(self, facts);
    return out;
}
