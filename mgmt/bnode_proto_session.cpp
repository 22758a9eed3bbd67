// Messages on a session: body protocol 2, "bnode". It sends messages and passes received ones to the callback
// of their type. Its state is a record per instance (message ids, default callbacks) and one per session
// (service, callbacks).
//
// Everything here runs with the locks of the instance and of the session held, taken in that order; both are
// recursive. A callback may send on its session. It may also wait for an answer by running the loop, and then
// further messages of the session are received inside it, or the session is closed or freed. After a callback
// has returned, only the message is freed, and the session is not used any more.
#include <cstdlib>
#include <cstring>

#include "mgmt/bnode_proto.h"
#include "mgmt/gcl_wire.h"
#include "mgmt/owners.h"
#include "runtime/logging.h"

namespace {

struct bn_callback {
    bn_request_callback request; // of odd types
    bn_response_callback response;
    void *data;
};
constexpr uint16_t MSG_TYPES = bn_msg_event_ack + 1;

// One per instance.
struct bn_instance_state {
    uint32_t next_msg_id;
    uint32_t transactions;
    tstring *audit_user;
    bn_callback callbacks[MSG_TYPES];
};
// One per session.
struct bn_session_state {
    uint16_t service; // the session's bnode service, 0 until it is known
    bn_callback callbacks[MSG_TYPES];
};

bn_instance_state *instance_state(gcl *instance) {
    gcl_body_protocol *protocol = gcl_get_body_protocol(instance, BN_PROTO);
    return protocol ? static_cast<bn_instance_state *>(protocol->state) : nullptr;
}
bn_session_state *session_state(gcl_session *session) {
    return static_cast<bn_session_state *>(gcl_session_get_protocol_state(session, BN_PROTO));
}

// --- Callbacks

lc_status set_instance_callback(gcl *instance, uint16_t type, bn_callback callback) {
    CHECK_NULL(instance);
    bn_instance_state *state = instance_state(instance);
    CHECK_NULL(state);
    state->callbacks[type] = callback;
    return LC_OK;
}
lc_status set_session_callback(gcl_session *session, uint16_t type, bn_callback callback) {
    CHECK_NULL(session);
    const gcl_session_guard guard(session);
    bn_session_state *state = session_state(session);
    CHECK_NULL(state);
    state->callbacks[type] = callback;
    return LC_OK;
}

} // namespace

// Define bn_set_global_callback_query_request_msg, bn_set_session_callback_query_request_msg and so on.
#define BN_REQUEST_SETTERS(kind, type)                                                                       \
    lc_status bn_set_global_callback_##kind##_msg(gcl *instance, bn_request_callback callback, void *data) { \
        return set_instance_callback(instance, type, {callback, nullptr, data});                             \
    }                                                                                                        \
    lc_status bn_set_session_callback_##kind##_msg(gcl_session *session, bn_request_callback callback,       \
                                                   void *data) {                                             \
        return set_session_callback(session, type, {callback, nullptr, data});                               \
    }
#define BN_RESPONSE_SETTERS(kind, type)                                                                      \
    lc_status bn_set_global_callback_##kind##_msg(gcl *instance, bn_response_callback callback,              \
                                                  void *data) {                                              \
        return set_instance_callback(instance, type, {nullptr, callback, data});                             \
    }                                                                                                        \
    lc_status bn_set_session_callback_##kind##_msg(gcl_session *session, bn_response_callback callback,      \
                                                   void *data) {                                             \
        return set_session_callback(session, type, {nullptr, callback, data});                               \
    }
BN_REQUEST_SETTERS(query_request, bn_msg_query_request)
BN_RESPONSE_SETTERS(query_response, bn_msg_query_response)
BN_REQUEST_SETTERS(set_request, bn_msg_set_request)
BN_RESPONSE_SETTERS(set_response, bn_msg_set_response)
BN_REQUEST_SETTERS(action_request, bn_msg_action_request)
BN_RESPONSE_SETTERS(action_response, bn_msg_action_response)
BN_REQUEST_SETTERS(event_request, bn_msg_event)
BN_RESPONSE_SETTERS(event_response, bn_msg_event_ack)

