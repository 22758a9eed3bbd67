// The numbers of the engine for a monitoring system, as texts of lines, because a node for each number of
// thousands of routers would be too many nodes. The words of a line are separated by blanks, and times are in
// seconds. The text of a group:
//
//   gauge WORD VALUE
//   counter WORD VALUE
//   router ID ADDRESS TWO_WAY SINCE_I_SEE_YOU CONNECTED OWN_SLOTS SLOTS
//   appliance ADDRESS WEIGHT
//   reason CODE SENDER COUNT SINCE_LAST
//
// and the text of what belongs to no group:
//
//   counter WORD VALUE
//   interface NAME UP STARTS STOPS LINK_DOWNS ADDRESS_CHANGES
//   reason CODE SENDER COUNT SINCE_LAST
#pragma once

#include <cstdint>

#include "runtime/csys.h"

// Bytes of the longest texts: 9 gauges, 21 counters, 32 routers, 32 appliances and 40 reasons; 4 counters,
// 127 interfaces and 16 reasons.
constexpr uint32_t WCCP_METRICS_BYTES = 12288;

// They take the engine lock. 0, or 1 when `buffer` is null, there is no such group, or the text did not fit.
int wccp_print_metrics(int id, csys_display_buf *buffer);
int wccp_print_global_metrics(csys_display_buf *buffer);
