// A list of changes in the order of their arrival.
#include "daemon/wccpd_early_changes.h"

#include <cstdlib>

#include "daemon/wccpd_config.h"
#include "runtime/logging.h"

namespace {

// Estimates.
constexpr size_t CHANGE_BYTES = 512;  // a change and its array
constexpr size_t BINDING_BYTES = 512; // a binding, its attribute and their arrays

struct early_change {
    early_change *next;
    bn_binding_array *new_values;
    config_change_time time;
};

struct early_change_list {
    early_change *first;
    early_change **end; // the null pointer at the end of the list; null while changes are not kept
    size_t bytes;
};
early_change_list kept_changes;

size_t estimate_bytes(const bn_binding_array *bindings) {
    size_t bytes = CHANGE_BYTES;
    const uint32_t count = bn_binding_array_length_quick(bindings);
    for (uint32_t i = 0; i < count; i++) {
        const bn_binding *binding = bn_binding_array_get_quick(bindings, i);
        const bn_attrib *value = nullptr;
        if (!binding)
            continue;
        (void)bn_binding_get_attrib(binding, bn_attrib_value, &value);
        bytes +=
            BINDING_BYTES + static_cast<size_t>(ts_length(binding->name)) + (value ? value->value_size : 0);
    }
    return bytes;
}

early_change *take_first_change() {
    early_change *change = kept_changes.first;
    if (!change)
        return nullptr;
    kept_changes.first = change->next;
    // The list is empty: the next change is linked from its head again.
    if (!kept_changes.first)
        kept_changes.end = &kept_changes.first;
    return change;
}

void free_change(early_change *change) {
    bn_binding_array_release(change->new_values);
    free(change);
}

} // namespace

early_changes_scope::early_changes_scope() {
    kept_changes.end = &kept_changes.first;
}

early_changes_scope::~early_changes_scope() {
    while (early_change *change = take_first_change())
        free_change(change);
    kept_changes = {};
}

bool early_changes_are_kept() {
    return kept_changes.end != nullptr;
}

lc_status keep_early_change(bn_binding_array **inout_new_values) {
    CHECK_CONDITION(early_changes_are_kept());
    const size_t bytes = estimate_bytes(*inout_new_values);
    // The sum never exceeds the maximum; therefore the difference cannot wrap.
    if (bytes > EARLY_CHANGES_MAX_BYTES - kept_changes.bytes) {
        LC_LOG(LC_LOG_ERR,
               "Configuration change lost: too many changes arrived during the start; restart wccpd");
        return LC_NO_SPACE;
    }
    early_change *change = static_cast<early_change *>(calloc(1, sizeof *change));
    CHECK_NULL(change);
    // From here on the list owns the array.
    change->new_values = *inout_new_values;
    change->time = CONFIG_CHANGE_DURING_START;
    *inout_new_values = nullptr;
    *kept_changes.end = change;
    kept_changes.end = &change->next;
    kept_changes.bytes += bytes;
    return LC_OK;
}

void early_changes_are_answered() {
    // All changes so far have arrived before the answer.
    for (early_change *change = kept_changes.first; change; change = change->next)
        change->time = CONFIG_CHANGE_IN_ANSWER;
}

void apply_early_changes() {
    while (early_change *change = take_first_change()) {
        LOG_STATUS(wccpd_config_apply(change->new_values, change->time));
        free_change(change);
    }
}
