// Interest lists.
//
// A list has two arrays: the current interests, and those that the change callback has been given last. Each
// operation changes the first one, then compares it with the second and passes the differences to the
// callback. The callback is called last, when both arrays are consistent; it may therefore change the list
// itself.
//
// A GCL instance (mgmt/gcl.h) is the user of a list, and its lock guards it.
#include "runtime/fdintrcb.h"

#include <cstdlib>

#include "runtime/guards.h"
#include "runtime/logging.h"

struct fdic {
    uint32_t next_id;
    fdic_change_callback callback;
    void *user_data;
    fdic_event_array *current;
    fdic_event_array *reported;
};

using owned_events = owned<fdic_event_array, fdic_event_array_release>;

lc_status fdic_init(fdic **out, fdic_change_callback callback, void *user_data) {
    CHECK_NULL(out);
    *out = nullptr;
    auto *context = static_cast<fdic *>(calloc(1, sizeof(fdic)));
    CHECK_NULL(context);
    context->next_id = 1;
    context->callback = callback;
    context->user_data = user_data;
    lc_status status = fdic_event_array_new(&context->current);
    if (status == LC_OK)
        status = fdic_event_array_new(&context->reported);
    if (status != LC_OK)
        (void)fdic_deinit(&context);
    CHECK_STATUS(status);
    *out = context;
    return LC_OK;
}

lc_status fdic_deinit(fdic **inout) {
    CHECK_NULL(inout);
    fdic *context = *inout;
    *inout = nullptr;
    if (!context)
        return LC_OK;
    LOG_STATUS(fdic_event_array_free(&context->current));
    LOG_STATUS(fdic_event_array_free(&context->reported));
    free(context);
    return LC_OK;
}

namespace {

fdic_event *find_interest(const fdic_event_array *events, uint32_t id, uint32_t *out_index) {
    fdic_event key{};
    key.id = id;
    // Both arrays are sorted by id, since new ids only increase.
    if (fdic_event_array_binary_search(events, &key, out_index) != LC_OK)
        return nullptr;
    return fdic_event_array_get_quick(events, *out_index);
}

// --- Comparing the interests before and after a call

bool can_be_watched(const fdic_event *event) {
    return (event->has_fd && event->fd >= 0) || (event->has_timer && event->delay >= 0);
}

// Whether the callback knows the interest as it is.
bool is_reported(const fdic_event *event, const fdic_event *reported) {
    if (!reported)
        return !event->active; // removed before it was ever reported
    if (event->active != reported->active || event->has_fd != reported->has_fd ||
        event->has_timer != reported->has_timer)
        return false;
    if (event->has_fd && (event->fd != reported->fd || event->want_read != reported->want_read ||
                          event->want_write != reported->want_write))
        return false;
    // The functions and their arguments never change after an interest has been added.
    return !event->has_timer || event->delay == reported->delay;
}

lc_status update_reported(fdic *context, const fdic_event *event) {
    uint32_t index = 0;
    if (event->active) {
        // Replaces the older record with this id; that is the array's policy for duplicates.
        CHECK_STATUS(fdic_event_array_insert_sorted(context->reported, event));
    } else if (find_interest(context->reported, event->id, &index)) {
        CHECK_STATUS(fdic_event_array_delete(context->reported, index));
    }
    return LC_OK;
}

lc_status collect_changes(fdic *context, bool all, fdic_event_array **out) {
    owned_events result;
    CHECK_STATUS(fdic_event_array_new(&result.pointer));
    const uint32_t count = fdic_event_array_length_quick(context->current);
    for (uint32_t i = 0; i < count; i++) {
        fdic_event *event = fdic_event_array_get_quick(context->current, i);
        uint32_t index = 0;
        const fdic_event *reported = find_interest(context->reported, event->id, &index);
        if (!can_be_watched(event))
            event->active = 0;
        if (!all && is_reported(event, reported))
            continue;
        if (event->id == 0) {
            LC_LOG(LC_LOG_ERR, "Invalid event for fd %d timeout %ld: 0 id", event->fd,
                   static_cast<long>(event->delay));
            continue;
        }
        CHECK_STATUS(update_reported(context, event));
        CHECK_STATUS(fdic_event_array_insert_sorted(result.pointer, event));
    }
    // From the end, so that the positions that are still to come don't change.
    for (uint32_t i = count; i-- > 0;)
        if (!fdic_event_array_get_quick(context->current, i)->active)
            CHECK_STATUS(fdic_event_array_delete(context->current, i));
    *out = result.take();
    return LC_OK;
}

lc_status report_changes(fdic *context) {
    owned_events changes;
    CHECK_STATUS(collect_changes(context, false, &changes.pointer));
    if (fdic_event_array_length_quick(changes.pointer) && context->callback)
        CHECK_STATUS(context->callback(changes.pointer, context->user_data));
    return LC_OK;
}

// --- Adding, changing and deleting interests

lc_status add_interest(fdic *context, fdic_event *event, int32_t *out_id) {
    event->context = context;
    event->id = context->next_id++;
    CHECK_STATUS(fdic_event_array_insert_sorted(context->current, event));
    // Set before the callback runs, which may already use or delete the interest.
    *out_id = static_cast<int32_t>(event->id);
    CHECK_STATUS(report_changes(context));
    return LC_OK;
}

} // namespace

