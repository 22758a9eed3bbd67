// Processes that mgmtd starts, or whose ends it sees by their sessions.
#include <csignal>

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/wait.h>
#include <unistd.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtd/supervise.h"

using strings = std::vector<std::string>;

TEST(Supervision, AnEndHasItsNameAndTheNextStartItsDelay) {
    int64_t delay = 0;
    for (const int64_t expected : {1000, 2000, 4000, 8000, 16000, 30000, 30000})
        EXPECT_EQ(delay = next_delay(delay, 10), expected);
    EXPECT_EQ(next_delay(delay, SETTLED_MS), 1000);
    const struct {
        int status;
        bool ending;
        const char *event;
    } cases[] = {{SIGKILL, false, "/pm/events/failure/crash"},
                 {SIGTERM, false, "/pm/events/proc/terminate"},
                 {W_EXITCODE(1, 0), false, "/pm/events/failure/unexpected_exit"},
                 {W_EXITCODE(0, 0), true, "/pm/events/proc/terminate"}};
    for (const auto &one : cases)
        EXPECT_STREQ(end_event(one.status, one.ending), one.event);
}

// Of a mgmtd that was killed: the program is ending, and cannot be started beside itself.
TEST(Supervision, AnEarlierRunEndsFirst) {
    std::string said;
    int64_t now = 1000;
    supervisor self, earlier;
    for (supervisor *each : {&earlier, &self}) {
        each->children.push_back({"slow", {"sleep", "100"}});
        each->children[0].lock_file = "/tmp/slow.lock";
        each->now_ms = [&] { return now; };
        each->say = [&](const std::string &line) { said += line + "\n"; };
        each->report = [](const std::string &, const std::string &) {};
    }
    (void)supervisor_tick(&earlier);
    said.clear();
    EXPECT_EQ(supervisor_tick(&self), now + EARLIER_RUN_EVERY_MS);
    now += EARLIER_RUN_EVERY_MS;
    (void)supervisor_tick(&self);
    EXPECT_EQ(said, "process slow: an earlier one still runs; waits for its end\n");
    kill(earlier.children[0].pid, SIGKILL); // its end counts before anybody has taken it in
    pollfd ended = {earlier.children[0].pidfd, POLLIN, 0};
    ASSERT_EQ(poll(&ended, 1, 5000), 1);
    now += EARLIER_RUN_EVERY_MS;
    (void)supervisor_tick(&self);
    EXPECT_FALSE(supervisor_is_done(self));
    for (supervisor *each : {&earlier, &self}) {
        each->ending = true;
        kill(each->children[0].pid, SIGKILL);
        poll(&(ended = {each->children[0].pidfd, POLLIN, 0}), 1, 5000);
        supervisor_reap(each);
        EXPECT_TRUE(supervisor_is_done(*each));
    }
    unlink("/tmp/slow.lock");
}

// Its number may be another process's by then.
TEST(Supervision, AChildWhoseEndSomebodyElseTookInIsOver) {
    std::vector<std::string> told;
    supervisor self;
    self.children.push_back({"quick", {"true"}});
    self.now_ms = [] { return int64_t{1000}; };
    self.say = [](const std::string &) {};
    self.report = [&](const std::string &event, const std::string &) { told.push_back(event); };
    (void)supervisor_tick(&self);
    ASSERT_FALSE(supervisor_is_done(self));
    ASSERT_EQ(waitpid(self.children[0].pid, nullptr, 0), self.children[0].pid);
    supervisor_reap(&self);
    EXPECT_TRUE(supervisor_is_done(self));
    EXPECT_EQ(told, strings{EVENT_PROCESS_EXIT});
}

