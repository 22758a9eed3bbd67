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
#include <fstream>
#include <new>
#include <thread>

#include "engine/cthread.h"
#include "engine/wccp_config.h"
#include "engine/wccp_link_mgr.h"
#include "runtime/common.h"
#include "tests/support/peer_network.h"

namespace {

be32 ipa(const std::string &text) {
    return from_raw_word(address_word(text));
}

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

int threads_named(const std::string &wanted) {
    int count = 0;
    DIR *directory = opendir("/proc/self/task");
    while (const dirent *entry = readdir(directory)) {
        std::ifstream file(std::string("/proc/self/task/") + entry->d_name + "/comm");
        std::string name;
        if (std::getline(file, name) && name == wanted)
            count++;
    }
    closedir(directory);
    return count;
}

class Network : public testing::Test {
protected:
    void SetUp() override {
        new (&wccp_g) wccp_global{};
        wccp_g.mcast_ttl = 5;
        wccp_init_network();
        peer.link("wan0", "10.1.0.1/24", "rt0", "10.1.0.2/24");
        peer.run("ip addr add 10.1.0.3/24 dev rt0");
        peer.run("ip route add 224.0.0.0/4 dev rt0");
        wan = bare("wan0", "10.1.0.1");
    }
    void TearDown() override {
        cthread_cancel_all();
        for (wccp_interface &interface : wccp_g.interfaces)
            wccp_close_sockets(&interface);
        run_command("ip link del wan0");
    }

    // An entry without a receive thread: whoever reads does so by hand.
    wccp_interface *bare(const char *name, const std::string &address) {
        wccp_interface *interface = &wccp_g.interfaces[wccp_g.if_count++];
        strlcpy(interface->name, name, sizeof interface->name);
        interface->ipa = ipa(address);
        interface->ucast_fd = interface->mcast_fd = -1;
        interface->rx_thread = reinterpret_cast<cthread *>(this);
        return interface;
    }
    void put_on_interface(wccp_service_group *group) { wccp_if_add_group(group, wan); }
    static wccp_pkt packet(uint32_t length, uint8_t fill) {
        wccp_pkt pkt = {};
        pkt.length = length;
        memset(pkt.data, fill, length);
        return pkt;
    }

    peer_network peer;
    wccp_interface *wan;
};

TEST_F(Network, NoAddressMeansNoSocketsAndNoThread) {
    wan->rx_thread = nullptr;
    wan->ipa = {};
    EXPECT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_EQ(wan->ucast_fd, -1);
    EXPECT_EQ(wan->mcast_fd, -1);
    EXPECT_EQ(wan->rx_thread, nullptr);

    const auto before = std::chrono::steady_clock::now();
    wccp_pkt pkt = {};
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 0);
    EXPECT_GE(std::chrono::steady_clock::now() - before, std::chrono::milliseconds(950));
}

TEST_F(Network, SocketsCarryTheirOptions) {
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_EQ(wan->ucast_bound, 1u);
    EXPECT_EQ(wan->mcast_bound, 0u);
    EXPECT_EQ(bound_to(wan->ucast_fd).sin_addr.s_addr, address_word("10.1.0.1"));
    EXPECT_EQ(bound_to(wan->ucast_fd).sin_port, htons(2048));
    EXPECT_EQ(bound_to(wan->mcast_fd).sin_port, 0);
    EXPECT_EQ(option(wan->ucast_fd, IP_MTU_DISCOVER), IP_PMTUDISC_DONT);
    EXPECT_EQ(option(wan->mcast_fd, IP_MTU_DISCOVER), IP_PMTUDISC_DONT);
    EXPECT_EQ(option(wan->mcast_fd, IP_MULTICAST_TTL), 5);
    EXPECT_EQ(option(wan->mcast_fd, IP_MULTICAST_LOOP), 0);
    in_addr out_interface = {};
    socklen_t length = sizeof out_interface;
    getsockopt(wan->mcast_fd, IPPROTO_IP, IP_MULTICAST_IF, &out_interface, &length);
    EXPECT_EQ(out_interface.s_addr, address_word("10.1.0.1"));
}

TEST_F(Network, OneThreadOutlivesTheSockets) {
    wan->rx_thread = nullptr;
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    const cthread *thread = wan->rx_thread;
    ASSERT_NE(thread, nullptr);
    EXPECT_STREQ(thread->name, "WCCP_RX_wan0");

    const size_t descriptors = open_descriptors();
    run_command("ip addr add 10.1.0.9/24 dev wan0");
    wan->ipa = ipa("10.1.0.9");
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_EQ(wan->rx_thread, thread);
    EXPECT_EQ(threads_named("WCCP_RX_wan0"), 1);
    EXPECT_EQ(bound_to(wan->ucast_fd).sin_addr.s_addr, address_word("10.1.0.9"));
    EXPECT_EQ(open_descriptors(), descriptors);
}

