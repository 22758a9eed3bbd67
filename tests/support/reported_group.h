// A service group whose routers report by direct calls, without packets or a network. Its interface is ready
// but has no sockets: messages are built and counted, but not sent.
#pragma once

#include <cstring>
#include <functional>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "engine/wccp_records.h"
#include "engine/wccp_utils.h"
#include "tests/support/log_lines.h"

constexpr be32 host(uint32_t last_octet) { // 10.0.0.x
    return to_be32(10u << 24 | last_octet);
}
constexpr be32 US = host(1);
constexpr be32 ROUTER_A = host(201), ROUTER_B = host(202), ROUTER_C = host(203);

using reported_appliances = std::vector<std::pair<be32, uint16_t>>; // address and weight

struct reported_group {
    // An enabled group in the engine's tables, started or not.
    explicit reported_group(bool started, uint8_t id = 51);
    ~reported_group(); // removes it, with everything that it owns
    reported_group(const reported_group &) = delete;
    reported_group &operator=(const reported_group &) = delete;

    // The sending router with this id, created if necessary: L2 and hash, without a tunnel.
    wccp_sending_router *router(be32 id) const;
    int report_routers(be32 from, const std::vector<be32> &list) const;
    int report(be32 from, const reported_appliances &list) const;
    // Both reports of an I-See-You; renews the hold time.
    void see(be32 from, const std::vector<be32> &routers, const reported_appliances &appliances) const;

    wccp_interface interface = {};
    wccp_service_group *group;
};

// Returns and removes the reasons of a group, or of packets of no group: "CODE SENDER: OFFERED|WANTED
// xCOUNT", separated by "; ". The sender is left out if there is none, and a count of 1.
std::string take_reasons(wccp_service_group *group);

// A base class before reported_group: checks at the end of a test that the engine has freed all memory.
struct all_freed {
    ~all_freed();
};

// Calls the tick this many times.
void pass_seconds(uint32_t seconds);
