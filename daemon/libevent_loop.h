// The event loop under a wrapper context `lew`; see libevent_loop.cpp. runtime/loop_host.h has its other
// half.
#pragma once

#include "runtime/guards.h"
#include "runtime/loop_host.h"

// A loop owned by the calling thread, to be freed with loop_free. A failed allocation ends the process with a
// message on standard error; null, with a line in the log, when the self-pipe could not be created.
loop_context *loop_new();
void loop_free(loop_context **inout); // sets the pointer to null
// Runs the loop until no event is left (`out_no_events` 1) or it has been escaped from (`out_escaped` 1);
// with `once` also until a round has called something. The outputs are set, not cleared. Owner's thread only;
// may be called from inside a callback.
lc_status loop_run(loop_context *context, bool once, int *out_no_events, int *out_escaped);
// Ends this and all later runs of the loop. Any thread.
lc_status loop_escape(loop_context *context);
// The loop's recursive lock.
void loop_lock_take(loop_context *context);
void loop_lock_give(loop_context *context);
// Holds it for a scope.
struct loop_guard {
    explicit loop_guard(loop_context *context) : held(context) { loop_lock_take(held); }
    ~loop_guard() { loop_lock_give(held); }
    loop_guard(const loop_guard &) = delete;
    loop_guard &operator=(const loop_guard &) = delete;
    cancel_off_guard cancel_off; // a thread is not cancelled in the middle of a callback or a wait
    loop_context *held;
};
// Makes the event a signal event and starts it. LC_ASSERTION, with a line in the log, for a signal that
// another loop has registered or a number outside 1 to LEW_SIGNAL_MAX.
lc_status loop_event_set_signal(loop_event *event, int signal_number);
