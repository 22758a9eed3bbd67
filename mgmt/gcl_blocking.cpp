// Opening a service while the caller waits: a poll() loop over the interests of this instance only. It is
// used before the session is used by other threads. Both locks are held all the time, also while it waits.
//
// The calling thread has its signals blocked, because the event loop accepts them only while it waits itself.
// A peer that never answers must not keep the process from ending. Therefore the wait ends with LC_CANCELLED
// while SIGHUP, SIGINT or SIGTERM is pending; the caller's event loop then handles the signal. A thread that
// doesn't handle signals is notified by the thread that does, through the flag `ending` of the instance. Both
// are checked five times a second.
//
// Each round works on a copy of the interests. A callback may remove an interest that is still to come in the
// copy; that is harmless, because the interest's function checks the state of the session, whose record is
// still there.
#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdlib>

#include <poll.h>

#include "mgmt/gcl_records.h"
#include "runtime/logging.h"
#include "runtime/ttime.h"

constexpr int FD_MAX = 0x1ffff;
constexpr int64_t END_LOOK_MS = 200;

namespace {

// A caller waits for a change of any of these.
struct watched_state {
    uint64_t frames_sent, frames_received;
    int32_t session_state, protocol_state;
};
// A timer of the interest list; it starts again whenever its delay has changed.
struct seen_timer {
    uint32_t id;
    int64_t delay, due_ms; // ms; due_ms is compared with lt_monotonic_ms
    bool called;
};
struct blocking_wait {
    gcl *instance;
    gcl_session *session;
    bool on_sent, on_received, on_session_state, on_protocol_state;
    uint16_t protocol;
    int64_t timeout_ms, started_ms; // negative timeout: no limit
    seen_timer *timers;             // owned by the operation
    uint32_t timer_count;
};

void free_polled(pollfd *polled) {
    free(polled);
}

watched_state read_watched_state(const blocking_wait *wait) {
    watched_state seen{wait->session->counters.frames_sent, wait->session->counters.frames_received,
                       wait->session->state, 0};
    gcl_body_protocol *protocol = gcl_get_body_protocol(wait->instance, wait->protocol);
    if (protocol && protocol->query_session_state && wait->session->protocol_state[wait->protocol])
        LOG_STATUS(protocol->query_session_state(wait->session, protocol, &seen.protocol_state));
    return seen;
}

bool has_changed(const blocking_wait *wait, const watched_state *before) {
    const watched_state now = read_watched_state(wait);
    const bool differs = (wait->on_sent && now.frames_sent != before->frames_sent) ||
                         (wait->on_received && now.frames_received != before->frames_received) ||
                         (wait->on_session_state && now.session_state != before->session_state) ||
                         (wait->on_protocol_state && now.protocol_state != before->protocol_state);
    if (differs)
        LC_LOG(LC_LOG_DEBUG, "CHANGE DETECTED");
    return differs;
}

} // namespace

bool gcl_end_is_pending(const gcl *instance) {
    if (instance->options.ending && *instance->options.ending)
        return true;
    // Includes the signals that are pending for the process as a whole.
    sigset_t pending;
    if (sigpending(&pending) != 0)
        return false;
    for (const int number : {SIGHUP, SIGINT, SIGTERM})
        if (sigismember(&pending, number) == 1)
            return true;
    return false;
}

