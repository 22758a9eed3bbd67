// tunneld as wccpd sees it: the tests write wccpd's side of the mailbox. The complete program runs without
// mgmtd here, and with it in the scenarios.

#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/shm.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include "peers/tunneld/kernel_state.h"
#include "peers/tunneld/nft_commands.h"
#include "peers/tunneld/tunneld.h"
#include "peers/tunneld/user_tun.h"
#include "platform/tunnel_mailbox.h"
#include "runtime/cmem.h"
#include "runtime/ttime.h"
#include "tests/support/test_host.h"

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
// Takes a command that wccpd replaces by another one, or withdraws, while it is executed.
void take_replaced(command_desk *desk, uint16_t id, uint16_t code) {
    std::thread wccpd([=] {
        std::this_thread::sleep_for(20ms);
        mailbox->command = 0;
        __atomic_store_n(&mailbox->tunnel_id, id, __ATOMIC_RELEASE);
        mailbox->command = code;
    });
    EXPECT_TRUE(take_one(desk));
    wccpd.join();
}

void write_mem_conf() {
    const std::filesystem::path conf = CMEM_CONF_PATH;
    std::filesystem::create_directories(conf.parent_path());
    std::ofstream(conf) << WCCP_MAILBOX_NAME << " local normal 0x51520001\n";
}

struct Tunneld : testing::Test {
    static void SetUpTestSuite() {
        write_mem_conf();
        std::filesystem::create_directories(std::filesystem::path(WCCPD_FILE).parent_path());
        EXPECT_FALSE(take_one(&before_wccpd));
        EXPECT_FALSE(before_wccpd.attached);
        mailbox = static_cast<wccp_tunnel_mailbox *>(
            cmem_create_block(sizeof(wccp_tunnel_mailbox), WCCP_MAILBOX_NAME));
        ASSERT_TRUE(mailbox);
        for (wccp_policy_role &role : mailbox->policy_roles)
            role.role = 2;
    }
    Tunneld() {
        mailbox->command = 0;
        out = open_memstream(&text, &length);
    }
    ~Tunneld() override {
        fclose(out);
        free(text);
    }
    // The lines since the last call.
    std::string lines() {
        fflush(out);
        const size_t from = std::exchange(told, length);
        return std::string(text + from, length - from);
    }
    static command_desk before_wccpd;
    command_desk desk;
    FILE *out = nullptr;
    char *text = nullptr;
    size_t length = 0, told = 0;
};
command_desk Tunneld::before_wccpd;

} // namespace

// Has to be the first test: the mailbox is not attached yet. The child has its own shared memory.
TEST(Mailbox, ABlockThatIsTooShortIsNotUsed) {
    write_mem_conf();
    const pid_t child = start_child([] {
        if (unshare(CLONE_NEWIPC) != 0 || !cmem_create_block(4096, WCCP_MAILBOX_NAME))
            return 2;
        const bool refused = !wccp_attach_mailbox() && wccp_get_tunnel_command() == 0 && !wccp_mailbox &&
                             wccp_get_role(65535) == 2;
        const int key = shmget(0x51520001, 0, 0);
        shmid_ds segment;
        const bool let_go = shmctl(key, IPC_STAT, &segment) == 0 && segment.shm_nattch == 1;
        return refused && let_go ? 0 : 1;
    });
    EXPECT_EQ(wait_for_child(child), 0);
}

