// mgmtd without sockets: what its file may hold, what a commit does and which events it sends, what queries
// find, and how a state is asked for. Change events are read with the client library that the daemon reads
// them with.
#include <algorithm>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <sstream>

#include <gtest/gtest.h>
#include <malloc.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include "mgmt/bnode_proto.h"
#include "mgmt/gcl.h"
#include "mgmt/mdc_main.h"
#include "mgmt/node_paths.h"
#include "peers/mgmtd/server.h"
#include "peers/mgmtd/supervise.h"

static const std::string GROUP = "/qv/wccpd/wccp/srv_grp/config/51";
static const std::string POLICY = "/qv/wccpd/wccp/policy_grp/config";
static const std::string STATE = "/qv/wccpd/wccp/srv_grp/state";

static node_name named(const std::string &text) {
    node_name out;
    EXPECT_TRUE(parse_node_name(text, &out)) << text;
    return out;
}

// --- The file

static std::string errors_of(const std::string &content) {
    config_text text;
    const bool good = config_parse(content, "F", &text);
    EXPECT_EQ(good, text.errors.empty());
    return text.errors;
}

TEST(ConfigFile, EachBadLineIsToldWithItsReason) {
    const std::string section = "[" + GROUP + "]\n";
    const struct {
        std::string content, error;
    } cases[] = {
        {"[/qv/wccpd/wccp/srv_grp/config/256]\nweight = 1\n", "F:1: \"256\" is no number between 0 and 255"},
        {"[/qv/wccpd/wccp/srv_grp/config/051]\n", "F:1: \"051\" is no number between 0 and 255"},
        {"[/qv/nobody]\n", "F:1: nothing can be set below /qv/nobody"},
        {"weight = 1\n", "F:1: \"weight\" is no name from the root, and it is in no section"},
        {section + "speed = 1\n", "F:2: " + GROUP + "/speed: there is no such node in the configuration"},
        {section + "weight\n", "F:2: expected [section] or name = value"},
        {section + "\n# c\nweight = 65536\n",
         "F:4: " + GROUP + "/weight: \"65536\" is not between 0 and 65535"},
        {section + "weight = -1\n", "F:2: " + GROUP + "/weight: \"-1\" is no uint32"},
        {section + "encap = GRE\n", "F:2: " + GROUP + "/encap: \"GRE\" is none of gre|l2|either"},
        {section + "protocol = 256\n", "F:2: " + GROUP + "/protocol: \"256\" is not between 1 and 255"},
        {section + "interface = a-name-too-long1\n",
         "F:2: " + GROUP + "/interface: \"a-name-too-long1\" is longer than 15 characters"},
        {section + "router/33/ipaddr = 10.0.0.1\n",
         "F:2: " + GROUP + "/router/33/ipaddr: \"33\" is no number between 1 and 32"},
        {section + "weight = 1\nweight = 2\n", "F:3: " + GROUP + "/weight: was given in line 2 already"},
        {section + "interface = \"eth0\n", "F:2: " + GROUP + "/interface: the closing quote is missing"},
        {"/logging/syslog/facility/system = 7\n",
         "F:1: /logging/syslog/facility/system: \"7\" is no log facility (a multiple of 8 up to 184)"},
        {section + "protocol = htp\n",
         "F:2: " + GROUP +
             "/protocol: \"htp\" is no protocol; give a name such as tcp or udp, or a number from 1 to "
             "255"},
        {"/logging/syslog/process/a /log_level = debug\n",
         "F:1: /logging/syslog/process/a /log_level: the part \"a \" of the name begins or ends with a "
         "blank; write "
         "it without"},
        {"[" NODE_BYPASS_CONFIG "/10.0.0.0]\n", "F:1: \"10.0.0.0\" is no IPv4 prefix such as 10.0.0.0/8"},
        {"[" NODE_BYPASS_CONFIG "/10.0.0.0\\/08]\n",
         "F:1: \"10.0.0.0/08\" is no IPv4 prefix such as 10.0.0.0/8"},
        {"[" NODE_BYPASS_CONFIG "/10.0.0.1\\/8]\n",
         "F:1: \"10.0.0.1/8\" has host bits that are not zero; write the address of the network, such as "
         "10.0.0.0/8, or /32 for a host"},
        {"[" NODE_ACCEPT_CONFIG "/10.0.0]\n", "F:1: \"10.0.0\" is no IPv4 address such as 10.0.0.1"},
        {"[" NODE_ACCEPT_CONFIG "/224.0.0.1]\n", "F:1: \"224.0.0.1\" is not the address of another host"},
        // What only the whole shows.
        {"[" NODE_INTERCEPT_CONFIG "/0]\ncheck = http\n",
         "F:2: " NODE_INTERCEPT_CONFIG
         "/0/check: http needs the path of a page, without blanks, in check_argument"},
        {"[" + GROUP + "/router/1]\n", "F:1: " + GROUP + "/router/1: has no ipaddr"},
        {section + "router/1/ipaddr = 10.0.0.1\nrouter/3/ipaddr = 10.0.0.3\n",
         "F:3: " + GROUP + "/router: entries are numbered from 1 without a gap, number 2 is missing"},
        {section + "router/1/ipaddr = 10.0.0.1\nrouter/2/ipaddr = 10.0.0.1\nweight = 3\n",
         "F:3: " + GROUP + "/router/2/ipaddr: 10.0.0.1 is given twice"},
        {section + "mask_src_ip = 0xff\nmask_dst_ip = 0\n",
         "F:3: " + GROUP + ": the four masks have 8 bits set together, the most is 7"},
    };
    for (const auto &one : cases)
        EXPECT_EQ(errors_of(one.content), one.error + "\n") << one.content;
    EXPECT_EQ(errors_of(section + "password = 123456789\n").find("123456789"), std::string::npos);
}

TEST(Schema, ListsAreCheckedAndBroughtIntoOneForm) {
    std::string crowd;
    for (int i = 1; i <= 65; i++)
        crowd += std::to_string(2 * i) + " ";
    const struct {
        const char *node;
        std::string text, kept, refused; // a piece of the reason
    } cases[] = {
        {"ports", " 443 80  8080-8090 8085-8100 81", "80-81 443 8080-8100", ""},
        {"ports", "1 65535 1-65535", "1-65535", ""},
        {"ports", "all", "all", ""},
        {"ports", "all 80", "", "is no list of ports"},
        {"ports", "0", "", "is no list of ports"},
        {"ports", "80-65536", "", "is no list of ports"},
        {"ports", "80-", "", "is no list of ports"},
        {"ports", "81-80", "", "is greater than its last"},
        {"ports", crowd, "", "more than 64 ranges"},
        {"ports", crowd + "1-1000", "1-1000", ""},
        {"bypass", "192.0.2.1 10.0.0.0/8 10.2.0.0/16 9.0.0.0/8 10.0.0.0/8",
         "9.0.0.0/8 10.0.0.0/8 192.0.2.1/32", ""},
        {"bypass", "255.255.255.255 10.0.0.0/8 0.0.0.0/0", "0.0.0.0/0", ""},
        {"bypass", "10.0.0.0/33", "", "is no list of IPv4 prefixes"},
        {"bypass", "10.0.0.1/31", "", "host bits"},
        {"check_argument", "usr/bin/true", "", "does not begin with"},
        {"check_argument", "/opt/a check", "/opt/a check", ""},
        {"to", "0", "", "is not between 1 and 65535"},
    };
    for (const auto &one : cases) {
        const node_name name = named(std::string(NODE_INTERCEPT_CONFIG "/51/") + one.node);
        std::string kept, reason;
        EXPECT_EQ(check_value(*find_schema_row(name), name, one.text, &kept, &reason), one.refused.empty())
            << one.text;
        EXPECT_EQ(one.refused.empty() ? kept : "", one.kept) << one.text;
        EXPECT_NE(reason.find(one.refused), std::string::npos) << reason;
    }
}

TEST(ConfigFile, WhatIsWrittenReadsTheSameWithItsComments) {
    const std::string content = "# of the appliance\n"
                                "[" +
                                GROUP +
                                "]\n"
                                "# slow link\n"
                                "mask_dst_ip = 0x0f\n"
                                "password = \" a\\\"b\\\\\"\n"
                                "router/10/ipaddr = 10.0.0.10\nrouter/9/ipaddr = 10.0.0.9\n"
                                "[/qv/wccpd/wccp/policy_grp/config/7]\n"
                                "[" NODE_BYPASS_CONFIG "/10.0.0.0\\/8]\nuntil = 7\n"
                                "[" NODE_ACCEPT_CONFIG "/10.0.0.1]\n"
                                "# of the log\n"
                                "[/logging/syslog/action/file]\n"
                                "\\/var\\/log\\/messages/facility/all/min_priority = info\n"
                                "# the end\n";
    config_text text, again;
    // Two of ten routers: what is read and written doesn't depend on the whole being sound.
    EXPECT_FALSE(config_parse(content, "F", &text));
    const std::string written = config_format(text.tree, text.comments);
    (void)config_parse(written, "F", &again);
    EXPECT_EQ(text.tree.set, again.tree.set) << written;
    EXPECT_EQ(config_format(again.tree, again.comments), written);
    EXPECT_EQ(again.tree.set[named(GROUP + "/password")], " a\"b\\");
    EXPECT_EQ(again.tree.set[named(GROUP + "/mask_dst_ip")], "15");
    for (const char *line : {"# of the appliance\n[", "# slow link\nmask_dst_ip",
                             "# of the log\n[/logging/syslog/action/file/", "# the end\n"})
        EXPECT_NE(written.find(line), std::string::npos) << line << "\n" << written;
    EXPECT_LT(written.find("router/9/"), written.find("router/10/"));
    EXPECT_EQ(written.find("weight"), std::string::npos) << "a default is not written";
}

// --- A server whose messages are kept instead of being sent

