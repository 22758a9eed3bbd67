// Queries that mgmtd answers itself, and those that it forwards to a daemon.
#include <gtest/gtest.h>
#include <malloc.h>

#include "mgmt/gcl.h"
#include "tests/support/mgmtd_fixture.h"

namespace {

const std::string WALK =
    " " + std::to_string(bn_qf_subtree | bn_qf_include_self); // flags of a walk of a group

struct Queries : Mgmtd {
    uint32_t asked = 0, node_id = 0; // the last query to a daemon

    // Takes the last query to the daemon; returns its name and flags.
    std::string take_query(uint32_t peer_id) {
        EXPECT_EQ(sent.back().peer, peer_id);
        const bn_request_node *node = last_node(sent.back().request);
        asked = sent.back().request->msg_id;
        node_id = node->node_id;
        const std::string out = name_of(node->binding) + " " + std::to_string(node->flags);
        clear();
        return out;
    }
    void answer(uint32_t peer_id, const std::vector<event_field> &fields, uint32_t with_code = 0) {
        answer_query(peer_id, asked, node_id, with_code, fields);
    }
    std::string answer_last(uint32_t peer_id, const std::vector<event_field> &fields,
                            uint32_t with_code = 0) {
        const std::string query = take_query(peer_id);
        answer(peer_id, fields, with_code);
        return query;
    }
    static event_field group(int id) {
        return {STATE + "/" + std::to_string(id), {bn_type_str, std::to_string(id)}};
    }
};

TEST_F(Queries, OfStatesAreForwardedToTheDaemonAndTheAnswerBack) {
    const event_field state = {STATE + "/51/oper", {bn_type_str, "ACTIVE"}};
    query(3, state.name, bn_query_get);
    ASSERT_EQ(sent.size(), 1u);
    // From the working session, not that of the alarms.
    EXPECT_EQ(take_query(1), state.name + " 0");
    answer(2, {state});
    EXPECT_TRUE(sent.empty()) << "only the queried daemon may answer";
    answer(1, {state});
    answer(1, {state}); // counts once
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].peer, 3u);
    EXPECT_EQ(found(), strings{state.name + "=ACTIVE"});
    EXPECT_EQ(last_response()->response_to, 77u);
}

TEST_F(Queries, ThatWaitAreBoundedAndKeepNoAnswers) {
    for (int id = 0; id < 16; id++)
        daemon.tree.set[named(GROUPS + std::to_string(id))] = std::to_string(id);
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
    open(4, "mgmtctl-9");
    query(4, "/qv/wccpd/system/state/" + std::string(PENDING_BYTES_MAX, 'a'), bn_query_get);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_NO_SPACE));
    (void)tick(MONITOR_TIMEOUT_MS);
    EXPECT_EQ(sent.size(), PENDING_SESSION_MAX);
    EXPECT_TRUE(daemon.pending.empty() && daemon.pending_bytes == 0);
}

