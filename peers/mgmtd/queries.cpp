// Queries: of the configuration and of what mgmtd itself reports from memory, of the state of a daemon by
// asking that daemon.
//
// The state nodes of each daemon stand beside the schema; a query below one of their roots goes to the
// daemon's session, all nodes of it in one request, with the rows in front as registration nodes. A query of
// a subtree that holds such a root takes it along, and is none the worse when the daemon isn't there or
// refuses. A node that can't be told in a message is left out, so that no asker waits in vain. The daemon
// whose session it is asks for its configuration only; it is never asked for what it asked for.
#include <algorithm>

#include "mgmt/bnode_proto.h"
#include "mgmt/node_paths.h"
#include "peers/mgmtd/server.h"

namespace {
struct state_source {
    const char *client; // the daemon's client name
    std::vector<const char *> roots;
    const std::vector<const char *> &(*nodes)();
};
} // namespace

static const state_source sources[] = {
    {"wccpd", {NODE_WCCPD_STATE, NODE_GROUP_STATE}, wccpd_state_nodes},
};
static constexpr uint32_t CAPABILITIES = 1; // the nodes can be read

// The newest working session of the daemon: the one that follows changes. 0 for none.
static uint32_t find_provider(const server *self, const state_source &source, uint32_t asker) {
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

static bool append_registrations(bn_request_msg *msg, const state_source &source) {
    owned_attribs attributes;
    owned_attrib mask;
    if (bn_attrib_new_uint32(&mask.pointer, bn_attrib_capability_mask, 0, CAPABILITIES) != LC_OK ||
        bn_attrib_array_new(&attributes.pointer) != LC_OK ||
        bn_attrib_array_set_takeover(attributes.pointer, bn_attrib_capability_mask, &mask.pointer) != LC_OK)
        return false;
    for (const char *name : source.nodes())
        if (bn_query_request_msg_append_with_attribs(msg, bn_query_registration_info, 0, name,
                                                     attributes.pointer, nullptr) != LC_OK)
            return false;
    return true;
}

namespace {
struct forwarded {
    uint32_t asked_id; // node id of the asker
    uint32_t subop, flags;
    std::string name;
};
struct found_node {
    uint32_t asked_id;
    const node_map::value_type *node;
};
struct query_plan {
    const state_source *source = nullptr;
    std::vector<forwarded> nodes;
    bool explicit_node = false, local_node = false;
};
} // namespace

static bool within(const node_name &name, const node_name &root) {
    return name == root || name.is_under(root);
}

// Which of the node's answers come from a daemon.
static void plan_node(query_plan *plan, uint32_t node_id, uint32_t subop, uint32_t flags,
                      const node_name &name) {
    for (const state_source &source : sources)
        for (const char *text : source.roots) {
            node_name root;
            (void)parse_node_name(text, &root);
            if (within(name, root)) {
                plan->source = &source;
                plan->explicit_node = true;
                plan->nodes.push_back({node_id, subop, flags, name.text()});
                return;
            }
            if (subop == bn_query_iterate && (flags & bn_qf_subtree) && root.is_under(name)) {
                plan->source = &source;
                plan->nodes.push_back({node_id, subop, flags, text});
            }
        }
    plan->local_node = true;
}

static void answer_here(const server *self, uint32_t subop, uint32_t flags, const node_name &name,
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

static bool forward(server *self, uint32_t asker, const bn_request_msg *request, const query_plan &plan,
                    uint32_t provider, const std::vector<found_node> &answered) {
    owned_request msg;
    if (bn_query_request_msg_create(&msg.pointer, 0, nullptr) != LC_OK ||
        !append_registrations(msg.pointer, *plan.source))
        return false;
    pending_query query{asker,
                        provider,
                        request->msg_id,
                        request->transaction_id,
                        self->now_ms() + MONITOR_TIMEOUT_MS,
                        plan.explicit_node,
                        {},
                        {}};
    for (const found_node &found : answered)
        query.answered.emplace_back(found.asked_id,
                                    event_field{found.node->first.text(), found.node->second});
    for (const forwarded &node : plan.nodes) {
        uint32_t node_id = 0;
        if (bn_query_request_msg_append_str(msg.pointer, node.subop, node.flags, node.name.c_str(),
                                            &node_id) != LC_OK)
            return false;
        query.node_ids[node_id] = node.asked_id;
    }
    msg.pointer->msg_id = self->next_query_id++;
    const uint32_t id = msg.pointer->msg_id;
    self->pending[id] = std::move(query);
    if (server_send_request(self, provider, msg.pointer))
        return true;
    self->pending.erase(id);
    return false;
}

static bool append_answer(bn_response_msg *response, uint32_t node_id, const std::string &name,
                          const node_value &value) {
    owned_binding binding(make_binding(name, value));
    return binding.pointer &&
           bn_query_response_msg_append_binding_takeover(response, &binding.pointer, node_id) == LC_OK;
}

void server_answer_query(server *self, uint32_t peer_id, bn_request_msg *msg) {
    query_plan plan;
    std::vector<found_node> answered;
    const uint32_t count = bn_request_per_node_array_length_quick(msg->nodes);
    for (uint32_t i = 0; i < count; i++) {
        const bn_request_node *node = bn_request_per_node_array_get_quick(msg->nodes, i);
        node_name name;
        if (!node || !node->binding || !parse_node_name(name_of(node->binding), &name))
            continue;
        plan_node(&plan, node->node_id, node->subop, node->flags, name);
        node_list found;
        answer_here(self, node->subop, node->flags, name, &found);
        for (const auto *entry : found)
            answered.push_back({node->node_id, entry});
    }
    uint32_t code = 0;
    std::string message;
    if (!plan.nodes.empty()) {
        const uint32_t provider = find_provider(self, *plan.source, peer_id);
        if (provider && forward(self, peer_id, msg, plan, provider, answered))
            return;
        if (plan.explicit_node) {
            code = LC_IO_CLOSED;
            message = std::string(plan.source->client) + " has no session";
        }
    }
    owned_response response;
    if (bn_query_response_msg_create(&response.pointer, msg->msg_id, code, message.c_str()) != LC_OK)
        return;
    for (const found_node &found : answered)
        (void)append_answer(response.pointer, found.asked_id, found.node->first.text(), found.node->second);
    (void)server_send_response(self, peer_id, response.pointer, msg->transaction_id);
}

void server_take_monitor_answer(server *self, uint32_t peer_id, bn_response_msg *msg) {
    const auto found = self->pending.find(msg->response_to);
    if (found == self->pending.end() || found->second.provider != peer_id)
        return; // too late, or never asked for
    const pending_query query = std::move(found->second);
    self->pending.erase(found);
    owned_response response;
    const bool told = query.whole && msg->return_message;
    if (bn_query_response_msg_create(&response.pointer, query.asker_message_id,
                                     query.whole ? msg->return_code : 0,
                                     told ? ts_str(msg->return_message) : "") != LC_OK)
        return;
    for (const auto &[node_id, field] : query.answered)
        (void)append_answer(response.pointer, node_id, field.name, field.value);
    const uint32_t count = bn_response_per_node_array_length_quick(msg->nodes);
    for (uint32_t i = 0; i < count; i++) {
        bn_response_node *node = bn_response_per_node_array_get_quick(msg->nodes, i);
        if (!node || !node->binding)
            continue;
        const auto asked = query.node_ids.find(node->node_id);
        if (asked != query.node_ids.end())
            (void)bn_query_response_msg_append_binding_takeover(response.pointer, &node->binding,
                                                                asked->second);
    }
    (void)server_send_response(self, query.asker, response.pointer, query.asker_transaction_id);
}
