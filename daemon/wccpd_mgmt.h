// The daemon's working session with mgmtd. Main thread only.
#pragma once

#include <cstdint>
#include <cstring>

#include "mgmt/owners.h"
#include "runtime/common.h"

struct gcl_session;
struct mdc;
extern gcl_session *wccpd_mgmt_session; // null before it is created and after wccpd_mgmt_deinit
extern mdc *wccpd_mcc;                  // the client handle for all mdc_ calls of the daemon

// Whether `name` is a node below `root`.
inline bool wccpd_is_under(const char *name, const char *root) {
    const size_t length = strlen(root);
    return strncmp(name, root, length) == 0 && name[length] == '/';
}

// Reads the value of a string node into `out`, which owns it. LC_NULL when it has none.
inline lc_status wccpd_read_text(const bn_binding *binding, owned_tstring *out) {
    CHECK_STATUS(bn_binding_get_tstr(binding, bn_attrib_value, bn_type_str, nullptr, &out->pointer));
    CHECK_NULL(out->pointer);
    return LC_OK;
}

// Opens the session and registers for events. Waits for mgmtd by running the loop. There is one attempt.
lc_status wccpd_mgmt_init();
lc_status wccpd_mgmt_shutdown(); // closes the session
lc_status wccpd_mgmt_deinit();   // frees everything; always LC_OK
