// When things happen: Here-I-Am, election, Redirect-Assign, time-outs and alarm checks, with ticks called by
// the test; and the state with its role.
#include "engine/wccp_state.h"

#include "engine/wccp_alarms.h"
#include "engine/wccp_host.h"
#include "engine/wccp_router_utils.h"
#include "platform/qvcommon.h"
#include "runtime/logging.h"
#include "tests/support/reported_group.h"

static std::vector<std::string> state_events; // constant, group, role and code of each

// Replaces the platform library's.
extern "C" int qv_state_event_send(uint32_t one, const char *group_id, uint32_t role, const uint8_t *code,
                                   gcl_session *) {
    std::ostringstream text;
    text << one << " " << group_id << " " << role << " " << +*code;
    state_events.push_back(text.str());
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
    EXPECT_EQ((seconds_at{group->designated, group->dsg_key_change, group->pending_acks,
                          group->dsg_appliances[0].assigned}),
              (seconds_at{1, 1, 1, 256}));
    EXPECT_EQ(stay_alive(39), (seconds_at{15, 25, 35}));
    EXPECT_TRUE(router(ROUTER_A)->assign_tx_count == 3 && group->dsg_key_change == 1);
    // A change of a weight is assigned at the next tick.
    see(ROUTER_A, {ROUTER_A}, {{US, 300}});
    EXPECT_TRUE(!(group->state_flags & WCCP_DESG_ELECT_PENDING) && group->dsg_key_change == 2);
    EXPECT_EQ(stay_alive(15), (seconds_at{1, 11}));
}

TEST_F(StateTest, TheLowestAddressAsANumberIsDesignated) {
    const std::tuple<be32, be32, uint32_t> cases[] = {
        {host(2), host(10), 1},    {host(10), host(2), 0},
        {host(2), host(0x101), 1}, // the last octet doesn't lead here
        {host(0x101), host(2), 0}, {host(1), to_be32(0xc0a80001), 1},
        {host(9), host(9), 1}, // only itself
    };
    for (const auto &[own, other, designated] : cases) {
        group->appliance_ipa = own;
        see(ROUTER_A, {ROUTER_A}, {});
        see(ROUTER_A, {ROUTER_A}, {{other, 65535}, {own, 0}});
        pass_seconds(1);
        EXPECT_TRUE(group->designated == designated && group->assign_timer.active == designated);
    }
}

TEST_F(StateTest, ElectionsFollowTheViews) {
    const be32 A = ROUTER_A, B = ROUTER_B, C = ROUTER_C;
    const struct {
        be32 from;
        std::vector<be32> routers;
        std::vector<uint32_t> appliances; // 10.0.0.x, of weight 100
        const char *elected;              // key, pending acknowledgements, slots of each active appliance
        const char *reasons = "-";        // not compared
    } steps[] = {
        {A, {A, B}, {1}, "no", "election-blocked 10.0.0.202: no I-See-You|two-way"},
        {B, {A, B}, {}, "no", "election-blocked 10.0.0.202: one-way|two-way"},
        {B, {A, B}, {1, 2}, "1 2 1:256", "appliance-left-out 10.0.0.2: 1|2"},
        {C, {}, {}, "1 2 1:256"}, // no change of any view
        // No appliance is reported by all.
        {B, {A, B}, {1, 3}, "1 0", "appliance-left-out 10.0.0.3: 1|3; appliance-left-out 10.0.0.1: 2|3"},
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
        const bool pending = group->pending_acks != 0;
        EXPECT_EQ(std::tuple(router(A)->assign_tx_count, (router(A)->flags & WCCP_RTR_ASSIGN_UNACKED) != 0,
                             group->assign_timer.active),
                  std::tuple(election ? 0 : 2, pending, pending));
        std::map<uint32_t, uint32_t> shares;
        for (uint32_t i = 0; i < group->dsg_active_count; i++)
            shares[group->dsg_appliances[i].ipa.bytes[3]] = group->dsg_appliances[i].assigned;
        std::ostringstream elected;
        elected << group->dsg_key_change << " " << +group->pending_acks;
        for (const auto &[octet, assigned] : shares)
            elected << " " << octet << ":" << assigned;
        EXPECT_EQ(group->designated ? elected.str() : "no", step.elected);
        const std::string reasons = take_reasons(group);
        EXPECT_TRUE(step.reasons == std::string("-") || reasons == step.reasons) << reasons;
    }
    EXPECT_EQ(wccp_update_designated_redirect_assignment(group, WCCP_ASSIGN_AFTER_WEIGHT_CHANGE), 0);
    EXPECT_EQ(group->assign_timer.active, 0);
}

