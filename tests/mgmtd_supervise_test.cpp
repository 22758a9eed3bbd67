// Processes that mgmtd starts, or whose ends it detects by their sessions.
#include <csignal>

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/wait.h>
#include <unistd.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtd/supervise.h"
#include "tests/support/texts.h"

namespace {

// "tunneld", which takes over, is "sleep 100". Time moves only when a test moves it.
struct Supervision : testing::Test {
    supervisor self;
    int64_t now = 100000;
    std::string said;
    strings events, restarts;
    child *tunneld = nullptr;

    void SetUp() override {
        self.now_ms = [this] { return now; };
        self.say = [this](const std::string &line) { said += line + "\n"; };
        self.report = [this](const std::string &event, const std::string &process) {
            events.push_back(process + event);
        };
        self.restarted = [this](const std::string &process, const std::string &last_end) {
            restarts.push_back(process + " " + last_end);
        };
        self.children = {{"tunneld", {"sleep", "100"}}};
        tunneld = &self.children[0];
        tunneld->takes_over = true;
    }
    void TearDown() override {
        self.ending = true;
        if (tunneld->pidfd >= 0)
            (void)end(SIGKILL, 0);
    }
    void open_session() { supervisor_session_opened(&self, "tunneld-" + std::to_string(tunneld->pid)); }
    static void await_end(const child &of) {
        pollfd ended = {of.pidfd, POLLIN, 0};
        EXPECT_EQ(poll(&ended, 1, 5000), 1);
    }
    // Ends the process after a run of that length. Returns the time until the next tick.
    int64_t end(int signal, int64_t ran_ms) {
        now += ran_ms;
        kill(tunneld->pid, signal);
        await_end(*tunneld);
        supervisor_reap(&self);
        return supervisor_tick(&self) - now;
    }
    int64_t tick(int64_t after_ms) {
        now += after_ms;
        return supervisor_tick(&self);
    }
};

TEST_F(Supervision, AnEndHasItsNameAndTheNextStartItsDelay) {
    int64_t delay = 0;
    for (const int64_t expected : {1000, 2000, 4000, 8000, 16000, 30000, 30000})
        EXPECT_EQ(delay = next_delay(delay, 10), expected);
    EXPECT_EQ(next_delay(delay, SETTLED_MS), 1000);
    EXPECT_STREQ(end_event(SIGKILL, false), EVENT_PROCESS_CRASH);
    EXPECT_STREQ(end_event(SIGTERM, false), EVENT_PROCESS_TERMINATE);
    EXPECT_STREQ(end_event(W_EXITCODE(1, 0), false), EVENT_PROCESS_EXIT);
    EXPECT_STREQ(end_event(W_EXITCODE(0, 0), true), EVENT_PROCESS_TERMINATE);
}

// After mgmtd was killed: the child of the killed one must end before the next is started.
TEST_F(Supervision, AnEarlierRunEndsFirst) {
    tunneld->lock_file = "/tmp/slow.lock";
    supervisor earlier = self;
    (void)supervisor_tick(&earlier);
    said.clear();
    EXPECT_EQ(supervisor_tick(&self), now + EARLIER_RUN_EVERY_MS);
    (void)tick(EARLIER_RUN_EVERY_MS);
    EXPECT_EQ(said, "process tunneld: an earlier one still runs; waits for its end\n");
    kill(earlier.children[0].pid, SIGKILL); // its end counts before it has been reaped
    await_end(earlier.children[0]);
    (void)tick(EARLIER_RUN_EVERY_MS);
    EXPECT_FALSE(supervisor_is_done(self));
    earlier.ending = true;
    supervisor_reap(&earlier);
    EXPECT_TRUE(supervisor_is_done(earlier));
    unlink("/tmp/slow.lock");
}

// Its process ID may have been reused.
TEST_F(Supervision, AChildReapedElsewhereHasEnded) {
    tunneld->takes_over = false;
    (void)supervisor_tick(&self);
    kill(tunneld->pid, SIGKILL);
    ASSERT_EQ(waitpid(tunneld->pid, nullptr, 0), tunneld->pid);
    supervisor_reap(&self);
    EXPECT_TRUE(supervisor_is_done(self));
    EXPECT_EQ(events, strings{"tunneld" EVENT_PROCESS_EXIT});
}

// tunneld is killed: the loss is reported unless the next one has its session in time.
TEST_F(Supervision, ALossIsReportedUnlessTheNextTakesOverInTime) {
    (void)supervisor_tick(&self);
    open_session();
    EXPECT_EQ(end(SIGKILL, 1000), TAKE_OVER_MS);
    EXPECT_FALSE(supervisor_is_done(self)) << "started again at once";
    supervisor_session_opened(&self, "tunneld-1");
    (void)tick(TAKE_OVER_MS - 1);
    said.clear();
    open_session();
    EXPECT_EQ(said, "process tunneld: ended by SIGKILL, replaced after 2999 ms\n");
    EXPECT_EQ(tick(1), -1);
    EXPECT_EQ(events, strings{});

    // Too late; a process that never had a session is restarted after the usual delays, within the same loss.
    EXPECT_EQ(end(SIGKILL, 1000), TAKE_OVER_MS);
    EXPECT_EQ(end(SIGKILL, 10), RESTART_DELAY_FIRST_MS);
    EXPECT_EQ(events, strings{});
    (void)tick(TAKE_OVER_MS - 10);
    EXPECT_EQ(events, strings{"tunneld" EVENT_PROCESS_CRASH});
    open_session();
    EXPECT_TRUE(lacks(said, "replaced after 30"));
    // One that ends soon after it has taken over is restarted with a delay.
    EXPECT_GT(end(SIGKILL, SHORT_RUN_MS - 1), 0);
    EXPECT_TRUE(supervisor_is_done(self));
    (void)tick(RESTART_DELAY_MAX_MS);
    EXPECT_EQ(restarts, strings(4, "tunneld ended by SIGKILL"));

    // An orderly end is reported immediately, and so is the end of mgmtd.
    events.clear();
    open_session();
    EXPECT_GE(end(SIGTERM, 1000), RESTART_DELAY_FIRST_MS);
    EXPECT_EQ(events, strings{"tunneld" EVENT_PROCESS_TERMINATE});
    (void)tick(RESTART_DELAY_MAX_MS);
    open_session();
    (void)end(SIGKILL, 1000);
    self.ending = true;
    (void)supervisor_tick(&self);
    (void)end(SIGKILL, TAKE_OVER_MS);
    EXPECT_EQ(events, strings(2, "tunneld" EVENT_PROCESS_TERMINATE));
    EXPECT_TRUE(supervisor_is_done(self));
}

// Started by systemd: mgmtd knows the sessions, and the reports of the process itself.
TEST_F(Supervision, AProcessStartedElsewhereIsKnownByItsSessions) {
    self.children = {{"tunneld", {}}, {"wccpd", {}}};
    tunneld = &self.children[0];
    tunneld->takes_over = true;
    EXPECT_EQ(supervisor_tick(&self), -1) << "nothing is started";
    // Sessions that open ("+") and close ("-"). Returns the time until the next tick.
    const auto sessions = [&](std::initializer_list<std::string> steps) {
        for (const std::string &step : steps)
            (step[0] == '+' ? supervisor_session_opened : supervisor_session_closed)(&self, step.substr(1));
        return supervisor_tick(&self) - now;
    };
    EXPECT_EQ(sessions({"+tunneld-7", "-tunneld-7"}), TAKE_OVER_MS);
    now += 40;
    EXPECT_LT(sessions({"+tunneld-9"}), 0);
    EXPECT_EQ(said, "process tunneld: its session is lost, replaced after 40 ms\n");

    // An orderly end is reported by the process; the end of its session is not a second one.
    EXPECT_TRUE(supervisor_take_report(&self, "tunneld"));
    EXPECT_LT(sessions({"-tunneld-9"}), 0);
    EXPECT_EQ(sessions({"+tunneld-11", "-tunneld-11"}), TAKE_OVER_MS);
    (void)tick(TAKE_OVER_MS);
    EXPECT_EQ(events, strings{"tunneld" EVENT_PROCESS_CRASH});

    (void)sessions({"+wccpd-8", "+wccpd-8", "-wccpd-8"});
    EXPECT_EQ(events.size(), 1u) << "it has another session";
    (void)sessions({"-wccpd-8"});
    EXPECT_EQ(events.back(), "wccpd" EVENT_PROCESS_EXIT);
    tunneld->command = {"tunneld"};
    EXPECT_FALSE(supervisor_take_report(&self, "tunneld")) << "the supervisor reports what it has started";
}

} // namespace
