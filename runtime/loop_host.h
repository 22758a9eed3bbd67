// The event loop as the rooms below the daemon see it. The daemon defines everything here; a program that
// links these rooms without the daemon links the loop with them.
//
// A wrapper context (`lew`) belongs to the thread that made it: only that thread dispatches, and every
// callback runs on it with the loop's lock held. Waits nest: a callback may dispatch again, to any depth.
#pragma once

#include <cstdint>

#include "runtime/common.h"

struct lew;          // wrapper context, one for each thread that runs a loop
struct lew_event;    // one registration, owned by the context through the caller's slot
struct loop_context; // the loop under a wrapper context
struct loop_event;   // one descriptor or time-out event of a loop

// What fired: the loop flags of a callback.
enum : short { LOOP_TIMEOUT = 0x01, LOOP_READ = 0x02, LOOP_WRITE = 0x04, LOOP_SIGNAL = 0x08 };

using lew_callback = lc_status (*)(int number, short flags, void *data, lew *context);

lc_status lew_init(lew **out);
lc_status lew_get_event_context(lew *context, loop_context **out);
// Signal numbers 1 to 65. The slot has to outlive the registration; it reads null again after
// lew_event_delete or lew_deinit. A filled slot is registered anew.
lc_status lew_event_reg_signal(lew *context, lew_event **inout_slot, int signal_number, lew_callback callback,
                               void *data);
lc_status lew_event_cancel(lew *context, lew_event **slot);
lc_status lew_event_delete(lew *context, lew_event **inout_slot);
lc_status lew_delete_all_events(lew *context);
// The outs may be null; both are cleared first. `out_no_events`: nothing at all remained registered.
// `out_escaped`: lew_escape_from_dispatch ended it, which lasts: later dispatches end at once as well.
lc_status lew_dispatch(lew *context, int *out_no_events, int *out_escaped);
lc_status lew_dispatch_once(lew *context, int *out_no_events, int *out_escaped);
// From any thread. Called from another thread than the owner's it returns once no callback is running, and
// none starts afterwards.
lc_status lew_escape_from_dispatch(lew *context);
// By the owner, or by anybody once the owner's thread has ended.
lc_status lew_deinit(lew **inout_context);

// Descriptor and time-out events. All of these on the owner's thread, or when it has ended.
using loop_function = void (*)(int fd, short flags, void *data);
lc_status loop_event_new(loop_context *context, loop_function function, void *data, loop_event **out);
// Watches `fd` for LOOP_READ, LOOP_WRITE or both until told otherwise. Takes the event out first when it was
// in.
lc_status loop_event_set_fd(loop_event *event, int fd, short flags);
// Fires once with LOOP_TIMEOUT after `delay_ms`.
lc_status loop_event_set_timer(loop_event *event, int64_t delay_ms);
// An event that is taken out or freed does not run, also when it has fired already.
void loop_event_remove(loop_event *event);
void loop_event_free(loop_event **inout_event);

// Work for the owner's thread, from any thread: the record is the head of the caller's own. `function` gets
// it back on the owner's thread before the next callback runs, in the order of posting, with `carry_out` 0
// when the loop ends first or the work was withdrawn, and frees it in either case. The poster waits for
// nothing.
struct loop_post {
    loop_post *next;
    const void *poster;
    void (*function)(loop_post *post, int carry_out);
};
int loop_is_own_thread(const loop_context *context);
void loop_post_work(loop_context *context, loop_post *post);
void loop_run_posted(loop_context *context); // owner's thread: carries out what is posted so far
void loop_withdraw_posted(loop_context *context, const void *poster);
