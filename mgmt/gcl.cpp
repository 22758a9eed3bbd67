// GCL instances, and the design of this library (mgmt/gcl*.cpp).
//
// Records: an instance (`gcl`) owns its sessions and its body protocols. A session owns its socket, its read
// buffer and its output queue (gcl_frames.cpp), and by the hooks of each body protocol that protocol's state.
// gcl_session.cpp makes, connects and closes sessions. The handshake that opens a session is protocol 1
// (gcl_admin.cpp); gcl_blocking.cpp waits for it.
//
// Locks: every operation takes the instance's lock, then the session's, by a guard that also disables
// cancellation. A cancelled thread therefore ends after its frame has been queued, never between a write and
// the update of the counters. A loop calls the sessions' callbacks with the loop's own lock held, and they
// then take these two; no operation here takes the lock of a loop, since changes of interests are posted to a
// loop of another thread (event_fdintrcb.cpp).
//
// Threads: one thread runs the loop that drives an instance's sessions; any thread may send. A sender that
// finds the peer closed closes the session, while the loop's thread may be waiting for the session's lock in
// the activity function; it then finds the session closed and does nothing. For the same reason the record of
// a freed session is kept until gcl_deinit, without everything that it owned.
//
// Nesting: the handler of a frame may run the loop, and thereby read frames of, send on, or close the session
// that it was called for. After every call of a handler or a hook, and after every send, the state of the
// session has to be checked again, and nothing that was read from it before may be used.
//
// Memory: a peer can only use up so much. A frame is limited by GCL_FRAME_MAX, the read buffer by what has
// been received, the output queue by GCL_QUEUE_MAX_BYTES.
#include "mgmt/gcl.h"

#include <csignal>
#include <cstdlib>
#include <cstring>

#include "mgmt/gcl_records.h"
#include "runtime/logging.h"

const lc_enum_entry gcl_session_state_table[] = {
    {GCL_SESSION_NONE, "none"},
    {GCL_SESSION_CLOSED, "closed"},
    {GCL_SESSION_INITIALIZED, "initialized"},
    {GCL_SESSION_LISTENING, "listening"},
    {GCL_SESSION_CONNECTED, "connected"},
    {0, nullptr},
};

namespace {

struct gcl_instance_guard {
    explicit gcl_instance_guard(gcl *instance) : instance_lock(instance->lock) {}
    cancel_off_guard cancel_off;
    lc_lock_guard instance_lock;
};

} // namespace

gcl_session_guard::gcl_session_guard(gcl_session *session)
    : instance_lock(session->instance->lock), session_lock(session->lock) {}

lc_status gcl_options_get_defaults(gcl_options *out) {
    CHECK_NULL(out);
    *out = {1, nullptr, nullptr, nullptr};
    return LC_OK;
}

namespace {

// A write to a closed peer must return EPIPE instead of ending the process. A process that handles SIGPIPE
// gets EPIPE already, and keeps its handler.
void ignore_sigpipe() {
    struct sigaction action;
    if (sigaction(SIGPIPE, nullptr, &action) == 0 &&
        ((action.sa_flags & SA_SIGINFO) || action.sa_handler != SIG_DFL))
        return;
    memset(&action, 0, sizeof action);
    action.sa_handler = SIG_IGN;
    sigfillset(&action.sa_mask);
    sigaction(SIGPIPE, &action, nullptr);
}

lc_status set_up_instance(gcl *instance) {
    CHECK_CONDITION(lc_lock_init(&instance->lock, 1) == 0);
    ignore_sigpipe();
    CHECK_STATUS(gcl_admin_register(instance));
    CHECK_STATUS(gcl_bn_init(instance));
    return LC_OK;
}

} // namespace

lc_status gcl_init(gcl **out, const gcl_options *options, fdic *interests) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(interests);
    auto *instance = static_cast<gcl *>(calloc(1, sizeof(gcl)));
    CHECK_NULL(instance);
    if (options)
        instance->options = *options;
    else
        (void)gcl_options_get_defaults(&instance->options);
    instance->interests = interests;
    instance->next_session_id = 1;
    const lc_status status = set_up_instance(instance);
    if (status != LC_OK)
        (void)gcl_deinit(&instance);
    CHECK_STATUS(status);
    *out = instance;
    return LC_OK;
}