// tunneld is killed: whether anybody hears of it depends on how soon the next one has its session.
TEST(Supervision, ALossIsReportedWhenNobodyTakesOverInTime) {
    strings told, restarts;
    std::string said;
    int64_t now = 100000;
    supervisor self;
    self.children.push_back({"tunneld", {"sleep", "100"}});
    self.children[0].takes_over = true;
    self.now_ms = [&] { return now; };
    self.say = [&](const std::string &line) { said += line + "\n"; };
    self.report = [&](const std::string &event, const std::string &) { told.push_back(event); };
    self.restarted = [&](const std::string &process, const std::string &last_end) {
        restarts.push_back(process + " " + last_end);
    };
    child &tunneld = self.children[0];
    const auto open_session = [&] {
        supervisor_session_opened(&self, "tunneld-" + std::to_string(tunneld.pid));
    };
    // Ends after a run of so long. Gives the time of the next thing to do, from then on.
    const auto end = [&](int signal, int64_t ran_ms) {
        now += ran_ms;
        kill(tunneld.pid, signal);
        pollfd ended = {tunneld.pidfd, POLLIN, 0};
        EXPECT_EQ(poll(&ended, 1, 5000), 1);
        supervisor_reap(&self);
        return supervisor_tick(&self) - now;
    };
    (void)supervisor_tick(&self);
    open_session();
    EXPECT_EQ(end(SIGKILL, 1000), TAKE_OVER_MS);
    EXPECT_FALSE(supervisor_is_done(self)) << "started again at once";
    supervisor_session_opened(&self, "tunneld-1");
    now += TAKE_OVER_MS - 1;
    (void)supervisor_tick(&self);
    said.clear();
    open_session();
    EXPECT_EQ(said, "process tunneld: ended by SIGKILL, replaced after 2999 ms\n");
    now++;
    EXPECT_EQ(supervisor_tick(&self), -1);
    EXPECT_EQ(told, strings{});

    // Too late; and the one that never had a session is started by the usual delays, within the same loss.
    EXPECT_EQ(end(SIGKILL, 1000), TAKE_OVER_MS);
    EXPECT_EQ(end(SIGKILL, 10), RESTART_DELAY_FIRST_MS);
    EXPECT_EQ(told, strings{});
    now += TAKE_OVER_MS - 10;
    (void)supervisor_tick(&self);
    EXPECT_EQ(told, strings{EVENT_PROCESS_CRASH});
    open_session();
    EXPECT_EQ(said.find("replaced after 30"), std::string::npos) << said;

    // One that ends as soon as it has taken over is not started again and again without a pause.
    EXPECT_GT(end(SIGKILL, SHORT_RUN_MS - 1), 0);
    EXPECT_TRUE(supervisor_is_done(self));
    now += RESTART_DELAY_MAX_MS;
    (void)supervisor_tick(&self);
    told.clear();

    // That it is replaced each time doesn't hide that it keeps crashing.
    EXPECT_EQ(restarts.size(), 4u);
    EXPECT_EQ(restarts.back(), "tunneld ended by SIGKILL");
    EXPECT_EQ(told, strings{});

    // An orderly end is one, and so is the end of everything.
    open_session();
    EXPECT_GE(end(SIGTERM, 1000), RESTART_DELAY_FIRST_MS);
    EXPECT_EQ(told, strings{EVENT_PROCESS_TERMINATE});
    now += RESTART_DELAY_MAX_MS;
    (void)supervisor_tick(&self);
    open_session();
    (void)end(SIGKILL, 1000);
    self.ending = true;
    (void)supervisor_tick(&self);
    (void)end(SIGKILL, TAKE_OVER_MS);
    EXPECT_EQ(told, (strings{EVENT_PROCESS_TERMINATE, EVENT_PROCESS_TERMINATE}));
    EXPECT_TRUE(supervisor_is_done(self));
}

// Started by systemd, say: mgmtd sees sessions, and what the process itself reports.
TEST(Supervision, SomebodyElsesProcessIsKnownByItsSessions) {
    strings told;
    std::string said;
    int64_t now = 100000;
    supervisor self;
    self.children = {{"tunneld", {}}, {"wccpd", {}}};
    self.children[0].takes_over = true;
    self.now_ms = [&] { return now; };
    self.say = [&](const std::string &line) { said += line; };
    self.report = [&](const std::string &event, const std::string &process) {
        told.push_back(process + event);
    };
    EXPECT_EQ(supervisor_tick(&self), -1) << "nobody is started";
    supervisor_session_opened(&self, "tunneld-7");
    supervisor_session_closed(&self, "tunneld-7");
    EXPECT_EQ(supervisor_tick(&self), now + TAKE_OVER_MS);
    now += 40;
    supervisor_session_opened(&self, "tunneld-9");
    EXPECT_EQ(said, "process tunneld: its session is lost, replaced after 40 ms");
    EXPECT_EQ(supervisor_tick(&self), -1);

    // An orderly end is reported by the process, and the end of its session is no second one.
    EXPECT_TRUE(supervisor_take_report(&self, "tunneld"));
    supervisor_session_closed(&self, "tunneld-9");
    EXPECT_EQ(supervisor_tick(&self), -1);
    supervisor_session_opened(&self, "tunneld-11");
    supervisor_session_closed(&self, "tunneld-11");
    now += TAKE_OVER_MS;
    (void)supervisor_tick(&self);
    EXPECT_EQ(told, strings{"tunneld" EVENT_PROCESS_CRASH});

    supervisor_session_opened(&self, "wccpd-8");
    supervisor_session_opened(&self, "wccpd-8");
    supervisor_session_closed(&self, "wccpd-8");
    EXPECT_EQ(told.size(), 1u) << "it has another session";
    supervisor_session_closed(&self, "wccpd-8");
    EXPECT_EQ(told.back(), "wccpd" EVENT_PROCESS_EXIT);
    self.children[0].command = {"tunneld"};
    EXPECT_FALSE(supervisor_take_report(&self, "tunneld")) << "the supervisor reports what it has started";
}
