// An event loop over libevent, with the guarantees that the daemon needs beyond it.
//
// Nesting. libevent refuses to run from inside one of its own callbacks. Here its callbacks therefore only
// put the event on a ready list. When event_base_loop has returned, ready events move to the end of a queue,
// and loop_run calls their functions from there. Such a function may call loop_run again: the inner rounds
// collect further events and continue with the same queue, what is left of the outer round first. An event
// that is removed or freed also leaves the queue: a function is never called for an event that an earlier
// function has removed. An event is not accessed after its function has been called, which may have freed it.
// While the queue is not empty, the next round polls the descriptors without waiting.
//
// Threads. Only the owner thread calls libevent. Another thread that needs a change posts it to a list, whose
// mutex is never held while another lock is taken; the owner carries it out before its next callback. Posting
// does not wait; the poster may therefore hold any lock. If the list was empty, the poster wakes the owner
// through the self-pipe. Posted work counts as something that ran, so that a wait for one round sees what it
// changed.
//
// Lock. The loop's lock is recursive and held during all callbacks. The wait releases it completely, whatever
// its depth, and takes it again to the same depth. A nested wait thus takes it while it holds the locks of
// its session, against the usual order. This cannot deadlock, because other threads hold this lock only to
// register a signal or to escape, and take no other lock meanwhile. It is a mutex with a condition, since a
// recursive mutex cannot be released completely.
//
// Signals are blocked in the owner's thread except during the wait. The handler writes a message of 128 bytes
// to the self-pipe; the owner reads it and queues the events of that signal. Each signal belongs to one loop.
// When its last event is removed, the earlier disposition is restored, but the signal stays blocked in this
// thread, so that a second SIGTERM does not kill the process in the middle of its orderly exit.
//
// Escape. The flag is never cleared. It is tested before each round and before each callback.
//
// The loop uses poll, not epoll: when a descriptor is closed while its event is active, poll reports it as
// ready, whereas epoll drops it silently.
#include "daemon/libevent_loop.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <event2/event.h>
#include <event2/event_struct.h>
#include <fcntl.h>
#include <pthread.h>
#include <unistd.h>

#include "daemon/libevent_wrapper.h"
#include "runtime/guards.h"
#include "runtime/logging.h"
#include "runtime/ttime.h"

static_assert(LOOP_TIMEOUT == EV_TIMEOUT && LOOP_READ == EV_READ && LOOP_WRITE == EV_WRITE &&
              LOOP_SIGNAL == EV_SIGNAL);

constexpr uint32_t MESSAGE_BYTES = 128;
constexpr time_t WAIT_MAX_SECONDS = 5;
constexpr uint32_t FDS_MAX = 100000;
constexpr int64_t TIME_MAX_SECONDS = 0x7ffffffe;

namespace {

enum class event_kind : uint8_t { unset, descriptor, timer, signal };

} // namespace

struct loop_event {
    loop_context *context;
    loop_function function;
    void *data;
    event base_event;
    event_kind kind;
    bool inserted;     // active, and counted in the context
    int number;        // descriptor or signal, -1 for a timer
    short ready_flags; // 0: not on the ready list
    loop_event *next_ready;
    short queued_flags; // 0: not in the queue
    loop_event *next_queued, *previous_queued;
    loop_event *next_signal;
};

namespace {

struct loop_lock {
    pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER; // guards holder and count
    pthread_cond_t freed = PTHREAD_COND_INITIALIZER;
    pthread_t holder{};
    uint32_t count = 0;
};

} // namespace

struct loop_context {
    event_base *base;
    pthread_t owner;
    loop_lock lock;
    std::atomic<int32_t> escape;
    int pipe_read, pipe_write;
    event *pipe_event, *limit_event; // limit_event bounds a wait without timers
    bool pipe_readable;
    uint32_t inserted, descriptors, timers; // numbers of active events
    loop_event *ready_first, *ready_last;
    loop_event *queue_first, *queue_last;
    loop_event *signals;
    sigset_t owned_signals;
    pthread_mutex_t posts_mutex;
    loop_post *posts_first, *posts_last;
};

// --- The lock

