// Reports of the daemons to mgmtd: processes, alarms, roles, and groups that have left their routers for a
// time.
#include <gtest/gtest.h>

#include "tests/support/mgmtd_fixture.h"

namespace {

// A process has several sessions. Another process ID is a restart, but the late end of its predecessor is
// not. 3 restarts in 5 minutes raise an alarm, which ends 5 minutes after the last one.
TEST_F(Mgmtd, ADaemonThatRestartsInALoopRaisesAnAlarm) {
    const auto alarm = [&](const char *process) {
        return value(NODE_ALARMS_RAISED "/196641/" + std::string(process));
    };
    const auto restart = [&](const char *session, int64_t after_ms) {
        now += after_ms;
        close(1);
        open(1, session);
    };
    const auto process = [&] {
        const std::string root = NODE_PROCESSES "/wccpd";
        return value(root) + " " + value(root + "/pid") + " " + value(root + "/restarts");
    };
    follow(3, {EVENT_RAISE_ALARM, EVENT_CLEAR_ALARM});
    close(2);
    EXPECT_EQ(process(), "running 7 0");
    open(6, "wccpd-8");
    close(1);
    EXPECT_EQ(process(), "running 8 1");
    close(6);
    open(7, "wccpdx-1");
    open(8, "tunneld-x");
    EXPECT_EQ(process() + std::to_string(walk(NODE_PROCESSES).size()), "gone 8 13");
    restart("wccpd-9", RESTARTS_WITHIN_MS);
    restart("wccpd-10", 1000);
    EXPECT_EQ(alarm("wccpd"), "") << "3 times in more than 5 minutes";
    restart("wccpd-11", 1000);
    EXPECT_EQ(alarm("wccpd") + "; " + alarm("wccpd/name") + " " + alarm("wccpd/reporter"),
              "restarted 3 times in 2 s; restart-loop mgmtd");
    restart("wccpd-12", 1000);
    EXPECT_EQ(alarm("wccpd"), "restarted 4 times in 3 s");
    EXPECT_EQ(server_tick(&daemon), now + RESTARTS_WITHIN_MS);
    close(1);
    now += RESTARTS_WITHIN_MS;
    EXPECT_EQ(server_tick(&daemon), -1) << "it does not run";
    open(1, "wccpd-13");
    EXPECT_EQ(server_tick(&daemon), now + RESTARTS_WITHIN_MS);
    EXPECT_EQ(told[3], strings{EVENT_RAISE_ALARM});
    (void)tick(RESTARTS_WITHIN_MS);
    EXPECT_EQ(told[3], (strings{EVENT_RAISE_ALARM, EVENT_CLEAR_ALARM}));
    EXPECT_EQ(alarm("wccpd"), "");

    // Under a supervisor only its reports count.
    daemon.supervises = true;
    for (const char *session : {"wccpd-14", "wccpd-15", "wccpd-16"})
        restart(session, 1000);
    EXPECT_EQ(alarm("wccpd"), "");
}

TEST_F(Mgmtd, ReportsLastUntilTheirSessionEndsAndAreBounded) {
    const auto raise = [&](uint32_t peer_id, const std::string &source, const std::string &text) {
        (void)report(peer_id, EVENT_RAISE_ALARM,
                     {{"alarm_type", {bn_type_str, "196638"}},
                      {"param_3", {bn_type_str, source}},
                      {"comment", {bn_type_str, text}}});
    };
    follow(3, {EVENT_RAISE_ALARM, EVENT_CLEAR_ALARM, EVENT_ROLE_CHANGE});
    raise(2, "eth0:grp:51", std::string(5000, 'x'));
    ASSERT_EQ(sent.size(), 2u);
    EXPECT_EQ(sent[0].peer, 3u) << "passed on";
    EXPECT_EQ(sent[1].mtype, bn_msg_event_ack);
    raise(2, "eth0:grp:51", "again");
    // An invalid number does not break a walk.
    (void)report(2, EVENT_ROLE_CHANGE, {{"role", {bn_type_uint32, "1"}}, {"code", {bn_type_str, "many"}}});
    EXPECT_EQ(walk(NODE_ALARM_STATE).size(), 8u) << "three of them about the process";
    EXPECT_EQ(value(NODE_ROLES "/51") + value(NODE_ROLES "/51/code"), "BACKUP0");
    clear();
    close(2);
    std::string forgotten; // events that watchers get
    for (const sent_message &one : sent)
        for (const event_field &field : fields_of(one.request))
            forgotten += field.name + "=" + field.value.text + "\n";
    EXPECT_TRUE(contains(forgotten, "param_3=eth0:grp:51\n", "role=2\n", "group=51\n"));
    EXPECT_EQ(sent.size(), 2u);
    EXPECT_EQ(walk(NODE_ALARMS_RAISED), strings{});
    for (size_t i = 0; i < ALARMS_MAX + 9; i++)
        raise(3, std::to_string(i), std::string(5000, 'x'));
    EXPECT_EQ(daemon.alarm_owners.size(), ALARMS_MAX);
    size_t kept = 0;
    for (const auto &[name, each] : daemon.state)
        kept += each.text.size();
    EXPECT_LT(kept, ALARMS_MAX * 1024);
}

// --- Groups that are out of their routers for a time

struct OutOfRouters : Mgmtd {
    const std::string admin = GROUP + "/admin", weight = GROUP + "/weight";
    const std::string goes = "51/admin=up>down", comes = "51/admin=down>up";