namespace {
struct sent_message {
    uint32_t peer;
    uint16_t mtype;
    bn_request_msg *request = nullptr;
    bn_response_msg *response = nullptr;
};

struct Mgmtd : testing::Test {
    server daemon;
    int64_t now = 1000;
    std::vector<sent_message> sent;
    std::string said;
    uint32_t asker = 3; // whose set requests are
    char file[32] = "/tmp/mgmtd-test-XXXXXX";

    void SetUp() override {
        ASSERT_TRUE(mkdtemp(file));
        daemon.file.path = std::string(file) + "/conf";
        daemon.now_ms = [this] { return now; };
        daemon.say = [this](const std::string &line) { said += line + "\n"; };
        daemon.local_addresses = [] { return std::vector<local_address>{{0x0a000065, 0x0a0000ff}}; };
        daemon.send = [this](uint32_t peer_id, uint16_t mtype, tbuffer *frame) {
            const owned_tbuffer buffer(frame);
            sent_message message{peer_id, mtype};
            if (mtype % 2 == 1)
                ASSERT_EQ(bn_request_msg_deserialize(frame, 32, &message.request), LC_OK);
            else
                ASSERT_EQ(bn_response_msg_deserialize(frame, 32, &message.response), LC_OK);
            sent.push_back(message);
        };
        tree_refresh(&daemon.tree);
        server_peer_opened(&daemon, 1, "wccpd-7"); // the working session
        server_peer_opened(&daemon, 2, "wccpd-7"); // the alarm session
        server_peer_opened(&daemon, 3, "mgmtctl-8");
        action(1, "/mgmtd/events/actions/interest/add",
               {{"event_name", {bn_type_name, EVENT_CONFIG_CHANGE}},
                {"match/1/pattern", {bn_type_str, "/qv/wccpd/**"}},
                {"match/2/pattern", {bn_type_str, "/qv/tunneld/system/config/mode/**"}}});
        EXPECT_EQ(code(), 0u);
        clear();
    }
    void TearDown() override {
        clear();
        (void)!system(("rm -rf " + std::string(file)).c_str());
    }
    void clear() {
        for (sent_message &message : sent) {
            (void)bn_request_msg_free(&message.request);
            (void)bn_response_msg_free(&message.response);
        }
        sent.clear();
    }
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
        bn_request_msg *msg = nullptr;
        ASSERT_EQ(bn_action_request_msg_create(&msg, name), LC_OK);
        for (const event_field &field : fields) {
            bn_binding *binding = make_binding(field.name, field.value);
            ASSERT_EQ(bn_action_request_msg_append_binding_takeover(msg, 0, &binding, nullptr), LC_OK);
        }
        EXPECT_TRUE(give(peer_id, msg));
    }
    void query(uint32_t peer_id, const std::string &name, uint32_t subop, uint32_t flags = 0) {
        bn_request_msg *msg = nullptr;
        ASSERT_EQ(bn_query_request_msg_create(&msg, 0, nullptr), LC_OK);
        ASSERT_EQ(bn_query_request_msg_append_str(msg, subop, flags, name.c_str(), nullptr), LC_OK);
        EXPECT_TRUE(give(peer_id, msg));
    }
    static const bn_request_node *last_node(const bn_request_msg *msg) {
        return bn_request_per_node_array_get_quick(msg->nodes,
                                                   bn_request_per_node_array_length_quick(msg->nodes) - 1);
    }
    // wccpd's answer.
    void answer(uint32_t peer_id, uint32_t response_to, uint32_t node_id, uint32_t code,
                const std::vector<event_field> &fields = {{STATE + "/51/oper", {bn_type_str, "ACTIVE"}}}) {
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
    std::vector<std::string> found() {
        std::vector<std::string> out;
        if (const bn_response_msg *response = last_response())
            for (const event_field &field : fields_of(response))
                out.push_back(field.name + "=" + field.value.text);
        return out;
    }
    // What the daemon makes of each change event that the peer was sent: "name=old>new", "-" for none.
    std::vector<std::vector<std::string>> events(uint32_t peer_id = 1) {
        std::vector<std::vector<std::string>> out;
        for (const sent_message &one : sent) {
            if (one.peer != peer_id || one.mtype != bn_msg_event)
                continue;
            out.emplace_back();
            EXPECT_STREQ(ts_str(one.request->text), EVENT_CONFIG_CHANGE);
            owned_bindings bindings, old_values, new_values;
            EXPECT_EQ(bn_request_get(one.request, nullptr, nullptr, 0, &bindings.pointer, nullptr, nullptr),
                      LC_OK);
            EXPECT_EQ(mdc_event_config_change_notif_extract(bindings.pointer, &old_values.pointer,
                                                            &new_values.pointer),
                      LC_OK);
            for (uint32_t i = 0; i < bn_binding_array_length_quick(new_values.pointer); i++) {
                const bn_binding *binding = bn_binding_array_get_quick(new_values.pointer, i);
                const bn_binding *old_value = nullptr;
                uint32_t flags = 0;
                (void)bn_binding_array_get_binding_by_name(old_values.pointer, name_of(binding).c_str(),
                                                           &old_value);
                (void)bn_binding_get_type(binding, bn_attrib_value, nullptr, &flags);
                out.back().push_back(name_of(binding) + "=" + (old_value ? value_of(old_value).text : "-") +
                                     ">" + (flags & bn_flag_deleted ? "-" : value_of(binding).text));
            }
        }
        return out;
    }
    std::vector<std::string> changes() {
        std::vector<std::string> out;
        for (const std::vector<std::string> &event : events())
            out.insert(out.end(), event.begin(), event.end());
        return out;
    }
    // The file with this content, and what mgmtd makes of it.
    void reload(const std::string &content) {
        std::ofstream(daemon.file.path) << content;
        clear();
        said.clear();
        server_reload(&daemon);
    }
    std::string content() const {
        std::ostringstream out;
        out << std::ifstream(daemon.file.path).rdbuf();
        return out.str();
    }
};
} // namespace

using strings = std::vector<std::string>;

static bool has(const strings &list, const std::string &wanted) {
    return std::find(list.begin(), list.end(), wanted) != list.end();
}

// --- Commits

TEST_F(Mgmtd, AGroupComesWithItsDefaultsAndGoesWhole) {
    EXPECT_EQ(set({{bn_set_create, GROUP + "/interface", "eth0"},
                   {bn_set_create, GROUP + "/router/1/ipaddr", "10.0.0.1"},
                   {bn_set_create, GROUP + "/weight", "7", bn_type_uint32}}),
              0u)
        << message();
    const strings added = changes();
    EXPECT_EQ(added.front(), GROUP + "=->51");
    for (const char *change : {"/interface=->eth0", "/router/1=->1", "/router/1/ipaddr=->10.0.0.1",
                               "/weight=->7", "/admin=->up", "/password=->", "/mask_dst_ip=->3840"})
        EXPECT_TRUE(has(added, GROUP + change)) << change;
    EXPECT_EQ(daemon.tree.revision, 2u);
    EXPECT_EQ(last_response()->db_revision_id, 2u);

    EXPECT_EQ(set({{bn_set_delete, GROUP, "", bn_type_none}}), 0u) << message();
    const strings gone = changes();
    EXPECT_EQ(gone.size(), added.size());
    EXPECT_TRUE(has(gone, GROUP + "=51>-") && has(gone, GROUP + "/admin=up>-"));
}

TEST_F(Mgmtd, ADeletedValueFallsBackToItsDefault) {
    ASSERT_EQ(set({{bn_set_create, GROUP + "/weight", "7"}}), 0u);
    EXPECT_EQ(set({{bn_set_delete, GROUP + "/weight", "", bn_type_none}}), 0u);
    EXPECT_EQ(changes(), strings{GROUP + "/weight=7>100"});
    EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "100"}}), 0u);
    EXPECT_EQ(changes(), strings{}) << "what holds already is no change";
}

TEST_F(Mgmtd, ARefusedStepLeavesEverythingAsItWas) {
    ASSERT_EQ(set({{bn_set_create, GROUP + "/router/1/ipaddr", "10.0.0.1"},
                   {bn_set_create, GROUP + "/policy_grp", "5"},
                   {bn_set_create, POLICY + "/5", ""}}),
              0u);
    const auto before = daemon.tree.set;
    std::string deep = GROUP;
    for (int i = 0; i < 64; i++)
        deep += "/a";
    const struct {
        set_node bad;
        lc_status code;
    } cases[] = {
        {{bn_set_modify, deep, "1"}, LC_BAD_PATH},
        {{bn_set_modify, GROUP + "/weight", "70000"}, LC_BAD_ARGUMENT},
        {{bn_set_modify, GROUP + "/weight", "1", bn_type_uint16}, LC_BAD_TYPE},
        {{bn_set_modify, GROUP + "/wait", "1"}, LC_NOT_FOUND},
        {{bn_set_modify, "/qv/wccpd/wccp/srv_grp/config/52/weight", "1"}, LC_NOT_FOUND},
        {{bn_set_modify, "weight", "1"}, LC_BAD_PATH},
        {{bn_set_create, GROUP + "/router/3/ipaddr", "10.0.0.3"}, LC_ASSERTION},
        {{bn_set_create, GROUP + "/router/2", ""}, LC_ASSERTION}, // no address
        {{bn_set_delete, GROUP + "/router/1/ipaddr", "", bn_type_none}, LC_ASSERTION},
        {{bn_set_reparent, GROUP, "", bn_type_none}, LC_NOT_IMPLEMENTED},
        // What the file would not give back.
        {{bn_set_create, "/logging/syslog/process/a\nb/log_level", "debug"}, LC_BAD_ARGUMENT},
        {{bn_set_create, "/logging/syslog/process/a\x7f/log_level", "debug"}, LC_BAD_ARGUMENT},
        {{bn_set_create, "/logging/syslog/process/ a/log_level", "debug"}, LC_BAD_ARGUMENT},
        {{bn_set_create, "/logging/syslog/process/a\\\\/log_level", "debug"}, LC_BAD_ARGUMENT},
        {{bn_set_create, "/logging/syslog/process/" + std::string(256, 'a') + "/log_level", "debug"},
         LC_BAD_ARGUMENT},
        // What cannot be a router.
        {{bn_set_create, GROUP + "/router/2/ipaddr", "127.0.0.2"}, LC_ASSERTION},
        {{bn_set_create, GROUP + "/router/2/ipaddr", "255.255.255.255"}, LC_ASSERTION},
        {{bn_set_create, GROUP + "/router/2/ipaddr", "10.0.0.101"}, LC_ASSERTION},
        {{bn_set_create, GROUP + "/router/2/ipaddr", "10.0.0.255"}, LC_ASSERTION},
        {{bn_set_create, GROUP + "/router/2/ipaddr", "224.0.1.9"}, LC_ASSERTION},
        {{bn_set_delete, POLICY + "/5", "", bn_type_none}, LC_ASSERTION},
    };
    for (const auto &one : cases) {
        EXPECT_EQ(set({{bn_set_modify, GROUP + "/admin", "down"}, one.bad}), static_cast<uint32_t>(one.code))
            << one.bad.name;
        EXPECT_TRUE(message().starts_with(one.bad.name.substr(0, 6))) << one.bad.name << ": " << message();
        EXPECT_EQ(message().find('\n'), std::string::npos) << message();
        EXPECT_EQ(changes(), strings{});
        EXPECT_EQ(daemon.tree.set, before) << one.bad.name;
    }
}

