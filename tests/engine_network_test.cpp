// Interfaces on a real veth pair, whose other end is in the routers' namespace: the sockets, the table of
// interfaces, and notifications, called directly in each order that the kernel may choose.

#include "engine/wccp_packet_io.h"

#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>

#include <chrono>
#include <csignal>
#include <filesystem>
#include <fstream>

#include "platform/limits.h"
#include "tests/support/engine_fixture.h"
#include "tests/support/reported_group.h"
#include "tests/support/test_host.h"

static std::function<void()> after_wait; // called once, when a descriptor is ready

// Replaces the C library's, so that descriptors can change between a receiver's wait and its read.
extern "C" int poll(pollfd *fds, nfds_t count, int wait_ms) {
    const timespec limit = {wait_ms / 1000, wait_ms % 1000 * 1000000L};
    const int ready = ppoll(fds, count, wait_ms < 0 ? nullptr : &limit, nullptr); // a cancellation point
    if (ready > 0 && after_wait)
        std::exchange(after_wait, nullptr)();
    return ready;
}

namespace {

int option_of(int fd, int name) {
    int value = 0;
    socklen_t length = sizeof value;
    EXPECT_EQ(getsockopt(fd, IPPROTO_IP, name, &value, &length), 0);
    return value;
}

std::string bound_to(int fd) { // "10.0.0.100:2048"
    sockaddr_in out = {};
    socklen_t length = sizeof out;
    EXPECT_EQ(getsockname(fd, reinterpret_cast<sockaddr *>(&out), &length), 0);
    return addr_text(from_raw_word(out.sin_addr.s_addr)).s + (":" + std::to_string(ntohs(out.sin_port)));
}

constexpr uint32_t LIMIT = 4; // interfaces in the table

struct Network : testing::Test {
    static void SetUpTestSuite() {
        std::filesystem::create_directories("/etc/opt/rvl");
        std::ofstream(PLATFORM_CONF_PATH) << "max_interfaces " << LIMIT << "\n";
    }
    // A table entry without a receive thread.
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
    // The interface gets its receive thread, and there is a router.
    wccp_service_group *live_group(const std::vector<std::string> &routers = {"10.0.0.2"}) {
        wan->rx_thread = nullptr;
        engine.router_socket("10.0.0.2");
        return engine.add_group(engine_fixture::group_config(61, routers));
    }
    static void notify_link(const char *name, uint32_t admin_up, uint32_t link_up) {
        qv_if_state_info info = {{}, admin_up, link_up};
        strlcpy(info.name, name, sizeof info.name);
        wccp_process_if_state_change(&info);
    }
    static void set_address(const std::string &address) { // "" for none
        run_command("ip addr flush dev wan0");
        if (!address.empty())
            run_command("ip addr add " + address + "/24 dev wan0");
        wccp_process_if_ipa_update("wan0");
    }

    engine_fixture engine; // wan0 has open sockets
    wccp_interface *wan = engine.interface;
    wccp_service_group group = {};
};

TEST_F(Network, NoAddressMeansNoSocketsAndNoThread) {
    wan->rx_thread = nullptr;
    wan->ipa = {};
    EXPECT_EQ(wccp_init_network_by_interface(wan), 0);
    EXPECT_TRUE(wan->ucast_fd == -1 && wan->mcast_fd == -1 && !wan->rx_thread);
    const auto before = std::chrono::steady_clock::now();
    wccp_pkt pkt = {};
    EXPECT_EQ(wccp_rx_pkt(wan, &pkt, 4096), 0);
    EXPECT_GE(std::chrono::steady_clock::now() - before, std::chrono::milliseconds(950));
}

// A set-up that failed, for either cause, is repeated on each of these occasions, and on no other.
TEST_F(Network, AFailedSetUpIsTriedAgain) {
    // A waiting receive thread keeps a closed socket for up to a second: this one shares the port with that
    // one, and with no other.
    const auto own_port = [owner = -1](bool on) mutable {
        if (!on) {
            close(owner);
            return;
        }
        owner = socket(AF_INET, SOCK_DGRAM, 0);
        int shared = 1;
        setsockopt(owner, SOL_SOCKET, SO_REUSEADDR, &shared, sizeof shared);
        EXPECT_EQ(bind_to(owner, to_host(ipa("10.0.0.100")), 2048), 0);
        shared = 0;
        setsockopt(owner, SOL_SOCKET, SO_REUSEADDR, &shared, sizeof shared);
    };
    const auto take_descriptors = [](bool on) {
        rlimit limit;
        getrlimit(RLIMIT_NOFILE, &limit);
        limit.rlim_cur = on ? 3 : limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
    };
    const std::function<void(bool)> causes[] = {own_port, take_descriptors};
    const auto count_descriptors = [] {
        return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {});
    };

