// The configuration tree: read once at start, then followed change by change. Main thread only.
#pragma once

#include "mgmt/bnode.h"
#include "runtime/common.h"

lc_status wccpd_config_query();
// The new values of a change event, in the order that decides what a change does to running groups.
lc_status wccpd_config_apply(bn_binding_array *new_values);
// Of them only what concerns the log, which is there before the engine is.
lc_status wccpd_config_apply_to_log(const bn_binding_array *new_values);
