// The path of the socket on which mgmtd listens.
#pragma once

#include <string>

#include <sys/un.h>

#include "mgmt/gcl_wire.h"

inline std::string provider_path() {
    char path[sizeof(sockaddr_un::sun_path)];
    gcl_socket_path("provider", "mgmtd", path, sizeof path);
    return path;
}
