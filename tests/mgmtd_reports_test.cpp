// What the daemons report to mgmtd, and what becomes of it: processes, alarms, roles, and groups that are out
// of their routers for a time.
#include <cstring>

#include <gtest/gtest.h>

#include "tests/support/mgmtd_fixture.h"

// A process has several sessions; another process id is a restart, and its predecessor's late end is none.
TEST_F(Mgmtd, ProcessesAreKnownByTheirSessions) {
    const auto process = [&] {
        query(3, NODE_PROCESSES, bn_query_iterate, bn_qf_subtree);
        strings out = found();
        std::erase_if(out, [](const std::string &node) { return node.find("/since=") != std::string::npos; });
        return out;
    };
    const auto wccpd = [](const char *state, const char *pid, const char *restarts) {
        return strings{NODE_PROCESSES "/wccpd=" + std::string(state),
                       NODE_PROCESSES "/wccpd/pid=" + std::string(pid),
                       NODE_PROCESSES "/wccpd/restarts=" + std::string(restarts)};
    };
    EXPECT_EQ(process(), wccpd("running", "7", "0"));
    server_peer_closed(&daemon, 2);
    EXPECT_EQ(process(), wccpd("running", "7", "0"));
    server_peer_opened(&daemon, 6, "wccpd-9");
    EXPECT_EQ(process(), wccpd("running", "9", "1"));
    server_peer_closed(&daemon, 1);
    EXPECT_EQ(process(), wccpd("running", "9", "1"));
    server_peer_closed(&daemon, 6);
    EXPECT_EQ(process(), wccpd("gone", "9", "1"));
    server_peer_opened(&daemon, 7, "wccpdx-1");
    server_peer_opened(&daemon, 8, "tunneld-x");
    EXPECT_EQ(process(), wccpd("gone", "9", "1"));
}

// 3 restarts in 5 minutes raise an alarm, which ends 5 minutes after the last one; whoever counts them.
TEST_F(Mgmtd, ADaemonThatRestartsInALoopRaisesAnAlarm) {
    const std::string alarm = NODE_ALARMS_RAISED "/196641/";
    for (const char *event : {EVENT_RAISE_ALARM, EVENT_CLEAR_ALARM})
        action(3, ACTION_ADD_INTEREST, {{"event_name", {bn_type_name, event}}});
    const auto alarms = [&] {
        strings out;
        query(3, NODE_ALARMS_RAISED, bn_query_iterate, bn_qf_subtree);
        for (const std::string &node : found())
            if (node.find("/since=") == std::string::npos)
                out.push_back(node.substr(alarm.size()));
        return out;
    };
    const auto heard = [&] {
        size_t events = 0;
        for (const sent_message &one : sent)
            events += one.mtype == bn_msg_event;
        clear();
        return events;
    };
    server_peer_closed(&daemon, 2);
    const auto restart = [&](const char *session, int64_t after_ms) {
        now += after_ms;
        server_peer_closed(&daemon, 1);
        server_peer_opened(&daemon, 1, session);
    };
    clear();
    restart("wccpd-8", 1000);
    restart("wccpd-9", RESTARTS_WITHIN_MS);
    restart("wccpd-10", 1000);
    EXPECT_EQ(alarms(), strings{}) << "3 times in more than 5 minutes";
    restart("wccpd-11", 1000);
    EXPECT_EQ(alarms(),
              (strings{"wccpd=restarted 3 times in 2 s", "wccpd/name=restart-loop", "wccpd/reporter=mgmtd"}));
    restart("wccpd-12", 1000);
    EXPECT_EQ(alarms()[0], "wccpd=restarted 4 times in 3 s");
    EXPECT_EQ(heard(), 1u);
    EXPECT_EQ(server_tick(&daemon), now + RESTARTS_WITHIN_MS);
    server_peer_closed(&daemon, 1);
    now += RESTARTS_WITHIN_MS;
    EXPECT_EQ(server_tick(&daemon), -1) << "it does not run";
    server_peer_opened(&daemon, 1, "wccpd-13");
    now += RESTARTS_WITHIN_MS;
    EXPECT_EQ(heard(), 0u);
    (void)server_tick(&daemon);
    EXPECT_EQ(heard(), 1u);
    EXPECT_EQ(alarms(), strings{});

    // The supervisor's word counts alone, also for a program that never has a session.
    daemon.supervises = true;
    for (const char *session : {"wccpd-14", "wccpd-15", "wccpd-16"})
        restart(session, 1000);
    EXPECT_EQ(alarms(), strings{});
    for (int i = 0; i < 3; i++)
        server_note_restart(&daemon, "tunneld", "exited with 1");
    EXPECT_EQ(alarms(), (strings{"tunneld=restarted 3 times in 0 s; the last one exited with 1",
                                 "tunneld/name=restart-loop", "tunneld/reporter=mgmtd"}));
    query(3, NODE_PROCESSES "/tunneld/restarts", bn_query_get);
    EXPECT_EQ(found(), strings{NODE_PROCESSES "/tunneld/restarts=3"});
}

