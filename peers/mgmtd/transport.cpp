// The sessions' sockets, one poll loop for all of them.
//
// A session goes: greeting sent, greeted (the client's name is known), open (the bnode service granted).
// Frames are whole before anything looks at them, and a header that can't be true ends its session, so what
// a client makes mgmtd hold is bounded by GCL_FRAME_MAX in and QUEUE_MAX_BYTES out. A client that doesn't
// read never stops the others: nothing here blocks.
//
// The directory lies in /tmp, where anybody may have made it first: it has to be a real directory of our own
// user that nobody else may write to. The lock on it, held as long as the process lives, keeps a second
// mgmtd off, and tells that a socket found in it is left over. The kernel says who a client is; only root
// and our own user are let in.
//
// A client binds a name there too, and removes it when it ends. What a killed one leaves is removed when
// mgmtd starts and with each session that comes. Not when a session ends: then its process is still about to
// go, and all sessions of a process share one name. A name that goes too early harms nobody, since a session
// is connected by then, or connects to mgmtd's name and not to its own.
#include "peers/mgmtd/transport.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <climits>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string_view>
#include <vector>

#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <pwd.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include "mgmt/bnode_proto.h"
#include "mgmt/gcl.h"
#include "mgmt/gcl_wire.h"
#include "peers/nodes/provider_path.h"

static constexpr const char *PROVIDER_NAME = "mgmtd";
static constexpr int READS_A_TURN = 16; // then the others have theirs

static void send_bnode(transport *self, uint32_t id, uint16_t mtype, tbuffer *taken);

// --- The socket

static bool fail(std::string *out_error, const std::string &what) {
    *out_error = what + ": " + strerror(errno);
    return false;
}

static bool open_directory(transport *self, std::string *out_error) {
    const std::string path(GCL_SOCKET_DIRECTORY, strlen(GCL_SOCKET_DIRECTORY) - 1);
    if (mkdir(path.c_str(), 0755) != 0 && errno != EEXIST)
        return fail(out_error, path);
    self->directory = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    struct stat about;
    if (self->directory < 0 || fstat(self->directory, &about) != 0)
        return fail(out_error, path);
    if (about.st_uid != geteuid()) {
        *out_error = path + ": belongs to user " + std::to_string(about.st_uid) + ", not to us";
        return false;
    }
    if ((about.st_mode & 07777) != 0755 && fchmod(self->directory, 0755) != 0)
        return fail(out_error, path);
    if (flock(self->directory, LOCK_EX | LOCK_NB) != 0) {
        *out_error = "another mgmtd runs";
        return false;
    }
    return true;
}

// The process that a client's socket is of, by its name "uds-client-NAME-PID"; 0 for other files.
static pid_t client_of_socket(std::string_view file) {
    pid_t pid = 0;
    const size_t dash = file.rfind('-');
    if (!file.starts_with("uds-client-") || dash == std::string_view::npos)
        return 0;
    const char *end = file.data() + file.size();
    const auto [last, error] = std::from_chars(file.data() + dash + 1, end, pid);
    return error == std::errc() && last == end && pid > 0 ? pid : 0;
}

