// The loop: rounds that nest, events that go while they wait for their turn, the escape, signals, and work
// that other threads post.
#include "daemon/libevent_wrapper.h"

#include <csignal>
#include <ctime>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>
#include <pthread.h>
#include <unistd.h>

namespace {

double now_seconds() {
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

struct Loop : testing::Test {
    lew *wrapper = nullptr;
    loop_context *loop = nullptr;
    void SetUp() override {
        ASSERT_EQ(lew_init(&wrapper), LC_OK);
        ASSERT_EQ(lew_get_event_context(wrapper, &loop), LC_OK);
    }
    void TearDown() override {
        EXPECT_EQ(lew_deinit(&wrapper), LC_OK);
        EXPECT_EQ(wrapper, nullptr);
    }
};

// An event with a pipe that has a byte in it until the event has run.
struct readable {
    loop_event *event = nullptr;
    int ends[2] = {-1, -1};
    int runs = 0;
    std::function<void()> action;
    void start(loop_context *loop) {
        ASSERT_EQ(pipe(ends), 0);
        ASSERT_EQ(loop_event_new(loop, fired, this, &event), LC_OK);
        ASSERT_EQ(loop_event_set_fd(event, ends[0], LOOP_READ), LC_OK);
        fill();
    }
    void fill() const { ASSERT_EQ(write(ends[1], "x", 1), 1); }
    static void fired(int fd, short flags, void *data) {
        auto *self = static_cast<readable *>(data);
        EXPECT_EQ(fd, self->ends[0]);
        EXPECT_EQ(flags, LOOP_READ);
        char byte;
        EXPECT_EQ(read(fd, &byte, 1), 1);
        self->runs++;
        if (self->action)
            self->action();
    }
    ~readable() {
        loop_event_free(&event);
        close(ends[0]);
        close(ends[1]);
    }
};

struct timer {
    loop_event *event = nullptr;
    int runs = 0;
    std::function<void()> action;
    void start(loop_context *loop, int64_t delay) {
        ASSERT_EQ(loop_event_new(loop, fired, this, &event), LC_OK);
        ASSERT_EQ(loop_event_set_timer(event, delay), LC_OK);
    }
    static void fired(int, short flags, void *data) {
        auto *self = static_cast<timer *>(data);
        EXPECT_EQ(flags, LOOP_TIMEOUT);
        self->runs++;
        if (self->action)
            self->action();
    }
    ~timer() { loop_event_free(&event); }
};

TEST_F(Loop, NothingRegisteredEndsWithNoEvents) {
    int none = 5, escaped = 5;
    EXPECT_EQ(lew_dispatch(wrapper, &none, &escaped), LC_OK);
    EXPECT_EQ(none, 1);
    EXPECT_EQ(escaped, 0);
    none = 5;
    EXPECT_EQ(lew_dispatch_once(wrapper, &none, nullptr), LC_OK);
    EXPECT_EQ(none, 1);
    EXPECT_EQ(lew_dispatch(nullptr, &none, &escaped), LC_NULL);
    EXPECT_EQ(none, 0);
}

TEST_F(Loop, ATimerFiresOnceAndIsThenNoEventAnyMore) {
    timer only;
    only.start(loop, 30);
    const double start = now_seconds();
    int none = 0;
    EXPECT_EQ(lew_dispatch(wrapper, &none, nullptr), LC_OK);
    EXPECT_EQ(none, 1);
    EXPECT_EQ(only.runs, 1);
    EXPECT_GE(now_seconds() - start, 0.025);
}

TEST_F(Loop, EscapeIsStickyAndWaitsForNothing) {
    readable idle;
    idle.start(loop);
    EXPECT_EQ(lew_escape_from_dispatch(wrapper), LC_OK);
    for (int i = 0; i < 2; i++) {
        int none = 1, escaped = 0;
        EXPECT_EQ(i ? lew_dispatch_once(wrapper, &none, &escaped) : lew_dispatch(wrapper, &none, &escaped),
                  LC_OK);
        EXPECT_EQ(none, 0);
        EXPECT_EQ(escaped, 1);
    }
    EXPECT_EQ(idle.runs, 0);
}

TEST_F(Loop, EscapeInACallbackEndsTheRoundBeforeTheNextCallback) {
    readable first, second;
    first.start(loop);
    second.start(loop);
    const auto leave = [&] { EXPECT_EQ(lew_escape_from_dispatch(wrapper), LC_OK); };
    first.action = second.action = leave;
    int escaped = 0;
    EXPECT_EQ(lew_dispatch(wrapper, nullptr, &escaped), LC_OK);
    EXPECT_EQ(escaped, 1);
    EXPECT_EQ(first.runs + second.runs, 1);
}

// The outer callback waits by running the loop; what its own round had found beside it runs in there.
TEST_F(Loop, WaitsNestToAnyDepth) {
    constexpr int depth = 50;
    std::vector<readable> events(depth);
    int inside = 0, deepest = 0;
    for (readable &each : events) {
        each.action = [&] {
            inside++;
            deepest = std::max(deepest, inside);
            if (deepest < depth) {
                int none = 1, escaped = 1;
                EXPECT_EQ(lew_dispatch_once(wrapper, &none, &escaped), LC_OK);
                EXPECT_EQ(none, 0);
                EXPECT_EQ(escaped, 0);
            }
            inside--;
        };
        each.start(loop);
    }
    EXPECT_EQ(lew_dispatch_once(wrapper, nullptr, nullptr), LC_OK);
    EXPECT_EQ(deepest, depth);
    for (readable &each : events)
        EXPECT_EQ(each.runs, 1);
}

TEST_F(Loop, ANestedWaitFindsWhatBecomesReadyMeanwhile) {
    readable outer, later;
    timer due;
    later.start(loop);
    EXPECT_EQ(lew_dispatch_once(wrapper, nullptr, nullptr), LC_OK);
    outer.action = [&] {
        due.start(loop, 20);
        due.action = [&] { later.fill(); };
        while (later.runs < 2)
            ASSERT_EQ(lew_dispatch_once(wrapper, nullptr, nullptr), LC_OK);
    };
    outer.start(loop);
    EXPECT_EQ(lew_dispatch_once(wrapper, nullptr, nullptr), LC_OK);
    EXPECT_EQ(outer.runs, 1);
    EXPECT_EQ(later.runs, 2);
}

TEST_F(Loop, AnEscapeInsideEndsEachDepthAtOnce) {
    readable outer;
    timer inner;
    int inner_escaped = 0, again = 0;
    outer.action = [&] {
        inner.start(loop, 1);
        EXPECT_EQ(lew_dispatch_once(wrapper, nullptr, &inner_escaped), LC_OK);
        EXPECT_EQ(lew_dispatch_once(wrapper, nullptr, &again), LC_OK);
    };
    inner.action = [&] { EXPECT_EQ(lew_escape_from_dispatch(wrapper), LC_OK); };
    outer.start(loop);
    int escaped = 0;
    EXPECT_EQ(lew_dispatch(wrapper, nullptr, &escaped), LC_OK);
    EXPECT_EQ(inner_escaped, 1);
    EXPECT_EQ(again, 1);
    EXPECT_EQ(escaped, 1);
}

// Two events ready in one round; whichever comes first takes the other away, by each way of doing so.
TEST_F(Loop, AnEventTakenAwayByAnEarlierCallbackNeverRuns) {
    for (int way = 0; way < 3; way++) {
        readable pair[2];
        const auto take_away = [&, way](int other) {
            if (way == 0)
                loop_event_remove(pair[other].event);
            else if (way == 1)
                loop_event_free(&pair[other].event);
            else { // taken away by a callback of a nested round
                timer nested;
                nested.start(loop, 0);
                nested.action = [&, other] { loop_event_free(&pair[other].event); };
                loop_event_remove(pair[other].event);
                EXPECT_EQ(lew_dispatch_once(wrapper, nullptr, nullptr), LC_OK);
            }
        };
        pair[0].action = [&] { take_away(1); };
        pair[1].action = [&] { take_away(0); };
        pair[0].start(loop);
        pair[1].start(loop);
        EXPECT_EQ(lew_dispatch_once(wrapper, nullptr, nullptr), LC_OK);
        EXPECT_EQ(pair[0].runs + pair[1].runs, 1) << way;
    }
}

TEST_F(Loop, AnEventMayFreeItself) {
    readable self;
    self.action = [&] { loop_event_free(&self.event); };
    self.start(loop);
    int none = 0;
    EXPECT_EQ(lew_dispatch(wrapper, &none, nullptr), LC_OK);
    EXPECT_EQ(none, 1);
    EXPECT_EQ(self.runs, 1);
}

TEST_F(Loop, AClosedPipeIsReadable) {
    int ends[2];
    ASSERT_EQ(pipe(ends), 0);
    struct seen {
        int runs = 0;
        loop_event *event = nullptr;
    } watch;
    const auto fired = [](int, short, void *data) {
        auto *self = static_cast<seen *>(data);
        self->runs++;
        loop_event_free(&self->event);
    };
    ASSERT_EQ(loop_event_new(loop, fired, &watch, &watch.event), LC_OK);
    ASSERT_EQ(loop_event_set_fd(watch.event, ends[0], LOOP_READ), LC_OK);
    close(ends[0]); // not even open any more
    EXPECT_EQ(lew_dispatch(wrapper, nullptr, nullptr), LC_OK);
    EXPECT_EQ(watch.runs, 1);
    close(ends[1]);
}

TEST_F(Loop, OnlyTheOwnerDispatches) {
    lc_status status = LC_OK, once = LC_OK;
    std::thread([&] {
        status = lew_dispatch(wrapper, nullptr, nullptr);
        once = lew_dispatch_once(wrapper, nullptr, nullptr);
    }).join();
    EXPECT_EQ(status, LC_ASSERTION);
    EXPECT_EQ(once, LC_ASSERTION);
}

// ---- Signals

struct signal_log {
    std::vector<int> numbers;
    std::function<void()> action;
    lc_status result = LC_OK;
    static lc_status take(int number, short flags, void *data, lew *) {
        auto *self = static_cast<signal_log *>(data);
        EXPECT_EQ(flags, LOOP_SIGNAL);
        self->numbers.push_back(number);
        if (self->action)
            self->action();
        return self->result;
    }
};

TEST_F(Loop, SignalsAreCallbacksInTheLoop) {
    signal_log log;
    log.result = LC_GENERIC; // logged, and the loop goes on
    lew_event *slots[2] = {};
    ASSERT_EQ(lew_event_reg_signal(wrapper, &slots[0], SIGUSR1, signal_log::take, &log), LC_OK);
    ASSERT_EQ(lew_event_reg_signal(wrapper, &slots[1], SIGUSR2, signal_log::take, &log), LC_OK);
    raise(SIGUSR1);
    EXPECT_TRUE(log.numbers.empty()); // blocked outside the wait
    EXPECT_EQ(lew_dispatch_once(wrapper, nullptr, nullptr), LC_OK);
    raise(SIGUSR2);
    raise(SIGUSR1);
    while (log.numbers.size() < 3)
        ASSERT_EQ(lew_dispatch_once(wrapper, nullptr, nullptr), LC_OK);
    EXPECT_EQ(log.numbers[0], SIGUSR1);
    EXPECT_EQ(log.numbers[1] + log.numbers[2], SIGUSR1 + SIGUSR2);
    EXPECT_EQ(lew_event_delete(wrapper, &slots[0]), LC_OK);
    EXPECT_EQ(slots[0], nullptr);
    EXPECT_EQ(lew_event_delete(wrapper, &slots[0]), LC_OK);
    EXPECT_EQ(le_signal_context(SIGUSR1), nullptr);
    EXPECT_EQ(le_signal_context(SIGUSR2), loop);
    EXPECT_EQ(lew_delete_all_events(wrapper), LC_OK);
    EXPECT_EQ(slots[1], nullptr);
    int none = 0;
    EXPECT_EQ(lew_dispatch(wrapper, &none, nullptr), LC_OK);
    EXPECT_EQ(none, 1);
}

// The exit deletes the registrations from inside one of them; a second SIGTERM then does not kill the
// process.
TEST_F(Loop, AllSignalsMayGoInsideTheCallbackOfOne) {
    signal_log log;
    lew_event *slots[2] = {};
    ASSERT_EQ(lew_event_reg_signal(wrapper, &slots[0], SIGTERM, signal_log::take, &log), LC_OK);
    ASSERT_EQ(lew_event_reg_signal(wrapper, &slots[1], SIGINT, signal_log::take, &log), LC_OK);
    raise(SIGTERM);
    raise(SIGINT);
    log.action = [&] {
        EXPECT_EQ(lew_event_delete(wrapper, &slots[0]), LC_OK);
        EXPECT_EQ(lew_event_delete(wrapper, &slots[1]), LC_OK);
        raise(SIGTERM);
    };
    int none = 0;
    EXPECT_EQ(lew_dispatch(wrapper, &none, nullptr), LC_OK);
    EXPECT_EQ(none, 1);
    EXPECT_EQ(log.numbers.size(), 1u);
}

TEST_F(Loop, ASignalIsOneContextsAndItsNumberIsChecked) {
    signal_log log;
    lew_event *slot = nullptr, *foreign = nullptr, *bad = nullptr;
    ASSERT_EQ(lew_event_reg_signal(wrapper, &slot, SIGUSR1, signal_log::take, &log), LC_OK);
    lew *other = nullptr;
    ASSERT_EQ(lew_init(&other), LC_OK);
    EXPECT_EQ(lew_event_reg_signal(other, &foreign, SIGUSR1, signal_log::take, &log), LC_ASSERTION);
    EXPECT_EQ(foreign, nullptr);
    for (int number : {0, -1, 66})
        EXPECT_EQ(lew_event_reg_signal(wrapper, &bad, number, signal_log::take, &log), LC_ASSERTION);
    EXPECT_EQ(lew_event_reg_signal(nullptr, &bad, SIGUSR2, signal_log::take, &log), LC_NULL);
    EXPECT_EQ(lew_event_reg_signal(wrapper, &bad, SIGUSR2, nullptr, &log), LC_NULL);
    EXPECT_EQ(bad, nullptr);
    // A filled slot is registered anew, but only where it is known.
    EXPECT_EQ(lew_event_reg_signal(other, &slot, SIGUSR2, signal_log::take, &log), LC_NOT_FOUND);
    EXPECT_EQ(lew_event_delete(other, &slot), LC_NOT_FOUND);
    EXPECT_EQ(lew_event_reg_signal(wrapper, &slot, SIGUSR2, signal_log::take, &log), LC_OK);
    EXPECT_EQ(le_signal_context(SIGUSR1), nullptr);
    EXPECT_EQ(lew_event_reg_signal(other, &foreign, SIGUSR1, signal_log::take, &log), LC_OK);
    EXPECT_EQ(lew_event_cancel(other, &foreign), LC_OK);
    EXPECT_EQ(lew_event_cancel(other, &foreign), LC_OK);
    EXPECT_NE(foreign, nullptr);
    EXPECT_EQ(lew_deinit(&other), LC_OK);
    EXPECT_EQ(foreign, nullptr);
    EXPECT_EQ(lew_delete_all_events(wrapper), LC_OK);
}

TEST_F(Loop, ASignalEndsAWait) {
    signal_log log;
    lew_event *slot = nullptr;
    ASSERT_EQ(lew_event_reg_signal(wrapper, &slot, SIGUSR1, signal_log::take, &log), LC_OK);
    const pthread_t self = pthread_self();
    std::thread sender([&] {
        usleep(50000);
        pthread_kill(self, SIGUSR1);
    });
    const double start = now_seconds();
    EXPECT_EQ(lew_dispatch_once(wrapper, nullptr, nullptr), LC_OK);
    EXPECT_LT(now_seconds() - start, 2);
    EXPECT_EQ(log.numbers.size(), 1u);
    sender.join();
    EXPECT_EQ(lew_delete_all_events(wrapper), LC_OK);
}

} // namespace
