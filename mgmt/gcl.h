// GCL sessions: framed stream sessions to a provider, client side.
//
// An instance owns sessions, each on one non-blocking stream socket. Every byte travels in frames, and a
// frame names the body protocol that it belongs to: 1, "admin", opens the session and lives here; others
// register themselves. Sessions are driven by the interest list that the instance was given; only the opening
// waits in a loop of its own.
//
// Every operation takes the instance's lock and then the session's, both recursive, with cancellation off
// until they are released. Any thread may send on a session that another thread's loop drives.
#pragma once

#include <atomic>
#include <cstdint>

#include <sys/socket.h>

#include "runtime/common.h"
#include "runtime/fdintrcb.h"
#include "runtime/guards.h"

struct gcl;
struct gcl_session;
struct gcl_body_protocol;
struct tbuffer;

constexpr uint16_t GCL_PROTO_ADMIN = 1;
constexpr uint32_t GCL_HEADER_BYTES = 32;
// A frame that announces less than its header or more than this ends its session.
constexpr uint32_t GCL_FRAME_MAX = 16u << 20;
// What a session keeps for a peer that doesn't read. A frame that would go past it is not taken, unless
// nothing waits.
constexpr uint64_t GCL_QUEUE_MAX_BYTES = 4u << 20;
// What is kept beyond that for refusals, so that a peer hears of an answer that did not fit.
constexpr uint64_t GCL_QUEUE_RESERVE_BYTES = 64u << 10;

enum : int32_t {
    GCL_SESSION_NONE = 0,
    GCL_SESSION_CLOSED = 1,
    GCL_SESSION_INITIALIZED = 2,
    GCL_SESSION_LISTENING = 3,
    GCL_SESSION_CONNECTED = 4,
};
extern const lc_enum_entry gcl_session_state_table[];

enum : int32_t {
    GCL_ADMIN_GREETING_AWAITED = 3,
    GCL_ADMIN_GREETING_SENT = 4,
    GCL_ADMIN_GREETED = 5,
    GCL_ADMIN_OPEN_SENT = 6,
    GCL_ADMIN_OPEN_ANSWERED = 7,
};

// Instance.
struct gcl_options {
    uint32_t options;
    const std::atomic<int32_t> *ending; // null, or not 0 once no wait of this instance is to go on
    void *open_service_hook;            // providers only
    void *open_service_argument;
};
lc_status gcl_options_get_defaults(gcl_options *out);
lc_status gcl_init(gcl **out, const gcl_options *options, fdic *interests);
lc_status gcl_shutdown(gcl *instance); // closes all sessions, without flushing; the records stay
lc_status gcl_deinit(gcl **inout);

// Session. The names that gcl_session_get_session_names gives are the session's own.
lc_status gcl_session_client_new(gcl *instance, const char *client_name, const sockaddr *address,
                                 socklen_t address_length, gcl_session **out);
// 14014: nobody is there; 14016: closed meanwhile.
lc_status gcl_session_client_connect_by_provider(gcl_session *session, const char *provider_name, int retry);
lc_status gcl_session_client_connect_by_sockaddr(gcl_session *session, const sockaddr *address,
                                                 socklen_t length, int retry);
lc_status gcl_session_client_open_service(gcl_session *session, uint16_t protocol, int32_t service,
                                          const char *name, int32_t reserved);
// `timeout_ms` -1 waits without limit. A wait, as one between attempts to connect, ends with LC_CANCELLED
// when a signal that ends the process is pending on the calling thread, and once the instance is `ending`.
lc_status gcl_session_client_open_service_blocking(gcl_session *session, uint16_t protocol, int32_t service,
                                                   const char *name, int32_t reserved, int64_t timeout_ms);
lc_status gcl_session_do_blocking_io(gcl *instance, gcl_session *session, int stop_on_frames_sent,
                                     int stop_on_frames_received, int stop_on_session_state,
                                     int stop_on_protocol_state, uint16_t protocol, int64_t timeout_ms);
