// The bound on what received packets can make this appliance write to its log. Engine lock held throughout,
// but for the exit, once no receive thread is left.
//
// A complaint is a line at notice level or above that any number of packets can cause: what is wrong with a
// packet or with what it reports, and what failed while it was processed, such as a new router's tunnel.
// Anybody can send packets, so complaints are counted for the interface that the packet arrived on: a burst
// of 200 lines passes, then 20 a second. What is beyond that is suppressed, and the number of suppressed
// lines is logged when the flood is over, or after a minute of it.
//
// A function logs its complaints with WCCP_COMPLAIN and need not know the interface: a scope on the receive
// thread says which one it is. Without a scope, as on the tick, nothing is suppressed.
#pragma once

#include "engine/wccp_records.h"
#include "runtime/logging.h"

// While it lives, complaints count for the interface. Scopes do not nest.
struct wccp_complaint_scope {
    explicit wccp_complaint_scope(wccp_interface *interface);
    ~wccp_complaint_scope();
    wccp_complaint_scope(const wccp_complaint_scope &) = delete;
    wccp_complaint_scope &operator=(const wccp_complaint_scope &) = delete;
};

// Whether the next complaint may be logged; it counts as logged or as suppressed from then on.
bool wccp_may_complain();

// Once a tick: logs how many complaints were suppressed, for each interface whose flood is over.
void wccp_report_suppressed_complaints();

#define WCCP_COMPLAIN(level, ...)                                                                            \
    do {                                                                                                     \
        if (lc_log_check_level(level) && wccp_may_complain())                                                \
            QV_LOG(level, __VA_ARGS__);                                                                      \
    } while (0)
