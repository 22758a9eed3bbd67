// Health checks of local proxies, on the program's loop: none blocks, each is bounded in time.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>

#include "peers/tunneld/view.h"
#include "runtime/loop_host.h"

struct proxy_health {
    enum { unknown, up, down } state = unknown; // unknown until `rise` or `fall` checks have agreed
    std::string reason;   // of the last failed check: "connection refused", "status 503"
    int64_t since_ms = 0; // monotonic, of the state
    uint64_t checks = 0, failures = 0;
};

struct health_monitor; // owned by whoever made it
// `changed` runs on the loop, after the state of a group's proxy has changed. Null: no memory.
health_monitor *health_new(loop_context *loop, std::function<void(uint8_t group)> changed);
void health_free(health_monitor *monitor);
// Checks what is in the table from now on. A check that is the same as before goes on with its state. The
// first check of a new one begins at once and the first result settles it.
void health_set_checks(health_monitor *monitor, const std::map<uint8_t, intercept> &intercepts);
const std::map<uint8_t, proxy_health> &health_states(const health_monitor *monitor);