    log_lines log;
    live_group();
    const wccp_grp_config unicast = engine_fixture::group_config(61, {"10.0.0.2"}),
                          multicast = engine_fixture::group_config(62, {"224.0.1.62"});
    const std::pair<const char *, std::function<void()>> occasions[] = {
        {"thirty seconds", [] { pass_seconds(30); }},
        {"a link notification", [] { notify_link("wan0", 1, 1); }},
        {"the link comes",
         [] {
             notify_link("wan0", 1, 0);
             notify_link("wan0", 1, 1);
         }},
        {"an address notification", [] { wccp_process_if_ipa_update("wan0"); }},
        {"a group is created again",
         [&] {
             pass_seconds(1);
             EXPECT_TRUE(wccp_del_group(61) == 0 && wccp_add_group(&unicast) == 0);
         }},
        {"a group is enabled",
         [&] {
             pass_seconds(1);
             engine.set_admin(61, WCCP_ADMIN_DOWN);
             engine.set_admin(61, WCCP_ADMIN_UP);
         }},
    };
    for (const auto &cause : causes)
        for (const auto &[occasion, happens] : occasions) {
            SCOPED_TRACE(occasion);
            const auto descriptors = count_descriptors();
            wccp_close_sockets(wan);
            cause(true);
            EXPECT_EQ(wccp_init_network_by_interface(wan), 1);
            EXPECT_TRUE(wan->ucast_bound == 0 && wan->mcast_fd == -1);
            log.take();
            EXPECT_EQ(wccp_add_group(&multicast), 1);
            EXPECT_EQ(count_of("WCCP: net init", log.take()), 0) << "one attempt in a second";
            EXPECT_EQ(wccp_find_group(62)->state_flags, 0u) << "it exists, but is not started";
            EXPECT_EQ(take_reasons(wccp_find_group(62)), &cause == causes
                                                             ? "port-taken: Address already in use|wan0"
                                                             : "socket-failed: Too many open files|wan0");
            wccp_pkt pkt = packet(100, 1);
            EXPECT_EQ(wccp_tx_pkt(wccp_find_group(62), &pkt), 0) << "nothing is sent without a port";
            happens();
            EXPECT_EQ(wan->ucast_bound, 0u);
            cause(false);
            pass_seconds(occasion == occasions[0].first ? 29 : 5);
            EXPECT_EQ(wan->ucast_bound, 0u);
            log.take();
            happens();
            EXPECT_TRUE(wan->ucast_bound == 1 && wan->mcast_fd >= 0);
            pass_seconds(31);
            EXPECT_EQ(count_of("set-up of 10.0.0.100 succeeded after an earlier failure", log.take()), 1);
            // The group that could not join is started, and there is a receiver.
            EXPECT_EQ(take_reasons(wccp_find_group(62)), "");
            EXPECT_EQ(wan->mcast_bound_ipa, ipa("224.0.1.62"));
            EXPECT_EQ(wccp_find_group(62)->hia_timer.active + threads_named("WCCP_RX_wan0"), 2);
            EXPECT_EQ(wccp_del_group(62), 0);
            EXPECT_EQ(count_descriptors(), descriptors);
        }

    // Not when no group needs it.
    wccp_service_group *known = wccp_find_group(61);
    wan->network_flaws = WCCP_FLAW_SOCKETS;
    for (const auto &[admin, ready] : {std::pair{0u, WCCP_ALL_READY},
                                       {+WCCP_ADMIN_DOWN, WCCP_ALL_READY},
                                       {+WCCP_ADMIN_UP, WCCP_IPA_READY}}) {
        known->admin_state = admin;
        wan->ready_flags = ready;
        pass_seconds(31);
        EXPECT_EQ(wan->network_flaws, +WCCP_FLAW_SOCKETS);
    }

