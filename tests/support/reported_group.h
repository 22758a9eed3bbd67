// A service group whose routers report by direct calls, without packets or a network. Its interface is ready
// but has no sockets: messages are built and counted, but not sent.
#pragma once

#include <gtest/gtest.h>

#include "engine/wccp_config.h"
#include "engine/wccp_mgr.h"
#include "engine/wccp_pkt_mgr.h"
#include "engine/wccp_router_utils.h"
#include "engine/wccp_utils.h"
#include "engine/wccp_view_utils.h"
#include "runtime/list.h"
#include "tests/support/log_lines.h"

constexpr be32 host(uint32_t last_octet) { // 10.0.0.x
    return to_be32(10u << 24 | last_octet);
}
constexpr be32 US = host(1), ROUTER_A = host(201), ROUTER_B = host(202), ROUTER_C = host(203);

using reported_appliances = std::vector<std::pair<be32, uint16_t>>; // address and weight

struct reported_group {
    // An enabled group in the engine's tables, started or not.
    explicit reported_group(bool started, uint8_t id = 51) {
        strcpy(interface.name, "lan0");
        interface.ipa = US;
        interface.ready_flags = WCCP_ALL_READY;
        interface.ucast_fd = interface.mcast_fd = -1;
        group = static_cast<wccp_service_group *>(wccp_malloc(sizeof *group));
        group->id = id;
        group->admin_state = WCCP_ADMIN_UP;
        group->appliance_ipa = US;
        group->weight = 100;
        group->cfg_fwd_method = WCCP_METHOD_L2;
        group->cfg_assign_method = WCCP_ASSIGN_HASH;
        group->compat_mode = WCCP_COMPAT_IOS;
        group->interfaces[0] = &interface;
        group->if_count = 1;
        group->tx_pkt = wccp_pkt_alloc();
        group->state_flags = WCCP_STATE_INIT;
        list_push_head(&wccp_g.group_list, group);
        wccp_g.groups[group->id] = group;
        wccp_g.group_count++;
        if (started)
            wccp_start_service_group(group);
    }
    ~reported_group() { // removes it, with everything that it owns
        wccp_flush_group_lists(group);
        list_unlink(group);
        wccp_g.groups[group->id] = nullptr;
        wccp_g.group_count--;
        wccp_pkt_free(group->tx_pkt);
        wccp_free(group);
    }
    reported_group(const reported_group &) = delete;
    reported_group &operator=(const reported_group &) = delete;

    // The sending router with this id, created if necessary: L2 and hash, without a tunnel.
    wccp_sending_router *router(be32 id) const {
        if (wccp_sending_router *known = wccp_find_sending_router(group, id))
            return known;
        const wccp_rtr_capabilities l2 = {2, 1, 2};
        wccp_sending_router *made = wccp_create_sending_router(group, id, &l2, &l2);
        made->last_icu_time = wccp_g.seconds;
        return made;
    }
    int report(be32 from, const reported_appliances &list) const {
        wccp_rtr_view_appliance decoded[WCCP_MAX_APPLIANCES] = {};
        uint32_t count = 0;
        for (const auto &[address, weight] : list) {
            decoded[count].ipa = address;
            decoded[count++].weight = weight;
        }
        return wccp_update_appliance_view(group, router(from), count, decoded);
    }
    // Both reports of an I-See-You; renews the hold time.
    void see(be32 from, const std::vector<be32> &routers, const reported_appliances &appliances) const {
        router(from)->last_icu_time = wccp_g.seconds;
        wccp_update_router_view(group, router(from), static_cast<uint32_t>(routers.size()), routers.data());
        report(from, appliances);
    }

    wccp_interface interface = {};
    wccp_service_group *group;
};

// Returns and removes the reasons of a group, or of packets of no group: "CODE SENDER: OFFERED|WANTED
// xCOUNT", separated by "; ". The sender is left out if there is none, and a count of 1.
inline std::string take_reasons(wccp_service_group *group) {
    std::string out;
    uint32_t count;
    wccp_reason *const table = wccp_reasons_of(group, &count);
    for (wccp_reason *each = table; each < table + count; each++) {
        if (each->code == WCCP_REASON_NONE)
            continue;
        out += (out.empty() ? "" : "; ") + std::string(wccp_reason_word(each->code));
        out += is_zero(each->sender) ? "" : std::string(" ") + addr_text(each->sender).s;
        out += std::string(": ") + each->offered.s + "|" + each->wanted.s;
        out += each->count > 1 ? " x" + std::to_string(each->count) : "";
        each->code = WCCP_REASON_NONE;
    }
    return out;
}

// A base class before reported_group: checks at the end of a test that the engine has freed all memory.
struct all_freed {
    ~all_freed() { EXPECT_EQ(wccp_g.stat_allocs.load(), wccp_g.stat_frees.load()); }
};

// Calls the tick this many times.
inline void pass_seconds(uint32_t seconds) {
    while (seconds--)
        wccp_tick();
}
