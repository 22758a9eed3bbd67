// The words of "mgmtctl group" and of the commands for redirected traffic, and the commits that they become.
// What mgmtd and wccpd make of those of groups is the subject of tests/scenario_mgmtctl_groups.sh.
#include <gtest/gtest.h>

#include <map>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/groups.h"
#include "peers/mgmtctl/intercepts.h"
#include "runtime/common.h"

namespace {
const std::string ROOT = "/qv/wccpd/wccp/srv_grp/config/51";

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

    group_result run(const std::vector<std::string> &words) { return group_command(link(), words); }
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
        link.set = [this](const std::vector<ctl_change_item> &items, ctl_reply *out,
                          std::string *out_reason) {
            commits.push_back(items);
            out->code = code;
            out->message = "not like that";
            *out_reason = "mgmtd closed the session";
            return out->code != 1;
        };
        return link;
    }
    std::string sent(size_t commit, const std::string &root = ROOT) const {
        static const char *const kinds[] = {"create", "modify", "remove", "reset"};
        std::string out;
        for (const ctl_change_item &item : commits.at(commit))
            out += std::string(kinds[static_cast<int>(item.change)]) + " " +
                   item.binding.name.substr(root.size()) + "=" + item.binding.value + ";";
        return out;
    }
};
const std::vector<std::string> NEW_ROUTERS = {"set",    "51",       "router", "10.0.0.1",
                                              "router", "10.0.0.2", "weight", "7"};
} // namespace

TEST(Groups, WrongWordsChangeNothingAndAreTold) {
    const struct {
        std::vector<std::string> words;
        int exit;
        const char *told;
    } cases[] = {
        {{"add", "52", "wieght", "7"}, CTL_USAGE, "did you mean \"weight\"?"},
        {{"add", "52", "zzzzzzzz", "7"}, CTL_USAGE, "known are"},
        {{"ad", "52"}, CTL_USAGE, "did you mean \"add\"?"},
        {{"add", "5x"}, CTL_USAGE, "group add N"},
        {{"add", "52", "weight"}, CTL_USAGE, "needs a value: 0 to 65535"},
        {{"set", "51", "router", "10.0.0.1", "router", "10.0.0.1"}, CTL_USAGE, "given twice"},
        {{"add", "51"}, CTL_REFUSED, "there is a group 51"},
        {{"restart", "52"}, CTL_NOT_FOUND, "there is no group 52"},
        {{"restart", "51", "now"}, CTL_USAGE, "group add N"},
    };
    for (const auto &one : cases) {
        fake mgmtd;
        const group_result result = mgmtd.run(one.words);
        EXPECT_EQ(result.exit, one.exit) << one.told;
        EXPECT_NE(result.error.find(one.told), std::string::npos) << result.error;
        EXPECT_TRUE(mgmtd.commits.empty()) << one.told;
    }
}

TEST(Groups, OneCommitWhereARunningGroupFollows) {
    fake mgmtd;
    EXPECT_EQ(mgmtd.run({"set", "51", "weight", "0x64", "router", "10.0.0.1", "hash-src-ip", "default"}).done,
              "unchanged");
    EXPECT_TRUE(mgmtd.commits.empty());
    EXPECT_EQ(mgmtd.run({"set", "51", "weight", "7", "password", "default", "policy", "5"}).done, "changed");
    ASSERT_EQ(mgmtd.commits.size(), 1u);
    EXPECT_EQ(mgmtd.sent(0), "modify /password=default;modify /policy_grp=5;modify /weight=7;");
    mgmtd.nodes[ROOT + "/weight"] = "7";
    EXPECT_EQ(mgmtd.run({"set", "51", "weight", "default"}).commits, 1);
    EXPECT_EQ(mgmtd.sent(0), "reset /weight=;");
    EXPECT_EQ(mgmtd.run({"set", "51", "encap", "l2", "assign", "mask", "weight", "8"}).note,
              "a running group applies a change of assign, encap only when it is restarted: "
              "mgmtctl group restart 51");
}

TEST(Groups, AsAWholeItIsOneCommitAsWell) {
    fake mgmtd;
    group_result result = mgmtd.run(NEW_ROUTERS);
    EXPECT_EQ(result.done, "recreated");
    EXPECT_EQ(result.note, "wccpd applies a change of router only by recreating the group");
    EXPECT_EQ(mgmtd.sent(0), "create /router/2/ipaddr=10.0.0.2;modify /weight=7;");
    result = mgmtd.run({"set", "51", "router", "none", "interface", "none"});
    EXPECT_EQ(mgmtd.sent(0), "remove /router/1=;reset /interface=;");
    EXPECT_NE(result.note.find("router, interface only by recreating the group; without an interface"),
              std::string::npos)
        << result.note;
    EXPECT_EQ(mgmtd.run({"restart", "51"}).done, "recreated");
    EXPECT_EQ(mgmtd.sent(0), "remove =;create =51;create /interface=eth0;create /password=a 'b;create "
                             "/router/1/ipaddr=10.0.0.1;");
    EXPECT_EQ(mgmtd.commits.size(), 1u);

    for (const auto &words : {NEW_ROUTERS, {"restart", "51"}}) {
        mgmtd.code = LC_ASSERTION;
        result = mgmtd.run(words);
        EXPECT_EQ(result.exit, CTL_REFUSED);
        EXPECT_EQ(result.done, "");
        mgmtd.code = 1;
        EXPECT_EQ(mgmtd.run(words).exit, CTL_UNREACHABLE);
    }
}

