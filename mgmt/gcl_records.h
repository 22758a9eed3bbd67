// Records of instances and sessions, and what the files of this library call of each other. Both locks of a
// session are held for everything that takes one.
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
constexpr uint32_t GCL_READ_ROOM = 0x10000; // least room for a read, and the step by which the buffer grows
constexpr uint32_t GCL_READ_MAX = 0x100000;
constexpr uint32_t GCL_READ_BUFFER_KEEP = 0x40000; // an empty buffer that has grown past this is made anew

struct gcl_frame {
    gcl_frame *next;
    gcl_session *session;
    uint32_t sequence;
    uint8_t *bytes; // owned
    uint32_t length;
    uint64_t written;
    int64_t time_queued_ms;
};

struct gcl_counters {
    uint64_t frames_sent, bytes_sent;
    uint64_t frames_received, bytes_received;
    uint64_t frames_delivered, bytes_delivered;
};

struct gcl_endpoint {
    sockaddr_storage address;
    socklen_t length; // 0 for none
    char path[108];   // for Unix sockets; "" for none
};

struct gcl_session {
    gcl *instance;
    gcl_session *next;
    uint32_t id;
    int32_t fd;
    char local_name[64];
    int32_t state;
    int32_t provider;
    int family;
    gcl_endpoint local, peer;
    int32_t uid, gid;
    char user[64];
    uint32_t sequence;
    tbuffer *read_buffer;
    uint32_t read_position, in_frame, frame_length;
    void *protocol_state[GCL_PROTOCOLS_MAX];
    gcl_frame *queue_head, *queue_tail;
    uint64_t queued_bytes;
    uint64_t frames_lost; // in the present filling of the queue
    int32_t want_write;
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
    gcl_session *freed; // records that are kept until gcl_deinit
    gcl_body_protocol *protocols[GCL_PROTOCOLS_MAX];
    lc_lock *lock;
    uint32_t admin_message_id, admin_second_counter;
};

// One for each session, the state of protocol 1.
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

// gcl_blocking.cpp: whether a signal that ends the process waits for this thread, or the instance is ending.
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
void gcl_forget_record(gcl_session *session); // frees a record that nobody can reach any more
