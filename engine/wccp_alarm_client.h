// The client session of its own, served by a thread of its own, on which alarms and state events go.
#pragma once

#include <cstdint>

#include "engine/wccp_alarms.h"
#include "runtime/common.h"

// Starts the thread and returns once its session is ready or has failed: the result of the thread's creation.
lc_status qv_alm_mgmt_init(const char *client_name);
lc_status qv_initiate_exit();
lc_status qv_alm_mgmt_shutdown();
lc_status qv_alm_mgmt_deinit();