TEST_F(Network, AFailedBindLeavesTheSocketOpenAndStopsAllSending) {
    wan->ipa = ipa("10.9.9.9"); // nobody here has it
    EXPECT_EQ(wccp_init_network_by_interface(wan), 1);
    EXPECT_GE(wan->ucast_fd, 0);
    EXPECT_EQ(wan->ucast_bound, 0u);
    EXPECT_EQ(wan->mcast_fd, -1);

    wccp_service_group group = {};
    put_on_interface(&group);
    group.mcast_configured = 1;
    group.mcast_ipa = ipa("224.0.0.5");
    wccp_pkt pkt = packet(100, 1);
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 0);
    EXPECT_TRUE(is_zero(pkt.ipa));

    const size_t descriptors = open_descriptors();
    wan->ipa = ipa("10.1.0.1");
    EXPECT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_EQ(open_descriptors(), descriptors + 1);
}

TEST_F(Network, JoiningBindsOnceAndRepeatsWithoutHarm) {
    EXPECT_EQ(wccp_join_mc_grp(wan, ipa("224.0.1.5")), 1);
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_EQ(wccp_join_mc_grp(wan, ipa("224.0.1.5")), 0);
    EXPECT_EQ(wan->mcast_bound, 1u);
    EXPECT_EQ(wccp_join_mc_grp(wan, ipa("224.0.1.5")), 0);
    EXPECT_EQ(wccp_join_mc_grp(wan, ipa("224.0.1.6")), 0);
    EXPECT_EQ(bound_to(wan->mcast_fd).sin_addr.s_addr, address_word("224.0.1.5"));
    EXPECT_EQ(bound_to(wan->mcast_fd).sin_port, htons(2048));
    run_command("ip maddr show dev wan0 | grep -q 224.0.1.6");
    EXPECT_EQ(wccp_join_mc_grp(wan, ipa("10.0.0.1")), 1);

    // A new pair of sockets joins what its groups want, and may be bound elsewhere.
    wccp_service_group silent = {}, group = {};
    put_on_interface(&silent);
    put_on_interface(&group);
    group.mcast_configured = 1;
    group.mcast_ipa = ipa("224.0.1.7");
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_EQ(bound_to(wan->mcast_fd).sin_addr.s_addr, address_word("224.0.1.7"));
}

TEST_F(Network, TheTtlReachesEverySocketThatTakesIt) {
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    const int pipe_like = open("/dev/null", O_RDONLY);
    wccp_interface *bad = bare("bad0", "10.1.0.1");
    bad->mcast_fd = pipe_like;
    wccp_interface *closed = bare("closed0", "10.1.0.1");
    wccp_interface *last = bare("last0", "10.1.0.1");
    ASSERT_EQ(wccp_init_network_by_interface(last), 0);

    EXPECT_EQ(wccp_set_mcast_ttl(5), 0) << "in force already: no socket is touched";
    EXPECT_EQ(wccp_set_mcast_ttl(0x1ff), 1);
    EXPECT_EQ(wccp_g.mcast_ttl, 255);
    EXPECT_EQ(option(wan->mcast_fd, IP_MULTICAST_TTL), 255);
    EXPECT_EQ(option(last->mcast_fd, IP_MULTICAST_TTL), 255);
    EXPECT_EQ(closed->mcast_fd, -1);
    bad->mcast_fd = -1;
    close(pipe_like);
    EXPECT_EQ(wccp_set_mcast_ttl(0), 0);
    EXPECT_EQ(wccp_g.mcast_ttl, 33);
    EXPECT_EQ(option(wan->mcast_fd, IP_MULTICAST_TTL), 33);
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_EQ(option(wan->mcast_fd, IP_MULTICAST_TTL), 33);
}

