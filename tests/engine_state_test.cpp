// The seconds at which things happen: Here-I-Am, election, Redirect-Assign, time-outs and alarm checks, with
// the engine's ticks turned by hand; and the state with its role.
#include "engine/wccp_state.h"

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "engine/wccp_alarms.h"
#include "engine/wccp_config.h"
#include "engine/wccp_host.h"
#include "engine/wccp_router_utils.h"
#include "platform/qvcommon.h"
#include "tests/support/log_lines.h"
#include "tests/support/reported_group.h"

struct state_event {
    uint32_t one;
    std::string group_id;
    uint32_t role;
    uint8_t code;
    bool operator==(const state_event &) const = default;
};
static std::vector<state_event> state_events;

// In the place of the platform library's.
extern "C" int qv_state_event_send(uint32_t one, const char *group_id, uint32_t role, const uint8_t *code,
                                   gcl_session *) {
    state_events.push_back({one, group_id, role, *code});
    return 14016;
}

namespace {

struct StateTest : testing::Test {
    StateTest() {
        wccp_g.seconds = 1000;
        shared = new reported_group(true);
        group = shared->group;
        state_events.clear();
    }
    ~StateTest() override {
        delete shared;
        EXPECT_EQ(wccp_g.stat_allocs.load(), wccp_g.stat_frees.load());
    }
    void see(be32 from, const std::vector<be32> &routers, const reported_appliances &appliances) {
        shared->see(from, routers, appliances);
    }
    // For so many seconds router A goes on reporting what it does.
    void stay_alive(uint32_t seconds) {
        while (seconds--) {
            pass_seconds(1);
            shared->router(ROUTER_A)->last_icu_time = wccp_g.seconds;
        }
    }
    reported_group *shared;
    wccp_service_group *group;
};

TEST_F(StateTest, HereIAmGoesAtOnceAndThenEveryTenSeconds) {
    std::vector<uint32_t> sent_at;
    for (uint32_t second = 1; second <= 35; second++) {
        const uint32_t before = group->tx_here_i_am;
        pass_seconds(1);
        if (group->tx_here_i_am != before)
            sent_at.push_back(second);
    }
    EXPECT_EQ(sent_at, (std::vector<uint32_t>{1, 11, 21, 31}));
    group->admin_state = WCCP_ADMIN_DOWN; // no tick for a disabled group
    pass_seconds(20);
    EXPECT_EQ(group->tx_here_i_am, 4u);
}

TEST_F(StateTest, ASoleApplianceElectsItselfAndAssignsSixteenSecondsAfterTheChange) {
    see(ROUTER_A, {ROUTER_A}, {{US, 100}});
    EXPECT_EQ(group->designated, 0u);
    pass_seconds(1);
    EXPECT_EQ(group->designated, 1u);
    EXPECT_EQ(group->dsg_key_change, 1u);
    EXPECT_EQ(group->pending_acks, 1);
    EXPECT_EQ(group->dsg_appliances[0].assigned, 256);
    std::vector<uint32_t> sent_at;
    for (uint32_t second = 2; second <= 40; second++) {
        const uint32_t before = group->tx_redirect_assign;
        stay_alive(1);
        if (group->tx_redirect_assign != before)
            sent_at.push_back(second);
    }
    EXPECT_EQ(sent_at, (std::vector<uint32_t>{16, 26, 36}));
    EXPECT_EQ(shared->router(ROUTER_A)->assign_tx_count, 3u);
    EXPECT_EQ(group->dsg_key_change, 1u);
}

TEST_F(StateTest, AWeightChangeIsAssignedAtTheNextTick) {
    see(ROUTER_A, {ROUTER_A}, {{US, 100}, {host(2), 100}});
    stay_alive(20);
    EXPECT_EQ(group->tx_redirect_assign, 1u);
    see(ROUTER_A, {ROUTER_A}, {{US, 100}, {host(2), 300}});
    EXPECT_FALSE(group->state_flags & WCCP_DESG_ELECT_PENDING);
    EXPECT_EQ(group->dsg_key_change, 2u);
    stay_alive(1);
    EXPECT_EQ(group->tx_redirect_assign, 2u);
    stay_alive(9);
    EXPECT_EQ(group->tx_redirect_assign, 2u);
    stay_alive(1);
    EXPECT_EQ(group->tx_redirect_assign, 3u);
}

TEST_F(StateTest, TheLowestAddressAsANumberIsDesignated) {
    const struct {
        be32 own;
        be32 other;
        bool designated;
    } cases[] = {
        {host(2), host(10), true},
        {host(10), host(2), false},
        {to_be32(0x0a000002), to_be32(0x0a000101), true}, // the last octet doesn't lead here
        {to_be32(0x0a000101), to_be32(0x0a000002), false},
        {to_be32(0x0a000001), to_be32(0xc0a80001), true},
        {host(9), host(9), true}, // itself only
    };
    for (const auto &c : cases) {
        group->appliance_ipa = c.own;
        see(ROUTER_A, {ROUTER_A}, {});
        see(ROUTER_A, {ROUTER_A}, {{c.other, 65535}, {c.own, 0}});
        pass_seconds(1);
        EXPECT_EQ(group->designated, c.designated ? 1u : 0u);
        EXPECT_EQ(group->assign_timer.active, c.designated ? 1 : 0);
    }
}

TEST_F(StateTest, EveryReportedRouterMustBeTwoWay) {
    see(ROUTER_A, {ROUTER_A, ROUTER_B}, {{US, 100}}); // B is not heard
    pass_seconds(1);
    EXPECT_EQ(group->designated, 0u);
    see(ROUTER_B, {ROUTER_A, ROUTER_B}, {}); // B doesn't list us
    pass_seconds(1);
    EXPECT_EQ(group->designated, 0u);
    EXPECT_FALSE(group->state_flags & WCCP_DESG_ELECT_PENDING); // no timer tries again
    see(ROUTER_B, {ROUTER_A, ROUTER_B}, {{US, 100}});
    pass_seconds(1);
    EXPECT_EQ(group->designated, 1u);
    EXPECT_EQ(group->pending_acks, 2);
    see(ROUTER_C, {}, {}); // no change of any view
    pass_seconds(1);
    EXPECT_EQ(group->designated, 1u);
    // All that a router listed is gone: nobody to be designated for.
    see(ROUTER_A, {}, {});
    see(ROUTER_B, {}, {});
    pass_seconds(1);
    EXPECT_EQ(group->designated, 0u);
}

TEST_F(StateTest, TheKeyCountsOnUntilTheElectionIsLost) {
    see(ROUTER_A, {ROUTER_A}, {{US, 100}, {host(3), 100}, {host(4), 100}});
    pass_seconds(1);
    EXPECT_EQ(group->dsg_key_change, 1u);
    shared->router(ROUTER_A)->assign_tx_count = 2;
    see(ROUTER_A, {ROUTER_A}, {{US, 100}, {host(4), 100}}); // 3 is down for one computation
    pass_seconds(1);
    EXPECT_EQ(group->dsg_key_change, 2u);
    EXPECT_EQ(group->dsg_appliances[0].assigned + group->dsg_appliances[1].assigned, 256);
    EXPECT_NE(group->dsg_appliances[0].assigned, 128);
    EXPECT_EQ(shared->router(ROUTER_A)->assign_tx_count, 0u);
    EXPECT_TRUE(shared->router(ROUTER_A)->flags & WCCP_RTR_ASSIGN_UNACKED);

    see(ROUTER_A, {ROUTER_A}, {{US, 100}, {host(0), 100}});
    pass_seconds(1);
    EXPECT_EQ(group->designated, 0u);
    EXPECT_EQ(group->pending_acks, 0);
    EXPECT_EQ(group->assign_timer.active, 0);
    EXPECT_FALSE(shared->router(ROUTER_A)->flags & WCCP_RTR_ASSIGN_UNACKED);
    see(ROUTER_A, {ROUTER_A}, {{US, 100}});
    pass_seconds(1);
    EXPECT_EQ(group->dsg_key_change, 1u);
}

TEST_F(StateTest, WithNobodyEligibleThereIsNoTable) {
    see(ROUTER_A, {ROUTER_A}, {{US, 100}});
    see(ROUTER_B, {}, {{host(2), 100}}); // reported by one router each
    pass_seconds(1);
    EXPECT_EQ(group->designated, 1u);
    EXPECT_EQ(group->dsg_key_change, 0u);
    EXPECT_EQ(group->bucket_count, 0u);
    EXPECT_EQ(group->assign_timer.active, 0);
    EXPECT_EQ(wccp_update_designated_redirect_assignment(group, WCCP_ASSIGN_AFTER_WEIGHT_CHANGE), 1);
    group->designated = 0;
    EXPECT_EQ(wccp_update_designated_redirect_assignment(group, WCCP_ASSIGN_AFTER_WEIGHT_CHANGE), 0);
    see(ROUTER_B, {}, {{US, 100}});
    pass_seconds(1);
    EXPECT_EQ(group->dsg_key_change, 1u);
    EXPECT_EQ(group->dsg_active_count, 1u);
}

TEST_F(StateTest, ASilentRouterGoesAfter40To44Seconds) {
    for (uint32_t phase = 0; phase < 5; phase++) {
        see(ROUTER_A, {ROUTER_A}, {{US, 100}});
        uint32_t gone_after = 0;
        while (group->sending_router_count != 0 && gone_after < 60) {
            pass_seconds(1);
            gone_after++;
        }
        const uint32_t sweep = (wccp_g.seconds - 1000) % 5; // sweeps go by the start of the group
        EXPECT_EQ(sweep, 0u);
        EXPECT_EQ(gone_after, phase == 0 ? 40u : 45u - phase);
        EXPECT_TRUE(group->state_flags & WCCP_DESG_ELECT_PENDING); // the election is the next tick's
        EXPECT_EQ(group->designated, 1u);
        EXPECT_EQ(group->raised_alarms, WCCP_ALARM_ADJACENCY);
        pass_seconds(1 + phase);
        EXPECT_EQ(group->designated, 0u);
        group->raised_alarms = 0;
    }
    EXPECT_EQ(group->routers_timed_out, 5u);
}

TEST_F(StateTest, StatesTellTheirRolesEachTime) {
    const auto flags = [this] { return group->state_flags & WCCP_STATE_MASK; };
    group->state_flags |= WCCP_CAPABILITIES_SET;
    wccp_appliance_state_init(group); // it is in INIT
    EXPECT_EQ(state_events.size(), 0u);
    wccp_appliance_state_active(group);
    EXPECT_EQ(flags(), WCCP_STATE_ACTIVE);
    EXPECT_EQ(group->state_time, 1000u);
    wccp_g.seconds = 1010;
    wccp_appliance_state_active(group);
    wccp_g.seconds = 1020;
    wccp_appliance_state_backup(group);
    EXPECT_EQ(flags(), WCCP_STATE_BACKUP);
    wccp_appliance_state_backup(group);
    EXPECT_EQ(group->transitions, 4u);
    wccp_g.seconds = 1030;
    wccp_appliance_state_init(group);
    EXPECT_EQ(flags(), WCCP_STATE_INIT);
    EXPECT_EQ(group->transitions, 4u);
    EXPECT_EQ(group->state_time, 1020u);
    EXPECT_TRUE(group->state_flags & WCCP_CAPABILITIES_SET);
    const state_event active = {1, "51", 0, 237}, backup = {1, "51", 1, 237};
    EXPECT_EQ(state_events, (std::vector<state_event>{active, active, backup, backup, backup}));

    state_events.clear();
    EXPECT_EQ(wccp_set_role_and_send_event(255, WCCP_ROLE_UNKNOWN), 0);
    EXPECT_EQ(wccp_set_role_and_send_event(255, 3), 1);
    EXPECT_EQ(state_events, (std::vector<state_event>{{1, "255", 2, 237}}));

    wccpd_exiting = 1; // the role changes, but nobody is told
    wccp_appliance_state_active(group);
    wccpd_exiting = 0;
    EXPECT_EQ(flags(), WCCP_STATE_ACTIVE);
    EXPECT_EQ(state_events.size(), 1u);
}

// Alarms.

TEST_F(StateTest, ASilentRouterRaisesTheAdjacencyAlarm60SecondsAfterTheStart) {
    const auto raised = [this] { return (group->raised_alarms & WCCP_ALARM_ADJACENCY) != 0; };
    group->ucast_router_count = 2;
    see(ROUTER_A, {ROUTER_A}, {{US, 100}});
    stay_alive(59);
    EXPECT_FALSE(raised());
    stay_alive(1);
    EXPECT_TRUE(raised());
    stay_alive(100); // a quiet group keeps what it has
    EXPECT_TRUE(raised());
    uint32_t cleared_after = 0;
    while (raised() && cleared_after < 100) {
        see(ROUTER_B, {ROUTER_A}, {{US, 100}});
        stay_alive(1);
        cleared_after++;
    }
    EXPECT_EQ(cleared_after, 60u);
}

TEST_F(StateTest, ConnectivityIsHealthyWithEnoughTwoWayAndNoneOneWay) {
    const auto check = [this] {
        group->raised_alarms = 0;
        wccp_alarm_verify_router_connectivity(group);
        return group->raised_alarms == 0;
    };
    EXPECT_TRUE(check()); // nothing expected, nothing there
    group->mcast_configured = 1;
    group->ucast_router_count = 5;
    EXPECT_FALSE(check());
    see(ROUTER_A, {}, {{US, 100}});
    EXPECT_TRUE(check());
    see(ROUTER_B, {}, {{US, 100}});
    EXPECT_TRUE(check());
    see(ROUTER_C, {}, {});
    EXPECT_FALSE(check());
}

TEST_F(StateTest, ALaterReasonLeavesTheCheckWhereItIs) {
    pass_seconds(20);
    wccp_alarm_schedule_verify_router_connectivity_timer(group, 0);
    EXPECT_EQ(group->router_alarm_timer.countdown, 40u);
    wccp_alarm_schedule_verify_router_connectivity_timer(group, 1);
    EXPECT_EQ(group->router_alarm_timer.countdown, 60u);
    EXPECT_EQ(group->alarm_router_sched, 3u);
    pass_seconds(59);
    EXPECT_EQ(group->router_alarm_timer.active, 1);
    pass_seconds(1);
    EXPECT_EQ(group->router_alarm_timer.active, 0);
    wccp_alarm_schedule_verify_router_connectivity_timer(group, 0); // a stopped one starts anew
    EXPECT_EQ(group->router_alarm_timer.countdown, 60u);
    wccp_alarm_schedule_verify_allocation_table_timer(group, 0);
    group->assign_alarm_timer.countdown = 0;
    wccp_alarm_schedule_verify_allocation_table_timer(group, 0);
    EXPECT_EQ(group->assign_alarm_timer.countdown, 60u);
}

TEST_F(StateTest, TheDesignatedComparesWhatItAskedFor) {
    const auto check = [this] {
        wccp_alarms_verify_allocation_table(group);
        return group->raised_alarms == 0;
    };
    see(ROUTER_A, {ROUTER_A}, {{US, 100}, {host(2), 100}, {host(3), 0}});
    see(ROUTER_B, {ROUTER_B}, {{US, 100}, {host(2), 100}, {host(3), 0}});
    pass_seconds(1);
    ASSERT_EQ(group->designated, 1u);
    EXPECT_FALSE(check());
    for (const be32 id : {ROUTER_A, ROUTER_B})
        for (uint32_t i = 0; i < 2; i++)
            shared->router(id)->view_appliances[i].buckets_assigned = 128;
    EXPECT_TRUE(check());
    shared->router(ROUTER_B)->view_appliances[0].buckets_assigned = 127;
    EXPECT_FALSE(check());
    EXPECT_EQ(group->raised_alarms, WCCP_ALARM_ASSIGNMENT);
    shared->router(ROUTER_B)->view_appliances[0].buckets_assigned = 128;
    shared->router(ROUTER_B)->view_appliances[2].weight = 1; // and no buckets
    EXPECT_FALSE(check());
}

TEST_F(StateTest, AlarmsAreToldInTheLogAndFailWithoutASession) {
    log_lines log;
    const auto tells = [&log](const std::vector<std::string> &wanted) {
        const std::string lines = log.take();
        size_t from = 0;
        for (const std::string &line : wanted) {
            from = lines.find(line, from);
            ASSERT_NE(from, std::string::npos) << line << "\n-- among --\n" << lines;
        }
    };
    group->ucast_router_count = 2;
    see(ROUTER_A, {ROUTER_A}, {{US, 100}, {host(2), 7}});
    log.take();
    wccp_alarm_verify_router_connectivity(group);
    tells({"WCCP GRP 51: alarm: verify router connectivity.",
           "WCCP GRP 51: alarm: raising router down alarm. routers configured: 2 connections one-way: 0 "
           "two-way: 1",
           "WCCP GRP 51: alarm: raising adjacency down alarm", "Error code 14001"});
    group->ucast_router_count = 1;
    wccp_alarm_verify_router_connectivity(group);
    tells({"WCCP GRP 51: alarm: clearing router down alarm: routers one-way: 0 two-way: 1 configured: 1.",
           "WCCP GRP 51: alarm: clearing adjacency down alarm"});
    wccp_alarm_verify_router_connectivity(group);
    tells({"WCCP GRP 51: alarm: router verification is ok. configured: 1 one-way: 0 two-way: 1"});
    shared->router(ROUTER_A)->view_appliances[0].buckets_assigned = 9;
    wccp_alarms_verify_allocation_table(group);
    tells({"WCCP GRP 51: alarm: verify assignment table.", "WCCP GRP 51: alarm: verify by non-designator.",
           "WCCP GRP 51: alarm: router 10.0.0.201 is not redirecting to appliance (10.0.0.2 weight 7)",
           "WCCP GRP 51: alarm: raising assignment table mismatch alarm"});
    pass_seconds(1);
    log.take();
    wccp_alarms_verify_allocation_table(group); // designated by now
    tells({"WCCP GRP 51: alarm: verify allocation. appliance 10.0.0.",
           "WCCP GRP 51: alarm: allocation mismatch. appliance 10.0.0."});
    EXPECT_EQ(group->raised_alarms, WCCP_ALARM_ASSIGNMENT);
}

TEST_F(StateTest, AnyOtherLooksForHoles) {
    group->appliance_ipa = host(9);
    const auto check = [this] {
        wccp_alarms_verify_allocation_table(group);
        return group->raised_alarms == 0;
    };
    group->raised_alarms = WCCP_ALARM_ASSIGNMENT;
    EXPECT_TRUE(check()); // no routers at all
    see(ROUTER_A, {}, {});
    EXPECT_FALSE(check());
    see(ROUTER_A, {}, {{host(1), 0}});
    EXPECT_FALSE(check()); // in order, but nobody gets anything
    see(ROUTER_A, {}, {{host(1), 0}, {host(2), 10}});
    EXPECT_FALSE(check());
    shared->router(ROUTER_A)->view_appliances[1].buckets_assigned = 1;
    EXPECT_TRUE(check());
}

TEST_F(StateTest, ClearingStopsTheTimersAndOnlyTouchesGroupsWithAlarms) {
    wccp_alarm_raise_router_down_alarm(group);
    wccp_alarms_verify_allocation_table(group);
    wccp_alarm_schedule_verify_allocation_table_timer(group, 0);
    wccp_alarms_clear_all();
    EXPECT_EQ(group->raised_alarms, 0);
    EXPECT_EQ(group->router_alarm_timer.active, 0);
    EXPECT_EQ(group->assign_alarm_timer.active, 0);
    wccp_alarm_schedule_verify_router_connectivity_timer(group, 0);
    wccp_alarms_clear_all();
    EXPECT_EQ(group->router_alarm_timer.active, 1);
}

} // namespace
