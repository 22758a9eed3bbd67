// mgmtctl without mgmtd: what it shows, what it says of changes and of names that don't exist, and its
// session with a provider made by hand.
#include <arpa/inet.h>

#include <filesystem>
#include <thread>

#include <gtest/gtest.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/check.h"
#include "peers/mgmtctl/config_change.h"
#include "peers/mgmtctl/nodes.h"
#include "peers/mgmtctl/render.h"
#include "peers/mgmtctl/watch.h"
#include "peers/nodes/binding_text.h"
#include "tests/support/canned_nodes.h"
#include "tests/support/gcl_provider.h"
#include "tests/support/texts.h"

static const std::string GROUPS = "/qv/wccpd/wccp/srv_grp/config", G51 = GROUPS + "/51",
                         STATES = "/qv/wccpd/wccp/srv_grp/state";

// --- What is shown

TEST(Shown, ValuesAreNumbersForAScriptAndPasswordsStarsForAll) {
    const auto check = [](const ctl_binding &binding, const std::string &json, const char *text) {
        EXPECT_EQ(json_line(json_node(binding, false)["value"]), json + "\n");
        EXPECT_EQ(text_node(binding, false), text);
    };
    check({"/a", "uint32", "4294967295"}, "4294967295", "/a = 4294967295\n");
    check({"/a", "float64", "nan"}, "\"nan\"", "/a = nan\n");
    check({"/a", "bool", "true"}, "true", "/a = true\n");
    check({"/a", "string", "7"}, "\"7\"", "/a = 7\n");
    check({"/a", "none", ""}, "null", "/a =\n");
    check({"/a", "string", "x\n y\n\n"}, "\"x\\n y\\n\\n\"", "/a =\n    x\n     y\n");
    check({"/a", "string", "\xff"}, "\"\\ufffd\"", "/a = \xff\n");
    check({"/a/password", "string", ""}, "\"\"", "/a/password =\n");
    check({"/a/debug", "string", "WCCP password  : ab 0x61\nx: y\n WCCP password : \nWCCP password"},
          "\"WCCP password  : ********\\nx: y\\n WCCP password : ********\\nWCCP password\"",
          "/a/debug =\n    WCCP password  : ********\n    x: y\n     WCCP password : ********\n    WCCP "
          "password\n");
}

TEST(Shown, AnEventIsALineAndAnObject) {
    const ctl_binding group = {"group", "uint8", "51"}, reason = {"reason", "string", "refused\033"};
    const ctl_binding up = {"up", "bool", "true"}, down = {"up", "bool", "false"};
    const auto check = [](const ctl_event &event, const char *text, const char *json) {
        EXPECT_EQ(text_event(event, false), strings{text});
        EXPECT_EQ(json_line(json_event(event, false)), std::string(json) + "\n");
    };
    check({EVENT_GROUP_LEAVE, {group, reason}}, "group 51 leaves its routers: refused?",
          R"({"event":"group_leave","group":51,"reason":"refused?"})");
    check({EVENT_GROUP_JOIN, {group}}, "group 51 joins its routers again",
          R"({"event":"group_join","group":51})");
    check({EVENT_PROXY_CHANGE, {group, down, reason}}, "proxy of group 51: down, refused?",
          R"({"event":"proxy","group":51,"proxy":"down","reason":"refused?"})");
    check({EVENT_PROXY_CHANGE, {group, up, reason}}, "proxy of group 51: up",
          R"({"event":"proxy","group":51,"proxy":"up","reason":null})");
}