// A frame of more than GCL_FRAME_MAX gives LC_NO_BUFFER_SPACE, with a line. A full output queue gives
// LC_CANCELLED; one line is logged for all frames lost while the queue is full.
lc_status gcl_session_send_frame_components(gcl_session *session, uint16_t proto, uint16_t mtype,
                                            uint32_t length, const void *body);
// The buffer has room for the header at its start; it is taken over, also on failure.
lc_status gcl_session_send_frame_components_tb(gcl_session *session, uint16_t proto, uint16_t mtype,
                                               uint32_t header_bytes, tbuffer **inout_buffer);
// The same, with a header of GCL_HEADER_BYTES, for a short frame instead of an answer that did not fit: it
// may use GCL_QUEUE_RESERVE_BYTES as well.
lc_status gcl_session_send_refusal_tb(gcl_session *session, uint16_t proto, uint16_t mtype,
                                      tbuffer **inout_buffer);
lc_status gcl_session_close(gcl_session *session, int flush);
// Not from another thread than the loop's while the loop runs.
lc_status gcl_session_free(gcl_session **inout);
lc_status gcl_session_get_state(gcl_session *session, int32_t *out_state, int32_t *out_admin_state);
lc_status gcl_session_get_session_names(gcl_session *session, const char **out_local_name,
                                        const char **out_peer_name);

// Body protocols. The instance takes a copy of the record. Hooks and handlers run with both locks held.
using gcl_session_hook = lc_status (*)(gcl_session *session, gcl_body_protocol *protocol);
using gcl_state_hook = lc_status (*)(gcl_session *session, gcl_body_protocol *protocol, int32_t *out_state);
// The buffer holds the whole frame, header in host order; the handler owns it. A failure closes the session.
using gcl_frame_handler = lc_status (*)(gcl_session *session, gcl_body_protocol *protocol,
                                        tbuffer **inout_frame, void *user_data);
struct gcl_message_handler {
    uint16_t protocol;
    uint16_t mtype; // 0 for a catch-all
    gcl_frame_handler function;
    void *user_data;
};
constexpr uint16_t GCL_HANDLERS_MAX = 16; // by mtype; entry 0 is the catch-all
struct gcl_body_protocol {
    uint16_t protocol; // 1 to GCL_PROTOCOLS_MAX - 1
    char name[32];
    int32_t enabled;
    gcl_session_hook session_new, session_free;
    gcl_session_hook connection_established, connection_accepted, connection_closed;
    gcl_state_hook query_session_state;
    gcl_message_handler handlers[GCL_HANDLERS_MAX];
    void *state; // the protocol's own, one for the instance
};
constexpr uint16_t GCL_PROTOCOLS_MAX = 8;
lc_status gcl_register_body_protocol(gcl *instance, const gcl_body_protocol *protocol);
gcl_body_protocol *gcl_get_body_protocol(gcl *instance, uint16_t protocol); // null when not registered
gcl *gcl_session_get_instance(gcl_session *session);
int32_t gcl_session_get_id(const gcl_session *session); // the "%d" of all session lines
// A protocol's record of one session: set in its session_new hook, freed and set to null in session_free.
void *gcl_session_get_protocol_state(gcl_session *session, uint16_t protocol);
lc_status gcl_session_set_protocol_state(gcl_session *session, uint16_t protocol, void *state);
int gcl_session_service_is_open(gcl_session *session, int32_t service);
int32_t gcl_session_get_current_service(gcl_session *session); // of the admin record; 0 before one is open

// Both locks of a session, with cancellation off, for a scope.
struct gcl_session_guard {
    explicit gcl_session_guard(gcl_session *session);
    cancel_off_guard cancel_off;
    lc_lock_guard instance_lock;
    lc_lock_guard session_lock;
};

// Body protocol 2, "bnode": gcl_init registers it, gcl_deinit frees its state.
lc_status gcl_bn_init(gcl *instance);
lc_status bn_deinit(gcl *instance);
