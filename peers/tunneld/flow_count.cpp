#include "peers/tunneld/flow_count.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>

#include <arpa/inet.h>
#include <linux/inet_diag.h>
#include <linux/netlink.h>
#include <linux/sock_diag.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <unistd.h>

namespace {

constexpr size_t ANSWER_BYTES = 65536;
// Not SYN_RECV, in which no proxy has accepted the connection yet, and not TIME_WAIT, which belongs to no
// process.
constexpr uint32_t STATES = 1u << TCP_ESTABLISHED | 1u << TCP_FIN_WAIT1 | 1u << TCP_FIN_WAIT2 |
                            1u << TCP_CLOSE_WAIT | 1u << TCP_CLOSING | 1u << TCP_LAST_ACK;

struct descriptor {
    int fd;
    explicit descriptor(int number) : fd(number) {}
    descriptor(const descriptor &) = delete;
    descriptor &operator=(const descriptor &) = delete;
    ~descriptor() {
        if (fd >= 0)
            close(fd);
    }
};

// False for an IPv6 address. A proxy that listens on both has its IPv4 connections in IPv6 sockets, with
// addresses below ::ffff:0:0/96.
bool read_socket_address(uint8_t family, const __be32 (&words)[4], uint32_t *out) {
    if (family == AF_INET6 && (words[0] != 0 || words[1] != 0 || ntohl(words[2]) != 0xFFFF))
        return false;
    *out = ntohl(family == AF_INET6 ? words[3] : words[0]);
    return true;
}

void add_flow_of_socket(const inet_diag_msg &socket, const std::vector<uint32_t> &own,
                        std::vector<flow_ends> *out) {
    flow_ends flow{};
    // A socket in FIN_WAIT2 that no process has (inode 0) only waits for the other side's FIN.
    if ((socket.idiag_state == TCP_FIN_WAIT2 && socket.idiag_inode == 0) || out->size() >= FLOWS_MAX ||
        !read_socket_address(socket.idiag_family, socket.id.idiag_src, &flow.local) ||
        !read_socket_address(socket.idiag_family, socket.id.idiag_dst, &flow.remote) ||
        flow.local >> 24 == 127 || std::binary_search(own.begin(), own.end(), flow.local))
        return;
    // What is left is transparent: no other socket has a foreign local address.
    flow.local_port = ntohs(socket.id.idiag_sport);
    flow.remote_port = ntohs(socket.id.idiag_dport);
    out->push_back(flow);
}

bool send_socket_query(int fd, uint8_t family) {
    struct {
        nlmsghdr header;
        inet_diag_req_v2 question;
    } request = {};
    request.header.nlmsg_len = sizeof request;
    request.header.nlmsg_type = SOCK_DIAG_BY_FAMILY;
    request.header.nlmsg_flags = NLM_F_REQUEST | NLM_F_DUMP;
    request.question.sdiag_family = family;
    request.question.sdiag_protocol = IPPROTO_TCP;
    request.question.idiag_states = STATES;
    return send(fd, &request, sizeof request, 0) == static_cast<ssize_t>(sizeof request);
}

// The kernel makes each part of the answer when it is read; therefore the reads need not block. Returns 0 or
// an errno.
int read_socket_list(int fd, const std::vector<uint32_t> &own, std::vector<flow_ends> *out) {
    const std::unique_ptr<char[]> bytes(new char[ANSWER_BYTES]);
    for (;;) {
        const ssize_t count = recv(fd, bytes.get(), ANSWER_BYTES, MSG_DONTWAIT);
        if (count < 0 && errno == EINTR)
            continue;
        if (count <= 0)
            return count < 0 ? errno : EIO;
        auto length = static_cast<unsigned>(count);
        for (const auto *message = reinterpret_cast<const nlmsghdr *>(bytes.get()); NLMSG_OK(message, length);
             message = NLMSG_NEXT(message, length)) {
            // A dump can take several reads, and ends with this message.
            if (message->nlmsg_type == NLMSG_DONE)
                return 0;
            if (message->nlmsg_type == NLMSG_ERROR)
                return message->nlmsg_len >= NLMSG_LENGTH(sizeof(nlmsgerr))
                           ? -static_cast<const nlmsgerr *>(NLMSG_DATA(message))->error
                           : EIO;
            if (message->nlmsg_len >= NLMSG_LENGTH(sizeof(inet_diag_msg)))
                add_flow_of_socket(*static_cast<const inet_diag_msg *>(NLMSG_DATA(message)), own, out);
        }
    }
}

bool has_port(const intercept &rules, uint16_t port) {
    return rules.ports.empty() ||
           std::any_of(rules.ports.begin(), rules.ports.end(),
                       [&](const port_range &range) { return range.first <= port && port <= range.last; });
}

} // namespace

bool read_transparent_flows(const std::vector<uint32_t> &own_addresses, std::vector<flow_ends> *out,
                            std::string *out_error) {
    out->clear();
    for (const uint8_t family : {uint8_t{AF_INET}, uint8_t{AF_INET6}}) {
        const descriptor kernel(socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, NETLINK_SOCK_DIAG));
        const int error = kernel.fd < 0 || !send_socket_query(kernel.fd, family)
                              ? errno
                              : read_socket_list(kernel.fd, own_addresses, out);
        if (error == 0 || (family == AF_INET6 && error == ENOENT)) // a kernel without IPv6
            continue;
        *out_error = std::string("sockets cannot be listed: ") + strerror(error);
        return false;
    }
    return true;
}

// The connection of a proxy that keeps the client's address to the server is transparent as well. With an
// intercept of all ports it would be counted as a second flow. Flows between the same two addresses are
// therefore counted by direction, and the larger number of the two counts.
std::map<uint8_t, uint32_t> count_flows(const std::vector<flow_ends> &flows,
                                        const std::map<uint8_t, intercept> &intercepts) {
    std::map<uint8_t, uint32_t> out;
    for (const auto &[group, rules] : intercepts) {
        if (rules.protocol != IPPROTO_TCP)
            continue;
        std::map<std::pair<uint32_t, uint32_t>, uint32_t> by_addresses[2]; // by the order of the addresses
        // Both directions of a pair of addresses have the same key, in one map each.
        for (const flow_ends &flow : flows)
            if (has_port(rules, flow.local_port))
                by_addresses[flow.local < flow.remote]
                            [{std::min(flow.local, flow.remote), std::max(flow.local, flow.remote)}]++;
        uint32_t &count = out[group];
        for (const auto &[addresses, number] : by_addresses[0]) {
            const auto other = by_addresses[1].find(addresses);
            count += std::max(number, other == by_addresses[1].end() ? 0 : other->second);
        }
        // Pairs that occur in this direction only.
        for (const auto &[addresses, number] : by_addresses[1])
            count += by_addresses[0].contains(addresses) ? 0 : number;
    }
    return out;
}
