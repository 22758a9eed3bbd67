#include "peers/mgmtctl/check.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

#include "peers/mgmtctl/check_firewall.h"
#include "peers/mgmtctl/render.h"
#include "peers/mgmtctl/show_json.h"
#include "platform/limits.h"
#include "runtime/cmem.h"

enum check_exit : int { CHECK_FINE = 0, CHECK_FIX = 1 };

const std::vector<reason_text> &check_texts() {
    static const std::vector<reason_text> texts = {
        {"rp-filter", true,
         "strict rp_filter on {who} drops redirected packets that are answered through another interface",
         "sysctl -w net/ipv4/conf/{who}/rp_filter=2"},
        {"forwarding-off", true, "{who} does not forward: packets that are returned to the router are lost",
         "sysctl -w net/ipv4/conf/{who}/forwarding=1"},
        {"forwarding-later", false,
         "{who} does not forward yet; tunneld turns it on once a router sends by L2",
         "nothing; when the group is ACTIVE and still lacks it, look at tunneld's log"},
        {"firewall-drops-wccp", true, "UDP port 2048 {offered} {who} is dropped in {wanted}",
         "nft insert rule {wanted} udp dport 2048 accept"},
        {"firewall-drops-gre", true, "protocol 47 (GRE) {offered} {who} is dropped in {wanted}",
         "nft insert rule {wanted} meta l4proto 47 accept"},
        {"firewall-unclear", false, "whether {offered} {who} passes depends on conditions in {wanted}",
         "nft list chain {wanted}; accept UDP port 2048 and protocol 47 from the routers"},
        {"mtu-small", true,
         "the MTU of {who} is {offered}: redirected packets arrive in fragments or are lost",
         "ip link set {who} mtu {wanted}, and the same at the router"},
        {"gre-missing", true, "the kernel has neither GRE nor TUN",
         "install a kernel with CONFIG_NET_IPGRE or CONFIG_TUN"},
        {"gre-by-tun", false, "the kernel has no GRE: tunneld carries the packets itself, through TUN",
         "modprobe ip_gre, or a kernel with CONFIG_NET_IPGRE, for more throughput"},
        {"tun-missing", false, "the kernel has no TUN: tunneld can only use the kernel's GRE",
         "modprobe tun, or a kernel with CONFIG_TUN, for --plane user and protected flows"},
        {"tproxy-missing", true, "the kernel has no TPROXY: no packet reaches a proxy",
         "modprobe nft_tproxy, or install a kernel with CONFIG_NFT_TPROXY"},
        {"clock-unsynchronised", true, "nothing synchronises the clock: it may jump",
         "run a client of NTP: chronyd, or timedatectl set-ntp true"},
        {"memory-lock", true, "wccpd may lock only {offered} of memory, but locks all that it uses",
         "give it CAP_IPC_LOCK or LimitMEMLOCK=infinity, and restart it"},
        {"mem-conf-unreadable", true, "{who} cannot be read: {offered}",
         "install it again: without it wccpd and tunneld have no mailbox"},
        {"mem-conf-line", true, "line {offered} of {who} is invalid and was ignored",
         "NAME local|inter|DIGIT normal|huge KEY [ADDRESS], numbers in hexadecimal"},
        {"mem-conf-mailbox", true, "{who} has no key for {wanted}: wccpd cannot start",
         "add the line: {wanted} local normal 5743434d"},
        {"platform-conf-unreadable", true, "{who} cannot be read: {offered}",
         "chmod 644 {who}, or remove it for the defaults"},
        {"platform-conf-line", true, "line {offered} of {who} is invalid and was ignored",
         "max_user_tunnels 0 to 65000, or max_interfaces from 1"},
    };
    return texts;
}

// --- The checks

namespace {
constexpr long MTU_WANTED = 1500, STRICT = 1;
constexpr const char *MAILBOX = "wccpd_mailbox", *ANY_ADDRESS = "0.0.0.0";

struct judging {
    const check_facts &facts;
    check_result result;
    const char *check = ""; // the name of the present check

