// Commits of mgmtd: their effects, the events about them, how they are kept, and who may make them.
#include <algorithm>
#include <fstream>

#include <gtest/gtest.h>
#include <unistd.h>

#include "mgmt/gcl.h"
#include "tests/support/mgmtd_fixture.h"

namespace {

const std::string POLICY = "/qv/wccpd/wccp/policy_grp/config/5";

TEST_F(Mgmtd, AGroupIsCreatedWithDefaultsAndDeletedWhole) {
    EXPECT_EQ(set("+interface=eth0 +router/1/ipaddr=10.0.0.1 +weight=7"), 0u) << message();
    const std::string added = changes();
    EXPECT_TRUE(added.starts_with("51=->51 "));
    EXPECT_TRUE(contains(added, " 51/interface=->eth0", " 51/router/1=->1 ", " 51/router/1/ipaddr=->10.0.0.1",
                         " 51/weight=->7", " 51/admin=->up", " 51/password=->", " 51/mask_dst_ip=->3840"));
    const size_t count = events()[0].size();
    EXPECT_EQ(last_response()->db_revision_id, 2u);
    EXPECT_EQ(set("-weight"), 0u);
    EXPECT_EQ(changes(), "51/weight=7>100");
    EXPECT_EQ(set("weight=100"), 0u);
    EXPECT_EQ(changes(), "") << "the same value is not a change";
    EXPECT_EQ(set("-51"), 0u) << message();
    EXPECT_EQ(events()[0].size(), count);
    EXPECT_TRUE(contains(changes(), "51=51>-", "51/admin=up>-"));
}

TEST_F(Mgmtd, ARefusedStepLeavesEverythingAsItWas) {
    ASSERT_EQ(set("+router/1/ipaddr=10.0.0.1 +policy_grp=5 +" + POLICY), 0u);
    const auto before = daemon.tree.set;
    const auto refuse = [&](lc_status status, const set_node &bad) {
        SCOPED_TRACE(bad.name);
        EXPECT_EQ(set({{bn_set_modify, GROUP + "/admin", "down"}, bad}), static_cast<uint32_t>(status));
        EXPECT_TRUE(message().starts_with(bad.name.substr(0, 6)) && lacks(message(), "\n")) << message();
        EXPECT_EQ(changes(), "");
        EXPECT_EQ(daemon.tree.set, before);
    };
    std::string deep = GROUP;
    for (int i = 0; i < 64; i++)
        deep += "/a";
    refuse(LC_BAD_PATH, {bn_set_modify, deep, "1"});
    refuse(LC_BAD_ARGUMENT, {bn_set_modify, GROUP + "/weight", "70000"});
    refuse(LC_BAD_TYPE, {bn_set_modify, GROUP + "/weight", "1", bn_type_uint16});
    refuse(LC_NOT_FOUND, {bn_set_modify, GROUP + "/wait", "1"});
    refuse(LC_NOT_FOUND, {bn_set_modify, GROUPS + "52/weight", "1"});
    refuse(LC_BAD_PATH, {bn_set_modify, "weight", "1"});
    refuse(LC_ASSERTION, {bn_set_create, GROUP + "/router/2", ""}); // no address
    refuse(LC_ASSERTION, {bn_set_delete, GROUP + "/router/1/ipaddr", "", bn_type_none});
    refuse(LC_ASSERTION, {bn_set_delete, POLICY, "", bn_type_none}); // it is in use
    refuse(LC_NOT_IMPLEMENTED, {bn_set_reparent, GROUP, "", bn_type_none});
    // The file would not give these back unchanged.
    for (const std::string &process : {std::string("a\nb"), std::string("a\\\\"), std::string(256, 'a')})
        refuse(LC_BAD_ARGUMENT,
               {bn_set_create, "/logging/syslog/process/" + process + "/log_level", "debug"});
    // Addresses that cannot be routers.
    for (const char *address : {"127.0.0.2", "10.0.0.101", "10.0.0.255", "224.0.1.9"})
        refuse(LC_ASSERTION, {bn_set_create, GROUP + "/router/2/ipaddr", address});
}

TEST_F(Mgmtd, ARunningGroupThatCannotFollowIsDeletedAndCreated) {
    follow(3, {EVENT_CONFIG_CHANGE});
    reload("[" + GROUP + "]\npolicy_grp = 5\nrouter/1/ipaddr = 10.0.0.1\n[" + GROUPS + "7]\n[" + GROUPS +
           "9]\n");
    const uint32_t revision = daemon.tree.revision;
    const auto check = [&](size_t count, const char *steps) { // of the events that wccpd gets
        EXPECT_EQ(set(steps), 0u) << message();
        EXPECT_EQ(events().size(), count) << steps;
        EXPECT_LE(events(3).size(), 1u) << "one commit to everybody else";
    };
    check(2, "priority=9 weight=9");
    check(2, "interface=eth1");
    check(2, "router/1/ipaddr=10.0.0.2");
    check(3, "+router/2/ipaddr=10.0.0.3 7/weight=9");
    check(2, "-policy_grp");
    check(2, "-7 +7/weight=9"); // recreated on purpose, with the same values
    check(2, "+8 weight=7");
    check(1, "encap=l2 assign_detail=x");
    check(1, "-assign_detail");
    EXPECT_EQ(daemon.tree.revision, revision + 9);

    // One file with all kinds: deleted, changed and created groups.
    reload("[" + GROUP + "]\npriority = 1\n[" + GROUPS + "7]\nweight = 1\n[" + GROUPS + "11]\n");
    const auto sent_events = events();
    ASSERT_EQ(sent_events.size(), 3u) << said;
    EXPECT_TRUE(contains(joined(sent_events[0], " "), "9=9>-", "51=51>-", "51/priority=9>-"));
    EXPECT_EQ(sent_events[1], strings{"7/weight=9>1"});
    EXPECT_TRUE(contains(joined(sent_events[2], " "), "11=->11", "51=->51", "51/priority=->1"));

    // Events are bounded, and none has only a part of a group.
    std::string many;
    for (int group = 100; group < 200; group++)
        many += "[" + GROUPS + std::to_string(group) + "]\n";
    reload(many);
    EXPECT_EQ(events().size(), 3u) << "the deleted groups, and the created ones in two parts";
    for (const auto &event : events()) {
        EXPECT_TRUE(event.front().ends_with(">-") || event.front().find("=->1") != std::string::npos);
        EXPECT_LT(event.size(), 1200u);
    }
}

// --- Commits that are kept

struct Kept : Mgmtd {
    int64_t clock = 1000000;

