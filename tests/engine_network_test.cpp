// Sockets of an interface against a real one: a veth pair whose other end lies in a namespace of its own,
// where the routers are. The receive thread is left out, but where it is the matter: datagrams are read by
// hand.

#include "engine/wccp_network.h"

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <cstring>

#include "engine/cthread.h"
#include "engine/wccp_config.h"
#include "engine/wccp_link_mgr.h"
#include "runtime/common.h"
#include "tests/support/engine_fixture.h"

namespace {

int option(int fd, int name) {
    int value = 0;
    socklen_t length = sizeof value;
    EXPECT_EQ(getsockopt(fd, IPPROTO_IP, name, &value, &length), 0);
    return value;
}

sockaddr_in bound_to(int fd) {
    sockaddr_in out = {};
    socklen_t length = sizeof out;
    EXPECT_EQ(getsockname(fd, reinterpret_cast<sockaddr *>(&out), &length), 0);
    return out;
}

size_t open_descriptors() {
    size_t count = 0;
    DIR *directory = opendir("/proc/self/fd");
    while (readdir(directory))
        count++;
    closedir(directory);
    return count;
}

class Network : public testing::Test {
protected:
    // A table entry without a receive thread: whoever reads does so by hand.
    static wccp_interface *bare(const char *name) {
        wccp_interface *interface = &wccp_g.interfaces[wccp_g.if_count++];
        strlcpy(interface->name, name, sizeof interface->name);
        interface->ipa = ipa("10.0.0.100");
        interface->rx_thread = wccp_g.interfaces[0].rx_thread;
        return interface;
    }
    static wccp_pkt packet(uint32_t length, uint8_t fill) {
        wccp_pkt pkt = {};
        pkt.length = length;
        memset(pkt.data, fill, length);
        return pkt;
    }
    void TearDown() override { wan->groups = nullptr; } // which lie on the stack of a test

    engine_fixture engine; // whose sockets are open
    wccp_interface *wan = engine.interface;
    wccp_service_group group = {};
};

TEST_F(Network, NoAddressMeansNoSocketsAndNoThread) {
    wan->rx_thread = nullptr;
    wan->ipa = {};
    EXPECT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_TRUE(wan->ucast_fd == -1 && wan->mcast_fd == -1);
    EXPECT_EQ(wan->rx_thread, nullptr);
    const auto before = std::chrono::steady_clock::now();
    wccp_pkt pkt = {};
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 0);
    EXPECT_GE(std::chrono::steady_clock::now() - before, std::chrono::milliseconds(950));
}

TEST_F(Network, SocketsCarryTheirOptions) {
    EXPECT_TRUE(wan->ucast_bound == 1 && wan->mcast_bound == 0);
    EXPECT_EQ(bound_to(wan->ucast_fd).sin_addr.s_addr, address_word("10.0.0.100"));
    EXPECT_EQ(bound_to(wan->ucast_fd).sin_port, htons(2048));
    EXPECT_EQ(bound_to(wan->mcast_fd).sin_port, 0);
    EXPECT_EQ(option(wan->ucast_fd, IP_MTU_DISCOVER), IP_PMTUDISC_DONT);
    EXPECT_EQ(option(wan->mcast_fd, IP_MTU_DISCOVER), IP_PMTUDISC_DONT);
    EXPECT_EQ(option(wan->mcast_fd, IP_MULTICAST_TTL), 5);
    EXPECT_EQ(option(wan->mcast_fd, IP_MULTICAST_LOOP), 0);
    EXPECT_EQ(static_cast<uint32_t>(option(wan->mcast_fd, IP_MULTICAST_IF)), address_word("10.0.0.100"));
}

TEST_F(Network, OneThreadOutlivesTheSockets) {
    wan->rx_thread = nullptr;
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    const cthread *thread = wan->rx_thread;
    ASSERT_NE(thread, nullptr);
    EXPECT_STREQ(thread->name, "WCCP_RX_wan0");
    const size_t descriptors = open_descriptors();
    run_command("ip addr add 10.0.0.9/24 dev wan0");
    wan->ipa = ipa("10.0.0.9");
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_EQ(wan->rx_thread, thread);
    EXPECT_EQ(threads_named("WCCP_RX_wan0"), 1);
    EXPECT_EQ(bound_to(wan->ucast_fd).sin_addr.s_addr, address_word("10.0.0.9"));
    EXPECT_EQ(open_descriptors(), descriptors);
}

