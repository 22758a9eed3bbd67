// The tunnel table with a tunneld that answers, refuses, or does not answer.

#include "engine/wccp_tunnel.h"

#include "engine/wccp_host.h"
#include "engine/wccpd_common.h"
#include "tests/support/fake_tunneld.h"
#include "tests/support/reported_group.h"

namespace {

const be32 self = to_be32(0x0A000001);

be32 router_address(uint32_t number) {
    return to_be32(0x0A000100 + number);
}

struct Tunnels : testing::Test {
    static void SetUpTestSuite() {
        write_mem_conf();
        ASSERT_EQ(wccp_init_shmem(), 0);
    }
    Tunnels() : tunneld(tunneld_does) {
        allocated = wccp_g.stat_allocs - wccp_g.stat_frees;
        wccpd_exiting = 0;
        wccp_g.groups[1] = wccp_g.groups[51] = &group;
    }
    ~Tunnels() override {
        wccp_g.groups[1] = wccp_g.groups[51] = nullptr;
        wccpd_exiting = 0;
        tunneld.answer_with(tunneld_does);
        EXPECT_EQ(wccp_del_all_tunnels(), 0);
        EXPECT_EQ(wccp_g.stat_allocs - wccp_g.stat_frees, allocated) << "every record is freed";
        for (uint32_t i = 0; i < 32; i++)
            EXPECT_EQ(wccp_add_tunnel(1, self, router_address(i)), 0) << "all ids are free again";
        wccp_del_all_tunnels();
    }
    std::vector<seen_command> commands() { return tunneld.take_commands(); }

    fake_tunneld tunneld;
    uint32_t allocated;
    log_lines log;
    wccp_service_group group = {}; // only for its reasons
};

std::optional<tunneld_answer> tunneld_refuses(const seen_command &command) {
    return tunneld_answer{1, command.code == MAILBOX_ADD_TUNNEL ? 5u : command.index};
}

} // namespace

TEST_F(Tunnels, GroupsThatShareARouterShareTheTunnel) {
    EXPECT_EQ(wccp_add_tunnel(51, self, router_address(1)), 0);
    EXPECT_TRUE(log.say("WCCP GRP 51: created GRE tunnel id 1000 10.0.0.1 <=> 10.0.1.1"));
    EXPECT_EQ(wccp_add_tunnel(52, self, router_address(1)), 0);
    EXPECT_EQ(wccp_del_tunnel(51, self, router_address(1), 0), 0);
    EXPECT_EQ(wccp_del_tunnel(51, self, router_address(2), 0), 0) << "no such tunnel";
    using seen = std::vector<seen_command>;
    EXPECT_EQ(commands(), (seen{{MAILBOX_ADD_TUNNEL, 1000, 0x0A000001, 0x0A000101, WCCP_NO_INDEX, 0, 0}}));
    EXPECT_EQ(wccp_del_tunnel(52, self, router_address(1), 0), 0);
    EXPECT_EQ(commands(), (seen{{MAILBOX_DELETE_TUNNEL, 1000, 0x0A000001, 0x0A000101, 2000, 0, 0}}));
    EXPECT_TRUE(log.say("WCCP GRP 52: deleted GRE tunnel id: 1000 10.0.0.1 <=> 10.0.1.1"));
    // By force, in spite of the other reference.
    for (const uint32_t id : {51u, 52u})
        wccp_add_tunnel(id, self, router_address(1));
    EXPECT_EQ(wccp_del_tunnel(0, self, router_address(1), 1), 0);
    EXPECT_TRUE(log.say("WCCP : deleted GRE tunnel id: 1000"));
    EXPECT_EQ(wccp_del_tunnel(52, self, router_address(1), 0), 0);
    EXPECT_EQ(commands().size(), 2u);
}

TEST_F(Tunnels, ThereAreThirtyTwoIdsAndAFreedOneIsUsedNext) {
    for (uint32_t i = 0; i < 32; i++) {
        ASSERT_EQ(wccp_add_tunnel(1, self, router_address(i)), 0);
        log.take();
    }
    EXPECT_EQ(commands().back().tunnel_id, g_qv_encap_wccp_last);
    EXPECT_EQ(wccp_add_tunnel(1, self, router_address(32)), 1);
    EXPECT_TRUE(log.say("WCCP GRP 1: No free tunnel id available"));
    EXPECT_EQ(take_reasons(&group), "tunnel-ids-exhausted 10.0.1.32: |ids 1000 to 1031");
    EXPECT_TRUE(wccp_add_tunnel(1, self, router_address(4)) == 0 && commands().empty())
        << "a known one needs no id";
    for (const uint32_t i : {31u, 7u}) {
        EXPECT_EQ(wccp_del_tunnel(1, self, router_address(i), 0), 0);
        EXPECT_EQ(wccp_add_tunnel(1, self, router_address(32 + i)), 0);
        EXPECT_EQ(commands().back().tunnel_id, g_qv_encap_wccp_first + i);
    }
}

