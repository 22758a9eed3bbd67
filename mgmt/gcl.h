// GCL: framed sessions on stream sockets, client side. wccpd, tunneld and mgmtctl use it to talk to mgmtd.
//
// An instance owns sessions, each on one non-blocking stream socket, usually a Unix socket to a provider such
// as mgmtd. Everything is sent in frames (gcl_wire.h), and each frame belongs to a body protocol: 1, "admin",
// opens the session and is part of this library; 2, "bnode", carries management messages (bnode_proto.h).
// Sessions are driven by the interest list that the instance is given; only opening a service waits in a loop
// of its own.
//
// Every operation takes the instance's lock and then the session's, both recursive, and disables cancellation
// while it holds them. Any thread may send on a session that another thread's loop drives. Null arguments are
// LC_NULL.
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
// The largest frame, with its header. A received frame whose length is larger, or smaller than the header,
// ends the session.
constexpr uint32_t GCL_FRAME_MAX = 16u << 20;
// The limit of a session's output queue. A frame that would exceed it is refused, unless the queue is empty.
constexpr uint64_t GCL_QUEUE_MAX_BYTES = 4u << 20;
// Additional space for the short refusals that replace responses which didn't fit.
constexpr uint64_t GCL_QUEUE_RESERVE_BYTES = 64u << 10;

enum : int32_t {
    GCL_SESSION_NONE = 0,
    GCL_SESSION_CLOSED = 1,
    GCL_SESSION_INITIALIZED = 2,
    GCL_SESSION_LISTENING = 3,
    GCL_SESSION_CONNECTED = 4,
};
extern const lc_enum_entry gcl_session_state_table[];

// The states of protocol 1 in a session.
enum : int32_t {
    GCL_ADMIN_GREETING_AWAITED = 3,
    GCL_ADMIN_GREETING_SENT = 4,
    GCL_ADMIN_GREETED = 5,
    GCL_ADMIN_OPEN_SENT = 6,
    GCL_ADMIN_OPEN_ANSWERED = 7,
};

// --- Instances
struct gcl_options {
    uint32_t options;
    const std::atomic<int32_t> *ending; // null, or a flag: not 0 ends all waits of this instance
    void *open_service_hook;            // providers only
    void *open_service_argument;
};
lc_status gcl_options_get_defaults(gcl_options *out);
// Null options are the defaults. The interest list stays the caller's and has to outlive the instance.
// SIGPIPE is ignored from now on, unless the process handles it.
lc_status gcl_init(gcl **out, const gcl_options *options, fdic *interests);
lc_status gcl_shutdown(gcl *instance); // closes all sessions, without flushing; the records stay
// Closes and frees all sessions. No other thread may use the instance any more.
lc_status gcl_deinit(gcl **inout);

// --- Sessions

// `client_name` has less than 20 characters and no "-", else LC_GENERIC; null is allowed. A null address
// makes a Unix socket at a path of its own below GCL_SOCKET_DIRECTORY; another one must be of the family
// AF_INET or AF_UNIX.
lc_status gcl_session_client_new(gcl *instance, const char *client_name, const sockaddr *address,
                                 socklen_t address_length, gcl_session **out);
// Connects to the socket of a provider, or to an address. LC_IO_ERROR, logged without a status line: there is
// no provider at the socket. With `retry` it tries up to six times, 1.5 seconds apart, with the locks held.
// LC_CANCELLED if the process is ending, LC_GENERIC for a session that isn't new, LC_ASSERTION for any other
// error. After a failure the session can only be freed.
lc_status gcl_session_client_connect_by_provider(gcl_session *session, const char *provider_name, int retry);
lc_status gcl_session_client_connect_by_sockaddr(gcl_session *session, const sockaddr *address,
                                                 socklen_t length, int retry);
lc_status gcl_session_client_open_service(gcl_session *session, uint16_t protocol, int32_t service,
                                          const char *name, int32_t reserved);
