// mgmtd without sockets: messages are kept instead of being sent. Change events are read with the client
// library that wccpd uses.
#pragma once

#include <algorithm>
#include <cctype>
#include <deque>
#include <filesystem>
#include <fstream>
#include <initializer_list>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "mgmt/bnode_proto.h"
#include "mgmt/mdc_main.h"
#include "mgmt/node_paths.h"
#include "peers/mgmtd/server.h"
#include "tests/support/mgmt_owners.h"
#include "tests/support/texts.h"

inline const std::string GROUPS = "/qv/wccpd/wccp/srv_grp/config/", GROUP = GROUPS + "51";
inline const std::string STATE = "/qv/wccpd/wccp/srv_grp/state";

inline node_name named(const std::string &text) {
    node_name out;
    EXPECT_TRUE(parse_node_name(text, &out)) << text;
    return out;
}

struct sent_message {
    uint32_t peer;
    uint16_t mtype;
    request_owner request;
    response_owner response;
};

struct Mgmtd : testing::Test {
    server daemon;
    int64_t now = 1000;
    std::deque<sent_message> sent;
    std::map<uint32_t, strings> told; // the names of all events, by the peer that got them
    std::string said;
    uint32_t asker = 3; // sends the set requests
    char file[32] = "/tmp/mgmtd-test-XXXXXX";