namespace {

void take_loop_lock(loop_lock *lock, uint32_t count) {
    const mutex_guard guard(&lock->mutex);
    const pthread_t self = pthread_self();
    while (lock->count && !pthread_equal(lock->holder, self)) // the holder itself never waits
        pthread_cond_wait(&lock->freed, &lock->mutex);
    lock->holder = self;
    lock->count += count;
}
void give_loop_lock(loop_lock *lock, uint32_t count) {
    const mutex_guard guard(&lock->mutex);
    lock->count -= count;
    // One waiter is enough: it wakes the next one when it gives the lock back.
    if (!lock->count)
        pthread_cond_signal(&lock->freed);
}

} // namespace

void loop_lock_take(loop_context *context) {
    take_loop_lock(&context->lock, 1);
}
void loop_lock_give(loop_context *context) {
    give_loop_lock(&context->lock, 1);
}

int loop_is_own_thread(const loop_context *context) {
    return pthread_equal(context->owner, pthread_self());
}

// --- The queue

namespace {

void queue_event(loop_event *event, short flags) {
    loop_context *context = event->context;
    // An event that is in the queue keeps its place; only its flags are added.
    const bool queued = event->queued_flags != 0;
    event->queued_flags = static_cast<short>(event->queued_flags | flags);
    if (queued)
        return;
    event->next_queued = nullptr;
    event->previous_queued = context->queue_last;
    // The link that has to refer to the event: its predecessor's, or the queue's first.
    (context->queue_last ? context->queue_last->next_queued : context->queue_first) = event;
    context->queue_last = event;
}

short unqueue_event(loop_event *event) {
    loop_context *context = event->context;
    const short flags = event->queued_flags;
    if (!flags)
        return 0;
    event->queued_flags = 0;
    (event->previous_queued ? event->previous_queued->next_queued : context->queue_first) =
        event->next_queued;
    (event->next_queued ? event->next_queued->previous_queued : context->queue_last) = event->previous_queued;
    return flags;
}

// Called by libevent during the wait, on the owner's thread and without the lock.
void handle_ready_event(evutil_socket_t, short flags, void *data) {
    loop_event *event = static_cast<loop_event *>(data);
    loop_context *context = event->context;
    const bool listed = event->ready_flags != 0;
    event->ready_flags = static_cast<short>(event->ready_flags | (flags & (EV_TIMEOUT | EV_READ | EV_WRITE)));
    if (listed || !event->ready_flags)
        return;
    event->next_ready = nullptr;
    (context->ready_last ? context->ready_last->next_ready : context->ready_first) = event;
    context->ready_last = event;
}
void handle_ready_pipe(evutil_socket_t, short, void *data) {
    static_cast<loop_context *>(data)->pipe_readable = true;
}
void handle_wait_limit(evutil_socket_t, short, void *) {}

void queue_ready_events(loop_context *context) {
    while (loop_event *event = context->ready_first) {
        context->ready_first = event->next_ready;
        const short flags = event->ready_flags;
        event->ready_flags = 0;
        queue_event(event, flags);
    }
    context->ready_last = nullptr;
}

// --- Events

void count_event(loop_event *event, bool in) {
    loop_context *context = event->context;
    // Adding ~0u subtracts 1.
    const uint32_t step = in ? 1u : ~0u;
    event->inserted = in;
    context->inserted += step;
    if (event->kind == event_kind::descriptor)
        context->descriptors += step;
    if (event->kind == event_kind::timer)
        context->timers += step;
}

} // namespace

lc_status loop_event_new(loop_context *context, loop_function function, void *data, loop_event **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(context);
    auto *event = static_cast<loop_event *>(calloc(1, sizeof(loop_event)));
    CHECK_NULL(event);
    event->context = context;
    event->function = function;
    event->data = data;
    *out = event;
    return LC_OK;
}

namespace {

lc_status insert_event(loop_event *event, const timeval *delay) {
    if (event_add(&event->base_event, delay) != 0)
        FAIL_WITH(LC_GENERIC);
    count_event(event, true);
    return LC_OK;
}

} // namespace

lc_status loop_event_set_fd(loop_event *event, int fd, short flags) {
    CHECK_NULL(event);
    CHECK_CONDITION(fd >= 0 && !(flags & ~(LOOP_READ | LOOP_WRITE)));
    const loop_guard guard(event->context);
    // Also necessary for libevent: event_assign must not be called for a pending event.
    loop_event_remove(event);
    event->kind = event_kind::descriptor;
    event->number = fd;
    if (event_assign(&event->base_event, event->context->base, fd, static_cast<short>(flags | EV_PERSIST),
                     handle_ready_event, event) != 0)
        FAIL_WITH(LC_GENERIC);
    if (!flags) { // it counts as registered, but waits for nothing
        count_event(event, true);
        return LC_OK;
    }
    CHECK_STATUS(insert_event(event, nullptr));
    return LC_OK;
}