namespace {

// The time left in milliseconds; -1 without a limit, -2 if there is none left.
int64_t time_until_timeout(blocking_wait *wait) {
    if (wait->timeout_ms < 0)
        return -1;
    const int64_t now = lt_curr_time_ms();
    // The wall clock may have been set back; the timeout then starts again.
    if (now < wait->started_ms)
        wait->started_ms = now;
    const int64_t left = wait->timeout_ms - (now - wait->started_ms);
    return left < 0 ? -2 : left;
}

void forget_deleted_timers(blocking_wait *wait, const fdic_event_array *events) {
    for (uint32_t i = wait->timer_count; i-- > 0;) {
        fdic_event key{};
        key.id = wait->timers[i].id;
        if (fdic_event_array_binary_search(events, &key, nullptr) != LC_OK)
            // The last one fills the gap. The loop runs backwards and has seen it already.
            wait->timers[i] = wait->timers[--wait->timer_count];
    }
}

// The record of a timer, which is made when the timer is first seen, and runs from then on.
lc_status track_timer(blocking_wait *wait, const fdic_event *event, int64_t now, seen_timer **out) {
    uint32_t at = 0;
    while (at < wait->timer_count && wait->timers[at].id != event->id)
        at++;
    if (at == wait->timer_count) {
        auto *larger =
            static_cast<seen_timer *>(realloc(wait->timers, (size_t{at} + 1) * sizeof(seen_timer)));
        CHECK_NULL(larger);
        wait->timers = larger;
        // A delay that no running timer has, so that the comparison below starts it.
        wait->timers[wait->timer_count++] = {event->id, -1, 0, false};
    }
    seen_timer *timer = &wait->timers[at];
    // A delay near the end of the range must not overflow.
    if (timer->delay != event->delay)
        *timer = {event->id, event->delay, now + std::min(event->delay, INT64_MAX - now), false};
    *out = timer;
    return LC_OK;
}

// Calls the timers that are due, each once. `out_next`: milliseconds to the next one, -1 if there is none.
lc_status run_due_timers(blocking_wait *wait, const fdic_event_array *events, int64_t *out_next) {
    const int64_t now = lt_monotonic_ms();
    *out_next = -1;
    forget_deleted_timers(wait, events);
    for (uint32_t i = 0; i < fdic_event_array_length_quick(events); i++) {
        const fdic_event *event = fdic_event_array_get_quick(events, i);
        if (!event->has_timer || event->delay < 0)
            continue;
        seen_timer *timer = nullptr;
        CHECK_STATUS(track_timer(wait, event, now, &timer));
        if (timer->called)
            continue;
        if (timer->due_ms > now) {
            const int64_t left = timer->due_ms - now;
            *out_next = *out_next < 0 || left < *out_next ? left : *out_next;
            continue;
        }
        // Before the call: a timer fires once, until its delay is changed.
        timer->called = true;
        LC_LOG(LC_LOG_INFO, "GCL timeout forced");
        CHECK_STATUS(
            event->timer_function(event->fd, FDIC_TIMER_EXPIRED, event->user_data, event->timer_argument));
    }
    return LC_OK;
}

lc_status fill_polled(const fdic_event_array *events, pollfd *polled) {
    for (uint32_t i = 0; i < fdic_event_array_length_quick(events); i++) {
        const fdic_event *event = fdic_event_array_get_quick(events, i);
        // poll() ignores a negative descriptor. Every interest has an entry, so that the indexes of both
        // arrays agree.
        polled[i] = {-1, 0, 0};
        if (!event->has_fd || (!event->want_read && !event->want_write))
            continue;
        if (event->fd > FD_MAX) {
            LC_LOG(LC_LOG_ERR, "fd too large: %d", event->fd);
            return LC_GENERIC;
        }
        polled[i].fd = event->fd;
        polled[i].events =
            static_cast<short>((event->want_read ? POLLIN : 0) | (event->want_write ? POLLOUT : 0));
    }
    return LC_OK;
}

// Calls the functions of the descriptors that are ready, until something that the caller waits for has
// changed.
lc_status run_ready(const blocking_wait *wait, const fdic_event_array *events, const pollfd *polled,
                    const watched_state *before, bool *out_stop) {
    // As in an event loop, an error shows as readable and writable, so that the session finds it.
    constexpr short broken = POLLERR | POLLHUP | POLLNVAL;
    for (uint32_t i = 0; i < fdic_event_array_length_quick(events) && !*out_stop; i++) {
        const fdic_event *event = fdic_event_array_get_quick(events, i);
        const bool readable = polled[i].revents & (POLLIN | broken);
        const bool writable = polled[i].revents & (POLLOUT | broken);
        if (readable && event->want_read && event->read_function)
            CHECK_STATUS(
                event->read_function(event->fd, FDIC_READABLE, event->user_data, event->read_argument));
        if (readable && event->user_data == wait->session)
            *out_stop = has_changed(wait, before);
        if (*out_stop)
            return LC_OK;
        if (writable && event->want_write && event->write_function)
            CHECK_STATUS(
                event->write_function(event->fd, FDIC_WRITABLE, event->user_data, event->write_argument));
        if (writable && event->user_data == wait->session)
            *out_stop = has_changed(wait, before);
    }
    return LC_OK;
}

lc_status wait_one_round(blocking_wait *wait, bool *out_stop) {
    if (wait->session->state == GCL_SESSION_CLOSED || wait->session->fd < 0)
        return LC_IO_CLOSED;
    if (gcl_end_is_pending(wait->instance))
        return LC_CANCELLED;
    owned<fdic_event_array, fdic_event_array_release> events;
    CHECK_STATUS(fdic_events_query(wait->instance->interests, &events.pointer));
    // Before the timers are called, which may cause the change that is waited for.
    const watched_state before = read_watched_state(wait);
    int64_t next_timer = -1;
    CHECK_STATUS(run_due_timers(wait, events.pointer, &next_timer));
    const uint32_t count = fdic_event_array_length_quick(events.pointer);
    // One more than needed, since calloc() may return null for 0 bytes.
    owned<pollfd, free_polled> polled(static_cast<pollfd *>(calloc(count + 1, sizeof(pollfd))));
    CHECK_NULL(polled.pointer);
    CHECK_QUIET(fill_polled(events.pointer, polled.pointer));
    const int64_t left = time_until_timeout(wait);
    if (left < -1)
        return LC_IO_TIMED_OUT;
    // Waits at most until the next timer, or until it is time to check again whether the process is ending.
    const int64_t slice = next_timer >= 0 && next_timer < END_LOOK_MS ? next_timer : END_LOOK_MS;
    const bool sliced = left < 0 || slice < left;
    const int ready = poll(polled.pointer, count, static_cast<int>(sliced ? slice : left));
    if (ready == 0)
        // The end of a slice isn't the caller's timeout.
        return sliced ? LC_OK : LC_IO_TIMED_OUT;
    if (ready < 0 && errno == EINTR)
        return LC_OK;
    if (ready < 0 && errno == EBADF)
        return LC_IO_CLOSED;
    if (ready < 0) {
        LC_LOG(LC_LOG_ERR, "poll: %m");
        return LC_GENERIC;
    }
    return run_ready(wait, events.pointer, polled.pointer, &before, out_stop);
}

} // namespace

