// libqvcommondyn.so, our stand-in for the platform's closed library: all but the notifications, which are in
// qvcommon_netlink.cpp.
//
// Only the names in qvcommon.h are exported (qvcommon.map). The notification thread runs until the process
// has ended, also while exit() runs destructors. Therefore nothing in these two files has a constructor or a
// destructor, and nothing of the C++ library is used that does.

#include "platform/qvcommon.h"

#include <arpa/inet.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>

#include "platform/qvcommon_netlink.h"
#include "platform/qvcommon_transport.h"

// Null if the program doesn't define it.
#pragma weak qv_state_event_transport

int32_t g_qvif_skfd = -1;

namespace {

std::atomic<int> events_without_transport;

} // namespace

void qvif_network_init_sockets() {
    // The builtins, because the exported variable is a plain integer.
    if (__atomic_load_n(&g_qvif_skfd, __ATOMIC_ACQUIRE) >= 0)
        return;
    const int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    int32_t expected = -1;
    if (fd >= 0 &&
        !__atomic_compare_exchange_n(&g_qvif_skfd, &expected, fd, false, __ATOMIC_ACQ_REL, __ATOMIC_ACQUIRE))
        close(fd); // another thread was first
}

int qv_register_netlink_notifier(uint32_t kind, qv_netlink_callback callback) {
    return qv_netlink_register(kind, callback);
}

int qv_start_netlink_monitor(uint32_t kind) {
    return qv_netlink_start(kind);
}

// 0 if the program accepted the event, else the negative number of events that it has not accepted so far.
int qv_state_event_send(uint32_t one, const char *group_id, uint32_t role, const uint8_t *code,
                        struct gcl_session *session) {
    if (qv_state_event_transport && qv_state_event_transport(one, group_id, role, code, session) == 0)
        return 0;
    return -1 - events_without_transport.fetch_add(1, std::memory_order_relaxed);
}

char *get_addr_str(int family, be32 address, int, char *buffer, size_t size) {
    // The family is the version number of the protocol, not an AF_ constant.
    if (buffer && size > 0 &&
        (family != 4 || !inet_ntop(AF_INET, &address, buffer, static_cast<socklen_t>(size))))
        buffer[0] = '\0';
    return buffer;
}
