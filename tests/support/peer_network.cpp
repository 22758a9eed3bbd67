#include "tests/support/peer_network.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sched.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdlib>

static std::string proc_path(int fd) {
    return "/proc/" + std::to_string(getpid()) + "/fd/" + std::to_string(fd);
}

static sockaddr_in inet_endpoint(const std::string &address, uint16_t port) {
    sockaddr_in out = {};
    out.sin_family = AF_INET;
    out.sin_port = htons(port);
    out.sin_addr.s_addr = address_word(address);
    return out;
}

void run_command(const std::string &command) {
    EXPECT_EQ(system(command.c_str()), 0) << command;
}

uint32_t address_word(const std::string &text) {
    in_addr address = {};
    EXPECT_EQ(inet_pton(AF_INET, text.c_str(), &address), 1) << text;
    return address.s_addr;
}

be32 ipa(const std::string &text) {
    return from_raw_word(address_word(text));
}

peer_network::peer_network() {
    home = open("/proc/thread-self/ns/net", O_RDONLY);
    EXPECT_EQ(unshare(CLONE_NEWNET), 0);
    there = open("/proc/thread-self/ns/net", O_RDONLY);
    EXPECT_EQ(setns(home, CLONE_NEWNET), 0);
    run("ip link set lo up");
}

peer_network::~peer_network() {
    close(there);
    close(home);
}

void peer_network::run(const std::string &command) const {
    run_command("nsenter --net=" + proc_path(there) + " " + command);
}

void peer_network::link(const std::string &name, const std::string &address, const std::string &peer_name,
                        const std::string &peer_address) const {
    run_command("ip link add " + name + " type veth peer name " + peer_name + " netns " + proc_path(there));
    if (!peer_address.empty())
        run("ip addr add " + peer_address + " dev " + peer_name);
    run("ip link set " + peer_name + " up");
    if (!address.empty())
        run_command("ip addr add " + address + " dev " + name);
    run_command("ip link set " + name + " up");
}

int peer_network::udp_socket(const std::string &address, uint16_t port) const {
    EXPECT_EQ(setns(there, CLONE_NEWNET), 0);
    const int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    EXPECT_EQ(setns(home, CLONE_NEWNET), 0);
    const int on = 1;
    setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
    const sockaddr_in local = inet_endpoint(address, port);
    EXPECT_EQ(bind(fd, reinterpret_cast<const sockaddr *>(&local), sizeof local), 0) << address;
    return fd;
}

datagram receive_datagram(int fd, int wait_ms) {
    pollfd ready = {.fd = fd, .events = POLLIN, .revents = 0};
    if (poll(&ready, 1, wait_ms) != 1)
        return {};
    datagram out;
    out.bytes.resize(65536);
    sockaddr_in from = {};
    socklen_t length = sizeof from;
    const ssize_t received =
        recvfrom(fd, out.bytes.data(), out.bytes.size(), 0, reinterpret_cast<sockaddr *>(&from), &length);
    out.bytes.resize(received > 0 ? static_cast<size_t>(received) : 0);
    char text[INET_ADDRSTRLEN];
    out.from = inet_ntop(AF_INET, &from.sin_addr, text, sizeof text);
    return out;
}

void send_datagram(int fd, const std::string &to, uint16_t port, const std::vector<uint8_t> &bytes) {
    const sockaddr_in remote = inet_endpoint(to, port);
    EXPECT_EQ(
        sendto(fd, bytes.data(), bytes.size(), 0, reinterpret_cast<const sockaddr *>(&remote), sizeof remote),
        static_cast<ssize_t>(bytes.size()));
}