TEST_F(Mgmtd, ARunningGroupThatCannotFollowIsDeletedAndCreated) {
    const std::string groups = "/qv/wccpd/wccp/srv_grp/config/";
    action(3, "/mgmtd/events/actions/interest/add", {{"event_name", {bn_type_name, EVENT_CONFIG_CHANGE}}});
    reload("[" + GROUP + "]\npolicy_grp = 5\nrouter/1/ipaddr = 10.0.0.1\n[" + groups + "7]\n[" + groups +
           "9]\n");
    const uint32_t revision = daemon.tree.revision;
    const struct {
        std::vector<set_node> nodes;
        size_t events;
    } cases[] = {
        {{{bn_set_modify, GROUP + "/priority", "9"}, {bn_set_modify, GROUP + "/weight", "9"}}, 2},
        {{{bn_set_modify, GROUP + "/protocol", "udp"}}, 2},
        {{{bn_set_modify, GROUP + "/interface", "eth1"}}, 2},
        {{{bn_set_modify, GROUP + "/router/1/ipaddr", "10.0.0.2"}}, 2},
        {{{bn_set_create, GROUP + "/router/2/ipaddr", "10.0.0.3"}, {bn_set_modify, groups + "7/weight", "9"}},
         3},
        {{{bn_set_delete, GROUP + "/policy_grp", "", bn_type_none}}, 2},
        // As it is, on purpose.
        {{{bn_set_delete, groups + "7", "", bn_type_none}, {bn_set_create, groups + "7/weight", "9"}}, 2},
        {{{bn_set_create, groups + "8", ""}, {bn_set_modify, GROUP + "/weight", "7"}}, 2},
        {{{bn_set_modify, GROUP + "/encap", "l2"}, {bn_set_modify, GROUP + "/assign_detail", "x"}}, 1},
        {{{bn_set_delete, GROUP + "/assign_detail", "", bn_type_none}}, 1},
    };
    for (const auto &one : cases) {
        EXPECT_EQ(set(one.nodes), 0u) << message();
        EXPECT_EQ(events().size(), one.events) << one.nodes[0].name;
        EXPECT_LE(events(3).size(), 1u) << "one commit to everybody else";
    }
    EXPECT_EQ(daemon.tree.revision, revision + std::size(cases));

    // All of it in one file: what goes, what follows, what comes.
    reload("[" + GROUP + "]\npriority = 1\n[" + groups + "7]\nweight = 1\n[" + groups + "11]\n");
    const auto told = events();
    ASSERT_EQ(told.size(), 3u) << said;
    EXPECT_TRUE(has(told[0], groups + "9=9>-") && has(told[0], GROUP + "=51>-") &&
                has(told[0], GROUP + "/priority=9>-"));
    EXPECT_EQ(told[1], strings{groups + "7/weight=9>1"});
    EXPECT_TRUE(has(told[2], groups + "11=->11") && has(told[2], GROUP + "=->51") &&
                has(told[2], GROUP + "/priority=->1"));

    // No event is larger than it need be, and none has a part of a group.
    std::string many;
    for (int group = 100; group < 140; group++) {
        many += "[" + groups + std::to_string(group) + "]\n";
        for (int router = 1; router <= 32; router++)
            many += "router/" + std::to_string(router) + "/ipaddr = 10.0.1." + std::to_string(router) + "\n";
    }
    reload(many);
    EXPECT_GT(events().size(), 3u);
    for (const auto &event : events()) {
        EXPECT_TRUE(event.front().ends_with(">-") || event.front().find("=->1") != std::string::npos);
        EXPECT_LT(event.size(), 1200u);
    }
}

TEST_F(Mgmtd, TheFileHoldsEachCommitBeforeItIsTold) {
    // Through a link whose target is yet to be.
    const std::string real = daemon.file.path + ".real";
    ASSERT_EQ(symlink("conf.real", daemon.file.path.c_str()), 0);
    ASSERT_EQ(set({{bn_set_create, GROUP + "/password", "secret"}}), 0u);
    struct stat about;
    ASSERT_EQ(lstat(real.c_str(), &about), 0);
    EXPECT_EQ(about.st_mode & 07777777, S_IFREG | 0600u);
    const auto before = daemon.tree.set;
    // One that is bad, or gone, changes nothing when it is read again, and is not written over.
    const std::string bad = "[" + GROUP + "]\nweight = heavy\n";
    reload(bad);
    EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "9"}}), static_cast<uint32_t>(LC_IO_ERROR));
    EXPECT_NE(message().find("SIGHUP"), std::string::npos) << message();
    EXPECT_EQ(content(), bad);
    unlink(real.c_str());
    server_reload(&daemon);
    EXPECT_EQ(changes(), strings{});
    EXPECT_EQ(daemon.tree.set, before);
    EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "9"}}), 0u) << message();
    reload(content() + "weight = 9\n");
    EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "8"}}), static_cast<uint32_t>(LC_IO_ERROR));
    reload("[" + GROUP + "]\nweight = 7\n");
    EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "8"}}), 0u) << message();

    // What would not be read the same is not written, whatever let it in.
    const std::string held = content();
    const node_name hidden = named("/logging/syslog/process/a /log_level");
    daemon.tree.set[hidden] = "debug";
    EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "9"}}), static_cast<uint32_t>(LC_IO_ERROR));
    EXPECT_NE(message().find("would not be read the same"), std::string::npos) << message();
    EXPECT_EQ(content(), held);
    daemon.tree.set.erase(hidden);

    const auto kept = daemon.tree.set;
    // Neither a device, which a commit would replace, nor a pipe, which would block, is a configuration file.
    for (const mode_t kind : {mode_t{S_IFCHR}, mode_t{S_IFIFO}}) {
        config_file special = {std::string(file) + "/special", {}};
        config_text text;
        unlink(special.path.c_str());
        if (mknod(special.path.c_str(), kind | 0600, kind == S_IFCHR ? makedev(1, 3) : 0) != 0)
            continue; // devices are root's
        ASSERT_FALSE(config_load(&special, &text)) << kind;
        EXPECT_NE(text.errors.find("not a regular file"), std::string::npos) << text.errors;
    }
    daemon.file.path = std::string(file) + "/no/such/directory";
    EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "9"}}), static_cast<uint32_t>(LC_IO_ERROR));
    EXPECT_EQ(changes(), strings{});
    EXPECT_EQ(daemon.tree.set, kept);
}