// --- Sending

namespace {

// The service id of messages, which is the service that was opened last before the first message was sent.
uint16_t service_of(gcl_session *session) {
    bn_session_state *state = session_state(session);
    if (!state)
        return 0;
    if (state->service == 0)
        state->service = static_cast<uint16_t>(gcl_session_get_current_service(session));
    return state->service;
}

// Sets the message id, and the service and transaction id if they aren't set.
template <typename Message>
lc_status number_message(gcl_session *session, Message *msg) {
    bn_instance_state *state = instance_state(gcl_session_get_instance(session));
    CHECK_NULL(state);
    msg->msg_id = state->next_msg_id++;
    if (msg->service_id == 0)
        msg->service_id = service_of(session);
    // By definition the id that the next message will have; the peer doesn't check it.
    if (msg->transaction_id == 0) {
        msg->transaction_id = state->next_msg_id;
        state->transactions++;
    }
    return LC_OK;
}

bool is_session_connected(gcl_session *session) {
    int32_t state = GCL_SESSION_NONE;
    return gcl_session_get_state(session, &state, nullptr) == LC_OK && state == GCL_SESSION_CONNECTED;
}

// The differences between sending the two kinds of message.
struct request_sending {
    static constexpr const char *title = "SEND REQ", *word = "request";
    static constexpr auto serialize = bn_request_msg_serialize;
    static constexpr auto dump = bn_request_msg_dump;
};
struct response_sending {
    static constexpr const char *title = "SEND RESP", *word = "response";
    static constexpr auto serialize = bn_response_msg_serialize;
    static constexpr auto dump = bn_response_msg_dump;
};

lc_status add_audit_user(gcl_session *session, bn_request_msg *msg) {
    const bn_instance_state *state = instance_state(gcl_session_get_instance(session));
    const bool audited = msg->msg_type == bn_msg_set_request || msg->msg_type == bn_msg_action_request;
    // Only these two can change something.
    if (audited && state->audit_user && !msg->audit_user)
        CHECK_STATUS(ts_dup(state->audit_user, &msg->audit_user));
    return LC_OK;
}
lc_status add_audit_user(gcl_session *, bn_response_msg *) {
    return LC_OK;
}

template <typename Kind, typename Message>
lc_status send_message(gcl_session *session, Message *msg) {
    CHECK_NULL(session);
    CHECK_NULL(msg);
    const gcl_session_guard guard(session);
    CHECK_STATUS(number_message(session, msg));
    CHECK_STATUS(add_audit_user(session, msg));
    owned_tbuffer buffer;
    CHECK_STATUS(Kind::serialize(msg, BN_FRAME_HEADER_BYTES, &buffer.pointer));
    Kind::dump(session, msg, LC_LOG_DEBUG, Kind::title);
    if (!is_session_connected(session)) {
        LC_LOG(LC_LOG_INFO, "Dropping %s to non-connected session %d", Kind::word,
               gcl_session_get_id(session));
        return LC_OK;
    }
    const lc_status status = gcl_session_send_frame_components_tb(session, BN_PROTO, msg->msg_type,
                                                                  BN_FRAME_HEADER_BYTES, &buffer.pointer);
    if (status == LC_NO_BUFFER_SPACE)
        CHECK_QUIET(status); // larger than a frame, which has been logged
    CHECK_STATUS(status);
    return LC_OK;
}

// Replaces a response that doesn't fit. Without any response the peer would wait until its timeout.
lc_status send_refusal(gcl_session *session, const bn_response_msg *msg, lc_status reason) {
    owned_response refusal;
    CHECK_STATUS(
        bn_response_msg_create(&refusal.pointer, msg->msg_type, msg->response_to, LC_NO_BUFFER_SPACE,
                               reason == LC_NO_BUFFER_SPACE
                                   ? BN_TOO_LARGE
                                   : "The session's output queue is full: ask for less, or try again later"));
    // The same ids, so that the peer takes the refusal as the answer to its request.
    refusal.pointer->service_id = msg->service_id;
    refusal.pointer->msg_id = msg->msg_id;
    refusal.pointer->transaction_id = msg->transaction_id;
    owned_tbuffer buffer;
    CHECK_STATUS(bn_response_msg_serialize(refusal.pointer, BN_FRAME_HEADER_BYTES, &buffer.pointer));
    bn_response_msg_dump(session, refusal.pointer, LC_LOG_DEBUG, response_sending::title);
    CHECK_STATUS(gcl_session_send_refusal_tb(session, BN_PROTO, msg->msg_type, &buffer.pointer));
    return LC_OK;
}

} // namespace

