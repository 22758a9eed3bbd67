// One poll loop serves the sockets of all sessions, and nothing in it blocks: a client that does not read
// cannot stop the others.
//
// The stages of a session are: greeting sent, greeted (the name of the client is known), open (the bnode
// service is granted). Frames are handled when they are complete, and a bad header ends the session. The
// memory of a client is therefore bounded: GCL_FRAME_MAX for what it sends, QUEUE_MAX_BYTES for what it does
// not read.
//
// The kernel identifies the user of a client. Root and the user of mgmtd may do everything, members of a
// group may look, and others are refused. Some places are reserved for wccpd and tunneld, by the name in the
// greeting. When all places are taken, a connection that has not greeted yet is ended in favour of a new one.
// Viewers have few places, and cannot use the name of a daemon.
#include "peers/mgmtd/transport.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>

#include <pwd.h>
#include <sys/socket.h>
#include <unistd.h>

#include "mgmt/bnode_proto.h"
#include "mgmt/gcl.h"
#include "mgmt/gcl_wire.h"

namespace {

constexpr const char *PROVIDER_NAME = "mgmtd";
constexpr int READS_A_TURN = 16;                                  // of a session, before the others are read
constexpr const char *DAEMON_PREFIXES[] = {"wccpd-", "tunneld-"}; // of the names of their sessions

void send_bnode(transport *self, uint32_t id, uint16_t mtype, tbuffer *taken);
bool fits_queue(const session &client, size_t bytes) {
    return client.queued_bytes == 0 || client.queued_bytes + bytes <= QUEUE_MAX_BYTES;
}

} // namespace

bool transport_listen(transport *self, server *owner, std::string *out_error) {
    self->owner = owner;
    owner->fits = [self](uint32_t id, size_t bytes) {
        const auto found = self->sessions.find(id);
        // For a session that is gone, the frame is dropped when it is sent.
        return found == self->sessions.end() || fits_queue(found->second, bytes);
    };
    owner->send = [self](uint32_t id, uint16_t mtype, tbuffer *frame) { send_bnode(self, id, mtype, frame); };
    self->place.say = owner->say;
    return listener_open(&self->place, out_error);
}

void transport_close(transport *self) {
    for (auto &[id, session] : self->sessions)
        close(session.fd);
    self->sessions.clear();
    listener_close(&self->place);
}

// --- Sending