    // For a failed join the sockets are kept.
    wan->ready_flags = WCCP_ALL_READY;
    wan->network_flaws = 0;
    struct stat before = {}, after = {};
    fstat(wan->ucast_fd, &before);
    EXPECT_EQ(wccp_add_group(&multicast), 0);
    run_command("echo 1 >/proc/sys/net/ipv4/igmp_max_memberships");
    wccp_grp_config other = engine_fixture::group_config(63, {"224.0.1.63"});
    EXPECT_EQ(wccp_add_group(&other), 1);
    EXPECT_EQ(take_reasons(wccp_find_group(63)), "join-failed: No buffer space available|wan0");
    run_command("echo 20 >/proc/sys/net/ipv4/igmp_max_memberships");
    pass_seconds(30);
    EXPECT_EQ(wccp_find_group(63)->hia_timer.active, 1);
    fstat(wan->ucast_fd, &after);
    EXPECT_EQ(after.st_ino, before.st_ino);
}

TEST_F(Network, JoiningBindsOnceAndRepeatsWithoutHarm) {
    EXPECT_EQ(wccp_join_mc_grp(bare("closed0"), ipa("224.0.1.5")), 1);
    // Without an address the kernel would choose another interface.
    wan->ipa = {};
    EXPECT_TRUE(wccp_join_mc_grp(wan, ipa("224.0.1.5")) == 1 && wan->mcast_bound == 0);
    wan->ipa = ipa("10.0.0.100");
    log_lines log;
    for (const char *address : {"224.0.1.5", "224.0.1.5", "224.0.1.6", "224.0.1.6"})
        EXPECT_EQ(wccp_join_mc_grp(wan, ipa(address)), 0);
    const std::string lines = log.take();
    EXPECT_EQ(count_of("are not received", lines), 1) << lines;
    EXPECT_EQ(count_of("is bound to 224.0.1.5, so datagrams sent to 224.0.1.6 are not received", lines), 1);
    EXPECT_EQ(wan->mcast_bound, 1u);
    EXPECT_EQ(bound_to(wan->mcast_fd), "224.0.1.5:2048");
    run_command("ip maddr show dev wan0 | grep -q 224.0.1.6");
    EXPECT_EQ(wccp_join_mc_grp(wan, ipa("10.0.0.1")), 1);
}

TEST_F(Network, SocketsCarryTheirOptions) {
    EXPECT_EQ(bound_to(wan->ucast_fd) + " " + bound_to(wan->mcast_fd), "10.0.0.100:2048 0.0.0.0:0");
    for (const int fd : {wan->ucast_fd, wan->mcast_fd})
        EXPECT_EQ(option_of(fd, IP_MTU_DISCOVER), IP_PMTUDISC_DONT);
    EXPECT_EQ(std::tuple(option_of(wan->mcast_fd, IP_MULTICAST_TTL),
                         option_of(wan->mcast_fd, IP_MULTICAST_LOOP),
                         static_cast<uint32_t>(option_of(wan->mcast_fd, IP_MULTICAST_IF))),
              std::tuple(5, 0, address_word("10.0.0.100")));
    // The TTL is set on every socket.
    wccp_interface *bad = bare("bad0"), *closed = bare("closed0"), *last = bare("last0");
    bad->mcast_fd = open("/dev/null", O_RDONLY);
    ASSERT_EQ(wccp_init_network_by_interface(last), 0);
    EXPECT_EQ(wccp_set_mcast_ttl(5), 0) << "unchanged: no socket is touched";
    EXPECT_EQ(wccp_set_mcast_ttl(0x1ff), 1);
    for (const wccp_interface *each : {wan, last})
        EXPECT_EQ(option_of(each->mcast_fd, IP_MULTICAST_TTL), 255);
    EXPECT_TRUE(wccp_g.mcast_ttl == 255 && closed->mcast_fd == -1);
    wccp_close_sockets(bad);
    EXPECT_TRUE(wccp_set_mcast_ttl(0) == 0 && wccp_g.mcast_ttl == 33);
    ASSERT_TRUE(wccp_init_network_by_interface(wan) == 0 && option_of(wan->mcast_fd, IP_MULTICAST_TTL) == 33);
}