lc_status loop_event_set_timer(loop_event *event, int64_t delay_ms) {
    CHECK_NULL(event);
    CHECK_CONDITION(delay_ms >= 0);
    const loop_guard guard(event->context);
    loop_event_remove(event);
    event->kind = event_kind::timer;
    event->number = -1;
    if (event_assign(&event->base_event, event->context->base, -1, 0, handle_ready_event, event) != 0)
        FAIL_WITH(LC_GENERIC);
    timeval delay;
    delay.tv_sec = delay_ms / 1000;
    delay.tv_usec = delay_ms % 1000 * 1000;
    // No expiry time exceeds 31 bits in seconds.
    delay.tv_sec = std::min(delay.tv_sec, TIME_MAX_SECONDS - lt_monotonic_ms() / 1000 - 1);
    CHECK_STATUS(insert_event(event, &delay));
    return LC_OK;
}

// --- Signals

std::atomic<loop_context *> le_signal_contexts[LEW_SIGNAL_MAX + 1];
namespace {

struct sigaction earlier_actions[LEW_SIGNAL_MAX + 1];
pthread_mutex_t signal_table_mutex = PTHREAD_MUTEX_INITIALIZER;

void write_signal_message(int number, siginfo_t *, void *) {
    // The handler interrupts code that may be about to read errno.
    const int saved = errno;
    const loop_context *context = le_signal_contexts[number].load();
    if (context) {
        char message[MESSAGE_BYTES] = {};
        memcpy(message, &number, sizeof number);
        // A full pipe would lose the message, but the owner empties it after each wait, and the handler runs
        // only during a wait.
        (void)!write(context->pipe_write, message, sizeof message);
    }
    errno = saved;
}

lc_status take_signal(loop_context *context, int number) {
    const mutex_guard guard(&signal_table_mutex);
    const loop_context *owner = le_signal_contexts[number].load();
    if (owner == context)
        return LC_OK;
    if (owner) {
        LC_LOG(LC_LOG_ERR, "Signal %d has already been registered from a different libevent context", number);
        return LC_ASSERTION;
    }
    struct sigaction action;
    memset(&action, 0, sizeof action);
    action.sa_sigaction = write_signal_message;
    action.sa_flags = SA_RESTART | SA_SIGINFO;
    sigfillset(&action.sa_mask);
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, number);
    pthread_sigmask(SIG_BLOCK, &set, nullptr); // before the handler exists
    // Before the handler is installed, which reads it.
    le_signal_contexts[number] = context;
    if (sigaction(number, &action, &earlier_actions[number]) != 0) {
        le_signal_contexts[number] = nullptr;
        FAIL_WITH(LC_GENERIC);
    }
    sigaddset(&context->owned_signals, number);
    return LC_OK;
}

void release_signal(loop_context *context, int number) {
    const mutex_guard guard(&signal_table_mutex);
    sigaction(number, &earlier_actions[number], nullptr);
    le_signal_contexts[number] = nullptr;
    sigdelset(&context->owned_signals, number);
}

} // namespace

lc_status loop_event_set_signal(loop_event *event, int number) {
    CHECK_NULL(event);
    CHECK_CONDITION(number >= 1 && number <= LEW_SIGNAL_MAX);
    loop_context *context = event->context;
    const loop_guard guard(context);
    loop_event_remove(event);
    CHECK_STATUS(take_signal(context, number));
    event->kind = event_kind::signal;
    event->number = number;
    event->next_signal = context->signals;
    context->signals = event;
    count_event(event, true);
    return LC_OK;
}

namespace {

void remove_signal_event(loop_event *event) {
    loop_context *context = event->context;
    bool others = false;
    for (loop_event **link = &context->signals; *link;) {
        loop_event *each = *link;
        if (each == event) {
            *link = each->next_signal;
            continue;
        }
        others |= each->number == event->number;
        link = &each->next_signal;
    }
    if (!others)
        release_signal(context, event->number);
}

} // namespace

