// tunneld as wccpd sees it: a test plays wccpd's side of the mailbox by hand. The program is seen by the
// scenarios.

#include <gtest/gtest.h>
#include <sched.h>
#include <sys/shm.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <map>
#include <string>
#include <thread>

#include "peers/tunneld/commands.h"
#include "platform/tunnel_mailbox.h"
#include "runtime/cmem.h"

using namespace std::chrono_literals;

namespace {

wccp_tunnel_mailbox *mailbox; // wccpd's own view of the block

void give(uint16_t code, uint16_t id, uint32_t remote) {
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

void write_mem_conf() {
    const std::filesystem::path conf = CMEM_CONF_PATH;
    std::filesystem::create_directories(conf.parent_path());
    std::ofstream(conf) << WCCP_MAILBOX_NAME << " local normal 0x51520001\n";
}

struct Tunneld : testing::Test {
    static void SetUpTestSuite() {
        write_mem_conf();
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
        const std::string all(text, length);
        const std::string fresh = all.substr(told);
        told = all.size();
        return fresh;
    }
    static command_desk before_wccpd;
    command_desk desk;
    FILE *out = nullptr;
    char *text = nullptr;
    size_t length = 0, told = 0;
};
command_desk Tunneld::before_wccpd;

} // namespace

// First of all, while this process has attached nothing: the child has shared memory of its own.
TEST(Mailbox, ABlockThatIsTooShortIsNotUsed) {
    write_mem_conf();
    const pid_t child = fork();
    if (child == 0) {
        if (unshare(CLONE_NEWIPC) != 0 || !cmem_create_block(4096, WCCP_MAILBOX_NAME))
            _exit(2);
        const bool refused = !wccp_attach_mailbox() && wccp_get_tunnel_command() == 0 && !wccp_mailbox &&
                             wccp_get_role(65535) == 2;
        const int key = shmget(0x51520001, 0, 0);
        shmid_ds segment;
        const bool let_go = shmctl(key, IPC_STAT, &segment) == 0 && segment.shm_nattch == 1;
        _exit(refused && let_go ? 0 : 1);
    }
    int status = -1;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
}

TEST_F(Tunneld, KeepsATableAndAnswersEachCommand) {
    constexpr uint16_t ADD = MAILBOX_ADD_TUNNEL, DELETE = MAILBOX_DELETE_TUNNEL;
    constexpr uint32_t NONE = WCCP_NO_INDEX;
    const command_options does = {.first_index = 7}, refuses = {.refuse = true},
                          without_index = {.first_index = WCCP_NO_INDEX}, is_silent = {.silent = true};
    const struct {
        const command_options *options; // of a daemon that starts here
        uint16_t code, id;
        uint32_t remote, status, index; // index: what the mailbox holds then
        std::string said;               // of a tunnel, after what it is
    } steps[] = {
        {&does, ADD, 300, 2, 0, 7, "done"},
        {nullptr, ADD, 301, 3, 0, 8, "done"},
        {nullptr, ADD, 300, 2, 0, 7, "done"},
        // The same ends under another id, and another tunnel under an id: what was there is replaced.
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
        {nullptr, ADD, 306, 2, 77, NONE, ""}, // printed once
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
        give(step.code, step.id, 0x0A000000 + step.remote);
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

// A command that wccpd takes back while it is carried out: an answer would be taken for another command's.
TEST_F(Tunneld, ACommandThatWasGivenUpGetsNoAnswer) {
    start_commands(&desk, {.slow_ms = 60}, out);
    static const struct {
        uint16_t code;
        uint16_t id;
        bool answered;
    } replacements[] = {{0, 0, false},
                        {MAILBOX_ADD_TUNNEL, 311, false},
                        {MAILBOX_DELETE_TUNNEL, 310, false},
                        {MAILBOX_ADD_TUNNEL, 310, true}};
    for (const auto &row : replacements) {
        give(MAILBOX_ADD_TUNNEL, 310, 0x0A000002);
        mailbox->status = 77;
        std::thread wccpd([&row] {
            std::this_thread::sleep_for(20ms);
            mailbox->command = 0;
            __atomic_store_n(&mailbox->tunnel_id, row.id ? row.id : uint16_t{310}, __ATOMIC_RELEASE);
            mailbox->command = row.code;
        });
        EXPECT_TRUE(take_one(&desk));
        wccpd.join();
        EXPECT_EQ(mailbox->status, row.answered ? 0u : 77u) << row.code << " " << row.id;
        EXPECT_EQ(desk.tunnels.size(), row.answered ? 1u : 0u);
        EXPECT_EQ(mailbox->command, row.answered ? 0 : row.code);
    }
}

// The tunnels as somebody else makes them: each change of the table is applied, also the undoing of an add.
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
    give(MAILBOX_ADD_TUNNEL, 310, 0x0A000002);
    EXPECT_TRUE(take_one(&desk));
    EXPECT_EQ(mailbox->fmst_index, 40u);
    give(MAILBOX_ADD_TUNNEL, 311, 0x0A000063); // which cannot be made
    EXPECT_TRUE(take_one(&desk));
    EXPECT_EQ(mailbox->fmst_index, WCCP_NO_INDEX);
    EXPECT_EQ(made.size(), 1u);
    give(MAILBOX_ADD_TUNNEL, 312, 0x0A000003);
    std::thread wccpd([] {
        std::this_thread::sleep_for(20ms);
        mailbox->command = 0;
    });
    EXPECT_TRUE(take_one(&desk));
    wccpd.join();
    EXPECT_EQ(made.size(), 1u) << "the add that was withdrawn is undone";
    give(MAILBOX_DELETE_TUNNEL, 310, 0x0A000002);
    EXPECT_TRUE(take_one(&desk));
    EXPECT_TRUE(made.empty());
}