    void SetUp() override {
        ASSERT_TRUE(mkdtemp(file));
        daemon.file.path = std::string(file) + "/conf";
        daemon.now_ms = [this] { return now; };
        daemon.say = [this](const std::string &line) { said += line + "\n"; };
        daemon.local_addresses = [] { return std::vector<local_address>{{0x0a000065, 0x0a0000ff}}; };
        daemon.send = [this](uint32_t peer_id, uint16_t mtype, tbuffer *frame) {
            const owned_tbuffer buffer(frame);
            sent_message &message = sent.emplace_back();
            message.peer = peer_id;
            message.mtype = mtype;
            if (mtype % 2 == 1)
                ASSERT_EQ(bn_request_msg_deserialize(frame, 32, &message.request), LC_OK);
            else
                ASSERT_EQ(bn_response_msg_deserialize(frame, 32, &message.response), LC_OK);
            if (mtype == bn_msg_event)
                told[peer_id].emplace_back(ts_str(message.request->text));
        };
        tree_refresh(&daemon.tree);
        server_peer_opened(&daemon, 1, "wccpd-7"); // the working session
        server_peer_opened(&daemon, 2, "wccpd-7"); // the alarm session
        server_peer_opened(&daemon, 3, "mgmtctl-8");
        action(1, ACTION_ADD_INTEREST,
               {{"event_name", {bn_type_name, EVENT_CONFIG_CHANGE}},
                {"match/1/pattern", {bn_type_str, "/qv/wccpd/**"}},
                {"match/2/pattern", {bn_type_str, "/qv/tunneld/system/config/mode/**"}}});
        EXPECT_EQ(code(), 0u);
        clear();
    }
    void TearDown() override { std::filesystem::remove_all(file); }
    void clear() { sent.clear(); }
    bool give(uint32_t peer_id, bn_request_msg *taken) {
        const owned_request msg(taken);
        taken->service_id = 2;
        if (taken->msg_id == 0)
            taken->msg_id = 77;
        owned_tbuffer frame;
        EXPECT_EQ(bn_request_msg_serialize(taken, 32, &frame.pointer), LC_OK);
        return server_take_frame(&daemon, peer_id, taken->msg_type, frame.pointer);
    }
    void action(uint32_t peer_id, const char *name, const std::vector<event_field> &fields) {
        bn_request_msg *msg = make_event(name, fields);
        msg->msg_type = bn_msg_action_request; // of the same form
        EXPECT_TRUE(give(peer_id, msg));
    }
    void follow(uint32_t peer_id, std::initializer_list<const char *> events_of) {
        for (const char *event : events_of) {
            action(peer_id, ACTION_ADD_INTEREST, {{"event_name", {bn_type_name, event}}});
            EXPECT_EQ(code(), 0u);
        }
        clear();
    }
    void open(uint32_t peer_id, const char *name) { server_peer_opened(&daemon, peer_id, name); }
    void close(uint32_t peer_id) { server_peer_closed(&daemon, peer_id); }
    // The changes that wccpd gets after an action, after an event about group 51, or after that time.
    std::string act(const char *name, const std::vector<event_field> &fields = {}) {
        clear();
        action(3, name, fields);
        return changes();
    }
    std::string report(uint32_t peer_id, const char *event, std::vector<event_field> fields = {}) {
        fields.push_back({"group", {bn_type_uint8, "51"}});
        clear();
        EXPECT_TRUE(give(peer_id, make_event(event, fields)));
        return changes();
    }
    std::string tick(int64_t after_ms) {
        clear();
        now += after_ms;
        (void)server_tick(&daemon);
        return changes();
    }
    void query(uint32_t peer_id, const std::string &name, uint32_t subop, uint32_t flags = 0,
               const std::string &second_name = "") {
        bn_request_msg *msg = nullptr;
        ASSERT_EQ(bn_query_request_msg_create(&msg, 0, nullptr), LC_OK);
        for (const std::string &each : second_name.empty() ? strings{name} : strings{name, second_name})
            ASSERT_EQ(bn_query_request_msg_append_str(msg, subop, flags, each.c_str(), nullptr), LC_OK);
        EXPECT_TRUE(give(peer_id, msg));
    }
    static const bn_request_node *last_node(const bn_request_msg *msg) {
        return bn_request_per_node_array_get_quick(msg->nodes,
                                                   bn_request_per_node_array_length_quick(msg->nodes) - 1);
    }
    void answer_query(uint32_t peer_id, uint32_t response_to, uint32_t node_id, uint32_t code,
                      const std::vector<event_field> &fields) {
        owned_response msg;
        owned_tbuffer frame;
        ASSERT_EQ(bn_query_response_msg_create(&msg.pointer, response_to, code, nullptr), LC_OK);
        for (const event_field &field : fields) {
            bn_binding *binding = make_binding(field.name, field.value);
            ASSERT_EQ(bn_query_response_msg_append_binding_takeover(msg.pointer, &binding, node_id), LC_OK);
        }
        msg.pointer->service_id = 2;
        ASSERT_EQ(bn_response_msg_serialize(msg.pointer, 32, &frame.pointer), LC_OK);
        EXPECT_TRUE(server_take_frame(&daemon, peer_id, bn_msg_query_response, frame.pointer));
    }
    struct set_node {
        uint32_t subop;
        std::string name, value;
        uint32_t type = bn_type_str;
    };
    uint32_t set(const std::vector<set_node> &nodes, uint32_t commit_flags = 0, uint32_t revision = 0) {
        bn_request_msg *msg = nullptr;
        EXPECT_EQ(bn_set_request_msg_create(&msg, commit_flags), LC_OK);
        msg->number = revision;
        for (const set_node &node : nodes) {
            bn_binding *binding = make_binding(node.name, {node.type, node.value});
            EXPECT_EQ(bn_set_request_msg_append_binding_takeover(msg, node.subop, 0, &binding, nullptr),
                      LC_OK);
        }
        clear();
        EXPECT_TRUE(give(asker, msg));
        return code();
    }
    // The same from words: NAME=VALUE modifies, +NAME=VALUE creates, -NAME deletes. The name is below group
    // 51 unless it begins with "/", or with the number of a group.
    uint32_t set(const std::string &steps, uint32_t commit_flags = 0, uint32_t revision = 0) {
        std::vector<set_node> nodes;
        std::istringstream words(steps);
        for (std::string word; words >> word;) {
            const bool deletes = word[0] == '-', creates = word[0] == '+';
            word.erase(0, deletes || creates);
            const size_t end = std::min(word.find('='), word.size());
            const std::string above = word[0] == '/' ? "" : isdigit(word[0]) ? GROUPS : GROUP + "/";
            const uint32_t subop = deletes ? bn_set_delete : creates ? bn_set_create : bn_set_modify;
            nodes.push_back({subop, above + word.substr(0, end), word.substr(std::min(end + 1, word.size())),
                             deletes ? bn_type_none : bn_type_str});
        }
        return set(nodes, commit_flags, revision);
    }
    // Starts with the file as it is; returns the warnings.
    std::string load() {
        std::string errors, warnings;
        EXPECT_TRUE(server_load(&daemon, &errors, &warnings)) << errors;
        server_begin(&daemon);
        return warnings;
    }
    void write(const std::string &content) const { std::ofstream(daemon.file.path) << content; }
    const bn_response_msg *last_response() {
        for (auto at = sent.rbegin(); at != sent.rend(); ++at)
            if (at->response)
                return at->response;
        return nullptr;
    }
    uint32_t code() {
        const bn_response_msg *response = last_response();
        return response ? response->return_code : UINT32_MAX;
    }
    std::string message() { return ts_str(last_response()->return_message); }
    // "name=value" of each binding of the last response.
    strings found() {
        strings out;
        if (const bn_response_msg *response = last_response())
            for (const event_field &field : fields_of(response))
                out.push_back(field.name + "=" + field.value.text);
        return out;
    }
    // The value of a node, "" without one; those of a subtree, without times.
    std::string value(const std::string &name, uint32_t peer_id = 3) {
        query(peer_id, name, bn_query_get);
        return found().empty() ? "" : found().front().substr(name.size() + 1);
    }
    strings walk(const std::string &name) {
        query(3, name, bn_query_iterate, bn_qf_subtree);
        strings out = found();
        std::erase_if(out, [](const std::string &node) { return node.find("/since=") != std::string::npos; });
        return out;
    }
    // The change events that were sent to the peer: "name=old>new", "-" for none; the names of nodes of
    // groups begin with the group's number.
    std::vector<strings> events(uint32_t peer_id = 1) {
        std::vector<strings> out;
        for (const sent_message &one : sent) {
            if (one.peer != peer_id || one.mtype != bn_msg_event)
                continue;
            out.emplace_back();
            EXPECT_STREQ(ts_str(one.request->text), EVENT_CONFIG_CHANGE);
            bindings_owner bindings, old_values, new_values;
            EXPECT_EQ(bn_request_get(one.request, nullptr, nullptr, 0, &bindings, nullptr, nullptr), LC_OK);
            EXPECT_EQ(mdc_event_config_change_notif_extract(bindings, &old_values, &new_values), LC_OK);
            for (uint32_t i = 0; i < bn_binding_array_length_quick(new_values); i++) {
                const bn_binding *binding = bn_binding_array_get_quick(new_values, i), *old_value = nullptr;
                uint32_t flags = 0;
                (void)bn_binding_get_type(binding, bn_attrib_value, nullptr, &flags);
                const std::string name = name_of(binding);
                (void)bn_binding_array_get_binding_by_name(old_values, name.c_str(), &old_value);
                out.back().push_back(name.substr(name.starts_with(GROUPS) ? GROUPS.size() : 0) + "=" +
                                     (old_value ? value_of(old_value).text : "-") + ">" +
                                     (flags & bn_flag_deleted ? "-" : value_of(binding).text));
            }
        }
        return out;
    }
    // Those sent to wccpd, separated by blanks.
    std::string changes() {
        strings out;
        for (const strings &event : events())
            out.insert(out.end(), event.begin(), event.end());
        return joined(out, " ");
    }
    // Writes the file and has mgmtd read it again.
    void reload(const std::string &content) {
        write(content);
        clear();
        said.clear();
        server_reload(&daemon);
    }
    std::string content() const { return text_of_file(daemon.file.path); }
};
