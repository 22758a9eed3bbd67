// tunneld as wccpd sees it: the tests write wccpd's side of the mailbox. The complete program runs without
// mgmtd here, and with it in the scenarios.

#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>

#include <chrono>

#include "peers/tunneld/kernel_state.h"
#include "peers/tunneld/tunneld.h"
#include "peers/tunneld/user_tun.h"
#include "runtime/ttime.h"
#include "tests/support/fake_tunneld.h"
#include "tests/support/test_host.h"
#include "tests/support/texts.h"

using namespace std::chrono_literals;

namespace {

wccp_tunnel_mailbox *mailbox; // wccpd's mapping

void give_command(uint16_t code, uint16_t id, uint32_t remote) {
    mailbox->command = 0;
    mailbox->tunnel_id = id;
    mailbox->local_ip = 0x0A000001;
    mailbox->remote_ip = remote;
    mailbox->fmst_index = WCCP_NO_INDEX;
    mailbox->command = code;
}

bool take_one(command_desk *desk) {
    bool end = false;
    return take_command(desk, &end);
}

struct Tunneld : testing::Test {
    static void SetUpTestSuite() {
        write_mem_conf();
        std::filesystem::create_directories(std::filesystem::path(WCCPD_FILE).parent_path());
        command_desk before_wccpd;
        EXPECT_FALSE(take_one(&before_wccpd));
        EXPECT_FALSE(before_wccpd.attached);
        mailbox = static_cast<wccp_tunnel_mailbox *>(
            cmem_create_block(sizeof(wccp_tunnel_mailbox), WCCP_MAILBOX_NAME));
        ASSERT_TRUE(mailbox);
    }
    Tunneld() { mailbox->command = 0; }
    command_desk desk;
};

} // namespace

// Has to be the first test: the mailbox is not attached yet. The child has its own shared memory.
TEST(Mailbox, ABlockThatIsTooShortIsNotUsed) {
    write_mem_conf();
    run_program([] {
        ASSERT_EQ(unshare(CLONE_NEWIPC), 0);
        ASSERT_TRUE(cmem_create_block(4096, WCCP_MAILBOX_NAME));
        EXPECT_FALSE(wccp_attach_mailbox() || wccp_get_tunnel_command() || wccp_mailbox);
        EXPECT_EQ(wccp_get_role(65535), 2u);
        shmid_ds segment;
        ASSERT_EQ(shmctl(shmget(0x51520001, 0, 0), IPC_STAT, &segment), 0);
        EXPECT_EQ(segment.shm_nattch, 1u) << "it is not detached";
    });
}

TEST_F(Tunneld, KeepsATableAndAnswersEachCommand) {
    constexpr uint16_t ADD = MAILBOX_ADD_TUNNEL, DELETE = MAILBOX_DELETE_TUNNEL;
    constexpr uint32_t NONE = WCCP_NO_INDEX;
    const command_options does = {.first_index = 7}, refuses = {.refuse = true},
                          without_index = {.first_index = WCCP_NO_INDEX}, is_silent = {.silent = true};
    const std::string to_2 = " 10.0.0.1 <=> 10.0.0.2 index none: ";
    const struct {
        const command_options *options; // set: a new daemon starts with them
        uint16_t code, id;
        uint32_t remote, status, index; // index: in the mailbox afterwards
        std::string said;
    } steps[] = {
        {&does, ADD, 300, 2, 0, 7, "add tunnel 300 10.0.0.1 <=> 10.0.0.2 index 7: done\n"},
        {nullptr, ADD, 301, 3, 0, 8, "add tunnel 301 10.0.0.1 <=> 10.0.0.3 index 8: done\n"},
        {nullptr, ADD, 300, 2, 0, 7, "add tunnel 300 10.0.0.1 <=> 10.0.0.2 index 7: done\n"},
        // A tunnel with the same ends or the same id is replaced.
        {nullptr, ADD, 305, 2, 0, 9, "add tunnel 305 10.0.0.1 <=> 10.0.0.2 index 9: done\n"},
        {nullptr, ADD, 301, 9, 0, 10, "add tunnel 301 10.0.0.1 <=> 10.0.0.9 index 10: done\n"},
        {nullptr, DELETE, 305, 2, 0, 9, "delete tunnel 305 10.0.0.1 <=> 10.0.0.2 index 9: done\n"},
        {nullptr, DELETE, 305, 2, 1, NONE, "delete tunnel 305" + to_2 + "no such tunnel\n"},
        {nullptr, DELETE, 300, 2, 1, NONE, "delete tunnel 300" + to_2 + "no such tunnel\n"},
        {nullptr, MAILBOX_L2_RETURN, 0, 0, 0, NONE, "L2 return group 51 value 1: done\n"},
        {nullptr, 9, 0, 0, 1, NONE, "unknown command 9: refused\n"},
        {&refuses, ADD, 306, 2, 1, NONE, "add tunnel 306" + to_2 + "refused\n"},
        {&without_index, ADD, 306, 2, 0, NONE, "add tunnel 306" + to_2 + "done, without an index\n"},
        {&is_silent, ADD, 306, 2, 77, NONE, "add tunnel 306" + to_2 + "not answered\n"},
        {nullptr, ADD, 306, 2, 77, NONE, ""}, // was printed already
    };
    mailbox->l2_group = 51;
    mailbox->l2_value = 1;
    for (const auto &step : steps) {
        SCOPED_TRACE(&step - steps);
        if (step.options) {
            start_commands(&desk, *step.options, stdout);
            EXPECT_FALSE(take_one(&desk)) << "nothing to do";
        }
        give_command(step.code, step.id, 0x0A000000 + step.remote);
        mailbox->status = 77;
        testing::internal::CaptureStdout();
        const bool taken = take_one(&desk);
        EXPECT_EQ(testing::internal::GetCapturedStdout(), step.said);
        EXPECT_EQ(taken, step.status != 77);
        EXPECT_EQ(mailbox->command, step.status == 77 ? step.code : 0);
        EXPECT_EQ(mailbox->status, step.status);
        EXPECT_EQ(mailbox->fmst_index, step.index);
    }
    ASSERT_EQ(desk.tunnels.size(), 1u);
    EXPECT_EQ(desk.tunnels.at(301).remote, 0x0A000009u);
}