static void remove_left_over(const transport *self) {
    const int fd = openat(self->directory, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    DIR *opened = fd < 0 ? nullptr : fdopendir(fd);
    if (!opened) {
        if (fd >= 0)
            close(fd);
        return;
    }
    const std::unique_ptr<DIR, int (*)(DIR *)> files(opened, closedir);
    while (const dirent *file = readdir(files.get())) {
        const pid_t pid = client_of_socket(file->d_name);
        struct stat about;
        if (pid > 0 && kill(pid, 0) != 0 && errno == ESRCH &&
            fstatat(self->directory, file->d_name, &about, AT_SYMLINK_NOFOLLOW) == 0 &&
            S_ISSOCK(about.st_mode))
            unlinkat(self->directory, file->d_name, 0);
    }
}

bool transport_listen(transport *self, server *owner, std::string *out_error) {
    self->owner = owner;
    owner->send = [self](uint32_t id, uint16_t mtype, tbuffer *frame) { send_bnode(self, id, mtype, frame); };
    if (!open_directory(self, out_error))
        return false;
    remove_left_over(self);
    self->socket_path = provider_path();
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    strlcpy(address.sun_path, self->socket_path.c_str(), sizeof address.sun_path);
    unlink(address.sun_path);
    self->listener = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (self->listener < 0)
        return fail(out_error, "socket");
    // The length that clients connect with may count less than the whole record; the path decides.
    const mode_t before = umask(0177);
    const int bound = bind(self->listener, reinterpret_cast<sockaddr *>(&address), sizeof address);
    umask(before);
    if (bound != 0 || listen(self->listener, 16) != 0)
        return fail(out_error, self->socket_path);
    return true;
}

void transport_close(transport *self) {
    for (auto &[id, session] : self->sessions)
        close(session.fd);
    self->sessions.clear();
    if (self->listener >= 0) {
        close(self->listener);
        unlink(self->socket_path.c_str());
    }
    if (self->directory >= 0)
        close(self->directory);
    self->listener = self->directory = -1;
}

// --- Sending

static void end_session(transport *self, session *client, const std::string &why) {
    if (client->ended)
        return;
    client->ended = true;
    if (!why.empty())
        self->owner->say("session of " + (client->name.empty() ? "a client" : client->name) + ": " + why);
}

static void queue_frame(transport *self, session *client, uint16_t proto, uint16_t mtype, std::string frame) {
    gcl_wire_header header{};
    const auto length = static_cast<uint32_t>(frame.size());
    memcpy(header.ident, GCL_FRAME_IDENT, sizeof header.ident);
    header.marker = to_be32(GCL_FRAME_MARKER);
    header.version = to_be32(GCL_FRAME_VERSION);
    header.total_length = to_be32(length);
    header.header_length = to_be16(sizeof header);
    header.sequence = to_be32(client->sequence++);
    header.proto = to_be16(proto);
    header.mtype = to_be16(mtype);
    header.body_length = to_be32(length - static_cast<uint32_t>(sizeof header));
    memcpy(frame.data(), &header, sizeof header);
    if (client->queued_bytes > 0 && client->queued_bytes + frame.size() > QUEUE_MAX_BYTES) {
        end_session(self, client, "does not read, ended");
        return;
    }
    client->queued_bytes += frame.size();
    client->queue.push_back(std::move(frame));
}

static void flush(transport *self, session *client) {
    while (!client->queue.empty() && !client->ended) {
        const std::string &frame = client->queue.front();
        const ssize_t sent = send(client->fd, frame.data() + client->written, frame.size() - client->written,
                                  MSG_NOSIGNAL | MSG_DONTWAIT);
        if (sent < 0 && errno == EINTR)
            continue;
        if (sent < 0 && (errno == EAGAIN || errno == EWOULDBLOCK))
            return;
        if (sent < 0) {
            end_session(self, client, "");
            return;
        }
        client->written += static_cast<size_t>(sent);
        if (client->written < frame.size())
            continue;
        client->queued_bytes -= frame.size();
        client->written = 0;
        client->queue.pop_front();
    }
}

template <typename Body>
static void send_admin(transport *self, session *client, uint16_t mtype, const Body &body,
                       const std::string &tail = "") {
    std::string frame(sizeof(gcl_wire_header), '\0');
    frame.append(reinterpret_cast<const char *>(&body), sizeof body);
    frame += tail;
    queue_frame(self, client, GCL_PROTO_ADMIN, mtype, std::move(frame));
}

static void send_bnode(transport *self, uint32_t id, uint16_t mtype, tbuffer *taken) {
    const owned_tbuffer buffer(taken);
    const auto found = self->sessions.find(id);
    if (found == self->sessions.end() || found->second.ended)
        return;
    queue_frame(
        self, &found->second, BN_PROTO, mtype,
        {reinterpret_cast<const char *>(tb_buf(taken)), static_cast<size_t>(std::max(tb_length(taken), 0))});
}

static void send_greeting(transport *self, session *client) {
    gcl_wire_greeting greeting{};
    greeting.version = to_be16(GCL_ADMIN_VERSION);
    greeting.message_id = to_be32(self->admin_messages);
    greeting.second_counter = to_be32(self->admin_messages++);
    const std::string name = std::string(PROVIDER_NAME) + "-" + std::to_string(getpid());
    strlcpy(greeting.name, name.c_str(), sizeof greeting.name);
    greeting.uid = to_be32(geteuid());
    greeting.gid = to_be32(getegid());
    const passwd *entry = getpwuid(geteuid());
    strlcpy(greeting.user, entry ? entry->pw_name : "", sizeof greeting.user);
    send_admin(self, client, GCL_ADMIN_GREETING, greeting);
}

// --- Admin messages

static std::string field_text(const char (&field)[32]) {
    return {field, strnlen(field, sizeof field)};
}

static bool take_greeting_response(transport *self, session *client, const std::string &frame) {
    gcl_wire_greeting_response response;
    if (frame.size() < sizeof(gcl_wire_header) + sizeof response || client->stage != session::greeting_sent) {
        end_session(self, client, "bad greeting response");
        return false;
    }
    memcpy(&response, frame.data() + sizeof(gcl_wire_header), sizeof response);
    const uint32_t uid = to_host(response.uid);
    const std::string name = field_text(response.name);
    const bool printable =
        !name.empty() && std::all_of(name.begin(), name.end(), [](char c) { return c > 0x20 && c < 0x7f; });
    if (to_host(response.version) != GCL_ADMIN_VERSION || !printable ||
        (uid != client->uid && uid != UINT32_MAX)) {
        end_session(self, client, "bad version, name or user in its greeting response");
        return false;
    }
    client->name = name;
    client->stage = session::greeted;
    return true;
}

static bool take_open_service(transport *self, uint32_t id, session *client, const std::string &frame) {
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
    response.request_second_counter = request.second_counter;
    response.request_message_id = request.message_id;
    strlcpy(response.peer_name, PROVIDER_NAME, sizeof response.peer_name);
    response.status = to_be32(refusal ? 1 : 0);
    response.text_length = to_be32(refusal ? static_cast<uint32_t>(strlen(refusal)) : 0);
    send_admin(self, client, GCL_ADMIN_OPEN_SERVICE_RESPONSE, response,
               refusal ? std::string(refusal, strlen(refusal) + 1) : "");
    if (refusal) {
        self->owner->say("session of " + client->name + ": service " + std::to_string(service) + " refused");
    } else if (client->stage == session::greeted) {
        client->stage = session::open;
        server_peer_opened(self->owner, id, client->name);
    }
    return true;
}

// --- Frames

static void take_frame(transport *self, uint32_t id, session *client, const gcl_wire_header &header,
                       const std::string &frame) {
    const uint16_t proto = to_host(header.proto), mtype = to_host(header.mtype);
    if (proto == GCL_PROTO_ADMIN && mtype == GCL_ADMIN_GREETING_RESPONSE) {
        (void)take_greeting_response(self, client, frame);
    } else if (proto == GCL_PROTO_ADMIN && mtype == GCL_ADMIN_OPEN_SERVICE) {
        (void)take_open_service(self, id, client, frame);
    } else if (proto == BN_PROTO && client->stage == session::open) {
        owned_tbuffer buffer;
        if (tb_new_buf(&buffer.pointer, frame.data(), static_cast<int32_t>(frame.size())) != LC_OK ||
            !server_take_frame(self->owner, id, mtype, buffer.pointer))
            end_session(self, client, "a message that can't be read, ended");
    } else {
        end_session(self, client,
                    "unexpected frame " + std::to_string(proto) + "/" + std::to_string(mtype) + ", ended");
    }
}

static bool header_is_sound(const gcl_wire_header &header) {
    const uint32_t total = to_host(header.total_length);
    return memcmp(header.ident, GCL_FRAME_IDENT, sizeof header.ident) == 0 &&
           to_host(header.version) == GCL_FRAME_VERSION && to_host(header.header_length) == sizeof header &&
           total >= sizeof header && total <= GCL_FRAME_MAX;
}

static void take_frames(transport *self, uint32_t id, session *client) {
    size_t at = 0;
    while (!client->ended && client->unread.size() - at >= sizeof(gcl_wire_header)) {
        gcl_wire_header header;
        memcpy(&header, client->unread.data() + at, sizeof header);
        if (!header_is_sound(header)) {
            end_session(self, client, "bad frame header, ended");
            break;
        }
        const uint32_t total = to_host(header.total_length);
        if (client->unread.size() - at < total)
            break;
        const std::string frame = client->unread.substr(at, total);
        at += total;
        take_frame(self, id, client, header, frame);
    }
    client->unread.erase(0, at);
}

static void read_session(transport *self, uint32_t id, session *client) {
    char bytes[65536];
    for (int turns = 0; turns < READS_A_TURN; turns++) {
        const ssize_t got = recv(client->fd, bytes, sizeof bytes, MSG_DONTWAIT);
        if (got < 0 && errno == EINTR)
            continue;
        if (got < 0 && (errno == EAGAIN || errno == EWOULDBLOCK))
            return;
        if (got > 0) {
            client->unread.append(bytes, static_cast<size_t>(got));
            take_frames(self, id, client);
        }
        if (got <= 0)
            end_session(self, client, "");
        if (client->ended || got < static_cast<ssize_t>(sizeof bytes))
            return;
    }
}

static void accept_session(transport *self) {
    const int fd = accept4(self->listener, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd < 0)
        return;
    remove_left_over(self);
    ucred credentials{};
    socklen_t length = sizeof credentials;
    const bool known = getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) == 0;
    if (!known || (credentials.uid != 0 && credentials.uid != geteuid()) ||
        self->sessions.size() >= SESSIONS_MAX) {
        self->owner->say(self->sessions.size() >= SESSIONS_MAX
                             ? "session refused: too many"
                             : "session refused: user " + std::to_string(credentials.uid));
        close(fd);
        return;
    }
    session &client = self->sessions[self->next_id++];
    client.fd = fd;
    client.uid = credentials.uid;
    client.sequence = GCL_SEQUENCE_PROVIDER;
    send_greeting(self, &client);
}