    // Starts again from the same files.
    void start() {
        daemon.kept = {};
        daemon.tree = {};
        daemon.return_at_ms = -1;
        daemon.clock_s = [this] { return clock; };
        (void)load();
    }
    // Number and cause of the last three.
    std::string history() {
        std::string out;
        const std::vector<history_entry> &all = daemon.kept.entries;
        for (size_t i = all.size() - std::min<size_t>(all.size(), 3); i < all.size(); i++)
            out += std::to_string(all[i].number) + " " + all[i].cause + "; ";
        return out;
    }
    std::string weight() { return daemon.tree.nodes[named(GROUP + "/weight")].text; }
    std::string text_of(uint32_t number) {
        return value(NODE_COMMITS "/" + std::to_string(number) + "/text");
    }
    std::string commits() const { return daemon.file.path + ".history"; }
};

TEST_F(Kept, OverAStartAndUpToFifty) {
    const std::string pending = commits() + "/pending";
    start();
    ASSERT_EQ(set("+weight=1"), 0u) << message();
    EXPECT_EQ(text_of(2), content());
    start();
    EXPECT_EQ(history(), "1 found at the start; 2 mgmtctl-8; ") << "nothing differs: no new commit";
    EXPECT_EQ(daemon.tree.revision, 2u);
    reload(content() + "priority = 1\n");
    std::ofstream(daemon.file.path, std::ios::app) << "encap = l2\n";
    std::ofstream(commits() + "/commit-x") << "";
    start();
    EXPECT_EQ(history(), "2 mgmtctl-8; 3 the configuration file was read again; 4 found at the start; ");

    // An interrupted commit counts if the file has been replaced.
    std::string reason;
    const history_entry cut = {5, clock, "root", "cut", 1, "x"};
    for (const bool replaced : {false, true}) {
        ASSERT_TRUE(history_prepare(daemon.kept, cut, content() + "weight = 2\n", &reason)) << reason;
        if (replaced)
            std::ofstream(daemon.file.path, std::ios::app) << "weight = 2\n";
        std::ofstream(pending + ".unfinished") << "#% comm";
        const std::string before = history();
        // The weight is given twice, which does not matter to the history.
        history_open(&daemon.kept, content(), daemon.say);
        EXPECT_EQ(history() == before, !replaced);
        EXPECT_TRUE(mode_of(pending) < 0 && mode_of(pending + ".unfinished") < 0);
    }
    EXPECT_EQ(history_find(daemon.kept, 5)->cause, "cut");

    write("[" + GROUP + "]\nweight = 3\n");
    start();
    for (int i = 0; i < 60; i++)
        ASSERT_EQ(set("weight=" + std::to_string(100 + i)), 0u) << message();
    const uint32_t last = daemon.tree.revision;
    query(3, NODE_COMMITS, bn_query_iterate);
    EXPECT_EQ(found().size(), HISTORY_MAX);
    EXPECT_EQ(text_of(last - 50), "");
    EXPECT_TRUE(contains(text_of(last - 49), "weight = 110"));
    std::ofstream(commits() + "/commit-" + std::to_string(last - 1)) << "#% commit 1\n";
    start();
    EXPECT_EQ(daemon.kept.entries.size(), HISTORY_MAX - 1) << "an entry that can't be read is reported";
    EXPECT_TRUE(contains(said, "commit " + std::to_string(last - 1) + " can't be read"));
}

TEST_F(Kept, OnConditions) {
    write("[" + GROUP + "]\nweight = 3\n");
    start();
    const uint32_t at = daemon.tree.revision;
    EXPECT_EQ(set("weight=4", 0, at + 1), static_cast<uint32_t>(LC_ASSERTION));
    EXPECT_EQ(set("weight=4", 4), static_cast<uint32_t>(LC_NOT_IMPLEMENTED));
    EXPECT_EQ(set("weight=4", bn_cf_check_only), 0u);
    EXPECT_EQ(message(), "1 node would change");
    EXPECT_EQ(set("weight=x", bn_cf_check_only), static_cast<uint32_t>(LC_BAD_ARGUMENT));
    EXPECT_EQ(weight() + std::to_string(daemon.tree.revision), "3" + std::to_string(at));

    // While a commit waits for confirmation, others are refused; it is undone in time, also by the next
    // mgmtd.
    const auto wait = [&](int64_t seconds) {
        clock += seconds;
        now += seconds * 1000;
        const int64_t next = server_tick(&daemon);
        return next < 0 ? -1 : next - now;
    };
    for (const std::string how : {"time", "start", "clock", "confirmed", "rollback"}) {
        ASSERT_EQ(set("weight=4", 2u << bn_cf_minutes_shift, daemon.tree.revision), 0u) << message();
        EXPECT_EQ(wait(20), 100000);
        EXPECT_EQ(set("weight=5"), static_cast<uint32_t>(LC_ASSERTION));
        reload("[" + GROUP + "]\nweight = 9\n");
        EXPECT_EQ(weight(), "4") << said;
        write(*daemon.file.seen);
        if (how == "clock")
            clock -= 1000000;
        if (how == "start" || how == "clock") {
            start();
            EXPECT_EQ(wait(0), how == "clock" ? 120000 : 100000);
        }
        const std::string directory = std::exchange(daemon.kept.directory, "/no/such"); // or the disk is full
        if (how == "confirmed") {
            (void)act(ACTION_CONFIRM);
            EXPECT_EQ(code(), static_cast<uint32_t>(LC_IO_ERROR)) << "it still waits";
            daemon.kept.directory = directory;
            (void)act(ACTION_CONFIRM);
            EXPECT_EQ(code(), 0u) << message();
            start();
        } else if (how == "rollback") {
            daemon.kept.directory = directory;
            EXPECT_EQ(set("weight=3", bn_cf_ends_wait), 0u) << message();
        } else {
            EXPECT_EQ(wait(how == "clock" ? 119 : 99), 1000);
            EXPECT_EQ(weight(), "4");
            EXPECT_EQ(wait(1), 60000) << how << ": it is tried again";
            daemon.kept.directory = directory;
            EXPECT_EQ(wait(60), -1);
        }
        EXPECT_EQ(weight(), how == "confirmed" ? "4" : "3") << how;
        EXPECT_EQ(wait(200), -1) << "no commit waits";
        EXPECT_EQ(set("weight=3"), 0u);
    }
    (void)act(ACTION_CONFIRM);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_NOT_FOUND));
}

