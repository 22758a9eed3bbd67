// A session of the project's client library, driven by a loop in this file over the library's list of
// descriptors, which is all that the library needs of its host.
//
// There is one thread. Every wait is a series of rounds. A round polls the descriptors of the list and calls
// their functions. These read frames and call the callbacks below, which convert an answer or an event to
// text at once and keep no object of the library. A wait ends when its condition holds, when the session is
// lost, at its deadline, or after a signal that ends the program (ctl_stop_signal). These signals are blocked
// from the check of that variable until ppoll unblocks them, so that none is missed in between.
//
// The library logs failures. At a terminal these lines would only repeat the reason that is given here, and
// the log is therefore suspended for the life of the process.
//
// A reason is one sentence without a period: what is wrong, and where to look.
#include "peers/mgmtctl/session.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <ctime>
#include <deque>
#include <memory>

#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include "mgmt/bnode_proto.h"
#include "mgmt/gcl.h"
#include "mgmt/node_paths.h"
#include "peers/nodes/binding_text.h"
#include "peers/nodes/provider_path.h"
#include "runtime/fdintrcb.h"
#include "runtime/logging.h"
#include "runtime/ttime.h"

namespace {
constexpr int32_t SERVICE = 2;
} // namespace

volatile std::sig_atomic_t ctl_stop_signal;

struct ctl_session {
    int64_t timeout_ms;
    fdic *interests = nullptr;
    gcl *instance = nullptr;
    gcl_session *session = nullptr;
    uint32_t awaited = 0; // message id of the request that waits for its answer, 0: none
    bool answered = false;
    bool quiet = false; // queries are not logged above debug level
    ctl_reply reply;
    std::deque<ctl_event> events;

    explicit ctl_session(int64_t limit_ms) : timeout_ms(limit_ms) {}
    ctl_session(const ctl_session &) = delete;
    ctl_session &operator=(const ctl_session &) = delete;
    ~ctl_session() {
        (void)gcl_deinit(&instance);
        (void)fdic_deinit(&interests);
    }
};

