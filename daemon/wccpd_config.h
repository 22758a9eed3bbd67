// The configuration tree: read once at start, then followed change by change. Main thread only.
#pragma once

#include "mgmt/bnode.h"
#include "runtime/common.h"

lc_status wccpd_config_query();

// When a change arrived. One that arrived during the start may be in what the start has read: an added group
// that exists already, and a missing group for a changed or deleted node, are no errors then.
enum config_change_time {
    CONFIG_CHANGE_RUNNING,
    CONFIG_CHANGE_DURING_START, // after the answer from which the groups were made
    CONFIG_CHANGE_IN_ANSWER,    // before that answer, which contains it
};
// The new values of a change event, in the order that decides what a change does to running groups.
lc_status wccpd_config_apply(bn_binding_array *new_values, config_change_time time = CONFIG_CHANGE_RUNNING);
