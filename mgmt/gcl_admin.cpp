// Body protocol 1, "admin": the handshake that opens a session, and services, on the client side. The frame
// reader calls its handlers, with both locks held.
//
// The provider sends a greeting; the client answers with a greeting response, then asks for a service with
// open service, which the provider answers. A client trusts a provider on a Unix socket only if the process
// that listens on it belongs to root or to its own user, and if the ids in the greeting, if any, are those of
// the owner of the socket file. Otherwise the client closes the session.
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <sys/socket.h>
#include <unistd.h>

#include "mgmt/gcl_io.h"
#include "mgmt/gcl_records.h"
#include "runtime/logging.h"

namespace {

template <size_t Size>
void fill_text_field(char (&field)[Size], const char *text) {
    memset(field, 0, Size);
    memcpy(field, text, strnlen(text, Size - 1));
}
void copy_text_field(char (&text)[33], const char (&field)[32]) {
    memcpy(text, field, sizeof field);
    text[sizeof field] = 0;
}

// Copies the body of a frame. LC_ASSERTION if it is shorter than the layout.
template <typename Layout>
lc_status copy_body(const tbuffer *frame, Layout *out) {
    CHECK_CONDITION(tb_length(frame) >= static_cast<int32_t>(GCL_HEADER_BYTES + sizeof(Layout)));
    memcpy(out, tb_buf(frame) + GCL_HEADER_BYTES, sizeof(Layout));
    return LC_OK;
}

lc_status admin_session_new(gcl_session *session, gcl_body_protocol *) {
    auto *admin = static_cast<gcl_admin *>(calloc(1, sizeof(gcl_admin)));
    CHECK_NULL(admin);
    // The state stays 0 until the session is connected.
    admin->uid = session->uid;
    admin->gid = session->gid;
    memcpy(admin->user, session->user, sizeof admin->user);
    session->protocol_state[GCL_PROTO_ADMIN] = admin;
    return LC_OK;
}

lc_status admin_session_free(gcl_session *session, gcl_body_protocol *) {
    free(session->protocol_state[GCL_PROTO_ADMIN]);
    session->protocol_state[GCL_PROTO_ADMIN] = nullptr;
    return LC_OK;
}

lc_status admin_established(gcl_session *session, gcl_body_protocol *) {
    gcl_admin *admin = gcl_admin_of(session);
    CHECK_NULL(admin);
    admin->state = GCL_ADMIN_GREETING_AWAITED;
    LC_LOG(LC_LOG_DEBUG, "session %d: proto admin: established connection", session->id);
    return LC_OK;
}

lc_status admin_query_state(gcl_session *session, gcl_body_protocol *, int32_t *out_state) {
    const gcl_admin *admin = gcl_admin_of(session);
    CHECK_NULL(admin);
    *out_state = admin->state;
    return LC_OK;
}

lc_status send_greeting_response(gcl_session *session, const gcl_admin *admin) {
    gcl *instance = session->instance;
    gcl_wire_greeting_response body{};
    body.version = to_be16(GCL_ADMIN_VERSION);
    // The counter continues over all sessions of the instance.
    body.message_id = to_be32(instance->admin_message_id++);
    body.second_counter = to_be32(instance->admin_second_counter++);
    fill_text_field(body.name, session->local_name);
    body.uid = to_be32(static_cast<uint32_t>(admin->uid));
    body.gid = to_be32(static_cast<uint32_t>(admin->gid));
    fill_text_field(body.user, admin->user);
    body.flags = to_be32(admin->flags);
    CHECK_STATUS(gcl_session_send_frame_components(session, GCL_PROTO_ADMIN, GCL_ADMIN_GREETING_RESPONSE,
                                                   sizeof body, &body));
    return LC_OK;
}

bool log_bad_ids(const gcl_session *session, int32_t uid, int32_t gid, uid_t wanted_uid, gid_t wanted_gid) {
    char uid_text[16], gid_text[16];
    snprintf(uid_text, sizeof uid_text, "%d", static_cast<int>(wanted_uid));
    snprintf(gid_text, sizeof gid_text, "%d", static_cast<int>(wanted_gid));
    LC_LOG(LC_LOG_ERR, "session %d: proto admin: bad uid / gid in greeting: %d/%d not %s/%s", session->id,
           uid, gid, uid_text, gid_text);
    return false;
}

// Every user can create a socket with the provider's name, since the directory is writable for all, and send
// any ids in a greeting. The user id of the listening process comes from the kernel.
bool listener_is_trusted(const gcl_session *session) {
    ucred listener{};
    socklen_t length = sizeof listener;
    // On the connecting side these are the ids that the peer had when it called listen().
    if (getsockopt(session->fd, SOL_SOCKET, SO_PEERCRED, &listener, &length) != 0) {
        LC_LOG(LC_LOG_ERR, "getsockopt SO_PEERCRED: %m");
        return false;
    }
    if (listener.uid == 0 || listener.uid == geteuid())
        return true;
    LC_LOG(LC_LOG_ERR, "session %d: proto admin: the provider runs as user %d, not as root or our own user",
           session->id, static_cast<int>(listener.uid));
    return false;
}

// Checks the peer by the ids in its greeting. Without ids (-1 and -1) it gets those of this process;
// otherwise they must be those of the owner of its socket file, or of this process if it has no file.
bool peer_is_trusted(const gcl_session *session, int32_t *inout_uid, int32_t *inout_gid) {
    const int32_t uid = *inout_uid, gid = *inout_gid;
    if (session->family != AF_UNIX && session->family != AF_INET) {
        LC_LOG(LC_LOG_DEBUG, "session %d: unknown af: %d", session->id, session->family);
        return false;
    }
    if (session->family == AF_UNIX && !listener_is_trusted(session))
        return false;
    if (uid == -1 && gid == -1) {
        *inout_uid = static_cast<int32_t>(geteuid());
        *inout_gid = static_cast<int32_t>(getegid());
        return true;
    }
    if (uid == -1 || gid == -1) {
        LC_LOG(LC_LOG_ERR, "session %d: proto admin: bad uid / gid in greeting: %d/%d", session->id, uid,
               gid);
        return false;
    }
    // Nothing on a TCP connection proves the ids.
    if (session->family != AF_UNIX)
        return true;
    uid_t wanted_uid = geteuid();
    gid_t wanted_gid = getegid();
    if (session->peer.path[0]) {
        // Ids that match nobody's, in case the owner can't be determined.
        wanted_uid = static_cast<uid_t>(-1);
        wanted_gid = static_cast<gid_t>(-1);
        LOG_STATUS(lf_get_file_owner(session->peer.path, &wanted_uid, &wanted_gid));
    }
    if (static_cast<uid_t>(uid) != wanted_uid || static_cast<gid_t>(gid) != wanted_gid)
        return log_bad_ids(session, uid, gid, wanted_uid, wanted_gid);
    return true;
}

lc_status refuse_peer(gcl_session *session) {
    LC_LOG(LC_LOG_INFO, "session %d: session terminated by client", session->id);
    CHECK_STATUS(gcl_session_close(session, 0));
    return LC_OK;
}

lc_status receive_greeting(gcl_session *session, gcl_body_protocol *, tbuffer **frame, void *) {
    const gcl_owned_buffer taken(*frame);
    *frame = nullptr;
    gcl_wire_greeting body{};
    CHECK_STATUS(copy_body(taken.pointer, &body));
    gcl_admin *admin = gcl_admin_of(session);
    CHECK_NULL(admin);
    if (to_host(body.version) != GCL_ADMIN_VERSION) {
        LC_LOG(LC_LOG_ERR, "session %d: proto admin: bad version in greeting: %d not %d", session->id,
               to_host(body.version), GCL_ADMIN_VERSION);
        return refuse_peer(session);
    }
    if (admin->state != GCL_ADMIN_GREETING_AWAITED) {
        LC_LOG(LC_LOG_ERR, "session %d: proto admin: bad state in greeting:%d not %d", session->id,
               admin->state, GCL_ADMIN_GREETING_AWAITED);
        return refuse_peer(session);
    }
    // The answer is sent before the peer is checked; it contains nothing but our name and ids.
    if (session->state == GCL_SESSION_CONNECTED) {
        CHECK_STATUS(send_greeting_response(session, admin));
    } else {
        LC_LOG(LC_LOG_INFO, "session %d: dropping greeting to non-connected session", session->id);
    }
    if (session->state == GCL_SESSION_CLOSED)
        return LC_OK; // sending has found the peer closed
    admin->state = GCL_ADMIN_GREETED;
    auto uid = static_cast<int32_t>(to_host(body.uid)), gid = static_cast<int32_t>(to_host(body.gid));
    if (!peer_is_trusted(session, &uid, &gid))
        return refuse_peer(session);
    admin->peer_uid = uid;
    admin->peer_gid = gid;
    admin->peer_flags = to_host(body.flags);
    copy_text_field(admin->peer_user, body.user);
    copy_text_field(admin->peer_name, body.name);
    admin->authenticated = 1;
    LC_LOG(LC_LOG_INFO, "session %d: client open for peer %s", session->id, admin->peer_name);
    return LC_OK;
}

} // namespace