TEST_F(Network, AFailedBindLeavesTheSocketOpenAndStopsAllSending) {
    const size_t descriptors = open_descriptors();
    wan->ipa = ipa("10.9.9.9"); // nobody here has it
    EXPECT_EQ(wccp_init_network_by_interface(wan), 1);
    EXPECT_GE(wan->ucast_fd, 0);
    EXPECT_EQ(wan->ucast_bound, 0u);
    EXPECT_EQ(wan->mcast_fd, -1);
    wccp_if_add_group(&group, wan);
    group.mcast_configured = 1;
    group.mcast_ipa = ipa("224.0.0.5");
    wccp_pkt pkt = packet(100, 1);
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 0);
    EXPECT_TRUE(is_zero(pkt.ipa));
    wan->ipa = ipa("10.0.0.100");
    EXPECT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_EQ(open_descriptors(), descriptors);
}

TEST_F(Network, JoiningBindsOnceAndRepeatsWithoutHarm) {
    EXPECT_EQ(wccp_join_mc_grp(bare("closed0"), ipa("224.0.1.5")), 1);
    for (const char *address : {"224.0.1.5", "224.0.1.5", "224.0.1.6"})
        EXPECT_EQ(wccp_join_mc_grp(wan, ipa(address)), 0);
    EXPECT_EQ(wan->mcast_bound, 1u);
    EXPECT_EQ(bound_to(wan->mcast_fd).sin_addr.s_addr, address_word("224.0.1.5"));
    EXPECT_EQ(bound_to(wan->mcast_fd).sin_port, htons(2048));
    run_command("ip maddr show dev wan0 | grep -q 224.0.1.6");
    EXPECT_EQ(wccp_join_mc_grp(wan, ipa("10.0.0.1")), 1);

    // A new pair of sockets joins what its groups want, and may be bound elsewhere.
    wccp_service_group silent = {};
    wccp_if_add_group(&silent, wan);
    wccp_if_add_group(&group, wan);
    group.mcast_configured = 1;
    group.mcast_ipa = ipa("224.0.1.7");
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_EQ(bound_to(wan->mcast_fd).sin_addr.s_addr, address_word("224.0.1.7"));
}

TEST_F(Network, TheTtlReachesEverySocketThatTakesIt) {
    wccp_interface *bad = bare("bad0"), *closed = bare("closed0"), *last = bare("last0");
    bad->mcast_fd = open("/dev/null", O_RDONLY);
    ASSERT_EQ(wccp_init_network_by_interface(last), 0);
    EXPECT_EQ(wccp_set_mcast_ttl(5), 0) << "in force already: no socket is touched";
    EXPECT_EQ(wccp_set_mcast_ttl(0x1ff), 1);
    EXPECT_EQ(wccp_g.mcast_ttl, 255);
    EXPECT_EQ(option(wan->mcast_fd, IP_MULTICAST_TTL), 255);
    EXPECT_EQ(option(last->mcast_fd, IP_MULTICAST_TTL), 255);
    EXPECT_EQ(closed->mcast_fd, -1);
    wccp_close_sockets(bad);
    EXPECT_EQ(wccp_set_mcast_ttl(0), 0);
    EXPECT_EQ(wccp_g.mcast_ttl, 33);
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_EQ(option(wan->mcast_fd, IP_MULTICAST_TTL), 33);
}

TEST_F(Network, ThePacketGoesWhereTheGroupSays) {
    const std::vector<uint8_t> expected(120, 0x5a), nothing;
    for (const char *router : {"10.0.0.2", "10.0.0.3"})
        engine.router_socket(router);
    engine.peer.run("ip route add 224.0.0.0/4 dev peer0");
    const int listener = engine.sockets["224.0.1.5"] = engine.peer.udp_socket("224.0.1.5", 2048);
    ip_mreq membership = {};
    membership.imr_multiaddr.s_addr = address_word("224.0.1.5");
    membership.imr_interface.s_addr = address_word("10.0.0.2");
    ASSERT_EQ(setsockopt(listener, IPPROTO_IP, IP_ADD_MEMBERSHIP, &membership, sizeof membership), 0);

    wccp_pkt pkt = packet(120, 0x5a);
    EXPECT_EQ(wccp_tx_pkt(nullptr, &pkt), 0);
    EXPECT_EQ(wccp_tx_pkt(&group, nullptr), 0);
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 0) << "no interface";
    wccp_if_add_group(&group, wan);
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 0) << "nobody to send to";
    group.ucast_routers[group.ucast_router_count++] = ipa("10.0.0.2");
    group.ucast_routers[group.ucast_router_count++] = ipa("10.0.0.3");
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 240);
    EXPECT_EQ(pkt.ipa, ipa("10.0.0.3"));
    EXPECT_EQ(engine.sent_to("10.0.0.2"), expected);
    EXPECT_EQ(engine.sent_to("10.0.0.3"), expected);
    pkt.ipa = ipa("10.0.0.2");
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 120) << "the packet's own address goes first";
    EXPECT_EQ(engine.sent_to("10.0.0.2"), expected);

    // With a multicast address the unicast routers get nothing.
    pkt.ipa = {};
    group.mcast_configured = 1;
    group.mcast_ipa = ipa("224.0.1.5");
    ASSERT_EQ(wccp_join_mc_grp(wan, group.mcast_ipa), 0);
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 120);
    EXPECT_EQ(pkt.ipa, group.mcast_ipa);
    const datagram got = receive_datagram(listener);
    EXPECT_EQ(got.bytes, expected);
    EXPECT_EQ(got.from, "10.0.0.100");
    for (const char *router : {"10.0.0.2", "10.0.0.3"})
        EXPECT_EQ(engine.sent_to(router), nothing);

    // What sendto says is handed on, and added up in the loop.
    group.mcast_configured = 0;
    pkt.ipa = {};
    run_command("ip link set wan0 down");
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), -2);
}

