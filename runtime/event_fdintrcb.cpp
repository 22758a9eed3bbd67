// The bridge from an interest list to an event loop. For each active interest it has an entry: the loop's
// event and a copy of the interest, whose function it calls when the event occurs.
//
// Entries are only used on the loop's thread. If another thread changes the list (a sender finds that its
// socket is full, that it has been emptied, or that the peer has closed it), the changes are copied and
// posted to the loop, which applies them on its own thread, in their order and before its next callback; the
// open and close handlers run there as well. The other thread doesn't wait and may therefore hold locks that
// a callback of the loop takes, and no entry is freed while its handler runs. A change made on the loop's own
// thread is applied at once, after those already posted.
//
// A handler works on a copy of its entry, because an interest's function may remove its own interest.
#include "runtime/event_fdintrcb.h"

#include <cstdlib>
#include <cstring>

#include "runtime/guards.h"
#include "runtime/hash_table.h"
#include "runtime/logging.h"

struct fdic_libevent {
    loop_context *loop;
    ht *entries; // by interest id
    fdic_handler close_handler;
    void *close_data;
    fdic_handler open_handler;
    void *open_data;
};

namespace {

struct fdic_libevent_entry {
    loop_context *loop;
    loop_event *event;
    fdic_event interest;
};

struct posted_changes {
    loop_post post; // first: the record is found by its address
    fdic_libevent *bridge;
    fdic_event_array *changes;
};

lc_status fdic_libevent_record_free(void *key, uint32_t, void *value, void *) {
    auto *entry = static_cast<fdic_libevent_entry *>(value);
    loop_event_free(&entry->event);
    free(entry);
    free(key);
    return LC_OK;
}

} // namespace

lc_status fdic_libevent_init(loop_context *loop, fdic_libevent **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(loop);
    auto *bridge = static_cast<fdic_libevent *>(calloc(1, sizeof(fdic_libevent)));
    CHECK_NULL(bridge);
    bridge->loop = loop;
    ht_options options;
    ht_default_options(&options);
    options.free_function = fdic_libevent_record_free;
    const lc_status status = ht_new(&bridge->entries, &options);
    if (status != LC_OK)
        free(bridge);
    CHECK_STATUS(status);
    *out = bridge;
    return LC_OK;
}

lc_status fdic_libevent_deinit(fdic_libevent **inout) {
    CHECK_NULL(inout);
    fdic_libevent *bridge = *inout;
    *inout = nullptr;
    if (!bridge)
        return LC_OK;
    // First, since posted changes refer to the bridge.
    loop_withdraw_posted(bridge->loop, bridge);
    LOG_STATUS(ht_free(&bridge->entries));
    free(bridge);
    return LC_OK;
}

lc_status fdic_libevent_set_fd_close_handler(fdic_libevent *bridge, fdic_handler function, void *user_data) {
    CHECK_NULL(bridge);
    bridge->close_handler = function;
    bridge->close_data = user_data;
    return LC_OK;
}
lc_status fdic_libevent_set_fd_open_handler(fdic_libevent *bridge, fdic_handler function, void *user_data) {
    CHECK_NULL(bridge);
    bridge->open_handler = function;
    bridge->open_data = user_data;
    return LC_OK;
}