TEST_F(Tunnels, ARefusedAddOrDeleteLeavesNothing) {
    for (const auto answer : {tunneld_refuses, +[](const seen_command &) -> std::optional<tunneld_answer> {
                                  return tunneld_answer{0, WCCP_NO_INDEX};
                              }}) {
        tunneld.answer_with(answer);
        EXPECT_EQ(wccp_add_tunnel(51, self, router_address(1)), 1);
        EXPECT_TRUE(log.say("WCCP GRP 51: failed to add tunnel: id: 1000 10.0.0.1 <=> 10.0.1.1"));
        EXPECT_EQ(take_reasons(&group), "tunnel-refused 10.0.1.1: tunnel id 1000|from 10.0.0.1");
        EXPECT_EQ(wccp_del_tunnel(51, self, router_address(1), 0), 0) << "not in the table";
        EXPECT_EQ(commands().size(), 1u);
    }
    tunneld.answer_with(tunneld_does);
    for (const uint32_t router : {1u, 2u})
        EXPECT_EQ(wccp_add_tunnel(51, self, router_address(router)), 0);
    EXPECT_EQ(commands()[0].tunnel_id, g_qv_encap_wccp_first);
    tunneld.answer_with(tunneld_refuses);
    EXPECT_EQ(wccp_del_tunnel(51, self, router_address(1), 0), 1);
    EXPECT_TRUE(log.say("WCCP GRP 51: failed to delete GRE tunnel id: 1000"));
    wccpd_exiting = 1;
    EXPECT_EQ(wccp_del_tunnel(51, self, router_address(2), 0), 0) << "not logged during the exit";
    EXPECT_FALSE(log.say("failed to delete"));
    wccp_del_all_tunnels();
    EXPECT_EQ(commands().size(), 2u) << "both are gone";
}

TEST_F(Tunnels, RestoreSendsEveryTunnelAgainAndKeepsThemAll) {
    for (uint32_t i = 0; i < 3; i++)
        wccp_add_tunnel(1, self, router_address(i));
    tunneld.answer_with([](const seen_command &command) {
        return command.tunnel_id == g_qv_encap_wccp_first + 1 ? tunneld_refuses(command)
                                                              : tunneld_answer{0, 70u + command.tunnel_id};
    });
    EXPECT_EQ(wccp_restore_all_tunnels(), 0);
    wccp_del_all_tunnels();
    const auto given = commands();
    ASSERT_EQ(given.size(), 9u);
    EXPECT_EQ(given[8].index, 70u + g_qv_encap_wccp_first) << "the new index";
}

// Several threads add and delete tunnels while all are deleted, as at exit: commands do not overlap, and each
// thread gets the answer to its own command.
TEST_F(Tunnels, DeletingAllWhileOthersAddAndDelete) {
    std::atomic<bool> stop = false;
    std::atomic<int> torn = 0;
    tunneld.answer_with([&torn](const seen_command &command) {
        const uint32_t index = command.code == MAILBOX_ADD_TUNNEL ? WCCP_NO_INDEX : 1000u + command.tunnel_id;
        torn += command.index != index || command.local != 0x0A000001 || command.remote >> 8 != 0x0A0001;
        return tunneld_does(command);
    });
    std::vector<std::thread> others;
    for (uint32_t other = 0; other < 3; other++)
        others.emplace_back([other, &stop, &torn] {
            for (uint32_t i = 0; !stop; i++) {
                const be32 router = router_address(100 + other * 20 + i % 8);
                torn += i / 8 % 2 ? wccp_del_tunnel(other, self, router, 0)
                                  : wccp_add_tunnel(other, self, router);
            }
        });
    for (int i = 0; i < 10; i++)
        EXPECT_EQ(wccp_del_all_tunnels(), 0);
    stop = true;
    for (std::thread &other : others)
        other.join();
    EXPECT_EQ(torn, 0);
}
