// The page of "mgmtctl show --html": input is escaped, unknown values are marked, groups that need attention
// are unfolded, and the file is replaced as a whole. tests/scenario_page.sh opens real pages in a browser.
#include <gtest/gtest.h>

#include <csignal>
#include <filesystem>

#include <sys/resource.h>

#include "peers/mgmtctl/html_file.h"
#include "peers/mgmtctl/show_draw.h"
#include "tests/support/texts.h"

namespace {
const page_origin ORIGIN = {"cache1", "2026-11-25 14:09:55 +0000", "1.0.0", 1795615795};

// A healthy group: this appliance is designated, and the routers have the wanted table.
snapshot_group good_group(int id, size_t routers = 2, size_t appliances = 2) {
    snapshot_group group;
    group.id = id;
    group.configured = group.running = group.designated = group.interface_set = true;
    group.state = "ACTIVE";
    group.admin = "up";
    group.link = "up";
    group.address = "10.0.1.0";
    group.routers_configured = routers;
    group.wanted.owners.resize(256);
    const auto percent = static_cast<uint32_t>(100 / appliances);
    std::vector<snapshot_load> loads;
    for (size_t i = 0; i < appliances; i++) {
        loads.push_back({"10.0.1." + std::to_string(i), percent});
        group.appliances.push_back(
            {loads[i].appliance, i == 0, 100, static_cast<int>(percent), true, percent, percent});
    }
    for (size_t i = 0; i < 256; i++)
        group.wanted.owners[i] = static_cast<int>(i * appliances / 256);
    group.tables.push_back(group.wanted);
    for (size_t i = 1; i <= routers; i++) {
        const std::string one = "10.0.0." + std::to_string(i);
        group.routers.push_back({one, one, true, "two-way", 0, "gre", "hash", "gre", loads});
        group.tables[0].routers.push_back(one);
    }
    return group;
}

snapshot good_snapshot(std::vector<snapshot_group> groups) {
    snapshot shown;
    shown.wccpd = wccpd_condition::running;
    shown.status = "Ready";
    shown.groups_total = groups.size();
    shown.traffic.tunneld = tunneld_condition::running;
    shown.traffic.plane = "kernel";
    for (const snapshot_group &group : groups) {
        traffic_intercept *one = &shown.traffic.intercepts.emplace_back();
        std::tie(one->group, one->proxy, one->flows) = std::tuple(group.id, "up", 3);
    }
    shown.groups = std::move(groups);
    return shown;
}

size_t count_of(const std::string &text, const std::string &wanted) {
    size_t count = 0;
    for (size_t at = 0; (at = text.find(wanted, at)) != std::string::npos; at += wanted.size())
        count++;
    return count;
}

} // namespace

TEST(Html, InputIsEscaped) {
    const std::string evil = "\"'><script>&amp;";
    snapshot_group group = good_group(51);
    for (std::string *text :
         {&group.interface, &group.protocol, &group.encap, &group.assign_method, &group.address, &group.link,
          &group.state, &group.routers[0].address, &group.routers[0].id, &group.routers[0].forward,
          &group.routers[0].assign, &group.routers[0].back, &group.appliances[1].address,
          &group.tables[0].routers[0]})
        *text = evil;
    group.reasons.push_back({evil, evil, evil, evil, evil, 4, 1, 1});
    snapshot shown = good_snapshot({group});
    shown.alarms.push_back({1, evil, evil, evil, evil, evil, -1});
    shown.alarms_total = 1;
    shown.reasons = group.reasons;
    traffic_state *traffic = &shown.traffic;
    traffic_tunnel tunnel;
    tunnel.local = tunnel.remote = tunnel.interface = evil;
    tunnel.refused = {{evil, 3}};
    traffic->tunnels.push_back(tunnel);
    traffic->intercepts[0].proxy_reason = evil;
    traffic->refused = tunnel.refused;
    traffic->refused_sources = {{evil, 2}};
    traffic->accepted = {{evil + "2", evil}};
    traffic->left = {{51, evil}};
    traffic->drains.push_back({51, evil, 3, 0, evil});
    traffic->protection.time = 300;
    traffic->protection.groups = {{51, false, evil, 0}};
    traffic->protection.members[evil] = {};
    for (std::string *text : {&shown.status, &shown.version, &shown.mode, &traffic->plane,
                              &traffic->plane_reason, &traffic->lack, &traffic->failure})
        *text = evil;
    const page_origin origin = {evil, evil, evil, 0};
    std::string page = draw_page(shown, origin);
    for (const char *proxy : {"up", "down", evil.c_str()}) {
        shown.traffic.intercepts[0].proxy = proxy;
        page += draw_page(shown, origin);
    }
    shown.unreachable = evil;
    page += draw_page(shown, origin);
    EXPECT_GT(count_of(page, "&quot;&#39;&gt;&lt;script&gt;&amp;amp;"), 100u);
    EXPECT_TRUE(lacks(page, "<script", "'><", ";&amp;\"", "\"'"));
}

