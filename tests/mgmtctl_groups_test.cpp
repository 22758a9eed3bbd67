// The words of "mgmtctl group" and of the commands for redirected traffic, and the commits that they become.
// What mgmtd and wccpd make of those of groups is the subject of tests/scenario_mgmtctl_groups.sh.
#include <gtest/gtest.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/groups.h"
#include "peers/mgmtctl/intercepts.h"
#include "runtime/common.h"
#include "tests/support/texts.h"

namespace {
const std::string ROOT = "/qv/wccpd/wccp/srv_grp/config/51";

strings split_line(const std::string &text) {
    std::istringstream in(text);
    return {std::istream_iterator<std::string>(in), {}};
}

struct fake {
    std::map<std::string, std::string> nodes = {{ROOT, "51"},
                                                {ROOT + "/interface", "eth0"},
                                                {ROOT + "/password", "a 'b"},
                                                {ROOT + "/router/1", "1"},
                                                {ROOT + "/router/1/ipaddr", "10.0.0.1"},
                                                {ROOT + "/weight", "100"}}; // its default
    std::vector<std::vector<ctl_change_item>> commits;                      // that were sent
    uint32_t code = 0;                                                      // of the answer, 1: none comes
    int session_after = 0; // which query tunneld answers, 0: none

    group_result group(const std::string &words) { return group_command(link(), split_line(words)); }
    traffic_result intercept(const std::string &words) {
        return intercept_command(link(), split_line(words));
    }
    traffic_result bypass(const std::string &words) {
        return bypass_command(link(), split_line(words), 1000);
    }
    traffic_result tunnel(const std::string &words) { return tunnel_command(link(), split_line(words)); }
    ctl_link link() {
        commits.clear();
        ctl_link link;
        link.settle_ms = 0;
        link.session_ms = session_after > 0 ? 3000 : 0;
        link.query = [this](ctl_walk walk, const std::string &name, ctl_reply *out, std::string *) {
            if (name.find("/state") != std::string::npos)
                out->code = LC_IO_CLOSED;
            if (name == NODE_PLANE_STATE "/name" && session_after > 0 && --session_after == 0)
                *out = {LC_OK, "", {{name, "string", "kernel"}}};
            for (const auto &[node, value] : nodes)
                if (node == name || (walk == ctl_walk::subtree && node.starts_with(name + "/")))
                    out->bindings.push_back({node, "string", value});
            return true;
        };
        link.set = [this](const std::vector<ctl_change_item> &items, ctl_reply *out, std::string *reason) {
            commits.push_back(items);
            out->code = code;
            out->message = "not like that";
            *reason = "mgmtd closed the session";
            return out->code != 1;
        };
        return link;
    }
    // The only commit, without the root of its nodes.
    std::string sent(const std::string &root = ROOT) const {
        static const char *const kinds[] = {"create", "modify", "remove", "reset"};
        std::string out;
        EXPECT_EQ(commits.size(), 1u);
        for (const ctl_change_item &item : commits.at(0))
            out += std::string(kinds[static_cast<int>(item.change)]) + " " +
                   item.binding.name.substr(root.size()) + "=" + item.binding.value + ";";
        return out;
    }
};
// The command has this status and error, and changes nothing.
template <typename Result>
void expect_refused(Result (fake::*command)(const std::string &), int exit, const char *words,
                    const char *told) {
    fake mgmtd;
    const Result result = (mgmtd.*command)(words);
    EXPECT_EQ(result.exit, exit) << words;
    EXPECT_TRUE(contains(result.error, told));
    EXPECT_TRUE(mgmtd.commits.empty()) << words;
}
} // namespace

TEST(Groups, WrongWordsChangeNothingAndAreTold) {
    expect_refused(&fake::group, CTL_USAGE, "add 52 wieght 7", "did you mean \"weight\"?");
    expect_refused(&fake::group, CTL_USAGE, "add 52 zzzzzzzz 7", "known are");
    expect_refused(&fake::group, CTL_USAGE, "ad 52", "did you mean \"add\"?");
    expect_refused(&fake::group, CTL_USAGE, "add 5x", "group add N");
    expect_refused(&fake::group, CTL_USAGE, "add 52 weight", "needs a value: 0 to 65535");
    expect_refused(&fake::group, CTL_USAGE, "set 51 router 10.0.0.1 router 10.0.0.1", "given twice");
    expect_refused(&fake::group, CTL_REFUSED, "add 51", "there is a group 51");
    expect_refused(&fake::group, CTL_NOT_FOUND, "restart 52", "there is no group 52");
    expect_refused(&fake::group, CTL_USAGE, "restart 51 now", "group add N");
}

