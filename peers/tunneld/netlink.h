// Requests about the kernel's interfaces, routes and rules, over one socket that stays open. Results are 0 or
// the kernel's errno. To be used by one thread only.
#pragma once

#include <netlink/attr.h>
#include <netlink/msg.h>

#include <functional>
#include <memory>
#include <string>

struct netlink_message_release {
    void operator()(nl_msg *message) const { nlmsg_free(message); }
};
using netlink_message = std::unique_ptr<nl_msg, netlink_message_release>;

// A request of this type (RTM_...) with its fixed header; NLM_F_REQUEST is added to the flags. The caller
// adds attributes of at most one kilobyte in total. Throws std::bad_alloc.
netlink_message make_netlink_message(int type, int flags, const void *header, size_t header_length);

// Sends a change and waits for its result.
int change_kernel(nl_msg *message);
// Sends a query (NLM_F_DUMP for a whole table, NLM_F_ACK for one object) and calls `each` with each answer;
// `each` must not send requests. Calls `restart` before the first answer, and again when the table has
// changed while it was read and is read again.
int query_kernel(nl_msg *message, const std::function<void(nlmsghdr *answer)> &each,
                 const std::function<void()> &restart);

// The value of an attribute of 32 bits in the byte order that it has there, or `missing` when the attribute
// is absent or shorter.
uint32_t read_netlink_u32(const nlattr *attribute, uint32_t missing = 0);

// Closes the socket, which the next request opens again. For a process that changes its network namespace, or
// that was forked and must not share the socket.
void close_kernel_socket();
