// From the appliance's view to the kernel's state: tunneld's links, routes, rules and settings are made,
// found, taken over and removed. The links are TUN devices of a test plane, since not every kernel has GRE.
// Each program (a tunneld, its successor) runs as a separate process.

#include <gtest/gtest.h>
#include <linux/rtnetlink.h>

#include <algorithm>
#include <filesystem>
#include <set>

#include "peers/tunneld/kernel_links.h"
#include "peers/tunneld/kernel_routes.h"
#include "peers/tunneld/kernel_state.h"
#include "peers/tunneld/link_names.h"
#include "peers/tunneld/sorting_rules.h"
#include "peers/tunneld/user_tun.h"
#include "tests/support/test_host.h"
#include "tests/support/texts.h"

// Replaces the rules that sort packets. It checks that the tables to which they send packets exist before the
// rules are added, and until they are removed.
static wanted_sorting sorted;
static bool needs_are_met(const wanted_sorting &sorting) {
    std::vector<found_rule> rules;
    std::vector<found_route> routes;
    std::set<uint32_t> routed;
    std::set<std::pair<std::string, uint32_t>> looked_up;
    if (find_rules(&rules) || find_routes(&routes))
        return false;
    for (const found_route &one : routes)
        routed.insert(one.route.table);
    for (const found_rule &one : rules)
        looked_up.insert({one.rule.in_interface, one.rule.table});
    return std::all_of(sorting.links.begin(), sorting.links.end(), [&](const std::string &name) {
        const uint32_t table = TABLE_LINK_FIRST + *link_number(name);
        return if_nametoindex(name.c_str()) && routed.contains(table) && looked_up.contains({name, table});
    });
}
[[gnu::weak]] bool apply_sorting_rules(const wanted_sorting &wanted, std::string *out_error) {
    if (!needs_are_met(sorted) || !needs_are_met(wanted))
        *out_error = "packets are sorted into a table that does not exist";
    sorted = wanted;
    return out_error->empty();
}
[[gnu::weak]] bool remove_sorting_rules(std::string *out_error) {
    return apply_sorting_rules({}, out_error);
}

