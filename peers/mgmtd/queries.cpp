// Queries. The configuration and the states that mgmtd keeps are answered from memory. The state nodes of a
// daemon are requested from the daemon: the query waits while other messages are handled.
//
// The state nodes of each daemon are listed beside the schema. A query below one of their roots is forwarded
// to the daemon's session, all its nodes in one request, after the list of state nodes as registration nodes.
// A walk of a subtree that contains such a root includes the daemon's nodes if the daemon answers, and
// succeeds without them.
//
// A walk of all service groups is forwarded in steps: the list of the groups, then group by group. The daemon
// therefore builds no answer about more than one group, and a walk that becomes larger than a frame is
// refused as soon as that shows. A walk above the roots of several daemons asks them one after the other, in
// the order of the table.
//
// A node that cannot be put into the answer is left out, so that the asker gets an answer in any case. A
// daemon's own query is never forwarded to the session that it came from.
#include <algorithm>

#include "mgmt/bnode_proto.h"
#include "mgmt/gcl.h"
#include "mgmt/node_paths.h"
#include "peers/mgmtd/server.h"
#include "peers/nodes/secrets.h"

namespace {

struct state_source {
    const char *client; // the daemon's client name
    std::vector<const char *> roots;
    const std::vector<const char *> &(*nodes)();
};

const state_source state_sources[] = {
    {"wccpd", {NODE_WCCPD_STATE, NODE_GROUP_STATE}, wccpd_state_nodes},
    {"tunneld",
     {NODE_PLANE_STATE, NODE_TUNNEL_STATE, NODE_INTERCEPT_STATE, NODE_PROTECTION_STATE},
     tunneld_state_nodes},
};
constexpr uint32_t CAPABILITIES = 1;       // of registered nodes: they can be read
constexpr size_t ANSWER_NODE_BYTES = 64;   // of a node in a message, in addition to its texts
constexpr size_t PENDING_NODE_BYTES = 128; // of a node that waits, in addition to its name

// The newest session of the daemon that follows changes of the configuration, which its alarm session does
// not. 0: none.
uint32_t find_provider(const server *self, const state_source &source, uint32_t asker) {
    const std::string prefix = std::string(source.client) + "-";
    uint32_t found = 0;
    uint64_t newest = 0;
    for (const auto &[id, who] : self->peers) {
        const bool works = std::any_of(who.interests.begin(), who.interests.end(), [](const interest &wish) {
            return wish.event == EVENT_CONFIG_CHANGE;
        });
        if (id != asker && works && who.name.starts_with(prefix) && who.first_seen > newest) {
            newest = who.first_seen;
            found = id;
        }
    }
    return found;
}

bool append_registrations(bn_request_msg *msg, const state_source &source) {
    owned_attribs attributes;
    owned_attrib mask;
    if (bn_attrib_new_uint32(&mask.pointer, bn_attrib_capability_mask, 0, CAPABILITIES) != LC_OK ||
        bn_attrib_array_new(&attributes.pointer) != LC_OK ||
        bn_attrib_array_set_takeover(attributes.pointer, bn_attrib_capability_mask, &mask.pointer) != LC_OK)
        return false;
    // The daemon answers walks from the list of nodes that the request carries; it keeps no list of its own.
    for (const char *name : source.nodes())
        if (bn_query_request_msg_append_with_attribs(msg, bn_query_registration_info, 0, name,
                                                     attributes.pointer, nullptr) != LC_OK)
            return false;
    return true;
}

bool is_at_or_under(const node_name &name, const node_name &root) {
    return name == root || name.is_under(root);
}

daemon_part *find_part(std::vector<daemon_part> *parts, size_t source) {
    for (daemon_part &part : *parts)
        if (part.source == source)
            return &part;
    parts->push_back({source, {}, {}, false});
    return &parts->back();
}

// Adds the nodes that daemons have to be asked for to the parts of the query.
void plan_node(std::vector<daemon_part> *parts, const asked_node &asked, const node_name &name) {
    const bool subtree = asked.subop == bn_query_iterate && (asked.flags & bn_qf_subtree);
    for (size_t source = 0; source < std::size(state_sources); source++)
        for (const char *text : state_sources[source].roots) {
            const node_name root = parsed_name(text);
            // By name: at or below the root of the daemon's nodes. Otherwise a walk of a subtree may contain
            // the root.
            const bool by_name = is_at_or_under(name, root);
            if (!by_name && !(subtree && root.is_under(name)))
                continue;
            // From above, the daemon is asked for its own part only.
            const asked_node node = {asked.id, asked.subop, asked.flags, by_name ? name.text() : text};
            daemon_part *part = find_part(parts, source);
            part->whole |= by_name;
            // All groups at once would make one answer of unknown size.
            (subtree && node.name == NODE_GROUP_STATE ? part->walks : part->nodes).push_back(node);
            // The roots don't overlap: no other daemon has nodes there.
            if (by_name)
                return;
        }
}

void collect_own_nodes(const server *self, uint32_t subop, uint32_t flags, const node_name &name,
                       node_list *out) {
    for (const node_map *nodes : {&self->tree.nodes, &self->state}) {
        if (subop == bn_query_get) {
            if (const auto found = nodes->find(name); found != nodes->end())
                out->push_back(&*found);
        } else if (subop == bn_query_iterate && !(flags & bn_qf_walk_only)) {
            collect_nodes(*nodes, name,
                          {(flags & bn_qf_subtree) != 0, (flags & bn_qf_include_self) != 0,
                           (flags & bn_qf_leaves_only) != 0},
                          out);
        }
    }
}

bool append_answer(bn_response_msg *response, uint32_t node_id, const std::string &name,
                   const node_value &value) {
    owned_binding binding(make_binding(name, value));
    return binding.pointer &&
           bn_query_response_msg_append_binding_takeover(response, &binding.pointer, node_id) == LC_OK;
}

void refuse_query(server *self, const pending_query &query, uint32_t code, const std::string &why) {
    owned_response response;
    if (bn_query_response_msg_create(&response.pointer, query.asker_message_id, code, why.c_str()) == LC_OK)
        (void)server_send_response(self, query.asker, response.pointer, query.asker_transaction_id);
}

bool is_shown_all(const server *self, uint32_t asker) {
    const auto found = self->peers.find(asker);
    return found != self->peers.end() && found->second.owner.may_change;
}

// Appends the nodes that mgmtd answers itself. False when the answer exceeds a message: the query has been
// refused.
bool append_own_answers(server *self, const pending_query &query, bn_response_msg *response) {
    // Counted while the answer grows, instead of building one that can't be sent.
    size_t bytes = query.gathered_bytes;
    const auto asker = self->peers.find(query.asker);
    // The asker may have ended its session while the query waited.
    const bool runs_groups = asker != self->peers.end() && server_runs_groups(asker->second);
    const bool all = is_shown_all(self, query.asker);
    const auto append = [&](uint32_t id, const node_name &name, node_value value) {
        const std::string text = name.text();
        if (!all)
            value.text = hidden_value(text, value.text);
        bytes += text.size() + value.text.size() + ANSWER_NODE_BYTES;
        if (bytes > GCL_FRAME_MAX)
            refuse_query(self, query, LC_NO_BUFFER_SPACE, BN_TOO_LARGE);
        else
            (void)append_answer(response, id, text, value);
        return bytes <= GCL_FRAME_MAX;
    };
    for (const asked_node &asked : query.asked) {
        node_name name;
        node_list found;
        node_value made;
        if (!parse_node_name(asked.name, &name))
            continue;
        collect_own_nodes(self, asked.subop, asked.flags, name, &found);
        for (const auto *entry : found)
            if (!append(asked.id, entry->first,
                        runs_groups ? server_value_for_wccpd(self, entry->first, entry->second)
                                    : entry->second))
                return false;
        // Made on request: these texts are not stored as nodes.
        if (asked.subop == bn_query_get && server_config_text(self, name, !all, &made) &&
            !append(asked.id, name, made))
            return false;
    }
    return true;
}

std::vector<asked_node> read_asked_nodes(const bn_request_msg *msg) {
    std::vector<asked_node> out;
    const uint32_t count = bn_request_per_node_array_length_quick(msg->nodes);
    out.reserve(count);
    for (uint32_t i = 0; i < count; i++)
        if (const bn_request_node *node = bn_request_per_node_array_get_quick(msg->nodes, i);
            node && node->binding)
            out.push_back({node->node_id, node->subop, node->flags, name_of(node->binding)});
    return out;
}

} // namespace

