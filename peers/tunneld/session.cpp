// The session with mgmtd, on the program's event loop. Nothing here waits: opening the session, sending a
// request and processing its answer are separate steps of the loop, so that the mailbox is served even if
// mgmtd is slow or stopped. The library's callbacks run with its locks held and only store what was received;
// advance_session(), called by the timer without a lock, does the rest.
//
// The configuration is read as a whole when the session has opened and after each change. It is small, and
// there is only one way to apply it. wccpd's state has no change event. It is queried after a change of the
// configuration or of a role, when the caller asks for it (tunnels are added with new routers), every few
// seconds while part of it is missing, and otherwise every 30 seconds.
//
// When the session is lost, what was received stays valid. A router that wccpd no longer lists is kept for as
// long as the tunnels of a restarted wccpd, since a new wccpd contacts its routers again.
#include "peers/tunneld/session.h"

#include <algorithm>
#include <memory>

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <unistd.h>

#include "mgmt/bnode_proto.h"
#include "mgmt/gcl.h"
#include "mgmt/mdc_main.h"
#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "peers/nodes/binding_text.h"
#include "peers/nodes/provider_path.h"
#include "peers/nodes/schema.h"
#include "peers/tunneld/session_config.h"
#include "runtime/event_fdintrcb.h"
#include "runtime/logging.h"
#include "runtime/ttime.h"

namespace {
constexpr int32_t SERVICE = 2;
constexpr int64_t RETRY_MS = 1000;        // between attempts to connect
constexpr int64_t OPENING_STEP_MS = 10;   // between the first looks at a session that is being opened
constexpr int64_t OPENING_MAX_MS = 10000; // for the whole opening
constexpr int64_t ANSWER_MAX_MS = 15000;  // after which a request is sent again
// The time between queries about routers. It starts with the first value after a possible change and doubles
// with each query: always up to the second value, and up to the third while something is missing. When
// nothing is missing, it is the fourth.
constexpr int64_t ROUTERS_FIRST_MS = 50, ROUTERS_SETTLED_MS = 1000, ROUTERS_MISSING_MS = 5000,
                  ROUTERS_KNOWN_MS = 30000;
constexpr int64_t OWNERS_MS = 2000;       // between queries about the owners of slots
constexpr int64_t ROUTER_KEPT_MS = 60000; // since wccpd has last listed it
constexpr int64_t NEVER = INT64_MAX;
constexpr size_t REASON_MAX = 256;
// Groups whose routers are queried with one request. wccpd answers no other request meanwhile; with 32
// routers each, it needs some 20 ms for these.
constexpr size_t GROUPS_AT_ONCE = 8;

struct known_router {
    group_router router;
    int64_t seen_ms;
};
struct request {
    uint32_t id = 0; // of the message that waits for an answer, or 0
    int64_t deadline_ms = 0;
};
using known_routers = std::map<std::pair<uint8_t, uint32_t>, known_router>; // by group and router id
} // namespace

struct mgmt_link {
    session_callbacks callbacks;
    fdic_libevent *bridge = nullptr;
    fdic *interests = nullptr;
    gcl *instance = nullptr;
    gcl_session *session = nullptr;
    loop_event *timer = nullptr;
    enum { closed, greeting, opening, open } stage = closed;
    uint32_t sessions = 0;
    int64_t connect_at_ms = 0, opened_ms = 0; // `opened_ms`: when the opening began

    request configuration, groups, routers, owners; // that wait for an answer
    int64_t read_at_ms = NEVER, ask_routers_at_ms = NEVER, ask_wait_ms = ROUTERS_FIRST_MS;
    int64_t ask_owners_at_ms = NEVER;
    bool routers_are_due = false;      // to be queried when the list of groups has arrived
    std::vector<node_name> unasked;    // groups that further queries are about
    std::vector<event_field> gathered; // the answers to earlier ones
    // Answers that advance_session() has yet to process, one for each of the requests above.
    std::vector<event_field> configured, listed, states, owned;
    bool has_configured = false, has_listed = false, has_states = false, has_owned = false;