lc_status gcl_register_body_protocol(gcl *instance, const gcl_body_protocol *protocol) {
    CHECK_NULL(instance);
    CHECK_NULL(protocol);
    CHECK_CONDITION(protocol->protocol > 0 && protocol->protocol < GCL_PROTOCOLS_MAX);
    const gcl_instance_guard guard(instance);
    if (instance->protocols[protocol->protocol]) {
        LC_LOG(LC_LOG_ERR, "Already have registered body handler for proto %d", protocol->protocol);
        return LC_ASSERTION;
    }
    auto *copy = static_cast<gcl_body_protocol *>(malloc(sizeof(gcl_body_protocol)));
    CHECK_NULL(copy);
    *copy = *protocol;
    instance->protocols[protocol->protocol] = copy;
    return LC_OK;
}

gcl_body_protocol *gcl_get_body_protocol(gcl *instance, uint16_t protocol) {
    return instance && protocol < GCL_PROTOCOLS_MAX ? instance->protocols[protocol] : nullptr;
}

lc_status gcl_shutdown(gcl *instance) {
    CHECK_NULL(instance);
    const gcl_instance_guard guard(instance);
    lc_status result = LC_OK;
    // A close calls the close handler, which may change the list; therefore it is searched from the start
    // again after each.
    for (gcl_session *session = instance->sessions; session;) {
        if (session->state == GCL_SESSION_CLOSED) {
            session = session->next;
            continue;
        }
        const lc_status status = gcl_session_close(session, 0);
        LOG_STATUS(status);
        result = result ? result : status;
        // Closed sessions stay in the list and are skipped. One that can't be closed must not be tried
        // forever.
        session = status ? session->next : instance->sessions;
    }
    return result;
}

lc_status gcl_deinit(gcl **inout) {
    CHECK_NULL(inout);
    gcl *instance = *inout;
    if (!instance)
        return LC_OK;
    const cancel_off_guard cancel_off;
    // Null if gcl_init failed before it was created. The guard's scope ends before the lock is destroyed.
    if (instance->lock) {
        const lc_lock_guard guard(instance->lock);
        // Until the list is empty: a close handler may have freed the session, or made another one.
        while (gcl_session *session = instance->sessions) {
            if (session->state != GCL_SESSION_CLOSED)
                LOG_STATUS(gcl_session_close(session, 0));
            session = instance->sessions;
            if (session)
                LOG_STATUS(gcl_session_free(&session));
        }
        LOG_STATUS(bn_deinit(instance));
    }
    // No thread can be waiting for the lock of such a session any more.
    while (gcl_session *session = instance->freed) {
        instance->freed = session->next;
        gcl_forget_record(session);
    }
    for (gcl_body_protocol *protocol : instance->protocols)
        free(protocol);
    if (instance->lock)
        lc_lock_deinit(&instance->lock);
    free(instance);
    *inout = nullptr;
    return LC_OK;
}

// --- What body protocols use

gcl *gcl_session_get_instance(gcl_session *session) {
    return session ? session->instance : nullptr;
}
int32_t gcl_session_get_id(const gcl_session *session) {
    return session ? static_cast<int32_t>(session->id) : -1;
}
void *gcl_session_get_protocol_state(gcl_session *session, uint16_t protocol) {
    return session && protocol < GCL_PROTOCOLS_MAX ? session->protocol_state[protocol] : nullptr;
}
lc_status gcl_session_set_protocol_state(gcl_session *session, uint16_t protocol, void *state) {
    CHECK_NULL(session);
    CHECK_CONDITION(protocol < GCL_PROTOCOLS_MAX);
    session->protocol_state[protocol] = state;
    return LC_OK;
}
int gcl_session_service_is_open(gcl_session *session, int32_t service) {
    const gcl_admin *admin = session ? gcl_admin_of(session) : nullptr;
    // The service comes from the peer; it is compared before it is used as the number of a bit.
    return admin && service >= GCL_SERVICE_MIN && service <= GCL_SERVICE_MAX &&
           (admin->open_services >> service & 1u);
}
int32_t gcl_session_get_current_service(gcl_session *session) {
    const gcl_admin *admin = session ? gcl_admin_of(session) : nullptr;
    return admin ? admin->current_service : 0;
}
