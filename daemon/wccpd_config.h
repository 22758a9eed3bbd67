// Applies the configuration tree: read completely at the start, then followed change by change. Main thread
// only.
#pragma once

#include "mgmt/bnode.h"
#include "runtime/common.h"

// Reads the whole configuration from mgmtd, which runs the loop, and adds all groups. The first failure of a
// read or a binding of the wrong type ends it; what has been added stays.
lc_status wccpd_config_query();

// When a change arrived. What the start has read may contain a change that arrived during the start: then it
// is not an error if an added group exists already, or if the group of a changed or deleted node is missing.
enum config_change_time {
    CONFIG_CHANGE_RUNNING,
    CONFIG_CHANGE_DURING_START, // after the answer from which the groups were added
    CONFIG_CHANGE_IN_ANSWER,    // before that answer, which contains the change
};
// Applies the new values of a change event: policy groups first, then groups that were added or deleted, and
// only if there are none, single nodes. A binding of the wrong type ends it with a status; what has been
// applied stays.
lc_status wccpd_config_apply(bn_binding_array *new_values, config_change_time time = CONFIG_CHANGE_RUNNING);