lc_status fdic_event_add_fd(fdic *context, int32_t fd, int32_t want_read, int32_t want_write, void *user_data,
                            fdic_handler read_function, void *read_argument, fdic_handler write_function,
                            void *write_argument, int32_t *out_id) {
    CHECK_NULL(out_id);
    *out_id = -1;
    CHECK_NULL(context);
    fdic_event event{};
    // An interest in no descriptor is dropped when the changes are collected, and never reported.
    event.active = fd >= 0;
    event.has_fd = 1;
    event.fd = fd;
    event.user_data = user_data;
    event.want_read = want_read;
    event.want_write = want_write;
    event.read_function = read_function;
    event.read_argument = read_argument;
    event.write_function = write_function;
    event.write_argument = write_argument;
    event.delay = -1;
    CHECK_STATUS(add_interest(context, &event, out_id));
    return LC_OK;
}

lc_status fdic_event_add_timer(fdic *context, int64_t delay_ms, void *user_data, fdic_handler timer_function,
                               void *timer_argument, int32_t *out_id) {
    CHECK_NULL(out_id);
    *out_id = -1;
    CHECK_NULL(context);
    fdic_event event{};
    event.active = 1;
    event.fd = -1;
    event.user_data = user_data;
    event.has_timer = 1;
    event.delay = delay_ms < 0 ? -1 : delay_ms;
    event.timer_function = timer_function;
    event.timer_argument = timer_argument;
    LC_LOG(LC_LOG_INFO, "EVENT: adding for %p: %ld ms", user_data, static_cast<long>(event.delay));
    CHECK_STATUS(add_interest(context, &event, out_id));
    return LC_OK;
}

namespace {

// Finds the interest with this id. `what` was to be done with it, for the log line about an unknown id.
lc_status find_current(const fdic *context, int32_t id, const char *what, fdic_event **out) {
    uint32_t index = 0;
    CHECK_NULL(context);
    *out = id > 0 ? find_interest(context->current, static_cast<uint32_t>(id), &index) : nullptr;
    if (*out)
        return LC_OK;
    LC_LOG(LC_LOG_WARNING, "Asked to %s with bad id %d", what, id);
    return LC_NOT_FOUND;
}

} // namespace

lc_status fdic_event_update_fd(fdic *context, int32_t id, int32_t want_read, int32_t want_write) {
    fdic_event *event = nullptr;
    CHECK_QUIET(find_current(context, id, "update event fd", &event));
    event->want_read = want_read;
    event->want_write = want_write;
    CHECK_STATUS(report_changes(context));
    return LC_OK;
}

lc_status fdic_event_delete_fd(fdic *context, int32_t id) {
    fdic_event *event = nullptr;
    CHECK_QUIET(find_current(context, id, "update event fd", &event));
    event->active = 0;
    CHECK_STATUS(report_changes(context));
    return LC_OK;
}

lc_status fdic_event_update_timer(fdic *context, int32_t id, int64_t delay_ms) {
    fdic_event *event = nullptr;
    CHECK_QUIET(find_current(context, id, "update event timer", &event));
    event->delay = delay_ms < 0 ? -1 : delay_ms;
    CHECK_STATUS(report_changes(context));
    return LC_OK;
}

lc_status fdic_event_delete_timer(fdic *context, int32_t id) {
    fdic_event *event = nullptr;
    CHECK_QUIET(find_current(context, id, "delete event timer", &event));
    LC_LOG(LC_LOG_INFO, "EVENT: deleting for %p: %ld ms", event->user_data, static_cast<long>(event->delay));
    event->active = 0;
    CHECK_STATUS(report_changes(context));
    return LC_OK;
}

lc_status fdic_events_query(fdic *context, fdic_event_array **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(context);
    CHECK_STATUS(collect_changes(context, true, out));
    return LC_OK;
}