lc_status gcl_session_client_open_service(gcl_session *session, uint16_t protocol, int32_t service,
                                          const char *name, int32_t) {
    CHECK_NULL(session);
    const gcl_session_guard guard(session);
    if (session->state == GCL_SESSION_CLOSED || session->fd < 0)
        return LC_IO_CLOSED;
    if (session->state != GCL_SESSION_CONNECTED) {
        LC_LOG(LC_LOG_INFO, "session %d: dropping greeting to non-connected session", session->id);
        return LC_OK;
    }
    gcl_admin *admin = gcl_admin_of(session);
    CHECK_NULL(admin);
    gcl *instance = session->instance;
    gcl_wire_open_service body{};
    body.message_id = to_be32(instance->admin_message_id++);
    body.second_counter = to_be32(instance->admin_second_counter++);
    body.protocol = to_be32(protocol);
    body.service = to_be32(static_cast<uint32_t>(service));
    if (name)
        fill_text_field(body.name, name);
    // Set before sending, which may close the session.
    admin->state = GCL_ADMIN_OPEN_SENT;
    admin->pending_service = service;
    CHECK_STATUS(gcl_session_send_frame_components(session, GCL_PROTO_ADMIN, GCL_ADMIN_OPEN_SERVICE,
                                                   sizeof body, &body));
    LC_LOG(LC_LOG_DEBUG, "session %d: proto admin: sent open service (%d/%d)", session->id, protocol,
           service);
    return LC_OK;
}

