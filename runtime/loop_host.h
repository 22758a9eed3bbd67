// The event loop as the lower rooms use it. It is defined by daemon/libevent_loop.cpp and
// daemon/libevent_wrapper.cpp, which tunneld links as well (the library wccp_loop).
//
// A wrapper context (`lew`) belongs to the thread that created it, its owner: only the owner dispatches, and
// every callback runs on the owner's thread with the loop's lock held. Dispatching nests: a callback may
// dispatch again, to any depth. Unless noted otherwise a function is called by the owner.
#pragma once

#include <cstdint>

#include "runtime/common.h"

struct lew;          // wrapper context, one for each thread that runs a loop
struct lew_event;    // one registration; the context owns it, and the caller's slot points to it
struct loop_context; // the loop under a wrapper context
struct loop_event;   // one descriptor or timer event of a loop

// What has happened; the `flags` of a callback.
enum : short { LOOP_TIMEOUT = 0x01, LOOP_READ = 0x02, LOOP_WRITE = 0x04, LOOP_SIGNAL = 0x08 };

using lew_callback = lc_status (*)(int number, short flags, void *data, lew *context);

lc_status lew_init(lew **out);
lc_status lew_get_event_context(lew *context, loop_context **out);
// Calls `callback` for signals 1 to 65. `inout_slot` points to the caller's pointer to the registration,
// which must outlive it; lew_event_delete and lew_deinit set it to null. A slot that is in use is registered
// again.
lc_status lew_event_reg_signal(lew *context, lew_event **inout_slot, int signal_number, lew_callback callback,
                               void *data);
// Cancel disables a registration and keeps it; delete frees it. Both accept a slot that is null.
lc_status lew_event_cancel(lew *context, lew_event **slot);
lc_status lew_event_delete(lew *context, lew_event **inout_slot);
lc_status lew_delete_all_events(lew *context);
// lew_dispatch runs callbacks and posted work until nothing is registered any more or
// lew_escape_from_dispatch is called; lew_dispatch_once returns as soon as anything has run. Outs may be
// null, and are cleared first. `out_no_events`: nothing was registered any more. `out_escaped`:
// lew_escape_from_dispatch has been called, which is permanent: later dispatches return at once.
lc_status lew_dispatch(lew *context, int *out_no_events, int *out_escaped);
lc_status lew_dispatch_once(lew *context, int *out_no_events, int *out_escaped);
// From any thread. When another thread than the owner calls it, no callback is running when it returns, and
// none starts afterwards.
lc_status lew_escape_from_dispatch(lew *context);
// By the owner, or by any thread after the owner's thread has ended.
lc_status lew_deinit(lew **inout_context);

// Descriptor and timer events. By the owner, or by any thread after the owner's thread has ended.
using loop_function = void (*)(int fd, short flags, void *data);
lc_status loop_event_new(loop_context *context, loop_function function, void *data, loop_event **out);
// Calls the event's function whenever `fd` is readable (LOOP_READ in `flags`) or writable (LOOP_WRITE), until
// the event is removed. An event that is active already is removed first, also by loop_event_set_timer.
lc_status loop_event_set_fd(loop_event *event, int fd, short flags);
// Calls the event's function once, with LOOP_TIMEOUT, after `delay_ms` milliseconds.
lc_status loop_event_set_timer(loop_event *event, int64_t delay_ms);
// Once an event is removed or freed its function isn't called any more, even if the event was already due.
void loop_event_remove(loop_event *event);
void loop_event_free(loop_event **inout_event);

// Work that any thread posts to the owner. A loop_post is the first member of the poster's own record.
// `function` is called with it on the owner's thread before the next callback, in the order of posting, and
// frees it. When the work is withdrawn or the loop is freed first, it is called with `carry_out` 0 and only
// frees the record.
struct loop_post {
    loop_post *next;
    const void *poster;
    void (*function)(loop_post *post, int carry_out);
};
int loop_is_own_thread(const loop_context *context); // 1 when the caller is the owner
// Never waits for the owner; the caller may therefore hold locks that a callback takes.
void loop_post_work(loop_context *context, loop_post *post);
void loop_run_posted(loop_context *context); // carries out what has been posted so far
// Withdraws all work of this poster. By the owner, or by any thread after the owner's thread has ended.
void loop_withdraw_posted(loop_context *context, const void *poster);