// Groups are queried one after the other, as long as the answer fits in a message.
TEST_F(Queries, OfAllGroupsAreSentGroupByGroup) {
    query(3, "/qv/wccpd/wccp/srv_grp", bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(answer_last(1, {group(7), group(51)}), STATE + " 0");
    EXPECT_EQ(answer_last(1, {group(7), {STATE + "/7/oper", {bn_type_str, "INIT"}}}), STATE + "/7" + WALK);
    EXPECT_EQ(answer_last(1, {group(51)}), STATE + "/51" + WALK);
    EXPECT_EQ(found(), (strings{STATE + "/7=7", STATE + "/7/oper=INIT", STATE + "/51=51"}));
    clear();
    query(3, STATE, bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(answer_last(1, {}), STATE + " 0"); // no groups
    EXPECT_EQ(code(), 0u);

    const std::vector<event_field> large = {{STATE + "/1/debug", {bn_type_str, std::string(9 << 20, 'x')}}};
    const auto start = [&](uint32_t client) {
        clear();
        query(client, STATE, bn_query_iterate, bn_qf_subtree);
        EXPECT_EQ(answer_last(1, {group(1), group(2), group(3)}), STATE + " 0");
    };
    start(3);
    EXPECT_EQ(answer_last(1, large), STATE + "/1" + WALK);
    EXPECT_EQ(answer_last(1, large), STATE + "/2" + WALK);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_NO_BUFFER_SPACE));
    EXPECT_EQ(message(), "The answer is larger than a message: ask for less");
    for (uint32_t client = 10; client < 14; client++) { // and all walks together are bounded
        open(client, "mgmtctl-9");
        start(client);
        EXPECT_EQ(answer_last(1, large), STATE + "/1" + WALK);
        EXPECT_EQ(code(), client < 13 ? UINT32_MAX : static_cast<uint32_t>(LC_NO_SPACE));
    }
    (void)tick(MONITOR_TIMEOUT_MS);
    EXPECT_EQ(sent.size(), 3u);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_IO_TIMED_OUT));
    EXPECT_EQ(daemon.gathered_bytes + daemon.pending_bytes, 0u);
}

// Answers that a client has not read yet reduce the room for further ones.
TEST_F(Queries, WhoseAnswersDoNotFitAreRefused) {
    ASSERT_EQ(set("+router/1/ipaddr=10.0.0.1"), 0u);
    daemon.fits = [](uint32_t peer_id, size_t bytes) { return peer_id == 3 && bytes < 200; };
    query(3, GROUP, bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_NO_BUFFER_SPACE));
    EXPECT_EQ(message(), "Too much waits for you to read it: ask for less, or later");
    EXPECT_EQ(last_response()->response_to, 77u);
    EXPECT_EQ(value(GROUP + "/router/1/ipaddr"), "10.0.0.1");
    daemon.fits = nullptr;
    query(3, STATE + "/51/debug", bn_query_get);
    const event_field half = {STATE + "/51/debug", {bn_type_str, std::string(GCL_FRAME_MAX / 2 - 64, 'x')}};
    (void)answer_last(1, {half, half});
    EXPECT_EQ(message(), "The answer is larger than a message: ask for less");
}

TEST_F(Queries, ThatNobodyAnswers) {
    query(3, STATE, bn_query_iterate);
    EXPECT_EQ(server_tick(&daemon), now + MONITOR_TIMEOUT_MS);
    (void)tick(MONITOR_TIMEOUT_MS);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_IO_TIMED_OUT));
    // A walk that begins above the states succeeds without the daemon, whether it refuses or disconnects.
    for (const bool refuses : {true, false}) {
        clear();
        query(3, "/qv/wccpd", bn_query_iterate, bn_qf_subtree);
        if (refuses)
            (void)answer_last(1, {}, LC_NOT_FOUND);
        else
            close(1);
        EXPECT_EQ(code(), 0u);
        EXPECT_EQ(found().front(), "/qv/wccpd/system/config/mcast_ttl=1");
    }
    query(3, STATE + "/51/oper", bn_query_get);
    EXPECT_EQ(message(), "wccpd has no session");

    // A daemon that disconnects half-way contributes nothing, whichever of two daemons was queried first.
    open(1, "wccpd-8");
    open(5, "tunneld-9");
    follow(1, {EVENT_CONFIG_CHANGE});
    follow(5, {EVENT_CONFIG_CHANGE});
    query(3, NODE_PLANE_STATE, bn_query_iterate, bn_qf_subtree, "/qv/wccpd/wccp/srv_grp");
    (void)answer_last(1, {group(7), group(51)});
    (void)answer_last(1, {{STATE + "/7/oper", {bn_type_str, "INIT"}}});
    clear();
    close(1);
    (void)answer_last(5, {{NODE_PLANE_STATE "/name", {bn_type_str, "user"}}});
    EXPECT_EQ(found(), strings{NODE_PLANE_STATE "/name=user"});
}

} // namespace
