// Where mgmtd listens: clients of the session library go there by themselves, mgmtd binds it, mgmtctl names
// it.
#pragma once

#include <string>

#include <unistd.h>

#include "mgmt/gcl_wire.h"
#include "runtime/common.h"

inline std::string provider_path() {
    const std::string user = lc_devel_is_production() ? "" : "UID-" + std::to_string(geteuid()) + "-";
    return GCL_SOCKET_DIRECTORY + ("uds-provider-" + user) + "mgmtd";
}