namespace {

fdic_libevent_entry *find_bridge_entry(const fdic_libevent *bridge, uint32_t id) {
    void *value = nullptr;
    int found = 0;
    LOG_STATUS(ht_lookup(bridge->entries, &id, sizeof id, &found, nullptr, nullptr, &value));
    return found ? static_cast<fdic_libevent_entry *>(value) : nullptr;
}

// --- Calls from the event loop

lc_status call_read_function(int fd, const fdic_libevent_entry *entry) {
    const fdic_event *interest = &entry->interest;
    CHECK_CONDITION(interest->fd == fd);
    if (interest->has_fd && interest->want_read)
        CHECK_STATUS(
            interest->read_function(fd, FDIC_READABLE, interest->user_data, interest->read_argument));
    return LC_OK;
}
lc_status call_write_function(int fd, const fdic_libevent_entry *entry) {
    const fdic_event *interest = &entry->interest;
    CHECK_CONDITION(interest->fd == fd);
    if (interest->has_fd && interest->want_write)
        CHECK_STATUS(
            interest->write_function(fd, FDIC_WRITABLE, interest->user_data, interest->write_argument));
    return LC_OK;
}
lc_status call_timer_function(int fd, const fdic_libevent_entry *entry) {
    const fdic_event *interest = &entry->interest;
    CHECK_CONDITION(interest->has_timer);
    CHECK_STATUS(
        interest->timer_function(fd, FDIC_TIMER_EXPIRED, interest->user_data, interest->timer_argument));
    return LC_OK;
}

lc_status call_interest(int fd, short flags, const fdic_libevent_entry *entry) {
    // A failure ends this round of calls; each has been logged where it was found.
    if (flags & LOOP_READ)
        CHECK_QUIET(call_read_function(fd, entry));
    if (flags & LOOP_WRITE)
        CHECK_QUIET(call_write_function(fd, entry));
    if (flags & LOOP_TIMEOUT)
        CHECK_QUIET(call_timer_function(fd, entry));
    return LC_OK;
}

void fdic_libevent_handler(int fd, short flags, void *data) {
    auto *real = static_cast<fdic_libevent_entry *>(data);
    const fdic_libevent_entry entry = *real;
    if (flags & LOOP_SIGNAL) {
        LC_LOG(LC_LOG_WARNING, "Received unexpected signal %d (%s); unregistering event", fd,
               lc_signal_num_to_name(fd));
        loop_event_remove(real->event);
        return;
    }
    if (!(flags & (LOOP_READ | LOOP_WRITE | LOOP_TIMEOUT)))
        LC_LOG(LC_LOG_WARNING, "Called with event_type %d", flags);
    (void)call_interest(fd, flags, &entry);
}

// --- Registration with the event loop

lc_status remove_interest(fdic_libevent *bridge, const fdic_event *change) {
    fdic_libevent_entry *entry = find_bridge_entry(bridge, change->id);
    if (!entry)
        return LC_OK;
    // The arguments of the handler are read before the entry is freed.
    const bool has_handler = entry->interest.has_fd && bridge->close_handler;
    const int fd = entry->interest.fd;
    void *user_data = entry->interest.user_data;
    LOG_STATUS(ht_delete(bridge->entries, &change->id, sizeof change->id));
    if (has_handler)
        CHECK_STATUS(bridge->close_handler(fd, FDIC_FD_CLOSED, user_data, bridge->close_data));
    return LC_OK;
}

void free_bridge_entry(fdic_libevent_entry *entry) {
    loop_event_free(&entry->event);
    free(entry);
}

lc_status new_bridge_entry(fdic_libevent *bridge, uint32_t id, fdic_libevent_entry **out) {
    owned<fdic_libevent_entry, free_bridge_entry> entry(
        static_cast<fdic_libevent_entry *>(calloc(1, sizeof(fdic_libevent_entry))));
    CHECK_NULL(entry.pointer);
    entry.pointer->loop = bridge->loop;
    CHECK_STATUS(loop_event_new(bridge->loop, fdic_libevent_handler, entry.pointer, &entry.pointer->event));
    // NOLINTNEXTLINE(clang-analyzer-unix.MallocSizeof): the key of the table is the bytes of the id
    owned_text key(static_cast<char *>(malloc(sizeof id)));
    CHECK_NULL(key.pointer);
    memcpy(key.pointer, &id, sizeof id);
    CHECK_STATUS(ht_insert(bridge->entries, key.pointer, sizeof id, entry.pointer));
    key.take();
    *out = entry.take();
    return LC_OK;
}

lc_status apply_interest(fdic_libevent *bridge, const fdic_event *change) {
    if (!find_bridge_entry(bridge, change->id)) {
        fdic_libevent_entry *made = nullptr;
        CHECK_STATUS(new_bridge_entry(bridge, change->id, &made));
        made->interest = *change;
        if (change->has_fd && bridge->open_handler)
            CHECK_STATUS(
                bridge->open_handler(change->fd, FDIC_FD_OPENED, change->user_data, bridge->open_data));
    }
    // The open handler may have changed the table; therefore the entry is looked up again.
    fdic_libevent_entry *entry = find_bridge_entry(bridge, change->id);
    if (!entry)
        return LC_OK; // the open handler has removed it
    entry->interest = *change;
    loop_event_remove(entry->event);
    if (change->has_fd) {
        const int flags = (change->want_read ? LOOP_READ : 0) | (change->want_write ? LOOP_WRITE : 0);
        CHECK_STATUS(loop_event_set_fd(entry->event, change->fd, static_cast<short>(flags)));
    } else if (change->has_timer && change->delay >= 0) {
        CHECK_STATUS(loop_event_set_timer(entry->event, change->delay));
    }
    return LC_OK;
}

lc_status apply_changes(fdic_libevent *bridge, const fdic_event_array *changes) {
    // One failure doesn't keep the other changes from being applied; the first is returned.
    lc_status result = LC_OK;
    for (uint32_t i = 0; i < fdic_event_array_length_quick(changes); i++) {
        const fdic_event *change = fdic_event_array_get_quick(changes, i);
        const lc_status status =
            change->active ? apply_interest(bridge, change) : remove_interest(bridge, change);
        LOG_STATUS(status);
        result = result ? result : status;
    }
    return result;
}

void apply_posted_changes(loop_post *post, int carry) {
    auto *posted = reinterpret_cast<posted_changes *>(post);
    // Otherwise the work has been withdrawn, and only its memory is released.
    if (carry)
        (void)apply_changes(posted->bridge, posted->changes);
    (void)fdic_event_array_free(&posted->changes);
    free(posted);
}

lc_status post_changes(fdic_libevent *bridge, const fdic_event_array *changes) {
    auto *posted = static_cast<posted_changes *>(calloc(1, sizeof(posted_changes)));
    CHECK_NULL(posted);
    // The caller frees its array as soon as this returns.
    const lc_status status = fdic_event_array_duplicate(changes, &posted->changes);
    if (status != LC_OK)
        free(posted);
    CHECK_STATUS(status);
    // By the poster, fdic_libevent_deinit withdraws what hasn't been applied yet.
    posted->post.poster = bridge;
    posted->post.function = apply_posted_changes;
    posted->bridge = bridge;
    loop_post_work(bridge->loop, &posted->post);
    return LC_OK;
}

} // namespace

lc_status fdic_libevent_callback(const fdic_event_array *changes, void *data) {
    CHECK_NULL(changes);
    CHECK_NULL(data);
    auto *bridge = static_cast<fdic_libevent *>(data);
    if (!loop_is_own_thread(bridge->loop)) {
        CHECK_STATUS(post_changes(bridge, changes));
        return LC_OK;
    }
    // Changes that other threads have posted are older than these.
    loop_run_posted(bridge->loop);
    return apply_changes(bridge, changes);
}
