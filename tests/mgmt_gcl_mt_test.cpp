// A session on which other threads send while its own thread runs its loop, as for alarms and state events.
// With WCCP_STRESS=1 it runs longer: a minute of sending, a thousand closings.
#include <atomic>
#include <random>
#include <thread>

#include <pthread.h>

#include "runtime/ttime.h"
#include "tests/support/gcl_client.h"

// The stack of a cancelled thread keeps its marks, and the sanitizer then reports its own last write there.
extern "C" const char *__asan_default_options();
extern "C" const char *__asan_default_options() {
    return "use_sigaltstack=0";
}

namespace {

bool is_stress_run() {
    const char *value = getenv("WCCP_STRESS");
    return value && *value && *value != '0';
}
// Like the alarm client: a thread that makes the session, opens it and runs its loop.
struct session_thread {
    gcl_client client;
    std::atomic<uint32_t> ready{0}, ended{0}, acknowledged{0};
    std::thread thread;

    void run() {
        client.start();
        client.on_frame = [this](const wire &) {
            acknowledged++;
            return LC_OK;
        };
        client.on_close = [this, own = std::this_thread::get_id()] {
            EXPECT_EQ(std::this_thread::get_id(), own);
            EXPECT_EQ(lew_escape_from_dispatch(client.wrapper), LC_OK);
        };
        EXPECT_EQ(client.make(), LC_OK);
        EXPECT_EQ(gcl_session_client_connect_by_provider(client.session, "mgmtd", 1), LC_OK);
        EXPECT_EQ(client.open(-1), LC_OK);
        ready = 1;
        EXPECT_EQ(lew_dispatch(client.wrapper, nullptr, nullptr), LC_OK);
        ended = 1;
    }
    void start(gcl_provider *provider) {
        thread = std::thread([this] { run(); });
        EXPECT_TRUE(provider->open_session());
        while (!ready)
            usleep(500);
    }
};

// Like an engine thread: it holds a lock while it sends, and is cancelled at any moment and started again.
struct sender {
    session_thread *to;
    uint16_t number;
    std::thread thread;
    std::atomic<uint32_t> next{0};
    std::atomic<bool> stop{false};

    sender(session_thread *session, uint16_t own_number) : to(session), number(own_number) { start(); }
    void run() {
        static pthread_mutex_t engine = PTHREAD_MUTEX_INITIALIZER;
        std::minstd_rand random(number);
        while (!stop) {
            {
                const mutex_guard guard(&engine);
                const wire body = be(next, 4) + wire(random() % 4000, static_cast<char>('a' + number));
                if (to->client.send(number, body) == LC_OK)
                    next++;
            }
            if (random() % 16 == 0)
                usleep(50);
            pthread_testcancel();
        }
    }
    void start() {
        thread = std::thread([this] { run(); });
    }
    void cancel() {
        pthread_cancel(thread.native_handle());
        thread.join();
    }
    void join() {
        stop = true;
        thread.join();
    }
};

void wait_until(const std::function<bool()> &done) {
    for (const int64_t start = lt_monotonic_ms(); !done() && lt_monotonic_ms() - start < 10000;)
        usleep(500);
    ASSERT_TRUE(done());
}

// All frames of all senders arrive complete, once and in order, at whatever pace the provider reads.
TEST(GclThreads, ThreeSendersAndAProviderOfUnevenPace) {
    gcl_provider provider;
    ASSERT_TRUE(provider.listen_as("mgmtd"));
    session_thread session;
    session.start(&provider);
    sender senders[] = {{&session, 1}, {&session, 2}, {&session, 3}};
    std::atomic<bool> over{false};
    // Cancelled at random moments: the frame that it was sending is still sent completely and counted.
    std::thread canceller([&] {
        std::minstd_rand random(7);
        const int64_t end = lt_monotonic_ms() + (is_stress_run() ? 60000 : 3000);
        while (lt_monotonic_ms() < end) {
            usleep(2000 + static_cast<useconds_t>(random() % 10000));
            senders[2].cancel();
            senders[2].start();
        }
        for (sender &each : senders)
            each.join();
        over = true;
    });

    uint32_t expected[4] = {}, acknowledged = 0, sequence = 2000003;
    std::minstd_rand random(1);
    for (;;) {
        if (!over && random() % 300 == 0)
            usleep(static_cast<useconds_t>(random() % 60000)); // stops reading: the socket fills
        const wire frame = provider.take_frame(over ? 300 : 3000);
        if (frame.empty())
            break;
        const uint32_t who = number_at(frame, 26, 2);
        ASSERT_EQ(number_at(frame, 20), sequence++);
        ASSERT_TRUE(who >= 1 && who <= 3);
        ASSERT_EQ(number_at(frame, 32), expected[who]++) << who;
        ASSERT_EQ(frame.find_first_not_of(static_cast<char>('a' + who), 36), wire::npos);
        if (random() % 200 == 0) { // a burst of acknowledgements
            wire bytes;
            for (size_t i = random() % 100 + 1; i > 0; i--, acknowledged++)
                bytes += frame_bytes(3, 1, wire(i, 'k'));
            ASSERT_TRUE(provider.put(bytes));
        }
    }
    ASSERT_TRUE(over);
    canceller.join();
    for (uint16_t i = 1; i <= 3; i++)
        EXPECT_EQ(senders[i - 1].next, expected[i]);
    EXPECT_GT(sequence, 2000103u);
    wait_until([&] { return session.acknowledged == acknowledged; });
    EXPECT_FALSE(session.ended);
    EXPECT_EQ(lew_escape_from_dispatch(session.client.wrapper), LC_OK);
    session.thread.join();
    session.client.finish();
}

// The provider closes at random moments, while the loop's thread reads and others send. Whichever thread
// notices, the close handler is called once, on the session's own thread, and no thread hangs.
TEST(GclThreads, AProviderThatClosesWhileOthersSend) {
    gcl_provider provider;
    ASSERT_TRUE(provider.listen_as("mgmtd"));
    const int rounds = is_stress_run() ? 1000 : 60;
    std::minstd_rand random(3);
    for (int i = 0; i < rounds; i++) {
        session_thread session;
        session.start(&provider);
        sender senders[] = {{&session, 1}, {&session, 2}};
        if (i % 2)
            (void)provider.put(frame_bytes(3, 1, wire(static_cast<size_t>(random() % 3000), 'p')));
        if (i % 3)
            provider.take_frame();
        usleep(static_cast<useconds_t>(random() % 4000));
        provider.close_client();
        wait_until([&] { return session.ended == 1; });
        session.thread.join();
        for (sender &each : senders)
            each.join();
        EXPECT_EQ(session.client.closes, 1);
        session.client.finish();
        EXPECT_EQ(session.client.closes, 1);
    }
}

} // namespace