// Each is a server of its own over the same files.
TEST_F(Mgmtd, CommitsAreKeptOverAStart) {
    int64_t clock = 1000000;
    const auto start = [&] {
        std::string errors, warnings;
        daemon.kept = {};
        daemon.tree = {};
        daemon.return_at_ms = -1;
        daemon.clock_s = [&] { return clock; };
        ASSERT_TRUE(server_load(&daemon, &errors, &warnings)) << errors;
        server_begin(&daemon);
    };
    const auto history = [&] { // number, cause and whether it waits, of the last three
        std::string out;
        const std::vector<history_entry> &all = daemon.kept.entries;
        for (size_t i = all.size() - std::min<size_t>(all.size(), 3); i < all.size(); i++)
            out +=
                std::to_string(all[i].number) + " " + all[i].cause + (all[i].returns_to ? " waits; " : "; ");
        return out;
    };
    const auto weight = [&] { return daemon.tree.nodes[named(GROUP + "/weight")].text; };
    const auto text_of = [&](uint32_t number) {
        query(3, NODE_COMMITS "/" + std::to_string(number) + "/text", bn_query_get);
        return found().empty() ? "none" : found()[0].substr(found()[0].find('=') + 1);
    };
    const std::string commits = daemon.file.path + ".history", pending = commits + "/pending";
    start();
    ASSERT_EQ(set({{bn_set_create, GROUP + "/weight", "1"}}), 0u) << message();
    EXPECT_EQ(history(), "1 found at the start; 2 mgmtctl-8; ");
    EXPECT_EQ(text_of(2), content());
    start();
    EXPECT_EQ(history(), "1 found at the start; 2 mgmtctl-8; ") << "it is the same, and no new one";
    EXPECT_EQ(daemon.tree.revision, 2u);
    reload(content() + "priority = 1\n");
    std::ofstream(daemon.file.path, std::ios::app) << "encap = l2\n";
    std::ofstream(commits + "/commit-x") << "";
    start();
    EXPECT_EQ(history(), "2 mgmtctl-8; 3 the configuration file was read again; 4 found at the start; ");

    // One that was cut short counts when the file has been replaced.
    std::string reason;
    const history_entry cut = {5, clock, "root", "cut", 1, "x"};
    for (const bool replaced : {false, true}) {
        ASSERT_TRUE(history_prepare(daemon.kept, cut, content() + "weight = 2\n", &reason)) << reason;
        if (replaced)
            std::ofstream(daemon.file.path, std::ios::app) << "weight = 2\n";
        std::ofstream(pending + ".unfinished") << "#% comm";
        const std::string before = history();
        // The weight is given twice, which is no matter of the history.
        history_open(&daemon.kept, content(), daemon.say);
        EXPECT_EQ(history() == before, !replaced);
        EXPECT_TRUE(access(pending.c_str(), F_OK) != 0 &&
                    access((pending + ".unfinished").c_str(), F_OK) != 0);
    }
    EXPECT_EQ(history_find(daemon.kept, 5)->cause, "cut");

    // What a commit depends on.
    std::ofstream(daemon.file.path) << "[" << GROUP << "]\nweight = 3\n";
    start();
    const uint32_t at = daemon.tree.revision;
    const set_node four = {bn_set_modify, GROUP + "/weight", "4"};
    EXPECT_EQ(set({four}, 0, at - 1), static_cast<uint32_t>(LC_ASSERTION));
    EXPECT_EQ(set({four}, 4), static_cast<uint32_t>(LC_NOT_IMPLEMENTED));
    EXPECT_EQ(set({four}, bn_cf_check_only), 0u);
    EXPECT_EQ(message(), "1 node would change");
    EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "x"}}, bn_cf_check_only),
              static_cast<uint32_t>(LC_BAD_ARGUMENT));
    EXPECT_EQ(weight() + std::to_string(daemon.tree.revision), "3" + std::to_string(at));

    // One that waits to be confirmed: nothing else is taken, and it is undone in time, also by the next
    // mgmtd.
    const auto tick = [&](int64_t seconds) {
        clock += seconds;
        now += seconds * 1000;
        const int64_t next = server_tick(&daemon);
        return next < 0 ? -1 : next - now;
    };
    const uint32_t minutes = 2u << bn_cf_minutes_shift;
    for (const char *end : {"time", "start", "clock", "confirmed", "rollback"}) {
        const std::string how = end;
        ASSERT_EQ(set({four}, minutes, daemon.tree.revision), 0u) << message();
        EXPECT_EQ(tick(20), 100000);
        EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "5"}}), static_cast<uint32_t>(LC_ASSERTION));
        reload("[" + GROUP + "]\nweight = 9\n");
        EXPECT_EQ(weight(), "4") << said;
        std::ofstream(daemon.file.path) << *daemon.file.seen;
        if (how == "clock")
            clock -= 1000000;
        if (how == "start" || how == "clock") {
            start();
            EXPECT_EQ(tick(0), how == "clock" ? 120000 : 100000);
        }
        if (how == "confirmed") {
            daemon.file.path += "/no";
            const std::string directory = std::exchange(daemon.kept.directory, "/no/such");
            action(3, ACTION_CONFIRM, {});
            EXPECT_EQ(code(), static_cast<uint32_t>(LC_IO_ERROR)) << "it still waits";
            daemon.file.path.resize(daemon.file.path.size() - 3);
            daemon.kept.directory = directory;
            action(3, ACTION_CONFIRM, {});
            EXPECT_EQ(code(), 0u) << message();
            start();
        } else if (how == "rollback") {
            EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "3"}}, bn_cf_ends_wait), 0u) << message();
        } else {
            EXPECT_EQ(tick(how == "clock" ? 119 : 99), 1000);
            EXPECT_EQ(weight(), "4");
            // On a disk that is full it is tried again.
            const std::string directory = std::exchange(daemon.kept.directory, "/no/such");
            EXPECT_EQ(tick(1), 60000) << how;
            daemon.kept.directory = directory;
            EXPECT_EQ(tick(60), -1);
        }
        EXPECT_EQ(weight(), how == "confirmed" ? "4" : "3") << how;
        EXPECT_EQ(tick(200), -1) << "nothing waits any more";
        EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "3"}}), 0u);
    }
    action(3, ACTION_CONFIRM, {});
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_NOT_FOUND));

    for (int i = 0; i < 60; i++)
        ASSERT_EQ(set({{bn_set_modify, GROUP + "/weight", std::to_string(100 + i)}}), 0u) << message();
    const uint32_t last = daemon.tree.revision;
    EXPECT_EQ(daemon.kept.entries.size(), HISTORY_MAX);
    query(3, NODE_COMMITS, bn_query_iterate);
    EXPECT_EQ(found().size(), HISTORY_MAX);
    EXPECT_EQ(text_of(last - 50), "none");
    EXPECT_NE(text_of(last - 49).find("weight = 110"), std::string::npos);
    std::ofstream(commits + "/commit-" + std::to_string(last - 1)) << "#% commit 1\n";
    start();
    EXPECT_EQ(daemon.kept.entries.size(), HISTORY_MAX - 1) << "an entry that can't be read is reported";
    EXPECT_NE(said.find("commit " + std::to_string(last - 1) + " can't be read"), std::string::npos) << said;
}

TEST_F(Mgmtd, WhoMayOnlyLookChangesNothingAndSeesNoPassword) {
    std::ofstream(daemon.file.path) << "# geheim before\n[" << GROUP << "]\npassword = geheim\n";
    std::string errors, warnings;
    ASSERT_TRUE(server_load(&daemon, &errors, &warnings)) << errors;
    server_begin(&daemon);
    server_peer_opened(&daemon, 4, "mgmtctl-9", {"user 7", false});
    action(4, ACTION_ADD_INTEREST, {{"event_name", {bn_type_name, EVENT_CONFIG_CHANGE}}});
    EXPECT_EQ(code(), 0u);
    asker = 4;
    const auto refused = [&] {
        EXPECT_EQ(message(), "user 7 may look, but not change anything");
        return code() == LC_BAD_LOGIN;
    };
    for (const uint32_t flags : {0u, uint32_t{bn_cf_check_only}}) {
        (void)set({{bn_set_modify, GROUP + "/password", "geheim"}}, flags);
        EXPECT_TRUE(refused()) << "nor a check, which would tell whether the password is right";
    }
    for (const char *name :
         {ACTION_CONFIRM, "/mgmtd/process/actions/report", "/mgmtd/time/actions/zonechange"}) {
        action(4, name, {});
        EXPECT_TRUE(refused()) << name;
    }
    EXPECT_TRUE(give(4, make_event(EVENT_RAISE_ALARM, {{"alarm_type", {bn_type_str, "196638"}}})));
    EXPECT_TRUE(refused());
    EXPECT_TRUE(daemon.alarm_owners.empty());

    asker = 3;
    ASSERT_EQ(set({{bn_set_modify, GROUP + "/password", "secret"}}), 0u);
    EXPECT_EQ(events(4), (std::vector<strings>{{GROUP + "/password=********>********"}}));
    EXPECT_EQ(events(1), (std::vector<strings>{{GROUP + "/password=geheim>secret"}}));
    const std::string one = NODE_COMMITS "/1/text";
    for (const uint32_t peer_id : {3u, 4u})
        for (const std::string &name : {GROUP + "/password", std::string(NODE_CONFIG_TEXT), one}) {
            query(peer_id, name, bn_query_get);
            ASSERT_EQ(found().size(), 1u) << name;
            const bool shown = found()[0].find(name == one ? "geheim" : "secret") != std::string::npos;
            EXPECT_EQ(shown, peer_id == 3) << found()[0];
            EXPECT_EQ(found()[0].find("geheim before") != std::string::npos,
                      peer_id == 3 && name != GROUP + "/password");
        }
    for (const char *node : {"/51/debug", "/debug_all"}) {
        clear();
        query(4, STATE + node, bn_query_get);
        const bn_request_msg *asked = sent.back().request;
        answer(1, asked->msg_id, last_node(asked)->node_id, 0,
               {{STATE + node, {bn_type_str, "a: b\nWCCP password : geheim 0x67\nc"}}});
        EXPECT_EQ(found(), strings{STATE + node + "=a: b\nWCCP password : ********\nc"});
    }
}

TEST_F(Mgmtd, AStartTidiesUpAndReportsWhatItCannotRefuse) {
    const std::string left = daemon.file.path + ".unfinished";
    daemon.facility_file = std::string(file) + "/new/facility";
    std::ofstream(daemon.file.path) << "[" << GROUP << "]\nrouter/1/ipaddr = 10.0.0.101\n";
    std::ofstream(left) << "[/qv";
    chmod(daemon.file.path.c_str(), 0644);
    std::string errors, warnings;
    ASSERT_TRUE(server_load(&daemon, &errors, &warnings)) << errors;
    EXPECT_TRUE(warnings.starts_with(daemon.file.path + ":2: " + GROUP +
                                     "/router/1/ipaddr: 10.0.0.101 is an address "
                                     "of this appliance"))
        << warnings;
    server_begin(&daemon);
    EXPECT_NE(access(left.c_str(), F_OK), 0);
    EXPECT_NE(said.find("mode 0644"), std::string::npos) << said;
    struct stat about;
    ASSERT_EQ(stat(daemon.file.path.c_str(), &about), 0);
    EXPECT_EQ(about.st_mode & 0777, 0600u);

    // A commit that has nothing to do with the address is taken, and so is the file with it.
    EXPECT_EQ(set({{bn_set_modify, GROUP + "/weight", "8"}}), 0u) << message();
    reload(content() + "weight = 9\n");
    EXPECT_NE(said.find("configuration not read again"), std::string::npos) << said;
    reload("[" + GROUP + "]\nrouter/1/ipaddr = 10.0.0.101\nweight = 9\n");
    EXPECT_NE(said.find("/router/1/ipaddr: 10.0.0.101 is an address"), std::string::npos) << said;
    EXPECT_EQ(changes(), strings{GROUP + "/weight=8>9"});
    reload("[" + GROUP + "]\nrouter/1/ipaddr = 10.0.0.255\n");
    EXPECT_EQ(changes(), strings{}) << said;

    // The facility reaches the file that programs read when they start; its other lines stay.
    const auto facility = [&] {
        std::ostringstream out;
        out << std::ifstream(daemon.facility_file).rdbuf();
        return out.str();
    };
    EXPECT_EQ(facility(), "system 136\n");
    std::ofstream(daemon.facility_file) << "# local\nflow 8\nsystem 16\n";
    reload("[/logging/syslog/facility]\nsystem = 128\n");
    EXPECT_EQ(facility(), "system 128\n# local\nflow 8\n");
}