namespace {

void end_session(transport *self, session *client, const std::string &why) {
    if (client->ended)
        return;
    // Only marked: callers iterate over the sessions or hold pointers to them.
    client->ended = true;
    if (!why.empty())
        self->owner->say("session of " + (client->name.empty() ? "a client" : client->name) + ": " + why);
}

void queue_frame(transport *self, session *client, uint16_t proto, uint16_t mtype, std::string frame) {
    gcl_wire_header header{};
    const auto length = static_cast<uint32_t>(frame.size());
    memcpy(header.ident, GCL_FRAME_IDENT, sizeof header.ident);
    header.marker = to_be32(GCL_FRAME_MARKER);
    header.version = to_be32(GCL_FRAME_VERSION);
    header.total_length = to_be32(length);
    header.header_length = to_be16(sizeof header);
    // Nothing on the other side checks the sequence; it helps when a trace is read.
    header.sequence = to_be32(client->sequence++);
    header.proto = to_be16(proto);
    header.mtype = to_be16(mtype);
    header.body_length = to_be32(length - static_cast<uint32_t>(sizeof header));
    memcpy(frame.data(), &header, sizeof header);
    if (!fits_queue(*client, frame.size())) {
        end_session(self, client, "does not read, ended");
        return;
    }
    client->queued_bytes += frame.size();
    client->queue.push_back(std::move(frame));
}

void flush_queue(transport *self, session *client) {
    while (!client->queue.empty() && !client->ended) {
        const std::string &frame = client->queue.front();
        const ssize_t sent = send(client->fd, frame.data() + client->written, frame.size() - client->written,
                                  MSG_NOSIGNAL | MSG_DONTWAIT);
        if (sent < 0 && errno == EINTR)
            continue;
        if (sent < 0 && (errno == EAGAIN || errno == EWOULDBLOCK))
            return;
        // Without a log line: the client has gone, and its session is logged as closed.
        if (sent < 0) {
            end_session(self, client, "");
            return;
        }
        // The kernel may take a part of a frame; the rest stays at the head of the queue.
        client->written += static_cast<size_t>(sent);
        if (client->written < frame.size())
            continue;
        client->queued_bytes -= frame.size();
        client->written = 0;
        client->queue.pop_front();
    }
}

template <typename Body>
void send_admin(transport *self, session *client, uint16_t mtype, const Body &body,
                const std::string &tail = "") {
    std::string frame(sizeof(gcl_wire_header), '\0');
    frame.append(reinterpret_cast<const char *>(&body), sizeof body);
    frame += tail;
    queue_frame(self, client, GCL_PROTO_ADMIN, mtype, std::move(frame));
}

void send_bnode(transport *self, uint32_t id, uint16_t mtype, tbuffer *taken) {
    const owned_tbuffer buffer(taken);
    const auto found = self->sessions.find(id);
    if (found == self->sessions.end() || found->second.ended)
        return;
    queue_frame(
        self, &found->second, BN_PROTO, mtype,
        {reinterpret_cast<const char *>(tb_buf(taken)), static_cast<size_t>(std::max(tb_length(taken), 0))});
}

void send_greeting(transport *self, session *client) {
    gcl_wire_greeting greeting{};
    greeting.version = to_be16(GCL_ADMIN_VERSION);
    greeting.message_id = to_be32(self->admin_messages);
    greeting.second_counter = to_be32(self->admin_messages++);
    const std::string name = std::string(PROVIDER_NAME) + "-" + std::to_string(getpid());
    strlcpy(greeting.name, name.c_str(), sizeof greeting.name);
    greeting.uid = to_be32(geteuid());
    greeting.gid = to_be32(self->place.group); // the client compares it with that of the socket's file
    const passwd *entry = getpwuid(geteuid());
    strlcpy(greeting.user, entry ? entry->pw_name : "", sizeof greeting.user);
    send_admin(self, client, GCL_ADMIN_GREETING, greeting);
}

// --- Admin messages

std::string read_name_field(const char (&field)[32]) {
    return {field, strnlen(field, sizeof field)};
}

bool is_daemon_name(const std::string &name) {
    return std::any_of(std::begin(DAEMON_PREFIXES), std::end(DAEMON_PREFIXES),
                       [&](const char *prefix) { return name.starts_with(prefix); });
}

bool has_place(const transport *self, const std::string &name) {
    const auto clients = std::count_if(self->sessions.begin(), self->sessions.end(), [](const auto &each) {
        const session &other = each.second;
        return !other.ended && other.stage != session::greeting_sent && !is_daemon_name(other.name);
    });
    return is_daemon_name(name) || clients < static_cast<ptrdiff_t>(CLIENT_SESSIONS_MAX);
}

bool take_greeting_response(transport *self, session *client, std::string_view frame) {
    gcl_wire_greeting_response response;
    if (frame.size() < sizeof(gcl_wire_header) + sizeof response || client->stage != session::greeting_sent) {
        end_session(self, client, "bad greeting response");
        return false;
    }
    memcpy(&response, frame.data() + sizeof(gcl_wire_header), sizeof response);
    const uint32_t uid = to_host(response.uid);
    const std::string name = read_name_field(response.name);
    const bool printable =
        !name.empty() && std::all_of(name.begin(), name.end(), [](char c) { return c > 0x20 && c < 0x7f; });
    if (to_host(response.version) != GCL_ADMIN_VERSION || !printable ||
        // A client may leave its user open with -1. Rights depend only on what the kernel has reported.
        (uid != client->uid && uid != UINT32_MAX)) {
        end_session(self, client, "bad version, name or user in its greeting response");
        return false;
    }
    // This session does not count itself, because it is still in the stage `greeting_sent`.
    const bool allowed = has_place(self, name);
    client->name = name;
    if (is_daemon_name(name) && !client->owner.may_change) {
        end_session(self, client, "refused, " + client->owner.user + " may not use the name of a daemon");
        return false;
    }
    if (!allowed) {
        end_session(self, client, "refused, too many");
        return false;
    }
    client->stage = session::greeted;
    return true;
}

bool take_open_service(transport *self, uint32_t id, session *client, std::string_view frame) {
    gcl_wire_open_service request;
    if (frame.size() < sizeof(gcl_wire_header) + sizeof request || client->stage == session::greeting_sent) {
        end_session(self, client, "bad service open");
        return false;
    }
    memcpy(&request, frame.data() + sizeof(gcl_wire_header), sizeof request);
    const uint32_t service = to_host(request.service);
    const char *refusal =
        service < static_cast<uint32_t>(GCL_SERVICE_MIN) || service > static_cast<uint32_t>(GCL_SERVICE_MAX)
            ? GCL_BAD_SERVICE_TEXT
        : to_host(request.protocol) != BN_PROTO ? "Bad protocol in service open."
                                                : nullptr;
    gcl_wire_open_service_response response{};
    response.message_id = to_be32(self->admin_messages++);
    // Returned as they came; the client matches its request by them.
    response.request_second_counter = request.second_counter;
    response.request_message_id = request.message_id;
    strlcpy(response.peer_name, PROVIDER_NAME, sizeof response.peer_name);
    response.status = to_be32(refusal ? 1 : 0);
    response.text_length = to_be32(refusal ? static_cast<uint32_t>(strlen(refusal)) : 0);
    send_admin(self, client, GCL_ADMIN_OPEN_SERVICE_RESPONSE, response,
               // With a NUL, which the length in the message does not count.
               refusal ? std::string(refusal, strlen(refusal) + 1) : "");
    if (refusal) {
        self->owner->say("session of " + client->name + ": service " + std::to_string(service) + " refused");
    } else if (client->stage == session::greeted) {
        // Not for further services, which are granted on the same session.
        client->stage = session::opened;
        server_peer_opened(self->owner, id, client->name, client->owner);
    }
    return true;
}

// --- Frames

void take_frame(transport *self, uint32_t id, session *client, const gcl_wire_header &header,
                std::string_view frame) {
    const uint16_t proto = to_host(header.proto), mtype = to_host(header.mtype);
    if (proto == GCL_PROTO_ADMIN && mtype == GCL_ADMIN_GREETING_RESPONSE) {
        (void)take_greeting_response(self, client, frame);
    } else if (proto == GCL_PROTO_ADMIN && mtype == GCL_ADMIN_OPEN_SERVICE) {
        (void)take_open_service(self, id, client, frame);
    } else if (proto == BN_PROTO && client->stage == session::opened) {
        owned_tbuffer buffer;
        // `frame` points into `unread`, which nothing changes until the frame has been handled.
        if (tb_new_buf_const(&buffer.pointer, frame.data(), static_cast<uint32_t>(frame.size())) != LC_OK ||
            !server_take_frame(self->owner, id, mtype, buffer.pointer))
            end_session(self, client, "a message that can't be read, ended");
    } else {
        end_session(self, client,
                    "unexpected frame " + std::to_string(proto) + "/" + std::to_string(mtype) + ", ended");
    }
}

bool header_is_sound(const session &client, const gcl_wire_header &header) {
    const uint32_t total = to_host(header.total_length);
    // Bounds what is stored while the frame is incomplete.
    const uint32_t most = client.stage == session::opened ? GCL_FRAME_MAX : OPENING_FRAME_MAX;
    return memcmp(header.ident, GCL_FRAME_IDENT, sizeof header.ident) == 0 &&
           to_host(header.version) == GCL_FRAME_VERSION && to_host(header.header_length) == sizeof header &&
           total >= sizeof header && total <= most;
}

void take_frames(transport *self, uint32_t id, session *client) {
    size_t at = 0;
    while (!client->ended && client->unread.size() - at >= sizeof(gcl_wire_header)) {
        gcl_wire_header header;
        memcpy(&header, client->unread.data() + at, sizeof header);
        if (!header_is_sound(*client, header)) {
            end_session(self, client, "bad frame header, ended");
            break;
        }
        const uint32_t total = to_host(header.total_length);
        if (client->unread.size() - at < total)
            break;
        const std::string_view frame = std::string_view(client->unread).substr(at, total);
        at += total;
        take_frame(self, id, client, header, frame);
    }
    // Once for all frames; erasing each one would move the rest each time.
    client->unread.erase(0, at);
}

void read_session(transport *self, uint32_t id, session *client) {
    char bytes[65536];
    // A client that sends without pause must not keep the others waiting.
    for (int turns = 0; turns < READS_A_TURN; turns++) {
        const ssize_t got = recv(client->fd, bytes, sizeof bytes, MSG_DONTWAIT);
        if (got < 0 && errno == EINTR)
            continue;
        if (got < 0 && (errno == EAGAIN || errno == EWOULDBLOCK))
            return;
        if (got > 0) {
            client->unread.append(bytes, static_cast<size_t>(got));
            // Before the next read, so that `unread` holds little more than one incomplete frame.
            take_frames(self, id, client);
        }
        if (got <= 0)
            end_session(self, client, "");
        // A short read has emptied the socket; poll reports what follows.
        if (client->ended || got < static_cast<ssize_t>(sizeof bytes))
            return;
    }
}

// Ends a connection that has not greeted yet if all places are taken. False: all of them have greeted.
bool make_room(transport *self) {
    if (self->sessions.size() < SESSIONS_MAX)
        return true;
    for (auto &[id, client] : self->sessions) // in the order of their ids: the oldest first
        if (client.stage == session::greeting_sent && !client.ended) {
            end_session(self, &client, "ended for a new connection, it has not greeted");
            return true;
        }
    return false;
}

// --- The user of a client

bool is_member(int fd, const ucred &who, gid_t group) {
    // The supplementary groups at the time of the connection. The option takes and returns bytes.
    gid_t groups[256];
    socklen_t length = sizeof groups;
    if (group == static_cast<gid_t>(-1))
        return false;
    if (who.gid == group)
        return true;
    // Of a user in more groups than fit here, only the primary group counts.
    return getsockopt(fd, SOL_SOCKET, SO_PEERGROUPS, groups, &length) == 0 &&
           std::find(groups, groups + length / sizeof *groups, group) != groups + length / sizeof *groups;
}

// Only the user of mgmtd is looked up. The lookup of others may ask a server on the network, while all
// sessions wait.
std::string name_of_user(uid_t uid) {
    const passwd *entry = uid != 0 && uid == geteuid() ? getpwuid(uid) : nullptr;
    return uid == 0 ? "root" : entry ? entry->pw_name : "user " + std::to_string(uid);
}

// Fills in the user of a connection. Returns why it is refused, or "".
std::string identify_client(const transport *self, int fd, session *out) {
    ucred who{};
    socklen_t length = sizeof who;
    // The user at the time of connect(): later changes of the process have no effect.
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &who, &length) != 0)
        return "its user is not known";
    out->uid = who.uid;
    out->owner = {name_of_user(who.uid), who.uid == 0 || who.uid == geteuid()};
    if (out->owner.may_change)
        return "";
    if (!is_member(fd, who, self->place.viewers))
        return out->owner.user;
    // All their connections count, also those that have not greeted, so that they can't crowd out others.
    const auto viewers = std::ranges::count_if(
        self->sessions, [](const auto &each) { return !each.second.ended && !each.second.owner.may_change; });
    return viewers < static_cast<ptrdiff_t>(VIEWER_SESSIONS_MAX) ? "" : "too many of those who may only look";
}