TEST_F(Tunneld, KeepsATableAndAnswersEachCommand) {
    constexpr uint16_t ADD = MAILBOX_ADD_TUNNEL, DELETE = MAILBOX_DELETE_TUNNEL;
    constexpr uint32_t NONE = WCCP_NO_INDEX;
    const command_options does = {.first_index = 7}, refuses = {.refuse = true},
                          without_index = {.first_index = WCCP_NO_INDEX}, is_silent = {.silent = true};
    const struct {
        const command_options *options; // set: a new daemon starts with them
        uint16_t code, id;
        uint32_t remote, status, index; // index: in the mailbox afterwards
        std::string said;               // printed; for tunnels after their description
    } steps[] = {
        {&does, ADD, 300, 2, 0, 7, "done"},
        {nullptr, ADD, 301, 3, 0, 8, "done"},
        {nullptr, ADD, 300, 2, 0, 7, "done"},
        // A tunnel with the same ends or the same id is replaced.
        {nullptr, ADD, 305, 2, 0, 9, "done"},
        {nullptr, ADD, 301, 9, 0, 10, "done"},
        {nullptr, DELETE, 305, 2, 0, 9, "done"},
        {nullptr, DELETE, 305, 2, 1, NONE, "no such tunnel"},
        {nullptr, DELETE, 300, 2, 1, NONE, "no such tunnel"},
        {nullptr, MAILBOX_L2_RETURN, 0, 0, 0, NONE, "L2 return group 51 value 1: done"},
        {nullptr, 9, 0, 0, 1, NONE, "unknown command 9: refused"},
        {&refuses, ADD, 306, 2, 1, NONE, "refused"},
        {&without_index, ADD, 306, 2, 0, NONE, "done, without an index"},
        {&is_silent, ADD, 306, 2, 77, NONE, "not answered"},
        {nullptr, ADD, 306, 2, 77, NONE, ""}, // was printed already
    };
    mailbox->l2_group = 51;
    mailbox->l2_value = 1;
    for (const auto &step : steps) {
        SCOPED_TRACE(&step - steps);
        if (step.options) {
            start_commands(&desk, *step.options, out);
            EXPECT_FALSE(take_one(&desk)) << "nothing to do";
            lines();
        }
        give_command(step.code, step.id, 0x0A000000 + step.remote);
        mailbox->status = 77;
        EXPECT_EQ(take_one(&desk), step.status != 77);
        EXPECT_EQ(mailbox->command, step.status == 77 ? step.code : 0);
        EXPECT_EQ(mailbox->status, step.status);
        EXPECT_EQ(mailbox->fmst_index, step.index);
        std::string line = step.said;
        if (step.id && !line.empty())
            line = (step.code == ADD ? "add tunnel " : "delete tunnel ") + std::to_string(step.id) +
                   " 10.0.0.1 <=> 10.0.0." + std::to_string(step.remote) + " index " +
                   (step.index == NONE ? "none" : std::to_string(step.index)) + ": " + line;
        EXPECT_EQ(lines(), line.empty() ? "" : line + "\n");
    }
    ASSERT_EQ(desk.tunnels.size(), 1u);
    EXPECT_EQ(desk.tunnels.at(301).remote, 0x0A000009u);
}

// wccpd withdraws a command that is being executed. It would take an answer for that of another command.
TEST_F(Tunneld, ACommandThatWasGivenUpGetsNoAnswer) {
    start_commands(&desk, {.slow_ms = 60}, out);
    static const struct {
        uint16_t code, id;
        bool answered;
    } replacements[] = {{0, 310, false},
                        {MAILBOX_ADD_TUNNEL, 311, false},
                        {MAILBOX_DELETE_TUNNEL, 310, false},
                        {MAILBOX_ADD_TUNNEL, 310, true}};
    for (const auto &row : replacements) {
        give_command(MAILBOX_ADD_TUNNEL, 310, 0x0A000002);
        mailbox->status = 77;
        take_replaced(&desk, row.id, row.code);
        EXPECT_EQ(mailbox->status, row.answered ? 0u : 77u) << row.code << " " << row.id;
        EXPECT_EQ(desk.tunnels.size(), row.answered ? 1u : 0u);
        EXPECT_EQ(mailbox->command, row.answered ? 0 : row.code);
    }
}