TEST_F(Mgmtd, AnInterestHearsWhatItsPatternsName) {
    EXPECT_EQ(set({{bn_set_modify, "/qv/tunneld/system/config/mode", "bridge"},
                   {bn_set_modify, "/qv/tunneld/system/config/bonding", "true"}}),
              0u);
    EXPECT_EQ(changes(), strings{"/qv/tunneld/system/config/mode=router>bridge"});
    action(3, "/mgmtd/events/actions/interest/add", {{"match/1/pattern", {bn_type_str, "/a"}}});
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_BAD_ARGUMENT));
    const owned_request large(make_event("/a", {{"a", {bn_type_str, std::string(GCL_FRAME_MAX, 'x')}}}));
    clear();
    EXPECT_FALSE(server_send_request(&daemon, 1, large.pointer));
    EXPECT_TRUE(sent.empty()) << "wccpd would end its session";
    action(3, "/mgmtd/events/actions/interest/add", std::vector<event_field>(1025, {"a", {bn_type_str, ""}}));
    EXPECT_EQ(message(), "more than 1024 fields");
    action(3, "/mgmtd/reboot", {});
    EXPECT_EQ(message(), "No such action: /mgmtd/reboot");
    const auto add = [&](size_t number, size_t length) {
        action(3, "/mgmtd/events/actions/interest/add",
               {{"event_name", {bn_type_name, "/event/" + std::to_string(number)}},
                {"match/1/pattern", {bn_type_str, "/" + std::string(length, 'a')}}});
        return code();
    };
    EXPECT_EQ(add(0, INTEREST_BYTES_MAX), static_cast<uint32_t>(LC_NO_SPACE));
    for (size_t i = 0; i < INTERESTS_MAX; i++)
        EXPECT_EQ(add(i, 1), 0u);
    EXPECT_EQ(add(INTERESTS_MAX, 1), static_cast<uint32_t>(LC_NO_SPACE));
    EXPECT_EQ(add(0, 2), 0u) << "one is replaced";
}

// --- Queries

TEST_F(Mgmtd, QueriesThatWaitAreBoundedAndKeepNoAnswers) {
    for (int group = 0; group < 16; group++)
        daemon.tree.set[{{"qv", "wccpd", "wccp", "srv_grp", "config", std::to_string(group)}}] =
            std::to_string(group);
    tree_refresh(&daemon.tree);
    const size_t before = mallinfo2().uordblks;
    size_t refused = 0;
    for (uint32_t i = 0; i < 300; i++) {
        query(3, "/qv", bn_query_iterate, bn_qf_subtree);
        refused += sent.back().peer == 3 && code() == LC_NO_SPACE;
        clear();
    }
    EXPECT_EQ(refused, 300 - PENDING_SESSION_MAX);
    EXPECT_LT(mallinfo2().uordblks - before, 1u << 20);
    server_peer_opened(&daemon, 4, "mgmtctl-9");
    query(4, "/qv/wccpd/system/state/" + std::string(PENDING_BYTES_MAX, 'a'), bn_query_get);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_NO_SPACE));
    clear();
    now += MONITOR_TIMEOUT_MS;
    (void)server_tick(&daemon);
    EXPECT_EQ(sent.size(), PENDING_SESSION_MAX);
    EXPECT_TRUE(daemon.pending.empty() && daemon.pending_bytes == 0);
}

TEST_F(Mgmtd, GetAndIterate) {
    ASSERT_EQ(set({{bn_set_create, GROUP + "/router/1/ipaddr", "10.0.0.1"},
                   {bn_set_create, "/qv/wccpd/wccp/srv_grp/config/7", ""}}),
              0u);
    const std::string groups = "/qv/wccpd/wccp/srv_grp/config";
    const struct {
        std::string name;
        uint32_t subop, flags;
        strings found;
    } cases[] = {
        {groups, bn_query_iterate, 0, {groups + "/7=7", GROUP + "=51"}},
        {GROUP + "/router",
         bn_query_iterate,
         bn_qf_subtree | bn_qf_include_self,
         {GROUP + "/router/1=1", GROUP + "/router/1/ipaddr=10.0.0.1"}},
        {GROUP + "/router/1",
         bn_query_iterate,
         bn_qf_subtree | bn_qf_include_self | bn_qf_leaves_only,
         {GROUP + "/router/1/ipaddr=10.0.0.1"}},
    };
    for (const auto &one : cases) {
        query(1, one.name, one.subop, one.flags);
        EXPECT_EQ(found(), one.found) << one.name;
        EXPECT_EQ(code(), 0u) << one.name;
    }
    EXPECT_EQ(last_response()->response_to, 77u);
}

TEST_F(Mgmtd, AStateIsAskedForAndTheAnswerPassedOn) {
    query(3, STATE + "/51/oper", bn_query_get);
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].peer, 1u) << "the working session, not that of the alarms";
    const bn_request_node *last = last_node(sent[0].request);
    EXPECT_EQ(name_of(last->binding), STATE + "/51/oper");
    const uint32_t asked = sent[0].request->msg_id, node_id = last->node_id;
    clear();
    answer(2, asked, node_id, 0);
    EXPECT_TRUE(sent.empty()) << "only who was asked may answer";
    answer(1, asked, node_id, 0);
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].peer, 3u);
    EXPECT_EQ(found(), strings{STATE + "/51/oper=ACTIVE"});
    EXPECT_EQ(last_response()->response_to, 77u);
    answer(1, asked, node_id, 0);
    EXPECT_EQ(sent.size(), 1u) << "an answer counts once";
}

// The groups are asked for one after the other, and no longer than the answer fits a message.
TEST_F(Mgmtd, AWalkOfAllGroupsGoesGroupByGroup) {
    const auto group = [](int id) {
        return event_field{STATE + "/" + std::to_string(id), {bn_type_str, std::to_string(id)}};
    };
    // Answers what wccpd was asked last; what it was asked for.
    const auto answer_last = [&](const std::vector<event_field> &fields) {
        const bn_request_msg *asked = sent.back().request;
        const bn_request_node *node = last_node(asked);
        const uint32_t flags = node->flags, node_id = node->node_id, id = asked->msg_id;
        const std::string name = name_of(node->binding);
        clear();
        answer(1, id, node_id, 0, fields);
        return name + " " + std::to_string(flags);
    };
    const std::string whole = " " + std::to_string(bn_qf_subtree | bn_qf_include_self);
    query(3, "/qv/wccpd/wccp/srv_grp", bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(answer_last({group(7), group(51)}), STATE + " 0");
    EXPECT_EQ(answer_last({group(7), {STATE + "/7/oper", {bn_type_str, "INIT"}}}), STATE + "/7" + whole);
    EXPECT_EQ(answer_last({group(51)}), STATE + "/51" + whole);
    EXPECT_EQ(found(), (strings{STATE + "/7=7", STATE + "/7/oper=INIT", STATE + "/51=51"}));
    clear();
    query(3, STATE, bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(answer_last({}), STATE + " 0"); // no groups
    EXPECT_EQ(code(), 0u);

    const std::vector<event_field> large = {{STATE + "/1/debug", {bn_type_str, std::string(9 << 20, 'x')}}};
    const auto start = [&](uint32_t client) {
        clear();
        query(client, STATE, bn_query_iterate, bn_qf_subtree);
        EXPECT_EQ(answer_last({group(1), group(2), group(3)}), STATE + " 0");
    };
    start(3);
    EXPECT_EQ(answer_last(large), STATE + "/1" + whole);
    EXPECT_EQ(answer_last(large), STATE + "/2" + whole);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_NO_BUFFER_SPACE));
    EXPECT_EQ(message(), "The answer is larger than a message: ask for less");
    for (uint32_t client = 10; client < 14; client++) { // and all walks together are bounded
        server_peer_opened(&daemon, client, "mgmtctl-9");
        start(client);
        EXPECT_EQ(answer_last(large), STATE + "/1" + whole);
        EXPECT_EQ(code(), client < 13 ? UINT32_MAX : static_cast<uint32_t>(LC_NO_SPACE));
    }
    now += MONITOR_TIMEOUT_MS;
    clear();
    EXPECT_EQ(server_tick(&daemon), -1);
    EXPECT_EQ(sent.size(), 3u);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_IO_TIMED_OUT));
    EXPECT_EQ(daemon.gathered_bytes + daemon.pending_bytes, 0u);
}

// What a client doesn't read leaves room for less and less.
TEST_F(Mgmtd, AnAnswerThatDoesNotFitIsRefused) {
    ASSERT_EQ(set({{bn_set_create, GROUP + "/router/1/ipaddr", "10.0.0.1"}}), 0u);
    clear();
    daemon.fits = [](uint32_t peer_id, size_t bytes) { return peer_id == 3 && bytes < 200; };
    query(3, GROUP, bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_NO_BUFFER_SPACE));
    EXPECT_EQ(message(), "Too much waits for you to read it: ask for less, or later");
    EXPECT_EQ(last_response()->response_to, 77u);
    query(3, GROUP + "/router/1/ipaddr", bn_query_get);
    EXPECT_EQ(code(), 0u);
    daemon.fits = nullptr;
    query(3, STATE + "/51/debug", bn_query_get);
    const bn_request_node *asked = last_node(sent.back().request);
    const uint32_t half = GCL_FRAME_MAX / 2 - 64;
    answer(1, sent.back().request->msg_id, asked->node_id, 0,
           {{STATE + "/51/debug", {bn_type_str, std::string(half, 'x')}},
            {STATE + "/51/debug", {bn_type_str, std::string(half, 'x')}}});
    EXPECT_EQ(message(), "The answer is larger than a message: ask for less");
}

