// A token bucket for each interface: BURST tokens, refilled at LINES_PER_SECOND of wccp_g.seconds.
#include "engine/wccp_complaints.h"

namespace {

constexpr uint32_t BURST = 200;
constexpr uint32_t LINES_PER_SECOND = 20;
constexpr uint32_t REPORT_PERIOD =
    60; // seconds; how often the number of suppressed lines is logged in a flood

wccp_interface *current_interface; // of the current scope, null outside one

} // namespace

wccp_complaint_scope::wccp_complaint_scope(wccp_interface *interface) {
    current_interface = interface;
}

wccp_complaint_scope::~wccp_complaint_scope() {
    current_interface = nullptr;
}

namespace {

// Takes one line from the budget; false when it is used up.
bool take_from_budget(wccp_complaint_budget *budget) {
    // In 64 bits, because the time since the last complaint can be years.
    const uint64_t refill = uint64_t{LINES_PER_SECOND} * (wccp_g.seconds - budget->refill_time);
    budget->refill_time = wccp_g.seconds;
    budget->spent = refill < budget->spent ? budget->spent - static_cast<uint32_t>(refill) : 0;
    if (budget->spent >= BURST)
        return false;
    budget->spent++;
    return true;
}

} // namespace

bool wccp_may_complain() {
    // Only lines about received packets are limited.
    if (!current_interface)
        return true;
    wccp_complaint_budget *budget = &current_interface->complaints;
    if (take_from_budget(budget))
        return true;
    if (budget->suppressed++ == 0)
        budget->suppressed_since = wccp_g.seconds;
    return false;
}

void wccp_report_suppressed_complaints() {
    for (uint32_t i = 0; i < wccp_g.if_count; i++) {
        wccp_complaint_budget *budget = &wccp_g.interfaces[i].complaints;
        const bool goes_on = budget->suppressed != budget->suppressed_at_tick;
        budget->suppressed_at_tick = budget->suppressed;
        // Reported when a tick has suppressed nothing, which ends the flood, and every minute while it lasts.
        if (budget->suppressed == 0 || (goes_on && wccp_g.seconds - budget->suppressed_since < REPORT_PERIOD))
            continue;
        (void)take_from_budget(budget); // this line is always logged, but counts
        QV_LOG(LC_LOG_ERR, "WCCP: %s: %u more lines about received packets were suppressed.",
               wccp_g.interfaces[i].name, budget->suppressed);
        budget->suppressed = budget->suppressed_at_tick = 0;
    }
}