TEST_F(Network, APacketIsSentToTheDestinationsOfTheGroup) {
    const std::vector<uint8_t> expected(120, 0x5a), nothing;
    for (const char *router : {"10.0.0.2", "10.0.0.3"})
        engine.router_socket(router);
    const auto received = [this] {
        return std::pair(engine.sent_to("10.0.0.2"), engine.sent_to("10.0.0.3"));
    };
    engine.peer.run("ip route add 224.0.0.0/4 dev peer0");
    const int listener = engine.sockets["224.0.1.5"] = engine.peer.udp_socket("224.0.1.5", 2048);
    const ip_mreq membership = {{address_word("224.0.1.5")}, {address_word("10.0.0.2")}};
    ASSERT_EQ(setsockopt(listener, IPPROTO_IP, IP_ADD_MEMBERSHIP, &membership, sizeof membership), 0);

    wccp_pkt pkt = packet(120, 0x5a);
    EXPECT_EQ(wccp_tx_pkt(nullptr, &pkt) + wccp_tx_pkt(&group, nullptr) + wccp_tx_pkt(&group, &pkt), 0);
    group.interfaces[0] = wan;
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 0) << "no destination";
    for (const char *router : {"10.0.0.2", "10.0.0.3"})
        group.ucast_routers[group.ucast_router_count++] = ipa(router);
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 240);
    EXPECT_EQ(pkt.ipa, ipa("10.0.0.3"));
    EXPECT_EQ(received(), std::pair(expected, expected));
    pkt.ipa = ipa("10.0.0.2");
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 120) << "the packet's own address comes first";
    EXPECT_EQ(received(), std::pair(expected, nothing));

    // With a multicast address nothing is sent to unicast routers.
    pkt.ipa = {};
    group.mcast_configured = 1;
    group.mcast_ipa = ipa("224.0.1.5");
    ASSERT_EQ(wccp_join_mc_grp(wan, group.mcast_ipa), 0);
    const int32_t unicast = std::exchange(wan->ucast_fd, -1); // the multicast socket is used
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 120);
    wan->ucast_fd = unicast;
    EXPECT_EQ(pkt.ipa, group.mcast_ipa);
    const datagram got = receive_datagram(listener);
    EXPECT_TRUE(got.bytes == expected && got.from == "10.0.0.100");
    EXPECT_EQ(received(), std::pair(nothing, nothing));

    // Results of sendto are returned, and added up over the routers.
    group.mcast_configured = 0;
    pkt.ipa = {};
    run_command("ip link set wan0 down");
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), -2);
    const std::string fault = ": Network is unreachable|120 bytes";
    EXPECT_EQ(take_reasons(&group), "send-failed 10.0.0.2" + fault + "; send-failed 10.0.0.3" + fault);
    wccp_tx_pkt(&group, &pkt);
    run_command("ip link set wan0 up");
    pkt.ipa = ipa("10.0.0.2");
    EXPECT_EQ(wccp_tx_pkt(&group, &pkt), 120);
    EXPECT_EQ(take_reasons(&group), "send-failed 10.0.0.3" + fault) << "a successful send ends the reason";
}

// Addresses that do not exist: datagrams stay in the send buffer while the kernel tries to resolve them.
TEST_F(Network, RoutersThatAreGoneDoNotBlockSending) {
    group.interfaces[0] = wan;
    group.ucast_router_count = 32;
    for (uint32_t i = 0; i < 32; i++)
        group.ucast_routers[i] = ipa("10.0.0." + std::to_string(150 + i));
    const auto began = std::chrono::steady_clock::now();
    for (int round = 0; round < 300; round++) {
        wccp_pkt pkt = packet(1400, 1);
        wccp_tx_pkt(&group, &pkt);
    }
    EXPECT_LT(std::chrono::steady_clock::now() - began, std::chrono::milliseconds(2500));
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
    for (pollfd each : {pollfd{wan->ucast_fd, POLLIN, 0}, pollfd{wan->mcast_fd, POLLIN, 0}})
        ASSERT_EQ(poll(&each, 1, 5000), 1); // on a busy system they arrive late, and in any order
    wccp_pkt pkt = {};
    EXPECT_TRUE(wccp_rx_pkt(wan, &pkt, 4096) == 20 && pkt.ipa == ipa("10.0.0.3"));
    EXPECT_TRUE(wccp_rx_pkt(wan, &pkt, 4096) == 10 && pkt.data[0] == 1 && pkt.data[10] == 2);
    // Of a datagram longer than the buffer, no byte after the buffer is written.
    for (const uint32_t length : {4096u, 4095u}) {
        memset(pkt.data, 0, sizeof pkt.data);
        send("10.0.0.100", 4096 + 1, 3);
        EXPECT_EQ(wccp_rx_pkt(wan, &pkt, length), static_cast<int>(length));
        EXPECT_EQ(std::count(pkt.data, pkt.data + 4096, 3), length);
    }
}