TEST_F(Mgmtd, AStateThatNobodyGives) {
    query(3, STATE, bn_query_iterate);
    EXPECT_EQ(server_tick(&daemon), now + MONITOR_TIMEOUT_MS);
    now += MONITOR_TIMEOUT_MS;
    EXPECT_EQ(server_tick(&daemon), -1);
    EXPECT_EQ(code(), static_cast<uint32_t>(LC_IO_TIMED_OUT));
    // A walk that only comes by has its own nodes to tell, whether it is refused or the session goes.
    for (const bool refused : {true, false}) {
        clear();
        query(3, "/qv/wccpd", bn_query_iterate, bn_qf_subtree);
        const bn_request_msg *asked = sent[0].request;
        if (refused)
            answer(1, asked->msg_id, last_node(asked)->node_id, LC_NOT_FOUND);
        else
            server_peer_closed(&daemon, 1);
        EXPECT_EQ(code(), 0u);
        EXPECT_EQ(found().front(), "/qv/wccpd/system/config/mcast_ttl=1");
    }
    query(3, STATE + "/51/oper", bn_query_get);
    EXPECT_EQ(message(), "wccpd has no session");

    // Of two daemons the one that goes half-way leaves nothing, whichever was asked for first.
    const auto follow = [&](uint32_t peer_id) {
        action(peer_id, "/mgmtd/events/actions/interest/add",
               {{"event_name", {bn_type_name, EVENT_CONFIG_CHANGE}}});
        clear();
    };
    server_peer_opened(&daemon, 1, "wccpd-8");
    server_peer_opened(&daemon, 5, "tunneld-9");
    follow(1);
    follow(5);
    bn_request_msg *both = nullptr;
    ASSERT_EQ(bn_query_request_msg_create(&both, 0, nullptr), LC_OK);
    for (const char *name : {NODE_PLANE_STATE, "/qv/wccpd/wccp/srv_grp"})
        ASSERT_EQ(bn_query_request_msg_append_str(both, bn_query_iterate, bn_qf_subtree, name, nullptr),
                  LC_OK);
    EXPECT_TRUE(give(3, both));
    const auto answer_last = [&](uint32_t peer_id, const std::vector<event_field> &fields) {
        ASSERT_EQ(sent.size(), 1u);
        ASSERT_EQ(sent[0].peer, peer_id);
        const uint32_t id = sent[0].request->msg_id, node_id = last_node(sent[0].request)->node_id;
        clear();
        answer(peer_id, id, node_id, 0, fields);
    };
    answer_last(1, {{STATE + "/7", {bn_type_str, "7"}}, {STATE + "/51", {bn_type_str, "51"}}});
    answer_last(1, {{STATE + "/7/oper", {bn_type_str, "INIT"}}});
    clear();
    server_peer_closed(&daemon, 1);
    answer_last(5, {{NODE_PLANE_STATE "/name", {bn_type_str, "user"}}});
    EXPECT_EQ(found(), strings{NODE_PLANE_STATE "/name=user"});
}

// --- Events

// A process has several sessions; another process id is a restart, and its predecessor's late end is none.
TEST_F(Mgmtd, ProcessesAreKnownByTheirSessions) {
    const auto process = [&] {
        query(3, NODE_PROCESSES, bn_query_iterate, bn_qf_subtree);
        strings out = found();
        std::erase_if(out, [](const std::string &node) { return node.find("/since=") != std::string::npos; });
        return out;
    };
    const auto wccpd = [](const char *state, const char *pid, const char *restarts) {
        return strings{NODE_PROCESSES "/wccpd=" + std::string(state),
                       NODE_PROCESSES "/wccpd/pid=" + std::string(pid),
                       NODE_PROCESSES "/wccpd/restarts=" + std::string(restarts)};
    };
    EXPECT_EQ(process(), wccpd("running", "7", "0"));
    server_peer_closed(&daemon, 2);
    EXPECT_EQ(process(), wccpd("running", "7", "0"));
    server_peer_opened(&daemon, 6, "wccpd-9");
    EXPECT_EQ(process(), wccpd("running", "9", "1"));
    server_peer_closed(&daemon, 1);
    EXPECT_EQ(process(), wccpd("running", "9", "1"));
    server_peer_closed(&daemon, 6);
    EXPECT_EQ(process(), wccpd("gone", "9", "1"));
    server_peer_opened(&daemon, 7, "wccpdx-1");
    server_peer_opened(&daemon, 8, "tunneld-x");
    EXPECT_EQ(process(), wccpd("gone", "9", "1"));
}