namespace {
bool set_reason(std::string *out_reason, const std::string &reason) {
    if (out_reason)
        *out_reason = reason;
    return false;
}

// --- Rounds

bool is_connected(const ctl_session *self) {
    int32_t state = GCL_SESSION_NONE;
    return gcl_session_get_state(self->session, &state, nullptr) == LC_OK && state == GCL_SESSION_CONNECTED;
}

lc_status nothing_to_note(const fdic_event_array *, void *) {
    return LC_OK; // each round reads the list again
}

void call_ready(const fdic_event_array *events, const std::vector<pollfd> &polled) {
    constexpr short broken = POLLERR | POLLHUP | POLLNVAL;
    for (uint32_t i = 0; i < polled.size(); i++) {
        const fdic_event *event = fdic_event_array_get_quick(events, i);
        // After an error or a hang-up, the functions find the cause by reading or writing.
        if ((polled[i].revents & (POLLIN | broken)) && event->want_read && event->read_function)
            (void)event->read_function(event->fd, FDIC_READABLE, event->user_data, event->read_argument);
        if ((polled[i].revents & (POLLOUT | broken)) && event->want_write && event->write_function)
            (void)event->write_function(event->fd, FDIC_WRITABLE, event->user_data, event->write_argument);
    }
}

struct blocked_signals {
    sigset_t before;
    blocked_signals() {
        sigset_t stop;
        sigemptyset(&stop);
        for (const int number : {SIGINT, SIGTERM, SIGHUP})
            sigaddset(&stop, number);
        sigprocmask(SIG_BLOCK, &stop, &before);
    }
    ~blocked_signals() { sigprocmask(SIG_SETMASK, &before, nullptr); }
    blocked_signals(const blocked_signals &) = delete;
    blocked_signals &operator=(const blocked_signals &) = delete;
};

enum class round { ran, over, interrupted };

// One poll until `deadline` (-1: no limit). Calls the functions of the descriptors that are ready. It also
// ends when `other_fd` can be read.
round run_round(ctl_session *self, int64_t deadline, int other_fd = -1) {
    const blocked_signals blocked;
    if (ctl_stop_signal)
        return round::interrupted;
    owned<fdic_event_array, fdic_event_array_release> events;
    if (fdic_events_query(self->interests, &events.pointer) != LC_OK)
        return round::over;
    std::vector<pollfd> polled(fdic_event_array_length_quick(events.pointer));
    for (uint32_t i = 0; i < polled.size(); i++) {
        const fdic_event *event = fdic_event_array_get_quick(events.pointer, i);
        // poll ignores a negative descriptor. Timers therefore keep their places, and both lists stay
        // parallel.
        polled[i].fd = event->has_fd ? event->fd : -1;
        polled[i].events =
            static_cast<short>((event->want_read ? POLLIN : 0) | (event->want_write ? POLLOUT : 0));
    }
    polled.push_back({other_fd, POLLIN, 0});
    const int64_t left = deadline < 0 ? 0 : std::max<int64_t>(deadline - lt_monotonic_ms(), 0);
    const timespec limit = {static_cast<time_t>(left / 1000), static_cast<long>(left % 1000 * 1000000)};
    const int ready = ppoll(polled.data(), polled.size(), deadline < 0 ? nullptr : &limit, &blocked.before);
    if (ready < 0)
        return errno == EINTR ? round::interrupted : round::over;
    const bool other_ready = polled.back().revents != 0;
    polled.pop_back();
    if (ready > 0)
        call_ready(events.pointer, polled);
    return ready == 0 || other_ready ? round::over : round::ran;
}

// Runs rounds until `done`, within the session's time limit.
template <typename Done>
bool wait_for(ctl_session *self, const char *what, Done done, std::string *out_reason) {
    const int64_t deadline = lt_monotonic_ms() + self->timeout_ms;
    while (!done()) {
        if (!is_connected(self))
            return set_reason(out_reason, std::string("mgmtd closed the session ") + what);
        const round result = run_round(self, deadline);
        // At the deadline; or poll itself has failed.
        if (result == round::over) {
            std::string seconds = std::to_string(self->timeout_ms / 1000);
            if (self->timeout_ms % 1000)
                // The added 1000 keeps the zeros of the three digits; its own digit is cut off.
                seconds += "." + std::to_string(self->timeout_ms % 1000 + 1000).substr(1);
            return set_reason(out_reason, "mgmtd gave no answer in " + seconds + " s");
        }
        // Another signal, for example a change of the window's size, does not end the wait.
        if (result == round::interrupted && ctl_stop_signal)
            return set_reason(out_reason, "interrupted");
    }
    return true;
}

// --- Answers and events

std::vector<ctl_binding> bindings_text(const std::vector<event_field> &fields) {
    std::vector<ctl_binding> out;
    out.reserve(fields.size());
    for (const event_field &field : fields)
        out.push_back({field.name, type_name(field.value.type), field.value.text});
    return out;
}

lc_status take_response(gcl_session *, bn_response_msg *msg, void *data) {
    auto *self = static_cast<ctl_session *>(data);
    if (self->awaited == 0 || msg->response_to != self->awaited)
        return LC_OK; // the answer to a request that has timed out
    self->awaited = 0;
    self->answered = true;
    self->reply = {msg->return_code, msg->return_message ? ts_str(msg->return_message) : "",
                   bindings_text(fields_of(msg)), msg->db_revision_id};
    return LC_OK;
}

lc_status take_event(gcl_session *, bn_request_msg *msg, void *data) {
    auto *self = static_cast<ctl_session *>(data);
    self->events.push_back({msg->text ? ts_str(msg->text) : "", bindings_text(fields_of(msg))});
    return LC_OK;
}

// --- Opening

const char *const ALLOWED = "only root, the user that mgmtd runs as and the group wccpd may use it";

// The library reports these cases as one error, after it has made a directory and a socket. They are checked
// before that, to tell them apart.
bool somebody_listens(std::string *out_reason) {
    const std::string path = provider_path();
    // Other errors, such as a directory that may not be entered, are left to access().
    struct stat about = {};
    if (stat(path.c_str(), &about) != 0 && (errno == ENOENT || errno == ENOTDIR))
        return set_reason(out_reason, "mgmtd is not running (nothing listens at " + path + ")");
    if (access(path.c_str(), W_OK) != 0)
        return set_reason(out_reason, path + ": " + strerror(errno) + "; " + ALLOWED);
    // Anybody can create the directory in /tmp before mgmtd does, and listen there.
    if (about.st_uid != 0 && about.st_uid != geteuid())
        return set_reason(out_reason, path + " belongs to user " + std::to_string(about.st_uid) +
                                          "; only root's mgmtd and our own user's are trusted");
    return true;
}

lc_status make_instance(ctl_session *self) {
    CHECK_QUIET(fdic_init(&self->interests, nothing_to_note, nullptr));
    CHECK_QUIET(gcl_init(&self->instance, nullptr, self->interests));
    CHECK_QUIET(bn_set_global_callback_query_response_msg(self->instance, take_response, self));
    CHECK_QUIET(bn_set_global_callback_set_response_msg(self->instance, take_response, self));
    CHECK_QUIET(bn_set_global_callback_action_response_msg(self->instance, take_response, self));
    CHECK_QUIET(bn_set_global_callback_event_request_msg(self->instance, take_event, self));
    // The kernel names the socket, because users who may only look cannot create one in mgmtd's directory.
    const sockaddr unnamed = {AF_UNIX, ""};
    return gcl_session_client_new(self->instance, "mgmtctl", &unnamed, sizeof unnamed.sa_family,
                                  &self->session);
}

bool connect_to_mgmtd(ctl_session *self, std::string *out_reason) {
    const lc_status made = make_instance(self);
    if (made != LC_OK)
        return set_reason(out_reason, "a session can't be made: " +
                                          std::string(lc_enum_to_string_quiet(lc_status_table, made)));
    switch (gcl_session_client_connect_by_provider(self->session, "mgmtd", 0)) {
    case LC_OK:
        return true;
    // The socket is there, but nobody listens: mgmtd was killed.
    case LC_IO_ERROR:
        return set_reason(out_reason, "mgmtd is not running (nothing listens at " + provider_path() + ")");
    default:
        return set_reason(out_reason, "mgmtd can't be reached: " + std::string(strerror(errno)));
    }
}

bool open_service(ctl_session *self, std::string *out_reason) {
    const auto stage = [self] {
        int32_t state = 0;
        (void)gcl_session_get_state(self->session, nullptr, &state);
        return state;
    };
    if (!wait_for(
            self, "before it was open", [&] { return stage() == GCL_ADMIN_GREETED; }, out_reason))
        return false;
    // A service can be requested only after the greeting.
    if (gcl_session_client_open_service(self->session, BN_PROTO, SERVICE, nullptr, 0) != LC_OK ||
        !wait_for(
            self, "before it was open", [&] { return stage() == GCL_ADMIN_OPEN_ANSWERED; }, out_reason))
        return is_connected(self) ? false
                                  : set_reason(out_reason, "mgmtd closed the session before it was open");
    // The answer may be a refusal.
    if (!gcl_session_service_is_open(self->session, SERVICE))
        return set_reason(out_reason, "mgmtd refuses its service to us");
    return true;
}
} // namespace