TEST_F(Network, DescriptorsChangeBetweenTheWaitAndTheRead) {
    // Ends a read that blocks. The first process of a namespace only receives signals that it handles.
    signal(SIGALRM, [](int) { _exit(1); });
    alarm(20);
    const int router = engine.router_socket("10.0.0.2");
    wccp_pkt pkt = {};
    // A new socket, which is empty.
    send_datagram(router, "10.0.0.100", WCCP_PORT, {1, 2, 3, 4});
    after_wait = [&] { EXPECT_EQ(wccp_init_network_by_interface(wan), 0); };
    EXPECT_TRUE(wccp_rx_pkt(wan, &pkt, sizeof pkt.data) < 1 && !after_wait);
    // Another file, from which nothing may be read.
    send_datagram(router, "10.0.0.100", WCCP_PORT, {1, 2, 3, 4});
    int other = -1;
    after_wait = [&] {
        const int number = wan->ucast_fd;
        wccp_close_sockets(wan);
        int pair[2];
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_DGRAM, 0, pair), 0);
        ASSERT_EQ(write(pair[1], "theirs", 6), 6);
        other = dup2(pair[0], number);
    };
    ASSERT_TRUE(wccp_rx_pkt(wan, &pkt, sizeof pkt.data) < 1 && other >= 0);
    char bytes[8] = {};
    EXPECT_EQ(recv(other, bytes, sizeof bytes, MSG_DONTWAIT), 6);
    close(other);
    alarm(0);
}

TEST_F(Network, TheTableGrowsToItsLimitAndHasEachNameOnce) {
    strlcpy(wccp_primary_wan_interface_name, "lo", sizeof wccp_primary_wan_interface_name);
    EXPECT_EQ(wccp_if_add_interface("wan0"), wan);
    const wccp_interface *lo = wccp_if_add_interface("lo");
    ASSERT_TRUE(lo == &wccp_g.interfaces[1] && wccp_g.primary_if == lo);
    EXPECT_EQ(std::tuple(lo->ipa, lo->ready_flags, lo->ucast_bound),
              std::tuple(ipa("127.0.0.1"), WCCP_ALL_READY, 1));
    EXPECT_TRUE(is_zero(wccp_get_address("a-name-longer-than-sixteen-bytes")));
    const wccp_interface *absent = wccp_if_add_interface("absent0");
    ASSERT_TRUE(absent && absent->ready_flags == 0 && absent->ucast_fd == -1 && !absent->rx_thread);
    EXPECT_NE(wccp_if_add_interface("absent1"), nullptr);
    EXPECT_EQ(wccp_if_add_interface("absent2"), nullptr);
    EXPECT_EQ(wccp_if_add_interface("absent1"), &wccp_g.interfaces[3]);
    // A group is accepted, but only its connectivity alarm runs.
    wccp_service_group *waiting = engine.add_group(engine_fixture::group_config(1, {}, "absent1"));
    EXPECT_EQ(take_reasons(waiting), "interface-missing: |absent1");
    EXPECT_EQ(std::tuple(waiting->hia_timer.active, waiting->monitor_timer.active,
                         waiting->router_alarm_timer.active),
              std::tuple(0, 0, 1));
    EXPECT_EQ(wccp_del_group(1), 0);
    const wccp_grp_config homeless = engine_fixture::group_config(1, {}, "absent2");
    EXPECT_EQ(wccp_add_group(&homeless), 1);

    for (uint32_t i = 0; i < LIMIT; i++)
        EXPECT_EQ(wccp_if_add_group(&group, &wccp_g.interfaces[i]), 0);
    EXPECT_EQ(wccp_if_add_group(&group, wan), 1);
    EXPECT_EQ(wccp_if_add_group(nullptr, wan) + wccp_if_add_group(&group, nullptr), 2);
    for (wccp_interface &interface : wccp_g.interfaces)
        interface.groups = nullptr;
}

TEST_F(Network, OtherNotificationsAreIgnored) {
    const wccp_interface before = *wan;
    notify_link("other0", 0, 0);
    wccp_process_if_ipa_update("other0");
    wccp_process_if_ipa_update(nullptr);
    wccp_process_if_state_change(nullptr);
    notify_link("wan0", 1, 1); // already up
    EXPECT_EQ(wccp_g.if_count, 1);
    wccpd_exiting = 1;
    notify_link("wan0", 0, 0);
    set_address("10.0.0.7");
    EXPECT_EQ(memcmp(&before, wan, sizeof before), 0);
    wccpd_exiting = 0;
}