TEST_F(Network, ThePacketGoesWhereTheGroupSays) {
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    const int first = peer.udp_socket("10.1.0.2", 2048), second = peer.udp_socket("10.1.0.3", 2048);
    const int group_listener = peer.udp_socket("224.0.1.5", 2048);
    ip_mreq membership = {};
    membership.imr_multiaddr.s_addr = address_word("224.0.1.5");
    membership.imr_interface.s_addr = address_word("10.1.0.2");
    ASSERT_EQ(setsockopt(group_listener, IPPROTO_IP, IP_ADD_MEMBERSHIP, &membership, sizeof membership), 0);

    wccp_service_group group = {};
    wccp_pkt pkt = packet(120, 0x5a);
    EXPECT_EQ(wccp_tx_pkt(nullptr, &pkt), 0);
    EXPECT_EQ(wccp_tx_pkt(&group, nullptr), 0);
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 0) << "no interface";
    put_on_interface(&group);
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 0) << "nobody to send to";

    group.ucast_routers[group.ucast_router_count++] = ipa("10.1.0.2");
    group.ucast_routers[group.ucast_router_count++] = ipa("10.1.0.3");
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 240);
    EXPECT_EQ(pkt.ipa, ipa("10.1.0.3"));
    for (const int fd : {first, second}) {
        const datagram got = receive_datagram(fd);
        EXPECT_EQ(got.bytes, std::vector<uint8_t>(120, 0x5a));
        EXPECT_EQ(got.from, "10.1.0.1");
    }
    pkt.ipa = ipa("10.1.0.2");
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 120) << "the packet's own address goes first";
    EXPECT_EQ(receive_datagram(first).bytes.size(), 120u);

    // With a multicast address the unicast routers get nothing.
    pkt.ipa = {};
    group.mcast_configured = 1;
    group.mcast_ipa = ipa("224.0.1.5");
    ASSERT_EQ(wccp_join_mc_grp(wan, group.mcast_ipa), 0);
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 120);
    EXPECT_EQ(pkt.ipa, group.mcast_ipa);
    const datagram got = receive_datagram(group_listener);
    EXPECT_EQ(got.bytes.size(), 120u);
    EXPECT_EQ(got.from, "10.1.0.1");
    EXPECT_TRUE(receive_datagram(first, 50).bytes.empty());
    EXPECT_TRUE(receive_datagram(second, 50).bytes.empty());

    // What sendto says is handed on, and added up in the loop.
    group.mcast_configured = 0;
    pkt.ipa = {};
    run_command("ip link set wan0 down");
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), -2);
    for (const int fd : {first, second, group_listener})
        close(fd);
}

TEST_F(Network, OneDatagramIsReadAtATimeAndTheMulticastSocketFirst) {
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    ASSERT_EQ(wccp_join_mc_grp(wan, ipa("224.0.1.5")), 0);
    const int router = peer.udp_socket("10.1.0.3", 4711);
    send_datagram(router, "10.1.0.1", 2048, std::vector<uint8_t>(10, 1));
    send_datagram(router, "224.0.1.5", 2048, std::vector<uint8_t>(20, 2));
    wccp_pkt pkt = {};
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 20);
    EXPECT_EQ(pkt.ipa, ipa("10.1.0.3"));
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 10);
    EXPECT_EQ(pkt.data[0], 1);
    EXPECT_EQ(pkt.data[10], 2);

    // As long as the buffer, and longer: no byte behind it is written.
    send_datagram(router, "10.1.0.1", 2048, std::vector<uint8_t>(4096, 3));
    send_datagram(router, "10.1.0.1", 2048, std::vector<uint8_t>(5000, 4));
    send_datagram(router, "10.1.0.1", 2048, std::vector<uint8_t>(3000, 5));
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 4096);
    EXPECT_EQ(pkt.data[4095], 3);
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 4096);
    EXPECT_EQ(pkt.data[4095], 4);
    memset(pkt.data, 0, sizeof pkt.data);
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 100), 100);
    EXPECT_EQ(pkt.data[99], 5);
    EXPECT_EQ(pkt.data[100], 0);
    close(router);
}

TEST_F(Network, DescriptorsBeyondAThousandAreWaitedOn) {
    rlimit limit = {};
    getrlimit(RLIMIT_NOFILE, &limit);
    const rlimit before = limit;
    limit.rlim_cur = 2048;
    if (setrlimit(RLIMIT_NOFILE, &limit) != 0)
        GTEST_SKIP() << "no more than " << before.rlim_max << " descriptors here";
    std::vector<int> fillers;
    while (fillers.empty() || fillers.back() < 1100)
        fillers.push_back(open("/dev/null", O_RDONLY | O_CLOEXEC));
    ASSERT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_GT(wan->ucast_fd, 1023);
    const int router = peer.udp_socket("10.1.0.3", 4711);
    send_datagram(router, "10.1.0.1", 2048, std::vector<uint8_t>(10, 1));
    wccp_pkt pkt = {};
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 10);
    wccp_close_sockets(wan);
    close(router);
    for (const int fd : fillers)
        close(fd);
    setrlimit(RLIMIT_NOFILE, &before);
}

TEST_F(Network, TheKernelIsAskedForAddressAndState) {
    for (int i = 0; i < 300 && !wccp_get_if_status("wan0"); i++)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_EQ(wccp_get_if_status("wan0"), 1u);
    EXPECT_EQ(wccp_get_address("wan0"), ipa("10.1.0.1"));
    EXPECT_EQ(wccp_get_if_status("nowhere0"), 0u);
    EXPECT_TRUE(is_zero(wccp_get_address("nowhere0")));
    EXPECT_TRUE(is_zero(wccp_get_address("a-name-longer-than-sixteen-bytes")));

    peer.run("ip link set rt0 down"); // up, but not running
    for (int i = 0; i < 300 && wccp_get_if_status("wan0"); i++)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    EXPECT_EQ(wccp_get_if_status("wan0"), 0u);
    run_command("ip link show wan0 | grep -q '[<,]UP[,>]'");
    run_command("ip addr flush dev wan0");
    EXPECT_TRUE(is_zero(wccp_get_address("wan0")));
}

} // namespace
