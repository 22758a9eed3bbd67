// When things happen: Here-I-Am, election, Redirect-Assign, time-outs and alarm checks, with ticks called by
// the test; and the state with its role.
#include "engine/wccp_state.h"

#include <map>
#include <sstream>

#include "engine/wccp_alarms.h"
#include "engine/wccp_config.h"
#include "engine/wccp_host.h"
#include "engine/wccp_router_utils.h"
#include "platform/qvcommon.h"
#include "runtime/logging.h"
#include "tests/support/reported_group.h"

namespace {

std::vector<std::string> state_events; // constant, group, role and code of each

} // namespace

// Replaces the platform library's.
extern "C" int qv_state_event_send(uint32_t one, const char *group_id, uint32_t role, const uint8_t *code,
                                   gcl_session *) {
    state_events.push_back(std::to_string(one) + " " + group_id + " " + std::to_string(role) + " " +
                           std::to_string(*code));
    return 14016;
}

namespace {

struct StateTest : testing::Test, all_freed, reported_group {
    StateTest() : reported_group(true) { state_events.clear(); }
    // For so many seconds router A, once it is known, goes on reporting what it does. The seconds, counted
    // from 1, at which `counter` rose.
    std::vector<uint32_t>
    stay_alive(uint32_t seconds,
               uint32_t wccp_service_group::*counter = &wccp_service_group::tx_redirect_assign) {
        std::vector<uint32_t> risen;
        for (uint32_t second = 1; second <= seconds; second++) {
            const uint32_t before = group->*counter;
            pass_seconds(1);
            if (group->sending_router_count != 0)
                router(ROUTER_A)->last_icu_time = wccp_g.seconds;
            if (group->*counter != before)
                risen.push_back(second);
        }
        return risen;
    }
    bool raised(uint16_t alarm) const { return (group->raised_alarms & alarm) != 0; }
};
using seconds_at = std::vector<uint32_t>;

TEST_F(StateTest, HereIAmGoesAtOnceAndThenEveryTenSeconds) {
    EXPECT_EQ(stay_alive(35, &wccp_service_group::tx_here_i_am), (seconds_at{1, 11, 21, 31}));
    group->admin_state = WCCP_ADMIN_DOWN; // no tick for a disabled group
    EXPECT_EQ(stay_alive(20, &wccp_service_group::tx_here_i_am), seconds_at{});
}

TEST_F(StateTest, ASoleApplianceElectsItselfAndAssignsSixteenSecondsAfterTheChange) {
    see(ROUTER_A, {ROUTER_A}, {{US, 100}});
    EXPECT_EQ(group->designated, 0u);
    EXPECT_EQ(stay_alive(1), seconds_at{});
    EXPECT_EQ(group->designated, 1u);
    EXPECT_EQ(group->dsg_key_change, 1u);
    EXPECT_EQ(group->pending_acks, 1);
    EXPECT_EQ(group->dsg_appliances[0].assigned, 256);
    EXPECT_EQ(stay_alive(39), (seconds_at{15, 25, 35}));
    EXPECT_EQ(router(ROUTER_A)->assign_tx_count, 3u);
    EXPECT_EQ(group->dsg_key_change, 1u);
    // A change of a weight is assigned at the next tick.
    see(ROUTER_A, {ROUTER_A}, {{US, 300}});
    EXPECT_FALSE(group->state_flags & WCCP_DESG_ELECT_PENDING);
    EXPECT_EQ(group->dsg_key_change, 2u);
    EXPECT_EQ(stay_alive(15), (seconds_at{1, 11}));
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
        {host(9), host(9), true}, // only itself
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

TEST_F(StateTest, ElectionsFollowTheViews) {
    const be32 A = ROUTER_A, B = ROUTER_B, C = ROUTER_C;
    const struct {
        be32 from;
        std::vector<be32> routers;
        std::vector<uint32_t> appliances; // 10.0.0.x, of weight 100
        const char *elected;              // key, pending acknowledgements, slots of each active appliance
        const char *reasons = nullptr;    // null: not compared
    } steps[] = {
        {A, {A, B}, {1}, "no", "election-blocked 10.0.0.202: no I-See-You|two-way"},
        {B, {A, B}, {}, "no", "election-blocked 10.0.0.202: one-way|two-way"},
        {B, {A, B}, {1, 2}, "1 2 1:256", "appliance-left-out 10.0.0.2: 1|2"},
        {C, {}, {}, "1 2 1:256"}, // no change of any view
        {B,
         {A, B},
         {1, 3},
         "1 0", // no appliance is reported by all
         "appliance-left-out 10.0.0.3: 1|3; appliance-left-out 10.0.0.1: 2|3"},
        {C, {}, {0, 1}, "no"},     // a lower address
        {C, {}, {1}, "1 3 1:256"}, // the key starts again
        {A, {A, B}, {1, 3}, "2 3 1:256"},
        {B, {A, B}, {3, 1, 4}, "3 3 1:256"},
        {A, {A, B}, {4, 3, 1}, "4 3 1:256"},
        {C, {}, {1, 4, 3}, "5 3 1:85 3:85 4:86"},
        {C, {}, {1, 4}, "6 3 1:127 4:129"}, // 3 is down for one computation
        {A, {}, {}, "no"},
    };
    for (const auto &step : steps) {
        SCOPED_TRACE(&step - steps);
        reported_appliances appliances;
        for (const uint32_t each : step.appliances)
            appliances.push_back({host(each), 100});
        see(step.from, step.routers, appliances);
        const bool election = (group->state_flags & WCCP_DESG_ELECT_PENDING) != 0;
        router(A)->assign_tx_count = 2;
        pass_seconds(1);
        EXPECT_FALSE(group->state_flags & WCCP_DESG_ELECT_PENDING); // it is not repeated
        EXPECT_EQ(router(A)->assign_tx_count, election ? 0u : 2u);
        EXPECT_EQ((router(A)->flags & WCCP_RTR_ASSIGN_UNACKED) != 0, group->pending_acks != 0);
        EXPECT_EQ(group->assign_timer.active, group->pending_acks != 0);
        std::map<uint32_t, uint32_t> shares;
        for (uint32_t i = 0; i < group->dsg_active_count; i++)
            shares[group->dsg_appliances[i].ipa.bytes[3]] = group->dsg_appliances[i].assigned;
        std::string elected =
            std::to_string(group->dsg_key_change) + " " + std::to_string(group->pending_acks);
        for (const auto &[octet, assigned] : shares)
            elected += " " + std::to_string(octet) + ":" + std::to_string(assigned);
        EXPECT_EQ(group->designated ? elected : "no", step.elected);
        const std::string reasons = take_reasons(group);
        EXPECT_EQ(reasons, step.reasons ? step.reasons : reasons);
    }
    EXPECT_EQ(wccp_update_designated_redirect_assignment(group, WCCP_ASSIGN_AFTER_WEIGHT_CHANGE), 0);
    EXPECT_EQ(group->assign_timer.active, 0);
}

// Each computation could warn of every appliance that is not listed by all routers.
TEST_F(StateTest, AnApplianceThatIsLeftOutIsLoggedOnce) {
    log_lines log;
    lc_log_set_daemon_log_level(LC_LOG_WARNING);
    const be32 A = ROUTER_A, B = ROUTER_B;
    const struct {
        be32 from;
        reported_appliances appliances;
        uint32_t seconds; // that pass after the report
        std::string logged;
    } steps[] = {
        {A, {{US, 1}, {host(3), 1}}, 0, ""},
        {B, {{US, 1}, {host(4), 1}}, 1, "4 3 "}, // the election
        {A, {{US, 2}, {host(3), 2}}, 0, ""},     // two computations
        {A, {{US, 3}, {host(3), 3}}, 1, ""},     // in another second
        // 5 and 6 are new.
        {A, {{host(5), 1}, {US, 4}, {host(6), 1}, {host(3), 4}}, 0, "3 5 4 6 "},
        {B, {{US, 5}, {host(3), 5}, {host(4), 5}}, 0, ""},     // 3 is listed by all from now on
        {A, {{US, 6}, {host(3), 6}, {host(6), 1}}, 1, "4 6 "}, // without 5
        {B, {{US, 7}, {host(4), 5}}, 1, "3 4 6 "},
        {A, {{US, 8}, {host(3), 6}, {host(6), 1}}, 59, ""},
        {A, {{US, 9}, {host(3), 6}, {host(6), 1}}, 1, ""},
        {A, {{US, 1}, {host(3), 6}, {host(6), 1}}, 1, "3 4 6 "},
    };
    for (const auto &step : steps) {
        see(step.from, {A, B}, step.appliances);
        for (uint32_t second = 0; second < step.seconds; second++) {
            router(A)->last_icu_time = router(B)->last_icu_time = wccp_g.seconds;
            pass_seconds(1);
        }
        std::istringstream lines(log.take());
        std::string logged;
        for (std::string line; std::getline(lines, line);)
            if (const size_t at = line.find("NO redirect. appliance (ipa  10.0.0."); at != std::string::npos)
                logged += line.substr(at + 36, 1) + " ";
        EXPECT_EQ(logged, step.logged) << "step " << &step - steps;
    }
    EXPECT_EQ(group->designated, 1u);
}

TEST_F(StateTest, ARouterTimesOutAfter40To44Seconds) {
    for (uint32_t phase = 0; phase < 5; phase++) { // the sweep depends on the start of the group
        see(ROUTER_A, {ROUTER_A}, {{US, 100}});
        const uint32_t expected = phase == 0 ? 40 : 45 - phase;
        pass_seconds(expected - 1);
        EXPECT_EQ(group->sending_router_count, 1u);
        pass_seconds(1);
        EXPECT_EQ(group->sending_router_count, 0u);
        EXPECT_TRUE(group->state_flags & WCCP_DESG_ELECT_PENDING); // in the next tick
        EXPECT_EQ(group->designated, 1u);
        EXPECT_EQ(group->raised_alarms, WCCP_ALARM_ADJACENCY);
        pass_seconds(1 + phase);
        EXPECT_EQ(group->designated, 0u);
        group->raised_alarms = 0;
    }
    EXPECT_EQ(group->routers_timed_out, 5u);
}

TEST_F(StateTest, EveryEntryIntoAStatePublishesItsRole) {
    const struct {
        int (*enter)(wccp_service_group *);
        uint32_t state, transitions, state_time;
    } steps[] = {
        {wccp_appliance_state_init, WCCP_STATE_INIT, 0, 0}, // already in INIT
        {wccp_appliance_state_active, WCCP_STATE_ACTIVE, 1, 1010},
        {wccp_appliance_state_active, WCCP_STATE_ACTIVE, 2, 1020},
        {wccp_appliance_state_backup, WCCP_STATE_BACKUP, 3, 1030},
        {wccp_appliance_state_backup, WCCP_STATE_BACKUP, 4, 1040},
        {wccp_appliance_state_init, WCCP_STATE_INIT, 4, 1040},
    };
    group->state_flags |= WCCP_CAPABILITIES_SET;
    group->state_time = 0;
    wccp_g.seconds = 1000;
    for (const auto &step : steps) {
        step.enter(group);
        EXPECT_EQ(group->state_flags, step.state | WCCP_CAPABILITIES_SET);
        EXPECT_EQ(group->transitions, step.transitions);
        EXPECT_EQ(group->state_time, step.state_time);
        wccp_g.seconds += 10;
    }
    wccpd_exiting = 1; // the role changes, but no event is sent
    wccp_appliance_state_active(group);
    wccpd_exiting = 0;
    EXPECT_TRUE(group->state_flags & WCCP_STATE_ACTIVE);
    EXPECT_EQ(wccp_set_role_and_send_event(255, WCCP_ROLE_UNKNOWN), 0);
    EXPECT_EQ(wccp_set_role_and_send_event(255, 3), 1);
    const std::string active = "1 51 0 237", backup = "1 51 1 237";
    EXPECT_EQ(state_events,
              (std::vector{active, active, backup, backup, backup, std::string("1 255 2 237")}));
}

// --- Alarms

TEST_F(StateTest, AMissingRouterRaisesTheAdjacencyAlarm60SecondsAfterTheStart) {
    group->ucast_router_count = 2;
    see(ROUTER_A, {ROUTER_A}, {{US, 100}});
    stay_alive(59);
    EXPECT_FALSE(raised(WCCP_ALARM_ADJACENCY));
    stay_alive(1);
    EXPECT_TRUE(raised(WCCP_ALARM_ADJACENCY));
    stay_alive(100); // without events the alarm stays
    EXPECT_TRUE(raised(WCCP_ALARM_ADJACENCY));
    uint32_t cleared_after = 0;
    while (raised(WCCP_ALARM_ADJACENCY) && cleared_after < 100) {
        see(ROUTER_B, {ROUTER_A}, {{US, 100}});
        stay_alive(1);
        cleared_after++;
    }
    EXPECT_EQ(cleared_after, 60u);
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
    wccp_alarm_schedule_verify_router_connectivity_timer(group, 0); // a stopped timer starts again
    EXPECT_EQ(group->router_alarm_timer.countdown, 60u);
    group->assign_alarm_timer = {.active = 1, .mode = 2, .remaining = 1, .period = 60, .countdown = 0};
    wccp_alarm_schedule_verify_allocation_table_timer(group, 0);
    EXPECT_EQ(group->assign_alarm_timer.countdown, 60u);
    // Clearing stops the timers, but only of a group with alarms.
    wccp_alarms_clear_all();
    EXPECT_EQ(group->router_alarm_timer.active, 1);
    wccp_alarm_raise_router_down_alarm(group);
    wccp_alarms_verify_allocation_table(group);
    group->raised_alarms = WCCP_ALARM_ADJACENCY | WCCP_ALARM_ASSIGNMENT;
    wccp_alarms_clear_all();
    EXPECT_EQ(group->raised_alarms, 0);
    EXPECT_EQ(group->router_alarm_timer.active + group->assign_alarm_timer.active, 0);
}

// The checks: the log lines after "alarm: ", and "event" when a message was sent, which fails without a
// session.
struct CheckTest : StateTest {
    std::string said(int (*check)(wccp_service_group *)) {
        log.take();
        EXPECT_EQ(check(group), 0);
        std::istringstream lines(log.take());
        std::string found;
        for (std::string line; std::getline(lines, line);) {
            const size_t at = line.find("WCCP GRP 51: alarm: ");
            found += at != std::string::npos                       ? line.substr(at + 20) + "\n"
                     : line.ends_with("Error code 14001 returned") ? "event\n"
                                                                   : "";
        }
        return found;
    }
    std::string connectivity() { return said(wccp_alarm_verify_router_connectivity); }
    std::string allocation() { return said(wccp_alarms_verify_allocation_table); }
    log_lines log;
};

TEST_F(CheckTest, ConnectivityIsHealthyWithEnoughTwoWayAndNoneOneWay) {
    const std::string begin = "verify router connectivity.\n",
                      raise = "raising adjacency down alarm\nevent\n",
                      clear = "clearing adjacency down alarm\nevent\n";
    EXPECT_EQ(connectivity(), begin + "router verification is ok. configured: 0 one-way: 0 two-way: 0\n");
    group->ucast_router_count = 2;
    EXPECT_EQ(connectivity(), begin +
                                  "raising router down alarm. routers configured: 2 connections one-way: 0 "
                                  "two-way: 0\n" +
                                  raise);
    see(ROUTER_A, {}, {{US, 1}});
    EXPECT_EQ(connectivity(), begin); // already active
    group->mcast_configured = 1;      // one router is then enough
    EXPECT_EQ(connectivity(),
              begin + "clearing router down alarm: routers one-way: 0 two-way: 1 configured: 1.\n" + clear);
    see(ROUTER_B, {}, {{US, 1}});
    EXPECT_EQ(connectivity(), begin + "router verification is ok. configured: 1 one-way: 0 two-way: 2\n");
    router(ROUTER_C);
    EXPECT_EQ(connectivity(), begin +
                                  "raising router down alarm. routers configured: 1 connections one-way: 1 "
                                  "two-way: 2\n" +
                                  raise);
}

TEST_F(CheckTest, TheAssignmentIsComparedOrSearchedForGaps) {
    const std::string begin = "verify assignment table.\n", other = begin + "verify by non-designator.\n",
                      raise = "raising assignment table mismatch alarm\nevent\n",
                      clear = "clearing assignment table alarm\nevent\n",
                      nobody = "router 10.0.0.201 is not redirecting to ANY appliance.\n";
    group->raised_alarms = WCCP_ALARM_ASSIGNMENT;
    EXPECT_EQ(allocation(), other + clear); // no routers
    see(ROUTER_A, {}, {});
    EXPECT_EQ(allocation(), other + nobody + raise);
    see(ROUTER_A, {}, {{US, 0}});
    EXPECT_EQ(allocation(), other + nobody); // in order, but redirects to none
    see(ROUTER_A, {}, {{US, 0}, {host(2), 7}});
    EXPECT_EQ(allocation(),
              other + "router 10.0.0.201 is not redirecting to appliance (10.0.0.2 weight 7)\n");
    router(ROUTER_A)->view_appliances[1].buckets_assigned = 1;
    EXPECT_EQ(allocation(), other + clear);

    for (const be32 id : {ROUTER_A, ROUTER_B})
        see(id, {id}, {{US, 100}, {host(2), 100}, {host(3), 0}});
    pass_seconds(1);
    ASSERT_EQ(group->designated, 1u);
    const auto compared = [](const std::string &appliance, const std::string &router, uint32_t buckets) {
        return "allocation. appliance 10.0.0." + appliance + " buckets dsg: 128 router 10.0.0." + router +
               " " + std::to_string(buckets) + "\n";
    };
    const auto mismatch = [&](const char *appliance, const char *router, uint32_t buckets) {
        const std::string look = compared(appliance, router, buckets);
        return "verify " + look + std::string(look).replace(10, 0, " mismatch");
    };
    const std::string first = begin + "verify " + compared("2", "202", 128) + "verify " +
                              compared("2", "201", 128) + "verify " + compared("1", "202", 128);
    take_reasons(group);
    EXPECT_EQ(allocation(), begin + mismatch("2", "202", 0) + raise);
    EXPECT_EQ(take_reasons(group), "assignment-differs 10.0.0.202: 0 buckets for 10.0.0.2|128");
    for (const be32 id : {ROUTER_A, ROUTER_B})
        for (uint32_t i = 0; i < 2; i++)
            router(id)->view_appliances[i].buckets_assigned = 128;
    EXPECT_EQ(allocation(), first + "verify " + compared("1", "201", 128) + clear);
    router(ROUTER_A)->view_appliances[0].buckets_assigned = 127;
    EXPECT_EQ(allocation(), first + mismatch("1", "201", 127) + raise);
    wccp_g.seconds++;
    router(ROUTER_A)->view_appliances[0].buckets_assigned = 128;
    router(ROUTER_A)->view_appliances[2].weight = 1; // without buckets
    EXPECT_EQ(allocation(),
              first + "verify " + compared("1", "201", 128) +
                  "allocation mismatch. appliance 10.0.0.3 weight : 1 router 10.0.0.201 buckets : 0\n");
    EXPECT_EQ(take_reasons(group), "assignment-differs 10.0.0.201: 0 buckets for 10.0.0.3|some x2");
}

} // namespace
