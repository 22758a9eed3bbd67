// The numbers of a group for a monitoring system as one text, so that thousands of routers need no nodes of
// their own. Each line has words separated by blanks; times are in seconds:
//
//   group ACTIVE DESIGNATED UPTIME ROUTERS APPLIANCES PENDING_ACKS      the first two are 1 or 0
//   counter WORD VALUE
//   router ID ADDRESS TWO_WAY SINCE_I_SEE_YOU CONNECTED OWN_SLOTS SLOTS
//   appliance ADDRESS WEIGHT
//   reason CODE SENDER COUNT SINCE_LAST
#pragma once

#include <cstdint>

#include "runtime/csys.h"

// Bytes of the longest text: 17 counters, 32 routers, 32 appliances and 40 reasons.
constexpr uint32_t WCCP_METRICS_BYTES = 12288;

// Takes the engine lock. 0, or 1 when `buffer` is null, there is no such group, or the text did not fit.
int wccp_print_metrics(int id, csys_display_buf *buffer);