void loop_event_remove(loop_event *event) {
    const loop_guard guard(event->context);
    unqueue_event(event); // its function is not called any more
    if (!event->inserted)
        return;
    count_event(event, false);
    if (event->kind == event_kind::signal)
        remove_signal_event(event);
    else
        event_del(&event->base_event);
}

void loop_event_free(loop_event **inout) {
    loop_event *event = *inout;
    *inout = nullptr;
    if (!event)
        return;
    loop_event_remove(event);
    free(event);
}

namespace {

// Reads all messages from the self-pipe: numbers of signals, or 0 for a plain wake-up.
void read_wake_pipe(loop_context *context) {
    char message[MESSAGE_BYTES];
    // Writes of up to PIPE_BUF bytes are atomic; therefore the pipe has only whole messages.
    while (read(context->pipe_read, message, sizeof message) == static_cast<ssize_t>(sizeof message)) {
        int number = 0;
        memcpy(&number, message, sizeof number);
        for (loop_event *event = context->signals; number && event; event = event->next_signal)
            if (event->number == number)
                queue_event(event, LOOP_SIGNAL);
    }
}

lc_status wake_owner(loop_context *context) {
    const char message[MESSAGE_BYTES] = {};
    ssize_t written;
    do
        written = write(context->pipe_write, message, sizeof message);
    while (written < 0 && errno == EINTR);
    if (written < 0 && errno == EAGAIN)
        return LC_OK; // a full pipe wakes the owner as well
    CHECK_CONDITION(written == static_cast<ssize_t>(sizeof message));
    return LC_OK;
}

} // namespace

// --- Work posted by other threads

void loop_post_work(loop_context *context, loop_post *post) {
    // Cancelled between the list and the wake-up, the poster would leave its work waiting for the next event.
    const cancel_off_guard cancel_off;
    post->next = nullptr;
    bool first;
    {
        const mutex_guard guard(&context->posts_mutex);
        first = context->posts_first == nullptr;
        (context->posts_last ? context->posts_last->next : context->posts_first) = post;
        context->posts_last = post;
    }
    // A later post finds the wake-up of the first one still pending.
    if (first)
        LOG_STATUS(wake_owner(context));
}

namespace {

loop_post *take_first_post(loop_context *context) {
    const mutex_guard guard(&context->posts_mutex);
    loop_post *post = context->posts_first;
    if (post) {
        context->posts_first = post->next;
        if (!post->next)
            context->posts_last = nullptr;
    }
    return post;
}

bool run_posts(loop_context *context) {
    bool ran = false;
    while (loop_post *post = take_first_post(context)) {
        post->function(post, 1); // without the posts' mutex: it may post again, or free the post
        ran = true;
    }
    return ran;
}

} // namespace

void loop_run_posted(loop_context *context) {
    const loop_guard guard(context);
    (void)run_posts(context);
}

void loop_withdraw_posted(loop_context *context, const void *poster) {
    loop_post *withdrawn = nullptr;
    {
        const mutex_guard guard(&context->posts_mutex);
        loop_post *kept_last = nullptr;
        for (loop_post **link = &context->posts_first; *link;) {
            loop_post *post = *link;
            if (post->poster == poster) {
                *link = post->next;
                post->next = withdrawn;
                withdrawn = post;
            } else {
                kept_last = post;
                link = &post->next;
            }
        }
        context->posts_last = kept_last;
    }
    // Without the posts' mutex, because the functions may free the posts or post again.
    while (loop_post *post = withdrawn) {
        withdrawn = post->next;
        post->function(post, 0);
    }
}

// --- Rounds

