// The monitoring tree: what mdc_dispatch_mon_request is given. Main thread only.
#pragma once

#include "mgmt/mdc_main.h"

// `in_walk`: a bool, or null for false. A walk asks for every dump that there is, and those that are cut are
// no errors then.
lc_status wccpd_mon_handle_get(const char *node_name, const tstr_array *name_parts, void *in_walk,
                               bn_binding_array *out_bindings);
lc_status wccpd_mon_handle_iterate(const char *node_name, const tstr_array *name_parts, void *data,
                                   tstr_array *out_names);