namespace {

// --- The wanted state

constexpr uint32_t LOCAL = 0x0A000065, R1 = 0x0A000001, R2 = 0x0A000002, OTHER = 0x0A000009;

appliance_view two_tunnels() {
    appliance_view view;
    view.tunnels = {{3, {LOCAL, R1}}, {4, {LOCAL, R2}}};
    view.groups[61] = {"eth0", LOCAL, 0, false, {{R1, R1 + 16, travel::gre, travel::gre}}};
    view.intercepts[61].to = 3128;
    return view;
}

std::string describe_route(const wanted_route &route) {
    return "route " + std::to_string(route.table) + (route.local ? " local" : " " + route.interface) +
           (route.via ? " via " + address_text(route.via) : "");
}
std::string describe_rule(const wanted_rule &rule) {
    char text[80];
    snprintf(text, sizeof text, "rule %u %s %x %u", rule.preference - RULE_PREFERENCE,
             rule.in_interface.c_str(), rule.mark, rule.table);
    return text;
}

std::set<std::string> links_and_tables(const wanted_state &wanted) {
    std::set<std::string> lines;
    for (const auto &link : wanted.links)
        lines.insert("link " + link.name + " " + link_alias(link.wish));
    for (const auto &rule : wanted.rules)
        lines.insert(describe_rule(rule));
    for (const auto &route : wanted.routes)
        lines.insert(describe_route(route));
    return lines;
}
std::set<std::string> describe_wanted(const wanted_state &wanted) {
    std::set<std::string> lines = links_and_tables(wanted);
    for (const auto &setting : wanted.settings)
        lines.insert("setting " + setting.path + " " + setting.value + (setting.restore ? " restored" : ""));
    const wanted_sorting &sorting = wanted.sorting;
    for (const auto &[word, names] : {std::pair{"l2 ", &sorting.l2_interfaces},
                                      {"member ", &sorting.members},
                                      {"passing ", &sorting.passing}})
        for (const auto &name : *names)
            lines.insert(word + name);
    for (const auto &[name, mark] : sorting.l2_into_gre)
        lines.insert("l2 " + name + " into " + std::to_string(mark - MARK_RETURN));
    for (const auto &ends : sorting.ends)
        lines.insert("ends " + address_text(ends.local) + " " + address_text(ends.remote));
    for (const auto &group : sorting.groups) {
        std::string line = "group " + std::to_string(group.group);
        for (const auto &name : group.interfaces)
            line += " " + name;
        for (const uint32_t mark : group.pass_marks)
            line += mark ? " " + std::to_string(mark - MARK_PASS) : " -";
        lines.insert(line + (group.rules.to ? "" : " unwanted"));
    }
    for (const auto &[id, group] : wanted.passing)
        lines.insert("bucket 9 of " + std::to_string(id) + " to " + address_text(group.members[9]) +
                     (group.by_source_port ? " by source" : ""));
    lines.insert("mss " + std::to_string(sorting.mss) + (sorting.drop_outer_gre ? " outer dropped" : ""));
    return lines;
}

// Group 61 shares its flows with OTHER; group 62 redirects the servers' replies.
void share_flows(appliance_view *view, bool by_mask) {
    view->groups[62] = view->groups[61];
    for (const uint8_t id : {uint8_t{61}, uint8_t{62}}) {
        view->protections[id] = {by_mask, {1, 0, 0, 0}, {OTHER, R1}, {0, OTHER}};
        if (!by_mask)
            view->protections[id].targets.assign(256, OTHER);
    }
}

void use_l2(appliance_view *view) {
    for (auto &[id, group] : view->groups)
        group.routers[0].forward = group.routers[0].give_back = travel::l2;
}

const struct {
    const char *name;
    strings lines;                                                          // "!line": it is missing
    std::function<void(appliance_view &)> change = [](appliance_view &) {}; // of two_tunnels()
} wanted_cases[] = {
    {"a group with its router's tunnel; the other is carried as well",
     {"link wccp0 tunneld 3 10.0.0.101 10.0.0.1", "link wccp1 tunneld 4 10.0.0.101 10.0.0.2",
      "group 61 wccp0", "rule 0 wccp1 57430001 204800", "rule 1 wccp1 57430002 254", "rule 3 wccp1 0 204802",
      "route 204800 local", "route 204802 wccp1", "setting wccp1/rp_filter 0",
      "setting all/rp_filter 0 restored", "setting all/send_redirects 0 restored", "ends 10.0.0.101 10.0.0.2",
      "mss 1432 outer dropped", "!l2 eth0", "!setting eth0/forwarding 1 restored"}},
    {"routers not known yet: every tunnel of the group's address",
     {"group 61 wccp0 wccp1", "route 204803 wccp2"},
     [](appliance_view &view) {
         view.groups[61].routers.clear();
         view.tunnels[5] = {LOCAL + 1, R1};
     }},
    {"no intercept without a group, nor for a group that gets no packets",
     {"mss 1432 outer dropped", "!group 61", "!group 61 wccp0", "!group 70", "!group 62 wccp0 unwanted"},
     [](appliance_view &view) {
         view.intercepts[70] = view.intercepts[61];
         view.groups[62] = view.groups[61];
         view.groups[61].local = OTHER;
     }},
    {"nothing known",
     {"mss 0 outer dropped", "!route 204800 local", "!setting all/rp_filter 0 restored"},
     [](appliance_view &view) { view = {}; }},
    {"a further source has links of its own, but only one for the same ends",
     {"link wccp2 tunneld 3 10.0.0.101 10.0.0.9 accepted", "route 204803 wccp2", "group 61 wccp0 wccp1 wccp2",
      "!route 204804 wccp3"},
     [](appliance_view &view) {
         view.tunnels[5] = {LOCAL, R1}; // a second id for the same ends
         view.accepted = {{OTHER, R1}, {OTHER, 0}, {R2, 0}, {0, 0}};
     }},
    {"L2 return agreed with the router, which a further source follows",
     {"route 204801 eth0 via 10.0.0.17", "route 204803 eth0 via 10.0.0.17", "route 204802 wccp1", "!l2 eth0"},
     [](appliance_view &view) {
         view.groups[61].routers[0].give_back = travel::l2;
         view.accepted = {{OTHER, R1}};
     }},
    {"one group of two has agreed on L2 return: the link they share returns by GRE",
     {"route 204801 wccp0", "group 61 wccp0", "group 62 wccp0 unwanted"},
     [](appliance_view &view) {
         view.groups[62] = view.groups[61];
         view.groups[62].routers[0].give_back = travel::l2;
     }},
    {"L2 return forced by one of two",
     {"route 204801 eth0 via 10.0.0.17"},
     [](appliance_view &view) {
         view.groups[62] = view.groups[61];
         view.groups[62].force_l2_return = true;
     }},
    {"L2 both ways, also without an intercept",
     {"l2 eth0", "rule 0 eth0 57430001 204800", "setting eth0/forwarding 1 restored",
      "setting eth0/send_redirects 0 restored", "setting all/send_redirects 0 restored",
      "mss 0 outer dropped", "!setting all/rp_filter 0 restored", "!group 61 eth0",
      "!rule 1 eth0 57430002 254", "!member wccp0"},
     [](appliance_view &view) {
         share_flows(&view, true);
         view.groups.erase(62);
         view.tunnels.clear();
         view.intercepts.clear();
         use_l2(&view);
     }},
    {"redirected by L2, returned by GRE",
     {"l2 eth0", "l2 eth0 into 1", "rule 2 eth0 57430101 204802", "group 61 wccp1 eth0",
      "route 204802 wccp1"},
     [](appliance_view &view) {
         view.groups[61].routers = {{R2, R2, travel::l2, travel::gre}};
     }},
    {"another appliance, by mask: its link is not replaced by that of an accepted source",
     {"link wccp2 tunneld 0 10.0.0.101 10.0.0.9 member", "member wccp2", "group 61 wccp0 - 2",
      "group 62 wccp0 - 2 unwanted", "rule 2  57450002 270339", "route 270339 wccp2", "route 204803 wccp0",
      "rule 0 wccp2 57430001 204800", "rule 3 wccp2 0 204803", "ends 10.0.0.101 10.0.0.9",
      "!rule 1 wccp2 57430002 254", "!passing wccp3", "!bucket 9 of 61 to 10.0.0.9"},
     [](appliance_view &view) {
         share_flows(&view, true);
         view.accepted = {{OTHER, 0}};
     }},
    {"another appliance, by bucket: a passing link as well",
     {"link wccp3 tunneld 0 10.0.0.101 10.0.0.9 passing", "passing wccp3", "rule 3 wccp3 0 270339",
      "bucket 9 of 61 to 10.0.0.9", "bucket 9 of 62 to 10.0.0.9 by source", "group 61 wccp0",
      "!ends 10.0.0.101 10.0.0.2 passing", "!member wccp3"},
     [](appliance_view &view) { share_flows(&view, false); }},
    {"another appliance, by L2",
     {"link wccp0 tunneld 0 10.0.0.101 10.0.0.1 member", "route 204801 eth0 via 10.0.0.17",
      "route 270337 wccp0", "group 61 eth0 - 1"},
     [](appliance_view &view) {
         share_flows(&view, true);
         view.tunnels.clear();
         use_l2(&view);
     }},
    {"an interface name with a path is ignored",
     {"route 204801 wccp0", "!l2 ../../x", "!rule 0 ../../x 57430001 204800"},
     [](appliance_view &view) {
         view.groups[61] = {"../../x", LOCAL, 0, true, {{R1, R1, travel::l2, travel::gre}}};
     }},
};

TEST(wanted_state, follows_the_view) {
    for (const auto &one : wanted_cases) {
        SCOPED_TRACE(one.name);
        appliance_view view = two_tunnels();
        one.change(view);
        const auto lines = describe_wanted(make_wanted_state(view, {}, true));
        for (const auto &line : one.lines)
            EXPECT_TRUE(line[0] == '!' ? !lines.count(line.substr(1)) : lines.count(line)) << line;
    }
}

TEST(wanted_state, links_keep_their_numbers) {
    appliance_view view = two_tunnels();
    view.tunnels = {{9, {LOCAL, R2}}, {1, {LOCAL, OTHER}}}; // R2 with another id
    const std::vector<wanted_link> before = make_wanted_state(two_tunnels(), {}, false).links;
    const auto links = make_wanted_state(view, before, false).links;
    // wccp0 still exists when the new link is made.
    EXPECT_EQ(links, (std::vector<wanted_link>{{"wccp1", {9, LOCAL, R2}}, {"wccp2", {1, LOCAL, OTHER}}}));
}

TEST(link_names, only_ours_are_read) {
    for (const auto &[kind, word] : {std::pair{link_kind::tunnel, ""},
                                     {link_kind::accepted, " accepted"},
                                     {link_kind::member, " member"},
                                     {link_kind::passing, " passing"}}) {
        const link_wish each = {65535, LOCAL, R1, kind};
        EXPECT_EQ(link_alias(each), "tunneld 65535 10.0.0.101 10.0.0.1" + std::string(word));
        EXPECT_EQ(parse_link_alias(link_alias(each)), each);
    }
    for (const std::string alias :
         {"", "tunneld", "tunneld 3 10.0.0.101", "tunneld 65536 10.0.0.101 10.0.0.1",
          "tunneld 03 10.0.0.101 10.0.0.1", "tunneld 3 10.0.0.101 10.0.0.1 ",
          "tunneld 3 10.0.0.101 10.0.0.1 accepted more", "tunneld -1 1.1.1.1 2.2.2.2",
          "tunneld 3 10.0.0.101 10.0.0.1 refused", "tunneld 3 10.0.0.256 10.0.0.1"})
        EXPECT_FALSE(parse_link_alias(alias)) << alias;
    EXPECT_FALSE(parse_link_alias("tunneld 3 10.0.0.101 10.0.0.1" + std::string(200, ' ')));
    for (const char *name : {"wccp", "wccp01", "wccp65536", "wccp123456", "wccp1x", "eth0"})
        EXPECT_FALSE(link_number(name)) << name;
    EXPECT_EQ(link_number("wccp65535"), 65535u);
}

// --- The kernel

bool make_tun(const std::string &name, const link_wish &, uint32_t *out_index, std::string *) {
    static std::map<std::string, uint32_t> held; // indices of the interfaces that this process has opened
    if (!held[name] || held[name] != if_nametoindex(name.c_str())) {
        EXPECT_GE(open_tun(name), 0);
    }
    *out_index = held[name] = if_nametoindex(name.c_str());
    return true;
}
const data_plane tun_plane = {"tun", nullptr, nullptr, nullptr, make_tun, remove_interface, nullptr};

const std::string SETTINGS = "/proc/sys/net/ipv4/conf/";
void put_setting(const std::string &path, const std::string &value) {
    std::ofstream(SETTINGS + path) << value;
}
// The values of several settings, each of which is one character.
std::string read_settings(const strings &paths) {
    std::string values;
    for (const auto &path : paths)
        values += text_of_file(SETTINGS + path)[0];
    return values;
}

// Whether the kernel's route for a packet contains the text.
bool is_routed(const std::string &arguments, const std::string &text) {
    const std::string find_route = "ip route get 198.51.100.1 from 203.0.113.1 " + arguments;
    return system((find_route + " 2>&1 | grep -q '" + text + "'").c_str()) == 0;
}

// Counts the kernel's notifications about links, addresses, routes, rules and settings during the steps.
int count_changes(const std::function<void()> &steps) {
    const int fd = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, NETLINK_ROUTE);
    const sockaddr_nl own = {AF_NETLINK, 0, 0,
                             RTMGRP_LINK | RTMGRP_IPV4_IFADDR | RTMGRP_IPV4_ROUTE | RTMGRP_IPV4_RULE |
                                 1 << (RTNLGRP_IPV4_NETCONF - 1)};
    EXPECT_EQ(bind(fd, reinterpret_cast<const sockaddr *>(&own), sizeof own), 0);
    steps();
    char buffer[65536];
    int count = 0;
    while (recv(fd, buffer, sizeof buffer, MSG_DONTWAIT) > 0)
        count++;
    close(fd);
    return count;
}

