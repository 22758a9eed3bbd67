// Queries: what mgmtd answers itself, and what it asks a daemon for.
#include <gtest/gtest.h>
#include <malloc.h>

#include "mgmt/gcl.h"
#include "tests/support/mgmtd_fixture.h"

TEST_F(Mgmtd, QueriesThatWaitAreBoundedAndKeepNoAnswers) {
    for (int group = 0; group < 16; group++)
        daemon.tree.set[{{"qv", "wccpd", "wccp", "srv_grp", "config", std::to_string(group)}}] =
            std::to_string(group);
    tree_refresh(&daemon.tree);
    const size_t before = mallinfo2().uordblks;
    size_t refused = 0;
    for (uint32_t i = 0; i < 300; i++) {
        query(3, "/qv", bn_query_iterate, bn_qf_subtree);
        refused += sent.back().peer == 3 && code() == LC_NO_SPACE;
        clear();
    }
    EXPECT_EQ(refused, 300 - PENDING_SESSION_MAX);
    EXPECT_LT(mallinfo2().uordblks - before, 1u << 20);
    server_peer_opened(&daemon, 4, "mgmtctl-9");
    query(4, "/qv/wccpd/system/state/" + std::string(PENDING_BYTES_MAX, 'a'), bn_query_get);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_NO_SPACE));
    clear();
    now += MONITOR_TIMEOUT_MS;
    (void)server_tick(&daemon);
    EXPECT_EQ(sent.size(), PENDING_SESSION_MAX);
    EXPECT_TRUE(daemon.pending.empty() && daemon.pending_bytes == 0);
}

TEST_F(Mgmtd, GetAndIterate) {
    ASSERT_EQ(set({{bn_set_create, GROUP + "/router/1/ipaddr", "10.0.0.1"},
                   {bn_set_create, "/qv/wccpd/wccp/srv_grp/config/7", ""}}),
              0u);
    const std::string groups = "/qv/wccpd/wccp/srv_grp/config";
    const struct {
        std::string name;
        uint32_t subop, flags;
        strings found;
    } cases[] = {
        {groups, bn_query_iterate, 0, {groups + "/7=7", GROUP + "=51"}},
        {GROUP + "/router",
         bn_query_iterate,
         bn_qf_subtree | bn_qf_include_self,
         {GROUP + "/router/1=1", GROUP + "/router/1/ipaddr=10.0.0.1"}},
        {GROUP + "/router/1",
         bn_query_iterate,
         bn_qf_subtree | bn_qf_include_self | bn_qf_leaves_only,
         {GROUP + "/router/1/ipaddr=10.0.0.1"}},
    };
    for (const auto &one : cases) {
        query(1, one.name, one.subop, one.flags);
        EXPECT_EQ(found(), one.found) << one.name;
        EXPECT_EQ(code(), 0u) << one.name;
    }
    EXPECT_EQ(last_response()->response_to, 77u);
}

TEST_F(Mgmtd, AStateIsAskedForAndTheAnswerPassedOn) {
    query(3, STATE + "/51/oper", bn_query_get);
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].peer, 1u) << "the working session, not that of the alarms";
    const bn_request_node *last = last_node(sent[0].request);
    EXPECT_EQ(name_of(last->binding), STATE + "/51/oper");
    const uint32_t asked = sent[0].request->msg_id, node_id = last->node_id;
    clear();
    answer(2, asked, node_id, 0);
    EXPECT_TRUE(sent.empty()) << "only who was asked may answer";
    answer(1, asked, node_id, 0);
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].peer, 3u);
    EXPECT_EQ(found(), strings{STATE + "/51/oper=ACTIVE"});
    EXPECT_EQ(last_response()->response_to, 77u);
    answer(1, asked, node_id, 0);
    EXPECT_EQ(sent.size(), 1u) << "an answer counts once";
}

// The groups are asked for one after the other, and no longer than the answer fits a message.
TEST_F(Mgmtd, AWalkOfAllGroupsGoesGroupByGroup) {
    const auto group = [](int id) {
        return event_field{STATE + "/" + std::to_string(id), {bn_type_str, std::to_string(id)}};
    };
    // Answers what wccpd was asked last; what it was asked for.
    const auto answer_last = [&](const std::vector<event_field> &fields) {
        const bn_request_msg *asked = sent.back().request;
        const bn_request_node *node = last_node(asked);
        const uint32_t flags = node->flags, node_id = node->node_id, id = asked->msg_id;
        const std::string name = name_of(node->binding);
        clear();
        answer(1, id, node_id, 0, fields);
        return name + " " + std::to_string(flags);
    };
    const std::string whole = " " + std::to_string(bn_qf_subtree | bn_qf_include_self);
    query(3, "/qv/wccpd/wccp/srv_grp", bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(answer_last({group(7), group(51)}), STATE + " 0");
    EXPECT_EQ(answer_last({group(7), {STATE + "/7/oper", {bn_type_str, "INIT"}}}), STATE + "/7" + whole);
    EXPECT_EQ(answer_last({group(51)}), STATE + "/51" + whole);
    EXPECT_EQ(found(), (strings{STATE + "/7=7", STATE + "/7/oper=INIT", STATE + "/51=51"}));
    clear();
    query(3, STATE, bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(answer_last({}), STATE + " 0"); // no groups
    EXPECT_EQ(code(), 0u);

    const std::vector<event_field> large = {{STATE + "/1/debug", {bn_type_str, std::string(9 << 20, 'x')}}};
    const auto start = [&](uint32_t client) {
        clear();
        query(client, STATE, bn_query_iterate, bn_qf_subtree);
        EXPECT_EQ(answer_last({group(1), group(2), group(3)}), STATE + " 0");
    };
    start(3);
    EXPECT_EQ(answer_last(large), STATE + "/1" + whole);
    EXPECT_EQ(answer_last(large), STATE + "/2" + whole);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_NO_BUFFER_SPACE));
    EXPECT_EQ(message(), "The answer is larger than a message: ask for less");
    for (uint32_t client = 10; client < 14; client++) { // and all walks together are bounded
        server_peer_opened(&daemon, client, "mgmtctl-9");
        start(client);
        EXPECT_EQ(answer_last(large), STATE + "/1" + whole);
        EXPECT_EQ(code(), client < 13 ? UINT32_MAX : static_cast<uint32_t>(LC_NO_SPACE));
    }
    now += MONITOR_TIMEOUT_MS;
    clear();
    EXPECT_EQ(server_tick(&daemon), -1);
    EXPECT_EQ(sent.size(), 3u);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_IO_TIMED_OUT));
    EXPECT_EQ(daemon.gathered_bytes + daemon.pending_bytes, 0u);
}