// --- Events and permissions

TEST_F(Mgmtd, AViewerChangesNothingAndSeesNoPassword) {
    write("# geheim before\n[" + GROUP + "]\npassword = geheim\n");
    (void)load();
    server_peer_opened(&daemon, 4, "mgmtctl-9", {"user 7", false});
    follow(4, {EVENT_CONFIG_CHANGE});
    asker = 4;
    const auto refused = [&] {
        EXPECT_EQ(message(), "user 7 may look, but not change anything");
        return code() == LC_BAD_LOGIN;
    };
    for (const uint32_t flags : {0u, uint32_t{bn_cf_check_only}}) {
        (void)set("password=geheim", flags);
        EXPECT_TRUE(refused()) << "nor a check, which would tell whether the password is right";
    }
    action(4, ACTION_CONFIRM, {});
    EXPECT_TRUE(refused());
    (void)report(4, EVENT_RAISE_ALARM, {{"alarm_type", {bn_type_str, "196638"}}});
    EXPECT_TRUE(refused() && daemon.alarm_owners.empty());

    asker = 3;
    ASSERT_EQ(set("password=secret"), 0u);
    EXPECT_EQ(events(4), std::vector<strings>{{"51/password=********>********"}});
    EXPECT_EQ(changes(), "51/password=geheim>secret");
}