std::map<std::string, uint32_t> indices;
std::string reconcile_kernel(const wanted_state &wanted, const data_plane &plane = tun_plane) {
    std::string error;
    const bool done = reconcile_kernel_state(plane, wanted, &indices, &error);
    EXPECT_EQ(done, error.empty());
    return error;
}

// Everything in the kernel that tunneld has made, as links_and_tables() describes it.
std::set<std::string> find_ours() {
    std::set<std::string> lines;
    std::vector<found_link> links;
    std::vector<found_rule> rules;
    std::vector<found_route> routes;
    EXPECT_EQ(find_links(false, &links), 0);
    EXPECT_EQ(find_rules(&rules), 0);
    EXPECT_EQ(find_routes(&routes), 0);
    for (const auto &link : links)
        lines.insert("link " + link.name + " " + link.alias +
                     (link.group == LINK_GROUP && link.mtu == LINK_MTU && link.is_up ? "" : " unmarked"));
    for (const auto &one : rules)
        lines.insert(describe_rule(one.rule) + (one.odd ? " odd" : ""));
    for (const auto &one : routes)
        lines.insert(describe_route(one.route) + (one.odd ? " odd" : ""));
    return lines;
}
void reconcile_all(const wanted_state &wanted, const data_plane &plane = tun_plane) {
    EXPECT_EQ(reconcile_kernel(wanted, plane), "");
    EXPECT_EQ(find_ours(), links_and_tables(wanted));
}
void remove_all(const data_plane &plane = tun_plane) {
    std::string error;
    EXPECT_TRUE(remove_kernel_state(plane, &error)) << error;
    EXPECT_EQ(find_ours(), std::set<std::string>());
}

