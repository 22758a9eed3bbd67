// Start and stop of the engine in both modes, the tick, allocation, and the named threads.

#include <pthread.h>
#include <sched.h>
#include <signal.h>
#include <sys/resource.h>

#include <algorithm>

#include "engine/wccpd_common.h"
#include "platform/qvcommon.h"
#include "tests/support/engine_fixture.h"
#include "tests/support/fake_tunneld.h"

// Replaces the platform's library: registration fails on request, and no thread is started.
static bool registration_fails;
int qv_register_netlink_notifier(uint32_t, qv_netlink_callback) {
    return registration_fails ? 5 : 0;
}
int qv_start_netlink_monitor(uint32_t) {
    return 0;
}

namespace {

struct Manager : testing::Test {
    void SetUp() override {
        wccpd_exiting = 0;
        registration_fails = false;
        test_host_bridge_mode = 0;
        strlcpy(wccp_primary_wan_interface_name, "lo", sizeof wccp_primary_wan_interface_name);
        write_mem_conf();
    }
    void TearDown() override {
        wccpd_exiting = 0;
        wccp_exit_mgr();
        EXPECT_EQ(wccp_g.stat_allocs, wccp_g.stat_frees);
    }
    static wccp_service_group *add_group(uint8_t id, uint32_t admin) {
        wccp_grp_config config = engine_fixture::group_config(id, {}, "lo");
        config.admin = admin;
        EXPECT_EQ(wccp_add_group(&config), 0);
        return wccp_find_group(id);
    }
};

TEST_F(Manager, StartsThreadsMailboxAndPrimaryInterface) {
    memset(static_cast<void *>(&wccp_g.seconds), 0xff, sizeof wccp_g.seconds);
    registration_fails = true; // not a failure of the start
    EXPECT_EQ(wccp_init_link_mgr(), 5);
    wccp_deinit_link_mgr();
    ASSERT_TRUE(wccp_init_mgr() == 0 && wccp_g.primary_if);
    EXPECT_STREQ(wccp_g.primary_if->name, "lo");
    EXPECT_TRUE(wccp_g.seconds < 10 && wccp_g.mcast_ttl == 5 && wccp_g.interfaces[126].ucast_fd == -1);
    EXPECT_TRUE(wccp_mailbox && threads_named("WCCP_TIMER") == 1 && threads_named("WCCP_RX_lo") == 1);
    const wccp_service_group *zero = add_group(0, WCCP_ADMIN_DOWN);
    EXPECT_TRUE(wccp_find_group(256) == zero && !wccp_find_group(1));
}

TEST_F(Manager, InBridgeModeThereAreReceiversButNoTicks) {
    test_host_bridge_mode = 1;
    ASSERT_EQ(wccp_init_mgr(), 0);
    EXPECT_EQ(threads_named("WCCP_RX_lo"), 1) << "an interface with an address has its receive thread";
    EXPECT_EQ(threads_named("WCCP_TIMER"), 0);
    // A tick counts enabled groups only, and does nothing once the exit has begun.
    wccp_service_group *up = add_group(1, WCCP_ADMIN_UP), *down = add_group(2, WCCP_ADMIN_DOWN),
                       *unset = add_group(3, 0);
    EXPECT_EQ(up->hia_timer.active + down->hia_timer.active + unset->hia_timer.active, 1);
    unset->monitor_timer = down->monitor_timer = up->monitor_timer;
    for (const int exiting : {0, 0, 1}) {
        wccpd_exiting = exiting;
        wccp_tick();
    }
    EXPECT_EQ(std::tuple(wccp_g.seconds, up->monitor_timer.countdown, down->monitor_timer.countdown,
                         unset->monitor_timer.countdown),
              std::tuple(2, 3, 5, 5));
}

TEST_F(Manager, OnlyBridgeModeStopsTheEngine) {
    ASSERT_EQ(wccp_init_mgr(), 0);
    const wccp_service_group *group = add_group(1, WCCP_ADMIN_UP);
    for (const char *unknown : {"", "Bridge", "bridged", "bridg", static_cast<const char *>(nullptr)})
        EXPECT_EQ(wccp_system_mode_change_event(unknown), 1);
    EXPECT_EQ(wccp_system_mode_change_event("router") + wccp_system_mode_change_event("server"), 0);
    EXPECT_TRUE(group->hia_timer.active == 1 && threads_named("WCCP_TIMER") == 1);
    EXPECT_EQ(wccp_system_mode_change_event("bridge"), 0);
    EXPECT_TRUE(group->hia_timer.active == 0 && group->admin_state == WCCP_ADMIN_UP);
    EXPECT_EQ(wccp_system_mode_change_event("router"), 0) << "nothing starts them again";
    EXPECT_EQ(threads_named("WCCP_"), 0);
}

TEST_F(Manager, AllocationsAreZeroedAndCounted) {
    ASSERT_EQ(wccp_init_mgr(), 0);
    const uint32_t allocs = wccp_g.stat_allocs, frees = wccp_g.stat_frees;
    auto *dirty = static_cast<uint8_t *>(wccp_malloc(4096));
    memset(dirty, 0xff, 4096);
    wccp_free(dirty);
    auto *clean = static_cast<uint8_t *>(wccp_malloc(4096));
    EXPECT_EQ(std::count(clean, clean + 4096, 0), 4096);
    wccp_free(clean);
    wccp_free(nullptr);
    EXPECT_TRUE(wccp_g.stat_allocs == allocs + 2 && wccp_g.stat_frees == frees + 2);
#ifndef WCCP_SANITIZED // whose allocator ends the program
    EXPECT_EQ(wccp_calloc(0xffffffff, 0xffffffff), nullptr);
    EXPECT_TRUE(wccp_g.stat_alloc_fails == 1 && wccp_g.stat_allocs == allocs + 2);
#endif
}

TEST(Text, ATimeIsWrittenOnlyWhereItFits) {
    const std::tuple<uint32_t, uint32_t, const char *> rows[] = {
        {0xffffffff, 128, "49710:6:28:15"}, {59, 256 + 32, "0:0:0:59"}, {1, 31, ""}, {1, 256, ""}};
    for (const auto &[seconds, length, wanted] : rows) {
        char text[512] = "";
        wccp_seconds_to_str(seconds, text, length);
        EXPECT_STREQ(text, wanted);
    }
}

struct observation {
    size_t stack = 0;
    sigset_t blocked;
    cpu_set_t cpus = {};
    int runs = 0, ended = 0, nice = 0;
};

void *observe_thread(void *argument) {
    auto *seen = static_cast<observation *>(argument);
    pthread_attr_t attributes;
    pthread_getattr_np(pthread_self(), &attributes);
    pthread_attr_getstacksize(&attributes, &seen->stack);
    pthread_attr_destroy(&attributes);
    pthread_sigmask(SIG_BLOCK, nullptr, &seen->blocked);
    sched_getaffinity(0, sizeof seen->cpus, &seen->cpus);
    seen->nice = getpriority(PRIO_PROCESS, 0);
    seen->runs++;
    return nullptr;
}

TEST(Thread, HasItsNameStackSignalMaskAndCpu) {
    observation seen;
    const auto note_end = [](void *argument) -> void * {
        static_cast<observation *>(argument)->ended++;
        return nullptr;
    };
    cthread *context = cthread_init(std::string(100, 'n').c_str(), observe_thread, &seen, note_end, &seen,
                                    SCHED_OTHER, 3, 0, 7);
    ASSERT_NE(context, nullptr);
    EXPECT_EQ(strlen(context->name), 63u);
    ASSERT_EQ(cthread_start(context), 0);
    EXPECT_TRUE(context->listed == 1 && context->heartbeat != 0);
    cthread_join(context);
    EXPECT_TRUE(seen.runs == 1 && seen.nice == 3 && seen.ended == 1);
#ifndef WCCP_SANITIZED // the sanitizers need more
    EXPECT_LE(seen.stack, 132u * 1024);
#endif
    for (const int number : {SIGHUP, SIGINT, SIGTERM, SIGPIPE, SIGUSR1, SIGUSR2})
        EXPECT_EQ(sigismember(&seen.blocked, number), 1) << number;
    EXPECT_TRUE(CPU_COUNT(&seen.cpus) == 1 && CPU_ISSET(0, &seen.cpus));
    sigset_t own;
    pthread_sigmask(SIG_BLOCK, nullptr, &own);
    EXPECT_EQ(sigismember(&own, SIGTERM), 0) << "the caller's mask is unchanged";

    // A CPU that does not exist does not prevent it from running.
    context = cthread_init("astray", observe_thread, &seen, nullptr, nullptr, SCHED_OTHER, 0, 128, 0);
    ASSERT_EQ(cthread_start(context), 0);
    cthread_join(context);
    EXPECT_EQ(seen.runs, 2);
}

cthread *make_sleeper(uint32_t policy) {
    const auto sleep_for_ever = [](void *) -> void * {
        for (;;)
            pause();
    };
    return cthread_init("sleeper", sleep_for_ever, nullptr, nullptr, nullptr, policy, 0, 0, 0);
}

TEST(Thread, AllAreCancelledBeforeTheFirstIsJoined) {
    // A thread that was not started, or could not be, ends all the same.
    cthread *idle = make_sleeper(SCHED_OTHER), *refused = make_sleeper(77);
    cthread_cancel(idle);
    cthread_join(idle);
    EXPECT_TRUE(cthread_start(refused) == 1 && refused->listed == 0);
    cthread_join(refused);

    cthread *one = nullptr;
    for (int i = 0; i < 21; i++) {
        one = make_sleeper(SCHED_OTHER);
        ASSERT_EQ(cthread_start(one), 0);
    }
    cthread_cancel(one);
    EXPECT_EQ(one->listed, 0);
    cthread_join(one);
    cthread *chain = cthread_cancel_listed();
    int count = 0;
    for (const cthread *context = chain; context; context = context->next)
        count++;
    EXPECT_TRUE(count == 20 && !cthread_cancel_listed());
    cthread_join_chain(chain);
}

} // namespace
