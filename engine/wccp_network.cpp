// The sockets of an interface and its receive thread.
//
// Each interface owns a unicast socket, bound to its address, and a multicast socket, bound to the first
// group address that is joined on it. Both are opened and closed with the engine lock held: by the main
// thread and the notifier thread when configuration or the kernel changes something, and by the timer thread
// on a retry.
//
// A step of the set-up can fail, because there are no descriptors left or another process has the port. The
// set-up then ends there and the interface records which part failed (network_flaws). That part is tried
// again at the next notification for the interface, when configuration adds or enables a group on it, and
// every 30 seconds while an enabled group needs it.
//
// Buffers. All groups of an interface send Here-I-Am in the same tick, with the engine lock held, and their
// routers answer at once. With 256 groups of 32 routers some 8000 datagrams arrive before the tick releases
// the lock. The kernel's default buffer holds a few hundred; the rest would be lost in every round, until
// routers time out. A larger buffer costs memory only while datagrams are queued.
//
// A receive thread is created once for an interface and outlives its sockets. `rx_thread` stays set when the
// thread has been ended by the change to bridge mode, so that no second one is created.

#include "engine/wccp_network.h"

#include <errno.h>
#include <fcntl.h>
#include <net/if.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>

#include "engine/cthread.h"
#include "engine/wccp_complaints.h"
#include "engine/wccp_host.h"
#include "engine/wccp_packet_io.h"
#include "engine/wccp_pkt_mgr.h"
#include "engine/wccp_utils.h"
#include "platform/qvcommon.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

