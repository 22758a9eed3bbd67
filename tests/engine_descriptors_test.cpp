// Descriptors that change between a receiver's wait and its read. A poll of this program replaces the C
// library's, so that the change happens exactly there.

#include <csignal>
#include <functional>
#include <utility>

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include "engine/wccp_network.h"
#include "engine/wccp_packet_io.h"
#include "tests/support/engine_fixture.h"

static std::function<void()> after_wait; // called once, when a descriptor is ready

extern "C" int poll(pollfd *fds, nfds_t count, int wait_ms) {
    const timespec limit = {wait_ms / 1000, wait_ms % 1000 * 1000000L};
    const int ready = ppoll(fds, count, wait_ms < 0 ? nullptr : &limit, nullptr);
    if (ready > 0 && after_wait)
        std::exchange(after_wait, nullptr)();
    return ready;
}

namespace {

class Descriptors : public testing::Test {
protected:
    void SetUp() override {
        // Ends a read that blocks. The first process of a namespace only receives signals that it handles.
        signal(SIGALRM, [](int) { _exit(1); });
        alarm(20);
        send_datagram(engine.router_socket("10.0.0.2"), "10.0.0.100", WCCP_PORT, {1, 2, 3, 4});
    }
    void TearDown() override { alarm(0); }

    engine_fixture engine;
    wccp_interface *wan = engine.interface;
    wccp_pkt pkt = {};
};

TEST_F(Descriptors, ADescriptorOfAnotherFileIsNotRead) {
    int other = -1;
    after_wait = [&] {
        const int number = wan->ucast_fd;
        wccp_close_sockets(wan);
        int pair[2];
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_DGRAM, 0, pair), 0);
        ASSERT_EQ(write(pair[1], "theirs", 6), 6);
        other = dup2(pair[0], number);
    };
    EXPECT_LT(wccp_rx_pkt(wan, &pkt, sizeof pkt.data), 1);
    ASSERT_GE(other, 0);
    char bytes[8] = {};
    EXPECT_EQ(recv(other, bytes, sizeof bytes, MSG_DONTWAIT), 6);
    close(other);
}

TEST_F(Descriptors, ANewSocketThatIsEmptyDoesNotBlock) {
    after_wait = [&] { EXPECT_EQ(wccp_init_network_by_interface(wan), 0); };
    EXPECT_LT(wccp_rx_pkt(wan, &pkt, sizeof pkt.data), 1);
    EXPECT_EQ(after_wait, nullptr);
}

} // namespace
