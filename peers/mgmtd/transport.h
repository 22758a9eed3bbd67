// The provider's side of sessions: the socket that clients find under the name "mgmtd", and their frames.
#pragma once

#include <cstdint>
#include <deque>
#include <map>
#include <string>

#include "peers/mgmtd/server.h"

constexpr size_t SESSIONS_MAX = 64;
constexpr size_t QUEUE_MAX_BYTES = 32u << 20; // for a client that doesn't read; then its session ends

struct session {
    int fd;
    uint32_t uid;
    enum { greeting_sent, greeted, open } stage = greeting_sent;
    std::string name; // from the greeting response
    std::string unread;
    std::deque<std::string> queue;
    size_t queued_bytes = 0, written = 0; // in the queue; of its first frame
    uint32_t sequence;
    bool ended = false; // goes at the end of the round
};

struct transport {
    server *owner = nullptr;
    int listener = -1, directory = -1;
    std::string socket_path;
    std::map<uint32_t, session> sessions;
    uint32_t next_id = 1;
    uint32_t admin_messages = 0;
};

// Makes the directory and the socket, with their owner and mode from the first moment. False with the reason;
// another mgmtd that runs is one.
bool transport_listen(transport *self, server *owner, std::string *out_error);
// Waits for traffic, for `other_fd` or for the time, and handles what came. True when `other_fd` is readable.
bool transport_round(transport *self, int other_fd, int64_t timeout_ms);
void transport_close(transport *self);
