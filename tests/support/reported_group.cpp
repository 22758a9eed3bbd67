#include "tests/support/reported_group.h"

#include "engine/wccp_config.h"
#include "engine/wccp_mgr.h"
#include "engine/wccp_pkt_mgr.h"
#include "engine/wccp_router_utils.h"
#include "engine/wccp_view_utils.h"
#include "runtime/list.h"

reported_group::reported_group(bool started, uint8_t id) {
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

reported_group::~reported_group() {
    wccp_flush_group_lists(group);
    list_unlink(group);
    wccp_g.groups[group->id] = nullptr;
    wccp_g.group_count--;
    wccp_pkt_free(group->tx_pkt);
    wccp_free(group);
}

wccp_sending_router *reported_group::router(be32 id) const {
    if (wccp_sending_router *known = wccp_find_sending_router(group, id))
        return known;
    const wccp_rtr_capabilities l2 = {2, 1, 2};
    wccp_sending_router *made = wccp_create_sending_router(group, id, &l2, &l2);
    made->last_icu_time = wccp_g.seconds;
    return made;
}

int reported_group::report_routers(be32 from, const std::vector<be32> &list) const {
    return wccp_update_router_view(group, router(from), static_cast<uint32_t>(list.size()), list.data());
}

int reported_group::report(be32 from, const reported_appliances &list) const {
    wccp_rtr_view_appliance decoded[WCCP_MAX_APPLIANCES] = {};
    uint32_t count = 0;
    for (const auto &[address, weight] : list) {
        decoded[count].ipa = address;
        decoded[count++].weight = weight;
    }
    return wccp_update_appliance_view(group, router(from), count, decoded);
}

void reported_group::see(be32 from, const std::vector<be32> &routers,
                         const reported_appliances &appliances) const {
    router(from)->last_icu_time = wccp_g.seconds;
    report_routers(from, routers);
    report(from, appliances);
}

std::string take_reasons(wccp_service_group *group) {
    std::string out;
    uint32_t count;
    wccp_reason *const table = wccp_reasons_of(group, &count);
    for (wccp_reason *each = table; each < table + count; each++) {
        if (each->code == WCCP_REASON_NONE)
            continue;
        out += (out.empty() ? "" : "; ") + std::string(wccp_reason_word(each->code));
        if (!is_zero(each->sender))
            out += std::string(" ") + addr_text(each->sender).s;
        out += std::string(": ") + each->offered.s + "|" + each->wanted.s;
        out += each->count > 1 ? " x" + std::to_string(each->count) : "";
        each->code = WCCP_REASON_NONE;
    }
    return out;
}

all_freed::~all_freed() {
    EXPECT_EQ(wccp_g.stat_allocs.load(), wccp_g.stat_frees.load());
}

void pass_seconds(uint32_t seconds) {
    while (seconds--)
        wccp_tick();
}