pending_query server_take_pending(server *self, std::map<uint32_t, pending_query>::iterator at) {
    pending_query out = std::move(at->second);
    self->pending_bytes -= out.bytes;
    // The sums count only what is in `pending`. The caller has the query, and adds it again if it is
    // forwarded.
    self->gathered_bytes -= out.gathered_bytes;
    self->pending.erase(at);
    return out;
}

namespace {

bool may_wait(const server *self, const pending_query &query) {
    const auto of_asker = std::count_if(self->pending.begin(), self->pending.end(),
                                        [&](const auto &each) { return each.second.asker == query.asker; });
    return of_asker < static_cast<ptrdiff_t>(PENDING_SESSION_MAX) && self->pending.size() < PENDING_MAX &&
           self->pending_bytes + query.bytes <= PENDING_BYTES_MAX;
}

// The request to the daemon. The ids of its nodes go to `query`. Null when it cannot be made.
bn_request_msg *make_forwarded(const state_source &source, const std::vector<asked_node> &nodes,
                               bool list_groups, pending_query *query) {
    owned_request msg;
    if (bn_query_request_msg_create(&msg.pointer, 0, nullptr) != LC_OK ||
        !append_registrations(msg.pointer, source))
        return nullptr;
    // One query is forwarded several times, each time with new ids.
    query->node_ids.clear();
    query->list_id = 0;
    for (const asked_node &node : nodes) {
        uint32_t node_id = 0;
        if (bn_query_request_msg_append_str(msg.pointer, node.subop, node.flags, node.name.c_str(),
                                            &node_id) != LC_OK)
            return nullptr;
        query->node_ids[node_id] = node.id;
    }
    if (list_groups && bn_query_request_msg_append_str(msg.pointer, bn_query_iterate, 0, NODE_GROUP_STATE,
                                                       &query->list_id) != LC_OK)
        return nullptr;
    return msg.take();
}

// Asks the daemon of the current part for these nodes. Returns LC_OK when the query waits for the answer.
uint32_t forward_query(server *self, const std::vector<asked_node> &nodes, bool list_groups,
                       pending_query query) {
    query.bytes = 0;
    for (const asked_node &node : query.asked)
        query.bytes += node.name.size() + PENDING_NODE_BYTES;
    for (const daemon_part &part : query.parts)
        query.bytes += (part.nodes.size() + part.walks.size()) * PENDING_NODE_BYTES;
    if (!may_wait(self, query))
        return LC_NO_SPACE;
    const owned_request msg(
        make_forwarded(state_sources[query.parts[query.next_part - 1].source], nodes, list_groups, &query));
    if (!msg.pointer)
        return LC_IO_CLOSED;
    // Unique across all sessions, unlike the ids of other messages: an answer finds its query by it alone.
    const uint32_t id = msg.pointer->msg_id = self->next_query_id++, provider = query.provider;
    query.deadline_ms = self->now_ms() + MONITOR_TIMEOUT_MS;
    self->pending_bytes += query.bytes;
    self->gathered_bytes += query.gathered_bytes;
    self->pending[id] = std::move(query);
    if (server_send_request(self, provider, msg.pointer))
        return LC_OK;
    (void)server_take_pending(self, self->pending.find(id));
    return LC_IO_CLOSED;
}

bool is_limit(uint32_t code) {
    return code == LC_NO_SPACE || code == LC_NO_BUFFER_SPACE;
}

// Sends the response: the nodes of mgmtd and those that daemons have answered. When a limit is exceeded, the
// response has the code of the limit and no nodes.
void finish_query(server *self, const pending_query &query, uint32_t code, const std::string &words) {
    // A part of a walk without the rest would look like the whole.
    if (is_limit(code)) {
        refuse_query(self, query, code, words);
        return;
    }
    owned_response response;
    if (bn_query_response_msg_create(&response.pointer, query.asker_message_id, code, words.c_str()) !=
            LC_OK ||
        !append_own_answers(self, query, response.pointer))
        return;
    const bn_response_per_node_array *nodes = query.gathered ? query.gathered->nodes : nullptr;
    for (uint32_t i = 0; i < bn_response_per_node_array_length_quick(nodes); i++) {
        bn_response_node *node = bn_response_per_node_array_get_quick(nodes, i);
        // Moves the binding; `gathered` is freed with the query.
        (void)bn_query_response_msg_append_binding_takeover(response.pointer, &node->binding, node->node_id);
    }
    (void)server_send_response(self, query.asker, response.pointer, query.asker_transaction_id);
}

void ask_next(server *self, pending_query query);

// The daemon of the current part has answered everything, or failed. A failure is reported only if its nodes
// were asked for by name.
void end_part(server *self, pending_query query, uint32_t code, const std::string &words) {
    // `next_part` is already that of the following part.
    const bool whole = query.next_part > 0 && query.parts[query.next_part - 1].whole;
    if (is_limit(code) || (code != LC_OK && whole))
        finish_query(self, query, code, words);
    else
        ask_next(self, std::move(query));
}

void fail_to_ask(server *self, pending_query query, uint32_t code) {
    const std::string daemon = state_sources[query.parts[query.next_part - 1].source].client;
    end_part(self, std::move(query), code,
             code == LC_NO_SPACE ? "Too many queries wait for " + daemon : daemon + " has no session");
}

void ask_next(server *self, pending_query query) {
    if (query.next_part == query.parts.size()) {
        finish_query(self, query, LC_OK, "");
        return;
    }
    const daemon_part part = query.parts[query.next_part++];
    query.groups.clear();
    query.next_group = 0;
    query.provider = find_provider(self, state_sources[part.source], query.asker);
    // `query` is copied: if it can't be forwarded, it is still needed for the answer.
    const uint32_t code =
        query.provider ? forward_query(self, part.nodes, !part.walks.empty(), query) : uint32_t{LC_IO_CLOSED};
    if (code != LC_OK)
        fail_to_ask(self, std::move(query), code);
}

} // namespace

