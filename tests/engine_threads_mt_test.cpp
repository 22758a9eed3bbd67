// The engine's threads together: the stop while they wait for the lock or for tunneld, and addresses that
// change while receivers wait. An alarm ends the program if a thread never returns.

#include <net/if.h>
#include <netinet/in.h>
#include <sys/ioctl.h>
#include <sys/socket.h>

#include <chrono>
#include <optional>

#include "engine/wccp_pkt_mgr.h"
#include "engine/wccp_router_utils.h"
#include "engine/wccpd_common.h"
#include "tests/support/engine_fixture.h"
#include "tests/support/fake_tunneld.h"
#include "tests/support/router_messages.h"

using namespace std::chrono_literals;
using steady = std::chrono::steady_clock;

namespace {

template <typename Condition>
bool becomes_true(Condition condition) { // within five seconds
    const auto end = steady::now() + 5s;
    while (!condition() && steady::now() < end)
        std::this_thread::sleep_for(2ms);
    return condition();
}

// The I-See-You of a router that lists this appliance: no security, GRE and hash, no assignment yet.
std::vector<uint8_t> i_see_you(uint8_t id, const std::string &router, const std::string &appliance) {
    const be32 from = ipa(router), to = ipa(appliance);
    return wire_message(11, {security_info(), service_info(id), router_identity(from, to, 1),
                             router_view({from}, {element_of(to, 0)}), capability_info(1, 1, 1)});
}
void see_you(int fd, uint8_t id, const std::string &router, const std::string &appliance) {
    send_datagram(fd, appliance, 2048, i_see_you(id, router, appliance));
}

struct Threads : testing::Test {
    // Only the main thread may set up the log, which the first line would do.
    static void SetUpTestSuite() { (void)lc_log_init("wccpd", "wccpd", 0, 0x1060000, LC_LOG_INFO, 128, 1); }
    void SetUp() override {
        alarm(240);
        fresh_engine();
        write_mem_conf();
        ASSERT_EQ(wccp_init_shmem(), 0);
        tunneld.emplace(tunneld_does);
        strlcpy(wccp_primary_wan_interface_name, "wan0", sizeof wccp_primary_wan_interface_name);
        peer.link("wan0", "10.1.0.1/24", "rt0", "10.1.0.2/24");
        peer.link("wan1", "10.2.0.1/24", "rt1", "10.2.0.2/24");
        ASSERT_TRUE(link_becomes("wan0", 1) && link_becomes("wan1", 1));
        first = peer.udp_socket("10.1.0.2", 2048);
        second = peer.udp_socket("10.2.0.2", 2048);
    }
    void TearDown() override {
        end_engine();
        close(first);
        close(second);
        run_command("ip link del wan0 && ip link del wan1");
    }

    static wccp_service_group *add_group(uint8_t id, const char *interface) {
        wccp_grp_config config = engine_fixture::group_config(id, {}, interface);
        config.fwd_method = WCCP_METHOD_EITHER;
        EXPECT_EQ(wccp_add_group(&config), 0);
        return wccp_find_group(id);
    }
    static uint32_t router_count(uint8_t id) {
        const wccp_engine_lock lock;
        const wccp_service_group *group = wccp_find_group(id);
        return group ? group->sending_router_count : 0;
    }
    static void start_timer_thread() {
        cthread *timer = cthread_init("WCCP_TIMER", wccp_timer_thread_fn, {}, nullptr, {}, 0, 0, 0, 0);
        EXPECT_EQ(cthread_start(timer), 0);
    }

    // After a stop or an exit.
    static void nothing_runs() {
        EXPECT_EQ(threads_named("WCCP_"), 0);
        ASSERT_EQ(pthread_mutex_trylock(&wccp_g.lock), 0);
        pthread_mutex_unlock(&wccp_g.lock);
    }

