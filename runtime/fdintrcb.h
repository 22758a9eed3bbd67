// Interest lists: the descriptors and timers that a library wants to be called for, independent of the event
// loop that watches them. A change callback passes each change on to the loop (runtime/event_fdintrcb.h is
// one). A list has no lock; its owner's lock guards it.
#pragma once

#include <cstdint>

#include "runtime/common.h"
#include "runtime/typed_arrays.h"

// Why an interest's function is called.
enum : uint32_t {
    FDIC_READABLE = 1,
    FDIC_WRITABLE = 2,
    FDIC_TIMER_EXPIRED = 3,
    FDIC_FD_OPENED = 4,
    FDIC_FD_CLOSED = 5,
};
using fdic_handler = lc_status (*)(int fd, uint32_t kind, void *user_data, void *argument);

struct fdic;
// An interest, in a descriptor (has_fd) or a timer (has_timer).
struct fdic_event {
    fdic *context;
    uint32_t id;    // 0 is invalid
    int32_t active; // 0: to be removed
    int32_t has_fd;
    int32_t fd;
    void *user_data;
    int32_t want_read, want_write;
    fdic_handler read_function;
    void *read_argument;
    fdic_handler write_function;
    void *write_argument;
    int32_t has_timer;
    int64_t delay; // milliseconds; -1: not armed
    fdic_handler timer_function;
    void *timer_argument;
};

// The array fdic_event_array is declared in typed_arrays.h. It is sorted by id, and a record replaces one of
// its id.

// Gets the interests that have changed, one with `active` 0 if it was removed. They are freed after the
// callback returns.
using fdic_change_callback = lc_status (*)(const fdic_event_array *changes, void *user_data);

lc_status fdic_init(fdic **out, fdic_change_callback callback, void *user_data);
lc_status fdic_deinit(fdic **inout);
// Ids are greater than 0; -1 on failure. An unknown id is logged and gives LC_NOT_FOUND. An interest in a
// descriptor below 0, or a timer with a negative delay, is removed at once, without a call of the change
// callback if it was never reported. A timer runs once; to run it again, set another delay.
lc_status fdic_event_add_fd(fdic *context, int32_t fd, int32_t want_read, int32_t want_write, void *user_data,
                            fdic_handler read_function, void *read_argument, fdic_handler write_function,
                            void *write_argument, int32_t *out_id);
lc_status fdic_event_update_fd(fdic *context, int32_t id, int32_t want_read, int32_t want_write);
lc_status fdic_event_delete_fd(fdic *context, int32_t id);
lc_status fdic_event_add_timer(fdic *context, int64_t delay_ms, void *user_data, fdic_handler timer_function,
                               void *timer_argument, int32_t *out_id);
lc_status fdic_event_update_timer(fdic *context, int32_t id, int64_t delay_ms);
lc_status fdic_event_delete_timer(fdic *context, int32_t id);
// A copy of all interests, for the caller to free.
lc_status fdic_events_query(fdic *context, fdic_event_array **out);