void server_answer_query(server *self, uint32_t peer_id, bn_request_msg *msg) {
    pending_query query = {};
    query.asker = peer_id;
    query.asker_message_id = msg->msg_id;
    query.asker_transaction_id = msg->transaction_id;
    query.asked = read_asked_nodes(msg);
    for (const asked_node &node : query.asked)
        if (node_name name; parse_node_name(node.name, &name))
            plan_node(&query.parts, node, name);
    // The nodes of the request decide in which order the parts were found.
    std::ranges::sort(query.parts, {}, &daemon_part::source);
    ask_next(self, std::move(query));
}

void server_answer_without(server *self, pending_query query, uint32_t code, const std::string &why) {
    if (query.next_part == 1) { // only this daemon has answered, and not completely
        query.gathered.reset();
        query.gathered_bytes = 0;
    }
    end_part(self, std::move(query), code, why);
}

namespace {

// Dumps of wccpd contain passwords. If there is no memory for the hidden text, the node is left out.
void hide_passwords_in(bn_binding **inout) {
    const std::string name = name_of(*inout);
    const node_value value = value_of(*inout);
    const std::string hidden = hidden_value(name, value.text);
    if (hidden == value.text)
        return;
    (void)bn_binding_free(inout);
    *inout = make_binding(name, {value.type, hidden});
}

// Moves the bindings of the daemon's answer to the query. False when a limit is exceeded: the query has been
// refused.
bool gather_answer(server *self, pending_query *query, bn_response_msg *msg, size_t bytes) {
    // The query is out of `pending`; its bytes are in none of the server's sums now.
    query->gathered_bytes += bytes;
    if (query->gathered_bytes > GCL_FRAME_MAX) {
        refuse_query(self, *query, LC_NO_BUFFER_SPACE, BN_TOO_LARGE);
        return false;
    }
    bn_response_msg *made = nullptr;
    if (self->gathered_bytes + query->gathered_bytes > GATHERED_BYTES_MAX ||
        (!query->gathered && bn_query_response_msg_create(&made, 0, 0, nullptr) != LC_OK)) {
        refuse_query(self, *query, LC_NO_SPACE, "Too many large answers are waiting: ask for less, or later");
        return false;
    }
    if (made)
        query->gathered.reset(made, bn_release_response);
    const bool all = is_shown_all(self, query->asker);
    for (uint32_t i = 0; i < bn_response_per_node_array_length_quick(msg->nodes); i++) {
        bn_response_node *node = bn_response_per_node_array_get_quick(msg->nodes, i);
        if (!node || !node->binding)
            continue;
        if (!all)
            hide_passwords_in(&node->binding);
        const auto asked = query->node_ids.find(node->node_id);
        if (asked != query->node_ids.end())
            (void)bn_query_response_msg_append_binding_takeover(query->gathered.get(), &node->binding,
                                                                asked->second);
        // Only the names are used: each group is asked for with its root node.
        else if (query->list_id && node->node_id == query->list_id)
            query->groups.push_back(name_of(node->binding));
    }
    return true;
}

} // namespace

void server_take_monitor_answer(server *self, uint32_t peer_id, bn_response_msg *msg, size_t bytes) {
    const auto found = self->pending.find(msg->response_to);
    if (found == self->pending.end() || found->second.provider != peer_id)
        return; // the query has timed out, or was sent to another session
    server_note_answer(self, self->peers.at(peer_id).name, true);
    pending_query query = server_take_pending(self, found);
    if (!gather_answer(self, &query, msg, bytes))
        return;
    // Also reached without groups: either there are none, or the part had no walk.
    if (msg->return_code != LC_OK || query.next_group == query.groups.size()) {
        end_part(self, std::move(query), msg->return_code,
                 msg->return_message ? ts_str(msg->return_message) : "");
        return;
    }
    std::vector<asked_node> nodes = query.parts[query.next_part - 1].walks;
    for (asked_node &node : nodes) {
        node.name = query.groups[query.next_group];
        // The group's root is below the list that was asked for, but is itself the root of this walk.
        node.flags |= bn_qf_include_self;
    }
    query.next_group++;
    const uint32_t code = forward_query(self, nodes, false, query);
    if (code != LC_OK)
        fail_to_ask(self, std::move(query), code);
}
