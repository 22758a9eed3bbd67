// Sending routers with GRE tunnels, with tunneld on the other side of the mailbox.
#include <memory>
#include <vector>

#include <gtest/gtest.h>

#include "engine/wccp_router_utils.h"
#include "engine/wccp_tunnel.h"
#include "engine/wccp_utils.h"
#include "engine/wccpd_common.h"
#include "tests/support/fake_tunneld.h"
#include "tests/support/reported_group.h"

namespace {

const wccp_rtr_capabilities GRE = {1, 1, 1};

struct TunnelledRouters : testing::Test {
    static void SetUpTestSuite() {
        write_mem_conf();
        ASSERT_EQ(wccp_init_shmem(), 0);
    }
    ~TunnelledRouters() override {
        wccp_del_all_tunnels();
        shared.reset();
        EXPECT_EQ(wccp_g.stat_allocs.load(), wccp_g.stat_frees.load());
    }
    std::vector<uint16_t> codes() {
        std::vector<uint16_t> found;
        for (const seen_command &command : tunneld.take_commands())
            found.push_back(command.code);
        return found;
    }
    fake_tunneld tunneld{tunneld_does};
    std::unique_ptr<reported_group> shared = std::make_unique<reported_group>(false);
    wccp_service_group *group = shared->group;
};

TEST_F(TunnelledRouters, GetATunnelEachAndGiveItBack) {
    const wccp_rtr_capabilities gre_return = {2, 1, 1};
    ASSERT_NE(wccp_create_sending_router(group, ROUTER_A, &GRE, &GRE), nullptr);
    wccp_sending_router *b = wccp_create_sending_router(group, ROUTER_B, &gre_return, &gre_return);
    ASSERT_NE(b, nullptr);
    EXPECT_EQ(b->flags, WCCP_RTR_ONE_WAY | WCCP_RTR_HAS_TUNNEL);
    EXPECT_EQ(codes(), (std::vector<uint16_t>{MAILBOX_ADD_TUNNEL, MAILBOX_ADD_TUNNEL}));
    tunneld.answer_with([](const seen_command &) { return tunneld_answer{1, 5}; });
    EXPECT_EQ(wccp_create_sending_router(group, ROUTER_C, &GRE, &GRE), nullptr);
    EXPECT_EQ(group->sending_router_count, 2u);
    tunneld.answer_with(tunneld_does);
    codes();
    wccp_g.seconds += 40;
    wccp_monitor_sending_routers(group);
    EXPECT_EQ(group->sending_router_count, 0u);
    EXPECT_EQ(codes(), (std::vector<uint16_t>{MAILBOX_DELETE_TUNNEL, MAILBOX_DELETE_TUNNEL}));
}

} // namespace
