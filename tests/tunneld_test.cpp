// tunneld as wccpd sees it: a test plays wccpd's side of the mailbox by hand, once against the functions and
// once against the program.

#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/shm.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>

#include <nlohmann/json.hpp>

#include "platform/tunnel_mailbox.h"
#include "platform/tunneld/tunneld.h"
#include "runtime/cmem.h"

using namespace std::chrono_literals;

namespace {

wccp_tunnel_mailbox *mailbox; // wccpd's own view of the block

bool soon(const std::function<bool()> &condition) {
    const auto give_up = std::chrono::steady_clock::now() + 10s;
    while (!condition())
        if (std::chrono::steady_clock::now() > give_up)
            return false;
        else
            std::this_thread::sleep_for(1ms);
    return true;
}

void give(uint16_t code, uint16_t id, uint32_t remote, uint32_t index = WCCP_NO_INDEX) {
    mailbox->command = 0;
    mailbox->tunnel_id = id;
    mailbox->local_ip = 0x0A000001;
    mailbox->remote_ip = remote;
    mailbox->fmst_index = index;
    mailbox->command = code;
}

void write_mem_conf() {
    const std::filesystem::path conf = CMEM_CONF_PATH;
    std::filesystem::create_directories(conf.parent_path());
    std::ofstream(conf) << WCCP_MAILBOX_NAME << " local normal 0x51520001\n";
}

struct Tunneld : testing::Test {
    static void SetUpTestSuite() {
        write_mem_conf();
        EXPECT_FALSE(tunneld_step(&before_wccpd));
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
    void start(const tunneld_options &options) { tunneld_start(&daemon, options, out); }
    // One command through the daemon; its status.
    uint32_t done(uint16_t code, uint16_t id, uint32_t remote) {
        give(code, id, remote);
        EXPECT_TRUE(tunneld_step(&daemon));
        EXPECT_EQ(mailbox->command, 0);
        return mailbox->status;
    }
    // The lines since the last call.
    std::string lines() {
        fflush(out);
        const std::string all(text, length);
        const std::string fresh = all.substr(told);
        told = all.size();
        return fresh;
    }
    static tunneld before_wccpd;
    tunneld daemon;
    FILE *out = nullptr;
    char *text = nullptr;
    size_t length = 0, told = 0;
};
tunneld Tunneld::before_wccpd;

// The program, with its output in a file.
struct program {
    explicit program(const std::vector<std::string> &options) {
        pid = fork();
        if (pid == 0) {
            std::vector<char *> arguments = {const_cast<char *>("tunneld")};
            for (const std::string &option : options)
                arguments.push_back(const_cast<char *>(option.c_str()));
            arguments.push_back(nullptr);
            if (freopen(path, "w", stdout))
                execv(WCCP_BIN_DIR "/tunneld", arguments.data());
            _exit(127);
        }
    }
    ~program() {
        if (pid > 0) {
            kill(pid, SIGKILL);
            waitpid(pid, nullptr, 0);
        }
    }
    int end() {
        kill(pid, SIGTERM);
        int status = -1;
        EXPECT_TRUE(soon([&] { return waitpid(pid, &status, WNOHANG) == pid; }));
        pid = -1;
        return status;
    }
    static std::string output() {
        std::stringstream all;
        all << std::ifstream(path).rdbuf();
        return all.str();
    }
    static constexpr const char *path = "/tmp/tunneld.out";
    pid_t pid;
};

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

TEST_F(Tunneld, KeepsATableOfItsTunnels) {
    start({.first_index = 7});
    EXPECT_FALSE(tunneld_step(&daemon)) << "nothing to do";
    EXPECT_EQ(done(MAILBOX_ADD_TUNNEL, 300, 0x0A000002), 0u);
    EXPECT_EQ(mailbox->fmst_index, 7u);
    EXPECT_EQ(done(MAILBOX_ADD_TUNNEL, 301, 0x0A000003), 0u);
    EXPECT_EQ(mailbox->fmst_index, 8u);
    EXPECT_EQ(done(MAILBOX_ADD_TUNNEL, 300, 0x0A000002), 0u) << "given again";
    EXPECT_EQ(mailbox->fmst_index, 7u);
    EXPECT_EQ(daemon.tunnels.size(), 2u);
    // The same ends under another id, and another tunnel under an id: what was there is replaced.
    EXPECT_EQ(done(MAILBOX_ADD_TUNNEL, 305, 0x0A000002), 0u);
    EXPECT_EQ(done(MAILBOX_ADD_TUNNEL, 301, 0x0A000009), 0u);
    ASSERT_EQ(daemon.tunnels.size(), 2u);
    EXPECT_EQ(daemon.tunnels.at(305).remote, 0x0A000002u);
    EXPECT_EQ(daemon.tunnels.at(301).remote, 0x0A000009u);
    lines();
    EXPECT_EQ(done(MAILBOX_DELETE_TUNNEL, 305, 0x0A000002), 0u);
    EXPECT_EQ(done(MAILBOX_DELETE_TUNNEL, 305, 0x0A000002), 1u) << "gone already";
    EXPECT_EQ(daemon.tunnels.size(), 1u);
    EXPECT_EQ(lines(), "delete tunnel 305 10.0.0.1 <=> 10.0.0.2 index 9: done\n"
                       "delete tunnel 305 10.0.0.1 <=> 10.0.0.2 index none: no such tunnel\n");
    mailbox->l2_group = 51;
    mailbox->l2_value = 1;
    EXPECT_EQ(done(MAILBOX_L2_RETURN, 0, 0), 0u);
    EXPECT_EQ(lines(), "L2 return group 51 value 1: done\n");
    EXPECT_EQ(done(9, 0, 0), 1u) << "an unknown code is answered too";
}

TEST_F(Tunneld, FailsOnDemand) {
    start({.refuse = true});
    EXPECT_EQ(done(MAILBOX_ADD_TUNNEL, 300, 0x0A000002), 1u);
    EXPECT_EQ(mailbox->fmst_index, WCCP_NO_INDEX);
    EXPECT_EQ(done(MAILBOX_L2_RETURN, 0, 0), 1u);
    start({.first_index = WCCP_NO_INDEX});
    EXPECT_EQ(done(MAILBOX_ADD_TUNNEL, 300, 0x0A000002), 0u);
    EXPECT_EQ(mailbox->fmst_index, WCCP_NO_INDEX);
    EXPECT_TRUE(daemon.tunnels.empty());
    lines();
    start({.silent = true});
    for (int i = 0; i < 3; i++) {
        give(MAILBOX_ADD_TUNNEL, 300, 0x0A000002);
        tunneld_step(&daemon);
        EXPECT_EQ(mailbox->command, MAILBOX_ADD_TUNNEL);
    }
    EXPECT_EQ(lines(), "add tunnel 300 10.0.0.1 <=> 10.0.0.2 index none: not answered\n") << "told once";
}

// A command that wccpd takes back while it is carried out: an answer would be taken for another command's.
TEST_F(Tunneld, ACommandThatWasGivenUpGetsNoAnswer) {
    start({.slow_ms = 60});
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
        EXPECT_TRUE(tunneld_step(&daemon));
        wccpd.join();
        EXPECT_EQ(mailbox->status, row.answered ? 0u : 77u) << row.code << " " << row.id;
        EXPECT_EQ(daemon.tunnels.size(), row.answered ? 1u : 0u);
        EXPECT_EQ(mailbox->command, row.answered ? 0 : row.code);
    }
}

TEST_F(Tunneld, TheProgramAnswersBeforeAndAfterAnother) {
    for (int run = 0; run < 2; run++) {
        mailbox->policy_roles[65535].role = run == 0 ? 0 : 1;
        program tunneld({"--json", "--roles", "--index", "40"});
        give(MAILBOX_ADD_TUNNEL, 300, 0x0A000002);
        ASSERT_TRUE(soon([] { return mailbox->command == 0; }));
        EXPECT_EQ(mailbox->status, 0u);
        EXPECT_EQ(mailbox->fmst_index, 40u);
        EXPECT_TRUE(soon([] { return program::output().find("policy_group") != std::string::npos; }));
        EXPECT_EQ(tunneld.end(), 0) << "SIGTERM ends it in order";
        std::istringstream output(program::output());
        std::string line;
        std::vector<nlohmann::json> objects;
        while (std::getline(output, line))
            objects.push_back(nlohmann::json::parse(line));
        ASSERT_EQ(objects.size(), 3u);
        EXPECT_EQ(objects[0]["event"], "attached");
        EXPECT_EQ(objects[1]["command"], "add");
        EXPECT_EQ(objects[1]["tunnel_id"], 300);
        EXPECT_EQ(objects[1]["remote"], "10.0.0.2");
        EXPECT_EQ(objects[1]["index"], 40);
        EXPECT_EQ(objects[1]["result"], "done");
        EXPECT_EQ(objects[2]["policy_group"], 65535);
        EXPECT_EQ(objects[2]["role"], run == 0 ? "ACTIVE" : "BACKUP");
    }
}

TEST_F(Tunneld, TheProgramSleepsMostOfTheTime) {
    const auto cpu_ms = [] {
        rusage usage;
        getrusage(RUSAGE_CHILDREN, &usage);
        return (usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) * 1000 +
               (usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1000;
    };
    const auto before = cpu_ms();
    program tunneld({"--silent"});
    give(MAILBOX_ADD_TUNNEL, 300, 0x0A000002);
    ASSERT_TRUE(soon([] { return program::output().find("not answered") != std::string::npos; }));
    std::this_thread::sleep_for(1s);
    EXPECT_EQ(tunneld.end(), 0);
    EXPECT_LT(cpu_ms() - before, 500);
}
