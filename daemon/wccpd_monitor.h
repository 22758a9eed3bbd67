// The monitoring tree: the callbacks that mdc_dispatch_mon_request calls. Main thread only.
#pragma once

#include "mgmt/mdc_main.h"

// Appends at most one binding, none for an unknown name. `in_walk` points to a bool, or is null for false: in
// a walk over a subtree a dump that does not fit is not logged as an error, since nobody asked for it in
// particular.
lc_status wccpd_mon_handle_get(const char *node_name, const tstr_array *name_parts, void *in_walk,
                               bn_binding_array *out_bindings);
// Appends the last name parts of the node's children.
lc_status wccpd_mon_handle_iterate(const char *node_name, const tstr_array *name_parts, void *data,
                                   tstr_array *out_names);