TEST_F(Network, OneDatagramIsReadAtATimeAndTheMulticastSocketFirst) {
    ASSERT_EQ(wccp_join_mc_grp(wan, ipa("224.0.1.5")), 0);
    const int router = engine.router_socket("10.0.0.3");
    engine.peer.run("ip route add 224.0.0.0/4 dev peer0");
    const auto send = [router](const char *to, size_t size, uint8_t fill) {
        send_datagram(router, to, 2048, std::vector<uint8_t>(size, fill));
    };
    send("10.0.0.100", 10, 1);
    send("224.0.1.5", 20, 2);
    wccp_pkt pkt = {};
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 20);
    EXPECT_EQ(pkt.ipa, ipa("10.0.0.3"));
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 10);
    EXPECT_TRUE(pkt.data[0] == 1 && pkt.data[10] == 2);

    // As long as the buffer, and longer: no byte behind it is written.
    send("10.0.0.100", 4096, 3);
    send("10.0.0.100", 5000, 4);
    send("10.0.0.100", 3000, 5);
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 4096);
    EXPECT_EQ(pkt.data[4095], 3);
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 4096);
    EXPECT_EQ(pkt.data[4095], 4);
    memset(pkt.data, 0, sizeof pkt.data);
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 100), 100);
    EXPECT_TRUE(pkt.data[99] == 5 && pkt.data[100] == 0);
}

TEST_F(Network, DescriptorsBeyondAThousandAreWaitedOn) {
    rlimit limit = {};
    getrlimit(RLIMIT_NOFILE, &limit);
    const rlimit before = limit;
    limit.rlim_cur = 2048;
    if (setrlimit(RLIMIT_NOFILE, &limit) != 0)
        GTEST_SKIP() << "no more than " << before.rlim_max << " descriptors here";
    const int router = engine.router_socket("10.0.0.3");
    wccp_close_sockets(wan);
    std::vector<int> fillers;
    while (fillers.empty() || fillers.back() < 1100)
        fillers.push_back(open("/dev/null", O_RDONLY | O_CLOEXEC));
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_GT(wan->ucast_fd, 1023);
    send_datagram(router, "10.0.0.100", 2048, std::vector<uint8_t>(10, 1));
    wccp_pkt pkt = {};
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 10);
    wccp_close_sockets(wan);
    for (const int fd : fillers)
        close(fd);
    setrlimit(RLIMIT_NOFILE, &before);
}

TEST_F(Network, TheKernelIsAskedForAddressAndState) {
    EXPECT_TRUE(link_becomes("wan0", 1));
    EXPECT_EQ(wccp_get_address("wan0"), ipa("10.0.0.100"));
    EXPECT_EQ(wccp_get_if_status("nowhere0"), 0u);
    for (const char *name : {"nowhere0", "a-name-longer-than-sixteen-bytes"})
        EXPECT_TRUE(is_zero(wccp_get_address(name)));
    engine.peer.run("ip link set peer0 down"); // up, but not running
    EXPECT_TRUE(link_becomes("wan0", 0));
    run_command("ip link show wan0 | grep -q '[<,]UP[,>]'");
    run_command("ip addr flush dev wan0");
    EXPECT_TRUE(is_zero(wccp_get_address("wan0")));
}

} // namespace
