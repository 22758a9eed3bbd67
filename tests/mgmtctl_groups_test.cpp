// The words of "mgmtctl group", and the commits that they become. What mgmtd and wccpd make of these is the
// subject of tests/scenario_mgmtctl_groups.sh.
#include <gtest/gtest.h>

#include <map>

#include "peers/mgmtctl/groups.h"
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

    group_result run(const std::vector<std::string> &words) {
        commits.clear();
        group_link link;
        link.settle_ms = 0;
        link.query = [this](ctl_walk walk, const std::string &name, ctl_reply *out, std::string *) {
            if (name.find("/state") != std::string::npos)
                out->code = LC_IO_CLOSED;
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
        return group_command(link, words);
    }
    std::string sent(size_t commit) const {
        static const char *const kinds[] = {"create", "modify", "remove", "reset"};
        std::string out;
        for (const ctl_change_item &item : commits.at(commit))
            out += std::string(kinds[static_cast<int>(item.change)]) + " " +
                   item.binding.name.substr(ROOT.size()) + "=" + item.binding.value + ";";
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
}

TEST(Groups, AsAWholeItIsOneCommitAsWell) {
    fake mgmtd;
    group_result result = mgmtd.run(NEW_ROUTERS);
    EXPECT_EQ(result.done, "recreated");
    EXPECT_EQ(result.note, "wccpd takes a change of router only with the group as a whole");
    EXPECT_EQ(mgmtd.sent(0), "create /router/2/ipaddr=10.0.0.2;modify /weight=7;");
    result = mgmtd.run({"set", "51", "router", "none", "interface", "none"});
    EXPECT_EQ(mgmtd.sent(0), "remove /router/1=;reset /interface=;");
    EXPECT_NE(result.note.find("router, interface only with the group as a whole; without an interface"),
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
