// The provider's side of sessions: the socket that clients find under the name "mgmtd", and their frames.
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
constexpr size_t CLIENT_SESSIONS_MAX = 56; // the other places are kept for the appliance's daemons
constexpr size_t VIEWER_SESSIONS_MAX = 12;
// For a client that doesn't read. An answer that doesn't fit is refused; for other frames its session ends.
constexpr size_t QUEUE_MAX_BYTES = 32u << 20;
constexpr uint32_t OPENING_FRAME_MAX = 4096; // before the service is open
constexpr int64_t OPENING_MAX_MS = 10000;    // from the connection until the service is open
constexpr int64_t LISTENER_CHECK_MS = 2000;
constexpr int64_t ACCEPT_PAUSE_MS = 1000; // when there is no descriptor for a connection that waits

struct session {
    int fd;
    uint32_t uid;
    peer_owner owner;
    enum { greeting_sent, greeted, opened } stage = greeting_sent;
    std::string name; // from the greeting response
    std::string unread;
    std::deque<std::string> queue;
    size_t queued_bytes = 0, written = 0; // in the queue; of its first frame
    uint32_t sequence;
    int64_t open_by_ms;
    bool ended = false; // goes at the end of the round
};

struct transport {
    server *owner = nullptr;
    listener place;
    int64_t check_place_at_ms = 0;
    int64_t accept_at_ms = 0; // no connection is accepted before
    std::map<uint32_t, session> sessions;
    uint32_t next_id = 1;
    uint32_t admin_messages = 0;
};

// False with the reason; another mgmtd that runs is one.
bool transport_listen(transport *self, server *owner, std::string *out_error);
// Waits for traffic, for one of `inout_others` or for the time (-1: no limit), and handles the traffic. What
// came of the others is in their `revents`.
void transport_round(transport *self, std::vector<pollfd> *inout_others, int64_t timeout_ms);
void transport_close(transport *self);