// Provides an interface "eth0" that is not tunneld's.
struct kernel_state : testing::Test {
    const int lan = open_tun("eth0");
    void SetUp() override {
        ASSERT_GE(lan, 0) << "run by lab/in-appliance";
        ASSERT_EQ(system("ip address add 10.0.0.101/24 dev eth0 && ip link set eth0 up && "
                         "ip route add default via 10.0.0.254 && cd /proc/sys/net/ipv4/conf && "
                         "for key in rp_filter send_redirects; do "
                         "echo 1 >all/$key && echo 0 >default/$key && echo 0 >eth0/$key || exit; done"),
                  0);
    }
    void TearDown() override {
        run_program([] { remove_all(); });
        ioctl(lan, TUNSETPERSIST, 0);
        close(lan);
    }
};

TEST_F(kernel_state, made_once_followed_and_removed) {
    run_program([] {
        appliance_view view = two_tunnels();
        share_flows(&view, false);
        auto wanted = make_wanted_state(view, {}, true);
        reconcile_all(wanted);
        EXPECT_EQ(indices["wccp1"], if_nametoindex("wccp1"));
        for (const auto &setting : wanted.settings)
            EXPECT_EQ(read_settings({setting.path}), setting.value) << setting.path;

        EXPECT_TRUE(is_routed("iif wccp0", "table 204801"));
        EXPECT_TRUE(is_routed("iif wccp0 mark 0x57430001", "^local "));
        EXPECT_TRUE(is_routed("iif wccp0 mark 0x57430002", "dev eth0"));

        EXPECT_EQ(count_changes([&] { EXPECT_EQ(reconcile_kernel(wanted), ""); }), 0);

        // A tunnel gets another id and L2 return, the other tunnel is deleted, and flows are no longer passed
        // on.
        const uint32_t index = indices["wccp0"];
        view.tunnels = {{30, {LOCAL, R1}}};
        view.groups[61].force_l2_return = true;
        view.protections.clear();
        wanted = make_wanted_state(view, wanted.links, true);
        reconcile_all(wanted);
        EXPECT_EQ(indices, (std::map<std::string, uint32_t>{{"wccp0", index}}));

        // An operator sets a link down, which removes its route, and then deletes the link.
        EXPECT_EQ(system("ip link set wccp0 down mtu 1400"), 0);
        reconcile_all(wanted);
        EXPECT_EQ(system("ip link delete wccp0"), 0);
        reconcile_all(wanted);
        EXPECT_EQ(indices["wccp0"], if_nametoindex("wccp0"));

        // A link with other ends is a new link, even if it has the same number.
        wanted.links[0].wish.remote = OTHER;
        reconcile_all(wanted);

        remove_all();
        EXPECT_FALSE(std::filesystem::exists("/run/tunneld/settings"));
    });
}