TEST(Groups, OneCommitWhereARunningGroupFollows) {
    fake mgmtd;
    EXPECT_EQ(mgmtd.group("set 51 weight 0x64 router 10.0.0.1 hash-src-ip default").done, "unchanged");
    EXPECT_TRUE(mgmtd.commits.empty());
    EXPECT_EQ(mgmtd.group("set 51 weight 7 password default policy 5").done, "changed");
    EXPECT_EQ(mgmtd.sent(), "modify /password=default;modify /policy_grp=5;modify /weight=7;");
    mgmtd.nodes[ROOT + "/weight"] = "7";
    EXPECT_TRUE(mgmtd.group("set 51 weight default").commits == 1 && mgmtd.sent() == "reset /weight=;");
    EXPECT_EQ(mgmtd.group("set 51 encap l2 assign mask weight 8").note,
              "a running group applies a change of assign, encap only when it is restarted: "
              "mgmtctl group restart 51");
}

TEST(Groups, AsAWholeItIsOneCommitAsWell) {
    const char *const new_routers = "set 51 router 10.0.0.1 router 10.0.0.2 weight 7";
    fake mgmtd;
    group_result result = mgmtd.group(new_routers);
    EXPECT_EQ(result.done, "recreated");
    EXPECT_EQ(result.note, "wccpd applies a change of router only by recreating the group");
    EXPECT_EQ(mgmtd.sent(), "create /router/2/ipaddr=10.0.0.2;modify /weight=7;");
    result = mgmtd.group("set 51 router none interface none");
    EXPECT_EQ(mgmtd.sent(), "remove /router/1=;reset /interface=;");
    EXPECT_TRUE(contains(result.note, "router, interface only by recreating the group; without an"));
    EXPECT_EQ(mgmtd.group("restart 51").done, "recreated");
    EXPECT_EQ(mgmtd.sent(), "remove =;create =51;create /interface=eth0;create /password=a 'b;create "
                            "/router/1/ipaddr=10.0.0.1;");

    for (const char *words : {new_routers, "restart 51"}) {
        mgmtd.code = LC_ASSERTION;
        result = mgmtd.group(words);
        EXPECT_EQ(result.done + std::to_string(result.exit), std::to_string(CTL_REFUSED));
        mgmtd.code = 1;
        EXPECT_EQ(mgmtd.group(words).exit, CTL_UNREACHABLE);
    }
}

// --- Redirected traffic

static const std::string INTERCEPT = NODE_INTERCEPT_CONFIG "/51";

TEST(Intercepts, WrongClausesChangeNothingAndAreTold) {
    expect_refused(&fake::intercept, CTL_USAGE, "ad 51", "did you mean \"add\"?");
    for (const char *words : {"add 51", "set 51", "delete 51 to 1", "add 5x all to 3128"})
        expect_refused(&fake::intercept, CTL_USAGE, words, "intercept add GROUP");
    expect_refused(&fake::intercept, CTL_USAGE, "add 51 port 80", "\"to\" is missing");
    expect_refused(&fake::intercept, CTL_USAGE, "add 51 to 80", "\"all\" is missing");
    expect_refused(&fake::intercept, CTL_USAGE, "add 51 port to 80", "\"port\" needs a value");
    expect_refused(&fake::intercept, CTL_USAGE, "add 51 port 80 all to 1", "exclude each other");
    expect_refused(&fake::intercept, CTL_USAGE, "add 51 port 80 tp 3128", "did you mean \"to\"?");
    expect_refused(&fake::intercept, CTL_USAGE, "set 51 to none", "\"to\" needs a value");
    expect_refused(&fake::intercept, CTL_USAGE, "set 51 rise 2 rise 3", "given twice");
    expect_refused(&fake::intercept, CTL_USAGE, "set 51 check htp /", "did you mean \"http\"?");
    expect_refused(&fake::intercept, CTL_USAGE, "set 51 check http rise 2", "needs the path of a page");
    expect_refused(&fake::intercept, CTL_USAGE, "add 51 all port 80 to 1", "\"all\" exclude each other");
    expect_refused(&fake::intercept, CTL_USAGE, "add 51 all all to 1", "\"all\" is given twice");
    expect_refused(&fake::intercept, CTL_USAGE, "show x", "intercept show [GROUP]");
    expect_refused(&fake::intercept, CTL_NOT_FOUND, "set 51 rise 2", "no intercept for group 51");
}

