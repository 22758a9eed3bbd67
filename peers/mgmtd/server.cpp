// The messages of sessions: actions, set requests and events. Queries are in queries.cpp, commits in
// commits.cpp, alarms and roles in reports.cpp.
//
// Everything runs on one thread, called from the loop of the transport. A message is handled and answered
// before the next one is read, except for a query that has to wait for a daemon: it becomes a record in
// `pending`. Sending only appends to a queue of the transport.
//
// The transport decides whether the user of a session may change anything. A viewer gets answers without
// passwords, and events. The size of a request is bounded by that of a frame.
#include "peers/mgmtd/server.h"

#include <algorithm>

#include "mgmt/bnode_proto.h"
#include "mgmt/gcl.h"
#include "mgmt/node_paths.h"

namespace {

constexpr uint16_t SERVICE = 2;

} // namespace

// --- Sending

bool server_send_request(server *self, uint32_t peer_id, bn_request_msg *msg) {
    const auto found = self->peers.find(peer_id);
    if (!msg || found == self->peers.end())
        return false;
    msg->service_id = SERVICE;
    // A forwarded query has an id already, by which its answer is recognized.
    if (msg->msg_id == 0)
        msg->msg_id = found->second.next_message_id++;
    if (msg->transaction_id == 0)
        // As the client library numbers its own messages.
        msg->transaction_id = msg->msg_id + 1;
    owned_tbuffer frame;
    if (bn_request_msg_serialize(msg, BN_FRAME_HEADER_BYTES, &frame.pointer) != LC_OK)
        return false;
    if (frame.pointer->length > GCL_FRAME_MAX) {
        self->say("message to " + found->second.name + " left out: it is larger than a frame");
        return false;
    }
    self->send(peer_id, msg->msg_type, frame.take());
    return true;
}

namespace {

// A response without bindings, to be sent instead of one that is too large. Frees the bytes of that one.
tbuffer *make_refusal(const bn_response_msg *msg, const char *words, tbuffer *unsent) {
    tb_free(&unsent);
    owned_response refusal;
    if (bn_response_msg_create(&refusal.pointer, msg->msg_type, msg->response_to, LC_NO_BUFFER_SPACE,
                               words) != LC_OK)
        return nullptr;
    refusal.pointer->service_id = msg->service_id;
    refusal.pointer->msg_id = msg->msg_id;
    refusal.pointer->transaction_id = msg->transaction_id;
    tbuffer *frame = nullptr;
    (void)bn_response_msg_serialize(refusal.pointer, BN_FRAME_HEADER_BYTES, &frame);
    return frame;
}

} // namespace

bool server_send_response(server *self, uint32_t peer_id, bn_response_msg *msg, uint32_t transaction_id) {
    const auto found = self->peers.find(peer_id);
    if (!msg || found == self->peers.end())
        return false;
    msg->service_id = SERVICE;
    msg->msg_id = found->second.next_message_id++;
    msg->transaction_id = transaction_id;
    msg->db_revision_id = self->tree.revision;
    owned_tbuffer frame;
    // A request always gets a response, because the client waits for one.
    if (bn_response_msg_serialize(msg, BN_FRAME_HEADER_BYTES, &frame.pointer) != LC_OK ||
        frame.pointer->length > GCL_FRAME_MAX) {
        // The large frame is freed before the refusal is made.
        frame.pointer = make_refusal(msg, BN_TOO_LARGE, frame.take());
    } else if (self->fits && !self->fits(peer_id, frame.pointer->length)) {
        frame.pointer =
            make_refusal(msg, "Too much waits for you to read it: ask for less, or later", frame.take());
    }
    if (!frame.pointer)
        return false;
    self->send(peer_id, msg->msg_type, frame.take());
    return true;
}

namespace {

void send_answer(server *self, uint32_t peer_id, const bn_request_msg *request, uint32_t code,
                 const std::string &message) {
    owned_response response;
    if (bn_response_msg_create(&response.pointer, bn_request_msg_response_msg_type(request->msg_type),
                               request->msg_id, code, message.c_str()) == LC_OK)
        (void)server_send_response(self, peer_id, response.pointer, request->transaction_id);
}

bool wants_event(const peer &who, const std::string &event) {
    return std::any_of(who.interests.begin(), who.interests.end(),
                       [&](const interest &wish) { return wish.event == event; });
}

} // namespace

void server_send_event(server *self, const std::string &event, const std::vector<event_field> &fields) {
    std::vector<uint32_t> ids;
    for (const auto &[id, who] : self->peers)
        if (wants_event(who, event))
            ids.push_back(id);
    // A message for each receiver: the ids in it are those of the session.
    for (const uint32_t id : ids) {
        const owned_request msg(make_event(event, fields));
        (void)server_send_request(self, id, msg.pointer);
    }
}

