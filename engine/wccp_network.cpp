// Sockets and packet I/O of the interfaces.
//
// Each interface owns a unicast socket, bound to its address, and a multicast socket, bound to the first
// group address that is joined on it. They are opened and closed by the main thread and the notifier only,
// neither of which is ever cancelled, with the engine lock held. Sending happens under the engine lock as
// well, on whichever thread holds it. The interface's receive thread works without it.
//
// The descriptor lock. A receive thread waits on numbers, and while it waits the number can be closed and
// come back as another file: a socket of another interface, or the session with mgmtd. So the two cells of an
// interface change under a small mutex, behind all others, and the receive thread takes that mutex twice: for
// the numbers that it will wait on, and, once something is ready, to read its interface's number of that
// moment, without blocking. What it reads therefore belongs to its interface; what its stale wait woke up for
// may be nothing of its own, and then it reads nothing and comes again. It waits with no lock, for a second
// at most, by poll, which takes descriptors of any size.
//
// All groups of an interface say Here-I-Am in one tick, with the engine lock held, and their routers answer
// at once: with 256 groups of 32 routers some 8000 datagrams wait for that tick to end. The kernel's usual
// buffer holds a few hundred; the rest would be lost at every tick, and routers time out. What a larger
// buffer may hold is the kernel's memory and is taken only while it is full.
//
// Sending never waits. A router that is gone from the network is looked for by the kernel for three seconds,
// and what is sent to it meanwhile stays in the socket's send buffer: a few such routers in many groups fill
// it, and a send that waited would stand still under the engine lock, with the tick and all that is received.
// So that buffer is as large as the other one, and where it is full all the same the message is lost, as on
// the way; the next one comes with its timer.
//
// A datagram that is longer than the buffer is cut to it, and the tail is gone: what is handed on has the
// length of the buffer, and the check of the message's own length decides.
//
// A receive thread is made once for an interface and outlives its sockets. `rx_thread` only tells that it was
// made: after the change to bridge mode the thread is gone, the cell stays, and so no second one is made.

#include "engine/wccp_network.h"

#include <errno.h>
#include <fcntl.h>
#include <net/if.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>

#include "engine/cthread.h"
#include "engine/wccp_mgr.h"
#include "engine/wccp_utils.h"
#include "platform/qvcommon.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

static pthread_mutex_t descriptor_lock = PTHREAD_MUTEX_INITIALIZER;

static constexpr int WAIT_MS = 1000;
static constexpr int BUFFER = 16 << 20; // each way, bytes, the kernel's own records of the datagrams included

static sockaddr_in socket_address(be32 address) {
    sockaddr_in out = {};
    out.sin_family = AF_INET;
    out.sin_port = htons(WCCP_PORT);
    out.sin_addr.s_addr = raw_word(address);
    return out;
}

static int bind_to(int fd, be32 address) {
    const sockaddr_in local = socket_address(address);
    return bind(fd, reinterpret_cast<const sockaddr *>(&local), sizeof local);
}

static void set_descriptor(int32_t *cell, int fd) {
    const mutex_guard guard(&descriptor_lock);
    *cell = fd;
}

static void close_descriptor(int32_t *cell) {
    const mutex_guard guard(&descriptor_lock);
    if (*cell > 0)
        close(*cell);
    *cell = -1;
}

void wccp_close_sockets(wccp_interface *interface) {
    close_descriptor(&interface->ucast_fd);
    close_descriptor(&interface->mcast_fd);
    interface->ucast_bound = 0;
    interface->mcast_bound = 0;
}

namespace {

struct socket_option {
    int level, name;
    const void *value;
    socklen_t length;
    const char *failure; // with the interface's name
};

} // namespace

// As large as the kernel gives it.
static void widen_buffer(int fd, int forced, int within_limits) {
    if (setsockopt(fd, SOL_SOCKET, forced, &BUFFER, sizeof BUFFER) != 0)
        (void)setsockopt(fd, SOL_SOCKET, within_limits, &BUFFER, sizeof BUFFER);
}

