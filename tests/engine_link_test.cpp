// The reactions to link and address notifications, given by hand in every order that the kernel may choose.

#include "engine/wccp_link_mgr.h"

#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "engine/wccp_config.h"
#include "engine/wccp_host.h"
#include "platform/limits.h"
#include "runtime/common.h"
#include "tests/support/engine_fixture.h"

namespace {

constexpr uint32_t LIMIT = 4;

class Link : public testing::Test {
protected:
    static void SetUpTestSuite() {
        mkdir("/etc/opt/rvl", 0755);
        FILE *conf = fopen(PLATFORM_CONF_PATH, "w");
        ASSERT_NE(conf, nullptr);
        fprintf(conf, "max_interfaces %u\n", LIMIT);
        fclose(conf);
    }
    void SetUp() override {
        fresh_engine();
        strlcpy(wccp_primary_wan_interface_name, "wan0", sizeof wccp_primary_wan_interface_name);
        peer.link("wan0", "", "rt0", "10.1.0.2/24");
        ASSERT_TRUE(link_becomes("wan0", 1));
        router = peer.udp_socket("10.1.0.2", 2048);
        wan = wccp_if_add_interface("wan0");
        ASSERT_NE(wan, nullptr);
    }
    void TearDown() override {
        end_engine();
        close(router);
        run_command("ip link del wan0");
    }
    static wccp_service_group *add_group(uint8_t id) {
        const wccp_grp_config config = engine_fixture::group_config(id, {"10.1.0.2"});
        EXPECT_EQ(wccp_add_group(&config), 0);
        return wccp_find_group(id);
    }
    static void make_active(wccp_service_group *group) {
        group->state_flags = (group->state_flags & ~WCCP_STATE_MASK) | WCCP_STATE_ACTIVE;
    }
    static void tell_link(const char *name, uint32_t admin_up, uint32_t link_up) {
        qv_if_state_info info = {};
        strlcpy(info.name, name, sizeof info.name);
        info.admin_up = admin_up;
        info.link_up = link_up;
        wccp_process_if_state_change(&info);
    }
    static void set_address(const char *address) {
        run_command("ip addr flush dev wan0");
        if (address)
            run_command(std::string("ip addr add ") + address + "/24 dev wan0");
        wccp_process_if_ipa_update("wan0");
    }