void server_process_event(server *self, const std::string &event, const std::string &process) {
    self->say("process " + process + ": " + event);
    server_send_event(self, event, {{"process_name", {bn_type_str, process}}});
}

// --- Actions

struct action_answer {
    uint32_t code;
    std::string message;
};

namespace {

size_t count_interest_bytes(const interest &wish) {
    size_t bytes = wish.event.size();
    for (const std::string &pattern : wish.patterns)
        bytes += pattern.size() + sizeof(std::string);
    return bytes;
}

bool may_add_interest(const peer &who, const interest &wish) {
    size_t count = 1, bytes = count_interest_bytes(wish);
    for (const interest &old : who.interests)
        // An interest in the same event is replaced and needs no further room.
        if (old.event != wish.event) {
            count++;
            bytes += count_interest_bytes(old);
        }
    return count <= INTERESTS_MAX && bytes <= INTEREST_BYTES_MAX;
}

// The patterns are in fields "match/N/pattern". Their order does not matter.
action_answer add_interest(server *self, uint32_t peer_id, const std::vector<event_field> &fields) {
    interest wish;
    for (const event_field &field : fields) {
        const std::string &name = field.name;
        if (name == "event_name")
            wish.event = field.value.text;
        else if (name.starts_with("match/") && name.ends_with("/pattern"))
            wish.patterns.push_back(field.value.text);
        else
            return {LC_BAD_ARGUMENT, "An interest has no " + name};
    }
    node_name event;
    if (!parse_node_name(wish.event, &event))
        return {LC_BAD_ARGUMENT, "An interest needs an event_name"};
    for (const std::string &pattern : wish.patterns)
        if (node_name parsed; !parse_node_name(pattern, &parsed))
            return {LC_BAD_ARGUMENT, "No pattern: " + pattern};
    peer &who = self->peers[peer_id];
    if (!may_add_interest(who, wish))
        return {LC_NO_SPACE, "Too many interests, or too long ones, for one session"};
    std::erase_if(who.interests, [&](const interest &old) { return old.event == wish.event; });
    who.interests.push_back(std::move(wish));
    return {};
}

action_answer remove_interest(server *self, uint32_t peer_id, const std::vector<event_field> &fields) {
    const std::string *event = find_field(fields, "event_name");
    if (!event || std::erase_if(self->peers[peer_id].interests,
                                [&](const interest &old) { return old.event == *event; }) == 0)
        return {LC_NOT_FOUND, "No such interest"};
    return {};
}

// The end of a process, reported by the program that started it or by the process itself.
action_answer report_process(server *self, uint32_t, const std::vector<event_field> &fields) {
    static const std::map<std::string, const char *> events = {
        {"crash", EVENT_PROCESS_CRASH},
        {"unexpected_exit", EVENT_PROCESS_EXIT},
        {"terminate", EVENT_PROCESS_TERMINATE},
    };
    const std::string *process = find_field(fields, "process_name");
    const std::string *kind = find_field(fields, "event");
    const auto found = kind ? events.find(*kind) : events.end();
    if (!process || process->empty() || found == events.end())
        return {LC_BAD_ARGUMENT,
                "A report needs process_name and event: crash, unexpected_exit or terminate"};
    // Under --supervise the supervisor has seen the end itself. The reporter gets code 0 all the same.
    if (!self->is_news || self->is_news(*process))
        server_process_event(self, found->second, *process);
    return {};
}

action_answer report_time_zone(server *self, uint32_t, const std::vector<event_field> &) {
    self->say("time zone changed");
    server_send_event(self, EVENT_TIME_ZONE, {});
    return {};
}

action_answer confirm_commit(server *self, uint32_t peer_id, const std::vector<event_field> &) {
    const commit_result result = server_confirm(self, self->peers[peer_id].name);
    return {result.code, result.message};
}

template <uint32_t (*Run)(server *, const std::vector<event_field> &, std::string *)>
action_answer run_action(server *self, uint32_t, const std::vector<event_field> &fields) {
    action_answer out{};
    out.code = Run(self, fields, &out.message);
    return out;
}

const struct {
    const char *name;
    action_answer (*run)(server *self, uint32_t peer_id, const std::vector<event_field> &fields);
    bool looks = false; // changes nothing, and is allowed to viewers
} actions[] = {
    {ACTION_ADD_INTEREST, add_interest, true},
    {ACTION_REMOVE_INTEREST, remove_interest, true},
    {ACTION_CONFIRM, confirm_commit},
    {ACTION_REPORT_PROCESS, report_process},
    {"/mgmtd/time/actions/zonechange", report_time_zone},
    {ACTION_DRAIN, run_action<server_begin_drain>},
    {ACTION_DRAIN_CANCEL, run_action<server_cancel_drain>},
};

std::string read_text(const tstring *text) {
    return text ? ts_str(text) : "";
}

// False for a viewer, whose request has been refused then.
bool may_change(server *self, uint32_t peer_id, const bn_request_msg *msg) {
    const peer_owner &owner = self->peers[peer_id].owner;
    if (!owner.may_change)
        // Answered and not dropped, so that the client does not wait.
        send_answer(self, peer_id, msg, LC_BAD_LOGIN, owner.user + " may look, but not change anything");
    return owner.may_change;
}

void take_action(server *self, uint32_t peer_id, const bn_request_msg *msg) {
    const std::string name = read_text(msg->text);
    for (const auto &action : actions)
        if (name == action.name) {
            if (!action.looks && !may_change(self, peer_id, msg))
                return;
            const action_answer result = action.run(self, peer_id, fields_of(msg));
            send_answer(self, peer_id, msg, result.code, result.message);
            return;
        }
    send_answer(self, peer_id, msg, LC_NOT_FOUND, "No such action: " + name);
}

// --- Changes of the configuration

commit_order read_commit_order(const peer &who, const bn_request_msg *msg) {
    commit_order order;
    order.who = who.name;
    order.user = who.owner.user;
    if (const std::string person = read_text(msg->audit_user); !person.empty())
        // The kernel vouches for the user of the session, but nobody for this name; both are kept.
        order.user += " (" + person + ")";
    order.cause = read_text(msg->text);
    // The client's name is better than nothing in the list of commits.
    if (order.cause.empty())
        order.cause = who.name;
    order.check_only = msg->flags & bn_cf_check_only;
    order.ends_wait = msg->flags & bn_cf_ends_wait;
    order.revision = msg->number;
    order.confirm_minutes = msg->flags >> bn_cf_minutes_shift;
    return order;
}

void take_set(server *self, uint32_t peer_id, const bn_request_msg *msg) {
    constexpr uint32_t known = bn_cf_check_only | bn_cf_ends_wait | ~0u << bn_cf_minutes_shift;
    std::vector<set_step> steps;
    if (!may_change(self, peer_id, msg))
        return;
    // An unknown flag may be a condition of the commit and can't be ignored.
    if (msg->flags & ~known) {
        send_answer(self, peer_id, msg, LC_NOT_IMPLEMENTED,
                    "The request has commit flags that are not known");
        return;
    }
    const uint32_t count = bn_request_per_node_array_length_quick(msg->nodes);
    steps.reserve(count);
    for (uint32_t i = 0; i < count; i++) {
        const bn_request_node *node = bn_request_per_node_array_get_quick(msg->nodes, i);
        if (!node || !node->binding)
            continue;
        // A deletion may come without a value.
        const node_value value = value_of(node->binding);
        set_step step{set_kind::modify, name_of(node->binding), value.type, value.text};
        if (node->subop == bn_set_create)
            step.kind = set_kind::create;
        // The same for both: what has a default returns to it, and everything else is gone.
        else if (node->subop == bn_set_delete || node->subop == bn_set_reset)
            step.kind = set_kind::remove;
        else if (node->subop != bn_set_modify) {
            send_answer(self, peer_id, msg, LC_NOT_IMPLEMENTED,
                        step.name + ": nodes are created, modified, reset and deleted only");
            return;
        }
        steps.push_back(std::move(step));
    }
    const commit_result result = server_commit(self, steps, read_commit_order(self->peers[peer_id], msg));
    send_answer(self, peer_id, msg, result.code, result.message);
}

} // namespace