// A datagram socket with these options, or -1; each failure has its line.
template <size_t Count>
static int open_socket(const wccp_interface *interface, const char *open_failure,
                       const socket_option (&options)[Count]) {
    const int fd = socket(AF_INET, SOCK_DGRAM, 0);
    if (fd < 0) {
        QV_LOG(LC_LOG_ERR, open_failure, interface->name);
        return -1;
    }
    for (const socket_option &option : options) {
        if (setsockopt(fd, option.level, option.name, option.value, option.length) == 0)
            continue;
        QV_LOG(LC_LOG_ERR, option.failure, interface->name);
        close(fd);
        return -1;
    }
    widen_buffer(fd, SO_RCVBUFFORCE, SO_RCVBUF);
    widen_buffer(fd, SO_SNDBUFFORCE, SO_SNDBUF);
    (void)fcntl(fd, F_SETFL, O_NONBLOCK);
    return fd;
}

static int open_unicast(wccp_interface *interface) {
    const int on = 1, no_discovery = IP_PMTUDISC_DONT;
    const socket_option options[] = {
        {SOL_SOCKET, SO_REUSEADDR, &on, sizeof on, "WCCP: net init %s: Cannot set mcast socket option: %m"},
        {IPPROTO_IP, IP_MTU_DISCOVER, &no_discovery, sizeof no_discovery,
         "WCCP: net init %s Cannot disable path mtu discovery. %m"},
    };
    const int fd = open_socket(interface, "WCCP: net init %s: Fail to open ucast socket. %m", options);
    if (fd < 0)
        return 1;
    // A socket that cannot be bound stays open: it is `ucast_bound` that allows sending.
    const int result = bind_to(fd, interface->ipa);
    if (result != 0)
        QV_LOG(LC_LOG_ERR, "WCCP: net init: %s Cannot bind unicast UDP socket to %s:%d: %m", interface->name,
               addr_text(interface->ipa).s, WCCP_PORT);
    set_descriptor(&interface->ucast_fd, fd);
    if (result != 0)
        return 1;
    interface->ucast_bound = 1;
    return 0;
}

static int open_multicast(wccp_interface *interface) {
    const int on = 1, no_discovery = IP_PMTUDISC_DONT;
    const uint8_t ttl = wccp_g.mcast_ttl, no_loop = 0;
    const socket_option options[] = {
        {SOL_SOCKET, SO_REUSEADDR, &on, sizeof on, "WCCP: net init %s: Cannot set mc socket options. %m"},
        {IPPROTO_IP, IP_MULTICAST_TTL, &ttl, sizeof ttl, "WCCP: net init %s Cannot set mcast output TTL. %m"},
        {IPPROTO_IP, IP_MULTICAST_LOOP, &no_loop, sizeof no_loop,
         "WCCP: net init %s: Cannot disable mcast loopback. %m"},
        {IPPROTO_IP, IP_MTU_DISCOVER, &no_discovery, sizeof no_discovery,
         "WCCP: net init %s mcast cannot disable path mtu discovery. %m"},
    };
    const int fd = open_socket(interface, "WCCP: net init %s: Cannot open mc socket. %m", options);
    if (fd < 0)
        return 1;
    set_descriptor(&interface->mcast_fd, fd);
    if (setsockopt(fd, IPPROTO_IP, IP_MULTICAST_IF, &interface->ipa, sizeof interface->ipa) != 0) {
        QV_LOG(LC_LOG_ERR, "WCCP: net init %s: Cannot set mcast output interface to: %s. %m", interface->name,
               addr_text(interface->ipa).s);
        return 1;
    }
    return 0;
}

static int start_rx_thread(wccp_interface *interface) {
    if (interface->rx_thread) {
        QV_LOG(LC_LOG_INFO, "WCCP: net init %s: receive thread is running already", interface->name);
        return 0;
    }
    char name[32];
    snprintf(name, sizeof name, "WCCP_RX_%s", interface->name);
    cthread *thread = cthread_init(name, wccp_rx_thread_fn, interface, nullptr, nullptr, 0, 0, 0, 0);
    if (!thread || cthread_start(thread) != 0) {
        cthread_join(thread);
        QV_LOG(LC_LOG_ERR, "WCCP: net init %s Failed to spawn rx thread", interface->name);
        return 1;
    }
    interface->rx_thread = thread;
    return 0;
}

int wccp_init_network_by_interface(wccp_interface *interface) {
    wccp_close_sockets(interface);
    if (is_zero(interface->ipa)) {
        QV_LOG(LC_LOG_INFO, "WCCP: net init %s not bound (no IP address)", interface->name);
        return 0;
    }
    interface->device = wccp_get_device(interface->name);
    if (open_unicast(interface) || open_multicast(interface))
        return 1;
    wccp_config_mcast(interface);
    QV_LOG(LC_LOG_INFO, "WCCP: net init %s: sockets of %s are open", interface->name,
           addr_text(interface->ipa).s);
    return start_rx_thread(interface);
}