namespace {

constexpr int SOCKET_BUFFER_BYTES = 16 << 20; // each way; the kernel's overhead for a datagram counts too

int bind_socket(int fd, be32 address) {
    const sockaddr_in local = wccp_socket_address(address);
    return bind(fd, reinterpret_cast<const sockaddr *>(&local), sizeof local);
}

struct socket_option {
    int level, name;
    const void *value;
    socklen_t length;
    const char *failure; // format of the log line, given the interface's name
};

// The first option needs CAP_NET_ADMIN; the second is limited by net.core.rmem_max or wmem_max.
void set_buffer_size(int fd, int forced, int within_limits) {
    if (setsockopt(fd, SOL_SOCKET, forced, &SOCKET_BUFFER_BYTES, sizeof SOCKET_BUFFER_BYTES) != 0)
        (void)setsockopt(fd, SOL_SOCKET, within_limits, &SOCKET_BUFFER_BYTES, sizeof SOCKET_BUFFER_BYTES);
}

// Returns a non-blocking datagram socket with these options, or -1 with a line in the log and the errno in
// network_error.
template <size_t Count>
int open_datagram_socket(wccp_interface *interface, const char *open_failure,
                         const socket_option (&options)[Count]) {
    const int fd = socket(AF_INET, SOCK_DGRAM, 0);
    if (fd < 0) {
        interface->network_error = errno;
        QV_LOG(LC_LOG_ERR, open_failure, interface->name);
        return -1;
    }
    for (const socket_option &option : options) {
        if (setsockopt(fd, option.level, option.name, option.value, option.length) == 0)
            continue;
        interface->network_error = errno;
        QV_LOG(LC_LOG_ERR, option.failure, interface->name);
        close(fd);
        return -1;
    }
    set_buffer_size(fd, SO_RCVBUFFORCE, SO_RCVBUF);
    set_buffer_size(fd, SO_SNDBUFFORCE, SO_SNDBUF);
    // The engine lock is held while sending; a blocking socket could hold it up (wccp_packet_io.cpp).
    (void)fcntl(fd, F_SETFL, O_NONBLOCK);
    return fd;
}

int open_unicast_socket(wccp_interface *interface) {
    const int on = 1, no_discovery = IP_PMTUDISC_DONT; // messages may be fragmented
    const socket_option options[] = {
        {SOL_SOCKET, SO_REUSEADDR, &on, sizeof on, "WCCP: net init %s: Cannot set mcast socket option: %m"},
        {IPPROTO_IP, IP_MTU_DISCOVER, &no_discovery, sizeof no_discovery,
         "WCCP: net init %s Cannot disable path mtu discovery. %m"},
    };
    const int fd =
        open_datagram_socket(interface, "WCCP: net init %s: Fail to open ucast socket. %m", options);
    if (fd < 0)
        return 1;
    // A socket that cannot be bound stays open until the next set-up; only `ucast_bound` permits sending.
    const int result = bind_socket(fd, interface->ipa);
    if (result != 0) {
        interface->network_error = errno;
        QV_LOG(LC_LOG_ERR, "WCCP: net init: %s Cannot bind unicast UDP socket to %s:%d: %m", interface->name,
               addr_text(interface->ipa).s, WCCP_PORT);
    }
    wccp_set_descriptor(&interface->ucast_fd, fd);
    if (result != 0)
        return 1;
    interface->ucast_bound = 1;
    return 0;
}

int open_multicast_socket(wccp_interface *interface) {
    const int on = 1, no_discovery = IP_PMTUDISC_DONT;
    const uint8_t ttl = wccp_g.mcast_ttl, no_loop = 0;
    const socket_option options[] = {
        // Several interfaces may join the same group address, each with a socket of its own bound to it.
        {SOL_SOCKET, SO_REUSEADDR, &on, sizeof on, "WCCP: net init %s: Cannot set mc socket options. %m"},
        {IPPROTO_IP, IP_MULTICAST_TTL, &ttl, sizeof ttl, "WCCP: net init %s Cannot set mcast output TTL. %m"},
        {IPPROTO_IP, IP_MULTICAST_LOOP, &no_loop, sizeof no_loop,
         "WCCP: net init %s: Cannot disable mcast loopback. %m"},
        {IPPROTO_IP, IP_MTU_DISCOVER, &no_discovery, sizeof no_discovery,
         "WCCP: net init %s mcast cannot disable path mtu discovery. %m"},
    };
    const int fd = open_datagram_socket(interface, "WCCP: net init %s: Cannot open mc socket. %m", options);
    if (fd < 0)
        return 1;
    wccp_set_descriptor(&interface->mcast_fd, fd); // stays open even if the next step fails
    if (setsockopt(fd, IPPROTO_IP, IP_MULTICAST_IF, &interface->ipa, sizeof interface->ipa) != 0) {
        interface->network_error = errno;
        QV_LOG(LC_LOG_ERR, "WCCP: net init %s: Cannot set mcast output interface to: %s. %m", interface->name,
               addr_text(interface->ipa).s);
        return 1;
    }
    return 0;
}

int start_rx_thread(wccp_interface *interface) {
    if (interface->rx_thread) {
        QV_LOG(LC_LOG_INFO, "WCCP: net init %s: receive thread is running already", interface->name);
        return 0;
    }
    char name[32];
    snprintf(name, sizeof name, "WCCP_RX_%s", interface->name);
    cthread *thread = cthread_init(name, wccp_rx_thread_fn, interface, nullptr, nullptr, 0, 0, 0, 0);
    if (!thread || cthread_start(thread) != 0) {
        // The thread is not running: this only frees the context, if there is one.
        cthread_join(thread);
        QV_LOG(LC_LOG_ERR, "WCCP: net init %s Failed to spawn rx thread", interface->name);
        return 1;
    }
    interface->rx_thread = thread;
    return 0;
}

ifreq make_interface_request(const char *name) {
    ifreq request = {};
    strlcpy(request.ifr_name, name, sizeof request.ifr_name);
    request.ifr_addr.sa_family = AF_INET;
    return request;
}

} // namespace