void accept_session(transport *self) {
    const int fd = accept4(self->place.socket, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd < 0) {
        // The connection stays in the backlog, and poll would return at once each time.
        if (errno != EAGAIN && errno != EINTR && errno != ECONNABORTED)
            self->accept_at_ms = self->owner->now_ms() + ACCEPT_PAUSE_MS;
        return;
    }
    // A new session is a good time to remove what killed clients have left.
    listener_tidy(&self->place);
    session client{};
    std::string refusal = identify_client(self, fd, &client);
    if (refusal.empty() && !make_room(self))
        refusal = "too many";
    if (!refusal.empty()) {
        self->owner->say("session refused: " + refusal);
        close(fd);
        return;
    }
    client.fd = fd;
    client.sequence = GCL_SEQUENCE_PROVIDER;
    client.open_by_ms = self->owner->now_ms() + OPENING_MAX_MS;
    // The greeting is queued in the stored session.
    session &kept = self->sessions[self->next_id++] = std::move(client);
    send_greeting(self, &kept);
}

// Removing a session may send events to other sessions and so end one of them; therefore the search starts
// over.
void remove_ended_sessions(transport *self) {
    for (bool again = true; again;) {
        again = false;
        for (auto at = self->sessions.begin(); at != self->sessions.end(); ++at) {
            if (!at->second.ended)
                continue;
            const uint32_t id = at->first;
            close(at->second.fd);
            // Erased before the server is notified, so that no event is queued for it.
            self->sessions.erase(at);
            server_peer_closed(self->owner, id);
            again = true;
            break;
        }
    }
}

