// `lew`: the daemon's interface to the event loop. A context owns the loop (libevent_loop.cpp) and the events
// that its callers have registered. It keeps them as a sorted array of the addresses of the callers' slots;
// removing an address frees the event and sets the slot to null. A slot must therefore outlive its
// registration, and it is null after lew_event_delete and lew_deinit.
//
// Events are registered, cancelled and deleted with the loop's lock held, by any thread while the loop waits.
// Only the owner dispatches. A callback may delete its own event, as happens to all six signals at exit.
#include "daemon/libevent_wrapper.h"

#include <cstdlib>

#include "daemon/libevent_loop.h"
#include "runtime/array.h"
#include "runtime/logging.h"

struct lew_event {
    loop_event *registered;
    lew *context;
    lew_callback callback;
    void *data;
};

struct lew {
    loop_context *loop;
    array *slots; // addresses of the callers' slots, sorted, each at most once
};

namespace {

void free_slot(void *element) {
    auto **slot = static_cast<lew_event **>(element);
    lew_event *event = *slot;
    *slot = nullptr;
    if (event)
        loop_event_free(&event->registered);
    free(event);
}

lc_status init_context(lew *context) {
    array_options options;
    CHECK_STATUS(array_options_get_defaults(&options));
    options.free = free_slot;
    options.duplicate_policy = array_dup_refuse;
    CHECK_STATUS(array_new(&context->slots, &options));
    context->loop = loop_new();
    CHECK_CONDITION(context->loop != nullptr);
    return LC_OK;
}

} // namespace

lc_status lew_init(lew **out) {
    CHECK_NULL(out);
    *out = nullptr;
    auto *context = static_cast<lew *>(calloc(1, sizeof(lew)));
    CHECK_NULL(context);
    // On failure the array may exist already; the loop does not.
    const lc_status status = init_context(context);
    if (status != LC_OK) {
        LOG_STATUS(array_free(&context->slots));
        free(context);
    }
    CHECK_STATUS(status);
    *out = context;
    return LC_OK;
}

lc_status lew_get_event_context(lew *context, loop_context **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(context);
    *out = context->loop;
    return LC_OK;
}

namespace {

lc_status find_slot(const lew *context, lew_event **slot, uint32_t *out_place) {
    // The key is the address of the slot, not what it holds.
    return array_binary_search(context->slots, slot, out_place);
}
lc_status add_slot(lew *context, lew_event **slot) {
    void *element = slot;
    return array_insert_sorted_takeover(context->slots, &element);
}

void lew_universal_event_handler(int number, short flags, void *data) {
    const lew_event event = *static_cast<lew_event *>(data); // a copy, because its callback may delete it
    LOG_STATUS(event.callback(number, flags, event.data, event.context));
}

lc_status make_signal_event(lew *context, lew_event **slot) {
    auto *event = static_cast<lew_event *>(calloc(1, sizeof(lew_event)));
    CHECK_NULL(event);
    event->context = context;
    lc_status status = loop_event_new(context->loop, lew_universal_event_handler, event, &event->registered);
    // The array keeps the address of the slot; the event itself is set only when nothing can fail any more.
    if (status == LC_OK)
        status = add_slot(context, slot);
    if (status != LC_OK) {
        loop_event_free(&event->registered);
        free(event);
        FAIL_WITH(status);
    }
    *slot = event;
    return LC_OK;
}

} // namespace

lc_status lew_event_reg_signal(lew *context, lew_event **slot, int signal_number, lew_callback callback,
                               void *data) {
    CHECK_NULL(context);
    CHECK_NULL(slot);
    CHECK_NULL(callback);
    CHECK_CONDITION(signal_number >= 1 && signal_number <= LEW_SIGNAL_MAX);
    const loop_guard guard(context->loop);
    uint32_t place;
    const bool made = *slot == nullptr; // otherwise an earlier registration is replaced
    if (made) {
        CHECK_STATUS(make_signal_event(context, slot));
    } else {
        CHECK_STATUS(find_slot(context, slot, &place));
        loop_event_remove((*slot)->registered);
    }
    (*slot)->callback = callback;
    (*slot)->data = data;
    const lc_status status = loop_event_set_signal((*slot)->registered, signal_number);
    // Deleting the address frees the event and clears the slot.
    if (status != LC_OK && made && find_slot(context, slot, &place) == LC_OK)
        LOG_STATUS(array_delete(context->slots, place));
    CHECK_STATUS(status);
    return LC_OK;
}

lc_status lew_event_cancel(lew *context, lew_event **slot) {
    CHECK_NULL(context);
    CHECK_NULL(slot);
    const loop_guard guard(context->loop);
    if (*slot)
        loop_event_remove((*slot)->registered);
    return LC_OK;
}

lc_status lew_event_delete(lew *context, lew_event **slot) {
    CHECK_NULL(context);
    CHECK_NULL(slot);
    const loop_guard guard(context->loop);
    if (!*slot)
        return LC_OK;
    uint32_t place;
    CHECK_STATUS(find_slot(context, slot, &place));
    CHECK_STATUS(array_delete(context->slots, place));
    return LC_OK;
}

lc_status lew_delete_all_events(lew *context) {
    CHECK_NULL(context);
    const loop_guard guard(context->loop);
    while (array_length_quick(context->slots))
        CHECK_STATUS(array_delete(context->slots, 0));
    return LC_OK;
}

namespace {

lc_status run_dispatch(lew *context, bool once, int *out_no_events, int *out_escaped) {
    // The caller's outputs may be null; loop_run needs both.
    int no_events = 0, escaped = 0;
    if (out_no_events)
        *out_no_events = 0;
    if (out_escaped)
        *out_escaped = 0;
    CHECK_NULL(context);
    const lc_status status = loop_run(context->loop, once, &no_events, &escaped);
    if (out_no_events)
        *out_no_events = no_events;
    if (out_escaped)
        *out_escaped = escaped;
    CHECK_STATUS(status);
    return LC_OK;
}

} // namespace

lc_status lew_dispatch(lew *context, int *out_no_events, int *out_escaped) {
    return run_dispatch(context, false, out_no_events, out_escaped);
}
lc_status lew_dispatch_once(lew *context, int *out_no_events, int *out_escaped) {
    return run_dispatch(context, true, out_no_events, out_escaped);
}

lc_status lew_escape_from_dispatch(lew *context) {
    CHECK_NULL(context);
    CHECK_STATUS(loop_escape(context->loop));
    return LC_OK;
}

lc_status lew_deinit(lew **inout) {
    CHECK_NULL(inout);
    lew *context = *inout;
    if (!context)
        return LC_OK;
    // Sets all slots to null, while the loop that the events belong to still exists.
    CHECK_STATUS(lew_delete_all_events(context));
    CHECK_STATUS(array_free(&context->slots));
    loop_free(&context->loop);
    free(context);
    *inout = nullptr;
    return LC_OK;
}
