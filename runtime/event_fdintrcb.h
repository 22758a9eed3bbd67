// The bridge from an interest list (runtime/fdintrcb.h) to an event loop (runtime/loop_host.h).
#pragma once

#include "runtime/fdintrcb.h"
#include "runtime/loop_host.h"

struct fdic_libevent;

lc_status fdic_libevent_init(loop_context *loop, fdic_libevent **out);
// On the loop's thread, or after it has ended.
lc_status fdic_libevent_deinit(fdic_libevent **inout);
// The handlers are called when a descriptor is removed from the list or added to it, with FDIC_FD_CLOSED or
// FDIC_FD_OPENED, the interest's user data, and `user_data` as the argument; always on the loop's thread.
lc_status fdic_libevent_set_fd_close_handler(fdic_libevent *bridge, fdic_handler function, void *user_data);
lc_status fdic_libevent_set_fd_open_handler(fdic_libevent *bridge, fdic_handler function, void *user_data);
// The change callback to pass to fdic_init, with the bridge as its user data. Any thread may call it, with
// the list's lock held; on another thread than the loop's it only posts the changes and doesn't wait.
lc_status fdic_libevent_callback(const fdic_event_array *changes, void *bridge);