TEST(Shown, AChangeTellsBothSidesAndNoSecret) {
    const ctl_event change = {
        EVENT_CONFIG_CHANGE,
        bindings_of("/mgmtd/notification/dbchange/",
                    "%09 uint32 9|%09/change_type string modify|%09/name string " + G51 +
                        "/password|%09/new_attribs/value string neu|%09/prev_attribs/value string alt|"
                        "%11/change_type string delete|%11/name string " +
                        G51 + "/policy_grp|%11/prev_attribs/value uint32 3|")};
    EXPECT_EQ(text_event(change, false), (strings{"modify " + G51 + "/password = ******** (was ********)",
                                                  "delete " + G51 + "/policy_grp (was 3)"}));
    const ctl_json told = json_event(change, true);
    EXPECT_EQ(told["changes"].items[0]["after"].text, "neu");
    EXPECT_EQ(json_text(told["changes"].items[1]),
              "{\"name\":\"" + G51 +
                  R"(/policy_grp","change":"delete","type":"uint32","before":3,"after":null})");
}

TEST(Shown, JsonIsWrittenInAsciiAndReadToADepth) {
    const strings pair = {"a", "b"};
    ctl_json made = {{"z", UINT64_MAX}, {"a", {{"x", -1}, {"y", nullptr}}}, {"pair", pair}, {"z", 2}};
    made["list"].push_back({1.5, true, "\xc3\xa4\xff\x7f\n"});
    made.update({{"a", ctl_json::array()}});
    EXPECT_EQ(json_text(made), "{\"z\":18446744073709551615,\"a\":[],\"pair\":[\"a\",\"b\"],"
                               "\"list\":[[1.5,true,\"\\u00e4\\ufffd\\u007f\\n\"]]}");
    const auto nested = [](size_t depth) { return std::string(depth, '[') + std::string(depth, ']'); };
    ctl_json read;
    EXPECT_TRUE(parse_json(nested(100), &read) && json_text(read) == nested(100));
    EXPECT_FALSE(parse_json(nested(101), &read) || parse_json("[1] 2", &read) || parse_json("", &read));
    EXPECT_TRUE(parse_json("{\"a\":1,\"a\":-2}", &read) && json_text(read["a"]) == "-2");
}

// --- Changes

TEST(Changes, WhatARunningGroupFollowsOnlyAsAWholeIsTold) {
    const groups_before before = {
        {G51, GROUPS + "/52"},
        bindings_of(G51, "%/priority uint32 10|%/protocol string tcp|%/policy_grp uint32 3|"
                         "%/weight uint32 100|%/router/1 uint8 1|")};
    // Changes are NAME=VALUE, or NAME to remove it; `note` is a piece of the note.
    const auto check = [&](const char *changes, const strings &created, const char *note) {
        std::vector<ctl_change_item> items;
        std::istringstream words(changes);
        for (std::string word; words >> word;) {
            const size_t end = std::min(word.find('='), word.size());
            items.push_back(
                {end < word.size() ? ctl_change::create : ctl_change::remove,
                 {GROUPS + "/" + word.substr(0, end), "", word.substr(std::min(end + 1, word.size()))}});
        }
        const change_notes said = notes_of(items, before);
        EXPECT_TRUE(said.created == created && said.notes.size() == (*note ? 1 : 0)) << changes;
        EXPECT_TRUE(contains(joined(said.notes, ""), note));
    };
    check("51/weight=7", {}, "");
    check("51/priority=10 51/priority=0x0a 51/protocol", {}, "");
    check("51/priority=9 51/router/2/ipaddr=10.0.0.2", {},
          "group 51: wccpd applies a change of priority, router only by");
    check("51/priority", {}, "a change of priority only by");
    check("51/interface", {}, "a change of interface"); // it wasn't set, as far as is known
    check("51/policy_grp 51/router/1", {}, "a change of policy_grp, router/1 only by");
    check("51/router/1 51", {}, "");
    check("53/weight=7 53/priority=1", {GROUPS + "/53"}, "");
    check("53/weight=7 52", {GROUPS + "/53"}, "");
    check("53/weight=7 51/weight=7", {GROUPS + "/53"}, "");
}

