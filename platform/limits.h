// Limits of the appliance, from /etc/opt/rvl/platform.conf, which has a line `name value` for each. They
// don't change while a process runs. Without the file the defaults apply; a bad line is logged and ignored.
// Any thread, no lock.
#pragma once

#include <cstdint>

constexpr const char *PLATFORM_CONF_PATH = "/etc/opt/rvl/platform.conf";

uint32_t get_max_user_tunnel_number(); // "max_user_tunnels", 200 by default
uint32_t get_max_tunnel_number();      // the same plus the 22 tunnels of the system
uint32_t qv_max_interfaces();          // "max_interfaces", 128 by default

// The limits as the first call of one of these reads them: the numbers in the file, or the defaults.
struct platform_limits {
    uint32_t max_user_tunnels;
    uint32_t max_interfaces;
};
// If `out_bad_line` isn't null, it gets the number of the first bad line, or 0, and nothing is logged.
platform_limits platform_limits_read(const char *path, uint32_t *out_bad_line = nullptr);