int wccp_join_mc_grp(wccp_interface *interface, be32 address) {
    if (interface->mcast_fd == -1)
        return 1;
    if (!interface->mcast_bound) {
        if (bind_to(interface->mcast_fd, address) != 0) {
            QV_LOG(LC_LOG_ERR, "WCCP: Interface %s: Cannot bind mcast UDP socket to %s:%d. %m",
                   interface->name, addr_text(address).s, WCCP_PORT);
            return 1;
        }
        interface->mcast_bound = 1;
    }
    ip_mreq membership = {};
    membership.imr_multiaddr.s_addr = raw_word(address);
    membership.imr_interface.s_addr = raw_word(interface->ipa);
    if (setsockopt(interface->mcast_fd, IPPROTO_IP, IP_ADD_MEMBERSHIP, &membership, sizeof membership) == 0)
        return 0;
    if (errno == EADDRINUSE) {
        QV_LOG(LC_LOG_INFO, "WCCP: Interface %s: We've already subscribed to mcast group: %s",
               interface->name, addr_text(address).s);
        return 0;
    }
    QV_LOG(LC_LOG_ERR, "WCCP: Interface %s: Failed to join multicast group: %s, errno: %m", interface->name,
           addr_text(address).s);
    return 1;
}

static int32_t send_to(int fd, const wccp_pkt *pkt, be32 address) {
    const sockaddr_in to = socket_address(address);
    return static_cast<int32_t>(
        sendto(fd, pkt->data, pkt->length, 0, reinterpret_cast<const sockaddr *>(&to), sizeof to));
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
    if (!interface->ucast_bound)
        return 0;
    if (!is_zero(pkt->ipa))
        return send_to(interface->ucast_fd, pkt, pkt->ipa);
    if (group->mcast_configured) {
        pkt->ipa = group->mcast_ipa;
        return send_to(interface->mcast_fd, pkt, pkt->ipa);
    }
    int32_t sum = 0;
    for (uint32_t i = 0; i < group->ucast_router_count; i++) {
        pkt->ipa = group->ucast_routers[i];
        sum += send_to(interface->ucast_fd, pkt, pkt->ipa);
    }
    return sum;
}

int32_t wccp_rx_pkt(wccp_interface *interface, wccp_pkt *pkt, uint32_t length) {
    enum { MCAST, UCAST };
    pollfd ready[2] = {};
    {
        const mutex_guard guard(&descriptor_lock);
        ready[MCAST] = {.fd = interface->mcast_fd, .events = POLLIN, .revents = 0};
        ready[UCAST] = {.fd = interface->ucast_fd, .events = POLLIN, .revents = 0};
    }
    if (ready[MCAST].fd == -1 && ready[UCAST].fd == -1) {
        sleep(1);
        return 0;
    }
    if (poll(ready, 2, WAIT_MS) < 1)
        return 0;

    sockaddr_in from = {};
    socklen_t from_length = sizeof from;
    ssize_t received;
    {
        const mutex_guard guard(&descriptor_lock);
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

static ifreq request_for(const char *name) {
    ifreq request = {};
    strlcpy(request.ifr_name, name, sizeof request.ifr_name);
    request.ifr_addr.sa_family = AF_INET;
    return request;
}

be32 wccp_get_address(const char *name) {
    ifreq request = request_for(name);
    if (ioctl(g_qvif_skfd, SIOCGIFADDR, &request) != 0)
        return {};
    sockaddr_in address;
    memcpy(&address, &request.ifr_addr, sizeof address);
    return from_raw_word(address.sin_addr.s_addr);
}

int32_t wccp_get_device(const char *name) {
    ifreq request = request_for(name);
    return ioctl(g_qvif_skfd, SIOCGIFINDEX, &request) == 0 ? request.ifr_ifindex : 0;
}

uint32_t wccp_get_if_status(const char *name) {
    ifreq request = request_for(name);
    if (ioctl(g_qvif_skfd, SIOCGIFFLAGS, &request) != 0) {
        QV_LOG(LC_LOG_WARNING, "WCCP: Failed to read link status %s (%m)", name);
        return 0;
    }
    const uint32_t both = IFF_UP | IFF_RUNNING;
    return (static_cast<uint32_t>(request.ifr_flags) & both) == both ? 1 : 0;
}