ctl_session *ctl_open(int64_t timeout_ms, std::string *out_reason) {
    (void)lc_init();
    G_logging_suspended = 1;
    auto self = std::make_unique<ctl_session>(timeout_ms);
    if (!somebody_listens(out_reason) || !connect_to_mgmtd(self.get(), out_reason) ||
        !open_service(self.get(), out_reason))
        return nullptr;
    return self.release();
}

void ctl_query_quietly(ctl_session *session) {
    session->quiet = true;
}

void ctl_close(ctl_session *session) {
    delete session;
}

// --- Requests

namespace {
bool send_request(ctl_session *self, bn_request_msg *msg, ctl_reply *out, std::string *out_reason) {
    // If the session is lost, the wait below reports that.
    if (bn_request_msg_send(self->session, msg) != LC_OK && is_connected(self))
        return set_reason(out_reason, "the request is too large for one message");
    self->awaited = msg->msg_id;
    self->answered = false;
    const bool came = wait_for(
        self, "during the request", [self] { return self->answered; }, out_reason);
    self->awaited = 0;
    *out = std::move(self->reply);
    self->reply = {};
    return came;
}

bool set_no_memory(std::string *out_reason) {
    return set_reason(out_reason, "the request can't be made");
}
} // namespace

bool ctl_query(ctl_session *session, ctl_walk walk, const std::string &name, ctl_reply *out,
               std::string *out_reason) {
    return ctl_query_all(session, walk, {name}, out, out_reason);
}

bool ctl_query_all(ctl_session *session, ctl_walk walk, const std::vector<std::string> &names, ctl_reply *out,
                   std::string *out_reason) {
    uint32_t flags = 0;
    if (walk == ctl_walk::subtree || walk == ctl_walk::leaves)
        flags |= bn_qf_subtree | bn_qf_include_self;
    if (walk == ctl_walk::leaves)
        flags |= bn_qf_leaves_only;
    if (session->quiet)
        flags |= bn_qf_quiet;
    const uint32_t subop = walk == ctl_walk::node ? bn_query_get : bn_query_iterate;
    owned_request msg;
    if (bn_query_request_msg_create(&msg.pointer, 0, nullptr) != LC_OK)
        return set_no_memory(out_reason);
    for (const std::string &name : names)
        if (bn_query_request_msg_append_str(msg.pointer, subop, flags, name.c_str(), nullptr) != LC_OK)
            return set_no_memory(out_reason);
    return send_request(session, msg.pointer, out, out_reason);
}