// --- Redirected traffic

static const std::string INTERCEPT = NODE_INTERCEPT_CONFIG "/51";
using words = std::vector<std::string>;

TEST(Intercepts, WrongClausesChangeNothingAndAreTold) {
    const struct {
        std::vector<std::string> words;
        int exit;
        const char *told;
    } cases[] = {
        {{"ad", "51"}, CTL_USAGE, "did you mean \"add\"?"},
        {{"add", "51"}, CTL_USAGE, "intercept add GROUP"},
        {{"set", "51"}, CTL_USAGE, "intercept add GROUP"},
        {{"delete", "51", "to", "1"}, CTL_USAGE, "intercept add GROUP"},
        {{"add", "5x", "all", "to", "3128"}, CTL_USAGE, "intercept add GROUP"},
        {{"add", "51", "port", "80"}, CTL_USAGE, "\"to\" is missing"},
        {{"add", "51", "to", "80"}, CTL_USAGE, "\"all\" is missing"},
        {{"add", "51", "port", "to", "80"}, CTL_USAGE, "\"port\" needs a value"},
        {{"add", "51", "port", "80", "all", "to", "1"}, CTL_USAGE, "exclude each other"},
        {{"add", "51", "port", "80", "tp", "3128"}, CTL_USAGE, "did you mean \"to\"?"},
        {{"set", "51", "to", "none"}, CTL_USAGE, "\"to\" needs a value"},
        {{"set", "51", "rise", "2", "rise", "3"}, CTL_USAGE, "given twice"},
        {{"set", "51", "check", "htp", "/"}, CTL_USAGE, "did you mean \"http\"?"},
        {{"set", "51", "check", "http", "rise", "2"}, CTL_USAGE, "needs the path of a page"},
        {{"add", "51", "all", "port", "80", "to", "1"}, CTL_USAGE, "\"all\" exclude each other"},
        {{"add", "51", "all", "all", "to", "1"}, CTL_USAGE, "\"all\" is given twice"},
        {{"show", "x"}, CTL_USAGE, "intercept show [GROUP]"},
        {{"set", "51", "bypass"}, CTL_USAGE, "\"bypass\" needs a value"},
        {{"set", "51", "rise", "2"}, CTL_NOT_FOUND, "no intercept for group 51"},
    };
    for (const auto &one : cases) {
        fake mgmtd;
        const traffic_result result = intercept_command(mgmtd.link(), one.words);
        EXPECT_EQ(result.exit, one.exit) << one.told;
        EXPECT_NE(result.error.find(one.told), std::string::npos) << result.error;
        EXPECT_TRUE(mgmtd.commits.empty()) << one.told;
    }
}

TEST(Intercepts, ClausesInAnyOrderAreOneCommit) {
    fake mgmtd;
    traffic_result result = intercept_command(
        mgmtd.link(), {"add", "51", "leave", "0", "bypass", "10.0.0.0/8", "192.0.2.1", "check", "http", "/x",
                       "to", "3128", "port", "443", "80", "port", "8000-8080", "bypass", "9.9.9.9"});
    EXPECT_EQ(result.done, "added");
    EXPECT_EQ(result.tunneld, "absent");
    EXPECT_EQ(result.note, "");
    EXPECT_EQ(mgmtd.sent(0, INTERCEPT),
              "create =;create /bypass=9.9.9.9/32 10.0.0.0/8 192.0.2.1/32;create /check=http;create "
              "/check_argument=/x;create /leave_after=0;create /ports=80 443 8000-8080;create /to=3128;");

    // Only what is given, and differs.
    for (const auto &[node, value] : std::map<std::string, std::string>{{"", "51"},
                                                                        {"/to", "3128"},
                                                                        {"/ports", "80 443"},
                                                                        {"/check", "http"},
                                                                        {"/check_argument", "/x"}})
        mgmtd.nodes[INTERCEPT + node] = value;
    const words unchanged = {"set", "51", "port", "443", "80", "rise", "2", "check", "http", "/x"};
    mgmtd.session_after = 2; // tunneld has just been started
    result = intercept_command(mgmtd.link(), unchanged);
    EXPECT_EQ(result.done, "unchanged");
    EXPECT_EQ(result.tunneld, "running");
    EXPECT_TRUE(mgmtd.commits.empty());
    EXPECT_EQ(intercept_command(mgmtd.link(), {"set", "51", "check", "tcp", "all"}).done, "changed");
    EXPECT_EQ(mgmtd.sent(0, INTERCEPT), "create /check=tcp;reset /check_argument=;create /ports=all;");
    EXPECT_EQ(intercept_command(mgmtd.link(), {"add", "51", "all", "to", "1"}).exit, CTL_REFUSED);

    // What is of no use is done, with a note.
    mgmtd.nodes[ROOT + "/protocol"] = "17";
    EXPECT_EQ(intercept_command(mgmtd.link(), {"set", "51", "to", "1"}).note,
              "group 51 redirects udp, and an intercept of tcp gets none of that");
    EXPECT_EQ(intercept_command(mgmtd.link(), {"set", "51", "protocol", "udp"}).note, "");
    EXPECT_EQ(intercept_command(mgmtd.link(), {"add", "052", "all", "to", "1"}).note,
              "there is no group 52; the intercept has no effect until the group exists");
    mgmtd.code = LC_NOT_FOUND;
    EXPECT_EQ(intercept_command(mgmtd.link(), {"delete", "52"}).exit, CTL_NOT_FOUND);
    mgmtd.code = LC_BAD_ARGUMENT;
    result = intercept_command(mgmtd.link(), {"set", "51", "to", "70000"});
    EXPECT_EQ(result.exit, CTL_REFUSED);
    EXPECT_EQ(result.error, "not like that");
    EXPECT_EQ(result.done, "");
}

