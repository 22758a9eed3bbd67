// Interest lists and the bridge that carries their changes into the loop.
#include <gtest/gtest.h>

#include "runtime/event_fdintrcb.h"
#include "tests/support/gcl_log.h"

namespace {

void *as_pointer(uintptr_t value) {
    return reinterpret_cast<void *>(value);
}

// --- The list alone

struct FdicList : testing::Test {
    fdic *list = nullptr;
    std::string reported; // "3+ " for an interest that is active, "3- " for one that was removed
    static lc_status take(const fdic_event_array *changes, void *data) {
        for (uint32_t i = 0; i < fdic_event_array_length_quick(changes); i++) {
            const fdic_event *event = fdic_event_array_get_quick(changes, i);
            static_cast<FdicList *>(data)->reported +=
                std::to_string(event->id) + (event->active ? "+ " : "- ");
        }
        return LC_OK;
    }
    FdicList() { EXPECT_EQ(fdic_init(&list, take, this), LC_OK); }
    ~FdicList() override { EXPECT_EQ(fdic_deinit(&list), LC_OK); }
    int32_t id = -5; // of the interest that was added last
    lc_status add_fd(int fd, int want_read, int want_write) {
        return fdic_event_add_fd(list, fd, want_read, want_write, nullptr, nullptr, nullptr, nullptr, nullptr,
                                 &id);
    }
    lc_status add_timer(int64_t delay) {
        return fdic_event_add_timer(list, delay, as_pointer(0x10), nullptr, nullptr, &id);
    }
    void expect(const char *changes, lc_status got, lc_status status = LC_OK) {
        EXPECT_EQ(got, status) << changes;
        EXPECT_EQ(reported, changes);
        reported.clear();
    }
};

TEST_F(FdicList, EachChangeIsReportedOnce) {
    gcl_log log;
    expect("1+ ", add_fd(10, 1, 0));
    fdic_event_array *copy = nullptr;
    ASSERT_EQ(fdic_events_query(list, &copy), LC_OK);
    fdic_event *event = fdic_event_array_get_quick(copy, 0);
    EXPECT_TRUE(fdic_event_array_length_quick(copy) == 1 && event->id == 1 && event->fd == 10);
    event->want_read = 0;
    EXPECT_EQ(fdic_event_array_free(&copy), LC_OK);
    expect("", fdic_event_update_fd(list, 1, 1, 0)); // no change
    expect("1+ ", fdic_event_update_fd(list, 1, 1, 1));
    expect("", add_fd(-1, 1, 1));
    expect("3+ ", add_fd(11, 0, 0)); // neither reading nor writing, but a descriptor
    expect("1- ", fdic_event_delete_fd(list, 1));
    expect("", fdic_event_delete_fd(list, 1), LC_NOT_FOUND);
    expect("", fdic_event_update_fd(list, 2, 1, 1), LC_NOT_FOUND);
    expect("", fdic_event_delete_fd(list, -1), LC_NOT_FOUND);
    expect("3- ", fdic_event_delete_fd(list, 3));

    expect("", add_timer(-7)); // not watched
    expect("5+ ", add_timer(50));
    expect("", fdic_event_update_timer(list, 5, 50));
    expect("5+ ", fdic_event_update_timer(list, 5, 60));
    expect("5- ", fdic_event_delete_timer(list, 5));
    expect("", fdic_event_delete_timer(list, 5), LC_NOT_FOUND);
    for (const char *line : {"update event fd with bad id 1", "delete event timer with bad id 5",
                             "EVENT: adding for 0x10: -1 ms", "EVENT: deleting for 0x10: 60 ms"})
        EXPECT_EQ(log.count(line), 1) << line;
}

// --- With the bridge

struct FdicBridge : testing::Test {
    lew *wrapper = nullptr;
    fdic_libevent *bridge = nullptr;
    fdic *list = nullptr;
    int ends[2] = {-1, -1};
    std::string calls; // "1:2 ": of this kind, with this argument
    std::function<lc_status(uint32_t)> on_call;