TEST(Html, UnknownValuesAreMarked) {
    snapshot shown;
    shown.wccpd = wccpd_condition::silent;
    shown.traffic.tunneld = tunneld_condition::absent;
    shown.groups.resize(shown.groups_total = 1);
    shown.groups[0].configured = shown.groups[0].interface_set = true;
    shown.groups[0].routers_configured = 1;
    shown.groups[0].routers.push_back({"10.0.0.1", "10.0.0.1", false, "unknown", 0, "", "", "", {}});
    std::string page = draw_page(shown, ORIGIN);
    EXPECT_TRUE(contains(page, "<dt>Alarms</dt><dd><span class=\"badge unknown\">",
                         "<dt>Flows</dt><dd><span class=\"badge unknown\">", "tunneld has no session",
                         "<code>wccpd-silent</code>", "cache1", "2026-11-25 14:09:55 +0000",
                         "mgmtctl 1.0.0"));
    EXPECT_TRUE(lacks(page, "nothing heard", "none reported", "no router has", "Nothing needs", "none:"));

    // Another appliance is designated; one weight has not been reported.
    shown = good_snapshot({good_group(51)});
    shown.groups[0].designated = false;
    shown.groups[0].wanted = {};
    shown.groups[0].appliances[1].weight = -1;
    page = draw_page(shown, ORIGIN);
    EXPECT_TRUE(contains(page, "only the designated appliance knows it",
                         "10.0.1.1</td><td><span class=\"badge unknown\">"));
    EXPECT_TRUE(lacks(page, "as wanted"));
}

TEST(Html, GroupsThatNeedAttentionAreUnfoldedAndFirst) {
    snapshot shown = good_snapshot(
        {good_group(1), good_group(2), good_group(3), good_group(4), good_group(5), good_group(6)});
    std::string page = draw_page(shown, ORIGIN);
    EXPECT_TRUE(contains(page, "<h1>Nothing needs attention</h1>") && count_of(page, "<details>") == 6);

    shown.groups[1].reasons.push_back({"password-mismatch", "10.0.0.1", "", "", "", 4, 70000, 3000});
    shown.groups[3].tables[0].owners[40] = 1;
    shown.alarms.push_back({196638, "adjacency", "eth0:grp:6", "raised", "2026/11/25 00:10:11", "wccpd", 6});
    shown.alarms_total = 1;
    page = draw_page(shown, ORIGIN);
    EXPECT_TRUE(contains(page, "<h1>3 of 6 groups need attention</h1>",
                         "10.0.0.1 signs its messages with another password"));
    EXPECT_TRUE(count_of(page, "<details open>") == 3 && count_of(page, "<details>") == 3);
    EXPECT_LT(page.find("id=\"group-6\""), page.find("id=\"group-1\""));
}

TEST(Html, ATableIsComparedBucketByBucket) {
    snapshot_group group = good_group(51, 3);
    group.tables.push_back(group.tables[0]);
    group.tables[0].routers = {"10.0.0.1", "10.0.0.3"};
    group.tables[1].routers = {"10.0.0.2"};
    for (size_t i = 40; i < 56; i++)
        group.tables[1].owners[i] = i < 44 ? -1 : 1;
    snapshot shown = good_snapshot({group});
    std::string page = draw_page(shown, ORIGIN);
    EXPECT_TRUE(contains(page, "16 buckets not as wanted",
                         "title=\"bucket 40: nobody, wanted: A 10.0.1.0\"><i>-</i>",
                         "class=\"o1 other\" title=\"bucket 55: B 10.0.1.1, wanted: A 10.0.1.0\"><i>B</i>",
                         "aria-label=\"A 112, B 140, nobody 4\""));
    const size_t legend = 4;
    EXPECT_EQ(count_of(page, "<i>"), 3 * 256u + 2 + legend);
    // With many groups, a run of buckets has one title.
    shown = good_snapshot(std::vector<snapshot_group>(17, group));
    page = draw_page(shown, ORIGIN);
    EXPECT_EQ(count_of(page, "<i>"), 17 * (3 * 256u + 2) + legend);
    EXPECT_EQ(count_of(page, "title=\"buckets 44 to 55: B 10.0.1.1, wanted: A 10.0.1.0\""), 17u);
    // The largest configuration: 256 groups, each with 32 routers, and 8 appliances.
    std::vector<snapshot_group> all;
    for (int id = 0; id < 256; id++)
        all.push_back(good_group(id, 32, 8));
    EXPECT_LT(draw_page(good_snapshot(all), ORIGIN).size(), 6u << 20);
}

TEST(Html, AFileIsReplacedAsAWholeOrNotAtAll) {
    const std::string directory = testing::TempDir() + "/page", file = directory + "/page.html",
                      link = directory + "/link";
    std::filesystem::remove_all(directory);
    std::filesystem::create_directory(directory);
    std::string reason;
    umask(027);
    ASSERT_TRUE(write_page_file(file, "old", &reason)) << reason;
    EXPECT_EQ(mode_of(file), 0640);
    chmod(file.c_str(), 0604);
    std::filesystem::create_symlink("page.html", link);
    ASSERT_TRUE(write_page_file(link, "new", &reason)) << reason;
    EXPECT_TRUE(std::filesystem::is_symlink(link) && mode_of(file) == 0604);

    signal(SIGXFSZ, SIG_IGN);
    rlimit before;
    getrlimit(RLIMIT_FSIZE, &before);
    const rlimit small = {1000, before.rlim_max};
    setrlimit(RLIMIT_FSIZE, &small);
    EXPECT_FALSE(write_page_file(file, std::string(5000, 'x'), &reason));
    setrlimit(RLIMIT_FSIZE, &before);
    EXPECT_TRUE(reason == "File too large" && text_of_file(file) == "new");
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(directory), {}), 2) << "a file is left over";
}
