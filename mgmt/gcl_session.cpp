// Client sessions: names and socket paths, making, connecting, closing and freeing sessions. Callers hold no
// lock; each operation takes both. While it connects, a session may wait for seconds with the locks held; no
// other thread knows the session by then.
//
// A session that could not connect keeps its registration in the interest list, without interest in reading
// or writing: removing it would call the close handler and thereby report the loss of a session that was
// never open. gcl_session_free removes it.
#include <cerrno>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include "mgmt/gcl_io.h"
#include "mgmt/gcl_records.h"
#include "runtime/logging.h"

constexpr size_t CLIENT_NAME_LIMIT = 20;
constexpr int CONNECT_ATTEMPTS = 6;
constexpr int CONNECT_DELAY_MS = 1500;

// --- Names

namespace {

lc_status check_client_name(const char *name) {
    // In the session's name a dash separates the client's name from the ids.
    if (name && strchr(name, '-')) {
        LC_LOG(LC_LOG_ERR, "Invalid character in client name: %s", name);
        return LC_GENERIC;
    }
    if (name && strlen(name) >= CLIENT_NAME_LIMIT) {
        LC_LOG(LC_LOG_ERR, "Client name too long: %s", name);
        return LC_GENERIC;
    }
    return LC_OK;
}

void set_local_name(gcl_session *session, const char *client_name) {
    const int pid = static_cast<int>(getpid());
    const int uid = static_cast<int>(geteuid());
    char *name = session->local_name;
    if (!client_name)
        snprintf(name, sizeof session->local_name, "UNKNOWN-%d.%d", uid, pid);
    else if (uid == 0)
        snprintf(name, sizeof session->local_name, "%s-%d", client_name, pid);
    else
        snprintf(name, sizeof session->local_name, "%s-%d.%d", client_name, uid, pid);
}

lc_status set_user(gcl_session *session) {
    for (const char *variable : {"LOGIN_USER", "LOGNAME", "USER"}) {
        owned_text value;
        CHECK_STATUS(lc_getenv_ts(variable, &value.pointer));
        if (value.pointer) {
            strlcpy(session->user, value.pointer, sizeof session->user);
            return LC_OK;
        }
    }
    snprintf(session->user, sizeof session->user, "%d-%d-%d", static_cast<int>(getpid()), session->uid,
             session->gid);
    return LC_OK;
}

} // namespace

void gcl_socket_path(const char *role, const char *name, char *out, size_t size) {
    if (lc_devel_is_production())
        snprintf(out, size, "%suds-%s-%s", GCL_SOCKET_DIRECTORY, role, name);
    else
        snprintf(out, size, "%suds-%s-UID-%d-%s", GCL_SOCKET_DIRECTORY, role, static_cast<int>(geteuid()),
                 name);
}