namespace {
// A value without a type, or one that does not fit its type, is sent as a string: mgmtd checks it and names
// the values that it accepts.
bn_binding *make_value(const ctl_binding &from) {
    uint32_t type = bn_type_str;
    owned_attrib fits;
    if (!type_named(from.type, &type) ||
        bn_attrib_new_str(&fits.pointer, bn_attrib_value, type, 0, from.value.c_str()) != LC_OK)
        type = bn_type_str;
    // `fits` was only a trial.
    return make_binding(from.name, {type, from.value});
}

// The person who called sudo; mgmtd itself knows only that the user is root.
lc_status add_person(bn_request_msg *msg) {
    const char *person = geteuid() == 0 ? getenv("SUDO_USER") : nullptr;
    return person && *person ? ts_new_str(&msg->audit_user, person) : LC_OK;
}
} // namespace

bool ctl_set(ctl_session *session, const std::vector<ctl_change_item> &items, const ctl_order &order,
             ctl_reply *out, std::string *out_reason) {
    // In the order of ctl_change.
    static constexpr uint32_t subops[] = {bn_set_create, bn_set_modify, bn_set_delete, bn_set_reset};
    owned_request msg;
    const uint32_t flags = (order.check_only ? bn_cf_check_only : 0u) |
                           (order.ends_wait ? bn_cf_ends_wait : 0u) |
                           order.confirm_minutes << bn_cf_minutes_shift;
    if (bn_set_request_msg_create(&msg.pointer, flags) != LC_OK || add_person(msg.pointer) != LC_OK)
        return set_no_memory(out_reason);
    (void)ts_free(&msg.pointer->text);
    if (ts_new_str(&msg.pointer->text, order.cause.c_str()) != LC_OK)
        return set_no_memory(out_reason);
    msg.pointer->number = order.revision;
    for (const ctl_change_item &item : items) {
        owned_binding binding(make_value(item.binding));
        if (!binding.pointer ||
            bn_set_request_msg_append_binding_takeover(msg.pointer, subops[static_cast<size_t>(item.change)],
                                                       0, &binding.pointer, nullptr) != LC_OK)
            return set_no_memory(out_reason);
    }
    return send_request(session, msg.pointer, out, out_reason);
}

bool ctl_action(ctl_session *session, const std::string &name, const std::vector<ctl_binding> &bindings,
                ctl_reply *out, std::string *out_reason) {
    owned_request msg;
    if (bn_action_request_msg_create(&msg.pointer, name.c_str()) != LC_OK)
        return set_no_memory(out_reason);
    for (const ctl_binding &from : bindings) {
        owned_binding binding(make_value(from));
        if (!binding.pointer ||
            bn_action_request_msg_append_binding_takeover(msg.pointer, 0, &binding.pointer, nullptr) != LC_OK)
            return set_no_memory(out_reason);
    }
    return send_request(session, msg.pointer, out, out_reason);
}

bool ctl_add_interest(ctl_session *session, const std::string &event,
                      const std::vector<std::string> &patterns, std::string *out_reason) {
    std::vector<ctl_binding> bindings = {{"event_name", "name", event}};
    for (size_t i = 0; i < patterns.size(); i++)
        bindings.push_back({"match/" + std::to_string(i + 1) + "/pattern", "string", patterns[i]});
    ctl_reply reply;
    if (!ctl_action(session, ACTION_ADD_INTEREST, bindings, &reply, out_reason))
        return false;
    return reply.code == 0 || set_reason(out_reason, reply.message);
}

int ctl_next_event(ctl_session *session, int64_t wait_ms, ctl_event *out, std::string *out_reason,
                   int other_fd) {
    const int64_t deadline = wait_ms < 0 ? -1 : lt_monotonic_ms() + wait_ms;
    while (session->events.empty()) {
        if (!is_connected(session)) {
            set_reason(out_reason, "mgmtd closed the session");
            return -1;
        }
        // An event that came with the last round is delivered, although the time is over.
        if (run_round(session, deadline, other_fd) != round::ran && session->events.empty())
            return 0;
    }
    *out = std::move(session->events.front());
    session->events.pop_front();
    return 1;
}
