// A provider of sessions for tests, from raw bytes: it shares no code with the client.
#pragma once

#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

using wire = std::string;

inline wire be(uint64_t value, int bytes) {
    wire out;
    while (bytes-- > 0)
        out.push_back(static_cast<char>(value >> (8 * bytes) & 0xff));
    return out;
}
inline wire padded(wire text, size_t size) {
    text.resize(size, '\0');
    return text;
}
inline uint32_t number_at(const wire &bytes, size_t offset, int size = 4) {
    uint32_t value = 0;
    for (int i = 0; i < size; i++)
        value = value << 8 | static_cast<uint8_t>(bytes[offset + static_cast<size_t>(i)]);
    return value;
}
inline wire frame_bytes(uint16_t proto, uint16_t mtype, const wire &body, uint32_t sequence = 1000001) {
    return wire("GCLF3210") + be(1, 4) + be(32 + body.size(), 4) + be(32, 2) + be(0, 2) + be(sequence, 4) +
           be(proto, 2) + be(mtype, 2) + be(body.size(), 4) + body;
}
inline wire greeting_bytes(uint32_t uid, uint32_t gid, uint16_t version = 2) {
    return frame_bytes(1, 1,
                       be(version, 2) + be(0, 4) + be(0, 4) + padded("mgmtd-1", 32) + be(uid, 4) +
                           be(gid, 4) + padded("admin", 32) + be(0, 4));
}
inline wire open_response_bytes(uint32_t request_id, uint32_t status, const wire &text = {}) {
    const size_t length = text.empty() ? 0 : text.size() + 1;
    return frame_bytes(1, 4,
                       be(1, 4) + be(0, 4) + be(request_id, 4) + padded("peer", 32) + be(status, 4) +
                           be(length, 4) + padded(text, length));
}

struct gcl_provider {
    int listener = -1, client = -1;
    wire unread;

    static wire path(const wire &name) { return "/tmp/gcl-socks/uds-provider-" + name; }
    bool listen_as(const wire &name) {
        mkdir("/tmp/gcl-socks", 0777);
        listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un address = {AF_UNIX, {}};
        strcpy(address.sun_path, path(name).c_str());
        unlink(address.sun_path);
        return bind(listener, reinterpret_cast<sockaddr *>(&address), sizeof address) == 0 &&
               listen(listener, 8) == 0;
    }
    bool accept_client() {
        client = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
        unread.clear();
        return client >= 0;
    }
    // Blocks until all bytes are sent.
    bool put(const wire &bytes) const {
        return send(client, bytes.data(), bytes.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
    }
    // Whole frames only; "" when the client closed or nothing came for `wait_ms`.
    wire take_frame(int wait_ms = 3000) {
        while (unread.size() < 32 || unread.size() < number_at(unread, 12)) {
            pollfd watched = {client, POLLIN, 0};
            char bytes[65536];
            const ssize_t got = poll(&watched, 1, wait_ms) > 0 ? recv(client, bytes, sizeof bytes, 0) : 0;
            if (got <= 0)
                return {};
            unread.append(bytes, static_cast<size_t>(got));
        }
        const wire frame = unread.substr(0, number_at(unread, 12));
        unread.erase(0, frame.size());
        return frame;
    }
    // The provider's part of opening a session.
    bool open_session() {
        if (!accept_client() || !put(greeting_bytes(~0u, ~0u)) || take_frame().empty())
            return false;
        const wire request = take_frame();
        return request.size() == 80 && put(open_response_bytes(number_at(request, 32), 0));
    }
    void close_client() {
        close(client);
        client = -1;
    }
    ~gcl_provider() {
        close(client);
        close(listener);
    }
};