TEST_F(kernel_state, what_a_killed_program_leaves_is_taken_over) {
    appliance_view view = two_tunnels();
    view.groups[61].routers[0].forward = travel::l2;
    run_program([&] { EXPECT_EQ(reconcile_kernel(make_wanted_state(view, {}, true)), ""); });
    // A link whose program has died does not lose packets: they are routed like others once the kernel has
    // noticed.
    const auto is_noticed = [] { return is_routed("iif eth0 mark 0x57430100", "dev eth0"); };
    for (int i = 0; i < 150 && !is_noticed(); i++)
        usleep(20000);
    EXPECT_TRUE(is_noticed());
    // A link without a mark, one with an invalid alias, one that is not tunneld's, and rules and routes that
    // are not wanted.
    for (const char *name : {"wccp5", "wccp7", "tun3"})
        close(open_tun(name));
    EXPECT_EQ(system("ip link set wccp7 group 2048 alias 'tunneld 3 10.0.0.101 10.0.0.1 $(reboot) \x01'\n"
                     "ip link set wccp1 alias ''\n"
                     "ip link set wccp5 up\n"
                     "ip route add 192.0.2.0/24 dev wccp5 table 204806 protocol 204\n"
                     "ip route add blackhole default table 204900 protocol 204\n"
                     "ip route add 192.0.3.0/24 dev eth0 table 204806\n"
                     "ip rule add from 192.0.2.7 table 204900 preference 2051 protocol 204\n"
                     "ip rule add from 192.0.2.8 table 204900 preference 2051"),
              0);
    run_program([&] {
        const uint32_t index = if_nametoindex("wccp0"), unmarked = if_nametoindex("wccp1");
        const auto before = find_own_links();
        EXPECT_EQ(before, (std::vector<wanted_link>{{"wccp0", {3, LOCAL, R1}}}));
        const auto wanted = make_wanted_state(view, before, true);
        reconcile_all(wanted);
        EXPECT_EQ(indices, (std::map<std::string, uint32_t>{{"wccp0", index}, {"wccp1", unmarked}}));
        EXPECT_EQ(system("ip route show table 204806 | grep -q eth0 && ip route flush table 204806 && "
                         "ip rule delete preference 2051 from 192.0.2.8 && ip link delete tun3"),
                  0);
        remove_all();
    });
}