// Opens a service and waits for the answer, `timeout_ms` at most for each step, or -1 without limit.
// LC_IO_TIMED_OUT; LC_IO_CLOSED if the peer closes, which closes the session as well; LC_GENERIC if the
// service is refused. A wait ends with LC_CANCELLED when SIGHUP, SIGINT or SIGTERM is pending for the calling
// thread, and when the instance is `ending`.
lc_status gcl_session_client_open_service_blocking(gcl_session *session, uint16_t protocol, int32_t service,
                                                   const char *name, int32_t reserved, int64_t timeout_ms);
lc_status gcl_session_do_blocking_io(gcl *instance, gcl_session *session, int stop_on_frames_sent,
                                     int stop_on_frames_received, int stop_on_session_state,
                                     int stop_on_protocol_state, uint16_t protocol, int64_t timeout_ms);
// Sends a frame; `length` is that of the body in bytes. What the socket doesn't take at once is queued. A
// frame larger than GCL_FRAME_MAX is LC_NO_BUFFER_SPACE, logged. If the output queue is full, the result is
// LC_CANCELLED; one line is logged for all frames that are refused until the queue has drained. LC_GENERIC if
// the session isn't connected. A peer that has closed is not a failure: the session is closed, with result 0.
lc_status gcl_session_send_frame_components(gcl_session *session, uint16_t proto, uint16_t mtype,
                                            uint32_t length, const void *body);
// The same with a buffer that begins with room for the header. It is taken over, also on failure.
lc_status gcl_session_send_frame_components_tb(gcl_session *session, uint16_t proto, uint16_t mtype,
                                               uint32_t header_bytes, tbuffer **inout_buffer);
// The same, with room of GCL_HEADER_BYTES, for a short frame that replaces a response which didn't fit: it
// may also use GCL_QUEUE_RESERVE_BYTES.
lc_status gcl_session_send_refusal_tb(gcl_session *session, uint16_t proto, uint16_t mtype,
                                      tbuffer **inout_buffer);
// `flush`: first writes as much of the queue as the socket takes. Closing a closed session does nothing.
lc_status gcl_session_close(gcl_session *session, int flush);
// Only on the loop's thread while the loop is running. An open session is closed, which is logged.
lc_status gcl_session_free(gcl_session **inout);
lc_status gcl_session_get_state(gcl_session *session, int32_t *out_state, int32_t *out_admin_state);
// The names are the session's, and valid until it is freed. The peer's is empty before its greeting.
lc_status gcl_session_get_session_names(gcl_session *session, const char **out_local_name,
                                        const char **out_peer_name);

// --- Body protocols. Hooks and handlers are called with both locks held. A failure of a hook fails the
// operation that calls it.
using gcl_session_hook = lc_status (*)(gcl_session *session, gcl_body_protocol *protocol);
using gcl_state_hook = lc_status (*)(gcl_session *session, gcl_body_protocol *protocol, int32_t *out_state);
// The buffer contains the whole frame, with its header in host order (gcl_frame_header), and belongs to the
// handler. A failure closes the session.
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
// Copies the record. LC_ASSERTION, logged, if the number is registered already.
lc_status gcl_register_body_protocol(gcl *instance, const gcl_body_protocol *protocol);
gcl_body_protocol *gcl_get_body_protocol(gcl *instance, uint16_t protocol); // null when not registered
gcl *gcl_session_get_instance(gcl_session *session);
int32_t gcl_session_get_id(const gcl_session *session); // the number in all log lines about the session
// A protocol's own data of a session: set by its session_new hook, freed and set to null by session_free.
void *gcl_session_get_protocol_state(gcl_session *session, uint16_t protocol);
lc_status gcl_session_set_protocol_state(gcl_session *session, uint16_t protocol, void *state);
int gcl_session_service_is_open(gcl_session *session, int32_t service);
int32_t gcl_session_get_current_service(gcl_session *session); // the service opened last; 0: none

// Holds both locks of a session, with cancellation disabled, for a scope.
struct gcl_session_guard {
    explicit gcl_session_guard(gcl_session *session);
    cancel_off_guard cancel_off;
    lc_lock_guard instance_lock;
    lc_lock_guard session_lock;
};

// Body protocol 2, "bnode": gcl_init calls the first, gcl_deinit the second.
lc_status gcl_bn_init(gcl *instance);
lc_status bn_deinit(gcl *instance);
