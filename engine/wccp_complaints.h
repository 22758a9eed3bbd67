// Limits how much received packets can make this appliance write to its log.
//
// A complaint is a line at notice level or above that any number of packets can cause: what is wrong with a
// packet or with what it reports, and what failed while it was processed, such as a new router's tunnel.
// Anybody can send packets. Complaints are therefore counted for the interface that the packet arrived on:
// after a burst of 200 lines, 20 lines a second pass. The rest is suppressed, and the number of suppressed
// lines is logged when the flood is over, or every minute while it lasts.
//
// Functions log complaints with WCCP_COMPLAIN and need not know the interface: the receive thread opens a
// scope for it. Outside a scope, for example in a tick, nothing is suppressed.
//
// Lock held for everything here, except during the exit once no receive thread is left.
#pragma once

#include "engine/wccp_records.h"
#include "runtime/logging.h"

// While an object of this type exists, complaints are counted for the interface. Scopes do not nest.
struct wccp_complaint_scope {
    explicit wccp_complaint_scope(wccp_interface *interface);
    ~wccp_complaint_scope();
    wccp_complaint_scope(const wccp_complaint_scope &) = delete;
    wccp_complaint_scope &operator=(const wccp_complaint_scope &) = delete;
};

// Whether the next complaint may be logged. Counts it as logged or as suppressed.
bool wccp_may_complain();

// Call it once a tick. For each interface whose flood has ended or lasted for a minute it logs how many
// complaints were suppressed.
void wccp_report_suppressed_complaints();

// QV_LOG for complaints.
#define WCCP_COMPLAIN(level, ...)                                                                            \
    do {                                                                                                     \
        if (lc_log_check_level(level) && wccp_may_complain())                                                \
            QV_LOG(level, __VA_ARGS__);                                                                      \
    } while (0)
