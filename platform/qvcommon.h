// libqvcommondyn.so, the platform's closed library: the socket for interface ioctls, notifications of link
// and address changes, addresses as text, state events. wccpd relies only on what is declared here, so that
// the platform's library can replace ours under the same name. Any thread may call these functions.
#pragma once

#include <cstddef>
#include <cstdint>

#include "runtime/byte_order.h"

struct gcl_session;

extern "C" {
// -1 until qvif_network_init_sockets is called, then an AF_INET datagram socket for interface ioctls.
extern int32_t g_qvif_skfd;
void qvif_network_init_sockets(void);

enum : uint32_t { QV_NOTIFY_LINK_STATE = 0, QV_NOTIFY_IPA_CHANGE = 1 };
struct qv_if_state_info {
    char name[16];     // NUL-terminated
    uint32_t admin_up; // 1: IFF_UP
    uint32_t link_up;  // 1: IFF_RUNNING
};
// The argument is a qv_if_state_info for QV_NOTIFY_LINK_STATE, and the name of the interface, a string, for
// QV_NOTIFY_IPA_CHANGE. It is valid only during the call.
typedef void (*qv_netlink_callback)(const void *argument);
// Both return 0 or an errno. From the start on the callback is called for every event of its kind, and first
// for every interface that exists, on the library's own thread, which holds no lock of ours.
int qv_register_netlink_notifier(uint32_t kind, qv_netlink_callback callback);
int qv_start_netlink_monitor(uint32_t kind);

// Sends the role of a group; `one` is 1, and `code` points to a byte of 237. The result is only for tests.
int qv_state_event_send(uint32_t one, const char *group_id, uint32_t role, const uint8_t *code,
                        struct gcl_session *session);

// Writes an IPv4 address as dotted decimal text to the buffer, and returns the buffer: get_addr_str(4,
// address, 0, buffer, 46). An empty text if it doesn't fit or the family isn't 4.
char *get_addr_str(int family, be32 address, int flags, char *buffer, size_t size);
}
