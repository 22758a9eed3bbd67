// The daemon as a service: whether it may do what it has to, and that it is alive.
#pragma once

#include "runtime/common.h"

// How many privileges are missing. Each is reported in the log and on standard error, with what it is for.
int wccpd_report_missing_privileges();
// Reports that the daemon is ready, and from then on that it is alive: that its loop goes round and that the
// engine's lock is free again and again. Main thread.
lc_status wccpd_service_ready();
void wccpd_service_deinit(); // before the loop is freed
