// Views: the union over the routers' reports, connections, weights, and the role that follows from what
// routers assign.
#include "engine/wccp_view_utils.h"

#include "engine/wccp_pkt_unload.h"
#include "engine/wccp_state.h"
#include "tests/support/reported_group.h"

namespace {

struct ViewTest : testing::Test, all_freed, reported_group {
    ViewTest() : reported_group(false) {}
    // The union in list order: routers with their references, appliances with weight and references; then the
    // rise of the change number since the last call.
    std::string views() {
        std::ostringstream text;
        const auto name = [](be32 ipa) { return std::string(addr_text(ipa).s).substr(5); };
        uint32_t routers = 0, appliances = 0;
        for (const wccp_view_router *entry = group->router_view; entry; entry = entry->next, routers++)
            text << name(entry->ipa) << ":" << entry->ref_count << " ";
        text << "|";
        for (const wccp_view_appliance *entry = group->appliance_view; entry;
             entry = entry->next, appliances++)
            text << " " << name(entry->ipa) << "/" << entry->weight << ":" << entry->ref_count;
        EXPECT_TRUE(group->router_view_count == routers && group->appliance_view_count == appliances);
        const uint32_t risen = group->change_number - seen_change_number;
        EXPECT_EQ((group->state_flags & WCCP_DESG_ELECT_PENDING) != 0, risen != 0);
        group->state_flags &= ~WCCP_DESG_ELECT_PENDING;
        seen_change_number = group->change_number;
        text << " +" << risen;
        return text.str();
    }
    uint32_t seen_change_number = 0;
};

TEST_F(ViewTest, ReportsUpdateTheUnion) {
    const be32 A = ROUTER_A, B = ROUTER_B;
    const be32 low = host(2), high = host(0x101);
    EXPECT_EQ(wccp_appliance_is_reported_by_all_senders(group, US), 1) << "there are none";
    group->ucast_router_count = 1;
    const std::tuple<be32, std::vector<be32>, reported_appliances, const char *> steps[] = {
        // Only the head is compared in a sorted insertion.
        {A,
         {},
         {{host(10), 100}, {host(11), 50}, {host(12), 75}, {host(13), 60}},
         "| 0.10/100:1 0.13/60:1 0.12/75:1 0.11/50:1 +1"},
        {A, {}, {}, "| +1"},
        {A,
         {},
         {{host(10), 50}, {host(11), 60}, {host(12), 55}, {host(13), 70}},
         "| 0.13/70:1 0.11/60:1 0.12/55:1 0.10/50:1 +1"},
        // Of equal weights the higher address, as a number, comes first.
        {A, {}, {{low, 9}, {high, 9}}, "| 1.1/9:1 0.2/9:1 +1"},
        {A, {}, {}, "| +1"},
        {A, {}, {{high, 9}, {low, 9}}, "| 1.1/9:1 0.2/9:1 +1"},
        // References are counted, and an entry is freed with the last one.
        {A, {A, B}, {{US, 100}, {low, 9}}, "0.202:1 0.201:1 | 0.1/100:1 0.2/9:1 +2"},
        {B, {B}, {{low, 9}}, "0.202:2 0.201:1 | 0.1/100:1 0.2/9:2 +2"},
        {A, {A, B}, {{US, 100}}, "0.202:2 0.201:1 | 0.1/100:1 0.2/9:1 +1"},
        {B, {}, {}, "0.202:1 0.201:1 | 0.1/100:1 +2"},
        // Of a repeated address in a report, new or known, only the first occurrence is stored.
        {A, {A, A}, {{US, 100}, {low, 9}, {US, 50}, {low, 9}}, "0.201:1 | 0.1/100:1 0.2/9:1 +2"},
        {B, {}, {{low, 9}, {low, 9}}, "0.201:1 | 0.1/100:1 0.2/9:2 +1"},
        {A, {A, A}, {{US, 100}, {low, 9}, {US, 50}, {low, 9}}, "0.201:1 | 0.1/100:1 0.2/9:2 +0"},
        {A, {A}, {{low, 9}, {US, 100}}, "0.201:1 | 0.1/100:1 0.2/9:2 +0"},
        {A, {A, A}, {{low, 9}, {low, 9}}, "0.201:1 | 0.2/9:2 +1"},
        {A, {}, {}, "| 0.2/9:1 +2"},
        // A weight is that of the last report that differs from its router's earlier one. The view does not
        // change.
        {A, {}, {{low, 9}, {US, 8}}, "| 0.2/9:2 0.1/8:1 +1"},
        {B, {}, {{low, 5}, {US, 3}}, "| 0.1/8:2 0.2/5:2 +1"},
        {B, {}, {{low, 5}, {US, 8}}, "| 0.1/8:2 0.2/5:2 +0"},
        {A, {}, {{low, 9}, {US, 8}}, "| 0.1/8:2 0.2/5:2 +0"},
    };
    for (const auto &[from, routers, appliances, wanted] : steps) {
        const wccp_sending_router *sender = router(from);
        const uint32_t earlier = sender->flags;
        group->raised_alarms = 0;
        wccp_g.seconds++;
        see(from, routers, appliances);
        EXPECT_EQ(views(), wanted);
        const bool listed = wccp_get_router_appliance_view_element(router(from), US) != nullptr;
        EXPECT_EQ(sender->flags, listed ? WCCP_RTR_TWO_WAY : WCCP_RTR_ONE_WAY);
        EXPECT_EQ(sender->state_time == wccp_g.seconds, sender->flags != earlier);
        EXPECT_EQ(group->raised_alarms, !listed && sender->flags != earlier ? WCCP_ALARM_ADJACENCY : 0);
    }
    wccp_g.seconds = 0;
    // A duplicate entry is logged and inserted after the head.
    auto *again = static_cast<wccp_view_appliance *>(wccp_malloc(sizeof(wccp_view_appliance)));
    again->ipa = US;
    again->weight = 8;
    EXPECT_EQ(wccp_view_list_add_appliance_sorted(group, again), 1);
    EXPECT_EQ(group->appliance_view->next, again);
    list_unlink(again);
    wccp_free(again);
}

TEST_F(ViewTest, AWeightChangeMakesTheDesignatedApplianceAssignAgain) {
    report(ROUTER_A, {{US, 100}, {host(2), 100}});
    group->designated = 1;
    views();
    router(ROUTER_A)->assign_tx_count = 3;
    EXPECT_EQ(report(ROUTER_A, {{US, 100}, {host(2), 300}}), 0);
    EXPECT_EQ(views(), "| 0.2/300:1 0.1/100:1 +0");
    EXPECT_EQ(std::tuple(group->dsg_key_change, group->assign_timer.countdown, group->pending_acks,
                         router(ROUTER_A)->assign_tx_count),
              std::tuple(1, 1, 1, 0));
    // When no appliance is left that all routers report, the update fails, but the whole report is applied,
    // so that the next one can remove it again.
    const be32 lowest = to_be32(0x0a000000);
    report(ROUTER_B, {{host(3), 100}});
    EXPECT_EQ(report(ROUTER_A, {{lowest, 1}, {US, 150}, {host(4), 1}}), 1);
    EXPECT_EQ(views(), "| 0.4/1:1 0.1/150:1 0.0/1:1 0.3/100:1 +2");
    EXPECT_EQ(router(ROUTER_A)->view_appliance_count, 3u);
    EXPECT_EQ(group->assign_timer.active + group->pending_acks, 0);
    for (const be32 id : {ROUTER_A, ROUTER_B})
        report(id, {{US, 150}, {host(3), 100}});
    EXPECT_EQ(views(), "| 0.1/150:2 0.3/100:2 +2");
}

// What a router assigns to this appliance and to all; then the number of routers that redirect here, the
// state, and the log line.
TEST_F(ViewTest, TheRoleFollowsWhatRoutersAssign) {
    const be32 A = ROUTER_A, B = ROUTER_B, C = ROUTER_C;
    constexpr uint32_t INIT = WCCP_STATE_INIT, ACTIVE = WCCP_STATE_ACTIVE, BACKUP = WCCP_STATE_BACKUP;
    const std::tuple<be32, uint16_t, uint16_t, uint8_t, uint32_t, uint32_t, std::string> steps[] = {
        {A, 128, 256, 1, ACTIVE, 1, "first router to self (router id 10.0.0.201 )"},
        {A, 100, 256, 1, ACTIVE, 1, ""},
        {B, 128, 256, 2, ACTIVE, 1, ""},
        {A, 0, 256, 1, ACTIVE, 1, ""},
        // B assigns elsewhere; then only A does; then no router.
        {B, 0, 256, 0, BACKUP, 2, "last router stopped redirecting to self. (router id 10.0.0.202)"},
        {B, 256, 256, 1, ACTIVE, 3, "first router to self (router id 10.0.0.202 )"},
        {B, 0, 0, 0, BACKUP, 4, "this rtr (id 10.0.0.202) does not redirect. but another router does"},
        {A, 0, 0, 0, INIT, 4, "no routers redirecting to group (router id 10.0.0.201)"},
        // Both stop.
        {A, 256, 256, 1, ACTIVE, 5, "first router to self (router id 10.0.0.201 )"},
        {B, 256, 256, 2, ACTIVE, 5, ""},
        {B, 0, 0, 1, ACTIVE, 5, ""},
        {A, 0, 0, 0, INIT, 5, "rtr does not redirect. no redirecting routers (router id 10.0.0.201)"},
        // Everything elsewhere from the start.
        {A, 0, 256, 0, BACKUP, 6, "router id 10.0.0.201 is redirecting to other  appliance(s)."},
        {B, 0, 256, 0, BACKUP, 6, ""},
        {A, 0, 0, 0, BACKUP, 6, ""},
        {C, 0, 64, 0, BACKUP, 6, ""},
        {B, 0, 0, 0, BACKUP, 6, ""},
        {C, 0, 0, 0, INIT, 6, "no routers redirecting to group (router id 10.0.0.203)"}};
    for (const be32 id : {A, B, C})
        report(id, {{US, 100}, {host(2), 100}});
    log_lines log;
    const auto assign = [this](be32 id, uint16_t self, uint16_t total) {
        wccp_sending_router *from = router(id);
        // As a view update leaves it: the other appliance has the rest.
        from->view_appliances[0].buckets_assigned = self;
        from->view_appliances[1].buckets_assigned = static_cast<uint16_t>(total - self);
        const wccp_assign_summary hash = {1, self, total}, mask = {};
        EXPECT_EQ(wccp_update_appliance_redirect_status(group, from, &hash, &mask), 0);
        EXPECT_TRUE(from->self_buckets == self && from->total_buckets == total);
    };
    for (const auto &[from, self, total, redirecting, state, transitions, line] : steps) {
        assign(from, self, total);
        EXPECT_EQ(
            std::tuple(group->redirecting_routers, group->state_flags & WCCP_STATE_MASK, group->transitions),
            std::tuple(redirecting, state, transitions));
        const std::string said = log.take(), begin = "WCCP GRP 51: redirect: ";
        EXPECT_EQ(count_of(begin, said) != 0, !line.empty()) << said;
        EXPECT_TRUE(line.empty() || count_of(begin + line, said) == 1) << said;
    }
    // A count of 0, as after a start of the group, does not wrap.
    for (const uint16_t total : {uint16_t{256}, uint16_t{0}}) {
        router(A)->self_buckets = router(A)->total_buckets = 9;
        assign(A, 0, total);
        EXPECT_EQ(group->redirecting_routers, 0);
    }
    // A map takes precedence, and a repetition changes nothing.
    const wccp_assign_summary hash = {1, 0, 0}, mask = {1, 8, 16};
    const uint32_t checks = group->alarm_assign_sched;
    for (int round = 0; round < 2; round++) {
        EXPECT_EQ(wccp_update_appliance_redirect_status(group, router(A), &hash, &mask), 0);
        EXPECT_EQ(std::tuple(router(A)->self_buckets, router(A)->total_buckets, group->alarm_assign_sched),
                  std::tuple(8, 16, checks + 1));
    }
    EXPECT_EQ(group->redirecting_routers, 1);
    // Neither: the elements say that a map should have come.
    const wccp_assign_summary none = {};
    log.take();
    EXPECT_EQ(wccp_update_appliance_redirect_status(group, router(A), &none, &none), 1);
    EXPECT_EQ(router(A)->self_buckets, 8);
    EXPECT_TRUE(log.say("update redirect status: assign. info not found. sender rtr id: 10.0.0.201"));
}

} // namespace