lc_status bn_request_msg_send(gcl_session *session, bn_request_msg *msg) {
    return send_message<request_sending>(session, msg);
}
lc_status bn_response_msg_send(gcl_session *session, bn_response_msg *msg) {
    CHECK_NULL(session);
    // Held throughout, so that no other thread sends between the attempt and the refusal.
    const gcl_session_guard guard(session);
    const lc_status status = send_message<response_sending>(session, msg);
    if (status != LC_NO_BUFFER_SPACE && status != LC_CANCELLED)
        return status;
    return send_refusal(session, msg, status);
}

// --- Receiving

namespace {

const char *const kind_words[] = {"query", "set", "action", "event"};
const char *kind_word(uint16_t type) {
    return kind_words[(type - 1) / 2];
}

// The type in the frame header decides whether the body is a request or a response; the type in the message
// decides which callback is called. False, logged, if one of them is not a message type.
bool check_types(gcl_session *session, uint16_t mtype, uint16_t msg_type) {
    for (const uint16_t type : {mtype, msg_type}) {
        if (type >= bn_msg_query_request && type <= bn_msg_event_ack)
            continue;
        LC_LOG(LC_LOG_ERR, "session %d: proto bnode: invalid body message type %d",
               gcl_session_get_id(session), type);
        return false;
    }
    return true;
}

lc_status receive_request(gcl_session *session, uint16_t mtype, tbuffer **inout_frame) {
    owned_request msg;
    CHECK_STATUS(bn_request_msg_deserialize(*inout_frame, BN_FRAME_HEADER_BYTES, &msg.pointer));
    // The callback may run the loop for long; the frame's memory isn't needed any more.
    bn_request_msg_dump(session, msg.pointer, -1, "RECV REQ");
    (void)tb_free(inout_frame);
    const uint16_t type = msg.pointer->msg_type;
    if (!check_types(session, mtype, type))
        return LC_OK;
    const bn_session_state *state = session_state(session);
    CHECK_NULL(state);
    // A copy: the callback may free the session, and the state with it.
    const bn_callback callback = state->callbacks[type];
    if (!callback.request) {
        LC_LOG(LC_LOG_WARNING, "session %d: proto bnode: no %s request callback", gcl_session_get_id(session),
               kind_word(type));
        return LC_OK;
    }
    // What a callback returns doesn't affect the session: a request that can't be carried out is no reason to
    // close it.
    (void)callback.request(session, msg.pointer, callback.data);
    return LC_OK;
}

lc_status receive_response(gcl_session *session, uint16_t mtype, tbuffer **inout_frame) {
    constexpr int32_t HEADER_BYTES = 20;
    const int32_t id = gcl_session_get_id(session);
    CHECK_CONDITION(tb_length(*inout_frame) >= static_cast<int32_t>(BN_FRAME_HEADER_BYTES) + HEADER_BYTES);
    // The service is checked before anything is read, so that a message for another service costs nothing.
    be16 wire_service = {};
    memcpy(wire_service.bytes, tb_buf(*inout_frame) + BN_FRAME_HEADER_BYTES, sizeof wire_service);
    const uint16_t service = to_host(wire_service);
    if (!gcl_session_service_is_open(session, service)) {
        LC_LOG(LC_LOG_ERR, "session %d: service %d not open: %d", id, service,
               gcl_session_get_current_service(session));
        return LC_OK;
    }
    owned_response msg;
    CHECK_STATUS(bn_response_msg_deserialize(*inout_frame, BN_FRAME_HEADER_BYTES, &msg.pointer));
    bn_response_msg_dump(session, msg.pointer, -1, "RECV RESP");
    (void)tb_free(inout_frame);
    const uint16_t type = msg.pointer->msg_type;
    if (!check_types(session, mtype, type))
        return LC_OK;
    const bn_session_state *state = session_state(session);
    CHECK_NULL(state);
    const bn_callback callback = state->callbacks[type];
    if (!callback.response) {
        const char *text = msg.pointer->return_message ? ts_str(msg.pointer->return_message) : "";
        LC_LOG(LC_LOG_WARNING, "session %d: proto bnode: no %s response callback: code = %d msg = %s", id,
               kind_word(type), static_cast<int>(msg.pointer->return_code), text);
        return LC_OK;
    }
    (void)callback.response(session, msg.pointer, callback.data);
    return LC_OK;
}

lc_status receive_frame(gcl_session *session, gcl_body_protocol *protocol, tbuffer **inout_frame, void *) {
    CHECK_NULL(inout_frame);
    owned_tbuffer frame(*inout_frame);
    *inout_frame = nullptr;
    LC_LOG(LC_LOG_DEBUG, "session %d: proto bnode: in receive CATCHALL", gcl_session_get_id(session));
    CHECK_CONDITION(tb_length(frame.pointer) >= static_cast<int32_t>(BN_FRAME_HEADER_BYTES));
    CHECK_NULL(session_state(session));
    gcl_frame_header header;
    // The frame reader has converted the header to host order.
    memcpy(&header, tb_buf(frame.pointer), sizeof header);
    CHECK_CONDITION(header.proto == protocol->protocol);
    // An invalid type is handled like a request; check_types then refuses it without ending the session.
    const bool response =
        header.mtype % 2 == 0 && header.mtype >= bn_msg_query_response && header.mtype <= bn_msg_event_ack;
    CHECK_STATUS(response ? receive_response(session, header.mtype, &frame.pointer)
                          : receive_request(session, header.mtype, &frame.pointer));
    return LC_OK;
}

// --- The protocol

lc_status session_new(gcl_session *session, gcl_body_protocol *protocol) {
    const bn_instance_state *shared = static_cast<const bn_instance_state *>(protocol->state);
    CHECK_NULL(shared);
    owned<void, bn_free_memory> state(calloc(1, sizeof(bn_session_state)));
    CHECK_NULL(state.pointer);
    // From here on the session has its own copies; changes of the instance's callbacks affect later sessions
    // only.
    memcpy(static_cast<bn_session_state *>(state.pointer)->callbacks, shared->callbacks,
           sizeof shared->callbacks);
    CHECK_STATUS(gcl_session_set_protocol_state(session, BN_PROTO, state.pointer));
    (void)state.take();
    return LC_OK;
}

lc_status session_free(gcl_session *session, gcl_body_protocol *) {
    free(session_state(session));
    return gcl_session_set_protocol_state(session, BN_PROTO, nullptr);
}

} // namespace