// Two configurations: what is shown of their difference, and what is asked for. Applied, nothing differs.
TEST(Changes, AWholeConfigurationIsItsDifference) {
    const std::string section = "[" + G51 + "]\n", routers = "router/1/ipaddr = 10.0.0.1\n";
    std::string errors;
    // The names are without the group's root; items are +NAME=VALUE, or -NAME.
    const auto check = [&](const std::string &from, const std::string &to, const char *wanted_changes,
                           const char *wanted_items, size_t notes) {
        config_text before;
        node_tree after, made;
        ASSERT_TRUE(config_parse(from, "F", &before)) << before.errors;
        ASSERT_TRUE(read_config(to, "F", before.tree, false, &after, &errors)) << errors;
        const std::vector<node_change> changes = config_changes(before.tree, after);
        const std::vector<ctl_change_item> asked = items_of(changes, after);
        strings shown, items;
        std::vector<set_step> steps;
        for (const node_change &change : changes)
            shown.push_back(text_change(change, false).erase(7, G51.size()));
        for (const auto &[kind, binding] : asked) {
            const bool creates = kind == ctl_change::create;
            items.push_back((creates ? "+" : "-") + binding.name.substr(G51.size()) +
                            (creates ? "=" + binding.value : ""));
            steps.push_back(
                {creates ? set_kind::create : set_kind::remove, binding.name, bn_type_str, binding.value});
        }
        EXPECT_EQ(joined(shown, ", "), wanted_changes) << to;
        EXPECT_EQ(joined(items, " "), wanted_items) << to;
        EXPECT_EQ(config_notes(asked, before.tree).notes.size(), notes) << to;
        EXPECT_EQ(tree_prepare(before.tree, steps, &made).message, "");
        EXPECT_EQ(made.nodes, after.nodes) << to;
        // What is exported reads the same, with the passwords and without.
        for (const bool secrets : {false, true})
            for (const std::string &text :
                 {export_text({made, {}, {}, ""}, secrets), json_line(export_json(made, secrets))}) {
                node_tree again;
                ASSERT_TRUE(read_config(text, "F", made, false, &again, &errors)) << text << errors;
                EXPECT_EQ(again.set, made.set) << text;
                EXPECT_EQ(contains(text, "= b") || contains(text, "\"b\""),
                          secrets && contains(to, "password = b"))
                    << text;
            }
    };
    check(section + "weight = 100\n", section, "", "", 0);
    check(section, section + "weight = 100\n", "", "", 0);
    check(section + "weight = 7\n", section, "modify /weight = 100 (was 7)", "-/weight", 0);
    check(section + "weight = 7\n", section + "weight=100\n", "modify /weight = 100 (was 7)", "+/weight=100",
          0);
    check("", section + "weight = 7\n", "add     = 51, add    /weight = 7", "+=51 +/weight=7", 0);
    check(section + "weight = 7\n", "", "delete  (was 51), delete /weight (was 7)", "-", 0);
    check(section + routers + "router/2/ipaddr = 10.0.0.2\npassword = a\n",
          section + routers + "password = b\n",
          "modify /password = ******** (was ********), delete /router/2 (was 2), "
          "delete /router/2/ipaddr (was 10.0.0.2)",
          "+/password=b -/router/2", 1);
    // A password that is hidden stays; an object of nodes is the same as a file.
    check(section + "password = a\nweight = 7\n", section + "password = ********\nweight = 7\n", "", "", 0);
    check(section + "password = a\nweight = 7\nencap = l2\n",
          "{\"" + G51 + "/password\": \"********\", \"" + G51 + "/weight\": 8, \"" + G51 +
              "/hash_dst_ip\": true}",
          "modify /encap = either (was l2), modify /hash_dst_ip = true (was false), "
          "modify /weight = 8 (was 7)",
          "-/encap +/hash_dst_ip=true +/weight=8", 1);

    config_text before;
    node_tree after;
    ASSERT_TRUE(config_parse(section + routers + "weight = 7\n", "F", &before));
    ASSERT_TRUE(
        read_config(section + "router/2/ipaddr = 10.0.0.2\n", "F", before.tree, true, &after, &errors));
    EXPECT_EQ(items_of(config_changes(before.tree, after), after).size(), 2u) << "the rest stays";
    const auto refuse = [&](const std::string &content, const std::string &error) {
        EXPECT_FALSE(read_config(content, "F", before.tree, false, &after, &errors));
        EXPECT_EQ(errors.substr(0, error.size()), error);
    };
    refuse(section + "password = ********\n", "F:2: " + G51 + "/password: the password is hidden, and");
    refuse(section + "weight = x\n", "F:2: " + G51 + "/weight: \"x\" is not a valid uint32\n");
    refuse("{", "F: is not a JSON object of nodes and their values\n");
    refuse(" {\"/a\": 1}", "F: /a: there is no such node in the configuration\n");
    refuse("{\"" + G51 + "/weight\": {\"a\": [[1]]}}",
           "F: " + G51 + "/weight: the value is neither a text nor");
    refuse("{\"" + G51 + "/weight\": 1.5}", "F: " + G51 + "/weight: \"1.5\" is not a valid uint32\n");
    refuse("{\"" + G51 + "\": 51, \"" + G51 + "\": 51}", "F: " + G51 + ": is given twice\n");
    refuse("{\"" + G51 + "/router/2/ipaddr\": \"10.0.0.2\"}",
           "F: " + G51 + "/router: entries are numbered from 1");
    refuse(std::string(1 << 20, '{'), "F: is not a JSON object");
    refuse("{\"" + G51 + "\":" + std::string(1 << 20, '['), "F: is not a JSON object");
}

