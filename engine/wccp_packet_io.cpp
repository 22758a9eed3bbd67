// Packet I/O of the interfaces: UDP over IPv4, one datagram per message.
//
// Sending runs with the engine lock held, on whichever thread holds it. Receiving runs on the receive thread
// of an interface without the engine lock.
//
// The descriptor lock. While a receive thread waits on a descriptor, the socket can be closed and its number
// reused for another file, such as a socket of another interface or the session with mgmtd. The descriptors
// of an interface therefore change only under a small mutex, which is taken after all other locks. The
// receive thread takes it twice: to copy the numbers that it waits on, and after the wait, to read without
// blocking from whatever socket its interface has by then. What it reads therefore always belongs to its
// interface; if the number has changed in between, it reads nothing and waits again. It holds no lock during
// the wait, which uses poll, because select cannot handle descriptors of 1024 and above.
//
// Sending never blocks. While the kernel tries to resolve the address of a router that has left the network,
// for about three seconds, datagrams for it stay in the socket's send buffer, and a few such routers in many
// groups fill it. A blocking send would then hold up the engine lock, and with it the tick and all reception.
// A message that finds the buffer full is lost, as it could be in the network; its timer sends the next one.
//
// A datagram longer than the receive buffer is truncated. The check of the message's own length then refuses
// it.

#include "engine/wccp_packet_io.h"

#include <errno.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstring>

#include "engine/wccp_utils.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

namespace {

constexpr int WAIT_MS = 1000;

pthread_mutex_t descriptor_lock = PTHREAD_MUTEX_INITIALIZER;

void close_descriptor(int32_t *cell) {
    const mutex_guard guard(&descriptor_lock);
    if (*cell > 0) // an interface that was never set up holds 0
        close(*cell);
    *cell = -1;
}

int32_t send_datagram(wccp_service_group *group, int fd, const wccp_pkt *pkt, be32 address) {
    const sockaddr_in to = wccp_socket_address(address);
    const auto sent = static_cast<int32_t>(
        sendto(fd, pkt->data, pkt->length, 0, reinterpret_cast<const sockaddr *>(&to), sizeof to));
    if (sent < 0) {
        // The calls below may overwrite errno.
        const int error = errno;
        // Thread-safe, unlike strerror; null for an unknown number.
        const char *words = strerrordesc_np(error);
        group->tx_send_errors++;
        if (wccp_note_reason(group, WCCP_REASON_SEND_FAILED, address,
                             wccp_reason_value("%s", words ? words : "unknown error"),
                             wccp_reason_value("%u bytes", pkt->length)))
            QV_LOG(LC_LOG_WARNING, "WCCP GRP %d: sending to %s fails: %s", group->id, addr_text(address).s,
                   words ? words : "unknown error");
        errno = error;
    } else {
        wccp_forget_reason(group, WCCP_REASON_SEND_FAILED, address);
    }
    return sent;
}

} // namespace

sockaddr_in wccp_socket_address(be32 address) {
    sockaddr_in out = {};
    out.sin_family = AF_INET;
    out.sin_port = htons(WCCP_PORT);
    out.sin_addr.s_addr = raw_word(address);
    return out;
}

void wccp_set_descriptor(int32_t *cell, int fd) {
    const mutex_guard guard(&descriptor_lock);
    *cell = fd;
}

void wccp_close_sockets(wccp_interface *interface) {
    close_descriptor(&interface->ucast_fd);
    close_descriptor(&interface->mcast_fd);
    interface->ucast_bound = 0;
    interface->mcast_bound = 0;
}

int32_t wccp_tx_pkt(wccp_service_group *group, wccp_pkt *pkt) {
    if (!group || !pkt) {
        QV_LOG(LC_LOG_ERR, "WCCP: group or pkt is NULL");
        return 0;
    }
    const wccp_interface *interface = group->interfaces[0];
    if (!interface) {
        QV_LOG(LC_LOG_ERR, "WCCP GRP %d: transmit: interface is not set", group->id);
        return 0;
    }
    if (!interface->ucast_bound) // an unbound socket would send from a port of the kernel's choice
        return 0;
    // A removal reply has a destination of its own. In all other packets it was cleared when they were built.
    if (!is_zero(pkt->ipa))
        return send_datagram(group, interface->ucast_fd, pkt, pkt->ipa);
    if (group->mcast_configured) {
        pkt->ipa = group->mcast_ipa;
        return send_datagram(group, interface->mcast_fd, pkt, pkt->ipa);
    }
    // A failed send adds -1. Only 0, which means that there was no destination, is a failure for the caller.
    int32_t sum = 0;
    for (uint32_t i = 0; i < group->ucast_router_count; i++) {
        pkt->ipa = group->ucast_routers[i];
        sum += send_datagram(group, interface->ucast_fd, pkt, pkt->ipa);
    }
    return sum;
}

int32_t wccp_rx_pkt(wccp_interface *interface, wccp_pkt *pkt, uint32_t length) {
    enum { MCAST, UCAST };
    pollfd ready[2] = {};
    {
        const mutex_guard guard(&descriptor_lock);
        // A descriptor of -1 is ignored by poll.
        ready[MCAST] = {.fd = interface->mcast_fd, .events = POLLIN, .revents = 0};
        ready[UCAST] = {.fd = interface->ucast_fd, .events = POLLIN, .revents = 0};
    }
    if (ready[MCAST].fd == -1 && ready[UCAST].fd == -1) {
        // Nothing wakes this thread when sockets are opened. The sleep is also a cancellation point.
        sleep(1);
        return 0;
    }
    // After a time-out the caller calls again and copies the descriptors again, which may have been replaced.
    if (poll(ready, 2, WAIT_MS) < 1)
        return 0;

    sockaddr_in from = {};
    socklen_t from_length = sizeof from;
    ssize_t received;
    {
        const mutex_guard guard(&descriptor_lock);
        // A ready unicast socket is read by the next call if both are ready.
        const int fd = ready[MCAST].revents ? interface->mcast_fd : interface->ucast_fd;
        if (fd == -1)
            return 0;
        received =
            recvfrom(fd, pkt->data, length, MSG_DONTWAIT, reinterpret_cast<sockaddr *>(&from), &from_length);
    }
    if (received < 1)
        return static_cast<int32_t>(received);
    pkt->ipa = from_raw_word(from.sin_addr.s_addr);
    QV_LOG(LC_LOG_INFO, "WCCP %-6s: Rx %d bytes from %s", interface->name, static_cast<int>(received),
           addr_text(pkt->ipa).s);
    return static_cast<int32_t>(received);
}
