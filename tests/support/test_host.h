// TUN devices, sockets and processes of the host on which tests of tunneld run.
#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/if_tun.h>
#include <net/if.h>
#include <netinet/in.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <functional>
#include <string>

// Opens a TUN device, which it makes if necessary, and which stays when it is closed. Returns -1 on failure.
inline int open_tun(const std::string &name, int flags = 0) {
    const int fd = open("/dev/net/tun", O_RDWR | O_CLOEXEC | flags);
    ifreq request = {};
    strncpy(request.ifr_name, name.c_str(), IFNAMSIZ - 1);
    request.ifr_flags = IFF_TUN | IFF_NO_PI;
    return ioctl(fd, TUNSETIFF, &request) == 0 && ioctl(fd, TUNSETPERSIST, 1) == 0 ? fd : -1;
}

// Both numbers are in host order.
inline sockaddr_in address_of(uint32_t address, uint16_t port = 0) {
    sockaddr_in out = {};
    out.sin_family = AF_INET;
    out.sin_addr.s_addr = htonl(address);
    out.sin_port = htons(port);
    return out;
}
// 0, or -1 and errno, as bind() returns it.
inline int bind_to(int fd, uint32_t address, uint16_t port = 0) {
    const sockaddr_in name = address_of(address, port);
    return bind(fd, reinterpret_cast<const sockaddr *>(&name), sizeof name);
}

// Starts a process that exits with the result of `steps`, without cleaning up.
inline pid_t start_child(const std::function<int()> &steps) {
    fflush(nullptr);
    const pid_t child = fork();
    if (child == 0) {
        const int result = steps();
        fflush(nullptr);
        _exit(result);
    }
    return child;
}
// Returns its status as waitpid() does.
inline int wait_for_child(pid_t child) {
    int status = -1;
    waitpid(child, &status, 0);
    return status;
}
// Runs the steps in a process that does not clean up. Their failures fail this test.
inline void run_program(const std::function<void()> &steps) {
    const pid_t child = start_child([&] {
        steps();
        return testing::Test::HasFailure() ? 1 : 0;
    });
    EXPECT_EQ(wait_for_child(child), 0) << "see above";
}