// --- Names

static canned_nodes sample_nodes() {
    return {bindings_of(
        "/qv/wccpd/wccp/srv_grp",
        "%/config/51 uint8 51|%/config/51/weight uint32 100|%/config/7 uint8 7|"
        "/logging/syslog/process/wccpd/log_level string info|"
        "%/state/51 string 51|%/state/51/num_appliances uint32 2|%/state/51/oper string ACTIVE|"
        "%/state/51/appliance/1/ipaddr ipv4addr 10.0.0.101|%/state/51/appliance/1/weight uint32 5|"
        "%/state/51/appliance/2/ipaddr ipv4addr 10.0.0.102|")};
}

TEST(Names, AreCompletedToTheirNextPartAndAMistypedOneGetsAHint) {
    canned_nodes known = sample_nodes();
    const auto check = [&](const std::string &word, const std::string &found) {
        EXPECT_EQ(joined(complete_node_name(std::ref(known), word), " "), found);
    };
    check("/qv/wccpd/system/state/debug_",
          "/qv/wccpd/system/state/debug_all /qv/wccpd/system/state/debug_global");
    check(GROUPS + "/", GROUPS + "/7 " + G51);
    check("/logging/syslog/process/", "/logging/syslog/process/wccpd");
    check("/logging/syslog/action/file/\\/va", "/logging/syslog/action/file/\\/var\\/log\\/messages");
    check(G51 + "/encap=", G51 + "/encap=gre " + G51 + "/encap=l2 " + G51 + "/encap=either");
    check("qv", "");
    const ctl_ask ask = std::ref(known);
    EXPECT_EQ(hint_for_missing(ask, "qv/wccpd"), "a name begins with \"/\"");
    EXPECT_EQ(hint_for_missing(ask, "/qv//wccpd"), "a name has no empty part");
    EXPECT_EQ(hint_for_missing(ask, "/qv"),
              "it has no value of its own; \"mgmtctl walk /qv\" lists what is below");
    EXPECT_EQ(hint_for_missing(ask, "/qv/wcpd/system"), "did you mean /qv/wccpd?");
    EXPECT_EQ(hint_for_missing(ask, G51 + "/wieght"), "did you mean " + G51 + "/weight?");
    EXPECT_EQ(hint_for_missing(ask, G51 + "/interface"), "it can be set, and has no default");
    EXPECT_EQ(hint_for_missing(ask, GROUPS + "/52/weight"), "there is no group 52");
    EXPECT_EQ(hint_for_missing(ask, G51 + "/zzzzzz"), "\"mgmtctl walk " + G51 + "\" lists what there is");
    EXPECT_EQ(hint_for_unchangeable(ask, STATES + "/51/oper"), "it is a state: it can only be read");
    EXPECT_EQ(hint_for_unchangeable(ask, G51 + "/weight"), "");
}