// --- Sessions and their messages

void server_peer_opened(server *self, uint32_t peer_id, const std::string &name, const peer_owner &owner) {
    peer &who = self->peers[peer_id];
    who.name = name;
    who.owner = owner;
    who.first_seen = ++self->peers_seen;
    self->say("session of " + name + " open");
    server_note_process(self, name);
    if (self->opened)
        self->opened(name);
}

void server_peer_closed(server *self, uint32_t peer_id) {
    const auto found = self->peers.find(peer_id);
    if (found == self->peers.end())
        return;
    // A copy, because the record is erased before the name is used.
    const std::string name = found->second.name;
    self->say("session of " + name + " closed");
    // Erased first: the checks below ask whether the daemon has another session, and events are not for this
    // one.
    self->peers.erase(found);
    if (self->closed)
        self->closed(name);
    server_note_process(self, name);
    // Collected first, because the answers change `pending`: a query may be forwarded to the next daemon.
    std::vector<pending_query> left;
    for (auto at = self->pending.begin(); at != self->pending.end();) {
        const auto query = at++;
        if (query->second.provider == peer_id)
            left.push_back(server_take_pending(self, query));
        // Nobody waits for it any more. A late answer of the daemon is ignored.
        else if (query->second.asker == peer_id)
            (void)server_take_pending(self, query);
    }
    for (const pending_query &query : left)
        server_answer_without(self, query, LC_IO_CLOSED, name + " ended its session before it answered");
    server_forget_reports(self, peer_id);
    server_orphan_left_groups(self, peer_id);
    server_orphan_weights(self, peer_id);
}

