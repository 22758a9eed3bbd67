// The daemon as a system service: its privileges, readiness and watchdog.
#pragma once

#include "runtime/common.h"

// Returns the number of missing privileges. Each is reported in the log and on standard error.
int wccpd_report_missing_privileges();
// Notifies the service manager that the daemon is ready, and if it has a watchdog, from then on periodically
// that the daemon is alive: that its loop is running and the engine lock is released from time to time. Main
// thread.
lc_status wccpd_service_ready();
void wccpd_service_deinit(); // call it before the loop is freed
