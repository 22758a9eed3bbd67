// Requests to the kernel's tables of interfaces, routes and rules, over one socket that stays open. Results
// are 0 or the kernel's errno. Not for more than one thread.
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

// A request of this type (RTM_...) with its fixed header; NLM_F_REQUEST is added to the flags. Attributes
// are put in by the caller, of no more than a kilobyte altogether.
netlink_message make_netlink_message(int type, int flags, const void *header, size_t header_length);

// Sends a change and waits for its result.
int change_kernel(nl_msg *message);
// Sends a query (NLM_F_DUMP for a whole table, NLM_F_ACK for one object) and gives each answer to `each`,
// which must not send. A table that changes meanwhile is read again, after `restart`.
int query_kernel(nl_msg *message, const std::function<void(nlmsghdr *answer)> &each,
                 const std::function<void()> &restart);
