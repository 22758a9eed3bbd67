// Numbers of the appliance that do not change while the daemon runs, from /etc/opt/rvl/platform.conf: one
// `name value` a line. A missing file means the defaults; a bad line is logged and passed over.
#pragma once

#include <cstdint>

constexpr const char *PLATFORM_CONF_PATH = "/etc/opt/rvl/platform.conf";

uint32_t get_max_user_tunnel_number(); // "max_user_tunnels"
uint32_t get_max_tunnel_number();      // the same plus 22
uint32_t qv_max_interfaces();          // "max_interfaces", 128 by default

// What the first of the above reads, once: the file's numbers over the defaults.
struct platform_limits {
    uint32_t max_user_tunnels;
    uint32_t max_interfaces;
};
// With `out_bad_line` nothing is logged: it gets the number of the first bad line, or 0.
platform_limits platform_limits_read(const char *path, uint32_t *out_bad_line = nullptr);
