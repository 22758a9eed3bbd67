// The monitoring tree: the callbacks that mdc_dispatch_mon_request calls. Main thread only.
#pragma once

#include "mgmt/mdc_main.h"

// How the nodes of a request are to be answered.
struct wccpd_mon_request {
    bool in_walk; // mgmtd asks for a whole subtree: a dump that does not fit is not logged as an error
    bool quiet;   // the request is repeated every second or so: nothing is logged above debug level
};
// Appends at most one binding, none for an unknown name. `request` is a wccpd_mon_request, or null for one
// with neither.
lc_status wccpd_mon_handle_get(const char *node_name, const tstr_array *name_parts, void *request,
                               bn_binding_array *out_bindings);
// Appends the last name parts of the node's children.
lc_status wccpd_mon_handle_iterate(const char *node_name, const tstr_array *name_parts, void *request,
                                   tstr_array *out_names);
