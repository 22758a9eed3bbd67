// Start and stop of the whole engine, and its timer thread.
#pragma once

#include "engine/wccp_records.h"

// Main thread. 0, or 1, with a line in the log, when the timer thread or the mailbox could not be created. A
// link manager that fails is logged only. Asks mgmtd for the system mode, which runs the event loop.
int wccp_init_mgr();
// Main thread, engine lock not held. Deletes all groups and tunnels and joins all threads. Always 0.
int wccp_exit_mgr();

// Main thread; takes the engine lock. "router" and "server" change nothing; "bridge" stops all groups and
// ends the threads for good. 0, or 1 for null and any other mode.
int wccp_system_mode_change_event(const char *mode);
// Opens the socket for interface queries unless it is open. Always 0.
int wccp_init_network();

// The body of the timer thread, a start function for cthread_init. Never returns.
void *wccp_timer_thread_fn(void *);
// One tick: advances the clock by a second and runs the timers of all enabled groups. Takes the engine lock.
// Does nothing once the exit has begun.
void wccp_tick();
