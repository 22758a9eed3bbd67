// The monitoring tree: what mdc_dispatch_mon_request is given. Main thread only.
#pragma once

#include "mgmt/mdc_main.h"

lc_status wccpd_mon_handle_get(const char *node_name, const tstr_array *name_parts, void *data,
                               bn_binding_array *out_bindings);
lc_status wccpd_mon_handle_iterate(const char *node_name, const tstr_array *name_parts, void *data,
                                   tstr_array *out_names);