TEST(Bypasses, HaveOneNameAndEndByThemselves) {
    fake mgmtd;
    const struct {
        words said;
        bool done;
        const char *told; // the error, or what is sent
    } cases[] = {
        {{"add", "10.0.0.0/08"}, true, "create /10.0.0.0\\/8=;"},
        {{"add", "192.0.2.1", "for", "60"},
         true,
         "create /192.0.2.1\\/32=;create /192.0.2.1\\/32/until=1060;"},
        {{"add", "10.0.0.1/8"}, false, "host bits"},
        {{"add", "10.0.0"}, false, "is no IPv4 prefix"},
        {{"add", "10.0.0.0/8", "fro", "60"}, false, "did you mean \"for\"?"},
        {{"add", "10.0.0.0/8", "for", "0"}, false, "number of seconds"},
        {{"add", "10.0.0.0/8", "for", "4294967296"}, false, "number of seconds"},
        {{"add", "10.0.0.0/8", "for"}, false, "bypass add PREFIX"},
        {{"delete", "10.0.0.0/8", "for", "1"}, false, "bypass add PREFIX"},
    };
    for (const auto &one : cases) {
        const traffic_result result = bypass_command(mgmtd.link(), one.said, 1000);
        EXPECT_EQ(result.exit, one.done ? CTL_OK : CTL_USAGE) << result.error;
        ASSERT_EQ(mgmtd.commits.size(), one.done ? 1u : 0u) << result.error;
        const std::string told = one.done ? mgmtd.sent(0, NODE_BYPASS_CONFIG) : result.error;
        EXPECT_NE(told.find(one.told), std::string::npos) << told;
    }
    mgmtd.nodes[NODE_BYPASS_CONFIG "/10.0.0.0\\/8"] = "10.0.0.0/8";
    EXPECT_EQ(bypass_command(mgmtd.link(), {"add", "10.0.0.0/8", "for", "5"}, 1000).done, "changed");
    EXPECT_EQ(mgmtd.sent(0, NODE_BYPASS_CONFIG), "create /10.0.0.0\\/8/until=1005;");
}

TEST(Tunnels, FurtherSourcesAreAcceptedAndTakenBack) {
    fake mgmtd;
    const struct {
        words said;
        const char *done, *told; // the error, or what is sent
    } cases[] = {
        {{"accept", "10.0.0.9"}, "accepted", "create =;"},
        {{"accept", "10.0.0.9", "router", "10.0.0.1"}, "accepted", "create =;create /router=10.0.0.1;"},
        {{"accept", "10.0.0.8"}, "changed", "reset /router=;"},
        {{"accept", "10.0.0.8", "router", "10.0.0.1"}, "unchanged", ""},
        {{"refuse", "10.0.0.9"}, "refused", "remove =;"},
        {{"acept", "10.0.0.9"}, "", "did you mean \"accept\"?"},
        {{"accept", "10.0.0"}, "", "\"10.0.0\" is no IPv4 address"},
        {{"accept", "127.0.0.1"}, "", "is not the address of another host"},
        {{"accept", "10.0.0.9", "for", "9"}, "", "known are router"},
        {{"refuse", "10.0.0.9", "router", "10.0.0.1"}, "", "tunnel accept ADDRESS"},
    };
    mgmtd.nodes[NODE_ACCEPT_CONFIG "/10.0.0.8"] = "10.0.0.8";
    mgmtd.nodes[NODE_ACCEPT_CONFIG "/10.0.0.8/router"] = "10.0.0.1";
    for (const auto &one : cases) {
        const traffic_result result = tunnel_command(mgmtd.link(), one.said);
        EXPECT_EQ(result.done, one.done) << result.error;
        const std::string told =
            mgmtd.commits.empty() ? result.error : mgmtd.sent(0, NODE_ACCEPT_CONFIG "/10.0.0.9");
        EXPECT_NE(told.find(one.told), std::string::npos) << told;
    }
}
