// A service group that learns of routers and appliances by the engine's own calls, with no packet and no
// network. Its one interface is ready but has no sockets: what it sends is built and counted.
#pragma once

#include <string>
#include <utility>
#include <vector>

#include "engine/wccp_records.h"

constexpr be32 host(uint32_t last_octet) { // 10.0.0.x
    return to_be32(10u << 24 | last_octet);
}
constexpr be32 US = host(1);
constexpr be32 ROUTER_A = host(201), ROUTER_B = host(202), ROUTER_C = host(203);

using reported_appliances = std::vector<std::pair<be32, uint16_t>>; // address and weight

struct reported_group {
    // An enabled group in the engine's tables; started, or as an addition leaves it.
    explicit reported_group(bool started, uint8_t id = 51);
    ~reported_group(); // takes it out again, with all that it has
    reported_group(const reported_group &) = delete;
    reported_group &operator=(const reported_group &) = delete;

    // The sending router of an id. A new one offers L2 both ways and hash: it needs no tunnel.
    wccp_sending_router *router(be32 id) const;
    int report_routers(be32 from, const std::vector<be32> &list) const;
    int report(be32 from, const reported_appliances &list) const;
    // A complete I-See-You: it counts as a sign of life, too.
    void see(be32 from, const std::vector<be32> &routers, const reported_appliances &appliances) const;

    wccp_interface interface = {};
    wccp_service_group *group;
};

// The reasons of a group, or of no group, and none of them afterwards: "CODE SENDER: OFFERED|WANTED xCOUNT"
// each, the sender and the count only where there is one and more than one, and a ";" in between.
std::string take_reasons(wccp_service_group *group);

// As a base before reported_group: at the end of a test all that the engine allocated is free again.
struct all_freed {
    ~all_freed();
};

// Ticks of the engine.
void pass_seconds(uint32_t seconds);