TEST_F(kernel_state, settings_come_back) {
    const strings filters = {"all/rp_filter", "eth0/rp_filter", "lan1/rp_filter", "default/rp_filter"};
    put_setting("default/rp_filter", "2");
    close(open_tun("lan1"));
    put_setting("lan1/rp_filter", "0");
    appliance_view view = two_tunnels();
    view.groups[61].routers[0].forward = travel::l2;
    const auto wanted = make_wanted_state(view, {}, true);
    run_program([&] {
        EXPECT_EQ(reconcile_kernel(wanted), "");
        EXPECT_EQ(read_settings(filters), "0112");
        EXPECT_EQ(read_settings({"eth0/forwarding", "eth0/accept_local", "eth0/send_redirects"}), "110");
        EXPECT_EQ(read_settings({"lan1/send_redirects"}), "1"); // as `all` had it
    });
    // The program was killed, an operator has changed a setting, and the file has invalid lines.
    put_setting("lan1/rp_filter", "2");
    EXPECT_EQ(
        system("(echo 'eth0/../../x 1 1'; echo 'all/rp_filter 1'; echo 'all/forwarding 1x 0'; head -c 5000 "
               "/dev/zero) >>/run/tunneld/settings"),
        0);
    run_program([&] {
        EXPECT_EQ(reconcile_kernel(wanted), ""); // the values found now are not the ones to restore
        view.groups[61].routers[0].forward = travel::gre;
        EXPECT_EQ(reconcile_kernel(make_wanted_state(view, wanted.links, true)), "");
        EXPECT_EQ(read_settings({"eth0/forwarding", "eth0/accept_local", "all/rp_filter", "eth0/rp_filter"}),
                  "0001");
        remove_all();
        EXPECT_EQ(read_settings(filters), "1022");
        EXPECT_EQ(read_settings({"all/send_redirects", "eth0/send_redirects", "lan1/send_redirects"}), "100");
        EXPECT_EQ(system("ls /run/tunneld/* 2>/dev/null"), 2 << 8);
    });
    EXPECT_EQ(system("ip link delete lan1"), 0);
}

