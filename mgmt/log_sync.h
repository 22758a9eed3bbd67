// Sets the log levels of the process from the management tree, at start and at each change, and follows
// changes of the time zone. On the main thread.
#pragma once

#include "mgmt/mdc_main.h"

// Reads the levels. A node that doesn't exist leaves its level unchanged. LC_BAD_TYPE for an unknown level of
// the process.
lc_status qv_init_log_level(mdc *session);
// Takes the changed bindings of a change event; null does nothing.
lc_status qv_handle_log_level_change(const bn_binding_array *bindings);
lc_status qv_read_log_facility(mdc *session, uint32_t *out_facility); // LC_NULL when the node is absent
// Asks for time zone events, and handles one: LC_NOT_FOUND for another event.
lc_status qv_register_time_zone_change(mdc *session);
lc_status qv_handle_time_zone_change(const char *event_name);
