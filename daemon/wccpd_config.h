// The configuration tree: read once at start, then followed change by change. Main thread only.
#pragma once

#include "mgmt/bnode.h"
#include "runtime/common.h"

lc_status wccpd_config_query();

// When a change arrived. The engine follows one that arrived during the start as it does any other, but finds
// without complaint that it has been followed already: an added group is there, a group of a deleted or
// changed node is gone.
enum config_change_time {
    CONFIG_CHANGE_RUNNING,
    CONFIG_CHANGE_DURING_START, // after the answer from which the groups were made
    CONFIG_CHANGE_IN_ANSWER,    // before that answer, which contains it
};
// The new values of a change event, in the order that decides what a change does to running groups.
lc_status wccpd_config_apply(bn_binding_array *new_values, config_change_time time = CONFIG_CHANGE_RUNNING);