TEST_F(Mgmtd, ReportsStandUntilTheirSessionEndsAndAreBounded) {
    for (const char *event : {EVENT_RAISE_ALARM, EVENT_CLEAR_ALARM, EVENT_ROLE_CHANGE})
        action(3, ACTION_ADD_INTEREST, {{"event_name", {bn_type_name, event}}});
    clear();
    const auto raise = [&](uint32_t peer_id, const std::string &source, const std::string &text) {
        EXPECT_TRUE(give(peer_id,
                         make_event("/qv/alarms/events/raise_alarm", {{"alarm_type", {bn_type_str, "196638"}},
                                                                      {"param_3", {bn_type_str, source}},
                                                                      {"comment", {bn_type_str, text}}})));
    };
    raise(2, "eth0:grp:51", std::string(5000, 'x'));
    ASSERT_EQ(sent.size(), 2u);
    EXPECT_EQ(sent[0].peer, 3u) << "passed on";
    EXPECT_EQ(sent[1].mtype, bn_msg_event_ack);
    raise(2, "eth0:grp:51", "again");
    // A number that is none stops no walk.
    EXPECT_TRUE(give(2, make_event("/qv/state/events/role_change", {{"group", {bn_type_str, "51"}},
                                                                    {"role", {bn_type_uint32, "1"}},
                                                                    {"code", {bn_type_str, "many"}}})));
    clear();
    query(3, "/qv/alarms/state", bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(found().size(), 11u) << "four of them about the process";
    EXPECT_TRUE(has(found(), "/qv/alarms/state/role/51=BACKUP") &&
                has(found(), "/qv/alarms/state/role/51/code=0"));
    clear();
    server_peer_closed(&daemon, 2);
    strings forgotten; // what watchers get
    for (const sent_message &one : sent)
        for (const event_field &field : fields_of(one.request))
            forgotten.push_back(field.name + "=" + field.value.text);
    EXPECT_TRUE(has(forgotten, "param_3=eth0:grp:51") && has(forgotten, "role=2") &&
                has(forgotten, "group=51"));
    EXPECT_EQ(sent.size(), 2u);
    query(3, NODE_ALARMS_RAISED, bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(found(), strings{});
    for (size_t i = 0; i < ALARMS_MAX + 9; i++)
        raise(3, std::to_string(i), std::string(5000, 'x'));
    EXPECT_EQ(daemon.alarm_owners.size(), ALARMS_MAX);
    size_t kept = 0;
    for (const auto &[name, value] : daemon.state)
        kept += value.text.size();
    EXPECT_LT(kept, ALARMS_MAX * 1024);
}

// --- Groups that are out of their routers for a time

TEST_F(Mgmtd, AGroupThatIsOutOfItsRoutersIsDownForWccpdAlone) {
    const std::string admin = GROUP + "/admin", left = "/qv/alarms/state/left/51";
    const auto seen_by = [&](uint32_t peer_id) {
        query(peer_id, admin, bn_query_get);
        return found().empty() ? "" : found().front().substr(admin.size() + 1);
    };
    std::string heard; // by a session that watches: l and j
    const auto listen = [&] {
        for (const sent_message &one : sent)
            if (one.peer == 8 && one.mtype == bn_msg_event)
                heard += strcmp(ts_str(one.request->text), EVENT_GROUP_LEAVE) == 0 ? "l" : "j";
        return changes();
    };
    const auto report = [&](uint32_t peer_id, const char *event, std::vector<event_field> more = {}) {
        more.push_back({"group", {bn_type_uint8, "51"}});
        clear();
        EXPECT_TRUE(give(peer_id, make_event(event, more)));
        return listen();
    };
    server_peer_opened(&daemon, 8, "mgmtctl-1");
    for (const char *event : {EVENT_GROUP_LEAVE, EVENT_GROUP_JOIN})
        action(8, "/mgmtd/events/actions/interest/add", {{"event_name", {bn_type_name, event}}});
    const event_field reason = {"reason", {bn_type_str, "proxy down: status 503"}};
    const strings goes = {admin + "=up>down"}, comes = {admin + "=down>up"};
    ASSERT_EQ(set({{bn_set_create, GROUP + "/interface", "eth0"},
                   {bn_set_create, GROUP + "/router/1/ipaddr", "10.0.0.1"},
                   {bn_set_create, NODE_INTERCEPT_CONFIG "/51/ports", "80"},
                   {bn_set_create, NODE_INTERCEPT_CONFIG "/51/to", "3128"}}),
              0u)
        << message();
    action(3, "/mgmtd/events/actions/interest/add", {{"event_name", {bn_type_name, EVENT_CONFIG_CHANGE}}});
    const std::string saved = content();
    EXPECT_EQ(report(3, EVENT_GROUP_LEAVE, {reason}), strings{}) << "only tunneld may say so";
    server_peer_opened(&daemon, 5, "tunneld-9");
    EXPECT_EQ(report(5, EVENT_GROUP_LEAVE, {reason}), goes);
    EXPECT_EQ(events(3).size(), 0u);
    EXPECT_EQ(seen_by(1) + " " + seen_by(3), "down up");
    EXPECT_EQ(content(), saved);
    query(3, left, bn_query_get);
    EXPECT_EQ(found(), strings{left + "=proxy down: status 503"});
    EXPECT_EQ(report(5, EVENT_GROUP_LEAVE, {reason}), strings{}) << "it knows already";

    // What is configured meanwhile does not bring the group up.
    for (const char *word : {"down", "up"}) {
        EXPECT_EQ(set({{bn_set_modify, admin, word}}), 0u);
        EXPECT_EQ(changes(), strings{});
        EXPECT_EQ(events(3).size(), 1u);
        EXPECT_EQ(seen_by(1) + " " + seen_by(3), std::string("down ") + word);
    }
    EXPECT_EQ(set({{bn_set_modify, GROUP + "/priority", "7"}}), 0u);
    EXPECT_TRUE(has(changes(), admin + "=->down")) << "it is created again in wccpd";
    EXPECT_EQ(report(5, EVENT_GROUP_JOIN), comes);
    EXPECT_EQ(seen_by(1), "up");
    EXPECT_EQ(report(5, EVENT_GROUP_JOIN), strings{});

    // tunneld goes: for a time another may take over.
    const auto tick = [&](int64_t after_ms) {
        clear();
        now += after_ms;
        (void)server_tick(&daemon);
        return listen();
    };
    EXPECT_EQ(report(5, EVENT_GROUP_LEAVE, {reason}), goes);
    server_peer_closed(&daemon, 5);
    EXPECT_EQ(tick(LEFT_KEEP_MS - 1), strings{});
    server_peer_opened(&daemon, 6, "tunneld-10");
    EXPECT_EQ(tick(LEFT_KEEP_MS), strings{});
    EXPECT_EQ(report(6, EVENT_PROXY_CHANGE, {{"up", {bn_type_bool, "false"}}}), strings{});
    EXPECT_EQ(report(6, EVENT_PROXY_CHANGE, {{"up", {bn_type_bool, "true"}}}), comes);
    EXPECT_EQ(report(6, EVENT_GROUP_LEAVE, {reason}), goes);
    server_peer_closed(&daemon, 6);
    clear();
    EXPECT_EQ(server_tick(&daemon), now + LEFT_KEEP_MS);
    EXPECT_EQ(tick(LEFT_KEEP_MS), comes);
    query(3, left, bn_query_get);
    EXPECT_EQ(found(), strings{});

    EXPECT_EQ(heard, "ljljlj") << "each change once, whoever reports it";

    // With the group it goes, and doesn't come back with it.
    server_peer_opened(&daemon, 7, "tunneld-11");
    EXPECT_EQ(report(7, EVENT_GROUP_LEAVE, {reason}), goes);
    EXPECT_EQ(set({{bn_set_delete, GROUP, ""}}), 0u);
    EXPECT_TRUE(daemon.left.empty());
    EXPECT_EQ(report(7, EVENT_GROUP_LEAVE, {reason}), strings{});
    EXPECT_TRUE(daemon.left.empty());
    EXPECT_EQ(set({{bn_set_create, GROUP + "/interface", "eth0"}}), 0u);
    EXPECT_TRUE(has(changes(), admin + "=->up"));
}

TEST_F(Mgmtd, AGroupThatIsDrainedAnnouncesNothingAndLeavesOnceItIsEmpty) {
    const std::string admin = GROUP + "/admin", weight = GROUP + "/weight", drain = NODE_DRAINS "/51";
    const auto report = [&](const char *event, std::vector<event_field> more) {
        more.push_back({"group", {bn_type_uint8, "51"}});
        clear();
        EXPECT_TRUE(give(5, make_event(event, more)));
        return changes();
    };
    const auto act = [&](const char *name, const std::vector<event_field> &fields = {}) {
        clear();
        action(3, name, fields);
        return changes();
    };
    const auto slow_down = [&](const char *percent) {
        return report(EVENT_GROUP_WEIGHT, {{"percent", {bn_type_uint32, percent}}});
    };
    const auto count = [&](const char *flows, const char *empty) {
        return report(EVENT_DRAIN_PROGRESS,
                      {{"flows", {bn_type_uint32, flows}}, {"empty", {bn_type_bool, empty}}});
    };
    const auto state = [&](const std::string &below = "") {
        query(3, drain + below, bn_query_get);
        return found().empty() ? "" : found().front().substr(drain.size() + below.size() + 1);
    };
    const auto tick = [&](int64_t after_ms) {
        clear();
        now += after_ms;
        (void)server_tick(&daemon);
        return changes();
    };
    ASSERT_EQ(set({{bn_set_create, GROUP + "/interface", "eth0"},
                   {bn_set_create, weight, "7"},
                   {bn_set_create, NODE_INTERCEPT_CONFIG "/51/ports", "80"},
                   {bn_set_create, NODE_INTERCEPT_CONFIG "/51/to", "3128"}}),
              0u);
    server_peer_opened(&daemon, 5, "tunneld-9");
    // The steps of a slow start; what is configured meanwhile comes in its part. No step is less than 1.
    EXPECT_EQ(slow_down("20"), strings{weight + "=7>1"});
    EXPECT_EQ(slow_down("20"), strings{});
    EXPECT_EQ(slow_down("40"), strings{weight + "=1>2"});
    EXPECT_EQ(set({{bn_set_modify, weight, "10"}}), 0u);
    EXPECT_EQ(changes(), strings{weight + "=2>4"});
    query(3, weight, bn_query_get);
    EXPECT_EQ(found(), strings{weight + "=10"});
    // A drain takes the rest, and a new tunneld may still follow.
    EXPECT_EQ(act(ACTION_DRAIN, {{"group", {bn_type_uint8, "51"}}}), strings{weight + "=4>0"});
    EXPECT_EQ(server_tick(&daemon), now + 60000) << "the configured time";
    EXPECT_EQ(act(ACTION_DRAIN, {{"seconds", {bn_type_uint32, "9"}}}), strings{}) << "all groups, anew";
    EXPECT_EQ(slow_down("60"), strings{});
    EXPECT_EQ(slow_down("100"), strings{});
    EXPECT_EQ(count("3", "false"), strings{});
    EXPECT_EQ(state() + " " + state("/flows"), "draining 3");
    query(1, weight, bn_query_get);
    EXPECT_EQ(found(), strings{weight + "=0"});
    EXPECT_EQ(count("0", "true"), strings{admin + "=up>down"});
    EXPECT_EQ(state(), "drained");
    server_peer_closed(&daemon, 5);
    EXPECT_EQ(tick(100000), strings{}) << "it stays out";
    EXPECT_EQ(act(ACTION_DRAIN), strings{});
    EXPECT_EQ(act(ACTION_DRAIN_CANCEL), (strings{weight + "=0>10", admin + "=down>up"}));
    EXPECT_EQ(state(), "");
    EXPECT_EQ(act(ACTION_DRAIN_CANCEL), strings{});
    EXPECT_EQ(message(), "There is no drain");
    // Without tunneld, or with flows that don't end, by its time.
    for (const bool followed : {false, true}) {
        if (followed) {
            server_peer_opened(&daemon, 5, "tunneld-10");
            EXPECT_EQ(slow_down("80"), strings{weight + "=10>8"});
        }
        (void)act(ACTION_DRAIN, {{"seconds", {bn_type_uint32, "9"}}});
        if (followed) {
            EXPECT_EQ(count("5", "false"), strings{});
        }
        EXPECT_EQ(tick(8999), strings{});
        EXPECT_EQ(tick(1), strings{admin + "=up>down"});
        EXPECT_EQ(state(), "over");
        (void)act(ACTION_DRAIN_CANCEL, {{"group", {bn_type_uint8, "51"}}});
    }
    // What a tunneld that is gone for good has slowed down gets its weight back.
    server_peer_closed(&daemon, 5);
    EXPECT_EQ(tick(LEFT_KEEP_MS - 1), strings{});
    EXPECT_EQ(tick(1), strings{weight + "=8>10"});
    EXPECT_NE(content().find("weight = 10"), std::string::npos);
    const struct {
        std::vector<event_field> fields;
        const char *refused;
    } bad[] = {{{{"group", {bn_type_str, "256"}}}, "group is no number between 0 and 255"},
               {{{"group", {bn_type_str, "7"}}}, "There is no group 7"},
               {{{"seconds", {bn_type_str, "86401"}}}, "seconds is no number between 0 and 86400"}};
    for (const auto &one : bad) {
        EXPECT_EQ(act(ACTION_DRAIN, one.fields), strings{});
        EXPECT_EQ(message(), one.refused);
    }
    (void)act(ACTION_DRAIN);
    EXPECT_EQ(set({{bn_set_delete, GROUP, ""}}), 0u);
    EXPECT_TRUE(daemon.drains.empty());
    EXPECT_EQ(state(), "");
}