lc_status gcl_session_do_blocking_io(gcl *instance, gcl_session *session, int stop_on_frames_sent,
                                     int stop_on_frames_received, int stop_on_session_state,
                                     int stop_on_protocol_state, uint16_t protocol, int64_t timeout_ms) {
    CHECK_NULL(instance);
    CHECK_NULL(session);
    // The guard disables cancellation for the whole wait, which therefore has to check for itself whether the
    // process is ending.
    const gcl_session_guard guard(session);
    blocking_wait wait = {};
    wait.instance = instance;
    wait.session = session;
    wait.on_sent = stop_on_frames_sent != 0;
    wait.on_received = stop_on_frames_received != 0;
    wait.on_session_state = stop_on_session_state != 0;
    wait.on_protocol_state = stop_on_protocol_state != 0;
    wait.protocol = protocol;
    wait.timeout_ms = timeout_ms;
    wait.started_ms = lt_curr_time_ms();
    bool stop = false;
    lc_status status = LC_OK;
    while (!stop && status == LC_OK)
        status = wait_one_round(&wait, &stop);
    free(wait.timers);
    CHECK_QUIET(status);
    return LC_OK;
}

namespace {

// One step of opening a service. A peer that closes, or doesn't answer in time, is an ordinary event and not
// logged. If it closes, the session is closed.
lc_status wait_for_peer(gcl_session *session, int on_received, uint16_t protocol, int64_t timeout_ms) {
    const lc_status status =
        gcl_session_do_blocking_io(session->instance, session, 0, on_received, 1, 1, protocol, timeout_ms);
    if (status == LC_IO_TIMED_OUT)
        CHECK_QUIET(status);
    if (status == LC_IO_CLOSED) {
        LOG_STATUS(gcl_session_close(session, 0));
        CHECK_QUIET(status);
    }
    CHECK_STATUS(status);
    return LC_OK;
}

} // namespace

lc_status gcl_session_client_open_service_blocking(gcl_session *session, uint16_t protocol, int32_t service,
                                                   const char *name, int32_t reserved, int64_t timeout_ms) {
    CHECK_NULL(session);
    const gcl_session_guard guard(session);
    const gcl_admin *admin = gcl_admin_of(session);
    CHECK_NULL(admin);
    // A session that has opened a service before is past its greeting.
    while (admin->state != GCL_ADMIN_GREETED && admin->state != GCL_ADMIN_OPEN_ANSWERED) {
        CHECK_QUIET(wait_for_peer(session, 0, GCL_PROTO_ADMIN, timeout_ms));
        if (admin->state != GCL_ADMIN_GREETING_AWAITED && admin->state != GCL_ADMIN_GREETED)
            return LC_GENERIC;
    }
    CHECK_STATUS(gcl_session_client_open_service(session, protocol, service, name, reserved));
    // If another service is open already, a refusal sets the state back to GREETED, but then nothing is
    // pending.
    while (admin->state != GCL_ADMIN_OPEN_ANSWERED && admin->pending_service) {
        CHECK_QUIET(wait_for_peer(session, 1, protocol, timeout_ms));
        if (admin->state < GCL_ADMIN_GREETING_AWAITED || admin->state > GCL_ADMIN_OPEN_ANSWERED ||
            admin->state == GCL_ADMIN_GREETING_SENT)
            return LC_GENERIC;
    }
    return gcl_session_service_is_open(session, service) ? LC_OK : LC_GENERIC;
}