// What ends may tell others, who may end of it in turn.
static void sweep(transport *self) {
    for (bool again = true; again;) {
        again = false;
        for (auto at = self->sessions.begin(); at != self->sessions.end(); ++at) {
            if (!at->second.ended)
                continue;
            const uint32_t id = at->first;
            close(at->second.fd);
            self->sessions.erase(at);
            server_peer_closed(self->owner, id);
            again = true;
            break;
        }
    }
}

bool transport_round(transport *self, int other_fd, int64_t timeout_ms) {
    for (auto &[id, client] : self->sessions)
        flush(self, &client);
    sweep(self);
    std::vector<pollfd> watched = {{other_fd, POLLIN, 0}, {self->listener, POLLIN, 0}};
    std::vector<uint32_t> ids;
    for (const auto &[id, client] : self->sessions) {
        watched.push_back({client.fd, static_cast<short>(POLLIN | (client.queue.empty() ? 0 : POLLOUT)), 0});
        ids.push_back(id);
    }
    const int timeout = static_cast<int>(std::clamp<int64_t>(timeout_ms, -1, INT_MAX));
    if (poll(watched.data(), watched.size(), timeout) <= 0)
        return false;
    for (size_t i = 0; i < ids.size(); i++) {
        session &client = self->sessions[ids[i]];
        if (watched[i + 2].revents & POLLOUT)
            flush(self, &client);
        if (watched[i + 2].revents & (POLLIN | POLLHUP | POLLERR))
            read_session(self, ids[i], &client);
    }
    if (watched[1].revents & POLLIN)
        accept_session(self);
    for (auto &[id, client] : self->sessions)
        flush(self, &client);
    sweep(self);
    return (watched[0].revents & POLLIN) != 0;
}
