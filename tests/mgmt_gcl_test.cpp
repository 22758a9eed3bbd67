// Sessions with a provider that is written as raw bytes: opening, the frame reader, the output queue.
#include <algorithm>
#include <csignal>

#include <gtest/gtest.h>
#include <malloc.h>
#include <netinet/in.h>

#include "mgmt/gcl_records.h"
#include "runtime/ttime.h"
#include "tests/support/gcl_client.h"
#include "tests/support/gcl_log.h"

namespace {

struct Gcl : testing::Test {
    gcl_provider provider;
    gcl_client client;
    void SetUp() override {
        ASSERT_TRUE(provider.listen_as("mgmtd"));
        client.start();
    }
    void TearDown() override {
        client.finish();
        EXPECT_NE(access(own_path().c_str(), F_OK), 0);
    }
    static wire own_name() { return "wccpd-" + std::to_string(getpid()); }
    static wire own_path() { return "/tmp/gcl-socks/uds-client-" + own_name(); }
    void connect() {
        ASSERT_EQ(client.make(), LC_OK);
        ASSERT_EQ(gcl_session_client_connect_by_provider(client.session, "mgmtd", 0), LC_OK);
    }
    void open() {
        connect();
        std::thread other([&] { EXPECT_TRUE(provider.open_session()); });
        EXPECT_EQ(client.open(), LC_OK);
        other.join();
    }
    // Ends a session that may be closed already, for the next case of a table.
    void drop() {
        EXPECT_EQ(gcl_session_close(client.session, 0), LC_OK);
        EXPECT_EQ(gcl_session_free(&client.session), LC_OK);
        provider.close_client();
        client.frames.clear();
        client.closes = 0;
        client.on_frame = nullptr;
    }
    void round() { ASSERT_EQ(lew_dispatch_once(client.wrapper, nullptr, nullptr), LC_OK); }
    // Receives what the session sends, in a thread, while the loop runs.
    std::vector<wire> taken(int count) {
        std::vector<wire> got;
        std::thread other([&] {
            for (int i = 0; i < count; i++)
                got.push_back(provider.take_frame());
            ASSERT_TRUE(provider.put(frame_bytes(3, 1, "done")));
        });
        client.frames.clear();
        until([&] { return !client.frames.empty(); });
        other.join();
        return got;
    }
    // The loop waits without waking up. It has ended afterwards.
    void expect_idle() {
        const clock_t used = clock();
        std::thread other([&] {
            usleep(200000);
            EXPECT_EQ(lew_escape_from_dispatch(client.wrapper), LC_OK);
        });
        EXPECT_EQ(lew_dispatch(client.wrapper, nullptr, nullptr), LC_OK);
        other.join();
        EXPECT_LT(static_cast<double>(clock() - used) / CLOCKS_PER_SEC, 0.1);
    }
    void until(const std::function<bool()> &done) {
        const int64_t start = lt_monotonic_ms();
        while (!done() && lt_monotonic_ms() - start < 5000)
            round();
        ASSERT_TRUE(done());
    }
    void expect_frames(const std::vector<wire> &expected) {
        until([&] { return client.frames.size() >= expected.size(); });
        EXPECT_TRUE(client.frames == expected);
        client.frames.clear();
    }
};

// ---- The opening

TEST_F(Gcl, TheOpeningByteByByte) {
    setenv("LOGIN_USER", "root", 1);
    connect();
    EXPECT_EQ(client.state(true), GCL_ADMIN_GREETING_AWAITED);
    wire answer;
    std::vector<wire> requests;
    std::thread other([&] {
        ASSERT_TRUE(provider.accept_client());
        for (const char byte : greeting_bytes(~0u, ~0u)) { // a read for each byte
            ASSERT_TRUE(provider.put(wire(1, byte)));
            usleep(200);
        }
        answer = provider.take_frame();
        const std::pair<uint32_t, wire> answers[] = {
            {1, "Bad service id in service open."}, {0, ""}, {1, ""}};
        for (const auto &[status, text] : answers) {
            requests.push_back(provider.take_frame());
            ASSERT_TRUE(provider.put(open_response_bytes(number_at(requests.back(), 32), status, text)));
        }
    });
    EXPECT_EQ(client.open(), LC_GENERIC);
    EXPECT_EQ(client.state(true), GCL_ADMIN_OPEN_ANSWERED);
    EXPECT_FALSE(gcl_session_service_is_open(client.session, 2));
    EXPECT_EQ(client.open(), LC_OK);
    EXPECT_TRUE(gcl_session_service_is_open(client.session, 2));
    EXPECT_EQ(gcl_session_get_current_service(client.session), 2);
    EXPECT_EQ(gcl_session_client_open_service_blocking(client.session, 2, 3, nullptr, 0, 3000), LC_GENERIC);
    EXPECT_EQ(client.state(true), GCL_ADMIN_GREETED);
    EXPECT_FALSE(gcl_session_service_is_open(client.session, 3));
    other.join();

    const wire ids = padded(own_name(), 32) + be(geteuid(), 4) + be(getegid(), 4) + padded("root", 32);
    EXPECT_EQ(answer, frame_bytes(1, 2, be(2, 2) + wire(12, '\0') + ids + be(0, 4), 2000001));
    EXPECT_EQ(requests[0], frame_bytes(1, 3, padded(be(1, 4) + be(1, 4) + be(2, 4) + be(2, 4), 48), 2000002));

    const char *own = nullptr, *peer = nullptr;
    EXPECT_EQ(gcl_session_get_session_names(client.session, &own, &peer), LC_OK);
    EXPECT_TRUE(own == own_name() && peer == wire("mgmtd-1"));
    EXPECT_EQ(access(own_path().c_str(), F_OK), 0);
}

TEST_F(Gcl, ThePeersIdsAreChecked) {
    gcl_log log;
    const auto check = [&](uint32_t uid, uint32_t gid, uint16_t version, bool accepted, const char *line) {
        connect();
        ASSERT_TRUE(provider.accept_client() && provider.put(greeting_bytes(uid, gid, version)));
        round();
        EXPECT_EQ(client.state(), accepted ? GCL_SESSION_CONNECTED : GCL_SESSION_CLOSED) << line;
        EXPECT_EQ(log.count(line), 1) << line;
        EXPECT_EQ(log.count("session terminated by client"), accepted ? 0 : 1) << line;
        log.clear();
        drop();
    };
    constexpr uint32_t none = ~0u;
    check(none, none, 2, true, "client open for peer mgmtd-1");
    check(geteuid(), getegid(), 2, true, "client open for peer mgmtd-1");
    check(none, getegid(), 2, false, "proto admin: bad uid / gid in greeting: -1/0\n");
    check(geteuid(), none, 2, false, "proto admin: bad uid / gid in greeting: 0/-1\n");
    check(geteuid() + 7, getegid(), 2, false, "proto admin: bad uid / gid in greeting: 7/0 not 0/0");
    check(none, none, 3, false, "proto admin: bad version in greeting: 3 not 2");
    if (geteuid() != 0 || seteuid(1) != 0)
        GTEST_SKIP() << "only one user is known here";
    const int listening = listen(provider.listener, 8); // as user 1 from now on
    ASSERT_EQ(seteuid(0) | listening, 0);
    check(none, none, 2, false, "the provider runs as user 1, not as root or our own user");
}

TEST_F(Gcl, APeerThatNeverAnswersOrCloses) {
    connect();
    std::vector<intptr_t> ran; // each timer once during the wait, when it is due
    const auto note = [](int, uint32_t, void *data, void *argument) -> lc_status {
        static_cast<std::vector<intptr_t> *>(data)->push_back(reinterpret_cast<intptr_t>(argument));
        return LC_OK;
    };
    int32_t id = 0;
    for (const intptr_t delay : {80, 30, 0}) {
        auto *argument = reinterpret_cast<void *>(delay);
        ASSERT_EQ(fdic_event_add_timer(client.interests, delay, &ran, note, argument, &id), LC_OK);
    }
    const int64_t start = lt_monotonic_ms();
    EXPECT_EQ(client.open(150), LC_IO_TIMED_OUT);
    EXPECT_EQ(ran, (std::vector<intptr_t>{0, 30, 80}));
    EXPECT_GE(lt_monotonic_ms() - start, 140);
    EXPECT_EQ(client.state(), GCL_SESSION_CONNECTED);
    ASSERT_TRUE(provider.accept_client() && provider.put(greeting_bytes(~0u, ~0u).substr(0, 60)));
    provider.close_client(); // in the middle of a frame
    EXPECT_EQ(client.open(), LC_IO_CLOSED);
    EXPECT_TRUE(client.state() == GCL_SESSION_CLOSED && client.closes == 1);
    EXPECT_EQ(client.open(), LC_IO_CLOSED);
    EXPECT_EQ(gcl_session_close(client.session, 1), LC_OK);
    EXPECT_EQ(client.closes, 1);
}

// The signals that end the process are blocked in the thread that connects; a pending one ends the attempts.
TEST_F(Gcl, ConnectingEndsWithTheProcess) {
    sigset_t end;
    sigemptyset(&end);
    sigaddset(&end, SIGTERM);
    ASSERT_EQ(pthread_sigmask(SIG_BLOCK, &end, nullptr), 0);
    ASSERT_EQ(kill(getpid(), SIGTERM), 0);
    const int64_t start = lt_monotonic_ms();
    ASSERT_EQ(client.make(), LC_OK);
    EXPECT_EQ(gcl_session_client_connect_by_provider(client.session, "nobody", 1), LC_CANCELLED);
    EXPECT_LT(lt_monotonic_ms() - start, 2500);
    int taken_signal = 0;
    EXPECT_EQ(sigwait(&end, &taken_signal), 0);
    ASSERT_EQ(pthread_sigmask(SIG_UNBLOCK, &end, nullptr), 0);
}

TEST_F(Gcl, NamesAndNumbersThatAreRefused) {
    gcl_log log;
    gcl_body_protocol again{};
    again.protocol = 1;
    EXPECT_EQ(gcl_register_body_protocol(client.instance, &again), LC_ASSERTION);
    EXPECT_EQ(log.count("Already have registered body handler for proto 1"), 1);
    gcl *nothing = nullptr;
    EXPECT_EQ(gcl_deinit(&nothing), LC_OK);
    EXPECT_EQ(gcl_init(&nothing, nullptr, nullptr), LC_NULL);
    for (const char *name : {"a-b", "abcdefghijklmnopqrst"}) {
        EXPECT_EQ(client.make(name), LC_GENERIC);
        EXPECT_EQ(client.session, nullptr);
    }
    const auto expect_own = [&](const char *name, const wire &expected) {
        const char *own = nullptr;
        ASSERT_EQ(client.make(name), LC_OK);
        EXPECT_EQ(gcl_session_get_session_names(client.session, &own, nullptr), LC_OK);
        EXPECT_EQ(own, expected + std::to_string(getpid()));
    };
    expect_own("abcdefghijklmnopqrs", "abcdefghijklmnopqrs-");
    expect_own(nullptr, "UNKNOWN-" + std::to_string(geteuid()) + ".");
}

TEST_F(Gcl, WithoutAProvider) {
    gcl_log log;
    ASSERT_EQ(client.make(), LC_OK);
    EXPECT_EQ(client.send(1, "early"), LC_GENERIC);
    EXPECT_EQ(log.count("tried to send frame in state 2"), 1);
    int64_t start = lt_monotonic_ms();
    EXPECT_EQ(gcl_session_client_connect_by_provider(client.session, "nobody", 0), LC_IO_ERROR);
    EXPECT_LT(lt_monotonic_ms() - start, 1000);
    EXPECT_EQ(client.state(), GCL_SESSION_CLOSED);
    EXPECT_EQ(client.closes, 0); // no session was lost
    EXPECT_EQ(log.count("Failed to connect to provider."), 1);
    EXPECT_EQ(log.count("Error code"), 0);
    EXPECT_EQ(gcl_session_client_connect_by_provider(client.session, "mgmtd", 0), LC_GENERIC);
    EXPECT_EQ(log.count("client called to connect in invalid state: 1 (closed)"), 1);
    expect_idle(); // neither spins on the closed descriptor nor ends

    ASSERT_EQ(client.make(), LC_OK);
    gcl_provider late;
    std::thread other([&] {
        usleep(500000);
        ASSERT_TRUE(late.listen_as("late"));
    });
    start = lt_monotonic_ms();
    EXPECT_EQ(gcl_session_client_connect_by_provider(client.session, "late", 1), LC_OK);
    EXPECT_NEAR(static_cast<double>(lt_monotonic_ms() - start), 1500, 400);
    EXPECT_EQ(log.count("Could not connect to provider; delaying and retrying."), 1);
    other.join();
}

TEST_F(Gcl, OverTheInternetProtocol) {
    gcl_log log;
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof address;
    auto *generic = reinterpret_cast<sockaddr *>(&address);
    provider.listener = socket(AF_INET, SOCK_STREAM, 0);
    ASSERT_EQ(bind(provider.listener, generic, length) | listen(provider.listener, 4), 0);
    ASSERT_EQ(getsockname(provider.listener, generic, &length), 0);
    ASSERT_EQ(gcl_session_client_new(client.instance, "wccpd", generic, length, &client.session), LC_OK);
    ASSERT_EQ(gcl_session_client_connect_by_sockaddr(client.session, generic, length, 1), LC_OK);
    EXPECT_EQ(log.count("connected to 127.0.0.1:" + std::to_string(ntohs(address.sin_port))), 1);
    gcl_session *session = nullptr;
    address.sin_family = AF_IPX;
    EXPECT_EQ(gcl_session_client_new(client.instance, "wccpd", generic, length, &session), LC_GENERIC);
    EXPECT_EQ(log.count("Unknown af 4"), 1);
}

// ---- The frame reader

TEST_F(Gcl, FramesInEveryCut) {
    open();
    const wire both = frame_bytes(3, 8, "text") + frame_bytes(3, 7, "");
    for (const size_t piece : {1u, 31u, 32u, 33u, 68u}) { // the last one: both frames in one read
        for (size_t at = 0; at < both.size(); at += piece) {
            ASSERT_TRUE(provider.put(both.substr(at, piece)));
            round();
        }
        expect_frames({be(8, 2) + "text", be(7, 2)});
    }
}

TEST_F(Gcl, BadFramesEndTheSessionAndForeignOnesDoNot) {
    gcl_log log;
    const wire good = frame_bytes(3, 1, "body");
    const auto check = [&](const wire &bytes, bool closes, const char *line) {
        open();
        log.clear();
        client.on_frame = [](const wire &frame) { return frame[1] == 13 ? LC_BAD_TYPE : LC_OK; };
        ASSERT_TRUE(provider.put(bytes));
        round();
        EXPECT_EQ(log.count(line), 1) << line;
        EXPECT_EQ(client.state(), closes ? GCL_SESSION_CLOSED : GCL_SESSION_CONNECTED) << line;
        EXPECT_EQ(client.closes, closes ? 1 : 0) << line;
        EXPECT_LE(client.frames.size(), 1u) << line;
        client.frames.clear();
        if (!closes) { // later frames are read
            ASSERT_TRUE(provider.put(good));
            expect_frames({be(1, 2) + "body"});
        }
        drop();
    };
    const auto check_changed = [&](size_t offset, const wire &bytes, const char *line) {
        check(wire(good).replace(offset, bytes.size(), bytes), true, line);
    };
    check(frame_bytes(5, 1, "body"), false, "DISCARDED frame 1000001 (36) proto 5 ");
    check(frame_bytes(700, 1, "body"), false, "DISCARDED frame 1000001 (36) proto 700 ");
    check(frame_bytes(3, 65535, "body"), false, "upper layer handoff of 1000001 len 36");
    check(frame_bytes(1, 9, "body"), false, "proto admin: in receive CATCHALL");
    check(frame_bytes(1, 1, "short"), true, "closing after error condition");
    check(frame_bytes(1, 4, "short"), true, "closing after error condition");
    check(greeting_bytes(~0u, ~0u), true, "bad state in greeting:7 not 3");
    check(frame_bytes(3, 13, "its handler fails") + good, true, "closing after error condition");
    check_changed(0, "XCLF", "invalid frame ident: ");
    check_changed(8, be(2, 4), "invalid frame version: 2");
    check_changed(16, be(31, 2), "invalid frame header len: 31 vs 32");
    check_changed(12, be(31, 4), "invalid frame total length: 31");
    check_changed(12, be(0, 4), "invalid frame total length: 0");
    check_changed(12, be(0xffffffff, 4), "invalid frame total length: 4294967295");
    check_changed(12, be((16 << 20) + 1, 4), "invalid frame total length: 16777217");
}

// The header of a frame of the largest size takes no memory for bytes that have not been received.
TEST_F(Gcl, ALengthInAHeaderTakesNoMemory) {
    open();
    const size_t before = mallinfo2().uordblks + mallinfo2().hblkhd;
    ASSERT_TRUE(provider.put(frame_bytes(3, 1, "").replace(12, 4, be(16 << 20, 4)) + wire(100, 'x')));
    round();
    EXPECT_LT(mallinfo2().uordblks + mallinfo2().hblkhd, before + (1 << 20));
    EXPECT_EQ(client.state(), GCL_SESSION_CONNECTED);
}

// A handler runs the loop to wait for later frames. Meanwhile the buffer is moved, enlarged and emptied,
// although the outer call still has frames to deliver; each piece that is sent ends in the middle of a frame.
TEST_F(Gcl, TheReaderIsReentrant) {
    open();
    const wire wait = frame_bytes(3, 1, "wait"), cut = frame_bytes(3, 3, "cut in two");
    std::mutex one_writer;
    size_t waits = 0, deepest = 0, depth = 0;
    client.on_frame = [&](const wire &frame) {
        if (frame[1] != 1)
            return LC_OK;
        deepest = std::max(deepest, ++depth);
        if (++waits <= 3) {
            const wire own(500000, static_cast<char>('0' + waits));
            std::thread other([&] {
                const std::lock_guard<std::mutex> guard(one_writer);
                EXPECT_TRUE(provider.put(cut.substr(20) + frame_bytes(3, 2, own) + cut.substr(0, 20)));
            });
            until([&] { return std::ranges::count(client.frames, be(2, 2) + own) == 1; });
            other.join();
        }
        depth--;
        return LC_OK;
    };
    ASSERT_TRUE(provider.put(wait + wait + wait + wait + cut.substr(0, 20)));
    until([&] { return waits == 4; });
    ASSERT_TRUE(provider.put(cut.substr(20)));
    until([&] { return client.frames.size() == 4 + 3 + 4; });
    EXPECT_GE(deepest, 3u);
    EXPECT_EQ(std::ranges::count(client.frames, be(1, 2) + "wait"), 4);
    EXPECT_EQ(std::ranges::count(client.frames, be(3, 2) + "cut in two"), 4);
}

// The session ends while a handler runs: closed by the peer in a nested round, closed by the handler, or
// freed by it.
TEST_F(Gcl, TheSessionEndsDuringAHandler) {
    for (int way = 0; way < 3; way++) {
        open();
        client.on_frame = [&, way](const wire &) -> lc_status {
            if (way == 0) {
                provider.close_client();
                until([&] { return client.closes == 1; });
                return LC_OK;
            }
            EXPECT_EQ(gcl_session_close(client.session, 0), LC_OK);
            return way == 2 ? gcl_session_free(&client.session) : LC_OK;
        };
        ASSERT_TRUE(provider.put(frame_bytes(3, 1, "a") + frame_bytes(3, 1, "b")));
        round();
        // What was received before the peer closed is delivered; after our own close nothing is.
        EXPECT_EQ(client.frames.size(), way == 0 ? 2u : 1u) << way;
        EXPECT_EQ(client.closes, 1) << way;
        if (way < 2)
            drop();
    }
}

// ---- The output queue

TEST_F(Gcl, FramesAreSentCompletelyInOrderAndAtTheRateLimit) {
    open();
    std::vector<wire> sent;
    for (uint16_t i = 1; i <= 40; i++) { // far more than the socket takes
        const wire body(50000, static_cast<char>('A' + i % 26));
        ASSERT_EQ(client.send(i, body), LC_OK);
        sent.push_back(frame_bytes(3, i, body, 2000002u + i));
    }
    const std::pair<wire, uint32_t> buffers[] = {{wire(32, '\0') + "in place", 32}, {"put", 16}};
    for (const auto &[bytes, offset] : buffers) {
        tbuffer *buffer = nullptr;
        ASSERT_EQ(tb_new_buf(&buffer, bytes.data(), static_cast<int32_t>(bytes.size())), LC_OK);
        EXPECT_EQ(gcl_session_send_frame_components_tb(client.session, 3, 99, offset, &buffer), LC_OK);
        EXPECT_EQ(buffer, nullptr);
    }
    sent.push_back(frame_bytes(3, 99, "in place", 2000043));
    sent.push_back(frame_bytes(3, 99, "put", 2000044));
    EXPECT_TRUE(taken(42) == sent);
    const wire body(50000, 'r');
    client.session->rate_limit = 100; // kilobytes a second
    const int64_t start = lt_monotonic_ms();
    ASSERT_EQ(client.send(1, body), LC_OK);
    EXPECT_EQ(taken(1)[0], frame_bytes(3, 1, body, 2000045));
    EXPECT_NEAR(static_cast<double>(lt_monotonic_ms() - start), 400, 200);
    expect_idle(); // does not wait for a writable socket
}

TEST_F(Gcl, SessionsEndWithAQueue) {
    open();
    provider.close_client();
    EXPECT_EQ(client.send(1, "to nobody"), LC_OK);
    EXPECT_TRUE(client.state() == GCL_SESSION_CLOSED && client.closes == 1);
    EXPECT_EQ(client.send(1, "to nobody"), LC_GENERIC);
    drop();

    gcl_log log;
    open();
    for (int i = 0; i < 20; i++)
        ASSERT_EQ(client.send(1, wire(50000, 'f')), LC_OK);
    EXPECT_EQ(gcl_session_close(client.session, 1), LC_OK);
    EXPECT_EQ(log.count("closed with output queue"), 1);
    EXPECT_EQ(client.closes, 1);
    EXPECT_EQ(gcl_shutdown(client.instance), LC_OK);
    EXPECT_EQ(client.closes, 1);
}

} // namespace