namespace {

lc_status receive_open_response(gcl_session *session, gcl_body_protocol *, tbuffer **frame, void *) {
    const gcl_owned_buffer taken(*frame);
    *frame = nullptr;
    gcl_wire_open_service_response body{};
    CHECK_STATUS(copy_body(taken.pointer, &body));
    gcl_admin *admin = gcl_admin_of(session);
    CHECK_NULL(admin);
    const auto status = static_cast<int32_t>(to_host(body.status));
    const int32_t pending = admin->pending_service;
    LC_LOG(LC_LOG_DEBUG, "session %d: proto admin: received open service response %d", session->id, status);
    admin->pending_service = 0;
    if (status == 0 && pending >= GCL_SERVICE_MIN && pending <= GCL_SERVICE_MAX) {
        admin->current_service = pending;
        admin->open_services |= 1u << pending;
        admin->state = GCL_ADMIN_OPEN_ANSWERED;
        copy_text_field(admin->peer_service_name, body.peer_name);
    } else {
        // A refused first service counts as answered too: the caller that waits for it finds the service not
        // open.
        admin->state = admin->open_services ? GCL_ADMIN_GREETED : GCL_ADMIN_OPEN_ANSWERED;
    }
    return LC_OK;
}

lc_status ignore_message(gcl_session *session, gcl_body_protocol *, tbuffer **frame, void *) {
    LC_LOG(LC_LOG_DEBUG, "session %d: proto admin: in receive CATCHALL", session->id);
    tb_free(frame);
    return LC_OK;
}

} // namespace

lc_status gcl_admin_register(gcl *instance) {
    gcl_body_protocol admin{};
    admin.protocol = GCL_PROTO_ADMIN;
    strlcpy(admin.name, "admin", sizeof admin.name);
    admin.enabled = 1;
    admin.session_new = admin_session_new;
    admin.session_free = admin_session_free;
    admin.connection_established = admin_established;
    admin.query_session_state = admin_query_state;
    // Messages that only a provider receives are ignored.
    const struct {
        uint16_t mtype;
        gcl_frame_handler function;
    } handlers[] = {
        {0, ignore_message},
        {GCL_ADMIN_GREETING, receive_greeting},
        {GCL_ADMIN_GREETING_RESPONSE, ignore_message},
        {GCL_ADMIN_OPEN_SERVICE, ignore_message},
        {GCL_ADMIN_OPEN_SERVICE_RESPONSE, receive_open_response},
    };
    for (const auto &row : handlers)
        admin.handlers[row.mtype] = {GCL_PROTO_ADMIN, row.mtype, row.function, nullptr};
    CHECK_STATUS(gcl_register_body_protocol(instance, &admin));
    return LC_OK;
}
