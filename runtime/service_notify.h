// Status reports to the service manager, by the protocol of sd_notify(3): a datagram for each report, to the
// socket named in $NOTIFY_SOCKET. Without that variable nothing is sent.
#pragma once

#include <cstdint>

// Reads the variables that the service manager has set, and removes them from the environment, so that child
// processes don't inherit them. main() calls it once, before it starts any thread.
void service_open();
// Sends "READY=1", "STOPPING=1", "WATCHDOG=1" or "STATUS=...", or several separated by newlines. Never
// blocks; a report that can't be sent is lost. Any thread; not a cancellation point.
void service_report(const char *state);
// The watchdog timeout: the service manager ends a program that sends no "WATCHDOG=1" for this many
// milliseconds. -1 if the watchdog is not enabled.
int64_t service_watchdog_ms();