TEST(Names, ANumberOfAppliancesThatCantBeMakesNoEndlessRowOfQuestions) {
    canned_nodes known = sample_nodes();
    std::vector<ctl_binding> many = {{STATES + "/51/num_appliances", "uint32", "4000000000"},
                                     {STATES + "/51/oper", "string", "x"}};
    ASSERT_TRUE(add_appliances(std::ref(known), STATES, &many) && known.asked == 64);
    EXPECT_EQ(many[1].value, "10.0.0.101") << "in their place";
    ctl_reply reply;
    ASSERT_TRUE(add_appliances(std::ref(known), STATES + "/51/appliance", &reply.bindings));
    EXPECT_EQ(reply.bindings.size(), 3u) << "a walk from the list down has no count in it";
}

TEST(Walks, WhatIsLargerThanAMessageComesInPieces) {
    canned_nodes known = sample_nodes();
    const auto names = [&](const std::string &root, uint32_t code) {
        node_name parsed;
        ctl_reply reply;
        EXPECT_TRUE(parse_node_name(root, &parsed));
        EXPECT_TRUE(query_walk(std::ref(known), ctl_walk::subtree, parsed, &reply) && reply.code == code);
        strings out;
        for (const ctl_binding &binding : reply.bindings)
            out.push_back(binding.name);
        std::sort(out.begin(), out.end());
        return out;
    };
    const strings all = names("/qv", LC_OK);
    EXPECT_EQ(known.asked, 1u);
    for (known.most = 3; known.most < 9; known.most++)
        EXPECT_EQ(names("/qv", LC_OK), all) << known.most;
    known.most = 0;
    EXPECT_TRUE(names("/qv", LC_NO_BUFFER_SPACE).empty());
}

// --- The session

// A message of the service as a frame.
template <auto Serialize, typename Message>
static wire frame_of(const Message &msg) {
    owned_tbuffer frame;
    msg.pointer->service_id = 2;
    EXPECT_EQ(Serialize(msg.pointer, 0, &frame.pointer), LC_OK);
    return frame_bytes(2, msg.pointer->msg_type,
                       {reinterpret_cast<const char *>(tb_buf(frame.pointer)),
                        static_cast<size_t>(tb_length(frame.pointer))});
}
static wire event_frame(const char *name) {
    owned_request msg;
    EXPECT_EQ(bn_event_request_msg_create(&msg.pointer, name), LC_OK);
    return frame_of<bn_request_msg_serialize>(msg);
}
static wire answer_frame(uint32_t response_to, uint32_t code, const char *text) {
    owned_response msg;
    EXPECT_EQ(bn_query_response_msg_create(&msg.pointer, response_to, code, text), LC_OK);
    return frame_of<bn_response_msg_serialize>(msg);
}