TEST_F(Network, AddressAndLinkInEitherOrderEndInReady) {
    wccp_service_group *known = live_group();
    make_active(known);
    for (const bool link_first : {true, false}) {
        notify_link("wan0", 1, 0); // administratively up, without carrier
        EXPECT_EQ(std::tuple(wan->link_up, wan->ready_flags, known->hia_timer.active, known->state_flags),
                  std::tuple(0, WCCP_IPA_READY, 0, WCCP_STATE_INIT));
        notify_link("wan0", 0, 1);
        EXPECT_EQ(take_reasons(known), "interface-down: |wan0 x2");
        set_address("");
        EXPECT_EQ(wan->ready_flags, 0u);
        if (link_first)
            notify_link("wan0", 1, 1);
        set_address("10.0.0.100");
        EXPECT_EQ(known->hia_timer.active, link_first ? 1 : 0);
        notify_link("wan0", 1, 1);
        EXPECT_EQ(std::tuple(wan->ready_flags, known->hia_timer.active, known->hia_timer.countdown,
                             known->appliance_ipa),
                  std::tuple(WCCP_ALL_READY, 1, 1, ipa("10.0.0.100")));
    }
    EXPECT_TRUE(wan->link_down_count == 2 && wan->stop_count == 4);
    EXPECT_TRUE(engine.sent_to("10.0.0.2").empty() && known->tx_link_drops == 1) << "no shutdown message";
}

// The interface is deleted and created again while the notifier waits; the address that it then reads is the
// same.
TEST_F(Network, AnInterfaceCreatedAgainWithItsAddressJoinsAgain) {
    live_group({"224.0.1.61"});
    ASSERT_EQ(wan->mcast_bound, 1u);
    run_command("ip maddr show dev wan0 | grep -q 224.0.1.61");
    run_command("ip link del wan0");
    engine.peer.link("wan0", "10.0.0.100/24", "peer0", "");
    ASSERT_TRUE(link_becomes("wan0", 1));
    run_command("! ip maddr show dev wan0 | grep -q 224.0.1.61");
    wccp_process_if_ipa_update("wan0");
    EXPECT_TRUE(wan->ipa_change_count == 0 && wan->ready_flags == WCCP_ALL_READY);
    run_command("ip maddr show dev wan0 | grep -q 224.0.1.61");
    const int32_t fd = wan->mcast_fd;
    wccp_process_if_ipa_update("wan0");
    EXPECT_EQ(wan->mcast_fd, fd) << "the same device: its sockets are kept";
}

TEST_F(Network, AnAddressIsChangedRemovedAndAdded) {
    // The shutdown message is sent from the old socket and the old address, which lo still has.
    wccp_service_group *known = live_group();
    make_active(known);
    run_command("ip addr add 10.0.0.100/32 dev lo");
    set_address("10.0.0.7");
    const datagram shutdown_message = receive_datagram(engine.sockets["10.0.0.2"]);
    ASSERT_TRUE(shutdown_message.bytes.size() > 12 && shutdown_message.from == "10.0.0.100");
    EXPECT_EQ(memcmp(&shutdown_message.bytes.end()[-4], "\x0a\x00\x00\x64", 4), 0);
    EXPECT_EQ(known->appliance_ipa, ipa("10.0.0.7"));
    EXPECT_TRUE(known->state_flags == WCCP_STATE_INIT && known->hia_timer.active == 1);
    EXPECT_EQ(bound_to(wan->ucast_fd), "10.0.0.7:2048");
    EXPECT_EQ(threads_named("WCCP_RX_wan0"), 1);
    run_command("ip addr del 10.0.0.100/32 dev lo");

    make_active(known);
    const int32_t fd = wan->ucast_fd;
    set_address("");
    EXPECT_TRUE(engine.sent_to("10.0.0.2").empty() && known->tx_link_drops == 1) << "it is not tried";
    EXPECT_TRUE(is_zero(known->appliance_ipa) && known->hia_timer.active == 0);
    EXPECT_TRUE(wan->ready_flags == WCCP_LINK_READY && wan->ucast_fd == fd)
        << "the sockets stay until the next address";

    set_address("10.0.0.9");
    wccp_tick();
    const datagram first = receive_datagram(engine.sockets["10.0.0.2"]);
    ASSERT_TRUE(first.bytes.size() == 108 && first.from == "10.0.0.9" && wan->ipa_change_count == 3);
    EXPECT_EQ(memcmp(&first.bytes[48], "\x0a\x00\x00\x09", 4), 0) << "the web-cache id";
    wccp_deinit_link_mgr();
    EXPECT_TRUE(wan->ucast_fd == -1 && wan->mcast_fd == -1 && wan->ucast_bound == 0);
}

} // namespace