// wccpd withdraws a command that is being executed, or replaces it by another one. It would take an answer
// for that of the other command. With `apply`, each change of the table is applied, including the removal of
// a withdrawn tunnel.
TEST_F(Tunneld, ACommandThatWasGivenUpGetsNoAnswer) {
    constexpr uint16_t ADD = MAILBOX_ADD_TUNNEL, DELETE = MAILBOX_DELETE_TUNNEL, FAILS = 311;
    static const struct {
        uint16_t code, id, later_code, later_id; // the same later: the command is answered
        uint32_t index;                          // in the mailbox afterwards
        size_t tunnels;
    } rows[] = {
        {ADD, 310, 0, 310, WCCP_NO_INDEX, 0}, // withdrawn
        {ADD, 310, ADD, FAILS, WCCP_NO_INDEX, 0},
        {ADD, 310, DELETE, 310, WCCP_NO_INDEX, 0},
        {ADD, 310, ADD, 310, 1310, 1},
        {ADD, FAILS, ADD, FAILS, WCCP_NO_INDEX, 1},
        {ADD, 312, 0, 312, WCCP_NO_INDEX, 1},
        {DELETE, 310, DELETE, 310, 1310, 0},
    };
    std::map<uint16_t, command_tunnel> made;
    start_commands(&desk, {.slow_ms = 60}, stdout);
    desk.apply = [&](std::map<uint16_t, command_tunnel> *tunnels) {
        for (auto &[id, tunnel] : *tunnels)
            tunnel.index = id == FAILS ? WCCP_NO_INDEX : 1000u + id;
        made = *tunnels;
    };
    for (const auto &row : rows) {
        SCOPED_TRACE(&row - rows);
        give_command(row.code, row.id, 0x0A000000 + row.id);
        mailbox->status = 77;
        std::thread wccpd([row] {
            std::this_thread::sleep_for(20ms);
            mailbox->command = 0;
            __atomic_store_n(&mailbox->tunnel_id, row.later_id, __ATOMIC_RELEASE);
            mailbox->command = row.later_code;
        });
        EXPECT_TRUE(take_one(&desk));
        wccpd.join();
        const bool answered = row.code == row.later_code && row.id == row.later_id;
        EXPECT_EQ(mailbox->status, answered ? 0u : 77u);
        EXPECT_EQ(mailbox->command, answered ? 0 : row.later_code);
        EXPECT_EQ(mailbox->fmst_index, row.index);
        EXPECT_EQ(desk.tunnels.size(), row.tunnels);
        EXPECT_EQ(made.size(), row.tunnels);
    }
}

// Tunnels that an earlier wccpd has ordered. The mailbox has no index if tunneld was killed during an add.
TEST_F(Tunneld, OnlyTunnelsOfAnOlderWccpdHaveToBeOrderedAgain) {
    static const struct {
        const char *pid; // noted by the previous tunneld; null: none
        size_t later;    // number of tunnels when their time is up
    } rows[] = {{"999999", 1}, {"", 2}, {nullptr, 2}};
    const int64_t now = lt_monotonic_ms();
    for (const auto &row : rows) {
        desk = {};
        start_commands(&desk, {}, stdout);
        desk.tunnels = {{300, {0x0A000001, 0x0A000002, 7}}, {301, {0x0A000001, 0x0A000003, 8}}};
        if (!row.pid)
            forget_wccpd();
        else if (*row.pid)
            std::ofstream(WCCPD_FILE) << row.pid << "\n";
        give_command(MAILBOX_ADD_TUNNEL, 300, 0x0A000002); // before the first watch_wccpd()
        EXPECT_TRUE(take_one(&desk));
        watch_wccpd(&desk, now);
        drop_unordered(&desk, now + UNORDERED_MS - 1000);
        EXPECT_EQ(desk.tunnels.size(), 2u);
        drop_unordered(&desk, now + UNORDERED_MS + 10000);
        EXPECT_EQ(desk.tunnels.size(), row.later) << (row.pid ? row.pid : "none");
        EXPECT_TRUE(desk.tunnels.contains(300));
    }
}