TEST(Session, ARequestGetsItsOwnAnswerAndEventsWaitForTheirTurn) {
    gcl_provider provider;
    std::string reason;
    ASSERT_TRUE(provider.listen_as("mgmtd"));
    std::thread peer([&] {
        ASSERT_TRUE(provider.open_session());
        wire query = provider.take_frame();
        ASSERT_GT(query.size(), 48u);
        const uint32_t id = number_at(query, 40);
        provider.put(event_frame("/one") + answer_frame(id + 100, 0, "of another") + event_frame("/two") +
                     answer_frame(id, 14008, "no"));
        query = provider.take_frame();
        provider.close_client();
        // The next session gets no service.
        ASSERT_TRUE(provider.accept_client() && provider.put(greeting_bytes(~0u, ~0u)));
        (void)provider.take_frame();
        provider.put(open_response_bytes(number_at(provider.take_frame(), 32), 1, "no"));
        (void)provider.take_frame();
    });
    ctl_session *session = ctl_open(3000, &reason);
    ASSERT_NE(session, nullptr) << reason;
    ctl_reply reply;
    EXPECT_TRUE(ctl_query(session, ctl_walk::node, "/a", &reply, &reason)) << reason;
    EXPECT_EQ(std::to_string(reply.code) + reply.message, "14008no");
    ctl_event event;
    for (const char *name : {"/one", "/two"}) {
        EXPECT_TRUE(ctl_next_event(session, 0, &event, &reason) == 1 && event.name == name);
    }
    EXPECT_FALSE(ctl_query(session, ctl_walk::node, "/a", &reply, &reason));
    EXPECT_EQ(reason, "mgmtd closed the session during the request");
    EXPECT_EQ(ctl_next_event(session, -1, &event, &reason), -1);
    ctl_close(session);
    EXPECT_TRUE(!ctl_open(3000, &reason) && reason == "mgmtd refuses its service to us");
    peer.join();
}

// --- What is wrong with the host

static check_facts sound_host() {
    check_facts host;
    host.groups = {{51, "eth0", true, "either"}, {52, "eth0", true, "l2"}, {53, "eth7", false, "gre"}};
    host.interfaces = {{"eth0", {true, {"10.0.0.101"}, 1500, 0, 1}}, {"wccp0", {true, {}, 1500, 0, 1}}};
    host.all_rp_filter = 0;
    host.sockets = {{"10.0.0.101", "wccpd", 7}, {"127.0.0.1", "dns", 8}};
    host.filter_listing = R"({"nftables":[]})";
    host.gre = host.tun = host.tproxy = check_feature::present;
    host.clock_synchronised = host.wccpd_runs = host.may_lock = true;
    return host;
}

// The codes of what was found, then what was not checked.
static std::string judge_host(const check_facts &host) {
    std::string text;
    const check_result result = judge_facts(host);
    for (const reason &each : result.findings) {
        text += each.code + (each.group < 0 ? " " : "@" + std::to_string(each.group) + " ");
        EXPECT_EQ((each.cause + each.next).find('{'), std::string::npos) << each.cause << each.next;
    }
    for (const auto &each : result.unchecked)
        text += "-" + each.check + " ";
    return text;
}

