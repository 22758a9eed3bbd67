// Brings the log levels of the process in line with the management tree, at start and at each change, and
// follows changes of the time zone.
#pragma once

#include "mgmt/mdc_main.h"

lc_status qv_init_log_level(mdc *session);
lc_status qv_handle_log_level_change(const bn_binding_array *bindings);
lc_status qv_read_log_facility(mdc *session, uint32_t *out_facility); // LC_NULL when the node is absent
lc_status qv_register_time_zone_change(mdc *session);
lc_status qv_handle_time_zone_change(const char *event_name); // 0 when it was the time zone event