    bool announced = false; // the caller has been called with `view` in this session
    configured_view view;
    std::map<uint8_t, size_t> expected; // number of configured routers by group, of groups that are up
    known_routers known;
    std::map<uint8_t, group_role> roles;
    std::vector<std::string> complaints;
};

namespace {
void advance_soon(mgmt_link *link) {
    LOG_STATUS(loop_event_set_timer(link->timer, 0));
}

// --- Requests

bool send_request(mgmt_link *link, bn_request_msg *msg, request *out) {
    if (bn_request_msg_send(link->session, msg) != LC_OK)
        return false;
    if (out)
        *out = {msg->msg_id, lt_monotonic_ms() + ANSWER_MAX_MS};
    return true;
}

bool send_queries(mgmt_link *link, uint32_t what, const std::vector<std::string> &names, uint32_t flags,
                  request *out, const std::vector<std::string> &single_nodes = {}) {
    owned_request msg;
    if (bn_query_request_msg_create(&msg.pointer, 0, nullptr) != LC_OK)
        return false;
    // bn_qf_quiet: the queries are repeated all the time, and wccpd does not log them at level info.
    for (const std::string &node : single_nodes)
        if (bn_query_request_msg_append_str(msg.pointer, bn_query_get, bn_qf_quiet, node.c_str(), nullptr) !=
            LC_OK)
            return false;
    for (const std::string &name : names)
        if (bn_query_request_msg_append_str(msg.pointer, what, flags | bn_qf_quiet, name.c_str(), nullptr) !=
            LC_OK)
            return false;
    return send_request(link, msg.pointer, out);
}

bool send_walks(mgmt_link *link, const std::vector<std::string> &roots, uint32_t flags, request *out) {
    return send_queries(link, bn_query_iterate, roots, flags, out);
}

bool send_interest(mgmt_link *link, const char *event, std::initializer_list<const char *> patterns) {
    owned_request msg;
    uint32_t number = 0;
    if (bn_action_request_msg_create(&msg.pointer, ACTION_ADD_INTEREST) != LC_OK ||
        bn_action_request_msg_append_new_binding(msg.pointer, 0, "event_name", bn_type_name, event,
                                                 nullptr) != LC_OK)
        return false;
    for (const char *pattern : patterns) {
        const std::string name = "match/" + std::to_string(++number) + "/pattern";
        if (bn_action_request_msg_append_new_binding(msg.pointer, 0, name.c_str(), bn_type_str, pattern,
                                                     nullptr) != LC_OK)
            return false;
    }
    return send_request(link, msg.pointer, nullptr);
}

void send_event(mgmt_link *link, const char *name, const std::vector<event_field> &fields) {
    owned_request msg;
    // The answer to an event is not waited for: a report that is lost is repeated in the next session.
    if (link->stage != mgmt_link::open || bn_event_request_msg_create(&msg.pointer, name) != LC_OK)
        return;
    for (const event_field &field : fields) {
        owned_binding binding(make_binding(field.name, field.value));
        if (!binding.pointer ||
            bn_event_request_msg_append_binding_takeover(msg.pointer, 0, &binding.pointer, nullptr) != LC_OK)
            return;
    }
    (void)send_request(link, msg.pointer, nullptr);
}

void ask_routers_now(mgmt_link *link) {
    link->ask_routers_at_ms = link->ask_owners_at_ms = lt_monotonic_ms();
    link->ask_wait_ms = ROUTERS_FIRST_MS;
}

// --- Answers and events
//
// The callbacks are called by the library with its locks held.

void log_complaints(mgmt_link *link, std::vector<std::string> complaints) {
    if (complaints != link->complaints)
        for (const std::string &line : complaints)
            LC_LOG(LC_LOG_WARNING, "%s", line.c_str());
    link->complaints = std::move(complaints);
}

// False when the message is not the answer to `waiting`. `out_came`: it is one with nodes, not a refusal.
bool take_answer(request *waiting, const bn_response_msg *msg, std::vector<event_field> *out,
                 bool *out_came) {
    // The answer to a request that was given up has a number that nothing waits for any more.
    if (waiting->id == 0 || msg->response_to != waiting->id)
        return false;
    waiting->id = 0;
    *out_came = msg->return_code == LC_OK;
    if (*out_came)
        *out = fields_of(msg);
    return true;
}

lc_status take_response(gcl_session *, bn_response_msg *msg, void *data) {
    auto *link = static_cast<mgmt_link *>(data);
    if (take_answer(&link->configuration, msg, &link->configured, &link->has_configured)) {
        if (!link->has_configured) { // for example when this program has not read from the session for long
            log_complaints(link, {std::string("The configuration was refused: ") +
                                  (msg->return_message ? ts_str(msg->return_message) : "")});
            // A change that was announced meanwhile may already have set an earlier time.
            link->read_at_ms = std::min(link->read_at_ms, lt_monotonic_ms() + RETRY_MS);
        }
        advance_soon(link);
    } else if (take_answer(&link->groups, msg, &link->listed, &link->has_listed) ||
               take_answer(&link->routers, msg, &link->states, &link->has_states) ||
               take_answer(&link->owners, msg, &link->owned, &link->has_owned)) {
        advance_soon(link);
    }
    return LC_OK;
}

lc_status ignore_response(gcl_session *, bn_response_msg *, void *) {
    return LC_OK;
}

lc_status take_event(gcl_session *, bn_request_msg *msg, void *data) {
    auto *link = static_cast<mgmt_link *>(data);
    const std::string name = msg->text ? ts_str(msg->text) : "";
    // Every event can mean other routers or roles. Only these two mean another configuration.
    if (name == EVENT_CONFIG_CHANGE || name == EVENT_DRAIN)
        link->read_at_ms = lt_monotonic_ms();
    ask_routers_now(link);
    advance_soon(link);
    return LC_OK;
}

// --- State queries

using state_tree = std::map<node_name, const state_node *>; // null: a node without a value, above others

state_tree build_state_tree(const std::vector<state_node> &nodes) {
    state_tree out;
    for (const state_node &node : nodes) {
        node_name name = parsed_name(node.name);
        if (name.parts.empty())
            continue;
        out[name] = &node;
        // A walk needs the nodes above as well, which the list does not have.
        for (name.parts.pop_back(); !name.parts.empty(); name.parts.pop_back())
            out.try_emplace(name, nullptr);
    }
    return out;
}

// A node that is one of many instances has no value of its own: its value is the last part of its name.
bool is_one_of_many(const node_name &name) {
    static const node_name patterns[] = {
        parsed_name(NODE_TUNNEL_STATE "/*"), parsed_name(NODE_INTERCEPT_STATE "/*"),
        parsed_name(NODE_PROTECTION_STATE "/group/*"), parsed_name(NODE_PROTECTION_STATE "/member/*")};
    return std::any_of(std::begin(patterns), std::end(patterns),
                       [&](const node_name &pattern) { return matches_pattern(pattern, name); });
}

lc_status get_state(const char *name, const tstr_array *, void *data, bn_binding_array *out) {
    const auto *tree = static_cast<const state_tree *>(data);
    const node_name wanted = parsed_name(name);
    const auto found = tree->find(wanted);
    if (found == tree->end() || (!found->second && !is_one_of_many(wanted)))
        return LC_OK;
    const node_value value = found->second ? node_value{found->second->type, found->second->text}
                                           : node_value{bn_type_str, wanted.parts.back()};
    owned_binding binding(make_binding(name, value));
    CHECK_NULL(binding.pointer);
    CHECK_STATUS(bn_binding_array_append_takeover(out, &binding.pointer));
    return LC_OK;
}

lc_status iterate_state(const char *name, const tstr_array *, void *data, tstr_array *out) {
    const auto *tree = static_cast<const state_tree *>(data);
    const node_name above = parsed_name(name);
    // In the order of the map, everything below a node follows it directly.
    for (auto at = tree->upper_bound(above); at != tree->end() && at->first.is_under(above); ++at)
        if (at->first.parts.size() == above.parts.size() + 1)
            CHECK_STATUS(tstr_array_append_str(out, at->first.parts.back().c_str()));
    return LC_OK;
}

lc_status take_query(gcl_session *session, bn_request_msg *msg, void *data) {
    auto *link = static_cast<mgmt_link *>(data);
    const std::vector<state_node> nodes = link->callbacks.state();
    state_tree tree = build_state_tree(nodes);
    CHECK_STATUS(mdc_dispatch_mon_request(session, msg, get_state, &tree, iterate_state, &tree));
    return LC_OK;
}

// --- The session

lc_status take_close(int, uint32_t, void *, void *data) {
    advance_soon(static_cast<mgmt_link *>(data));
    return LC_OK;
}

void drop_session(mgmt_link *link) {
    if (link->stage == mgmt_link::open)
        LC_LOG(LC_LOG_NOTICE, "Session with mgmtd lost; tunnels and intercepts stay as they are");
    link->stage = mgmt_link::closed;
    LOG_STATUS(gcl_session_free(&link->session));
    // Nothing is asked again: the next session reads everything anew.
    link->configuration = link->groups = link->routers = link->owners = {};
    link->has_configured = link->has_listed = link->has_states = link->has_owned = link->announced = false;
    link->read_at_ms = link->ask_routers_at_ms = link->ask_owners_at_ms = NEVER;
    link->connect_at_ms = lt_monotonic_ms() + RETRY_MS;
}

// Logs nothing, because it is tried every second while mgmtd is not running.
void connect_quietly(mgmt_link *link) {
    link->connect_at_ms = lt_monotonic_ms() + RETRY_MS;
    if (access(provider_path().c_str(), W_OK) != 0)
        return;
    // The library logs every failed attempt.
    const int suspended = G_logging_suspended.exchange(1);
    const bool connected =
        gcl_session_client_new(link->instance, "tunneld", nullptr, 0, &link->session) == LC_OK &&
        gcl_session_client_connect_by_provider(link->session, "mgmtd", 0) == LC_OK;
    if (!connected)
        (void)gcl_session_free(&link->session);
    G_logging_suspended = suspended;
    if (!connected)
        return;
    link->stage = mgmt_link::greeting;
    link->opened_ms = lt_monotonic_ms();
}

// The interest in changes also makes mgmtd send queries about tunneld's state to this session.
void begin_session(mgmt_link *link) {
    link->stage = mgmt_link::open;
    link->sessions++;
    LC_LOG(LC_LOG_NOTICE, "Session with mgmtd open");
    if (!send_interest(link, EVENT_CONFIG_CHANGE, {"/qv/tunneld/**", NODE_WCCPD "/**"}) ||
        !send_interest(link, EVENT_ROLE_CHANGE, {}) || !send_interest(link, EVENT_DRAIN, {}))
        LC_LOG(LC_LOG_WARNING, "Changes of the configuration cannot be followed: no interest could be sent");
    link->read_at_ms = lt_monotonic_ms();
    for (auto &[key, known] : link->known) // without a session wccpd could not be asked about them
        known.seen_ms = link->read_at_ms;
}

void continue_opening(mgmt_link *link) {
    int32_t admin = 0;
    (void)gcl_session_get_state(link->session, nullptr, &admin);
    if (link->stage == mgmt_link::greeting && admin == GCL_ADMIN_GREETED) {
        link->stage = mgmt_link::opening;
        if (gcl_session_client_open_service(link->session, BN_PROTO, SERVICE, nullptr, 0) != LC_OK)
            drop_session(link);
    } else if (link->stage == mgmt_link::opening && admin == GCL_ADMIN_OPEN_ANSWERED) {
        if (gcl_session_service_is_open(link->session, SERVICE))
            begin_session(link);
        else
            drop_session(link);
    } else if (lt_monotonic_ms() >= link->opened_ms + OPENING_MAX_MS) {
        drop_session(link);
    }
}

bool is_connected(const mgmt_link *link) {
    int32_t state = GCL_SESSION_NONE;
    return link->session && gcl_session_get_state(link->session, &state, nullptr) == LC_OK &&
           state == GCL_SESSION_CONNECTED;
}

// --- The view

std::map<std::string, uint32_t> find_interface_addresses() {
    std::map<std::string, uint32_t> out; // the first address of each interface
    ifaddrs *list = nullptr;
    if (getifaddrs(&list) != 0)
        return out;
    for (const ifaddrs *each = list; each; each = each->ifa_next)
        if (each->ifa_addr && each->ifa_addr->sa_family == AF_INET)
            out.try_emplace(each->ifa_name,
                            ntohl(reinterpret_cast<const sockaddr_in *>(each->ifa_addr)->sin_addr.s_addr));
    freeifaddrs(list);
    return out;
}

void take_configuration_answer(mgmt_link *link, configured_view *next) {
    std::vector<std::string> complaints;
    *next = read_configuration(link->configured, &complaints);
    link->expected = count_configured_routers(link->configured);
    log_complaints(link, std::move(complaints));
    link->configured.clear();
}

// While the methods are negotiated again with a router that has come back, the old ones stay in use.
void take_routers(mgmt_link *link) {
    const int64_t now = lt_monotonic_ms();
    for (const auto &[group, routers] : read_group_routers(link->states))
        for (const group_router &router : routers) {
            known_router &known = link->known[{group, router.id}];
            const group_router before = known.router;
            known = {router, now};
            if (router.forward == travel::unknown)
                known.router.forward = before.forward;
            if (router.give_back == travel::unknown)
                known.router.give_back = before.give_back;
        }
    link->states.clear();
}

void forget_old_routers(mgmt_link *link) {
    const int64_t now = lt_monotonic_ms();
    std::erase_if(link->known, [&](const auto &each) {
        return !link->expected.contains(each.first.first) || now - each.second.seen_ms > ROUTER_KEPT_MS;
    });
}

// Whether each group that is up is ACTIVE and has all of its configured routers, with their methods.
bool knows_all_routers(const mgmt_link *link) {
    std::map<uint8_t, size_t> good;
    for (const auto &[key, known] : link->known) {
        if (known.router.forward == travel::unknown || known.router.give_back == travel::unknown)
            return false;
        good[key.first]++;
    }
    return std::all_of(link->expected.begin(), link->expected.end(), [&](const auto &each) {
        const auto found = good.find(each.first);
        const auto role = link->roles.find(each.first);
        return each.second == 0 || (found != good.end() && found->second >= each.second &&
                                    role != link->roles.end() && role->second.active);
    });
}

void fill_in_wccpd_state(const mgmt_link *link, configured_view *inout) {
    // Read each time, because the address of an interface can change without any event of mgmtd.
    const std::map<std::string, uint32_t> addresses = find_interface_addresses();
    for (auto &[id, group] : inout->groups) {
        const auto found = addresses.find(group.interface);
        group.local = found == addresses.end() ? 0 : found->second;
        group.routers.clear();
        for (auto at = link->known.lower_bound({id, 0}); at != link->known.end() && at->first.first == id;
             ++at)
            group.routers.push_back(at->second.router);
        const auto role = link->roles.find(id);
        group.active = role != link->roles.end() && role->second.active;
        group.alone = role != link->roles.end() && role->second.alone;
    }
}

bool wants_owners(const mgmt_link *link) {
    // Without an intercept no flow is accepted here, and none has to be protected.
    return link->announced && link->view.protection_s != 0 && !link->view.intercepts.empty();
}

// Queries the routers of the next groups.
void query_routers(mgmt_link *link) {
    std::vector<std::string> walks, single_nodes;
    const size_t count = std::min(link->unasked.size(), GROUPS_AT_ONCE);
    for (size_t i = 0; i < count; i++) {
        walks.push_back(link->unasked[i].below("router").text());
        for (const char *leaf : {"oper", "num_appliances"})
            single_nodes.push_back(link->unasked[i].below(leaf).text());
    }
    link->unasked.erase(link->unasked.begin(), link->unasked.begin() + static_cast<ptrdiff_t>(count));
    (void)send_queries(link, bn_query_iterate, walks, bn_qf_subtree, &link->routers, single_nodes);
}

// Queries only the groups that wccpd has listed: it logs an error for a query about any other group.
void query_listed_groups(mgmt_link *link) {
    static const node_name root = parsed_name(NODE_GROUP_STATE);
    std::vector<std::string> owners;
    link->unasked.clear();
    for (const event_field &node : link->listed)
        if (node_name name = parsed_name(node.name);
            name.is_under(root) && name.parts.size() == root.parts.size() + 1) {
            owners.push_back(name.below("owners").text());
            if (link->routers_are_due)
                link->unasked.push_back(std::move(name));
        }
    link->listed.clear();
    link->gathered.clear();
    if (!link->unasked.empty())
        query_routers(link);
    if (!owners.empty() && wants_owners(link))
        (void)send_queries(link, bn_query_get, owners, 0, &link->owners);
}

int64_t routers_wait_ms(const mgmt_link *link) {
    return link->ask_wait_ms > ROUTERS_SETTLED_MS && knows_all_routers(link)
               ? ROUTERS_KNOWN_MS
               : std::min(link->ask_wait_ms, ROUTERS_MISSING_MS);
}

// Processes the answers that have come, and calls the caller with the changed view.
void process_answers(mgmt_link *link) {
    configured_view next = link->view;
    const bool configured = link->has_configured;
    if (configured) {
        take_configuration_answer(link, &next);
        ask_routers_now(link);
    }
    if (link->has_states) {
        link->gathered.insert(link->gathered.end(), link->states.begin(), link->states.end());
        // The states are complete, and are looked at, when all groups have been queried.
        link->has_states = link->unasked.empty();
        if (link->has_states)
            link->states = std::move(link->gathered);
        else
            query_routers(link);
    }
    // An empty list is an answer as well: routers that are no longer listed are forgotten in time.
    const bool answered = link->has_listed || link->has_states;
    if (link->has_listed)
        query_listed_groups(link);
    if (link->has_states) {
        link->roles = read_group_roles(link->states);
        take_routers(link);
    }
    if (answered)
        forget_old_routers(link);
    if (link->has_states)
        link->ask_routers_at_ms = lt_monotonic_ms() + routers_wait_ms(link);
    const bool owned = link->has_owned;
    link->has_configured = link->has_listed = link->has_states = link->has_owned = false;
    if (owned)
        for (const auto &[group, text] : read_group_owners(link->owned))
            link->callbacks.owners(group, text);
    // Answers about wccpd complete a configuration: before the first one of this session there is none to
    // complete.
    if (!configured && (!answered || !link->announced))
        return;
    fill_in_wccpd_state(link, &next);
    // A new session is always announced, since the caller then repeats its reports.
    if (link->announced && next == link->view)
        return;
    link->announced = true;
    link->view = std::move(next);
    link->callbacks.configured(link->view);
}

// Whether a request of this kind is due and none waits for an answer. One that has waited too long is given
// up.
bool may_ask(request *inout, int64_t at_ms, int64_t now) {
    if (inout->id && now >= inout->deadline_ms)
        inout->id = 0;
    return !inout->id && now >= at_ms;
}

// When wccpd's groups are to be queried next.
int64_t next_group_query_ms(const mgmt_link *link) {
    return wants_owners(link) ? std::min(link->ask_routers_at_ms, link->ask_owners_at_ms)
                              : link->ask_routers_at_ms;
}

// Sends the requests that are due. At most one of each kind waits for an answer.
void send_due_requests(mgmt_link *link) {
    const int64_t now = lt_monotonic_ms();
    if (may_ask(&link->configuration, link->read_at_ms, now)) {
        link->read_at_ms = NEVER;
        if (!send_walks(link, list_configuration_roots(), bn_qf_subtree, &link->configuration))
            link->read_at_ms = now + RETRY_MS;
    }
    // One round: first the list of groups, then the routers and owners of those that it names. The next one
    // begins when all three have been answered.
    if (!may_ask(&link->routers, now, now) || !may_ask(&link->owners, now, now) ||
        !may_ask(&link->groups, next_group_query_ms(link), now))
        return;
    (void)send_walks(link, {NODE_GROUP_STATE}, 0, &link->groups);
    link->ask_owners_at_ms = now + OWNERS_MS;
    // A round may be due for the owners alone.
    link->routers_are_due = link->ask_routers_at_ms <= now;
    if (!link->routers_are_due)
        return;
    link->ask_routers_at_ms = now + routers_wait_ms(link);
    link->ask_wait_ms = std::min(link->ask_wait_ms * 2, ROUTERS_MISSING_MS);
}

int64_t next_step_ms(const mgmt_link *link) {
    const int64_t now = lt_monotonic_ms();
    if (link->stage != mgmt_link::closed && !is_connected(link))
        return 0;
    switch (link->stage) {
    case mgmt_link::closed:
        return link->connect_at_ms - now;
    case mgmt_link::greeting:
    case mgmt_link::opening:
        // The steps of the opening are polled, and less often the longer mgmtd takes.
        return std::max(OPENING_STEP_MS, (now - link->opened_ms) / 4);
    default:
        break;
    }
    int64_t next = NEVER;
    for (const request *waiting : {&link->configuration, &link->groups, &link->routers, &link->owners})
        if (waiting->id)
            next = std::min(next, waiting->deadline_ms);
    // While a request waits for its answer, the next one of its kind is not sent.
    if (!link->configuration.id)
        next = std::min(next, link->read_at_ms);
    if (!link->groups.id && !link->routers.id && !link->owners.id)
        next = std::min(next, next_group_query_ms(link));
    return next == NEVER ? ROUTERS_KNOWN_MS : next - now;
}

void advance_session(int, short, void *data) {
    auto *link = static_cast<mgmt_link *>(data);
    if (link->stage != mgmt_link::closed && !is_connected(link))
        drop_session(link);
    if (link->stage == mgmt_link::closed && lt_monotonic_ms() >= link->connect_at_ms)
        connect_quietly(link);
    else if (link->stage == mgmt_link::greeting || link->stage == mgmt_link::opening)
        continue_opening(link);
    if (link->stage == mgmt_link::open) {
        process_answers(link);
        send_due_requests(link);
    }
    LOG_STATUS(loop_event_set_timer(link->timer, std::max<int64_t>(next_step_ms(link), 0)));
}

lc_status make_instance(mgmt_link *link, lew *loop) {
    loop_context *context = nullptr;
    CHECK_STATUS(lew_get_event_context(loop, &context));
    CHECK_STATUS(fdic_libevent_init(context, &link->bridge));
    CHECK_STATUS(fdic_init(&link->interests, fdic_libevent_callback, link->bridge));
    CHECK_STATUS(fdic_libevent_set_fd_close_handler(link->bridge, take_close, link));
    CHECK_STATUS(gcl_init(&link->instance, nullptr, link->interests));
    CHECK_STATUS(bn_set_global_callback_query_response_msg(link->instance, take_response, link));
    CHECK_STATUS(bn_set_global_callback_action_response_msg(link->instance, ignore_response, link));
    CHECK_STATUS(bn_set_global_callback_event_response_msg(link->instance, ignore_response, link));
    CHECK_STATUS(bn_set_global_callback_event_request_msg(link->instance, take_event, link));
    CHECK_STATUS(bn_set_global_callback_query_request_msg(link->instance, take_query, link));
    CHECK_STATUS(loop_event_new(context, advance_session, link, &link->timer));
    CHECK_STATUS(loop_event_set_timer(link->timer, 0));
    return LC_OK;
}
} // namespace