TEST(Intercepts, ClausesInAnyOrderAreOneCommit) {
    fake mgmtd;
    traffic_result result =
        mgmtd.intercept("add 51 leave 0 bypass 10.0.0.0/8 192.0.2.1 check http /x to 3128 port 443 80 "
                        "port 8000-8080 bypass 9.9.9.9");
    EXPECT_EQ(result.done + result.tunneld + result.note, "addedabsent");
    EXPECT_EQ(mgmtd.sent(INTERCEPT),
              "create =;create /bypass=9.9.9.9/32 10.0.0.0/8 192.0.2.1/32;create /check=http;create "
              "/check_argument=/x;create /leave_after=0;create /ports=80 443 8000-8080;create /to=3128;");

    // Only what is given, and differs.
    mgmtd.nodes.insert({{INTERCEPT, "51"},
                        {INTERCEPT + "/to", "3128"},
                        {INTERCEPT + "/ports", "80 443"},
                        {INTERCEPT + "/check", "http"},
                        {INTERCEPT + "/check_argument", "/x"}});
    mgmtd.session_after = 2; // tunneld has just been started
    result = mgmtd.intercept("set 51 port 443 80 rise 2 check http /x");
    EXPECT_TRUE(result.done + result.tunneld == "unchangedrunning" && mgmtd.commits.empty());
    EXPECT_EQ(mgmtd.intercept("set 51 check tcp all").done, "changed");
    EXPECT_EQ(mgmtd.sent(INTERCEPT), "create /check=tcp;reset /check_argument=;create /ports=all;");
    EXPECT_EQ(mgmtd.intercept("add 51 all to 1").exit, CTL_REFUSED);

    // What is of no use is done, with a note.
    mgmtd.nodes[ROOT + "/protocol"] = "17";
    EXPECT_EQ(mgmtd.intercept("set 51 to 1").note,
              "group 51 redirects udp, and an intercept of tcp gets none of that");
    EXPECT_EQ(mgmtd.intercept("set 51 protocol udp").note, "");
    EXPECT_EQ(mgmtd.intercept("add 052 all to 1").note,
              "there is no group 52; the intercept has no effect until the group exists");
    mgmtd.code = LC_NOT_FOUND;
    EXPECT_EQ(mgmtd.intercept("delete 52").exit, CTL_NOT_FOUND);
    mgmtd.code = LC_BAD_ARGUMENT;
    result = mgmtd.intercept("set 51 to 70000");
    EXPECT_TRUE(result.exit == CTL_REFUSED && result.done + result.error == "not like that");
}

TEST(Bypasses, HaveOneNameAndEndByThemselves) {
    expect_refused(&fake::bypass, CTL_USAGE, "add 10.0.0.1/8", "host bits");
    expect_refused(&fake::bypass, CTL_USAGE, "add 10.0.0.0/8 fro 60", "did you mean \"for\"?");
    expect_refused(&fake::bypass, CTL_USAGE, "add 10.0.0.0/8 for 0", "number of seconds");
    expect_refused(&fake::bypass, CTL_USAGE, "add 10.0.0.0/8 for 4294967296", "number of seconds");
    expect_refused(&fake::bypass, CTL_USAGE, "add 10.0.0.0/8 for", "bypass add PREFIX");
    expect_refused(&fake::bypass, CTL_USAGE, "delete 10.0.0.0/8 for 1", "bypass add PREFIX");
    fake mgmtd;
    EXPECT_EQ(mgmtd.bypass("add 10.0.0.0/08").exit, CTL_OK);
    EXPECT_EQ(mgmtd.sent(NODE_BYPASS_CONFIG), "create /10.0.0.0\\/8=;");
    EXPECT_EQ(mgmtd.bypass("add 192.0.2.1 for 60").exit, CTL_OK);
    EXPECT_EQ(mgmtd.sent(NODE_BYPASS_CONFIG), "create /192.0.2.1\\/32=;create /192.0.2.1\\/32/until=1060;");
    mgmtd.nodes[NODE_BYPASS_CONFIG "/10.0.0.0\\/8"] = "10.0.0.0/8";
    EXPECT_EQ(mgmtd.bypass("add 10.0.0.0/8 for 5").done, "changed");
    EXPECT_EQ(mgmtd.sent(NODE_BYPASS_CONFIG), "create /10.0.0.0\\/8/until=1005;");
}

TEST(Tunnels, FurtherSourcesAreAcceptedAndTakenBack) {
    expect_refused(&fake::tunnel, CTL_USAGE, "acept 10.0.0.9", "did you mean \"accept\"?");
    expect_refused(&fake::tunnel, CTL_USAGE, "accept 10.0.0", "\"10.0.0\" is no IPv4 address");
    expect_refused(&fake::tunnel, CTL_USAGE, "accept 10.0.0.9 for 9", "known are router");
    expect_refused(&fake::tunnel, CTL_USAGE, "refuse 10.0.0.9 router 10.0.0.1", "tunnel accept ADDRESS");
    fake mgmtd;
    mgmtd.nodes[NODE_ACCEPT_CONFIG "/10.0.0.8"] = "10.0.0.8";
    mgmtd.nodes[NODE_ACCEPT_CONFIG "/10.0.0.8/router"] = "10.0.0.1";
    const auto check = [&](const char *words, const char *done, const char *sent) {
        EXPECT_EQ(mgmtd.tunnel(words).done, done) << words;
        EXPECT_EQ(mgmtd.sent(NODE_ACCEPT_CONFIG), sent);
    };
    check("accept 10.0.0.9", "accepted", "create /10.0.0.9=;");
    check("accept 10.0.0.9 router 10.0.0.1", "accepted",
          "create /10.0.0.9=;create /10.0.0.9/router=10.0.0.1;");
    check("accept 10.0.0.8", "changed", "reset /10.0.0.8/router=;");
    check("refuse 10.0.0.9", "refused", "remove /10.0.0.9=;");
    EXPECT_EQ(mgmtd.tunnel("accept 10.0.0.8 router 10.0.0.1").done, "unchanged");
}