TEST(Check, EachFactIsJudged) {
    using enum check_feature;
    const auto check = [](void (*change)(check_facts &), const char *found) {
        check_facts host = sound_host();
        change(host);
        if (!host.mgmtd_error.empty())
            host.sockets.clear();
        EXPECT_EQ(judge_host(host), found);
    };
    check([](auto &) {}, "");
    check([](auto &it) { it.sockets[1].address = "0.0.0.0"; }, "port-taken ");
    check([](auto &it) { it.sockets[1].address = "10.0.0.101"; }, "port-taken ");
    check([](auto &it) { it.sockets[0].program = ""; }, "-UDP port 2048 ");
    check([](auto &it) { it.sockets[0].program = "", it.wccpd_runs = false; }, "port-taken -locked memory ");
    check([](auto &it) { it.groups[2].up = true; }, "interface-missing@53 ");
    check([](auto &it) { it.groups[0].interface = it.groups[1].interface = ""; },
          "no-interface@51 no-interface@52 ");
    check([](auto &it) { it.interfaces["eth0"].up = false; }, "interface-down@51 ");
    check([](auto &it) { it.interfaces["eth0"].addresses.clear(); }, "interface-no-address@51 ");
    check([](auto &it) { it.all_rp_filter = 1; }, "rp-filter rp-filter@52 ");
    check([](auto &it) { it.interfaces["eth0"].rp_filter = 1; }, "rp-filter@52 ");
    check([](auto &it) { it.all_rp_filter = 2, it.interfaces["wccp0"].rp_filter = 1; }, "");
    check([](auto &it) { it.interfaces["wccp0"].forwarding = 0; }, "forwarding-off ");
    check([](auto &it) { it.interfaces["eth0"].forwarding = 0; }, "forwarding-later@52 ");
    check([](auto &it) { it.interfaces["eth0"].mtu = 1499; }, "mtu-small@51 ");
    check([](auto &it) { it.gre = missing; }, "gre-by-tun ");
    check([](auto &it) { it.gre = it.tun = missing; }, "gre-missing ");
    check([](auto &it) { it.tproxy = missing, it.tun = unknown; }, "tproxy-missing -kernel ");
    check([](auto &it) { it.clock_synchronised = false; }, "clock-unsynchronised ");
    check([](auto &it) { it.may_lock = false; }, ""); // there is no limit
    check([](auto &it) { it.may_lock = false, it.lock_limit_bytes = 65536; }, "memory-lock ");
    check([](auto &it) { it.mem_conf.error = ENOENT, it.mem_conf.complete = false; }, "mem-conf-unreadable ");
    check([](auto &it) { it.mem_conf.bad_line = 3, it.mem_conf.complete = false; },
          "mem-conf-line mem-conf-mailbox ");
    check([](auto &it) { it.mem_conf.error = EACCES, it.root = false; }, "-mem.conf ");
    check([](auto &it) { it.platform_conf.error = ENOENT; }, "");
    check([](auto &it) { it.platform_conf.bad_line = 1; }, "platform-conf-line ");
    check([](auto &it) { it.filter_error = "no", it.legacy_tables = "filter"; }, "-firewall -firewall ");
    check([](auto &it) { it.mgmtd_error = "gone", it.groups.clear(), it.all_rp_filter = 1; },
          "rp-filter -interfaces -rp_filter -forwarding -MTU ");
    const std::string documents = text_of_file(WCCP_SOURCE_DIR "/docs/operations.md");
    for (const reason_text &text : check_texts())
        EXPECT_TRUE(contains(documents, std::string("| `") + text.code + "` "));
}

// A table "f" with a chain at a hook, of these rules.
static std::string nft_listing(const std::string &head, const strings &rules) {
    const std::string above = R"("family":"inet","table":"f",)";
    std::string text = R"({"nftables":[{"set":{)" + above + R"("name":"ports","elem":[53,2048]}},)" +
                       R"({"chain":{)" + above + R"("name":"refuse"}},{"chain":{)" + above +
                       R"("name":"c","type":"filter",)" + head + "}}";
    for (const std::string &rule : rules)
        text += R"(,{"rule":{)" + above + R"("chain":"c","expr":[)" + rule + "]}}";
    return text + R"(,{"rule":{)" + above + R"("chain":"refuse","expr":[{"reject":null}]}}]})";
}