mgmt_link *mgmt_link_new(lew *loop, session_callbacks callbacks) {
    auto *link = new mgmt_link;
    link->callbacks = std::move(callbacks);
    if (make_instance(link, loop) == LC_OK)
        return link;
    mgmt_link_free(link);
    return nullptr;
}

void mgmt_link_free(mgmt_link *link) {
    if (!link)
        return;
    if (link->bridge) // gcl_deinit() closes descriptors, and the handler must not run any more
        LOG_STATUS(fdic_libevent_set_fd_close_handler(link->bridge, nullptr, nullptr));
    LOG_STATUS(gcl_deinit(&link->instance));
    LOG_STATUS(fdic_libevent_deinit(&link->bridge));
    LOG_STATUS(fdic_deinit(&link->interests));
    loop_event_free(&link->timer);
    delete link;
}

bool mgmt_link_is_open(const mgmt_link *link) {
    return link->stage == mgmt_link::open && is_connected(link);
}

uint32_t mgmt_link_session(const mgmt_link *link) {
    return link->sessions;
}

void mgmt_link_ask_routers(mgmt_link *link) {
    if (link->stage != mgmt_link::open)
        return;
    ask_routers_now(link);
    advance_soon(link);
}

// --- Events

namespace {
event_field group_field(uint8_t group) {
    return {"group", {bn_type_uint8, std::to_string(group)}};
}
event_field reason_field(const std::string &reason) {
    return {"reason", {bn_type_str, shown_text(reason.substr(0, REASON_MAX))}};
}
} // namespace

