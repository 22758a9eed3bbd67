#include "peers/tunneld/netlink.h"

#include <linux/rtnetlink.h>
#include <netlink/netlink.h>
#include <netlink/socket.h>
#include <sys/socket.h>

#include <cerrno>
#include <new>

namespace {

constexpr int QUERY_TRIES = 5;

struct socket_release {
    void operator()(nl_sock *socket) const { nl_socket_free(socket); }
};
std::unique_ptr<nl_sock, socket_release> kernel;

// The socket, opened if necessary. It is closed after a request that was not answered, since that answer
// could still come and be taken for the next request's.
nl_sock *open_kernel_socket() {
    if (kernel)
        return kernel.get();
    kernel.reset(nl_socket_alloc());
    if (!kernel)
        throw std::bad_alloc();
    if (nl_connect(kernel.get(), NETLINK_ROUTE) < 0) {
        kernel.reset();
        return nullptr;
    }
    // Requests ask for an acknowledgement where they need one.
    nl_socket_disable_auto_ack(kernel.get());
    // The kernel then filters dumps by the request's header. An old kernel ignores it and sends everything.
    const int on = 1;
    setsockopt(nl_socket_get_fd(kernel.get()), SOL_NETLINK, NETLINK_GET_STRICT_CHK, &on, sizeof on);
    return kernel.get();
}

struct exchange {
    const std::function<void(nlmsghdr *)> *each;
    bool done = false;
    int error = 0;
};

int take_error_answer(sockaddr_nl *, nlmsgerr *message, void *context) {
    auto *state = static_cast<exchange *>(context);
    state->done = true;
    state->error = -message->error;
    return NL_STOP;
}

int take_last_answer(nl_msg *, void *context) {
    static_cast<exchange *>(context)->done = true;
    return NL_STOP;
}

int take_one_answer(nl_msg *message, void *context) {
    auto *state = static_cast<exchange *>(context);
    if (state->each)
        (*state->each)(nlmsg_hdr(message));
    return NL_OK;
}

struct callbacks_release {
    void operator()(nl_cb *callbacks) const { nl_cb_put(callbacks); }
};

// Sends a request and reads all of its answer. EINTR: the table has changed during the dump.
int exchange_messages(nl_msg *message, const std::function<void(nlmsghdr *)> *each) {
    nl_sock *socket = open_kernel_socket();
    if (!socket)
        return errno ? errno : EIO;
    const std::unique_ptr<nl_cb, callbacks_release> callbacks(nl_cb_alloc(NL_CB_DEFAULT));
    if (!callbacks)
        throw std::bad_alloc();
    exchange state;
    state.each = each;
    // A change ends with an acknowledgement, a dump with its last message, and either can end with an error.
    nl_cb_err(callbacks.get(), NL_CB_CUSTOM, take_error_answer, &state);
    nl_cb_set(callbacks.get(), NL_CB_FINISH, NL_CB_CUSTOM, take_last_answer, &state);
    nl_cb_set(callbacks.get(), NL_CB_ACK, NL_CB_CUSTOM, take_last_answer, &state);
    nl_cb_set(callbacks.get(), NL_CB_VALID, NL_CB_CUSTOM, take_one_answer, &state);
    nlmsg_hdr(message)->nlmsg_seq = NL_AUTO_SEQ; // otherwise a second try would have the first one's number
    if (nl_send_auto(socket, message) < 0) {
        const int error = errno;
        kernel.reset();
        return error ? error : EIO;
    }
    while (!state.done) {
        const int result = nl_recvmsgs(socket, callbacks.get());
        if (result == -NLE_DUMP_INTR)
            state.error = EINTR; // the rest of the dump still has to be read
        else if (result < 0 && !state.done) {
            kernel.reset();
            return EIO;
        }
    }
    return state.error;
}

} // namespace

netlink_message make_netlink_message(int type, int flags, const void *header, size_t header_length) {
    netlink_message message(nlmsg_alloc_simple(type, NLM_F_REQUEST | flags));
    if (!message || nlmsg_append(message.get(), const_cast<void *>(header), header_length, NLMSG_ALIGNTO) < 0)
        throw std::bad_alloc();
    return message;
}

int change_kernel(nl_msg *message) {
    nlmsg_hdr(message)->nlmsg_flags |= NLM_F_ACK;
    return exchange_messages(message, nullptr);
}

int query_kernel(nl_msg *message, const std::function<void(nlmsghdr *)> &each,
                 const std::function<void()> &restart) {
    int error = EINTR;
    // On a busy host the table can change during every dump: the last attempt's error is returned.
    for (int i = 0; i < QUERY_TRIES && error == EINTR; i++) {
        restart();
        error = exchange_messages(message, &each);
    }
    return error;
}

uint32_t read_netlink_u32(const nlattr *attribute, uint32_t missing) {
    return attribute && nla_len(attribute) >= 4 ? nla_get_u32(attribute) : missing;
}

void close_kernel_socket() {
    kernel.reset();
}