TEST(Check, RulesThatDropTheProtocolAreFound) {
    const auto match = [](const char *left, const char *right, const char *op = "==") {
        return std::string(R"({"match":{"op":")") + op + R"(","left":{)" + left + R"(},"right":)" + right +
               "}},";
    };
    const char *const port = R"("payload":{"protocol":"udp","field":"dport"})";
    const char *const protocol = R"("meta":{"key":"l4proto"})";
    const char *const from = R"("payload":{"protocol":"ip","field":"saddr"})";
    const std::string input = R"("hook":"input")", closed = R"("hook":"input","policy":"drop")",
                      accept = R"({"accept":null})", drop = R"({"counter":{}},{"drop":null})",
                      gre = match(protocol, "47"), udp = match(protocol, "17"), accept_gre = gre + accept,
                      replies = match(R"("ct":{"key":"state"})", R"(["established","related"])", "in");
    const std::string no_wccp = "firewall-drops-wccp@51 ", no_gre = "firewall-drops-gre@51 ",
                      unclear = "firewall-unclear@51 ";
    const auto check = [](const std::string &head, const strings &rules, const std::string &found) {
        check_facts host = sound_host();
        host.filter_listing = nft_listing(head, rules);
        EXPECT_EQ(judge_host(host), found) << host.filter_listing;
    };
    check(input, {}, "");
    check(closed, {replies + accept}, no_wccp + no_gre);
    check(R"("hook":"forward","policy":"drop")", {}, "");
    check(R"("hook":"output","policy":"drop")", {match(R"("meta":{"key":"oifname"})", R"("eth*")") + accept},
          "");
    check(closed, {match(port, "2048") + accept}, no_gre);
    check(closed, {match(port, R"("@ports")") + accept, accept_gre}, "");
    check(closed, {match(protocol, R"({"set":["gre","esp"]})") + accept}, no_wccp);
    check(closed, {match(port, R"({"set":[53,{"range":[2000,2047]}]})") + accept, accept_gre}, no_wccp);
    check(closed, {match(port, "53", "!=") + accept, accept_gre}, "");
    check(closed,
          {match(R"("meta":{"key":"iifname"})", R"("lo")") + accept, match(from, R"("10.0.0.1")") + accept},
          unclear + unclear);
    check(input, {gre + R"({"jump":{"target":"refuse"}})"}, no_gre);
    check(input, {R"({"limit":{"rate":10}},)" + match(port, "2048") + drop}, unclear);
    check(R"("hook":"prerouting")",
          {R"({"vmap":{"key":{"meta":{"key":"l4proto"}},"data":{"set":[["udp",{"drop":null}]]}}})"}, no_wccp);
    // Of iptables-nft.
    check(input,
          {udp + R"({"xt":{"type":"target","name":"LOG"}})",
           udp + R"({"xt":{"type":"target","name":"REJECT"}})", match(protocol, "6") + R"({"xt":null})"},
          no_wccp);
    check(input, {gre + R"({"xt":null})"}, unclear);
    // After what may be dropped, what is dropped; after what may pass, nothing is certain.
    check(closed, {match(from, R"("10.0.0.9")") + drop, accept_gre}, no_wccp + unclear);
}

TEST(Check, ThisHostIsLookedAt) {
    std::filesystem::create_directories("/etc/opt/rvl");
    std::ofstream("/etc/opt/rvl/mem.conf") << "# x\nwccpd_mailbox local normal\nother here\n";
    std::ofstream("/etc/opt/rvl/platform.conf") << "max_interfaces 7\nmax_interfaces 0\nmax_x 1\n";
    const int fd = socket(AF_INET6, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    const sockaddr_in6 local = {AF_INET6, htons(2048), 0, {}, 0};
    ASSERT_EQ(bind(fd, reinterpret_cast<const sockaddr *>(&local), sizeof local), 0);
    canned_nodes nodes = {{{G51, "uint8", "51"}, {G51 + "/interface", "string", "lo"}}};
    ctl_link link;
    link.query = std::ref(nodes);
    const check_facts host = gather_facts(link);
    close(fd);
    ASSERT_TRUE(host.groups.size() == 1 && host.interfaces.contains("lo") && host.sockets.size() == 1)
        << host.mgmtd_error;
    EXPECT_TRUE(host.groups[0].interface == "lo" && host.groups[0].up && host.groups[0].encap == "either");
    const check_interface &loopback = host.interfaces.at("lo");
    EXPECT_TRUE(loopback.up && loopback.addresses == strings{"127.0.0.1"} && loopback.mtu == 65536 &&
                loopback.forwarding && loopback.rp_filter);
    EXPECT_TRUE(host.sockets[0].address == "0.0.0.0" && host.sockets[0].process == getpid());
    EXPECT_TRUE(host.mem_conf.error == 0 && host.mem_conf.bad_line == 3 && !host.mem_conf.complete);
    EXPECT_TRUE(host.platform_conf.error == 0 && host.platform_conf.bad_line == 2);
    EXPECT_TRUE(!host.wccpd_runs && host.clock_synchronised);
    EXPECT_EQ(host.filter_listing.empty(), !host.filter_error.empty());
}
