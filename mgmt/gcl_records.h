// The records of instances and sessions, for mgmt/gcl*.cpp only. The instance's lock guards its record and
// the list of sessions; a session's record is used with both locks held, as are the functions below that take
// a session.
#pragma once

#include <atomic>
#include <cstdint>

#include <sys/socket.h>
#include <sys/types.h>

#include "mgmt/gcl.h"
#include "mgmt/gcl_wire.h"
#include "runtime/common.h"
#include "runtime/fdintrcb.h"
#include "runtime/tbuffer.h"

constexpr uint32_t GCL_READ_BUFFER_BYTES = 0x20000;
constexpr uint32_t GCL_READ_ROOM = 0x10000;        // free bytes that a read needs at least
constexpr uint32_t GCL_READ_MAX = 0x100000;        // bytes per read
constexpr uint32_t GCL_READ_BUFFER_KEEP = 0x40000; // a buffer larger than this is replaced once it is empty

// A frame in the output queue.
struct gcl_frame {
    gcl_frame *next;
    gcl_session *session;
    uint32_t sequence;
    uint8_t *bytes; // owned
    uint32_t length;
    uint64_t written;
    int64_t time_queued_ms; // lt_curr_time_ms
};

struct gcl_counters {
    uint64_t frames_sent, bytes_sent;
    uint64_t frames_received, bytes_received;
    uint64_t frames_delivered, bytes_delivered;
};

struct gcl_endpoint {
    sockaddr_storage address;
    socklen_t length; // 0 for none
    char path[108];   // of a Unix socket; "" for none
};

struct gcl_session {
    gcl *instance;
    gcl_session *next;
    uint32_t id; // in log lines
    int32_t fd;  // -1: closed
    char local_name[64];
    int32_t state;    // GCL_SESSION_...
    int32_t provider; // 0: a client session
    int family;       // AF_UNIX or AF_INET
    gcl_endpoint local, peer;
    int32_t uid, gid;
    char user[64];
    uint32_t sequence; // of the next frame
    tbuffer *read_buffer;
    uint32_t read_position, in_frame, frame_length; // the next frame begins at read_position
    void *protocol_state[GCL_PROTOCOLS_MAX];
    gcl_frame *queue_head, *queue_tail;
    uint64_t queued_bytes; // not written yet
    uint64_t frames_lost;  // refused since the queue became full
    int32_t want_write;    // 1: waits for the socket to be writable
    gcl_counters counters;
    uint32_t rate_limit; // kilobytes a second, 0 for none
    int32_t rate_timer;  // id in the interest list, -1 for none
    int32_t fd_interest; // id in the interest list, -1 for none
    lc_lock *lock;
};

struct gcl {
    gcl_options options;
    fdic *interests;
    uint32_t next_session_id;
    gcl_session *sessions;
    gcl_session *freed; // the records of freed sessions, see gcl.cpp
    gcl_body_protocol *protocols[GCL_PROTOCOLS_MAX];
    lc_lock *lock;
    uint32_t admin_message_id, admin_second_counter;
};

// The state of protocol 1 of a session.
struct gcl_admin {
    int32_t state;
    int32_t authenticated_by_us;
    int32_t uid, gid;
    char user[64];
    uint32_t flags;
    int32_t authenticated;
    int32_t peer_uid, peer_gid;
    char peer_user[33];
    uint32_t peer_flags;
    char peer_name[33];
    uint32_t open_services; // bit N for service N
    int32_t pending_service, current_service;
    char peer_service_name[33];
};

inline gcl_admin *gcl_admin_of(const gcl_session *session) {
    return static_cast<gcl_admin *>(session->protocol_state[GCL_PROTO_ADMIN]);
}

using gcl_owned_buffer = owned<tbuffer, tb_release>;

// gcl_blocking.cpp: whether a signal that ends the process is pending for this thread, or the instance is
// ending.
bool gcl_end_is_pending(const gcl *instance);

// gcl_admin.cpp
lc_status gcl_admin_register(gcl *instance);

// gcl_frames.cpp
lc_status gcl_session_fd_read_write_timeout_activity(int fd, uint32_t kind, void *session, void *argument);
lc_status gcl_run_output_queue(gcl_session *session);
void gcl_free_queue(gcl_session *session);

// gcl_session.cpp
enum gcl_hook_kind { GCL_HOOK_NEW, GCL_HOOK_FREE, GCL_HOOK_ESTABLISHED, GCL_HOOK_CLOSED };
lc_status gcl_run_hooks(gcl_session *session, gcl_hook_kind kind);
void gcl_forget_record(gcl_session *session); // frees the record of a freed session