    peer_network peer;
    int router = -1;
    wccp_interface *wan = nullptr;
};

TEST_F(Link, TheTableGrowsToItsLimitAndKnowsNobodyTwice) {
    EXPECT_EQ(wan->ready_flags, WCCP_LINK_READY);
    EXPECT_EQ(wan->rx_thread, nullptr);
    EXPECT_EQ(wan->ucast_fd, -1);
    EXPECT_EQ(wccp_if_add_interface("wan0"), wan);
    const wccp_interface *lo = wccp_if_add_interface("lo");
    ASSERT_EQ(lo, &wccp_g.interfaces[1]);
    EXPECT_EQ(lo->ipa, ipa("127.0.0.1"));
    EXPECT_EQ(lo->ready_flags, WCCP_ALL_READY);
    EXPECT_EQ(lo->ucast_bound, 1u);
    EXPECT_EQ(wccp_g.primary_if, wan);
    const wccp_interface *absent = wccp_if_add_interface("absent0");
    ASSERT_NE(absent, nullptr);
    EXPECT_EQ(absent->ready_flags, 0u);
    EXPECT_NE(wccp_if_add_interface("absent1"), nullptr);
    EXPECT_EQ(wccp_if_add_interface("absent2"), nullptr);
    EXPECT_EQ(wccp_if_find_interface("absent2"), nullptr);
    EXPECT_EQ(wccp_if_add_interface("absent1"), &wccp_g.interfaces[3]);
    wccp_grp_config config = engine_fixture::group_config(1, {});
    strlcpy(config.interface, "absent2", sizeof config.interface);
    EXPECT_EQ(wccp_add_group(&config), 1);

    wccp_service_group group = {};
    for (uint32_t i = 0; i < LIMIT; i++)
        EXPECT_EQ(wccp_if_add_group(&group, &wccp_g.interfaces[i]), 0);
    EXPECT_EQ(wccp_if_add_group(&group, wan), 1);
    EXPECT_EQ(wccp_if_add_group(nullptr, wan), 1);
    EXPECT_EQ(wccp_if_add_group(&group, nullptr), 1);
    for (wccp_interface &interface : wccp_g.interfaces)
        interface.groups = nullptr;
}

TEST_F(Link, WhatConcernsNobodyIsIgnored) {
    const wccp_interface before = *wan;
    tell_link("other0", 0, 0);
    wccp_process_if_ipa_update("other0");
    wccp_process_if_ipa_update(nullptr);
    wccp_process_if_state_change(nullptr);
    tell_link("wan0", 1, 1); // up already
    EXPECT_EQ(wccp_g.if_count, 1);
    run_command("ip addr add 10.1.0.1/24 dev wan0");
    wccpd_exiting = 1;
    tell_link("wan0", 0, 0);
    wccp_process_if_ipa_update("wan0");
    EXPECT_EQ(memcmp(&before, wan, sizeof before), 0);
    wccpd_exiting = 0;
    for (int i = 0; i < 2; i++) { // the second time it is the same address
        wccp_process_if_ipa_update("wan0");
        EXPECT_TRUE(wan->ipa_change_count == 1 && wan->start_count == 1);
    }
}

TEST_F(Link, TheLinkStopsAndStartsTheGroups) {
    set_address("10.1.0.1");
    wccp_service_group *group = add_group(61);
    EXPECT_EQ(group->hia_timer.active, 1);
    make_active(group);
    tell_link("wan0", 1, 0); // up by its administrator, without a carrier
    EXPECT_EQ(wan->link_up, 0u);
    EXPECT_EQ(wan->ready_flags, WCCP_IPA_READY);
    EXPECT_EQ(group->hia_timer.active, 0);
    EXPECT_EQ(group->state_flags, WCCP_STATE_INIT);
    tell_link("wan0", 0, 1);
    tell_link("wan0", 0, 0);
    EXPECT_TRUE(wan->link_down_count == 1 && wan->stop_count == 1);
    tell_link("wan0", 1, 1);
    EXPECT_EQ(wan->ready_flags, WCCP_ALL_READY);
    EXPECT_TRUE(group->hia_timer.active == 1 && group->hia_timer.countdown == 1);
    EXPECT_TRUE(receive_datagram(router, 0).bytes.empty()) << "no farewell over a link that is gone";
    EXPECT_EQ(group->tx_link_drops, 1u);
}

TEST_F(Link, AddressAndLinkInEitherOrderEndInReady) {
    const wccp_service_group *group = add_group(61);
    for (const bool link_first : {true, false}) {
        set_address(nullptr);
        tell_link("wan0", 0, 0);
        EXPECT_EQ(wan->ready_flags, 0u);
        if (link_first)
            tell_link("wan0", 1, 1);
        set_address("10.1.0.1");
        EXPECT_EQ(group->hia_timer.active, link_first ? 1 : 0);
        tell_link("wan0", 1, 1);
        EXPECT_EQ(wan->ready_flags, WCCP_ALL_READY);
        EXPECT_EQ(group->hia_timer.active, 1);
        EXPECT_EQ(group->appliance_ipa, ipa("10.1.0.1"));
    }
}

// Deleted and made again while the notifier waited: what it reads when it gets the lock is the old address.
TEST_F(Link, AnInterfaceMadeAgainWithItsAddressIsJoinedAgain) {
    set_address("10.1.0.1");
    wccp_grp_config config = engine_fixture::group_config(61, {"224.0.1.61"});
    ASSERT_EQ(wccp_add_group(&config), 0);
    ASSERT_EQ(wan->mcast_bound, 1u);
    run_command("ip maddr show dev wan0 | grep -q 224.0.1.61");
    run_command("ip link del wan0");
    peer.link("wan0", "10.1.0.1/24", "rt0", "10.1.0.2/24");
    ASSERT_TRUE(link_becomes("wan0", 1));
    run_command("! ip maddr show dev wan0 | grep -q 224.0.1.61");
    wccp_process_if_ipa_update("wan0");
    EXPECT_EQ(wan->ipa_change_count, 1u);
    EXPECT_EQ(wan->ready_flags, WCCP_ALL_READY);
    run_command("ip maddr show dev wan0 | grep -q 224.0.1.61");
    const int32_t fd = wan->mcast_fd;
    wccp_process_if_ipa_update("wan0");
    EXPECT_EQ(wan->mcast_fd, fd) << "the same device: nothing to open";
}

TEST_F(Link, AnAddressComesChangesAndGoes) {
    wccp_service_group *group = add_group(61), *other = add_group(62);
    EXPECT_TRUE(is_zero(group->appliance_ipa));
    set_address("10.1.0.1");
    EXPECT_EQ(wan->ucast_bound, 1u);
    EXPECT_NE(wan->rx_thread, nullptr);
    EXPECT_EQ(group->hia_timer.active, 1);
    EXPECT_EQ(other->appliance_ipa, ipa("10.1.0.1"));
    wccp_tick();
    for (int i = 0; i < 2; i++) { // the web-cache id stands 4 bytes into the fourth component
        const datagram first = receive_datagram(router);
        ASSERT_GE(first.bytes.size(), 52u);
        EXPECT_EQ(first.from, "10.1.0.1");
        EXPECT_EQ(memcmp(&first.bytes[48], "\x0a\x01\x00\x01", 4), 0);
    }

    // The farewell of the old address comes from the old socket, as long as the kernel lets it.
    make_active(group);
    run_command(
        "ip addr flush dev wan0 && ip addr add 10.1.0.7/24 dev wan0 && ip addr add 10.1.0.1/32 dev lo");
    wccp_process_if_ipa_update("wan0");
    const datagram farewell = receive_datagram(router);
    ASSERT_GE(farewell.bytes.size(), 12u);
    EXPECT_EQ(farewell.from, "10.1.0.1");
    EXPECT_EQ(memcmp(farewell.bytes.data() + farewell.bytes.size() - 4, "\x0a\x01\x00\x01", 4), 0);
    EXPECT_EQ(group->appliance_ipa, ipa("10.1.0.7"));
    EXPECT_EQ(group->state_flags, WCCP_STATE_INIT);
    EXPECT_EQ(group->hia_timer.active, 1);
    sockaddr_in bound = {};
    socklen_t length = sizeof bound;
    getsockname(wan->ucast_fd, reinterpret_cast<sockaddr *>(&bound), &length);
    EXPECT_EQ(bound.sin_addr.s_addr, address_word("10.1.0.7"));
    run_command("ip addr flush dev lo && ip addr add 127.0.0.1/8 dev lo");

    make_active(group);
    const int32_t fd = wan->ucast_fd;
    set_address(nullptr);
    EXPECT_TRUE(receive_datagram(router, 0).bytes.empty()) << "nothing to send a farewell from";
    EXPECT_TRUE(is_zero(group->appliance_ipa));
    EXPECT_EQ(group->hia_timer.active, 0);
    EXPECT_EQ(wan->ready_flags, WCCP_LINK_READY);
    EXPECT_EQ(wan->ucast_fd, fd) << "the sockets stay until the next address";
    EXPECT_EQ(wan->ipa_change_count, 3u);

    wccp_deinit_link_mgr();
    EXPECT_TRUE(wan->ucast_fd == -1 && wan->mcast_fd == -1 && wan->ucast_bound == 0);
}

} // namespace