namespace {

lc_status wait_for_events(loop_context *context) {
    const bool without_waiting = context->queue_first != nullptr;
    if (context->descriptors > FDS_MAX) {
        LC_LOG(LC_LOG_ERR, "too many fds");
        return LC_GENERIC;
    }
    const timeval limit = {WAIT_MAX_SECONDS, 0};
    // limit_event ends a wait that no timer would end.
    if (!without_waiting && !context->timers && event_add(context->limit_event, &limit) != 0)
        FAIL_WITH(LC_GENERIC);
    // A copy: another thread may register a signal during the wait, and exactly these are blocked again.
    const sigset_t signals = context->owned_signals;
    const uint32_t held = context->lock.count; // stable, because this thread holds the lock
    give_loop_lock(&context->lock, held);
    pthread_sigmask(SIG_UNBLOCK, &signals, nullptr);
    const int result = event_base_loop(context->base, EVLOOP_ONCE | (without_waiting ? EVLOOP_NONBLOCK : 0));
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    take_loop_lock(&context->lock, held);
    event_del(context->limit_event); // harmless if it was not added
    if (context->pipe_readable) {
        context->pipe_readable = false;
        read_wake_pipe(context);
    }
    queue_ready_events(context);
    if (result < 0)
        FAIL_WITH(LC_GENERIC);
    return LC_OK;
}

bool run_queued_events(loop_context *context) {
    bool ran = run_posts(context);
    while (loop_event *event = context->queue_first) {
        if (context->escape) // the rest stays queued
            break;
        const short flags = unqueue_event(event);
        if (event->kind == event_kind::timer) // it runs once
            count_event(event, false);
        event->function(event->number, flags, event->data); // may have freed the event
        run_posts(context);
        ran = true;
    }
    return ran;
}

} // namespace

lc_status loop_run(loop_context *context, bool once, int *out_no_events, int *out_escaped) {
    CHECK_CONDITION(loop_is_own_thread(context));
    const loop_guard guard(context);
    bool ran = run_posts(context);
    for (;;) {
        if (context->escape) {
            *out_escaped = 1;
            return LC_OK;
        }
        if (once && ran)
            return LC_OK;
        if (!context->inserted && !context->queue_first) { // waiting could not end
            *out_no_events = 1;
            return LC_OK;
        }
        CHECK_STATUS(wait_for_events(context));
        ran = run_queued_events(context);
    }
}

lc_status loop_escape(loop_context *context) {
    {
        const loop_guard guard(context);
        context->escape = 1;
    }
    // The owner itself tests the flag before its next wait.
    if (!loop_is_own_thread(context))
        CHECK_STATUS(wake_owner(context));
    return LC_OK;
}

// --- Creating and freeing

[[noreturn]] static void exit_with_message(const char *function, const char *what) {
    fprintf(stderr, "%s: %s\n", function, what);
    exit(1);
}

namespace {

event_base *make_event_base() {
    event_config *config = event_config_new();
    if (!config)
        return nullptr;
    // The file's header explains why not epoll; select cannot handle descriptors of 1024 and above.
    event_config_avoid_method(config, "epoll");
    event_config_avoid_method(config, "select");
    // Variables of the environment could otherwise exclude poll.
    event_config_set_flag(config, EVENT_BASE_FLAG_IGNORE_ENV);
    event_base *base = event_base_new_with_config(config);
    event_config_free(config);
    return base;
}

} // namespace

loop_context *loop_new() {
    auto *context = static_cast<loop_context *>(calloc(1, sizeof(loop_context)));
    if (!context)
        exit_with_message(__func__, "couldn't allocate event context");
    context->owner = pthread_self();
    context->lock = loop_lock();
    pthread_mutex_init(&context->posts_mutex, nullptr);
    sigemptyset(&context->owned_signals);
    int ends[2];
    // The signal handler must not block, and the reader stops when the pipe is empty.
    if (pipe2(ends, O_CLOEXEC | O_NONBLOCK) != 0) {
        LC_LOG(LC_LOG_ERR, "pipe system call failed");
        free(context);
        return nullptr;
    }
    context->pipe_read = ends[0];
    context->pipe_write = ends[1];
    context->base = make_event_base();
    if (!context->base)
        exit_with_message(__func__, "no event mechanism available");
    context->pipe_event =
        event_new(context->base, context->pipe_read, EV_READ | EV_PERSIST, handle_ready_pipe, context);
    // A timer: no descriptor and no other flags.
    context->limit_event = event_new(context->base, -1, 0, handle_wait_limit, nullptr);
    if (!context->pipe_event || !context->limit_event || event_add(context->pipe_event, nullptr) != 0)
        exit_with_message(__func__, "couldn't allocate event context");
    return context;
}

void loop_free(loop_context **inout) {
    loop_context *context = *inout;
    *inout = nullptr;
    if (!context)
        return;
    // With 0 the functions only free their posts and do not do the work.
    while (loop_post *post = take_first_post(context))
        post->function(post, 0);
    event_free(context->limit_event);
    event_free(context->pipe_event);
    event_base_free(context->base);
    close(context->pipe_read);
    close(context->pipe_write);
    pthread_mutex_destroy(&context->posts_mutex);
    free(context);
}
