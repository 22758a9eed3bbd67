// wccpd and tunneld at the mailbox, on separate threads.

#include "engine/wccpd_common.h"

#include <poll.h>
#include <sys/resource.h>
#include <sys/syscall.h>

#include <chrono>
#include <thread>

#include <gtest/gtest.h>

#include "engine/wccp_complaints.h"
#include "engine/wccp_host.h"
#include "tests/support/fake_tunneld.h"
#include "tests/support/log_lines.h"
#include "tests/support/test_host.h"

using namespace std::chrono_literals;

namespace {

const mailbox_address ONE = {{1, 0}}, TWO = {{2, 0}};

std::atomic<bool> no_waiting, answers_late;
std::atomic<int> polls, seconds_later;

// A process that has not created the mailbox, and only reads it, changes nothing.
int act_as_second_wccpd(int first) {
    const uint8_t id = 9;
    char byte;
    EXPECT_EQ(read(first, &byte, 1), 1);
    log_lines log;
    EXPECT_TRUE(wccp_init_shmem() == 1 && log.say("double create attempt"));
    EXPECT_TRUE(wccp_get_role(300) == 0 && wccp_mailbox);
    wccp_set_role(id, 1);
    wccp_add_policy_grp(300, 1, &id);
    wccp_del_entire_policy_grp(300);
    EXPECT_EQ(log.take(), "");
    uint32_t index = 5;
    EXPECT_TRUE(wccp_del_tunnel_encap(1, ONE, TWO, &index) == 1 && wccp_cleanup_shmem() == 0);
    return testing::Test::HasFailure() ? 1 : 0;
}

struct Mailbox : testing::Test {
    static void SetUpTestSuite() {
        write_mem_conf();
        int ready[2];
        ASSERT_EQ(pipe(ready), 0);
        const pid_t second = start_child([&ready] { return act_as_second_wccpd(ready[0]); });
        EXPECT_EQ(wccp_get_tunnel_command(), 0) << "no block yet";
        EXPECT_TRUE(wccp_get_role(7) == 2 && wccp_get_fmst_index() == WCCP_NO_INDEX);
        wccp_set_tunnel_command_status(0);
        uint32_t index = 5;
        EXPECT_TRUE(wccp_add_tunnel_encap(1, ONE, TWO, &index) == 1 && wccp_cleanup_shmem() == 0);
        ASSERT_TRUE(wccp_init_shmem() == 0 && wccp_get_fmst_index() == WCCP_NO_INDEX);
        EXPECT_EQ(wccp_init_shmem(), 1) << "its creator lives";
        ASSERT_TRUE(wccp_mailbox);
        const uint8_t id = 9;
        wccp_add_policy_grp(300, 1, &id);
        wccp_set_role(id, 0);
        wccp_mailbox->command = MAILBOX_L2_RETURN;
        EXPECT_TRUE(write(ready[1], "", 1) == 1 && wait_for_child(second) == 0);
        EXPECT_TRUE(wccp_get_role(300) == 0 && wccp_get_tunnel_command() == MAILBOX_L2_RETURN);
        wccp_cleanup_shmem();
    }
    void TearDown() override { wccp_cleanup_shmem(); }
};

} // namespace

// Replace the C library's: a wait can take no time, and the clock can be advanced.
extern "C" int poll(pollfd *fds, nfds_t count, int ms) {
    if (count != 0 || !no_waiting)
        return static_cast<int>(syscall(SYS_poll, fds, count, ms));
    if (++polls == 2000 && answers_late.exchange(false)) {
        wccp_set_fmst_index(77);
        wccp_set_tunnel_command_status(0);
    }
    return 0;
}
extern "C" int clock_gettime(clockid_t clock, timespec *out) noexcept {
    const long result = syscall(SYS_clock_gettime, clock, out);
    out->tv_sec += seconds_later;
    return static_cast<int>(result);
}