    void add_finding(const char *code, int group, const std::string &who, const std::string &offered = "",
                     const std::string &wanted = "") {
        reason one;
        one.code = code;
        one.group = group;
        one.who = who;
        one.offered = offered;
        one.wanted = wanted;
        fill_reason(check_texts(), &one);
        // Groups that share an interface have the same finding; once is enough.
        const auto same = [&](const reason &other) {
            return other.cause == one.cause && other.next == one.next;
        };
        if (std::none_of(result.findings.begin(), result.findings.end(), same))
            result.findings.push_back(std::move(one));
    }
    void note_unchecked(const std::string &why) { result.unchecked.push_back({check, why}); }
};

// Calls function(group, interface) for enabled groups whose interface exists.
template <typename Function>
void for_groups(const check_facts &facts, const Function &function) {
    for (const check_group &group : facts.groups) {
        const auto interface = facts.interfaces.find(group.interface);
        if (group.up && interface != facts.interfaces.end())
            function(group, interface->second);
    }
}

bool skip_without_groups(judging *work) {
    if (!work->facts.mgmtd_error.empty())
        work->note_unchecked("the groups are not known: " + work->facts.mgmtd_error);
    return !work->facts.mgmtd_error.empty();
}

bool is_in_the_way(const check_facts &facts, const check_socket &socket) {
    // Without mgmtd the interfaces of the groups are unknown, and any socket may collide.
    if (socket.address == ANY_ADDRESS || !facts.mgmtd_error.empty())
        return true;
    bool found = false;
    for_groups(facts, [&](const check_group &, const check_interface &interface) {
        found = found || std::count(interface.addresses.begin(), interface.addresses.end(), socket.address);
    });
    return found;
}

void judge_port(judging *work) {
    const check_facts &facts = work->facts;
    if (!facts.ports_error.empty())
        return work->note_unchecked(facts.ports_error);
    for (const check_socket &socket : facts.sockets) {
        if (socket.program == "wccpd" || !is_in_the_way(facts, socket))
            continue;
        // Without root the owner of a socket is hidden, and wccpd is the most likely one.
        if (socket.program.empty() && facts.wccpd_runs)
            work->note_unchecked("only root sees whether it is wccpd who has the port on " + socket.address);
        else
            work->add_finding("port-taken", -1, "",
                              socket.program.empty()
                                  ? "by a program that only root sees"
                                  : socket.program + " (process " + std::to_string(socket.process) + ")",
                              socket.address);
    }
}

void judge_interfaces(judging *work) {
    if (skip_without_groups(work))
        return;
    for (const check_group &group : work->facts.groups) {
        if (!group.up)
            continue;
        const auto found = work->facts.interfaces.find(group.interface);
        if (group.interface.empty())
            work->add_finding("no-interface", group.id, "");
        else if (found == work->facts.interfaces.end())
            work->add_finding("interface-missing", group.id, "", "", group.interface);
        else if (!found->second.up)
            work->add_finding("interface-down", group.id, "", "", group.interface);
        else if (found->second.addresses.empty())
            work->add_finding("interface-no-address", group.id, "", "", group.interface);
    }
}

bool is_own_link(const std::string &name) {
    // "wccp" and a number, as tunneld names its links.
    return name.starts_with("wccp") && name.size() > 4 &&
           std::all_of(name.begin() + 4, name.end(), [](char c) { return c >= '0' && c <= '9'; });
}

// Calls function(group or -1, name, interface) for the interfaces on which redirected packets arrive:
// tunnels, and interfaces of groups with L2 only. For other groups tunneld changes the settings itself when
// needed.
template <typename Function>
void for_redirected(const check_facts &facts, const Function &function) {
    for (const auto &[name, interface] : facts.interfaces)
        if (is_own_link(name))
            function(-1, name, interface);
    for_groups(facts, [&](const check_group &group, const check_interface &interface) {
        if (group.encap == "l2")
            function(group.id, group.interface, interface);
    });
}

void judge_rp_filter(judging *work) {
    (void)skip_without_groups(work); // tunnels are checked in any case
    for_redirected(work->facts, [&](int group, const std::string &name, const check_interface &interface) {
        if (!work->facts.all_rp_filter || !interface.rp_filter)
            return work->note_unchecked("the setting of " + name + " cannot be read");
        // The kernel uses the larger value: 2, which is loose, wins over 1.
        if (std::max(*work->facts.all_rp_filter, *interface.rp_filter) == STRICT)
            work->add_finding("rp-filter", group, name);
    });
}

void judge_forwarding(judging *work) {
    (void)skip_without_groups(work);
    for_redirected(work->facts, [&](int group, const std::string &name, const check_interface &interface) {
        if (!interface.forwarding)
            work->note_unchecked("the setting of " + name + " cannot be read");
        else if (*interface.forwarding == 0)
            work->add_finding(group < 0 ? "forwarding-off" : "forwarding-later", group, name);
    });
}

void judge_packets(judging *work, const ctl_json &rules, const check_group &group) {
    for (const bool gre : {false, true})
        for (const bool outgoing : {false, true}) {
            // Such a group is redirected without GRE.
            if (gre && group.encap == "l2")
                continue;
            const filter_finding found = judge_packet(rules, {gre, outgoing, group.interface});
            const std::string name = group.interface.empty() ? "any interface" : group.interface;
            const char *way = outgoing ? "out of" : "in by";
            if (found.result == filter_result::drops)
                work->add_finding(gre ? "firewall-drops-gre" : "firewall-drops-wccp", group.id, name, way,
                                  found.chain);
            else if (found.result == filter_result::unclear)
                work->add_finding("firewall-unclear", group.id, name,
                                  std::string(gre ? "protocol 47 (GRE) " : "UDP port 2048 ") + way,
                                  found.chain);
        }
}

void judge_firewall(judging *work) {
    const check_facts &facts = work->facts;
    if (!facts.legacy_error.empty())
        work->note_unchecked("the tables of iptables cannot be read: " + facts.legacy_error);
    // Their rules filter as well, but are not in nftables' listing.
    else if (!facts.legacy_tables.empty())
        work->note_unchecked("iptables has tables of its own (" + facts.legacy_tables +
                             "), which this cannot read: look through iptables-legacy-save");
    if (!facts.filter_error.empty())
        return work->note_unchecked("the rules cannot be read: " + facts.filter_error);
    ctl_json listing;
    const bool readable = parse_json(facts.filter_listing, &listing);
    const ctl_json &rules = std::as_const(listing)["nftables"];
    if (!readable || !rules.is_array())
        return work->note_unchecked("the rules cannot be read: their listing is not understood");
    if (!facts.mgmtd_error.empty())
        return judge_packets(work, rules, {-1, "", true, "either"});
    for (const check_group &group : facts.groups)
        if (group.up && !group.interface.empty())
            judge_packets(work, rules, group);
}

void judge_mtu(judging *work) {
    if (skip_without_groups(work))
        return;
    for_groups(work->facts, [&](const check_group &group, const check_interface &interface) {
        if (interface.mtu > 0 && interface.mtu < MTU_WANTED)
            work->add_finding("mtu-small", group.id, group.interface, std::to_string(interface.mtu),
                              std::to_string(MTU_WANTED));
    });
}

void judge_kernel(judging *work) {
    const check_facts &facts = work->facts;
    const std::pair<const char *, check_feature> features[] = {
        {"GRE", facts.gre}, {"TUN", facts.tun}, {"TPROXY", facts.tproxy}};
    for (const auto &[name, feature] : features)
        if (feature == check_feature::unknown)
            work->note_unchecked(std::string("neither the kernel nor its modules say whether it has ") +
                                 name);
    // One of the two is enough: tunneld can do GRE itself, through TUN.
    if (facts.gre == check_feature::missing && facts.tun != check_feature::unknown)
        work->add_finding(facts.tun == check_feature::missing ? "gre-missing" : "gre-by-tun", -1, "");
    else if (facts.tun == check_feature::missing)
        work->add_finding("tun-missing", -1, "");
    if (facts.tproxy == check_feature::missing)
        work->add_finding("tproxy-missing", -1, "");
}

void judge_clock(judging *work) {
    if (!work->facts.clock_synchronised)
        work->note_unchecked("the kernel does not say");
    else if (!*work->facts.clock_synchronised)
        work->add_finding("clock-unsynchronised", -1, "");
}

void judge_memory(judging *work) {
    const check_facts &facts = work->facts;
    if (!facts.wccpd_runs)
        work->note_unchecked("wccpd is not running: its limit is the one of its unit");
    else if (!facts.lock_limit_error.empty())
        work->note_unchecked(facts.lock_limit_error);
    // CAP_IPC_LOCK exempts a process from the limit.
    else if (!facts.may_lock && facts.lock_limit_bytes)
        work->add_finding("memory-lock", -1, "", std::to_string(*facts.lock_limit_bytes / 1024) + " KiB");
}

// False when the file could not be read.
bool judge_file(judging *work, const check_file &file, const char *path, const char *unreadable,
                const char *line) {
    // wccpd may run as a user that can read what this one cannot.
    if (file.error == EACCES && !work->facts.root)
        work->note_unchecked(std::string(path) + ": " + strerror(file.error));
    else if (file.error)
        work->add_finding(unreadable, -1, path, strerror(file.error));
    else if (file.bad_line)
        work->add_finding(line, -1, path, std::to_string(file.bad_line));
    return file.error == 0;
}

void judge_mem_conf(judging *work) {
    const check_file &file = work->facts.mem_conf;
    if (judge_file(work, file, CMEM_CONF_PATH, "mem-conf-unreadable", "mem-conf-line") && !file.complete)
        work->add_finding("mem-conf-mailbox", -1, CMEM_CONF_PATH, "", MAILBOX);
}

void judge_platform_conf(judging *work) {
    if (work->facts.platform_conf.error != ENOENT) // without a file the defaults are used
        (void)judge_file(work, work->facts.platform_conf, PLATFORM_CONF_PATH, "platform-conf-unreadable",
                         "platform-conf-line");
}

constexpr struct {
    const char *name;
    void (*judge)(judging *work);
} checks[] = {
    {"UDP port 2048", judge_port},
    {"interfaces", judge_interfaces},
    {"rp_filter", judge_rp_filter},
    {"forwarding", judge_forwarding},
    {"firewall", judge_firewall},
    {"MTU", judge_mtu},
    {"kernel", judge_kernel},
    {"clock", judge_clock},
    {"locked memory", judge_memory},
    {"mem.conf", judge_mem_conf},
    {"platform.conf", judge_platform_conf},
};
} // namespace

