// The loop under a wrapper context; see libevent_loop.cpp.
#pragma once

#include "runtime/guards.h"
#include "runtime/loop_host.h"

// A failed allocation ends the process with a message; null when the self-pipe could not be made.
loop_context *loop_new();
void loop_free(loop_context **inout);
// Runs rounds until something ends it; `once`: until a round has run something. Owner's thread.
lc_status loop_run(loop_context *context, bool once, int *out_no_events, int *out_escaped);
lc_status loop_escape(loop_context *context);
// The loop's lock for a scope.
void loop_lock_take(loop_context *context);
void loop_lock_give(loop_context *context);
struct loop_guard {
    explicit loop_guard(loop_context *context) : held(context) { loop_lock_take(held); }
    ~loop_guard() { loop_lock_give(held); }
    loop_guard(const loop_guard &) = delete;
    loop_guard &operator=(const loop_guard &) = delete;
    cancel_off_guard cancel_off; // callbacks and waits of a loop are not cancelled half way
    loop_context *held;
};
// Makes the event a signal event; 14002 for a signal that another context holds.
lc_status loop_event_set_signal(loop_event *event, int signal_number);
