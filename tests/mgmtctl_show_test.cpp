// The snapshot of "mgmtctl show": gathered from canned nodes, drawn for a terminal and as JSON, within
// bounds.
#include <gtest/gtest.h>

#include <algorithm>

#include <nlohmann/json.hpp>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/intercepts.h"
#include "peers/mgmtctl/show_draw.h"
#include "peers/mgmtctl/show_gather.h"
#include "peers/mgmtctl/show_json.h"
#include "peers/mgmtctl/show_texts.h"
#include "runtime/common.h"
#include "tests/support/canned_nodes.h"
#include "tests/support/texts.h"

namespace {

using json = nlohmann::json;

const char *const GROUP_ALARM = NODE_ALARMS_RAISED "/196638/eth0:grp:51";
const char *const GROUP_REASON = NODE_GROUP_STATE "/51/reason/3";

snapshot gather_canned(canned_nodes *from, const snapshot_limits &limits = {}) {
    from->asked = 0;
    return gather_snapshot(std::ref(*from), limits);
}

// Of a router: the first 64 buckets are A's, the others B's; the words as the engine has them.
std::string hash_rows(const std::string &router) {
    const std::string none = "00000000 00000000", all = "ffffffff ffffffff";
    const auto rows = [&](const char *appliance, const std::string &first, const std::string &rest) {
        return "\tRouter id                  : " + router + "\n\tAppliance ip               : " + appliance +
               "\n\tRxed hash assignment       : 0x" + first + " " + rest +
               "\n\t                           : 0x" + rest + " " + rest + "\n";
    };
    return rows("10.0.0.101", all, none) + rows("10.0.0.102", none, all);
}

// Sets nodes, "NAME VALUE|NAME VALUE|" and so on. The first letter of a name stands for a root.
void set_nodes(canned_nodes *from, const std::string &nodes) {
    static const std::map<char, const char *> roots = {
        {'C', NODE_GROUP_CONFIG "/51"}, {'S', NODE_GROUP_STATE "/51"}, {'D', GROUP_ALARM},
        {'P', NODE_PLANE_STATE},        {'T', NODE_TUNNEL_STATE},      {'I', NODE_INTERCEPT_STATE},
        {'L', NODE_LEFT_GROUPS},        {'X', NODE_INTERCEPT_CONFIG},  {'A', NODE_ACCEPT_CONFIG},
        {'G', NODE_PROTECTION_STATE},   {'Q', GROUP_REASON},           {'W', NODE_WCCPD_STATE}};
    std::istringstream in(nodes);
    for (std::string name, value; std::getline(in, name, ' ') && std::getline(in, value, '|');) {
        name.replace(0, 1, roots.at(name[0]));
        std::erase_if(from->nodes, [&](const ctl_binding &node) { return node.name == name; });
        from->add(name, value);
    }
}

canned_nodes one_group(const char *alarm = "D WCCP GRP 51: alarm: raising\033]0;evil\a adjacency down alarm|"
                                           "D/name adjacency|D/since 2025/11/25 00:10:11|") {
    canned_nodes from;
    set_nodes(&from,
              "C 51|C/interface eth0|C/weight 25|C/password secret|C/protocol tcp|"
              "C/router/1/ipaddr 10.0.0.1|C/router/2/ipaddr 10.0.0.2|C/router/3/ipaddr 10.0.0.3|"
              "S 51|S/oper ACTIVE, DESIGNATED|S/uptime 3723000|S/app_id 10.0.0.101|S/since 70000|"
              "S/counter/tx_here_i_am 7|S/num_appliances 2|"
              "S/appliance/1/ipaddr 10.0.0.101|S/appliance/1/weight 25|"
              "S/appliance/2/ipaddr 10.0.0.102|S/appliance/2/weight 75|"
              "S/router/1/id 10.0.0.2|S/router/1/ipaddr 10.0.0.2|S/router/1/state ONE-WAY connected|"
              "S/router/2/id 10.0.0.1|S/router/2/ipaddr 10.0.0.1|S/router/2/state TWO-WAY connected|"
              "S/router/1/appliance/10.0.0.101/load_dist 20|S/router/2/appliance/10.0.0.101/load_dist 25|"
              "S/router/1 1|S/router/2 2|W/is_alive Ready|W/version 1.0.0|"
              "S/debug     WCCP interfaces                  : # 1 eth0\n"
              "    WCCP interface ipa and link      : 10.0.0.101 up \n|"
              "S/assignment \tAppliance ip               : 10.0.0.101\n"
              "\tHash/mask allotment        : 30 % \n"
              "\tReceived router allocation\n" +
                  hash_rows("10.0.0.2") + hash_rows("10.0.0.1") + "|" + alarm);
    for (const std::string router : {"S/router/1", "S/router/2"})
        for (const char *node : {"/fwd_method GRE|", "/ret_method L2|", "/assign_method not-set|",
                                 "/conn_time 60000|", "/appliance/10.0.0.102/load_dist 75|"})
            set_nodes(&from, router + node);
    std::ranges::sort(from.nodes, {}, &ctl_binding::name);
    return from;
}

// 256 groups; the first 6 have 64 appliances, and 32 routers with 40 each.
canned_nodes many_groups() {
    canned_nodes from;
    from.add(NODE_PLANE_STATE "/name", "table");
    for (int i = 0; i < 256; i++) {
        const std::string id = std::to_string(i), root = NODE_GROUP_STATE "/" + id;
        from.add(NODE_GROUP_CONFIG "/" + id, id);
        from.add(root, id);
        from.add(root + "/oper", "ACTIVE");
        from.add(root + "/num_appliances", "4000000000");
        from.add(root + "/num_routers", "31");
        from.add(root + "/app_id", "10.0.2.1");
        for (int n = 1; n <= 64 && i < 6; n++) {
            from.add(root + "/appliance/" + std::to_string(n) + "/ipaddr", "10.0.2." + std::to_string(n));
            from.add(root + "/appliance/" + std::to_string(n) + "/weight", "1");
            const std::string router = root + "/router/" + std::to_string(n);
            for (int a = 1; a <= 40 && n <= 32; a++)
                from.add(router + "/appliance/10.0.2." + std::to_string(a) + "/load_dist", "3");
            if (n <= 32)
                from.add(router + "/ipaddr", "10.0.1." + std::to_string(n));
        }
    }
    return from;
}

auto columns_of(std::string line) {
    for (size_t at; (at = line.find('\033')) != std::string::npos;)
        line.erase(at, line.find('m', at) + 1 - at);
    return std::ranges::count_if(line, [](char c) { return (c & 0xc0) != 0x80; });
}

std::string screen_of(const snapshot &shown) {
    return joined(draw_screen(shown, {80, 0, false, false, ""}), "\n") + "\n";
}

TEST(Show, TellsTheWholeOfAGroup) {
    canned_nodes from = one_group();
    const snapshot shown = gather_canned(&from);
    const json all = json::parse(draw_json(shown)), group = all["groups"][0];
    ASSERT_EQ(group["routers"].size(), 3u);
    const json router = group["routers"][0], self = group["appliances"][0], table = group["tables"][0];
    // Routers are in the order of their addresses, and the designated appliance knows better than the
    // weights.
    EXPECT_EQ(
        (json{router["address"], router["assign"], router["shares"]["10.0.0.102"], self["asked_percent"],
              self["share_percent"], self["share_percent_most"], group["tables"].size(),
              table["routers"].size(), all["alarms"][0]["group"], all["version"], table["buckets"]})
            .dump(),
        R"(["10.0.0.1",null,75,30,20,25,1,2,51,"1.0.0",[)"
        R"({"appliance":"10.0.0.101","first":0,"last":63},{"appliance":"10.0.0.102","first":64,"last":255}]])");
    EXPECT_TRUE(
        contains(joined(draw_screen(shown, {80, 23, false, false, ""}), "\n"),
                 "wccpd Ready (1.0.0)   1 group: 1 active   1 alarm\n! group 51: 10.0.0.3 does not answer (7 "
                 "Here-I-Am sent), since 2025/11/25\n    00:10:11\n",
                 "\n  10.0.0.3 does not answer (7 Here-I-Am sent), for 0:01:10\n"
                 "  > wait 20 s; then check address, service group, password and path (UDP 2048)\n    on "
                 "the router\n",
                 "51  ACTIVE, designated !  up 1:02:03  10.0.0.101 on eth0  tcp  weight 25  md5\n",
                 "  router 10.0.0.1        two-way   0:01:00  fwd gre  assign -     return l2",
                 "  router 10.0.0.3        nothing heard\n",
                 "  A 10.0.0.101      this weight 25    asked  30% has 20-25%  ####..",
                 "  hash AAAAAAAAAAAAAAAABBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBBB\n"));
    EXPECT_EQ(draw_screen(shown, {48, 0, false, false, ""})[0], "wccpd Ready   1 group: 1 active   1 alarm")
        << "no room for the version";
    for (const std::string &line : draw_screen(shown, {79, 23, true, true, ""}))
        EXPECT_LE(columns_of(line), 79) << line;
}

TEST(Show, NothingOfATextReachesTheTerminalAsAControl) {
    canned_nodes from = one_group();
    for (ctl_binding &node : from.nodes)
        if (node.name.find("/state") != std::string::npos && !node.name.ends_with("/oper"))
            node.value += "\033[2J\2331m\r\n";
    const snapshot shown = gather_canned(&from);
    for (const std::string &text : {screen_of(shown), joined(draw_lines(shown), "\n"), draw_json(shown)})
        for (const char c : text)
            ASSERT_TRUE(c == '\n' || (c >= 0x20 && c < 0x7f)) << static_cast<int>(c) << " in " << text;
}

TEST(Show, IsEmptyAndSaysSoWhereverMgmtdGoes) {
    canned_nodes from = one_group();
    from.wccpd_code = LC_IO_TIMED_OUT;
    EXPECT_EQ(gather_canned(&from).wccpd, wccpd_condition::silent);
    EXPECT_EQ(from.asked, 11u) << "it is not asked again";
    from.wccpd_code = 0;
    (void)gather_canned(&from);
    for (size_t all = from.asked, n = 0; n < all; n++) {
        from.lost_after = n;
        const snapshot shown = gather_canned(&from);
        EXPECT_TRUE(shown.groups.empty() && !shown.unreachable.empty());
    }
}

TEST(Show, ManyGroupsAreBoundedInWorkAndRoom) {
    canned_nodes from = many_groups();
    const snapshot_limits limits = {.detailed = 4, .listed = 23, .alarms = 23};
    std::vector<std::string> lines = draw_screen(gather_canned(&from, limits), {79, 23, true, true, ""});
    ASSERT_TRUE(from.asked <= 16u + 23u * 7 && lines.size() == 23);
    EXPECT_TRUE(contains(lines[1], "routers 31/31  share 3%"));
    EXPECT_TRUE(contains(lines.back(), "and 235 groups not shown"));

    const snapshot detailed = gather_canned(&from, {.queries = 300});
    EXPECT_LE(from.asked, 300u + 70u);
    const json all = json::parse(draw_json(detailed));
    EXPECT_TRUE(all["groups_total"] == 256 && all["groups"].size() == 5);
    EXPECT_EQ(all["groups"][0]["appliances"].size(), 32u);
    // A single group of 32 routers and 32 appliances is shortened, the others give way to it and are counted.
    for (const int rows : {2, 7, 23, 60}) {
        lines = draw_screen(detailed, {79, rows, false, false, ""});
        EXPECT_LE(lines.size(), static_cast<size_t>(rows));
        EXPECT_TRUE(contains(lines.back(), "not shown"));
    }
    EXPECT_TRUE(contains(joined(lines, "\n"), "and 30 routers more"));
}

// --- Reasons

// What a command prints; it has to exit with this status.
std::string output_of(const std::function<int()> &command, int exit) {
    testing::internal::CaptureStdout();
    EXPECT_EQ(command(), exit);
    fflush(stdout);
    return testing::internal::GetCapturedStdout();
}
std::string explanation_of(const snapshot &shown, int group, int exit, bool as_json = false) {
    ctl_options options;
    options.json = as_json;
    return output_of([&] { return tell_reasons(options, shown, group); }, exit);
}

// Each row breaks a group that works, or changes it.
TEST(Show, AReasonHasACauseValuesATimeAndANextStep) {
    // Sets the nodes, and looks for the text in what explain prints.
    const auto check = [](const std::string &nodes, const char *said, int exit = 1, const char *screen = "") {
        SCOPED_TRACE(nodes);
        canned_nodes from = one_group("");
        std::erase_if(from.nodes, [](const auto &node) { return node.name.ends_with("/router/3/ipaddr"); });
        if (nodes[0] == 'Q')
            set_nodes(&from, "Q/source 0.0.0.0|Q/sender 0.0.0.0|Q/count 4|Q/first 70000|Q/last 3000|");
        set_nodes(&from, nodes + "P/name table|");
        const snapshot shown = gather_canned(&from);
        EXPECT_TRUE(contains(explanation_of(shown, 51, exit), said));
        EXPECT_TRUE(contains(screen_of(shown), screen));
        EXPECT_EQ(json::parse(draw_json(shown))["groups"][0]["tables"][0]["routers"].size(),
                  nodes.find("by the router") != std::string::npos ? 1u : 2u); // such a table is misread
        const json parsed = json::parse(explanation_of(shown, -1, exit, true));
        for (const json &each : parsed["reasons"])
            EXPECT_TRUE(each["cause"] != "" && each["next"] != "") << each;
    };
    check("", "group 51  ACTIVE, designated\n  nothing needs attention\n", 0);
    check("Q/code password-mismatch|Q/sender 10.0.0.1|",
          "  password-mismatch: 10.0.0.1 signs its messages with another password\n"
          "    4 times, first 0:01:10 ago, last 0:00:03 ago\n"
          "    next: set the same one on both: mgmtctl group set 51 password -\n",
          1, "51  ACTIVE, designated !");
    check("Q/code interface-missing|Q/wanted eth9|", "there is no interface eth9\n", 1,
          "51  ACTIVE, designated, no interface !");
    check("Q/code election-blocked|Q/sender 10.0.0.9|Q/offered no I-See-You|Q/wanted two-way|",
          "the routers list 10.0.0.9", 1,
          "  no appliance can be designated: the routers list 10.0.0.9, which is not\n"
          "    two-way here: no I-See-You, for 0:01:10\n");
    check("Q/code router-id-zero|Q/source 10.0.0.1|", "router-id-zero: 10.0.0.1 calls itself 0.0.0.0\n");
    check("Q/code query-refused|Q/offered a query|", "  nothing needs attention\n  query-refused: ", 0);
    check("Q/code method-differs|Q/sender 10.0.0.1|Q/offered hash by the router|Q/wanted mask|",
          "assignment is hash by the router, but mask here");
    check("Q/code not-known-here|Q/sender 10.0.0.1|", "  not-known-here: not-known-here of 10.0.0.1\n");
    check("S/oper BACKUP|",
          "redirected-elsewhere: this appliance gets nothing: the routers redirect to 10.0.0.102 75%");
    check("S/oper INIT|", "waiting-assignment: the routers answer; no table is in force yet (10.0.0.101 is");
    check("Q/code restart-needed|Q/offered forwarding by gre|Q/wanted L2|",
          "restart-needed: the group runs with forwarding by gre, but is configured with L2\n");
    check("C/admin down|", "  nothing needs attention\n  disabled: the group is disabled\n", 0);
}

TEST(Show, AnAlarmHasTheReasonThatFitsIt) {
    std::vector<reason> reasons;
    for (const char *code : {"service-mismatch", "no-answer", "assignment-differs", "proxy-down"}) {
        reasons.emplace_back().code = code;
        reasons.back().group = 51;
    }
    EXPECT_EQ(alarm_reason(reasons, 51, "adjacency", "")->code, "no-answer");
    EXPECT_EQ(alarm_reason(reasons, 51, "assignment", "")->code, "assignment-differs");
    reasons.resize(1);
    EXPECT_EQ(alarm_reason(reasons, 51, "adjacency", "")->code, "service-mismatch") << "there is no other";
}

TEST(Show, WhatIsNotKnownIsNotSaid) {
    canned_nodes from = one_group("");
    for (const uint32_t code : {uint32_t{LC_IO_CLOSED}, uint32_t{LC_IO_TIMED_OUT}}) {
        from.wccpd_code = code;
        const snapshot shown = gather_canned(&from);
        EXPECT_TRUE(lacks(screen_of(shown), "no alarm"));
        const json all = json::parse(draw_json(shown));
        EXPECT_TRUE(all["alarms_total"].is_null() && all["groups"][0]["state"].is_null());
        EXPECT_EQ(all["reasons"][0]["reason"], code == LC_IO_CLOSED ? "wccpd-absent" : "wccpd-silent");
        (void)explanation_of(shown, -1, 1);
    }
    from.lost_after = 0;
    EXPECT_EQ(json::parse(explanation_of(gather_canned(&from), -1, 2, true))["reasons"][0]["reason"],
              "mgmtd-unreachable");
    from.lost_after = SIZE_MAX;
    (void)explanation_of(gather_canned(&from, {.only = 52}), 52, 2, true);
}

TEST(Show, EveryReasonHasWordsAndIsInTheDocuments) {
    // The table is what "mgmtctl explain --list" prints.
    EXPECT_TRUE(contains(text_of_file(WCCP_SOURCE_DIR "/docs/operations.md"), reason_table_markdown()));
    const std::string engine = text_of_file(WCCP_SOURCE_DIR "/engine/wccp_reasons.cpp");
    size_t codes = 0;
    for (size_t at = 0; (at = engine.find("    {\"", at)) != std::string::npos; codes++) {
        at += 6;
        const std::string code = engine.substr(at, engine.find('"', at) - at);
        EXPECT_TRUE(code.empty() || find_reason_text(code)) << code;
    }
    EXPECT_GT(codes, 40u);
}

// --- Redirected traffic

const char *const TRAFFIC =
    "P/name user|P/reason kernel: no GRE|P/lack no tproxy|P/failure wccp0: busy\033|P/clamped 0|"
    "P/refused/source 9|P/refused_source/10.0.0.9 9|T/3 3|T/3/local 10.0.0.101|T/3/remote 10.0.0.1|"
    "T/3/interface wccp0|T/3/index 12|T/3/packets_in 1234567|T/3/bytes_in 999999999|T/3/fragments 4|"
    "T/3/refused/flags 2|T/3/in 7|T/3/own 3|P/own 3|I/51 51|I/51/proxy down|I/51/proxy_reason refused\033[2J|"
    "I/51/proxy_ms 640000|I/51/active true|I/51/left true|I/51/in 120|I/51/in_bytes 9000|I/51/to_proxy 100|"
    "I/51/returned 12|I/51/down 8|I/52 52|I/52/proxy up|I/52/active false|I/52/in 99999|"
    "I/52/to_proxy 18446744073709551615|G/time 300|G/passed 7|G/delivered 3|G/group/51 51|"
    "G/group/51/covered true|G/group/51/slots 128|G/group/52 52|G/group/52/covered false|"
    "G/group/52/reason no bucket|G/member/10.0.0.102/passed 7|L/51 no good check for 30 s|"
    "L/51/since 2025/11/25 00:10:11|X/51 51|X/51/ports 80 443|X/51/to 3128|X/51/rest return|X/51/check http|"
    "X/51/check_argument /a|A/10.0.0.8 10.0.0.8|A/10.0.0.8/router 0.0.0.0|";

TEST(Show, RedirectedTrafficIsPartOfItWithReasons) {
    canned_nodes from = one_group();
    EXPECT_TRUE(contains(screen_of(gather_canned(&from)), "\n\ntunneld: no session\n"));
    EXPECT_EQ(json::parse(draw_json(gather_canned(&from)))["traffic"]["clamped"], nullptr);
    set_nodes(&from, TRAFFIC);
    const snapshot shown = gather_canned(&from);
    const std::string screen = screen_of(shown);
    EXPECT_TRUE(
        contains(screen, "51  left its routers", "  router 10.0.0.3        not asked\n",
                 "\ntraffic  data plane user  1 tunnel\n"
                 "  51  proxy down 0:10:40  in 120  to proxy 100  returned 12  proxy down 8\n"
                 "  52  proxy up  in 99999  to proxy 18E  returned 0\n"
                 "  all packets are returned: no tproxy\n"
                 "  the kernel is not as wanted: wccp0: busy?\n", // the others are those of the command
                 "  group 51 has left its routers: no good check for 30 s\n"
                 "  group 52: not ACTIVE; new flows are returned\n"
                 "  group 52 is unprotected: no bucket\n"));
    EXPECT_TRUE(lacks(screen, " \n"));
    const json traffic = json::parse(draw_json(shown))["traffic"];
    const json protection = traffic["protection"];
    EXPECT_EQ((json{traffic["refused_sources"]["10.0.0.9"], traffic["tunnels"][0]["in"]["bytes"],
                    traffic["intercepts"][1]["sorted"]["to_proxy"]["packets"], traffic["reasons"].size(),
                    protection["members"][0]["passed"], protection["groups"][0]["slots"], traffic["lack"],
                    traffic["left"]})
                  .dump(),
              R"([9,999999999,18446744073709551615,8,7,128,"no tproxy",)"
              R"([{"group":51,"reason":"no good check for 30 s"}]])");
    // A proxy that is down is a reason of its own only while the group is in its routers, and fragments only
    // while nothing is clamped; a source that is accepted by now is none.
    std::erase_if(from.nodes, [](const auto &node) { return node.name.find("/left/") != std::string::npos; });
    set_nodes(&from, "A/10.0.0.9 10.0.0.9|P/clamped 1|");
    const std::string lines = joined(draw_lines(gather_canned(&from)), "\n");
    EXPECT_TRUE(contains(lines, "note  group 51: the proxy is down: refused?[2J\n"));
    EXPECT_TRUE(lacks(lines, "fragments", "refused source"));
}

TEST(Show, CommandsForTrafficPrintWhatTheyFind) {
    canned_nodes from;
    ctl_link link;
    link.query = std::ref(from);
    ctl_options options;
    const auto tunnels = [&](int exit) {
        return output_of([&] { return tell_tunnels(options, link); }, exit);
    };
    const auto intercepts = [&](const char *group, int exit) {
        return output_of([&] { return tell_intercepts(options, link, group); }, exit);
    };
    EXPECT_EQ(tunnels(CTL_UNREACHABLE), "tunneld has no session\n");
    set_nodes(&from, TRAFFIC);
    EXPECT_EQ(tunnels(CTL_OK),
              "data plane user\n  not used: kernel: no GRE\n  refused by reason:  source 9\n"
              "tunnel 3  10.0.0.101 to 10.0.0.1  on wccp0  index 12\n"
              "  in 1.2M (1.0G bytes)  out 0 (0 bytes)  fragments 4\n"
              "  sorted: in 7  to proxy 0  returned 0  own 3\n  refused by reason:  flags 2\n"
              "protection of flows for 300 s\n  passed on 7  received 0  delivered 3  returned 0\n"
              "  group 51  128 slots passed on\n  group 52  not covered: no bucket\n"
              "  appliance 10.0.0.102  passed on 7  received 0  delivered 0  returned 0\n"
              "refused 9 from 10.0.0.9\naccepted 10.0.0.8\n"
              "all packets are returned: no tproxy\nthe kernel is not as wanted: wccp0: busy?\n"
              "the router redirects this appliance's own traffic\n"
              "refused source 10.0.0.9: mgmtctl tunnel accept 10.0.0.9\n"
              "packets arrive in fragments, and the MSS of no flow has been clamped\n");
    for (int i = 0; i < 254; i++)
        from.add(NODE_PLANE_STATE "/refused_source/10.9.0." + std::to_string(i), "1");
    EXPECT_TRUE(lacks(tunnels(CTL_OK), "not listed"));
    from.add(NODE_PLANE_STATE "/refused_source/10.9.0.254", "1");
    EXPECT_TRUE(contains(tunnels(CTL_OK), "not listed"));
    EXPECT_EQ(intercepts("", CTL_OK), "51 port 80 443 to 3128 check http /a\n"
                                      "  proxy down 0:10:40: refused?[2J\n"
                                      "  in 120  to proxy 100  returned 12  proxy down 8\n"
                                      "  group 51 has left its routers: no good check for 30 s\n");
    options.json = true;
    const json one = json::parse(intercepts("51", CTL_OK))["intercepts"][0];
    EXPECT_EQ((json{one["to"], one["sorted"]["in"]["bytes"], one["left_reason"]}).dump(),
              R"([3128,9000,"no good check for 30 s"])");
    EXPECT_EQ(json::parse(intercepts("52", CTL_NOT_FOUND))["exit"], 4);
    from.lost_after = from.asked + 1;
    EXPECT_EQ(json::parse(tunnels(CTL_UNREACHABLE))["error"], "mgmtd closed the session");
}

TEST(Show, AssignmentTextsAreReadTolerantly) {
    std::string mask = "\tReceived router allocation\n";
    for (const auto &[appliance, words] :
         std::map<std::string, std::string>{{"10.0.0.101", "0x0000000f"}, {"10.0.0.102", "0x00001ff0"}})
        mask += "\tRouter id                  : 10.0.0.1\n\tAppliance ip               : " + appliance +
                "\n\tRxed value buckets (0-127) : " + words + " 00000000 00000000 00000000\n";
    snapshot_group group;
    take_assignment_text(mask, &group);
    ASSERT_TRUE(group.tables.size() == 1 && group.tables[0].mask);
    // 13 values with an owner, of the 16 of four bits.
    EXPECT_EQ(group.tables[0].owners, (std::vector<int>{0, 0, 0, 0, 1, 1, 1, 1, 1, 1, 1, 1, 1, -1, -1, -1}));

    // A wanted table tells how many values there are; tests/scenario_page.sh has that of hash buckets.
    std::string wanted = "\tAppliance ip               : 10.0.0.101\n\tHash/mask allotment        : 50 % \n"
                         "\t         0 : 0x00000003 0x00000000 0x0000   0x0000\n";
    for (const std::string row : {"0 : 0x00000000 0x00000000 0x0000   0x0000   10.0.0.101",
                                  "1 : 0x00000001 0x00000000 0x0000   0x0000   10.0.0.102",
                                  "2 : 0x00000002 0x00000000 0x0000   0x0000   0.0.0.0",
                                  "3 : 0x00000003 0x00000000 0x0000   0x0000   10.0.0.101"})
        wanted += "\t         " + row + "\n";
    snapshot_group four;
    take_assignment_text(wanted + mask, &four);
    EXPECT_TRUE(four.wanted.mask && four.wanted.owners == (std::vector<int>{0, 1, -1, 0}));
    EXPECT_EQ(four.tables.at(0).owners, (std::vector<int>{0, 0, 0, 0}));

    const std::string whole = mask + hash_rows("10.0.0.2") + std::string(1000, '\t') + hash_rows("\033");
    for (size_t length = 0; length < whole.size(); length++) {
        std::string cut = whole.substr(0, length);
        if (length > 4)
            cut[length - 4] = static_cast<char>(length);
        snapshot_group from;
        take_assignment_text(cut, &from);
        take_group_text(cut, &from);
        for (const snapshot_table &table : from.tables)
            for (const int owner : table.owners)
                ASSERT_LT(owner, static_cast<int>(from.appliances.size()));
    }
    std::string crowd; // each router has a table of its own, and knows an appliance of its own
    for (int i = 0; i < 2000; i++) {
        char words[16];
        snprintf(words, sizeof words, "0x%08x", i + 1);
        std::string rows = hash_rows(std::to_string(i));
        crowd += rows.replace(rows.find("0xffffffff"), 10, words) +
                 "\tAppliance ip               : " + std::to_string(i) + "\n";
    }
    snapshot_group from;
    take_assignment_text(crowd, &from);
    EXPECT_TRUE(from.appliances.size() <= 32 && from.tables.size() <= 32);
}

} // namespace