void *wccp_rx_thread_fn(void *argument) {
    auto *interface = static_cast<wccp_interface *>(argument);
    if (!interface) {
        QV_LOG(LC_LOG_ERR, "WCCP: net init: launching RX thread failed. (bad interface)");
        return nullptr;
    }
    QV_LOG(LC_LOG_INFO, "WCCP: %s: receive thread is running", interface->name);
    for (;;) {
        wccp_pkt pkt = {};
        pkt.cursor = pkt.data;
        const int32_t received = wccp_rx_pkt(interface, &pkt, sizeof pkt.data);
        if (received < 1)
            continue;
        pkt.length = static_cast<uint32_t>(received);
        // A thread that is cancelled while it waits here ends before it touches the packet.
        const wccp_engine_lock lock;
        if (wccpd_shutdown_in_progress() == 1) // the thread ends when it is cancelled
            continue;
        const wccp_complaint_scope complaints(interface);
        wccp_process_received_packet(&pkt);
    }
}

int wccp_init_network_by_interface(wccp_interface *interface) {
    wccp_close_sockets(interface);
    interface->network_flaws = 0;
    interface->network_tried = wccp_g.seconds;
    // Without an address this is not a failure: the notification of the first one repeats the set-up.
    if (is_zero(interface->ipa)) {
        QV_LOG(LC_LOG_INFO, "WCCP: net init %s not bound (no IP address)", interface->name);
        return 0;
    }
    interface->device = wccp_get_device(interface->name);
    if (open_unicast_socket(interface) || open_multicast_socket(interface)) {
        interface->network_flaws |= WCCP_FLAW_SOCKETS;
        return 1;
    }
    // A failed join is noted and tried again. It does not stop the unicast groups of the interface.
    wccp_config_mcast(interface);
    QV_LOG(LC_LOG_INFO, "WCCP: net init %s: sockets of %s are open", interface->name,
           addr_text(interface->ipa).s);
    if (start_rx_thread(interface) == 0)
        return 0;
    interface->network_flaws |= WCCP_FLAW_SOCKETS;
    return 1;
}

bool wccp_retry_network(wccp_interface *interface) {
    if (interface->network_flaws == 0 || is_zero(interface->ipa))
        return false;
    if (interface->network_flaws & WCCP_FLAW_SOCKETS) {
        wccp_init_network_by_interface(interface);
    } else { // only joins have failed: keep the sockets
        interface->network_flaws = 0;
        interface->network_tried = wccp_g.seconds;
        wccp_config_mcast(interface);
    }
    if (interface->network_flaws != 0)
        return false;
    QV_LOG(LC_LOG_NOTICE, "WCCP: net init %s: socket set-up of %s succeeded after an earlier failure",
           interface->name, addr_text(interface->ipa).s);
    return true;
}

int wccp_join_mc_grp(wccp_interface *interface, be32 address) {
    if (interface->mcast_fd == -1 || is_zero(interface->ipa))
        return 1;
    if (!interface->mcast_bound) {
        if (bind_socket(interface->mcast_fd, address) != 0) {
            interface->network_error = errno;
            QV_LOG(LC_LOG_ERR, "WCCP: Interface %s: Cannot bind mcast UDP socket to %s:%d. %m",
                   interface->name, addr_text(address).s, WCCP_PORT);
            // The first send would bind this socket to a port of the kernel's choice; therefore a retry needs
            // a new one.
            interface->network_flaws |= WCCP_FLAW_SOCKETS;
            return 1;
        }
        interface->mcast_bound = 1;
        interface->mcast_bound_ipa = address;
    }
    ip_mreq membership = {};
    membership.imr_multiaddr.s_addr = raw_word(address);
    membership.imr_interface.s_addr = raw_word(interface->ipa);
    if (setsockopt(interface->mcast_fd, IPPROTO_IP, IP_ADD_MEMBERSHIP, &membership, sizeof membership) == 0) {
        // The kernel delivers only what is sent to the bound address.
        if (address != interface->mcast_bound_ipa)
            QV_LOG(LC_LOG_NOTICE,
                   "WCCP: Interface %s: the multicast socket is bound to %s, so datagrams sent to %s are not "
                   "received",
                   interface->name, addr_text(interface->mcast_bound_ipa).s, addr_text(address).s);
        return 0;
    }
    if (errno == EADDRINUSE) { // another group has the same address
        QV_LOG(LC_LOG_INFO, "WCCP: Interface %s: We've already subscribed to mcast group: %s",
               interface->name, addr_text(address).s);
        return 0;
    }
    interface->network_error = errno;
    QV_LOG(LC_LOG_ERR, "WCCP: Interface %s: Failed to join multicast group: %s, errno: %m", interface->name,
           addr_text(address).s);
    interface->network_flaws |= WCCP_FLAW_JOIN;
    return 1;
}