void mgmt_link_group_leaves(mgmt_link *link, uint8_t group, const std::string &reason) {
    send_event(link, EVENT_GROUP_LEAVE, {group_field(group), reason_field(reason)});
}

void mgmt_link_group_joins(mgmt_link *link, uint8_t group) {
    send_event(link, EVENT_GROUP_JOIN, {group_field(group)});
}

void mgmt_link_weight_changed(mgmt_link *link, uint8_t group, uint32_t percent) {
    send_event(link, EVENT_GROUP_WEIGHT,
               {group_field(group), {"percent", {bn_type_uint32, std::to_string(percent)}}});
}

void mgmt_link_drain_progress(mgmt_link *link, uint8_t group, uint32_t flows, bool empty) {
    send_event(link, EVENT_DRAIN_PROGRESS,
               {group_field(group),
                {"flows", {bn_type_uint32, std::to_string(flows)}},
                {"empty", {bn_type_bool, empty ? "true" : "false"}}});
}

void mgmt_link_overload(mgmt_link *link, uint8_t group, bool overloaded, const std::string &text) {
    send_event(link, overloaded ? EVENT_RAISE_ALARM : EVENT_CLEAR_ALARM,
               {{"alarm_type", {bn_type_uint32, std::to_string(ALARM_TYPE_OVERLOAD)}},
                {"param_3", {bn_type_str, "proxy:grp:" + std::to_string(group)}},
                {"comment", {bn_type_str, text}}});
}

void mgmt_link_forget_roles(mgmt_link *link) {
    // In the view as well: the next report of the same roles is then a change.
    link->roles.clear();
    for (auto &[id, group] : link->view.groups)
        group.active = group.alone = false;
    mgmt_link_ask_routers(link);
}

void mgmt_link_proxy_changed(mgmt_link *link, uint8_t group, bool up, const std::string &reason) {
    send_event(link, EVENT_PROXY_CHANGE,
               {group_field(group), {"up", {bn_type_bool, up ? "true" : "false"}}, reason_field(reason)});
}

void mgmt_link_ends(mgmt_link *link) {
    owned_request msg;
    if (link->stage != mgmt_link::open ||
        bn_action_request_msg_create(&msg.pointer, ACTION_REPORT_PROCESS) != LC_OK)
        return;
    for (const auto &[name, value] : {std::pair("process_name", "tunneld"), {"event", "terminate"}})
        if (bn_action_request_msg_append_new_binding(msg.pointer, 0, name, bn_type_str, value, nullptr) !=
            LC_OK)
            return;
    (void)send_request(link, msg.pointer, nullptr);
}
