// The bridge between an interest list and an event loop.
#pragma once

#include "runtime/fdintrcb.h"
#include "runtime/loop_host.h"

struct fdic_libevent;

lc_status fdic_libevent_init(loop_context *loop, fdic_libevent **out);
// By the loop's thread, or once that has ended.
lc_status fdic_libevent_deinit(fdic_libevent **inout);
// Handlers get FDIC_FD_CLOSED or FDIC_FD_OPENED and the interest's user data, always on the loop's thread.
lc_status fdic_libevent_set_fd_close_handler(fdic_libevent *bridge, fdic_handler function, void *user_data);
lc_status fdic_libevent_set_fd_open_handler(fdic_libevent *bridge, fdic_handler function, void *user_data);
// The change callback for fdic_init, with the bridge as its user data. From any thread under the list's lock:
// another thread than the loop's only posts the changes and waits for nothing.
lc_status fdic_libevent_callback(const fdic_event_array *changes, void *bridge);
