// The event loop: nested rounds, events that are removed while they are queued, the escape, and signals.
#include "daemon/libevent_wrapper.h"

#include <csignal>
#include <thread>

#include <gtest/gtest.h>

#include "runtime/ttime.h"

namespace {

struct Loop : testing::Test {
    lew *wrapper = nullptr;
    loop_context *loop = nullptr;
    void SetUp() override {
        ASSERT_TRUE(lew_init(&wrapper) == LC_OK && lew_get_event_context(wrapper, &loop) == LC_OK);
    }
    void TearDown() override { EXPECT_TRUE(lew_deinit(&wrapper) == LC_OK && !wrapper); }
    // The result: "no events", "escaped", "ran" or a status.
    std::string dispatched(lc_status (*dispatch)(lew *, int *, int *)) const {
        int none = 5, escaped = 5;
        const lc_status status = dispatch(wrapper, &none, &escaped);
        return status != LC_OK ? std::to_string(status) : none ? "no events" : escaped ? "escaped" : "ran";
    }
    std::string once() const { return dispatched(lew_dispatch_once); }
    std::string whole() const { return dispatched(lew_dispatch); }
    void escape() const { EXPECT_EQ(lew_escape_from_dispatch(wrapper), LC_OK); }
};

// An event that counts its runs and performs an action of the test.
struct watched {
    loop_event *event = nullptr;
    int runs = 0, ends[2] = {-1, -1};
    std::function<void()> action;
    void make(loop_context *loop, std::function<void()> then) {
        action = std::move(then);
        ASSERT_EQ(loop_event_new(loop, fired, this, &event), LC_OK);
    }
    // On a pipe that holds a byte until the event has run.
    void start(loop_context *loop, std::function<void()> then = nullptr) {
        make(loop, std::move(then));
        ASSERT_TRUE(pipe(ends) == 0 && loop_event_set_fd(event, ends[0], LOOP_READ) == LC_OK);
        fill();
    }
    void fill() const { ASSERT_EQ(write(ends[1], "x", 1), 1); }
    void start_timer(loop_context *loop, int64_t delay, std::function<void()> then = nullptr) {
        make(loop, std::move(then));
        ASSERT_EQ(loop_event_set_timer(event, delay), LC_OK);
    }
    static void fired(int fd, short flags, void *data) {
        auto *self = static_cast<watched *>(data);
        char byte;
        EXPECT_TRUE(flags == LOOP_TIMEOUT || (flags == LOOP_READ && fd == self->ends[0]));
        if (flags == LOOP_READ)
            (void)!read(fd, &byte, 1);
        self->runs++;
        if (self->action)
            self->action();
    }
    ~watched() {
        loop_event_free(&event);
        close(ends[0]);
        close(ends[1]);
    }
};

TEST_F(Loop, EndsWhenNothingIsRegistered) {
    EXPECT_TRUE(whole() == "no events" && once() == "no events");
    watched only; // after it has fired, no event is left
    only.start_timer(loop, 30);
    const int64_t start = lt_monotonic_ms();
    EXPECT_TRUE(whole() == "no events" && only.runs == 1 && lt_monotonic_ms() - start >= 25);
    watched gone; // closed: reported as ready, and removes itself
    gone.start(loop, [&] { loop_event_free(&gone.event); });
    close(gone.ends[0]);
    EXPECT_TRUE(whole() == "no events" && gone.runs == 1);
    int none = 5;
    EXPECT_TRUE(lew_dispatch(nullptr, &none, nullptr) == LC_NULL && none == 0);
    std::thread([&] { EXPECT_EQ(whole() + once(), "1400214002"); }).join(); // only the owner may dispatch
}

// It ends the round as well: of two callbacks that are due, only one runs.
TEST_F(Loop, AnEscapeIsStickyAndEndsEachDepthAtOnce) {
    watched first, second, inner[2];
    first.start(loop, [&] {
        second.start(loop, [&] {
            for (watched &each : inner)
                each.start(loop, [&] { escape(); });
            EXPECT_EQ(once() + once(), "escapedescaped");
        });
        EXPECT_EQ(once(), "escaped"); // when the inner wait has ended
    });
    EXPECT_EQ(whole(), "escaped");
    first.fill();
    EXPECT_EQ(whole() + once(), "escapedescaped");
    EXPECT_TRUE(first.runs == 1 && second.runs == 1 && inner[0].runs + inner[1].runs == 1);
}

// A callback waits by running the loop, which then runs the other events of the same round, and those that
// become ready during the wait.
TEST_F(Loop, WaitsNestToAnyDepth) {
    constexpr int depth = 50;
    std::vector<watched> events(depth);
    watched twice, later, due;
    int inside = 0, deepest = 0;
    later.start_timer(loop, 5000); // not waited for
    twice.start(loop);
    EXPECT_EQ(once(), "ran");
    for (watched &each : events)
        each.start(loop, [&] {
            deepest = std::max(deepest, ++inside);
            if (deepest == depth && !due.event)
                due.start_timer(loop, 20, [&] { twice.fill(); });
            while (deepest < depth || twice.runs < 2)
                ASSERT_EQ(once(), "ran");
            inside--;
        });
    EXPECT_TRUE(once() == "ran" && deepest == depth && later.runs == 0);
    for (watched &each : events)
        EXPECT_EQ(each.runs, 1);
}

// Two events are ready in one round. The one that runs first removes the other, in each possible way.
TEST_F(Loop, AnEventRemovedByAnEarlierCallbackNeverRuns) {
    for (int way = 0; way < 3; way++) {
        watched pair[2];
        const auto remove_other = [&, way](int other) {
            if (way == 1)
                return loop_event_free(&pair[other].event);
            loop_event_remove(pair[other].event);
            if (way == 0)
                return;
            watched nested; // freed by a callback of a nested round
            nested.start_timer(loop, 0, [&, other] { loop_event_free(&pair[other].event); });
            EXPECT_EQ(once(), "ran");
        };
        pair[0].start(loop, [&] { remove_other(1); });
        pair[1].start(loop, [&] { remove_other(0); });
        EXPECT_EQ(once(), "ran");
        EXPECT_EQ(pair[0].runs + pair[1].runs, 1) << way;
    }
}

TEST_F(Loop, PostedWorkComesBeforeTheNextCallback) {
    static int carried;
    carried = 0;
    loop_post work = {};
    work.function = [](loop_post *, int carry_out) { carried += carry_out; };
    watched pair[2];
    for (watched &each : pair)
        each.start(loop, [&] {
            if (pair[0].runs + pair[1].runs == 1)
                std::thread([&] { loop_post_work(loop, &work); }).join();
            else
                EXPECT_EQ(carried, 1);
        });
    while (pair[0].runs + pair[1].runs < 2)
        ASSERT_EQ(once(), "ran");
}

// --- Signals

struct Signals : Loop {
    std::vector<int> numbers;
    std::function<void()> action;
    lc_status result = LC_OK;
    lew_event *slots[2] = {};
    static lc_status take(int number, short flags, void *data, lew *) {
        auto *self = static_cast<Signals *>(data);
        EXPECT_EQ(flags, LOOP_SIGNAL);
        self->numbers.push_back(number);
        if (self->action)
            self->action();
        return self->result;
    }
    lc_status reg(lew *context, lew_event **slot, int number) {
        return lew_event_reg_signal(context, slot, number, take, this);
    }
};

TEST_F(Signals, AreCallbacksInTheLoop) {
    result = LC_GENERIC; // logged, and the loop goes on
    ASSERT_TRUE(reg(wrapper, &slots[0], SIGUSR1) == LC_OK && reg(wrapper, &slots[1], SIGUSR2) == LC_OK);
    raise(SIGUSR1);
    EXPECT_TRUE(numbers.empty() && once() == "ran"); // blocked outside the wait
    raise(SIGUSR2);
    raise(SIGUSR1);
    while (numbers.size() < 3)
        ASSERT_EQ(once(), "ran");
    EXPECT_TRUE(numbers[0] == SIGUSR1 && numbers[1] + numbers[2] == SIGUSR1 + SIGUSR2);
    for (int i = 0; i < 2; i++)
        EXPECT_TRUE(lew_event_delete(wrapper, &slots[0]) == LC_OK && !slots[0]);
    EXPECT_TRUE(!le_signal_contexts[SIGUSR1] && le_signal_contexts[SIGUSR2] == loop);
    raise(SIGUSR2);
    EXPECT_TRUE(once() == "ran" && lew_delete_all_events(wrapper) == LC_OK && !slots[1]);
    EXPECT_EQ(whole(), "no events");
}

// The exit deletes all registrations in the callback of one of them. A second SIGTERM must stay blocked,
// since it would end the process.
TEST_F(Signals, AllCanBeDeletedInTheCallbackOfOne) {
    ASSERT_TRUE(reg(wrapper, &slots[0], SIGTERM) == LC_OK && reg(wrapper, &slots[1], SIGINT) == LC_OK);
    raise(SIGTERM);
    raise(SIGINT);
    action = [&] {
        for (lew_event *&slot : slots)
            EXPECT_EQ(lew_event_delete(wrapper, &slot), LC_OK);
        raise(SIGTERM);
    };
    EXPECT_TRUE(whole() == "no events" && numbers.size() == 1);
    sigset_t pending;
    int taken = 0;
    sigpending(&pending);
    EXPECT_EQ(sigismember(&pending, SIGTERM), 1);
    sigwait(&pending, &taken);
}

TEST_F(Signals, BelongToOneContextAndTheirNumberIsChecked) {
    lew *other = nullptr;
    lew_event *slot = nullptr, *foreign = nullptr;
    ASSERT_TRUE(lew_init(&other) == LC_OK && reg(wrapper, &slot, SIGUSR1) == LC_OK);
    for (const int number : {SIGUSR1, 0, -1, 66})
        EXPECT_EQ(reg(other, &foreign, number), LC_ASSERTION);
    EXPECT_TRUE(reg(nullptr, &foreign, SIGUSR2) == LC_NULL && !foreign);
    // A filled slot is registered again, but only in its own context.
    EXPECT_EQ(reg(other, &slot, SIGUSR2), LC_NOT_FOUND);
    EXPECT_TRUE(lew_event_delete(other, &slot) == LC_NOT_FOUND && reg(wrapper, &slot, SIGUSR2) == LC_OK);
    EXPECT_TRUE(!le_signal_contexts[SIGUSR1] && reg(other, &foreign, SIGUSR1) == LC_OK);
    EXPECT_TRUE(lew_event_cancel(other, &foreign) == LC_OK && foreign);
    EXPECT_TRUE(lew_deinit(&other) == LC_OK && !foreign && lew_delete_all_events(wrapper) == LC_OK);
}

} // namespace