// Each computation could warn of every appliance that is not listed by all routers.
TEST_F(StateTest, AnApplianceThatIsLeftOutIsLoggedOnce) {
    log_lines log;
    lc_log_set_daemon_log_level(LC_LOG_WARNING);
    const be32 A = ROUTER_A, B = ROUTER_B;
    // Report, seconds that pass after it, and the appliances that are logged.
    const std::tuple<be32, reported_appliances, uint32_t, std::string> steps[] = {
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
    for (const auto &[from, appliances, seconds, wanted] : steps) {
        see(from, {A, B}, appliances);
        for (uint32_t second = 0; second < seconds; second++) {
            router(A)->last_icu_time = router(B)->last_icu_time = wccp_g.seconds;
            pass_seconds(1);
        }
        std::istringstream lines(log.take());
        std::string logged;
        for (std::string line; std::getline(lines, line);)
            if (const size_t at = line.find("NO redirect. appliance (ipa  10.0.0."); at != std::string::npos)
                logged += line.substr(at + 36, 1) + " ";
        EXPECT_EQ(logged, wanted);
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
        EXPECT_TRUE(group->state_flags & WCCP_DESG_ELECT_PENDING); // in the next tick
        EXPECT_EQ(std::tuple(group->sending_router_count, group->designated, group->raised_alarms),
                  std::tuple(0, 1, WCCP_ALARM_ADJACENCY));
        pass_seconds(1 + phase);
        EXPECT_EQ(group->designated, 0u);
        group->raised_alarms = 0;
    }
    EXPECT_EQ(group->routers_timed_out, 5u);
}

TEST_F(StateTest, EveryEntryIntoAStatePublishesItsRole) {
    // Entry; the state afterwards, transitions, and time of the last one.
    const std::tuple<int (*)(wccp_service_group *), uint32_t, uint32_t, uint32_t> steps[] = {
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
    for (const auto &[enter, state, transitions, state_time] : steps) {
        enter(group);
        EXPECT_EQ(std::tuple(group->state_flags, group->transitions, group->state_time),
                  std::tuple(state | WCCP_CAPABILITIES_SET, transitions, state_time));
        wccp_g.seconds += 10;
    }
    wccpd_exiting = 1; // the role changes, but no event is sent
    wccp_appliance_state_active(group);
    wccpd_exiting = 0;
    EXPECT_TRUE(group->state_flags & WCCP_STATE_ACTIVE);
    EXPECT_EQ(wccp_set_role_and_send_event(255, WCCP_ROLE_UNKNOWN), 0);
    EXPECT_EQ(wccp_set_role_and_send_event(255, 3), 1);
    const std::string active = "1 51 0 237", backup = "1 51 1 237", other = "1 255 2 237";
    EXPECT_EQ(state_events, (std::vector{active, active, backup, backup, backup, other}));
}

// --- Alarms

TEST_F(StateTest, AMissingRouterRaisesTheAdjacencyAlarm60SecondsAfterTheStart) {
    group->ucast_router_count = 2;
    see(ROUTER_A, {ROUTER_A}, {{US, 100}});
    for (const uint32_t seconds : {59u, 1u, 100u}) { // without events the alarm stays
        stay_alive(seconds);
        EXPECT_EQ(group->raised_alarms & WCCP_ALARM_ADJACENCY, seconds == 59 ? 0 : 1);
    }
    uint32_t cleared_after = 0;
    for (; group->raised_alarms & WCCP_ALARM_ADJACENCY && cleared_after < 100; cleared_after++) {
        see(ROUTER_B, {ROUTER_A}, {{US, 100}});
        stay_alive(1);
    }
    EXPECT_EQ(cleared_after, 60u);
}

TEST_F(StateTest, ALaterReasonLeavesTheCheckWhereItIs) {
    pass_seconds(20);
    for (const int reason : {0, 1}) {
        wccp_alarm_schedule_verify_router_connectivity_timer(group, reason);
        EXPECT_EQ(group->router_alarm_timer.countdown, reason ? 60u : 40u);
    }
    EXPECT_EQ(group->alarm_router_sched, 3u);
    for (const uint32_t seconds : {59u, 1u}) {
        pass_seconds(seconds);
        EXPECT_EQ(group->router_alarm_timer.active, seconds == 59);
    }
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
    EXPECT_EQ(group->raised_alarms + group->router_alarm_timer.active + group->assign_alarm_timer.active, 0);
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
    const auto down = [&](const std::string &state) {
        return begin + "raising router down alarm. routers " + state + "\n" + raise;
    };
    EXPECT_EQ(connectivity(), begin + "router verification is ok. configured: 0 one-way: 0 two-way: 0\n");
    group->ucast_router_count = 2;
    EXPECT_EQ(connectivity(), down("configured: 2 connections one-way: 0 two-way: 0"));
    see(ROUTER_A, {}, {{US, 1}});
    EXPECT_EQ(connectivity(), begin); // already active
    group->mcast_configured = 1;      // one router is then enough
    EXPECT_EQ(connectivity(),
              begin + "clearing router down alarm: routers one-way: 0 two-way: 1 configured: 1.\n" + clear);
    see(ROUTER_B, {}, {{US, 1}});
    EXPECT_EQ(connectivity(), begin + "router verification is ok. configured: 1 one-way: 0 two-way: 2\n");
    router(ROUTER_C);
    EXPECT_EQ(connectivity(), down("configured: 1 connections one-way: 1 two-way: 2"));
}

TEST_F(CheckTest, TheAssignmentIsComparedOrSearchedForGaps) {
    const std::string begin = "verify assignment table.\n", other = begin + "verify by non-designator.\n",
                      raise = "raising assignment table mismatch alarm\nevent\n",
                      clear = "clearing assignment table alarm\nevent\n",
                      idle = other + "router 10.0.0.201 is not redirecting to ";
    group->raised_alarms = WCCP_ALARM_ASSIGNMENT;
    EXPECT_EQ(allocation(), other + clear); // no routers
    see(ROUTER_A, {}, {});
    EXPECT_EQ(allocation(), idle + "ANY appliance.\n" + raise);
    see(ROUTER_A, {}, {{US, 0}});
    EXPECT_EQ(allocation(), idle + "ANY appliance.\n"); // in order, but redirects to none
    see(ROUTER_A, {}, {{US, 0}, {host(2), 7}});
    EXPECT_EQ(allocation(), idle + "appliance (10.0.0.2 weight 7)\n");
    router(ROUTER_A)->view_appliances[1].buckets_assigned = 1;
    EXPECT_EQ(allocation(), other + clear);

    for (const be32 id : {ROUTER_A, ROUTER_B})
        see(id, {id}, {{US, 100}, {host(2), 100}, {host(3), 0}});
    pass_seconds(1);
    ASSERT_EQ(group->designated, 1u);
    const auto compared = [](const std::string &appliance, const std::string &router, uint32_t buckets) {
        return "verify allocation. appliance 10.0.0." + appliance + " buckets dsg: 128 router 10.0.0." +
               router + " " + std::to_string(buckets) + "\n";
    };
    const auto mismatch = [&](const char *appliance, const char *router, uint32_t buckets) {
        const std::string look = compared(appliance, router, buckets);
        return look + look.substr(7).insert(10, " mismatch");
    };
    const std::string first =
        begin + compared("2", "202", 128) + compared("2", "201", 128) + compared("1", "202", 128);
    take_reasons(group);
    EXPECT_EQ(allocation(), begin + mismatch("2", "202", 0) + raise);
    EXPECT_EQ(take_reasons(group), "assignment-differs 10.0.0.202: 0 buckets for 10.0.0.2|128");
    for (const be32 id : {ROUTER_A, ROUTER_B})
        for (uint32_t i = 0; i < 2; i++)
            router(id)->view_appliances[i].buckets_assigned = 128;
    EXPECT_EQ(allocation(), first + compared("1", "201", 128) + clear);
    router(ROUTER_A)->view_appliances[0].buckets_assigned = 127;
    EXPECT_EQ(allocation(), first + mismatch("1", "201", 127) + raise);
    wccp_g.seconds++;
    router(ROUTER_A)->view_appliances[0].buckets_assigned = 128;
    router(ROUTER_A)->view_appliances[2].weight = 1; // without buckets
    EXPECT_EQ(allocation(),
              first + compared("1", "201", 128) +
                  "allocation mismatch. appliance 10.0.0.3 weight : 1 router 10.0.0.201 buckets : 0\n");
    EXPECT_EQ(take_reasons(group), "assignment-differs 10.0.0.201: 0 buckets for 10.0.0.3|some x2");
}

} // namespace
