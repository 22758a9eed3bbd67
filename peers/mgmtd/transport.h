// The provider's side of sessions: accepts clients on the socket of the provider "mgmtd", and reads and
// writes their frames.
#pragma once

#include <cstdint>
#include <deque>
#include <map>
#include <string>
#include <vector>

#include <poll.h>

#include "peers/mgmtd/listener.h"
#include "peers/mgmtd/server.h"

constexpr size_t SESSIONS_MAX = 64;
constexpr size_t CLIENT_SESSIONS_MAX = 56; // the others are reserved for wccpd and tunneld
constexpr size_t VIEWER_SESSIONS_MAX = 12;
// Bytes that may wait for a client to read them. A response that does not fit is replaced by a refusal; with
// any other frame that does not fit the session is ended.
constexpr size_t QUEUE_MAX_BYTES = 32u << 20;
constexpr uint32_t OPENING_FRAME_MAX = 4096; // before the service is open
constexpr int64_t OPENING_MAX_MS = 10000;    // from the connection until the service is open
constexpr int64_t LISTENER_CHECK_MS = 2000;
constexpr int64_t ACCEPT_PAUSE_MS =
    1000; // after a connection could not be accepted, for example without a descriptor

struct session {
    int fd;
    uint32_t uid;
    peer_owner owner;
    enum { greeting_sent, greeted, opened } stage = greeting_sent;
    std::string name; // from the greeting response; "" before
    std::string unread;
    std::deque<std::string> queue;
    size_t queued_bytes = 0,
           written = 0; // bytes in the queue; bytes of its first frame that are sent already
    uint32_t sequence;
    int64_t open_by_ms;
    bool ended = false; // is removed at the end of the round
};

struct transport {
    server *owner = nullptr;
    listener place;
    int64_t check_place_at_ms = 0;
    int64_t accept_at_ms = 0; // no connection is accepted before this time
    std::map<uint32_t, session> sessions;
    uint32_t next_id = 1;
    uint32_t admin_messages = 0;
};

// False with the reason, for example when another mgmtd runs.
bool transport_listen(transport *self, server *owner, std::string *out_error);
// Waits until a client or one of `inout_others` is ready, or the time is over (-1: no limit), and serves the
// clients. The `revents` of the others are set.
void transport_round(transport *self, std::vector<pollfd> *inout_others, int64_t timeout_ms);
void transport_close(transport *self);