check_result judge_facts(const check_facts &facts) {
    judging work = {facts, {}};
    for (const auto &row : checks) {
        const size_t findings = work.result.findings.size(), unchecked = work.result.unchecked.size();
        work.check = row.name;
        row.judge(&work);
        if (findings == work.result.findings.size() && unchecked == work.result.unchecked.size())
            work.result.fine.emplace_back(row.name);
    }
    return std::move(work.result);
}

// --- The command

int tell_checks(const ctl_options &options, const check_result &result) {
    const bool fix = std::any_of(result.findings.begin(), result.findings.end(),
                                 [](const reason &each) { return each.attention; });
    const int exit = fix ? CHECK_FIX : CHECK_FINE;
    if (options.json) {
        ctl_json all = ctl_json::array(), unchecked = ctl_json::array();
        for (const reason &each : result.findings)
            all.push_back(reason_json(each));
        for (const auto &each : result.unchecked)
            unchecked.push_back({{"check", each.check}, {"why", each.why}});
        write_output(json_line({{"attention", fix},
                                {"reasons", all},
                                {"unchecked", unchecked},
                                {"fine", result.fine},
                                {"exit", exit}}));
        return exit;
    }
    for (const reason &each : result.findings)
        write_output(each.code + (each.group < 0 ? "" : " (group " + std::to_string(each.group) + ")") +
                     ": " + each.cause + "\n    " + (each.attention ? "fix: " : "no fault: ") + each.next +
                     "\n");
    std::map<std::string, std::string> unchecked; // the names of the checks, by the reason
    for (const auto &each : result.unchecked) {
        std::string &names = unchecked[each.why];
        names.append(names.empty() ? "" : ", ").append(each.check);
    }
    // Many checks share an obstacle, such as missing rights; it is printed once.
    for (const auto &[why, names] : unchecked)
        write_output(std::string("not checked: ").append(names).append(": ").append(why).append("\n"));
    std::string fine;
    for (const std::string &each : result.fine)
        fine += (fine.empty() ? "fine: " : ", ") + each;
    write_output(fine + (fine.empty() ? "" : "\n") + (fix ? "" : "nothing to fix\n"));
    return exit;
}

int ctl_check(const ctl_options &options) {
    return tell_checks(options, judge_facts(gather_facts(link_to_mgmtd(options))));
}
