// Reports of a program to the service manager that has started it, by the notification protocol of systemd:
// one datagram each, to the socket named in $NOTIFY_SOCKET. Without that variable nothing is sent.
#pragma once

#include <cstdint>

// Once, from main() and before any other thread: reads what the service manager has left in the environment
// and removes it there, since programs that are started later are none of its services.
void service_open();
// "READY=1", "STOPPING=1", "WATCHDOG=1" or "STATUS=..."; several are separated by newlines. Never blocks;
// what cannot be sent is lost. From any thread.
void service_report(const char *state);
// The silence, in milliseconds, after which the service manager ends the program; -1: it waits for ever.
int64_t service_watchdog_ms();