    std::optional<fake_tunneld> tunneld; // once there is a mailbox
    peer_network peer;
    int first = -1, second = -1; // a router's socket on each of the networks
};

// The exit takes a bounded time.
TEST_F(Threads, ExitWhileAReceiverWaitsForAnAbsentTunneld) {
    const wccp_interface *wan = add_group(61, "wan0")->interfaces[0];
    start_timer_thread();
    tunneld->answer_with(tunneld_is_silent);
    see_you(first, 61, "10.1.0.2", "10.1.0.1");
    tunneld->wait_for_command();
    wccpd_exiting = 1;
    const auto before = steady::now();
    EXPECT_EQ(wccp_exit_mgr(), 0);
    EXPECT_LT(steady::now() - before, 6s);
    nothing_runs();
    EXPECT_TRUE(wccp_g.group_count == 0 && wan->ucast_fd == -1);
}

// Notifications and datagrams that wait for the lock while the exit begins have no effect.
TEST_F(Threads, NotificationsAndADatagramDuringAnExit) {
    const wccp_interface *wan = add_group(61, "wan0")->interfaces[0];
    run_command("ip addr add 10.1.0.9/24 dev wan0 && ip addr del 10.1.0.1/24 dev wan0 && "
                "ip addr flush dev wan1 && ip addr add 10.1.0.1/32 dev lo");
    std::thread address, link;
    std::atomic<int> asked = 0;
    {
        const wccp_engine_lock lock;
        address = std::thread([&] {
            asked++;
            wccp_process_if_ipa_update("wan0");
        });
        link = std::thread([&] {
            qv_if_state_info info = {"wan0", 0, 0};
            asked++;
            wccp_process_if_state_change(&info);
        });
        ASSERT_TRUE(becomes_true([&] { return asked == 2; }));
        see_you(first, 62, "10.1.0.2", "10.1.0.1"); // an unknown group
        std::this_thread::sleep_for(100ms);
        wccpd_exiting = 1;
    }
    address.join();
    link.join();
    std::this_thread::sleep_for(50ms);
    EXPECT_EQ(wccp_exit_mgr(), 0);
    run_command("ip addr del 10.1.0.1/32 dev lo");
    EXPECT_TRUE(wccp_g.rx_failures == 0 && wan->ipa_change_count == 0 && wan->link_down_count == 0);
    nothing_runs();
    EXPECT_EQ(wan->ucast_fd, -1);
}

// The link or the address is lost, and the group has stopped. A packet that was queued before must not add a
// router: after the next start its methods would never be agreed.
TEST_F(Threads, APacketBetweenStopAndStartChangesNothing) {
    wccp_service_group *group = add_group(61, "wan0");
    const auto process = [] {
        const wccp_engine_lock lock;
        return wccp_process_received_packet(
            make_received(i_see_you(61, "10.1.0.2", "10.1.0.1"), ipa("10.1.0.2")).get());
    };
    const auto joins = [&] {
        EXPECT_EQ(process(), 0);
        EXPECT_TRUE(group->sending_router_count == 1 && group->fwd_method == WCCP_METHOD_GRE);
        EXPECT_TRUE(group->state_flags & WCCP_CAPABILITIES_SET);
        const std::vector<seen_command> seen = tunneld->take_commands();
        return seen.size() == 1 && seen[0].code == MAILBOX_ADD_TUNNEL && seen[0].local == 0x0a010001;
    };
    const std::pair<const char *, std::function<void(bool)>> ways[] = {
        {"link",
         [](bool up) {
             const qv_if_state_info info = {"wan0", up, up};
             wccp_process_if_state_change(&info);
         }},
        {"address", [](bool up) {
             run_command(std::string("ip addr ") + (up ? "add" : "del") + " 10.1.0.1/24 dev wan0");
             wccp_process_if_ipa_update("wan0");
         }}};
    (void)tunneld->take_commands(); // the L2 return of the start
    for (const auto &[gone, link_or_address] : ways) {
        SCOPED_TRACE(gone);
        EXPECT_TRUE(joins());
        link_or_address(false);
        (void)tunneld->take_commands(); // the delete
        const uint32_t icus = group->rx_icus;
        EXPECT_EQ(process(), 0);
        EXPECT_TRUE(group->rx_icus == icus && group->sending_router_count == 0 &&
                    group->state_flags == WCCP_STATE_INIT && tunneld->take_commands().empty());

        // If a router is known nevertheless, the next start removes it, and its tunnel from the old address.
        const wccp_rtr_capabilities gre = {WCCP_METHOD_GRE, WCCP_ASSIGN_HASH, WCCP_METHOD_GRE};
        const be32 old_address = group->appliance_ipa;
        ASSERT_NE(wccp_create_sending_router(group, ipa("10.1.0.2"), &gre, &gre), nullptr);
        group->assign_timer.active = 1;
        (void)tunneld->take_commands();
        link_or_address(true);
        EXPECT_EQ(group->sending_router_count + group->assign_timer.active, 0u);
        const std::vector<seen_command> seen = tunneld->take_commands();
        ASSERT_EQ(seen.size(), 2u); // and the L2 return
        EXPECT_TRUE(seen[0].code == MAILBOX_DELETE_TUNNEL && seen[0].local == to_host(old_address));
    }
    EXPECT_TRUE(joins());
    wccp_g.seconds += 40; // a router that is silent loses its tunnel, too
    wccp_monitor_sending_routers(group);
    const std::vector<seen_command> seen = tunneld->take_commands();
    EXPECT_TRUE(seen.size() == 1 && seen[0].code == MAILBOX_DELETE_TUNNEL && !group->sending_routers);
}

// Sets the address of an interface, like "ip" but without a process.
void set_address(const char *name, const char *address) {
    ifreq request = {};
    strlcpy(request.ifr_name, name, sizeof request.ifr_name);
    const sockaddr_in in = {AF_INET, 0, {address_word(address)}, {}};
    memcpy(&request.ifr_addr, &in, sizeof in);
    EXPECT_EQ(ioctl(g_qvif_skfd, SIOCSIFADDR, &request), 0);
}

TEST_F(Threads, AddressesChangeAndTheModeChangesUnderAFlood) {
    add_group(61, "wan0");
    add_group(62, "wan1");
    std::atomic<bool> over = false;
    std::thread flood([&] {
        while (!over) {
            for (const std::string end : {".1", ".9"}) {
                see_you(first, 61, "10.1.0.2", "10.1.0" + end);
                see_you(second, 62, "10.2.0.2", "10.2.0" + end);
            }
            send_datagram(first, "10.1.0.1", 2048, {0});
        }
    });
    const auto change = [&](const char *name, const char *one, const char *other) {
        for (int i = 0; i < 1000; i++) {
            set_address(name, i % 2 ? one : other);
            wccp_process_if_ipa_update(name);
        }
        EXPECT_EQ(wccp_if_find_interface(name)->ipa_change_count, 1000u);
    };
    std::thread second_changer(change, "wan1", "10.2.0.1", "10.2.0.9");
    change("wan0", "10.1.0.1", "10.1.0.9");
    second_changer.join();
    // Both receivers are alive and read what is sent to the present address.
    EXPECT_EQ(threads_named("WCCP_"), 2);
    for (const uint8_t id : {uint8_t{61}, uint8_t{62}})
        EXPECT_TRUE(becomes_true([=] { return router_count(id) == 1; }));

    // Bridge mode. The stop holds the lock while it waits for tunneld, and receivers with packets wait for
    // the lock meanwhile. Whichever gets it first, all threads end, and no packet reaches a stopped group.
    for (int round = 0; round < 30; round++) {
        start_timer_thread();
        EXPECT_TRUE(becomes_true([] { return router_count(61) + router_count(62) == 2; }));
        EXPECT_EQ(wccp_system_mode_change_event("bridge"), 0);
        nothing_runs();
        EXPECT_EQ(router_count(61) + router_count(62), 0u);
        const wccp_engine_lock lock;
        for (const uint8_t id : {uint8_t{61}, uint8_t{62}}) {
            wccp_service_group *group = wccp_find_group(id);
            group->interfaces[0]->rx_thread = nullptr; // the daemon never creates another one
            EXPECT_EQ(wccp_init_network_by_interface(group->interfaces[0]), 0);
            wccp_start_service_group(group);
        }
    }
    over = true;
    flood.join();
    const wccp_engine_lock lock;
    EXPECT_NE(wccp_if_find_interface("wan0")->complaints.spent, 0u)
        << "the complaints are counted for the receiver's interface";
}

} // namespace
