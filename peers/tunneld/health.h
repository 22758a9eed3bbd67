// Health checks of local proxies, on the program's event loop. No check blocks, and each has a time limit.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>

#include "peers/tunneld/view.h"
#include "runtime/loop_host.h"

struct proxy_health {
    enum { unknown, up, down } state = unknown; // unknown until the first result
    std::string reason;   // of the last failed check: "connection refused", "status 503"
    int64_t since_ms = 0; // monotonic; when the state began
    uint64_t checks = 0, failures = 0;
};

struct health_monitor; // released by health_free()
// `changed` is called on the loop after the state of a group's proxy has changed. Never null.
health_monitor *health_new(loop_context *loop, std::function<void(uint8_t group)> changed);
void health_free(health_monitor *monitor);
// Checks the proxies of these intercepts from now on. A check that has not changed keeps its state. A new one
// begins at once, and its first result sets the state; later, `rise` or `fall` results change it.
void health_set_checks(health_monitor *monitor, const std::map<uint8_t, intercept> &intercepts);
const std::map<uint8_t, proxy_health> &health_states(const health_monitor *monitor);