#ifndef WCCP_SANITIZED
// Before any thread has run: memory that a thread has freed could hold the table.
TEST_F(Mailbox, WithoutMemoryAMembershipIsRefusedAndTheRestStays) {
    const uint8_t id = 9;
    rlimit before;
    getrlimit(RLIMIT_AS, &before);
    const rlimit none = {1, before.rlim_max};
    setrlimit(RLIMIT_AS, &none);
    uint16_t refused = 1;
    while (refused != 0 && wccp_add_policy_grp(refused, 1, &id) == 0)
        refused++;
    setrlimit(RLIMIT_AS, &before);
    for (uint16_t policy = 1; policy <= refused; policy++)
        ASSERT_EQ(wccp_check_policy_group(policy, id), policy < refused);
    wccp_set_role(id, 0);
    EXPECT_EQ(wccp_get_role(refused), 2u);
    EXPECT_EQ(wccp_get_role(static_cast<uint16_t>(refused - 1)), 0u) << "the last one that accepted it";
    EXPECT_EQ(wccp_add_policy_grp(refused, 1, &id), 0) << "with memory again";
}
#endif

// tests/engine_tunnel_mt_test.cpp has the other answers.
TEST_F(Mailbox, AnswersComeBackAsTheyWereGiven) {
    fake_tunneld tunneld([](const seen_command &) { return tunneld_answer{5, 78}; });
    mailbox_put(wccp_mailbox->l2_group, uint8_t{7});
    mailbox_put(wccp_mailbox->l2_value, 8u);
    uint32_t index = WCCP_NO_INDEX;
    EXPECT_EQ(wccp_add_tunnel_encap(300, {{0x0A000001, 0}}, {{0xFFFFFFFE, 0}}, &index), 5);
    EXPECT_EQ(std::exchange(index, 4u), 78u);
    EXPECT_EQ(wccp_del_tunnel_encap(65534, {{0x0A000001, 0}}, {{0xC0A80001, 0}}, &index), 5);
    EXPECT_TRUE(index == 78 && wccp_set_L2_return(255, 0xABCD1234) == 5);
    // What is not an input of a command is unchanged.
    EXPECT_EQ(tunneld.take_commands(),
              (std::vector<seen_command>{{2, 300, 0x0A000001, 0xFFFFFFFE, WCCP_NO_INDEX, 7, 8},
                                         {1, 65534, 0x0A000001, 0xC0A80001, 4, 7, 8},
                                         {3, 65534, 0x0A000001, 0xC0A80001, 78, 255, 0xABCD1234}}));
}

