// The daemon's working session with mgmtd. Main thread only.
#pragma once

#include <cstdint>

#include "runtime/common.h"

struct gcl_session;
struct mdc;
extern gcl_session *wccpd_mgmt_session; // null before it is created and after wccpd_mgmt_deinit
extern mdc *wccpd_mcc;                  // what all mdc_ calls of the daemon are given

lc_status wccpd_mgmt_init();
lc_status wccpd_mgmt_shutdown();
lc_status wccpd_mgmt_deinit();