TEST_F(Mgmtd, AnInterestGetsTheChangesThatItsPatternsMatch) {
    EXPECT_EQ(set(NODE_SYSTEM_MODE "=bridge " NODE_SYSTEM_BONDING "=true"), 0u);
    EXPECT_EQ(changes(), NODE_SYSTEM_MODE "=router>bridge");
    (void)act(ACTION_ADD_INTEREST, {{"match/1/pattern", {bn_type_str, "/a"}}});
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_BAD_ARGUMENT));
    const owned_request large(make_event("/a", {{"a", {bn_type_str, std::string(GCL_FRAME_MAX, 'x')}}}));
    clear();
    EXPECT_FALSE(server_send_request(&daemon, 1, large.pointer));
    EXPECT_TRUE(sent.empty()) << "wccpd would end its session";
    (void)act(ACTION_ADD_INTEREST, std::vector<event_field>(1025, {"a", {bn_type_str, ""}}));
    EXPECT_EQ(message(), "more than 1024 fields");
    (void)act("/mgmtd/reboot");
    EXPECT_EQ(message(), "No such action: /mgmtd/reboot");
    const auto add = [&](size_t number, size_t length) {
        (void)act(ACTION_ADD_INTEREST, {{"event_name", {bn_type_name, "/event/" + std::to_string(number)}},
                                        {"match/1/pattern", {bn_type_str, "/" + std::string(length, 'a')}}});
        return code();
    };
    EXPECT_EQ(add(0, INTEREST_BYTES_MAX), static_cast<uint32_t>(LC_NO_SPACE));
    for (size_t i = 0; i < INTERESTS_MAX; i++)
        EXPECT_EQ(add(i, 1), 0u);
    EXPECT_EQ(add(INTERESTS_MAX, 1), static_cast<uint32_t>(LC_NO_SPACE));
    EXPECT_EQ(add(0, 2), 0u) << "one is replaced";
}

} // namespace