    static lc_status called(int fd, uint32_t kind, void *user_data, void *argument) {
        auto *self = static_cast<FdicBridge *>(user_data);
        EXPECT_TRUE(kind == FDIC_TIMER_EXPIRED ? fd == -1 : fd == self->ends[0]);
        self->calls +=
            std::to_string(kind) + ":" + std::to_string(reinterpret_cast<uintptr_t>(argument)) + " ";
        return self->on_call ? self->on_call(kind) : LC_OK;
    }
    void SetUp() override {
        loop_context *loop = nullptr;
        ASSERT_TRUE(lew_init(&wrapper) == LC_OK && lew_get_event_context(wrapper, &loop) == LC_OK);
        ASSERT_EQ(fdic_libevent_init(loop, &bridge), LC_OK);
        ASSERT_EQ(fdic_init(&list, fdic_libevent_callback, bridge), LC_OK);
        ASSERT_EQ(fdic_libevent_set_fd_close_handler(bridge, called, as_pointer(55)), LC_OK);
        ASSERT_EQ(fdic_libevent_set_fd_open_handler(bridge, called, as_pointer(44)), LC_OK);
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, ends), 0);
    }
    void TearDown() override {
        EXPECT_TRUE(fdic_libevent_deinit(&bridge) == LC_OK && fdic_deinit(&list) == LC_OK);
        EXPECT_EQ(lew_deinit(&wrapper), LC_OK);
        close(ends[0]);
        close(ends[1]);
    }
    int32_t add(int want_read, int want_write) {
        int32_t id = 0;
        EXPECT_EQ(fdic_event_add_fd(list, ends[0], want_read, want_write, this, called, as_pointer(1), called,
                                    as_pointer(2), &id),
                  LC_OK);
        return id;
    }
    void expect_round(const char *expected) {
        calls.clear();
        EXPECT_EQ(lew_dispatch_once(wrapper, nullptr, nullptr), LC_OK);
        EXPECT_EQ(calls, expected);
    }
};

TEST_F(FdicBridge, WhatAHandlerDoesToItsOwnInterest) {
    gcl_log log;
    const int32_t id = add(1, 1);
    EXPECT_EQ(calls, "4:44 ");
    ASSERT_EQ(write(ends[1], "x", 1), 1);
    for (const lc_status status : {LC_BAD_TYPE, LC_CANCELLED}) { // a failure ends this round of calls
        on_call = [status](uint32_t) { return status; };
        expect_round("1:1 ");
        EXPECT_EQ(log.count("Error code"), 1);
    }
    on_call = [&](uint32_t kind) { // the write function is still called after the interest is deleted
        return kind == FDIC_READABLE ? fdic_event_delete_fd(list, id) : LC_OK;
    };
    expect_round("1:1 5:55 2:2 ");
    int none = 0;
    EXPECT_TRUE(lew_dispatch(wrapper, &none, nullptr) == LC_OK && none == 1);
}

TEST_F(FdicBridge, TimersFireOnce) {
    int32_t id = 0, soon = 0, none = 0;
    ASSERT_EQ(fdic_event_add_timer(list, 5, this, called, as_pointer(3), &id), LC_OK);
    expect_round("3:3 ");
    EXPECT_EQ(fdic_event_update_timer(list, id, 5), LC_OK); // the same delay does not start it again
    EXPECT_TRUE(lew_dispatch_once(wrapper, &none, nullptr) == LC_OK && none == 1);
    // The largest delay does not overflow.
    EXPECT_EQ(fdic_event_update_timer(list, id, INT64_MAX), LC_OK);
    ASSERT_EQ(fdic_event_add_timer(list, 1, this, called, as_pointer(9), &soon), LC_OK);
    expect_round("3:9 ");
    EXPECT_EQ(fdic_event_delete_timer(list, id), LC_OK);
}

// A change that another thread makes is applied by the loop. Until then, or for ever if the loop has ended,
// the bridge does not change and no handler is called.
TEST_F(FdicBridge, ChangesOfAnotherThreadAreAppliedByTheLoop) {
    const int32_t id = add(1, 0);
    calls.clear();
    ASSERT_EQ(write(ends[1], "x", 1), 1);
    std::thread([&] { EXPECT_EQ(fdic_event_delete_fd(list, id), LC_OK); }).join();
    EXPECT_TRUE(calls.empty());
    expect_round("5:55 "); // and not 1:1
    int32_t second = 0;
    std::thread([&] {
        second = add(1, 0);
        EXPECT_EQ(fdic_event_update_fd(list, second, 1, 1), LC_OK);
    }).join();
    expect_round("4:44 ");
    expect_round("1:1 2:2 ");
    std::thread([&] { EXPECT_EQ(fdic_event_update_fd(list, second, 0, 0), LC_OK); }).join();
    calls.clear();
    EXPECT_EQ(fdic_event_update_fd(list, second, 0, 1), LC_OK); // after the other's change
    expect_round("2:2 ");
    std::thread([&] { EXPECT_EQ(fdic_event_delete_fd(list, second), LC_OK); }).join();
    calls.clear(); // freed while the change is still posted
}

} // namespace
