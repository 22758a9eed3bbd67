// The daemon's working session with mgmtd. Main thread only.
#pragma once

#include <cstdint>
#include <cstring>

#include "runtime/common.h"

struct gcl_session;
struct mdc;
extern gcl_session *wccpd_mgmt_session; // null before it is created and after wccpd_mgmt_deinit
extern mdc *wccpd_mcc;                  // what all mdc_ calls of the daemon are given

// True for the name of a node below `root`.
inline bool wccpd_is_under(const char *name, const char *root) {
    const size_t length = strlen(root);
    return strncmp(name, root, length) == 0 && name[length] == '/';
}

lc_status wccpd_mgmt_init();
lc_status wccpd_mgmt_shutdown();
lc_status wccpd_mgmt_deinit();