TEST_F(kernel_state, failures_are_reported_and_the_rest_is_done) {
    run_program([] {
        appliance_view view = two_tunnels();
        view.groups[61].interface = "eth7"; // does not exist
        view.groups[61].force_l2_return = true;
        const auto wanted = make_wanted_state(view, {}, true);
        ASSERT_EQ(system("mount --bind /proc/sys /proc/sys && mount -o remount,ro,bind /proc/sys"), 0);
        EXPECT_EQ(reconcile_kernel(wanted),
                  "cannot set /proc/sys/net/ipv4/conf/default/rp_filter to 1: Read-only file system");
        EXPECT_EQ(system("umount /proc/sys"), 0);
        auto expected = links_and_tables(wanted);
        EXPECT_EQ(expected.erase("route 204801 eth7 via 10.0.0.17"), 1u);
        EXPECT_EQ(find_ours(), expected);
        EXPECT_EQ(reconcile_kernel(wanted),
                  "cannot add the default route of table 204801 (eth7 via 10.0.0.17): No such device");
        EXPECT_EQ(read_settings({"wccp0/accept_local"}), "1");
    });
}

// Kernels without GRE are tested for the error only.
TEST(kernel_plane, makes_gre_links_or_says_why_not) {
    std::string error;
    auto wanted = make_wanted_state(two_tunnels(), {}, false);
    const auto reconcile_gre = [&] {
        reconcile_all(wanted, kernel_plane);
        std::vector<found_link> links;
        find_links(false, &links);
        for (const auto &link : links)
            EXPECT_TRUE(link.gre == wanted_gre(link.wish->local, link.wish->remote)) << link.name;
    };
    const bool has_gre = kernel_plane.probe(&error);
    EXPECT_EQ(find_ours(), std::set<std::string>()); // the probe leaves nothing
    if (!has_gre) {
        EXPECT_EQ(error, "the kernel cannot make GRE links: Operation not supported");
        EXPECT_EQ(reconcile_kernel(wanted, kernel_plane),
                  "cannot make link wccp0 (GRE 10.0.0.101 to 10.0.0.1): Operation not supported");
        EXPECT_TRUE(indices.empty());
        return;
    }
    close(open_tun("wccp0")); // left behind by the other plane
    run_program([&] {
        reconcile_gre();
        EXPECT_EQ(count_changes(reconcile_gre), 0);
        EXPECT_EQ(system("ip link set wccp1 type gre local 10.0.0.101 remote 10.0.0.7"), 0);
        reconcile_gre();
        std::swap(wanted.links[0].wish, wanted.links[1].wish);
        wanted.links.pop_back();
        reconcile_kernel(wanted, kernel_plane); // another link still has these ends
        wanted = make_wanted_state(two_tunnels(), wanted.links, false);
        reconcile_gre();
        plane_counters counters;
        kernel_plane.read_counters(&counters);
        EXPECT_EQ(counters.links.size(), 2u);
        remove_all(kernel_plane);
    });
}

} // namespace
