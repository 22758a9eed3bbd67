// Sending routers: the capability decision, creation and its limits, removal, and Removal Queries.
#include "engine/wccp_router_utils.h"

#include "engine/wccp_state.h"
#include "tests/support/reported_group.h"

namespace {

using numbers = std::vector<uint32_t>;

struct RouterTest : testing::Test, all_freed, reported_group {
    RouterTest() : reported_group(false) { wccp_g.seconds = 0; }
    // The agreed codes as one number, forwarding first; -1 minus the result when there is no agreement.
    int decide(uint32_t forwarding, uint32_t assignment, uint32_t ret) {
        const wccp_rtr_capabilities offered = {forwarding, assignment, ret};
        wccp_rtr_capabilities agreed = {7, 7, 7};
        uint32_t compatible = 7;
        const int result = wccp_process_router_capabilities(group, ROUTER_A, &offered, &agreed, &compatible);
        if (!compatible)
            return -1 - result;
        EXPECT_TRUE(result == 0 && compatible == 1);
        return static_cast<int>(agreed.forwarding * 100 + agreed.assignment * 10 + agreed.ret);
    }
    void configure(uint32_t forwarding, uint32_t assignment) {
        group->cfg_fwd_method = forwarding;
        group->cfg_assign_method = assignment;
    }
};

TEST_F(RouterTest, EachMethodIsAgreedByItsOwnRule) {
    // By local value and the two low bits of the offer; 0 for none in common.
    const int forwarding[5][4] = {{0, 0, 0, 0}, {0, 1, 0, 1}, {0, 0, 2, 2}, {0, 1, 2, 2}, {0, 0, 0, 0}};
    const int assign_with_gre[5][4] = {{0, 0, 0, 0}, {0, 1, 0, 1}, {0, 0, 2, 2}, {0, 1, 2, 1}, {0, 0, 0, 0}};
    const int returning[4] = {0, 1, 2, 1}; // not configurable
    for (uint32_t local = 0; local < 25; local++) {
        const uint32_t local_fwd = local / 5, local_assign = local % 5;
        configure(local_fwd, local_assign);
        for (uint32_t offer = 0; offer < 64; offer++) {
            const uint32_t fwd = offer & 3, assign = offer >> 2 & 3, ret = offer >> 4;
            const int f = forwarding[local_fwd][fwd];
            const int a = (f == 2 ? forwarding : assign_with_gre)[local_assign][assign]; // the same table
            const int r = returning[ret];
            const int expected = f == 0 || a == 0 ? -1 : r == 0 ? -2 : f * 100 + a * 10 + r;
            ASSERT_EQ(decide(fwd, assign, ret), expected);
            ASSERT_EQ(decide(fwd | 0xfffffffc, assign | 0x100, ret | 4), expected);
        }
    }
}

TEST_F(RouterTest, RefusalsAndRoutersAreLogged) {
    log_lines log;
    const auto logs = [&log](const std::vector<std::string> &wanted) { // in this order
        const std::string lines = log.take();
        size_t from = 0;
        for (const std::string &line : wanted) {
            from = lines.find("WCCP GRP 51: " + line, from);
            ASSERT_NE(from, std::string::npos) << line << "\n-- among --\n" << lines;
        }
    };
    const std::string refused = "incompatible capabilities (router id 10.0.0.201) : local";
    configure(WCCP_METHOD_L2, WCCP_ASSIGN_MASK);
    decide(0xfd, 3, 2);
    decide(3, 1, 3);
    decide(3, 3, 0);
    logs({refused + ": (fwd encap: L2 ) router sent: (fwd: gre return: L2)",
          refused + " assign method: mask  router assign method: hash",
          refused + " return method: gre or L2  router return method: none"});
    EXPECT_EQ(take_reasons(group), "forwarding-not-offered 10.0.0.201: gre|L2; assignment-not-offered "
                                   "10.0.0.201: hash|mask; return-not-offered 10.0.0.201: none|gre or L2");
    router(ROUTER_A);
    logs({"agreed capabilities: fwd: 2 assign: 1 return: 2 deciding rtr id 10.0.0.201",
          "alarm: schedule router connectivity verify timer in 60 seconds",
          "created ICU sending router 10.0.0.201 "});
    const wccp_rtr_capabilities agreed = {2, 1, 2};
    wccp_create_sending_router(group, {}, &agreed, &agreed);
    uint32_t buckets;
    wccp_get_router_assignment(group, router(ROUTER_A), host(3), &buckets);
    wccp_g.seconds += 40;
    wccp_monitor_sending_routers(group);
    logs({"invalid router id in ICU. 0.0.0.0",
          "get router assign. failed. cannot find appliance 10.0.0.3 in router's view: 10.0.0.201",
          "removing router (router id: 10.0.0.201) due to inactivity."});
    EXPECT_EQ(take_reasons(group), "router-id-zero: |; router-silent 10.0.0.201: |an I-See-You within 40 s");
}

TEST_F(RouterTest, WhatTheFirstRouterAgreedHoldsForAll) {
    configure(WCCP_METHOD_EITHER, WCCP_ASSIGN_EITHER);
    EXPECT_TRUE(decide(3, 3, 3) == 221 && decide(1, 3, 3) == 111);
    wccp_g.seconds = 0xfffffff0; // the hold time works across the wrap of the clock
    router(ROUTER_A);            // L2, hash, L2
    EXPECT_EQ(std::tuple(decide(1, 3, 3), decide(2, 2, 3), decide(2, 3, 1), decide(3, 3, 3)),
              std::tuple(-1, -1, -2, 212));
    configure(WCCP_METHOD_GRE, WCCP_ASSIGN_MASK);
    for (const uint32_t seconds : {39u, 1u}) {
        EXPECT_EQ(decide(3, 3, 3), 212);
        wccp_g.seconds += seconds;
        wccp_monitor_sending_routers(group);
    }
    EXPECT_EQ(group->sending_router_count + group->fwd_method + group->assign_method + group->ret_method, 0u);
    EXPECT_EQ(decide(3, 3, 3), 121);
}

TEST_F(RouterTest, ANewRouterIsOneWayAndKeepsItsOffer) {
    const wccp_rtr_capabilities offered = {0x1fe, 0x302, 2}, l2 = {2, 2, 2}, gre = {1, 1, 2},
                                gre_return = {2, 1, 1};
    const auto create = [&](be32 id, const wccp_rtr_capabilities &agreed) {
        return wccp_create_sending_router(group, id, &offered, &agreed);
    };
    EXPECT_TRUE(!create({}, l2) && !create(ROUTER_A, gre) && !create(ROUTER_A, gre_return)) << "no tunneld";
    EXPECT_TRUE(group->sending_router_count == 0 && !(group->state_flags & WCCP_CAPABILITIES_SET));
    wccp_g.seconds = 77;
    const wccp_sending_router *router = create(ROUTER_A, l2);
    ASSERT_NE(router, nullptr);
    EXPECT_EQ((numbers{router->cap_fwd, router->cap_assign, router->flags, router->state_time,
                       group->assign_method, group->router_alarm_timer.countdown}),
              (numbers{0xfe, 2, WCCP_RTR_ONE_WAY, 77, 2, 60}));
    for (uint32_t i = 2; i <= 33; i++)
        EXPECT_EQ(create(host(i), l2) != nullptr, i < 33);
    EXPECT_EQ(group->sending_router_count, 32u);
    EXPECT_EQ(wccp_find_sending_router(group, ROUTER_A), router);
    EXPECT_EQ(wccp_find_sending_router(group, ROUTER_B), nullptr);
}

TEST_F(RouterTest, ARemovalDropsReferencesRedirectionAndLastTheAgreement) {
    for (const be32 id : {ROUTER_A, ROUTER_B, ROUTER_C})
        see(id, {id, ROUTER_A}, {{US, 100}, {id, 100}});
    router(ROUTER_A)->self_buckets = router(ROUTER_B)->self_buckets = 10;
    group->redirecting_routers = 2;
    wccp_appliance_state_active(group);
    group->change_number = 0;
    const auto after = [this](uint32_t seconds) {
        wccp_g.seconds = seconds;
        wccp_monitor_sending_routers(group);
        return numbers{group->sending_router_count, group->router_view_count,   group->appliance_view_count,
                       group->change_number,        group->redirecting_routers, group->state_flags,
                       group->routers_timed_out};
    };
    const uint32_t changed = WCCP_DESG_ELECT_PENDING, agreed = WCCP_CAPABILITIES_SET;
    router(ROUTER_B)->last_icu_time = 20;
    router(ROUTER_C)->last_icu_time = 40;
    // A is still listed by the others; then the last router that redirects here is removed; then the last
    // router.
    EXPECT_EQ(after(40), (numbers{2, 3, 3, 1, 1, WCCP_STATE_ACTIVE | agreed | changed, 1}));
    EXPECT_EQ(group->raised_alarms, WCCP_ALARM_ADJACENCY);
    EXPECT_EQ(after(60), (numbers{1, 2, 2, 2, 0, WCCP_STATE_INIT | agreed | changed, 2}));
    EXPECT_EQ(after(100), (numbers{0, 0, 0, 3, 0, WCCP_STATE_INIT | changed, 3}));
    EXPECT_TRUE(!group->router_view && !group->appliance_view);
}

TEST_F(RouterTest, RemovalQueriesOfTwoWayRoutersAreAnsweredUpToALimit) {
    router(ROUTER_A);
    const auto query = [this](be32 from, uint32_t receive_id) {
        return wccp_process_router_removal_query(group, from, host(receive_id));
    };
    EXPECT_EQ(query(ROUTER_B, 77) + query(ROUTER_A, 77), 0); // not known, and one-way
    EXPECT_TRUE(group->removal_reply_count == 0 && is_zero(router(ROUTER_A)->receive_id));

    see(ROUTER_A, {ROUTER_A}, {{US, 100}});
    EXPECT_TRUE(query(ROUTER_A, 77) == 0 && router(ROUTER_A)->receive_id == host(77));
    ASSERT_EQ(group->removal_reply_count, 1u);
    const wccp_pkt *pkt = &group->removal_replies->pkt;
    EXPECT_EQ(pkt->ipa, ROUTER_A);
    EXPECT_NE(memmem(pkt->data, pkt->length, host(77).bytes, 4), nullptr) << "the query's receive id";
    const std::vector<uint8_t> written(pkt->data, pkt->data + pkt->length);
    see(ROUTER_A, {ROUTER_A, ROUTER_B}, {{US, 100}}); // the reply is not built again
    log_lines log;
    int answered = 1;
    for (int i = 1; i < 100; i++)
        answered += query(ROUTER_A, 78) == 0;
    EXPECT_EQ(answered, 8);
    EXPECT_EQ(take_reasons(group), "query-refused 10.0.0.202: a query before an I-See-You|; query-refused "
                                   "10.0.0.201: one more query|8 replies waiting at most x93");
    EXPECT_TRUE(log.say("maximum of waiting replies (8) reached. (router id 10.0.0.201)"));
    see(ROUTER_B, {ROUTER_A}, {{US, 100}}); // the flood does not affect another router
    EXPECT_EQ(query(ROUTER_B, 79), 0);
    pass_seconds(2);
    EXPECT_EQ(group->removal_reply_count, 9u);
    EXPECT_EQ(std::vector<uint8_t>(pkt->data, pkt->data + pkt->length), written);
    pass_seconds(2);
    EXPECT_TRUE(!group->removal_replies && group->removal_reply_count == 0);
    EXPECT_EQ(group->tx_removal_replies, 3u * 9);
}

} // namespace