    void SetUp() override {
        Mgmtd::SetUp();
        ASSERT_EQ(set("+interface=eth0 +router/1/ipaddr=10.0.0.1 +weight=7 +" NODE_INTERCEPT_CONFIG
                      "/51/ports=80 +" NODE_INTERCEPT_CONFIG "/51/to=3128"),
                  0u)
            << message();
    }
    std::string leave(uint32_t peer_id) {
        return report(peer_id, EVENT_GROUP_LEAVE, {{"reason", {bn_type_str, "proxy down: status 503"}}});
    }
    std::string find_proxy(uint32_t peer_id, const char *up) {
        return report(peer_id, EVENT_PROXY_CHANGE, {{"up", {bn_type_bool, up}}});
    }
    // The changes that wccpd gets after a commit.
    std::string changes_of(const std::string &steps) {
        EXPECT_EQ(set(steps), 0u) << message();
        return changes();
    }
};

TEST_F(OutOfRouters, TheGroupIsDownForWccpdAlone) {
    const std::string left = NODE_LEFT_GROUPS "/51";
    const auto seen = [&] { return value(admin, 1) + " " + value(admin); }; // as seen by wccpd and others
    open(8, "mgmtctl-1");
    follow(8, {EVENT_GROUP_LEAVE, EVENT_GROUP_JOIN});
    follow(3, {EVENT_CONFIG_CHANGE});
    const std::string saved = content();
    EXPECT_EQ(leave(3), "") << "only tunneld may report this";
    open(5, "tunneld-9");
    EXPECT_EQ(leave(5), goes);
    EXPECT_EQ(events(3).size(), 0u);
    EXPECT_EQ(seen(), "down up");
    EXPECT_EQ(content(), saved);
    EXPECT_EQ(value(left), "proxy down: status 503");
    EXPECT_EQ(leave(5), "") << "it knows already";
    // Configuring the group meanwhile does not bring it up.
    for (const std::string word : {"down", "up"}) {
        EXPECT_EQ(changes_of("admin=" + word), "");
        EXPECT_EQ(events(3).size(), 1u);
        EXPECT_EQ(seen(), "down " + word);
    }
    EXPECT_TRUE(contains(changes_of("priority=7"), "51/admin=->down")) << "it is created again in wccpd";
    EXPECT_EQ(report(5, EVENT_GROUP_JOIN), comes);
    EXPECT_EQ(seen(), "up up");
    EXPECT_EQ(report(5, EVENT_GROUP_JOIN), "");

    // tunneld ends: for a time another one may take over.
    EXPECT_EQ(leave(5), goes);
    close(5);
    EXPECT_EQ(tick(LEFT_KEEP_MS - 1), "");
    open(6, "tunneld-10");
    EXPECT_EQ(tick(LEFT_KEEP_MS) + find_proxy(6, "false"), "");
    EXPECT_EQ(find_proxy(6, "true"), comes);
    EXPECT_EQ(leave(6), goes);
    close(6);
    EXPECT_EQ(server_tick(&daemon), now + LEFT_KEEP_MS);
    EXPECT_EQ(tick(LEFT_KEEP_MS), comes);
    EXPECT_EQ(value(left), "");
    const std::string leaves = EVENT_GROUP_LEAVE, joins = EVENT_GROUP_JOIN;
    EXPECT_EQ(told[8], (strings{leaves, joins, leaves, joins, leaves, joins})) << "each change once";

    // The state ends with the group, and is not restored with it.
    open(7, "tunneld-11");
    EXPECT_EQ(leave(7), goes);
    EXPECT_EQ(set("-51"), 0u);
    EXPECT_TRUE(daemon.left.empty());
    EXPECT_EQ(leave(7), "");
    EXPECT_TRUE(contains(changes_of("+interface=eth0"), "51/admin=->up"));
}

TEST_F(OutOfRouters, ADrainedGroupAnnouncesWeightZeroAndLeavesOnceItIsEmpty) {
    const std::string drain = NODE_DRAINS "/51";
    const auto slow_down = [&](const char *percent) {
        return report(5, EVENT_GROUP_WEIGHT, {{"percent", {bn_type_uint32, percent}}});
    };
    const auto count = [&](const char *flows, const char *empty) {
        return report(5, EVENT_DRAIN_PROGRESS,
                      {{"flows", {bn_type_uint32, flows}}, {"empty", {bn_type_bool, empty}}});
    };
    const auto begin = [&](const char *field, const char *number) {
        return act(ACTION_DRAIN, {{field, {bn_type_str, number}}});
    };
    open(5, "tunneld-9");
    // Steps of a slow start; a weight configured meanwhile is reduced as well. No step is less than 1.
    EXPECT_EQ(slow_down("20"), "51/weight=7>1");
    EXPECT_EQ(slow_down("20"), "");
    EXPECT_EQ(slow_down("40"), "51/weight=1>2");
    EXPECT_EQ(changes_of("weight=10"), "51/weight=2>4");
    EXPECT_EQ(value(weight), "10");
    // A drain overrides the slow start.
    EXPECT_EQ(begin("group", "51"), "51/weight=4>0");
    EXPECT_EQ(server_tick(&daemon), now + 60000) << "the configured time";
    EXPECT_EQ(begin("seconds", "9"), "") << "all groups, anew";
    EXPECT_EQ(slow_down("60") + slow_down("100") + count("3", "false"), "");
    EXPECT_EQ(value(drain) + " " + value(drain + "/flows") + " " + value(weight, 1), "draining 3 0");
    EXPECT_EQ(count("0", "true"), goes);
    EXPECT_EQ(value(drain), "drained");
    close(5);
    EXPECT_EQ(tick(100000), "") << "it stays out";
    EXPECT_EQ(act(ACTION_DRAIN), "");
    EXPECT_EQ(act(ACTION_DRAIN_CANCEL), "51/weight=0>10 " + comes);
    EXPECT_EQ(value(drain), "");
    EXPECT_EQ(act(ACTION_DRAIN_CANCEL), "");
    EXPECT_EQ(message(), "There is no drain");
    // Without tunneld, or with flows that do not end, the time limit ends the drain.
    for (const bool followed : {false, true}) {
        if (followed) {
            open(5, "tunneld-10");
            EXPECT_EQ(slow_down("80"), "51/weight=10>8");
        }
        (void)begin("seconds", "9");
        EXPECT_EQ(followed ? count("5", "false") : "", "");
        EXPECT_EQ(tick(8999), "");
        EXPECT_EQ(tick(1), goes);
        EXPECT_EQ(value(drain), "over");
        (void)act(ACTION_DRAIN_CANCEL, {{"group", {bn_type_uint8, "51"}}});
    }
    // A group slowed down by a tunneld that does not return gets its weight back.
    close(5);
    EXPECT_EQ(tick(LEFT_KEEP_MS - 1), "");
    EXPECT_EQ(tick(1), "51/weight=8>10");
    EXPECT_TRUE(contains(content(), "weight = 10"));
    const auto refuse = [&](const char *field, const char *number, const char *reason) {
        EXPECT_EQ(begin(field, number), "");
        EXPECT_EQ(message(), reason);
    };
    refuse("group", "256", "group is not a number between 0 and 255");
    refuse("group", "7", "There is no group 7");
    refuse("seconds", "86401", "seconds is not a number between 0 and 86400");
    (void)act(ACTION_DRAIN);
    EXPECT_EQ(set("-51"), 0u);
    EXPECT_TRUE(daemon.drains.empty());
    EXPECT_EQ(value(drain), "");
}

} // namespace
