// The manager: start and stop of the whole engine, and its timer thread.
#pragma once

#include "engine/wccp_records.h"

int wccp_init_mgr(); // main thread; 0, or 1 when the engine did not start
int wccp_exit_mgr(); // main thread, no lock held; always 0

// "router" and "server" change nothing, "bridge" stops the groups and their threads for good. Takes the lock;
// 1 for any other mode.
int wccp_system_mode_change_event(const char *mode);
int wccp_init_network();

// The body of the timer thread (cthread start function).
void *wccp_timer_thread_fn(void *);
// One tick, as the timer thread runs it once a second; takes the lock.
void wccp_tick();