namespace {

void answer_late_queries(server *self) {
    const int64_t now = self->now_ms();
    std::vector<pending_query> late;
    for (auto at = self->pending.begin(); at != self->pending.end();) {
        const auto query = at++;
        if (query->second.deadline_ms <= now)
            late.push_back(server_take_pending(self, query));
    }
    for (const pending_query &query : late) {
        const auto provider = self->peers.find(query.provider);
        const std::string name = provider == self->peers.end() ? "the daemon" : provider->second.name;
        // The session continues: the daemon may only be slow, and wccpd exits when its session ends.
        self->say("query: no answer from " + name);
        server_note_answer(self, name, false);
        server_answer_without(self, query, LC_IO_TIMED_OUT, name + " did not answer in time");
    }
}

} // namespace

int64_t server_tick(server *self) {
    int64_t next = -1;
    answer_late_queries(self);
    keep_earlier(&next, server_drop_left_groups(self));
    keep_earlier(&next, server_return_unconfirmed(self));
    keep_earlier(&next, server_end_drains(self));
    keep_earlier(&next, server_expire_bypasses(self));
    keep_earlier(&next, server_clear_restart_alarms(self));
    for (const auto &[id, query] : self->pending) // last, because a query may have been forwarded meanwhile
        keep_earlier(&next, query.deadline_ms);
    return next;
}

namespace {

constexpr uint32_t FIELDS_MAX = 1024; // of an action or event: they are copied, and sent on to watchers

bool take_request(server *self, uint32_t peer_id, uint16_t mtype, const tbuffer *frame) {
    owned_request msg;
    // The type is in the frame header and in the message; handlers rely on both being the same.
    if (bn_request_msg_deserialize(frame, BN_FRAME_HEADER_BYTES, &msg.pointer) != LC_OK ||
        msg.pointer->msg_type != mtype)
        return false;
    const bool has_fields = mtype == bn_msg_action_request || mtype == bn_msg_event;
    if (has_fields && bn_request_per_node_array_length_quick(msg.pointer->nodes) > FIELDS_MAX) {
        send_answer(self, peer_id, msg.pointer, LC_BAD_ARGUMENT,
                    "more than " + std::to_string(FIELDS_MAX) + " fields");
        return true;
    }
    switch (mtype) {
    case bn_msg_query_request:
        server_answer_query(self, peer_id, msg.pointer);
        return true;
    case bn_msg_set_request:
        take_set(self, peer_id, msg.pointer);
        return true;
    case bn_msg_action_request:
        take_action(self, peer_id, msg.pointer);
        return true;
    case bn_msg_event:
        if (!may_change(self, peer_id, msg.pointer))
            return true;
        server_take_event(self, peer_id, read_text(msg.pointer->text), fields_of(msg.pointer));
        // An event is acknowledged in any case, also one that was ignored.
        send_answer(self, peer_id, msg.pointer, 0, "");
        return true;
    default:
        return false;
    }
}

} // namespace

bool server_take_frame(server *self, uint32_t peer_id, uint16_t mtype, const tbuffer *frame) {
    if (!self->peers.contains(peer_id) || mtype < bn_msg_query_request || mtype > bn_msg_event_ack)
        return false;
    if (mtype % 2 == 1) // requests have odd types
        return take_request(self, peer_id, mtype, frame);
    owned_response msg;
    if (bn_response_msg_deserialize(frame, BN_FRAME_HEADER_BYTES, &msg.pointer) != LC_OK)
        return false;
    // Other responses answer mgmtd's events. They are read, because a malformed one ends the session, and not
    // used.
    if (mtype == bn_msg_query_response)
        server_take_monitor_answer(self, peer_id, msg.pointer, frame->length);
    return true;
}