int wccp_config_mcast(wccp_interface *interface) {
    for (wccp_service_group *group = interface->groups; group; group = group->if_next)
        if (group->mcast_configured)
            wccp_join_mc_grp(interface, group->mcast_ipa);
    return 0;
}

namespace {

// The reason why the interface cannot carry its groups' packets. Causes come before their consequences.
wccp_reason_code find_network_fault(const wccp_interface *interface) {
    // The kernel is asked only about an interface that is not ready.
    if (!wccp_if_is_ready(interface) && wccp_get_device(interface->name) == 0)
        return WCCP_REASON_INTERFACE_MISSING;
    if (!(interface->ready_flags & WCCP_LINK_READY))
        return WCCP_REASON_INTERFACE_DOWN;
    if (!(interface->ready_flags & WCCP_IPA_READY))
        return WCCP_REASON_INTERFACE_NO_ADDRESS;
    if (interface->network_flaws & WCCP_FLAW_SOCKETS)
        return interface->network_error == EADDRINUSE ? WCCP_REASON_PORT_TAKEN : WCCP_REASON_SOCKET_FAILED;
    return interface->network_flaws & WCCP_FLAW_JOIN ? WCCP_REASON_JOIN_FAILED : WCCP_REASON_NONE;
}

} // namespace

void wccp_note_network(wccp_service_group *group) {
    static constexpr wccp_reason_code faults[] = {
        WCCP_REASON_INTERFACE_MISSING, WCCP_REASON_INTERFACE_DOWN, WCCP_REASON_INTERFACE_NO_ADDRESS,
        WCCP_REASON_PORT_TAKEN,        WCCP_REASON_SOCKET_FAILED,  WCCP_REASON_JOIN_FAILED,
    };
    const wccp_interface *interface = group->interfaces[0];
    const wccp_reason_code fault = interface ? find_network_fault(interface) : WCCP_REASON_NONE;
    for (const wccp_reason_code each : faults) // at most one of them is active
        if (each != fault)
            wccp_forget_reasons(group, each);
    if (fault == WCCP_REASON_NONE)
        return;
    // Only failed socket calls have an errno. The other faults occur while the interface is not ready.
    const char *error = wccp_if_is_ready(interface) ? strerrordesc_np(interface->network_error) : "";
    wccp_note_reason(group, fault, {}, wccp_reason_value("%s", error ? error : "unknown error"),
                     wccp_reason_value("%s", interface->name));
}

be32 wccp_get_address(const char *name) {
    ifreq request = make_interface_request(name);
    // Fails without a device, and with EADDRNOTAVAIL for a device without an address.
    if (ioctl(g_qvif_skfd, SIOCGIFADDR, &request) != 0)
        return {};
    // The union has a sockaddr; a copy reads it as sockaddr_in without breaking aliasing rules.
    sockaddr_in address;
    memcpy(&address, &request.ifr_addr, sizeof address);
    return from_raw_word(address.sin_addr.s_addr);
}

int32_t wccp_get_device(const char *name) {
    ifreq request = make_interface_request(name);
    return ioctl(g_qvif_skfd, SIOCGIFINDEX, &request) == 0 ? request.ifr_ifindex : 0;
}

uint32_t wccp_get_if_status(const char *name) {
    ifreq request = make_interface_request(name);
    if (ioctl(g_qvif_skfd, SIOCGIFFLAGS, &request) != 0) {
        QV_LOG(LC_LOG_WARNING, "WCCP: Failed to read link status %s (%m)", name);
        return 0;
    }
    // IFF_UP is what the administrator wants, IFF_RUNNING is what the driver reports about the link.
    const uint32_t both = IFF_UP | IFF_RUNNING;
    return (static_cast<uint32_t>(request.ifr_flags) & both) == both ? 1 : 0;
}