// What a client doesn't read leaves room for less and less.
TEST_F(Mgmtd, AnAnswerThatDoesNotFitIsRefused) {
    ASSERT_EQ(set({{bn_set_create, GROUP + "/router/1/ipaddr", "10.0.0.1"}}), 0u);
    clear();
    daemon.fits = [](uint32_t peer_id, size_t bytes) { return peer_id == 3 && bytes < 200; };
    query(3, GROUP, bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_NO_BUFFER_SPACE));
    EXPECT_EQ(message(), "Too much waits for you to read it: ask for less, or later");
    EXPECT_EQ(last_response()->response_to, 77u);
    query(3, GROUP + "/router/1/ipaddr", bn_query_get);
    EXPECT_EQ(code(), 0u);
    daemon.fits = nullptr;
    query(3, STATE + "/51/debug", bn_query_get);
    const bn_request_node *asked = last_node(sent.back().request);
    const uint32_t half = GCL_FRAME_MAX / 2 - 64;
    answer(1, sent.back().request->msg_id, asked->node_id, 0,
           {{STATE + "/51/debug", {bn_type_str, std::string(half, 'x')}},
            {STATE + "/51/debug", {bn_type_str, std::string(half, 'x')}}});
    EXPECT_EQ(message(), "The answer is larger than a message: ask for less");
}

TEST_F(Mgmtd, AStateThatNobodyGives) {
    query(3, STATE, bn_query_iterate);
    EXPECT_EQ(server_tick(&daemon), now + MONITOR_TIMEOUT_MS);
    now += MONITOR_TIMEOUT_MS;
    EXPECT_EQ(server_tick(&daemon), -1);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_IO_TIMED_OUT));
    // A walk that only comes by has its own nodes to tell, whether it is refused or the session goes.
    for (const bool refused : {true, false}) {
        clear();
        query(3, "/qv/wccpd", bn_query_iterate, bn_qf_subtree);
        const bn_request_msg *asked = sent[0].request;
        if (refused)
            answer(1, asked->msg_id, last_node(asked)->node_id, LC_NOT_FOUND);
        else
            server_peer_closed(&daemon, 1);
        EXPECT_EQ(code(), 0u);
        EXPECT_EQ(found().front(), "/qv/wccpd/system/config/mcast_ttl=1");
    }
    query(3, STATE + "/51/oper", bn_query_get);
    EXPECT_EQ(message(), "wccpd has no session");

    // Of two daemons the one that goes half-way leaves nothing, whichever was asked for first.
    const auto follow = [&](uint32_t peer_id) {
        action(peer_id, "/mgmtd/events/actions/interest/add",
               {{"event_name", {bn_type_name, EVENT_CONFIG_CHANGE}}});
        clear();
    };
    server_peer_opened(&daemon, 1, "wccpd-8");
    server_peer_opened(&daemon, 5, "tunneld-9");
    follow(1);
    follow(5);
    bn_request_msg *both = nullptr;
    ASSERT_EQ(bn_query_request_msg_create(&both, 0, nullptr), LC_OK);
    for (const char *name : {NODE_PLANE_STATE, "/qv/wccpd/wccp/srv_grp"})
        ASSERT_EQ(bn_query_request_msg_append_str(both, bn_query_iterate, bn_qf_subtree, name, nullptr),
                  LC_OK);
    EXPECT_TRUE(give(3, both));
    const auto answer_last = [&](uint32_t peer_id, const std::vector<event_field> &fields) {
        ASSERT_EQ(sent.size(), 1u);
        ASSERT_EQ(sent[0].peer, peer_id);
        const uint32_t id = sent[0].request->msg_id, node_id = last_node(sent[0].request)->node_id;
        clear();
        answer(peer_id, id, node_id, 0, fields);
    };
    answer_last(1, {{STATE + "/7", {bn_type_str, "7"}}, {STATE + "/51", {bn_type_str, "51"}}});
    answer_last(1, {{STATE + "/7/oper", {bn_type_str, "INIT"}}});
    clear();
    server_peer_closed(&daemon, 1);
    answer_last(5, {{NODE_PLANE_STATE "/name", {bn_type_str, "user"}}});
    EXPECT_EQ(found(), strings{NODE_PLANE_STATE "/name=user"});
}
