// libqvcommondyn.so, the platform's closed library: interface socket, link and address notifications, address
// text, state events. The daemon relies on nothing but what is declared here, so that another library of that
// name can replace ours.
#pragma once

#include <cstddef>
#include <cstdint>

#include "runtime/byte_order.h"

struct gcl_session;

extern "C" {
// Negative until qvif_network_init_sockets, then a datagram socket of family AF_INET for interface ioctls.
extern int32_t g_qvif_skfd;
void qvif_network_init_sockets(void);

enum : uint32_t { QV_NOTIFY_LINK_STATE = 0, QV_NOTIFY_IPA_CHANGE = 1 };
struct qv_if_state_info { // what the callback of QV_NOTIFY_LINK_STATE is given
    char name[16];
    uint32_t admin_up;
    uint32_t link_up;
};
// QV_NOTIFY_LINK_STATE gives a qv_if_state_info, QV_NOTIFY_IPA_CHANGE the interface's name as a string.
typedef void (*qv_netlink_callback)(const void *argument);
int qv_register_netlink_notifier(uint32_t kind, qv_netlink_callback callback); // 0 on success
// From here on the callback runs for every event of the kind, on the library's own thread.
int qv_start_netlink_monitor(uint32_t kind); // 0 on success

int qv_state_event_send(uint32_t one, const char *group_id, uint32_t role, const uint8_t *code,
                        struct gcl_session *session);

// (4, address, 0, buffer, 46): the address as dotted text in the buffer, which is returned.
char *get_addr_str(int family, be32 address, int flags, char *buffer, size_t size);
}
