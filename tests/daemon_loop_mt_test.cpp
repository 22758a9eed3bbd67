// The event loop and other threads: escapes and posted work end a wait, nested or not.
#include <thread>

#include <gtest/gtest.h>

#include "daemon/libevent_wrapper.h"
#include "runtime/ttime.h"

namespace {

std::atomic<int> carried, withdrawn; // posted work of this loop_thread

struct loop_thread {
    lew *wrapper = nullptr;
    loop_context *loop = nullptr;
    loop_event *starter = nullptr;
    std::function<void()> first;
    int escaped = 0;
    std::atomic<int> ready{0};
    std::thread thread;

    static void run_first(int, short, void *data) {
        auto *self = static_cast<loop_thread *>(data);
        // So that the loop has something to wait for.
        EXPECT_EQ(loop_event_set_timer(self->starter, 60000), LC_OK);
        if (self->first)
            self->first();
    }
    void start() {
        carried = withdrawn = 0;
        thread = std::thread([this] {
            ASSERT_TRUE(lew_init(&wrapper) == LC_OK && lew_get_event_context(wrapper, &loop) == LC_OK);
            ASSERT_EQ(loop_event_new(loop, run_first, this, &starter), LC_OK);
            ASSERT_EQ(loop_event_set_timer(starter, 0), LC_OK);
            ready = 1;
            EXPECT_EQ(lew_dispatch(wrapper, nullptr, &escaped), LC_OK);
        });
        while (!ready)
            usleep(1000);
    }
    void finish() {
        thread.join();
        loop_event_free(&starter);
        EXPECT_EQ(lew_deinit(&wrapper), LC_OK); // its owner thread has ended
    }
};

struct counted_post {
    loop_post post{};
    loop_context *loop;
    int number;
    int *expected;
    static void function(loop_post *post, int carry_out) {
        auto *self = reinterpret_cast<counted_post *>(post);
        if (carry_out) {
            EXPECT_TRUE(loop_is_own_thread(self->loop) && self->number == (*self->expected)++);
        }
        (carry_out ? carried : withdrawn)++;
        delete self;
    }
    static void send(loop_context *loop, int number, int *expected) {
        auto *record = new counted_post{{nullptr, expected, function}, loop, number, expected};
        loop_post_work(loop, &record->post);
    }
};

TEST(LoopThreads, PostedWorkIsCarriedOutInOrderOnTheOwnersThread) {
    constexpr int posters = 3, each = 2000;
    int expected[posters] = {}, unused[2] = {};
    loop_thread it;
    it.start();
    std::thread threads[posters];
    for (int poster = 0; poster < posters; poster++)
        threads[poster] = std::thread([&, poster] {
            for (int i = 0; i < each; i++)
                counted_post::send(it.loop, i, &expected[poster]);
        });
    for (std::thread &thread : threads)
        thread.join();
    for (int i = 0; carried < posters * each && i < 4000; i++)
        usleep(1000);
    EXPECT_TRUE(carried == posters * each && lew_escape_from_dispatch(it.wrapper) == LC_OK);
    it.thread.join();
    // Later posts are handed back when they are withdrawn or the loop is freed.
    for (int &poster : unused)
        counted_post::send(it.loop, 0, &poster);
    loop_withdraw_posted(it.loop, &unused[0]);
    EXPECT_EQ(withdrawn, 1);
    it.thread = std::thread([] {});
    it.finish();
    EXPECT_EQ(withdrawn, 2);
}

// Posted work ends a wait for one round, because it may have changed what is waited for.
TEST(LoopThreads, PostedWorkAndEscapesEndTheWaitAtEachDepth) {
    for (const bool nested : {false, true}) {
        std::atomic<int> ended{0}; // waits of the callback
        int expected = 0;
        loop_thread it;
        if (nested)
            it.first = [&] {
                int escaped = 0;
                for (; !carried || !escaped; ended = escaped + 1)
                    ASSERT_EQ(lew_dispatch_once(it.wrapper, nullptr, &escaped), LC_OK);
            };
        it.start();
        usleep(50000);
        const int64_t start = lt_monotonic_ms();
        counted_post::send(it.loop, 0, &expected);
        for (int i = 0; ended < (nested ? 1 : 0) && i < 3000; i++)
            usleep(1000);
        usleep(20000);
        EXPECT_EQ(lew_escape_from_dispatch(it.wrapper), LC_OK);
        it.finish();
        EXPECT_LT(lt_monotonic_ms() - start, 2000);
        EXPECT_TRUE(carried == 1 && it.escaped == 1 && ended == (nested ? 2 : 0));
    }
}

} // namespace