// With `apply`: each change of the table is applied, including the removal of a withdrawn tunnel.
TEST_F(Tunneld, AppliesEachChangeOfTheTable) {
    std::map<uint16_t, command_tunnel> made;
    uint32_t next = 40;
    start_commands(&desk, {.slow_ms = 60}, out);
    desk.apply = [&](std::map<uint16_t, command_tunnel> *tunnels) {
        for (auto &[id, tunnel] : *tunnels)
            if (tunnel.index == WCCP_NO_INDEX && tunnel.remote != 0x0A000063)
                tunnel.index = next++;
        made = *tunnels;
    };
    give_command(MAILBOX_ADD_TUNNEL, 310, 0x0A000002);
    EXPECT_TRUE(take_one(&desk));
    EXPECT_EQ(mailbox->fmst_index, 40u);
    give_command(MAILBOX_ADD_TUNNEL, 311, 0x0A000063); // fails
    EXPECT_TRUE(take_one(&desk));
    EXPECT_EQ(mailbox->fmst_index, WCCP_NO_INDEX);
    EXPECT_EQ(made.size(), 1u);
    give_command(MAILBOX_ADD_TUNNEL, 312, 0x0A000003);
    take_replaced(&desk, 312, 0);
    EXPECT_EQ(made.size(), 1u) << "the add that was withdrawn is undone";
    give_command(MAILBOX_DELETE_TUNNEL, 310, 0x0A000002);
    EXPECT_TRUE(take_one(&desk));
    EXPECT_TRUE(made.empty());
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
        start_commands(&desk, {}, out);
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

int end_process(pid_t child, int signal) {
    kill(child, signal);
    return wait_for_child(child);
}
pid_t start_tunneld(int unshared_fd = -1) {
    return start_child([unshared_fd] {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        close(unshared_fd);
        return freopen("/dev/null", "w", stdout) ? run_tunneld({.commands = {}, .plane = "user"}) : 1;
    });
}

// Leaves the state of a killed tunneld: a tunnel, an accepted source, and a group with an intercept.
int leave_a_tunnel() {
    std::string error;
    appliance_view view;
    view.tunnels = {{3, {0x0A000001, 0x0A000002}}};
    view.groups[61] = {"lo", 0x0A000001, 0, false, {}};
    view.intercepts[61].to = 3128;
    view.conditions[61] = {true, true};
    view.accepted = {{0x0A000009, 0}};
    std::map<std::string, uint32_t> indices;
    const bool done = user_plane.open(&error) &&
                      reconcile_kernel_state(user_plane, make_wanted_state(view, {}, true), &indices, &error);
    fprintf(stderr, "%s", error.c_str());
    return done ? 0 : 1;
}

// The maps of the sorting rules. Closes nft's context, which children would share.
std::string sorting_maps() {
    nlohmann::json maps;
    std::string error;
    EXPECT_TRUE(list_nft("list maps ip", &maps, &error)) << error;
    close_nft();
    return maps.dump();
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
    ASSERT_EQ(wait_for_child(start_child(leave_a_tunnel)), 0);
    const std::string maps = sorting_maps();
    const unsigned tunnel = if_nametoindex("wccp0"), beside = if_nametoindex("wccp1");
    ASSERT_TRUE(tunnel && beside && maps.find("goto") != std::string::npos) << maps;

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
    end_process(daemon, SIGKILL);

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
    EXPECT_EQ(end_process(daemon, SIGTERM), 0);
    EXPECT_FALSE(std::filesystem::exists(WCCP_WAKE_UP_PATH));
    wccp_wake_tunneld(); // without a receiver
    close(free_descriptor);
    const int still_free = dup(0);
    EXPECT_EQ(still_free, free_descriptor);
    close(still_free);
    EXPECT_FALSE(if_nametoindex("wccp0") || if_nametoindex("wccp1"));
    EXPECT_EQ(sorting_maps().find("goto"), std::string::npos);
    EXPECT_FALSE(std::filesystem::exists(WCCPD_FILE));
}