// No answers. A wait takes 2000 polls.
TEST_F(Mailbox, ATunneldThatDoesNotAnswerIsTriedAgainAfterTenSeconds) {
    uint32_t index = 42;
    const auto add = [&] { return wccp_add_tunnel_encap(9, ONE, TWO, &index); };
    const auto remove = [&] { return wccp_del_tunnel_encap(9, ONE, TWO, &index); };
    const auto l2_return = [] { return wccp_set_L2_return(3, 1); };
    const auto clear_slot = [] { wccp_set_tunnel_command_status(0); };
    const auto exiting = [](int value) { return [value] { wccpd_exiting = value; }; };
    const auto late_answer = [] { answers_late = true; };
    const auto later = [](int seconds) { return [seconds] { seconds_later += seconds; }; };
    const std::string add_line = ".NOTICE]: wccpd: GRE tunnel add timed out",
                      l2_line = ".ERR]: wccpd: GRE tunnel L2 return add timed out", no_line;
    const struct {
        std::function<void()> before;
        std::function<int()> give;
        int polls;
        uint16_t left; // in the slot
        const std::string &line;
        int result = 1;
    } steps[] = {
        {nullptr, l2_return, 2000, MAILBOX_L2_RETURN, l2_line},
        {nullptr, add, 0, MAILBOX_L2_RETURN, add_line},
        {nullptr, remove, 2000, MAILBOX_DELETE_TUNNEL, no_line},
        {nullptr, remove, 0, MAILBOX_DELETE_TUNNEL, no_line},
        {clear_slot, add, 2000, MAILBOX_IDLE, add_line},
        {nullptr, add, 0, MAILBOX_IDLE, add_line}, // a withdrawn add leaves nothing to clear
        {later(9), l2_return, 0, MAILBOX_IDLE, l2_line},
        {later(1), l2_return, 2000, MAILBOX_L2_RETURN, l2_line},
        {later(9), add, 0, MAILBOX_L2_RETURN, add_line},
        {later(1), add, 2000, MAILBOX_IDLE, add_line},
        {exiting(1), remove, 2000, MAILBOX_DELETE_TUNNEL, no_line},
        {nullptr, remove, 0, MAILBOX_DELETE_TUNNEL, no_line},
        {later(60), add, 0, MAILBOX_DELETE_TUNNEL, add_line},
        {exiting(0), remove, 2000, MAILBOX_DELETE_TUNNEL, no_line},
        {later(10), remove, 2000, MAILBOX_DELETE_TUNNEL, no_line},
        {clear_slot, remove, 2000, MAILBOX_DELETE_TUNNEL, no_line},
        // An answer during the last poll counts, and after it nothing is refused.
        {[&] { later(10)(), late_answer(); }, remove, 2000, MAILBOX_IDLE, no_line, 0},
        {late_answer, add, 2000, MAILBOX_IDLE, no_line, 0},
        {late_answer, l2_return, 2000, MAILBOX_IDLE, no_line, 0},
    };
    log_lines log;
    no_waiting = true;
    for (const auto &step : steps) {
        SCOPED_TRACE(&step - steps);
        if (step.before)
            step.before();
        polls = 0;
        EXPECT_EQ(step.give(), step.result);
        EXPECT_EQ(std::tuple(index, polls.load(), wccp_get_tunnel_command()),
                  std::tuple(step.result ? 42 : 77, step.polls, step.left));
        const std::string said = log.take();
        EXPECT_TRUE(step.line.empty() ? said.empty() : said.find(step.line) != std::string::npos) << said;
    }
    // Each packet of a new router causes an add. Their complaints are limited.
    wccp_interface wan0 = {};
    const wccp_complaint_scope complaints(&wan0);
    int lines = 0;
    for (int packet = 0; packet < 300; packet++)
        lines += add() == 1 && log.say(add_line);
    EXPECT_EQ(lines, 200);
    polls = 0;
    later(10)();
    late_answer();
    EXPECT_EQ(add(), 0) << "for the tests that follow";
    no_waiting = false;
}

// A writer that replaces its command all the time, as wccpd does after a time-out.
TEST_F(Mailbox, AReplacedCommandIsNeverReadHalf) {
    std::atomic<bool> stop = false;
    std::thread writer([&] {
        for (uint32_t i = 1; !stop; i++) {
            const uint32_t value = i % 60000;
            wccp_mailbox->command.store(0, std::memory_order_release);
            mailbox_put(wccp_mailbox->tunnel_id, static_cast<uint16_t>(value));
            mailbox_put(wccp_mailbox->local_ip, value);
            mailbox_put(wccp_mailbox->remote_ip, value);
            mailbox_put(wccp_mailbox->fmst_index, value);
            wccp_mailbox->command.store(static_cast<uint16_t>(1 + i % 2), std::memory_order_release);
            // Several within one read, then one for long enough.
            const auto next = std::chrono::steady_clock::now() + (i % 8 ? 0us : 40us);
            while (std::chrono::steady_clock::now() < next)
                ;
        }
    });
    int whole = 0, torn = 0;
    const auto end = std::chrono::steady_clock::now() + 500ms;
    while (std::chrono::steady_clock::now() < end) {
        uint16_t id = 0;
        mailbox_address local = {}, remote = {};
        uint32_t index = 0;
        const uint16_t code = wccp_get_tunnel_command();
        wccp_get_tunnel_parameters(&id, &local, &remote, &index);
        if (code == MAILBOX_IDLE || wccp_get_tunnel_command() != code)
            continue;
        whole++;
        torn += local.words[0] != id || remote.words[0] != id || index != id;
    }
    stop = true;
    writer.join();
    EXPECT_TRUE(whole > 100 && torn == 0);
}