TEST_F(Mgmtd, ReportsStandUntilTheirSessionEndsAndAreBounded) {
    action(3, "/mgmtd/events/actions/interest/add",
           {{"event_name", {bn_type_name, "/qv/alarms/events/raise_alarm"}}});
    clear();
    const auto raise = [&](uint32_t peer_id, const std::string &source, const std::string &text) {
        EXPECT_TRUE(give(peer_id,
                         make_event("/qv/alarms/events/raise_alarm", {{"alarm_type", {bn_type_str, "196638"}},
                                                                      {"param_3", {bn_type_str, source}},
                                                                      {"comment", {bn_type_str, text}}})));
    };
    raise(2, "eth0:grp:51", std::string(5000, 'x'));
    ASSERT_EQ(sent.size(), 2u);
    EXPECT_EQ(sent[0].peer, 3u) << "passed on";
    EXPECT_EQ(sent[1].mtype, bn_msg_event_ack);
    raise(2, "eth0:grp:51", "again");
    // A number that is none stops no walk.
    EXPECT_TRUE(give(2, make_event("/qv/state/events/role_change", {{"group", {bn_type_str, "51"}},
                                                                    {"role", {bn_type_uint32, "1"}},
                                                                    {"code", {bn_type_str, "many"}}})));
    clear();
    query(3, "/qv/alarms/state", bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(found().size(), 11u) << "four of them about the process";
    EXPECT_TRUE(has(found(), "/qv/alarms/state/role/51=BACKUP") &&
                has(found(), "/qv/alarms/state/role/51/code=0"));
    server_peer_closed(&daemon, 2);
    query(3, NODE_ALARMS_RAISED, bn_query_iterate, bn_qf_subtree);
    EXPECT_EQ(found(), strings{});
    for (size_t i = 0; i < ALARMS_MAX + 9; i++)
        raise(3, std::to_string(i), std::string(5000, 'x'));
    EXPECT_EQ(daemon.alarm_owners.size(), ALARMS_MAX);
    size_t kept = 0;
    for (const auto &[name, value] : daemon.state)
        kept += value.text.size();
    EXPECT_LT(kept, ALARMS_MAX * 1024);
}

// --- Groups that are out of their routers for a time

TEST_F(Mgmtd, AGroupThatIsOutOfItsRoutersIsDownForWccpdAlone) {
    const std::string admin = GROUP + "/admin", left = "/qv/alarms/state/left/51";
    const auto seen_by = [&](uint32_t peer_id) {
        query(peer_id, admin, bn_query_get);
        return found().empty() ? "" : found().front().substr(admin.size() + 1);
    };
    std::string heard; // by a session that watches: l and j
    const auto listen = [&] {
        for (const sent_message &one : sent)
            if (one.peer == 8 && one.mtype == bn_msg_event)
                heard += strcmp(ts_str(one.request->text), EVENT_GROUP_LEAVE) == 0 ? "l" : "j";
        return changes();
    };
    const auto report = [&](uint32_t peer_id, const char *event, std::vector<event_field> more = {}) {
        more.push_back({"group", {bn_type_uint8, "51"}});
        clear();
        EXPECT_TRUE(give(peer_id, make_event(event, more)));
        return listen();
    };
    server_peer_opened(&daemon, 8, "mgmtctl-1");
    for (const char *event : {EVENT_GROUP_LEAVE, EVENT_GROUP_JOIN})
        action(8, "/mgmtd/events/actions/interest/add", {{"event_name", {bn_type_name, event}}});
    const event_field reason = {"reason", {bn_type_str, "proxy down: status 503"}};
    const strings goes = {admin + "=up>down"}, comes = {admin + "=down>up"};
    ASSERT_EQ(set({{bn_set_create, GROUP + "/interface", "eth0"},
                   {bn_set_create, GROUP + "/router/1/ipaddr", "10.0.0.1"},
                   {bn_set_create, NODE_INTERCEPT_CONFIG "/51/ports", "80"},
                   {bn_set_create, NODE_INTERCEPT_CONFIG "/51/to", "3128"}}),
              0u)
        << message();
    action(3, "/mgmtd/events/actions/interest/add", {{"event_name", {bn_type_name, EVENT_CONFIG_CHANGE}}});
    const std::string saved = content();
    EXPECT_EQ(report(3, EVENT_GROUP_LEAVE, {reason}), strings{}) << "only tunneld may say so";
    server_peer_opened(&daemon, 5, "tunneld-9");
    EXPECT_EQ(report(5, EVENT_GROUP_LEAVE, {reason}), goes);
    EXPECT_EQ(events(3).size(), 0u);
    EXPECT_EQ(seen_by(1) + " " + seen_by(3), "down up");
    EXPECT_EQ(content(), saved);
    query(3, left, bn_query_get);
    EXPECT_EQ(found(), strings{left + "=proxy down: status 503"});
    EXPECT_EQ(report(5, EVENT_GROUP_LEAVE, {reason}), strings{}) << "it knows already";

    // What is configured meanwhile does not bring the group up.
    for (const char *word : {"down", "up"}) {
        EXPECT_EQ(set({{bn_set_modify, admin, word}}), 0u);
        EXPECT_EQ(changes(), strings{});
        EXPECT_EQ(events(3).size(), 1u);
        EXPECT_EQ(seen_by(1) + " " + seen_by(3), std::string("down ") + word);
    }
    EXPECT_EQ(set({{bn_set_modify, GROUP + "/priority", "7"}}), 0u);
    EXPECT_TRUE(has(changes(), admin + "=->down")) << "it is created again in wccpd";
    EXPECT_EQ(report(5, EVENT_GROUP_JOIN), comes);
    EXPECT_EQ(seen_by(1), "up");
    EXPECT_EQ(report(5, EVENT_GROUP_JOIN), strings{});

    // tunneld goes: for a time another may take over.
    const auto tick = [&](int64_t after_ms) {
        clear();
        now += after_ms;
        (void)server_tick(&daemon);
        return listen();
    };
    EXPECT_EQ(report(5, EVENT_GROUP_LEAVE, {reason}), goes);
    server_peer_closed(&daemon, 5);
    EXPECT_EQ(tick(LEFT_KEEP_MS - 1), strings{});
    server_peer_opened(&daemon, 6, "tunneld-10");
    EXPECT_EQ(tick(LEFT_KEEP_MS), strings{});
    EXPECT_EQ(report(6, EVENT_PROXY_CHANGE, {{"up", {bn_type_bool, "false"}}}), strings{});
    EXPECT_EQ(report(6, EVENT_PROXY_CHANGE, {{"up", {bn_type_bool, "true"}}}), comes);
    EXPECT_EQ(report(6, EVENT_GROUP_LEAVE, {reason}), goes);
    server_peer_closed(&daemon, 6);
    clear();
    EXPECT_EQ(server_tick(&daemon), now + LEFT_KEEP_MS);
    EXPECT_EQ(tick(LEFT_KEEP_MS), comes);
    query(3, left, bn_query_get);
    EXPECT_EQ(found(), strings{});

    EXPECT_EQ(heard, "ljljlj") << "each change once, whoever reports it";

    // With the group it goes, and doesn't come back with it.
    server_peer_opened(&daemon, 7, "tunneld-11");
    EXPECT_EQ(report(7, EVENT_GROUP_LEAVE, {reason}), goes);
    EXPECT_EQ(set({{bn_set_delete, GROUP, ""}}), 0u);
    EXPECT_TRUE(daemon.left.empty());
    EXPECT_EQ(report(7, EVENT_GROUP_LEAVE, {reason}), strings{});
    EXPECT_TRUE(daemon.left.empty());
    EXPECT_EQ(set({{bn_set_create, GROUP + "/interface", "eth0"}}), 0u);
    EXPECT_TRUE(has(changes(), admin + "=->up"));
}

TEST_F(Mgmtd, AGroupThatIsDrainedAnnouncesNothingAndLeavesOnceItIsEmpty) {
    const std::string admin = GROUP + "/admin", weight = GROUP + "/weight", drain = NODE_DRAINS "/51";
    const auto report = [&](const char *event, std::vector<event_field> more) {
        more.push_back({"group", {bn_type_uint8, "51"}});
        clear();
        EXPECT_TRUE(give(5, make_event(event, more)));
        return changes();
    };
    const auto act = [&](const char *name, const std::vector<event_field> &fields = {}) {
        clear();
        action(3, name, fields);
        return changes();
    };
    const auto slow_down = [&](const char *percent) {
        return report(EVENT_GROUP_WEIGHT, {{"percent", {bn_type_uint32, percent}}});
    };
    const auto count = [&](const char *flows, const char *empty) {
        return report(EVENT_DRAIN_PROGRESS,
                      {{"flows", {bn_type_uint32, flows}}, {"empty", {bn_type_bool, empty}}});
    };
    const auto state = [&](const std::string &below = "") {
        query(3, drain + below, bn_query_get);
        return found().empty() ? "" : found().front().substr(drain.size() + below.size() + 1);
    };
    const auto tick = [&](int64_t after_ms) {
        clear();
        now += after_ms;
        (void)server_tick(&daemon);
        return changes();
    };
    ASSERT_EQ(set({{bn_set_create, GROUP + "/interface", "eth0"},
                   {bn_set_create, weight, "7"},
                   {bn_set_create, NODE_INTERCEPT_CONFIG "/51/ports", "80"},
                   {bn_set_create, NODE_INTERCEPT_CONFIG "/51/to", "3128"}}),
              0u);
    server_peer_opened(&daemon, 5, "tunneld-9");
    // The steps of a slow start; what is configured meanwhile comes in its part. No step is less than 1.
    EXPECT_EQ(slow_down("20"), strings{weight + "=7>1"});
    EXPECT_EQ(slow_down("20"), strings{});
    EXPECT_EQ(slow_down("40"), strings{weight + "=1>2"});
    EXPECT_EQ(set({{bn_set_modify, weight, "10"}}), 0u);
    EXPECT_EQ(changes(), strings{weight + "=2>4"});
    query(3, weight, bn_query_get);
    EXPECT_EQ(found(), strings{weight + "=10"});
    // A drain takes the rest, and a new tunneld may still follow.
    EXPECT_EQ(act(ACTION_DRAIN, {{"group", {bn_type_uint8, "51"}}}), strings{weight + "=4>0"});
    EXPECT_EQ(server_tick(&daemon), now + 60000) << "the configured time";
    EXPECT_EQ(act(ACTION_DRAIN, {{"seconds", {bn_type_uint32, "9"}}}), strings{}) << "all groups, anew";
    EXPECT_EQ(slow_down("60"), strings{});
    EXPECT_EQ(slow_down("100"), strings{});
    EXPECT_EQ(count("3", "false"), strings{});
    EXPECT_EQ(state() + " " + state("/flows"), "draining 3");
    query(1, weight, bn_query_get);
    EXPECT_EQ(found(), strings{weight + "=0"});
    EXPECT_EQ(count("0", "true"), strings{admin + "=up>down"});
    EXPECT_EQ(state(), "drained");
    server_peer_closed(&daemon, 5);
    EXPECT_EQ(tick(100000), strings{}) << "it stays out";
    EXPECT_EQ(act(ACTION_DRAIN), strings{});
    EXPECT_EQ(act(ACTION_DRAIN_CANCEL), (strings{weight + "=0>10", admin + "=down>up"}));
    EXPECT_EQ(state(), "");
    EXPECT_EQ(act(ACTION_DRAIN_CANCEL), strings{});
    EXPECT_EQ(message(), "There is no drain");
    // Without tunneld, or with flows that don't end, by its time.
    for (const bool followed : {false, true}) {
        if (followed) {
            server_peer_opened(&daemon, 5, "tunneld-10");
            EXPECT_EQ(slow_down("80"), strings{weight + "=10>8"});
        }
        (void)act(ACTION_DRAIN, {{"seconds", {bn_type_uint32, "9"}}});
        if (followed) {
            EXPECT_EQ(count("5", "false"), strings{});
        }
        EXPECT_EQ(tick(8999), strings{});
        EXPECT_EQ(tick(1), strings{admin + "=up>down"});
        EXPECT_EQ(state(), "over");
        (void)act(ACTION_DRAIN_CANCEL, {{"group", {bn_type_uint8, "51"}}});
    }
    // What a tunneld that is gone for good has slowed down gets its weight back.
    server_peer_closed(&daemon, 5);
    EXPECT_EQ(tick(LEFT_KEEP_MS - 1), strings{});
    EXPECT_EQ(tick(1), strings{weight + "=8>10"});
    EXPECT_NE(content().find("weight = 10"), std::string::npos);
    const struct {
        std::vector<event_field> fields;
        const char *refused;
    } bad[] = {{{{"group", {bn_type_str, "256"}}}, "group is no number between 0 and 255"},
               {{{"group", {bn_type_str, "7"}}}, "There is no group 7"},
               {{{"seconds", {bn_type_str, "86401"}}}, "seconds is no number between 0 and 86400"}};
    for (const auto &one : bad) {
        EXPECT_EQ(act(ACTION_DRAIN, one.fields), strings{});
        EXPECT_EQ(message(), one.refused);
    }
    (void)act(ACTION_DRAIN);
    EXPECT_EQ(set({{bn_set_delete, GROUP, ""}}), 0u);
    EXPECT_TRUE(daemon.drains.empty());
    EXPECT_EQ(state(), "");
}

// --- Bypasses

TEST_F(Mgmtd, BypassesEndByThemselves) {
    const std::string root = NODE_BYPASS_CONFIG;
    int64_t clock = 1000;
    daemon.clock_s = [&] { return clock; };
    std::ofstream(daemon.file.path) << "[" << root << "]\n10.0.0.0\\/8/until = 900\n10.1.0.0\\/16/until = 0\n"
                                    << "10.2.0.0\\/16/until = 1010\n10.3.0.0\\/16/until = 1010\n";
    std::string errors, warnings;
    ASSERT_TRUE(server_load(&daemon, &errors, &warnings)) << errors;
    const auto kept = [&] {
        query(3, root, bn_query_iterate);
        strings out;
        for (const std::string &each : found())
            out.push_back(each.substr(each.find('=') + 1));
        return out;
    };
    const uint32_t before = daemon.tree.revision;
    EXPECT_EQ(server_tick(&daemon), now + 10000);
    EXPECT_EQ(kept(), (strings{"10.1.0.0/16", "10.2.0.0/16", "10.3.0.0/16"}));
    EXPECT_EQ(content().find("10.0.0.0"), std::string::npos) << content();
    clock += 10;
    now += 10000;
    EXPECT_EQ(server_tick(&daemon), -1);
    EXPECT_EQ(kept(), strings{"10.1.0.0/16"});
    EXPECT_EQ(daemon.tree.revision, before + 2) << "one commit for all that are due";
    // One that can't be deleted is tried again, not at each turn.
    ASSERT_EQ(set({{bn_set_create, root + "/10.4.0.0\\/16/until", "1011"}}), 0u);
    daemon.file.path = std::string(file) + "/no/such/directory";
    clock++;
    EXPECT_EQ(server_tick(&daemon), now + 60000);
    EXPECT_EQ(server_tick(&daemon), now + 60000);
    EXPECT_EQ(kept().size(), 2u);
}

// --- Supervision

TEST(Supervision, AnEndHasItsNameAndTheNextStartItsDelay) {
    int64_t delay = 0;
    for (const int64_t expected : {1000, 2000, 4000, 8000, 16000, 30000, 30000})
        EXPECT_EQ(delay = next_delay(delay, 10), expected);
    EXPECT_EQ(next_delay(delay, SETTLED_MS), 1000);
    const struct {
        int status;
        bool ending;
        const char *event;
    } cases[] = {{SIGKILL, false, "/pm/events/failure/crash"},
                 {SIGTERM, false, "/pm/events/proc/terminate"},
                 {W_EXITCODE(1, 0), false, "/pm/events/failure/unexpected_exit"},
                 {W_EXITCODE(0, 0), true, "/pm/events/proc/terminate"}};
    for (const auto &one : cases)
        EXPECT_STREQ(end_event(one.status, one.ending), one.event);
}

// Of a mgmtd that was killed: the program is ending, and cannot be started beside itself.
TEST(Supervision, AnEarlierRunEndsFirst) {
    std::string said;
    int64_t now = 1000;
    supervisor self, earlier;
    for (supervisor *each : {&earlier, &self}) {
        each->children.push_back({"slow", {"sleep", "100"}});
        each->children[0].lock_file = "/tmp/slow.lock";
        each->now_ms = [&] { return now; };
        each->say = [&](const std::string &line) { said += line + "\n"; };
        each->tell = [](const std::string &, const std::string &) {};
    }
    (void)supervisor_tick(&earlier);
    said.clear();
    EXPECT_EQ(supervisor_tick(&self), now + EARLIER_RUN_EVERY_MS);
    now += EARLIER_RUN_EVERY_MS;
    (void)supervisor_tick(&self);
    EXPECT_EQ(said, "process slow: an earlier one still runs; waits for its end\n");
    kill(earlier.children[0].pid, SIGKILL); // its end counts before anybody has taken it in
    pollfd ended = {earlier.children[0].pidfd, POLLIN, 0};
    ASSERT_EQ(poll(&ended, 1, 5000), 1);
    now += EARLIER_RUN_EVERY_MS;
    (void)supervisor_tick(&self);
    EXPECT_FALSE(supervisor_is_done(self));
    for (supervisor *each : {&earlier, &self}) {
        each->ending = true;
        kill(each->children[0].pid, SIGKILL);
        poll(&(ended = {each->children[0].pidfd, POLLIN, 0}), 1, 5000);
        supervisor_reap(each);
        EXPECT_TRUE(supervisor_is_done(*each));
    }
    unlink("/tmp/slow.lock");
}

// Its number may be another process's by then.
TEST(Supervision, AChildWhoseEndSomebodyElseTookInIsOver) {
    std::vector<std::string> told;
    supervisor self;
    self.children.push_back({"quick", {"true"}});
    self.now_ms = [] { return int64_t{1000}; };
    self.say = [](const std::string &) {};
    self.tell = [&](const std::string &event, const std::string &) { told.push_back(event); };
    (void)supervisor_tick(&self);
    ASSERT_FALSE(supervisor_is_done(self));
    ASSERT_EQ(waitpid(self.children[0].pid, nullptr, 0), self.children[0].pid);
    supervisor_reap(&self);
    EXPECT_TRUE(supervisor_is_done(self));
    EXPECT_EQ(told, strings{EVENT_PROCESS_EXIT});
}

// tunneld is killed: whether anybody hears of it depends on how soon the next one has its session.
TEST(Supervision, ALossIsReportedWhenNobodyTakesOverInTime) {
    strings told;
    std::string said;
    int64_t now = 100000;
    supervisor self;
    self.children.push_back({"tunneld", {"sleep", "100"}});
    self.children[0].takes_over = true;
    self.now_ms = [&] { return now; };
    self.say = [&](const std::string &line) { said += line + "\n"; };
    self.tell = [&](const std::string &event, const std::string &) { told.push_back(event); };
    child &tunneld = self.children[0];
    const auto open_session = [&] {
        supervisor_session_opened(&self, "tunneld-" + std::to_string(tunneld.pid));
    };
    // Ends after a run of so long. Gives the time of the next thing to do, from then on.
    const auto end = [&](int signal, int64_t ran_ms) {
        now += ran_ms;
        kill(tunneld.pid, signal);
        pollfd ended = {tunneld.pidfd, POLLIN, 0};
        EXPECT_EQ(poll(&ended, 1, 5000), 1);
        supervisor_reap(&self);
        return supervisor_tick(&self) - now;
    };
    (void)supervisor_tick(&self);
    open_session();
    EXPECT_EQ(end(SIGKILL, 1000), TAKE_OVER_MS);
    EXPECT_FALSE(supervisor_is_done(self)) << "started again at once";
    supervisor_session_opened(&self, "tunneld-1");
    now += TAKE_OVER_MS - 1;
    (void)supervisor_tick(&self);
    said.clear();
    open_session();
    EXPECT_EQ(said, "process tunneld: ended by SIGKILL, replaced after 2999 ms\n");
    now++;
    EXPECT_EQ(supervisor_tick(&self), -1);
    EXPECT_EQ(told, strings{});

    // Too late; and the one that never had a session is started by the usual delays, within the same loss.
    EXPECT_EQ(end(SIGKILL, 1000), TAKE_OVER_MS);
    EXPECT_EQ(end(SIGKILL, 10), RESTART_DELAY_FIRST_MS);
    EXPECT_EQ(told, strings{});
    now += TAKE_OVER_MS - 10;
    (void)supervisor_tick(&self);
    EXPECT_EQ(told, strings{EVENT_PROCESS_CRASH});
    open_session();
    EXPECT_EQ(said.find("replaced after 30"), std::string::npos) << said;

    // One that ends as soon as it has taken over is not started again and again without a pause.
    EXPECT_GT(end(SIGKILL, SHORT_RUN_MS - 1), 0);
    EXPECT_TRUE(supervisor_is_done(self));
    now += RESTART_DELAY_MAX_MS;
    (void)supervisor_tick(&self);
    told.clear();

    // That it is replaced each time doesn't hide that it keeps crashing.
    now += 2 * CRASHES_EVERY_MS;
    said.clear();
    for (int crash = 0; crash < 9; crash++) {
        open_session();
        EXPECT_EQ(end(SIGKILL, 20000), TAKE_OVER_MS);
    }
    open_session();
    const size_t warned = said.find("crashed 4 times in 60 s\n");
    ASSERT_NE(warned, std::string::npos) << said;
    EXPECT_EQ(said.find("crashed"), warned) << said;
    EXPECT_EQ(said.find("crashed", said.rfind("crashed 4 times in 60 s\n") + 1), std::string::npos) << said;
    EXPECT_EQ(told, strings{});

    // An orderly end is one, and so is the end of everything.
    open_session();
    EXPECT_GE(end(SIGTERM, 1000), RESTART_DELAY_FIRST_MS);
    EXPECT_EQ(told, strings{EVENT_PROCESS_TERMINATE});
    now += RESTART_DELAY_MAX_MS;
    (void)supervisor_tick(&self);
    open_session();
    (void)end(SIGKILL, 1000);
    self.ending = true;
    (void)supervisor_tick(&self);
    (void)end(SIGKILL, TAKE_OVER_MS);
    EXPECT_EQ(told, (strings{EVENT_PROCESS_TERMINATE, EVENT_PROCESS_TERMINATE}));
    EXPECT_TRUE(supervisor_is_done(self));
}

// Started by systemd, say: mgmtd sees sessions, and what the process itself reports.
TEST(Supervision, SomebodyElsesProcessIsKnownByItsSessions) {
    strings told;
    std::string said;
    int64_t now = 100000;
    supervisor self;
    self.children = {{"tunneld", {}}, {"wccpd", {}}};
    self.children[0].takes_over = true;
    self.now_ms = [&] { return now; };
    self.say = [&](const std::string &line) { said += line; };
    self.tell = [&](const std::string &event, const std::string &process) {
        told.push_back(process + event);
    };
    EXPECT_EQ(supervisor_tick(&self), -1) << "nobody is started";
    supervisor_session_opened(&self, "tunneld-7");
    supervisor_session_closed(&self, "tunneld-7");
    EXPECT_EQ(supervisor_tick(&self), now + TAKE_OVER_MS);
    now += 40;
    supervisor_session_opened(&self, "tunneld-9");
    EXPECT_EQ(said, "process tunneld: its session is lost, replaced after 40 ms");
    EXPECT_EQ(supervisor_tick(&self), -1);

    // An orderly end is reported by the process, and the end of its session is no second one.
    EXPECT_TRUE(supervisor_take_report(&self, "tunneld"));
    supervisor_session_closed(&self, "tunneld-9");
    EXPECT_EQ(supervisor_tick(&self), -1);
    supervisor_session_opened(&self, "tunneld-11");
    supervisor_session_closed(&self, "tunneld-11");
    now += TAKE_OVER_MS;
    (void)supervisor_tick(&self);
    EXPECT_EQ(told, strings{"tunneld" EVENT_PROCESS_CRASH});

    supervisor_session_opened(&self, "wccpd-8");
    supervisor_session_opened(&self, "wccpd-8");
    supervisor_session_closed(&self, "wccpd-8");
    EXPECT_EQ(told.size(), 1u) << "it has another session";
    supervisor_session_closed(&self, "wccpd-8");
    EXPECT_EQ(told.back(), "wccpd" EVENT_PROCESS_EXIT);
    self.children[0].command = {"tunneld"};
    EXPECT_FALSE(supervisor_take_report(&self, "tunneld")) << "the supervisor reports what it has started";
}