namespace {

void make_endpoint(gcl_endpoint *endpoint, const char *role, const char *name) {
    char path[256];
    gcl_socket_path(role, name, path, sizeof path);
    strlcpy(endpoint->path, path, sizeof endpoint->path);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    strlcpy(address.sun_path, path, sizeof address.sun_path);
    memcpy(&endpoint->address, &address, sizeof address);
    // The family, the path and its NUL.
    endpoint->length = static_cast<socklen_t>(strlen(address.sun_path) + 3);
}

lc_status copy_endpoint(gcl_endpoint *endpoint, const sockaddr *address, socklen_t length) {
    CHECK_CONDITION(length >= sizeof(sa_family_t) && length <= sizeof endpoint->address);
    *endpoint = {};
    memcpy(&endpoint->address, address, length);
    endpoint->length = length;
    if (endpoint->address.ss_family == AF_UNIX && length > offsetof(sockaddr_un, sun_path)) {
        // The path of a sockaddr_un need not end with a NUL. An abstract name, which begins with one, gives
        // an empty path and nothing to remove.
        const size_t room = length - offsetof(sockaddr_un, sun_path);
        const char *path =
            reinterpret_cast<const char *>(&endpoint->address) + offsetof(sockaddr_un, sun_path);
        memcpy(endpoint->path, path, strnlen(path, room < sizeof endpoint->path ? room : 107));
    }
    return LC_OK;
}

void endpoint_text(const gcl_endpoint *endpoint, char *out, size_t size) {
    strlcpy(out, endpoint->path, size);
    if (endpoint->address.ss_family != AF_INET)
        return;
    sockaddr_in address;
    memcpy(&address, &endpoint->address, sizeof address);
    const auto *bytes = reinterpret_cast<const uint8_t *>(&address.sin_addr);
    snprintf(out, size, "%d.%d.%d.%d:%d", bytes[0], bytes[1], bytes[2], bytes[3], ntohs(address.sin_port));
}

// --- Creation

lc_status open_unix(gcl_session *session) {
    // The socket is bound to a path of its own, which is how the provider sees who is connected.
    const char *path = session->local.path;
    // The first client of any user creates the directory. With the sticky bit nobody can remove another
    // user's socket.
    if (mkdir(GCL_SOCKET_DIRECTORY, 0700) == 0)
        (void)chmod(GCL_SOCKET_DIRECTORY, 01777);
    // The file of an earlier process with the same id would make bind() fail.
    (void)unlink(path);
    if (bind(session->fd, reinterpret_cast<const sockaddr *>(&session->local.address),
             session->local.length) != 0) {
        LC_LOG(LC_LOG_ERR, "bind: %m");
        return LC_GENERIC;
    }
    (void)chmod(path, 0777);
    return LC_OK;
}

lc_status open_inet(gcl_session *session) {
    // A program that runs with the ids of another user is refused: over TCP the provider can't verify ids.
    if (geteuid() != 0 && (getuid() != geteuid() || getgid() != getegid())) {
        LC_LOG(LC_LOG_ERR, "Bad uid/gid for INET client connection");
        return LC_GENERIC;
    }
    const struct {
        int level, option, value;
        const char *name;
    } options[] = {
        {SOL_SOCKET, SO_REUSEADDR, 1, "SO_REUSEADDR"},
        {IPPROTO_TCP, TCP_NODELAY, 1, "TCP_NODELAY"},
        {SOL_SOCKET, SO_KEEPALIVE, 1, "SO_KEEPALIVE"},
        {IPPROTO_TCP, TCP_KEEPIDLE, 60, "TCP_KEEPIDLE"},
    };
    for (const auto &row : options) {
        if (setsockopt(session->fd, row.level, row.option, &row.value, sizeof row.value) != 0) {
            LC_LOG(LC_LOG_ERR, "setsockopt %s: %m", row.name);
            return LC_GENERIC;
        }
    }
    return LC_OK;
}

lc_status open_session_socket(gcl_session *session) {
    session->family = session->local.address.ss_family;
    if (session->family != AF_UNIX && session->family != AF_INET) {
        LC_LOG(LC_LOG_ERR, "Unknown af %d", session->family);
        return LC_GENERIC;
    }
    session->fd = socket(session->family, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    CHECK_CONDITION(session->fd >= 0);
    if (session->family == AF_UNIX)
        CHECK_STATUS(open_unix(session));
    else
        CHECK_STATUS(open_inet(session));
    return LC_OK;
}

gcl_session_hook hook_of(const gcl_body_protocol *protocol, gcl_hook_kind kind) {
    switch (kind) {
    case GCL_HOOK_NEW:
        return protocol->session_new;
    case GCL_HOOK_FREE:
        return protocol->session_free;
    case GCL_HOOK_ESTABLISHED:
        return protocol->connection_established;
    case GCL_HOOK_CLOSED:
        return protocol->connection_closed;
    }
    return nullptr;
}

} // namespace

lc_status gcl_run_hooks(gcl_session *session, gcl_hook_kind kind) {
    for (gcl_body_protocol *protocol : session->instance->protocols) {
        const gcl_session_hook hook = protocol ? hook_of(protocol, kind) : nullptr;
        if (hook)
            CHECK_STATUS(hook(session, protocol));
    }
    return LC_OK;
}

namespace {

void *interest_argument(uintptr_t kind) {
    return reinterpret_cast<void *>(kind);
}

lc_status set_up_session(gcl_session *session, const char *client_name, const sockaddr *address,
                         socklen_t length) {
    gcl *instance = session->instance;
    // Created first, since gcl_session_free takes it.
    CHECK_CONDITION(lc_lock_init(&session->lock, 1) == 0);
    session->uid = static_cast<int32_t>(geteuid());
    session->gid = static_cast<int32_t>(getegid());
    set_local_name(session, client_name);
    CHECK_STATUS(set_user(session));
    CHECK_STATUS(tb_new_size(&session->read_buffer, GCL_READ_BUFFER_BYTES));
    if (address)
        CHECK_STATUS(copy_endpoint(&session->local, address, length));
    else
        make_endpoint(&session->local, "client", session->local_name);
    CHECK_STATUS(open_session_socket(session));
    CHECK_STATUS(gcl_run_hooks(session, GCL_HOOK_NEW));
    // Appended, so that gcl_shutdown closes sessions in the order in which they were made.
    gcl_session **link = &instance->sessions;
    while (*link)
        link = &(*link)->next;
    *link = session;
    CHECK_STATUS(fdic_event_add_fd(instance->interests, session->fd, 1, 0, session,
                                   gcl_session_fd_read_write_timeout_activity, interest_argument(1),
                                   gcl_session_fd_read_write_timeout_activity, interest_argument(2),
                                   &session->fd_interest));
    return LC_OK;
}

} // namespace

lc_status gcl_session_client_new(gcl *instance, const char *client_name, const sockaddr *address,
                                 socklen_t length, gcl_session **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(instance);
    CHECK_QUIET(check_client_name(client_name));
    // The new session has no lock yet; until it has one, the instance's lock is enough.
    const cancel_off_guard cancel_off;
    const lc_lock_guard guard(instance->lock);
    auto *session = static_cast<gcl_session *>(calloc(1, sizeof(gcl_session)));
    CHECK_NULL(session);
    session->instance = instance;
    session->id = instance->next_session_id++;
    session->fd = session->fd_interest = session->rate_timer = -1;
    session->state = GCL_SESSION_INITIALIZED;
    session->sequence = GCL_SEQUENCE_CLIENT;
    const lc_status status = set_up_session(session, client_name, address, length);
    if (status != LC_OK) {
        // Nobody knows the session yet: it is freed without gcl_session_close and its log lines.
        if (session->fd >= 0)
            close(session->fd);
        if (session->fd >= 0 && session->local.path[0])
            (void)unlink(session->local.path);
        session->fd = -1;
        session->state = GCL_SESSION_CLOSED;
        (void)gcl_session_free(&session);
    }
    CHECK_STATUS(status);
    *out = session;
    return LC_OK;
}

// --- Connecting

namespace {

// Closes a session that could not connect.
void abandon_connection(gcl_session *session) {
    if (session->fd_interest >= 0)
        // Before the descriptor is closed, since its number may be reused at once.
        LOG_STATUS(fdic_event_update_fd(session->instance->interests, session->fd_interest, 0, 0));
    close(session->fd);
    session->fd = -1;
    session->state = GCL_SESSION_CLOSED;
    if (session->family == AF_UNIX && session->local.path[0])
        (void)unlink(session->local.path);
    session->peer = {};
}

lc_status try_connect(gcl_session *session, int attempts) {
    // EISCONN: an earlier attempt on the non-blocking socket has succeeded meanwhile.
    for (;;) {
        attempts--;
        if (connect(session->fd, reinterpret_cast<const sockaddr *>(&session->peer.address),
                    session->peer.length) == 0 ||
            errno == EISCONN)
            return LC_OK;
        // The line that is logged below must show this error, not one of a later call.
        const int failure = errno;
        // There is no socket file, or nobody listens on it: the provider isn't running, or is just starting.
        const bool absent = failure == ECONNREFUSED || failure == ENOENT;
        const bool passing = absent || failure == EALREADY || failure == EINPROGRESS;
        if (passing && attempts > 0) {
            LC_LOG(LC_LOG_INFO, "Could not connect to provider; delaying and retrying.");
            (void)poll(nullptr, 0, CONNECT_DELAY_MS);
            if (gcl_end_is_pending(session->instance))
                return LC_CANCELLED;
            continue;
        }
        if (absent) {
            LC_LOG(LC_LOG_WARNING, "Failed to connect to provider.");
            return LC_IO_ERROR;
        }
        errno = failure;
        LC_LOG(LC_LOG_ERR, "connect: %m");
        return LC_ASSERTION;
    }
}

} // namespace

lc_status gcl_session_client_connect_by_sockaddr(gcl_session *session, const sockaddr *address,
                                                 socklen_t length, int retry) {
    CHECK_NULL(session);
    CHECK_NULL(address);
    const gcl_session_guard guard(session);
    if (session->state != GCL_SESSION_INITIALIZED) {
        LC_LOG(LC_LOG_ERR, "session %d: client called to connect in invalid state: %d (%s)", session->id,
               session->state, lc_enum_to_string_quiet(gcl_session_state_table, session->state));
        return LC_GENERIC;
    }
    CHECK_STATUS(copy_endpoint(&session->peer, address, length));
    const lc_status status = try_connect(session, retry ? CONNECT_ATTEMPTS : 1);
    if (status != LC_OK) {
        // try_connect has logged the reason, unless the process is ending.
        abandon_connection(session);
        return status;
    }
    session->state = GCL_SESSION_CONNECTED;
    char text[128];
    endpoint_text(&session->peer, text, sizeof text);
    LC_LOG(session->family == AF_INET ? LC_LOG_WARNING : LC_LOG_DEBUG, "session %d: connected to %s",
           session->id, text);
    CHECK_STATUS(gcl_run_hooks(session, GCL_HOOK_ESTABLISHED));
    return LC_OK;
}

lc_status gcl_session_client_connect_by_provider(gcl_session *session, const char *provider_name, int retry) {
    CHECK_NULL(session);
    CHECK_NULL(provider_name);
    gcl_endpoint peer{};
    make_endpoint(&peer, "provider", provider_name);
    const lc_status status = gcl_session_client_connect_by_sockaddr(
        session, reinterpret_cast<const sockaddr *>(&peer.address), peer.length, retry);
    if (status == LC_IO_ERROR || status == LC_IO_CLOSED)
        CHECK_QUIET(status);
    CHECK_STATUS(status);
    return LC_OK;
}

// --- Closing

namespace {

void drop_interests(gcl_session *session) {
    fdic *interests = session->instance->interests;
    const int32_t timer = session->rate_timer, descriptor = session->fd_interest;
    session->rate_timer = session->fd_interest = -1;
    if (timer >= 0)
        LOG_STATUS(fdic_event_delete_timer(interests, timer));
    if (descriptor >= 0) // last, since it calls the close handler
        LOG_STATUS(fdic_event_delete_fd(interests, descriptor));
}

} // namespace

lc_status gcl_session_close(gcl_session *session, int flush) {
    CHECK_NULL(session);
    const gcl_session_guard guard(session);
    if (session->state == GCL_SESSION_CLOSED)
        return LC_OK;
    const bool connected = session->state == GCL_SESSION_CONNECTED;
    if (connected && flush && session->queue_head)
        LOG_STATUS(gcl_run_output_queue(session));
    if (session->state == GCL_SESSION_CLOSED)
        return LC_OK; // the flush has found the peer closed
    if (session->queue_head)
        LC_LOG(LC_LOG_WARNING, "session %d: closed with output queue", session->id);
    if (connected)
        LOG_STATUS(gcl_run_hooks(session, GCL_HOOK_CLOSED));
    // The state and the descriptor are changed before the interests are removed: the close handler must find
    // the session closed, and may free it.
    close(session->fd);
    session->fd = -1;
    session->state = GCL_SESSION_CLOSED;
    // A provider's path belongs to its listening socket.
    if (session->family == AF_UNIX && !session->provider && session->local.path[0])
        (void)unlink(session->local.path);
    session->want_write = 0;
    drop_interests(session);
    return LC_OK;
}

namespace {

void unlink_session(gcl_session *session) {
    for (gcl_session **link = &session->instance->sessions; *link; link = &(*link)->next) {
        if (*link == session) {
            *link = session->next;
            break;
        }
    }
}

} // namespace

lc_status gcl_session_free(gcl_session **inout) {
    CHECK_NULL(inout);
    gcl_session *session = *inout;
    *inout = nullptr;
    if (!session)
        return LC_OK;
    // The creation of its lock failed; nothing else was created.
    if (!session->lock) {
        free(session);
        return LC_OK;
    }
    const gcl_session_guard guard(session);
    // Out of the list first: a close handler that is called below must not find the session there.
    unlink_session(session);
    LOG_STATUS(gcl_run_hooks(session, GCL_HOOK_FREE));
    for (uint16_t protocol = 0; protocol < GCL_PROTOCOLS_MAX; protocol++)
        if (session->protocol_state[protocol])
            LC_LOG(LC_LOG_WARNING, "session %d: bp state not null for %d", session->id, protocol);
    if (session->state != GCL_SESSION_CLOSED) {
        LC_LOG(LC_LOG_WARNING, "session %d: free was called without close", session->id);
        LOG_STATUS(gcl_session_close(session, 0));
    }
    drop_interests(session);
    gcl_free_queue(session);
    tb_free(&session->read_buffer);
    // The record stays with the instance: another thread may be waiting for its lock.
    session->next = session->instance->freed;
    session->instance->freed = session;
    return LC_OK;
}

void gcl_forget_record(gcl_session *session) {
    lc_lock_deinit(&session->lock);
    free(session);
}

// --- State

lc_status gcl_session_get_state(gcl_session *session, int32_t *out_state, int32_t *out_admin_state) {
    CHECK_NULL(session);
    const gcl_session_guard guard(session);
    if (out_state)
        *out_state = session->state;
    const gcl_admin *admin = gcl_admin_of(session);
    if (out_admin_state)
        *out_admin_state = admin ? admin->state : 0;
    return LC_OK;
}

lc_status gcl_session_get_session_names(gcl_session *session, const char **out_local_name,
                                        const char **out_peer_name) {
    CHECK_NULL(session);
    const gcl_session_guard guard(session);
    const gcl_admin *admin = gcl_admin_of(session);
    if (out_local_name)
        *out_local_name = session->local_name;
    if (out_peer_name)
        *out_peer_name = admin ? admin->peer_name : "";
    return LC_OK;
}