namespace {

pid_t start_tunneld(int unshared_fd = -1) {
    return start_child([unshared_fd] {
        close(unshared_fd);
        return freopen("/dev/null", "w", stdout) ? run_tunneld({.commands = {}, .plane = "user"}) : 1;
    });
}

// Leaves the state of a killed tunneld: a tunnel, an accepted source, and a group with an intercept.
void leave_a_tunnel() {
    std::string error;
    appliance_view view;
    view.tunnels = {{3, {0x0A000001, 0x0A000002}}};
    view.groups[61] = {"lo", 0x0A000001, 0, false, {}};
    view.intercepts[61].to = 3128;
    view.conditions[61] = {true, true};
    view.accepted = {{0x0A000009, 0}};
    std::map<std::string, uint32_t> indices;
    ASSERT_TRUE(user_plane.open(&error)) << error;
    ASSERT_TRUE(reconcile_kernel_state(user_plane, make_wanted_state(view, {}, true), &indices, &error))
        << error;
}

std::string sorting_maps() {
    EXPECT_EQ(system("nft list maps ip >/tmp/maps"), 0);
    return text_of_file("/tmp/maps");
}

uint32_t order_tunnel(uint16_t code, uint16_t id, uint32_t remote) {
    give_command(code, id, remote);
    wccp_wake_tunneld();
    for (int i = 0; i < 500 && mailbox->command != 0; i++)
        std::this_thread::sleep_for(10ms);
    EXPECT_EQ(mailbox->command, 0) << "not answered";
    return mailbox->fmst_index;
}

} // namespace

TEST_F(Tunneld, ASuccessorServesFlowsAndCommandsBeforeItHasAConfiguration) {
    ASSERT_EQ(system("ip address add 10.0.0.1/24 dev lo"), 0);
    run_program(leave_a_tunnel);
    const std::string maps = sorting_maps();
    const unsigned tunnel = if_nametoindex("wccp0"), beside = if_nametoindex("wccp1");
    ASSERT_TRUE(tunnel && beside && contains(maps, "goto")) << maps;

    pid_t daemon = start_tunneld();
    const uint32_t added = order_tunnel(MAILBOX_ADD_TUNNEL, 4, 0x0A000004);
    EXPECT_EQ(added, if_nametoindex("wccp2"));
    EXPECT_EQ(system("ip rule | grep -q 'iif wccp2 lookup 204803'"), 0);
    EXPECT_EQ(system("ip route show table 204803 | grep -q 'default dev wccp2'"), 0);
    order_tunnel(MAILBOX_DELETE_TUNNEL, 4, 0x0A000004);
    EXPECT_FALSE(if_nametoindex("wccp2"));
    EXPECT_EQ(if_nametoindex("wccp0"), tunnel);
    EXPECT_EQ(if_nametoindex("wccp1"), beside);
    EXPECT_EQ(sorting_maps(), maps);
    // An interface that was removed is made again by the next order, with a new index.
    EXPECT_EQ(system("ip link delete wccp0"), 0);
    const uint32_t again = order_tunnel(MAILBOX_ADD_TUNNEL, 3, 0x0A000002);
    EXPECT_NE(again, tunnel);
    EXPECT_EQ(again, if_nametoindex("wccp0"));
    EXPECT_EQ(system("ip route show table 204801 | grep -q 'default dev wccp0'"), 0);
    kill(daemon, SIGKILL);
    wait_for_child(daemon);

    // A link that cannot be taken over yet is taken over later.
    tun_device held;
    std::string error;
    ASSERT_TRUE(tun_open("wccp0", &held, &error)) << error;
    daemon = start_tunneld(held.fd);
    std::this_thread::sleep_for(500ms);
    close(held.fd);
    EXPECT_EQ(order_tunnel(MAILBOX_ADD_TUNNEL, 3, 0x0A000002), again);
    EXPECT_EQ(sorting_maps(), maps);
    // More wake-ups than its socket can queue don't block the sender, and commands are answered long before
    // the next regular look at the mailbox.
    const int free_descriptor = dup(0);
    for (int i = 0; i < 1000; i++)
        wccp_wake_tunneld();
    const int64_t began = lt_monotonic_ms();
    for (int i = 0; i < 10; i++)
        order_tunnel(MAILBOX_L2_RETURN, 0, 0);
    EXPECT_LT(lt_monotonic_ms() - began, 1000);
    kill(daemon, SIGTERM);
    EXPECT_EQ(wait_for_child(daemon), 0);
    EXPECT_FALSE(std::filesystem::exists(WCCP_WAKE_UP_PATH));
    wccp_wake_tunneld(); // without a receiver
    close(free_descriptor);
    EXPECT_EQ(dup(0), free_descriptor);
    close(free_descriptor);
    EXPECT_FALSE(if_nametoindex("wccp0") || if_nametoindex("wccp1"));
    EXPECT_TRUE(lacks(sorting_maps(), "goto"));
    EXPECT_FALSE(std::filesystem::exists(WCCPD_FILE));
}