lc_status gcl_bn_init(gcl *instance) {
    CHECK_NULL(instance);
    owned<void, bn_free_memory> state(calloc(1, sizeof(bn_instance_state)));
    CHECK_NULL(state.pointer);
    auto *shared = static_cast<bn_instance_state *>(state.pointer);
    shared->next_msg_id = 1;
    shared->transactions = 1;
    gcl_body_protocol protocol = {};
    protocol.protocol = BN_PROTO;
    strlcpy(protocol.name, "bnode", sizeof protocol.name);
    protocol.enabled = 1;
    protocol.session_new = session_new;
    protocol.session_free = session_free;
    // The catch-all: messages of all types are received in the same way.
    protocol.handlers[0] = {BN_PROTO, 0, receive_frame, nullptr};
    protocol.state = shared;
    CHECK_STATUS(gcl_register_body_protocol(instance, &protocol));
    (void)state.take();
    return LC_OK;
}

lc_status bn_deinit(gcl *instance) {
    gcl_body_protocol *protocol = gcl_get_body_protocol(instance, BN_PROTO);
    if (!protocol || !protocol->state)
        return LC_OK;
    auto *shared = static_cast<bn_instance_state *>(protocol->state);
    ts_release(shared->audit_user);
    free(shared);
    protocol->state = nullptr;
    return LC_OK;
}