// Does the work that is due. Returns the time until the next, `timeout_ms` at most (-1: no limit).
int64_t run_timers(transport *self, int64_t timeout_ms) {
    const int64_t now = self->owner->now_ms();
    if (now >= self->check_place_at_ms) {
        listener_check(&self->place);
        self->check_place_at_ms = now + LISTENER_CHECK_MS;
    }
    // There is always a next time, because the name of the socket is checked regularly.
    int64_t next = self->check_place_at_ms;
    if (now < self->accept_at_ms)
        next = std::min(next, self->accept_at_ms);
    for (auto &[id, client] : self->sessions) {
        if (client.stage == session::opened)
            continue;
        if (now >= client.open_by_ms)
            end_session(self, &client, "did not finish its opening, ended");
        next = std::min(next, client.open_by_ms);
    }
    const int64_t left = std::max<int64_t>(next - now, 0);
    return timeout_ms < 0 ? left : std::min(timeout_ms, left);
}

} // namespace

void transport_round(transport *self, std::vector<pollfd> *inout_others, int64_t timeout_ms) {
    const int64_t limit_ms = run_timers(self, timeout_ms);
    for (auto &[id, client] : self->sessions)
        // The timers of the caller may have queued frames.
        flush_queue(self, &client);
    remove_ended_sessions(self);
    std::vector<pollfd> watched = *inout_others;
    const size_t others = watched.size();
    // While accepting pauses, the socket is left out: poll ignores negative descriptors.
    const bool accepts = self->owner->now_ms() >= self->accept_at_ms;
    watched.push_back({accepts ? self->place.socket : -1, POLLIN, 0});
    std::vector<uint32_t> ids;
    for (const auto &[id, client] : self->sessions) {
        // POLLOUT only while something waits, because a writable socket would end every poll at once.
        watched.push_back({client.fd, static_cast<short>(POLLIN | (client.queue.empty() ? 0 : POLLOUT)), 0});
        ids.push_back(id);
    }
    if (poll(watched.data(), watched.size(), static_cast<int>(std::min<int64_t>(limit_ms, INT_MAX))) <= 0)
        return;
    std::copy_n(watched.begin(), others, inout_others->begin());
    for (size_t i = 0; i < ids.size(); i++) {
        // Sessions are removed only at the end of the round, and every id still exists.
        session &client = self->sessions[ids[i]];
        const short came = watched[others + 1 + i].revents;
        if (came & POLLOUT)
            flush_queue(self, &client);
        // After a hang-up there may still be frames to read; recv then reports the end.
        if (came & (POLLIN | POLLHUP | POLLERR))
            read_session(self, ids[i], &client);
    }
    if (watched[others].revents & POLLIN)
        accept_session(self);
    for (auto &[id, client] : self->sessions)
        flush_queue(self, &client);
    remove_ended_sessions(self);
}