TEST_F(Mailbox, AResetEndsAWaitWithoutAnAnswer) {
    for (int round = 0; round < 10; round++) {
        fake_tunneld tunneld(tunneld_is_silent);
        uint32_t index = 42, queued_index = 42;
        const auto began = std::chrono::steady_clock::now();
        std::thread add([&] { EXPECT_EQ(wccp_add_tunnel_encap(9, ONE, TWO, &index), 1); });
        tunneld.wait_for_command();
        std::thread queued([&] { wccp_del_tunnel_encap(9, ONE, TWO, &queued_index); });
        wccp_cleanup_shmem();
        add.join();
        tunneld.answer_with(tunneld_does);
        queued.join();
        EXPECT_LT(std::chrono::steady_clock::now() - began, 1500ms);
        EXPECT_EQ(index, 42u);
        EXPECT_TRUE(wccp_del_tunnel_encap(9, ONE, TWO, &index) == 0 && index == 1009) << "later ones work";
    }
}

TEST_F(Mailbox, AServiceGroupFollowsItsLastPolicyGroup) {
    const uint8_t id = 51;
    wccp_set_role(id, 0);
    wccp_add_policy_grp(1, 1, &id);
    wccp_add_policy_grp(65535, 1, &id);
    EXPECT_EQ(wccp_check_policy_group(1, id) + wccp_check_policy_group(65535, id), 2) << "the bit remains";
    const auto roles = [&](uint32_t next, const std::vector<uint32_t> &wanted) { // of 0, 1 and 65535
        wccp_set_role(id, next);
        EXPECT_EQ((std::vector{wccp_get_role(0), wccp_get_role(1), wccp_get_role(65535)}), wanted);
    };
    roles(1, {2, 0, 1});
    wccp_del_entire_policy_grp(1);
    roles(0, {2, 2, 1}); // since the delete it has no policy group
    // Policy group 0 can have members but does not follow them.
    wccp_add_policy_grp(0, 1, &id);
    roles(1, {0, 2, 1});
}

// Memberships change on the main thread while engine threads change roles. After the reset at exit, tunneld
// sees only UNKNOWN.
TEST_F(Mailbox, MembersAndRolesChangeConcurrently) {
    std::atomic<bool> stop = false;
    std::thread engine([&] {
        for (uint32_t i = 0; !stop; i++)
            wccp_set_role(static_cast<uint8_t>(i), i % 3);
    });
    uint32_t wrong = 0;
    for (int round = 0; round < 40; round++) {
        const auto end = std::chrono::steady_clock::now() + 2ms;
        for (uint32_t i = 0; std::chrono::steady_clock::now() < end; i++) {
            const auto policy = static_cast<uint16_t>(1 + i % 40);
            const uint8_t ids[] = {static_cast<uint8_t>(i), static_cast<uint8_t>(i * 7)};
            wccp_add_policy_grp(policy, 2, ids);
            wccp_remove_policy_grp(policy, ids[1]);
            if (i % 5 == 0)
                wccp_del_entire_policy_grp(policy);
        }
        wccp_mailbox->l2_value = 7;
        wccp_cleanup_shmem();
        std::this_thread::sleep_for(1ms);
        for (uint32_t policy = 0; policy < WCCP_POLICY_GROUPS; policy++)
            wrong += wccp_mailbox->policy_roles[policy].policy_group != policy ||
                     wccp_get_role(static_cast<uint16_t>(policy)) != 2;
        const char zeroes[28] = {}; // including the index
        wrong += memcmp(static_cast<void *>(wccp_mailbox), zeroes, sizeof zeroes) != 0;
    }
    stop = true;
    engine.join();
    EXPECT_EQ(wrong, 0u);
}
