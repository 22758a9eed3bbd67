// The sorting rules in the kernel. TUN devices stand for a link, an L2 interface, the default route and a
// link to another appliance; a proxy's sockets listen.

#include <gtest/gtest.h>
#include <poll.h>

#include <ctime>

#include "peers/tunneld/nft_commands.h"
#include "peers/tunneld/sorting_rules.h"
#include "tests/support/packets.h"
#include "tests/support/test_host.h"
#include "tests/support/wire_bytes.h"

namespace {

constexpr uint8_t FIN = TCP_FIN, SYN = TCP_SYN, ACK = TCP_ACK;
constexpr sorted_as TO_PROXY = SORTED_TO_PROXY, RETURNED = SORTED_RETURNED;
constexpr uint32_t CLIENT = 0xAC100005, SERVER = 0xC6336405, OWN = 0x0A000001, ROUTER = 0xC0000201;
constexpr uint32_t SPARED = 0x0A090101, BYPASSED = 0xCB007107; // bypassed for a group, and for all

uint16_t next_port = 20000;
struct packet {
    uint32_t source = CLIENT, destination = SERVER;
    uint8_t protocol = 6, flags = SYN;
    uint16_t port = 80, from = next_port++;
    uint32_t sequence = 1, acknowledged = 0;
    std::string text = "";
};

// For packets that are long enough.
const tcp_wire_header *tcp_of(const bytes &packet) {
    return reinterpret_cast<const tcp_wire_header *>(&packet[20]);
}
bytes make_bytes(const packet &what) {
    wire_bytes body;
    body.u16(what.from).u16(what.port);
    const bool syn = what.flags & SYN;
    const char *const rest = syn ? "ffff 00*4 020405b4" : "ffff 00*4";
    if (what.protocol == PROTOCOL_UDP)
        body.zeros(4);
    else
        body.u32(what.sequence).u32(what.acknowledged).u8(syn ? 0x60 : 0x50).u8(what.flags).hex(rest);
    body.bytes.insert(body.bytes.end(), what.text.begin(), what.text.end());
    return make_ip_packet(what.protocol, what.source, what.destination, body.bytes);
}

enum device { LINK, LAN, OUT, MEMBER, DEVICES };
constexpr const char *device_names[DEVICES] = {"wccp0", "lan0", "out0", "wccp9"};
constexpr uint32_t PASSED_ON = MARK_PASS + 9;
int devices[DEVICES];

void write_to_device(device where, const bytes &sent) {
    ASSERT_EQ(write(devices[where], sent.data(), sent.size()), static_cast<ssize_t>(sent.size()));
}

// The next packet from any device that `wanted` accepts. The kernel handles a packet, including the answer,
// while it is written: waiting is necessary only on a busy machine.
bytes take_packet(const std::function<bool(const bytes &)> &wanted, device *out_where, int ms = 60) {
    pollfd fds[DEVICES];
    for (int i = 0; i < DEVICES; i++)
        fds[i] = {devices[i], POLLIN, 0};
    while (poll(fds, DEVICES, ms) > 0)
        for (int i = 0; i < DEVICES; i++) {
            bytes got(2048);
            const ssize_t length = fds[i].revents ? read(devices[i], got.data(), got.size()) : 0;
            got.resize(length > 0 ? static_cast<size_t>(length) : 0);
            *out_where = static_cast<device>(i);
            if (!got.empty() && got[0] == 0x45 && wanted(got))
                return got;
        }
    return {};
}

void drain_devices() {
    device where;
    take_packet([](const bytes &) { return false; }, &where, 0);
}

int listen_on(int type, uint32_t address, uint16_t port) {
    const int fd = socket(AF_INET, type | SOCK_NONBLOCK | SOCK_CLOEXEC, 0), on = 1;
    setsockopt(fd, IPPROTO_IP, IP_TRANSPARENT, &on, sizeof(on));
    EXPECT_EQ(bind_to(fd, address, port), 0) << strerror(errno);
    listen(fd, 100); // has no effect on datagrams
    return fd;
}

sorted_group make_group(uint8_t number, uint8_t protocol, std::vector<port_range> ports) {
    sorted_group group{number, {}, {true, true}, {"wccp0"}};
    group.rules.protocol = protocol;
    group.rules.ports = std::move(ports);
    group.rules.to = 3128;
    return group;
}

wanted_sorting make_wanted() {
    wanted_sorting wanted;
    wanted.links = {"wccp0"};
    wanted.l2_interfaces = {"lan0"};
    wanted.members = {"wccp9"};
    wanted.groups = {make_group(5, 6, {{80, 80}, {8000, 8080}}), make_group(6, 17, {{53, 53}}),
                     make_group(7, 6, {{8040, 8100}})}; // group 5 has some of these ports
    wanted.groups[0].interfaces = {"wccp0", "lan0"};
    wanted.groups[0].rules.bypass = {{SPARED, 16}, {SPARED, 24}};
    wanted.bypasses = {{BYPASSED, 24}, {BYPASSED, 32}};
    wanted.own_addresses = {OWN};
    wanted.ends = {{OWN, ROUTER}};
    wanted.mss = 1400;
    return wanted;
}

struct Sorting : testing::Test {
    static void SetUpTestSuite() {
        for (int i = 0; i < DEVICES; i++)
            ASSERT_GE(devices[i] = open_tun(device_names[i], O_NONBLOCK), 0);
        ASSERT_EQ(
            system(
                "set -e; cd /proc/sys/net/ipv4/conf; echo 0 >all/rp_filter; ip addr add 10.0.0.1/32 dev lo\n"
                "for d in wccp0 lan0 out0 wccp9; do echo 1 >$d/forwarding; echo 0 >$d/rp_filter\n"
                "    echo 1 >$d/accept_local; ip link set $d up; done\n"
                "ip route add default dev out0; ip route add local default dev lo table 204800\n"
                "ip rule add pref 2048 fwmark 0x57430001 lookup 204800\n"
                "ip rule add pref 2049 fwmark 0x57430002 lookup main\n"
                "add() { ip route add default dev $1 table $2; ip rule add pref 2050 fwmark $3 lookup $2; }\n"
                "add wccp0 204801 0x57430100; add wccp9 270346 0x57450009\n"
                "for d in wccp0 wccp9; do ip rule add pref 2051 iif $d lookup 204801; done"),
            0);
        listen_on(SOCK_STREAM, INADDR_ANY, 3128);
        listen_on(SOCK_STREAM, INADDR_LOOPBACK, 3129);
        udp = listen_on(SOCK_DGRAM, INADDR_ANY, 3128);
    }
    ~Sorting() override {
        remove_rules();
        remove_rules();
        EXPECT_EQ(system("[ -z \"$(nft list ruleset)\" ]"), 0);
    }
    static void apply(const wanted_sorting &wanted) {
        std::string error;
        EXPECT_TRUE(apply_sorting_rules(wanted, &error)) << error;
    }
    static void remove_rules() {
        std::string error;
        EXPECT_TRUE(remove_sorting_rules(&error)) << error;
    }
    static sorting_counters counters() {
        sorting_counters read;
        std::string error;
        EXPECT_TRUE(read_sorting_counters(&read, &error)) << error;
        return read;
    }
    // Sends a packet and returns the result: the device from which it was read, "answer" or "refused" for a
    // reply of a TCP socket, "datagram" for the UDP socket, or "".
    static std::string send(const packet &what, device by = LINK, bytes *out_answer = nullptr) {
        drain_devices();
        write_to_device(by, make_bytes(what));
        device where = DEVICES;
        const bytes got = take_packet(
            [&](const bytes &each) {
                return each.size() >= 28 && (to_host(tcp_of(each)->source_port) == what.from ||
                                             to_host(tcp_of(each)->destination_port) == what.from);
            },
            &where);
        char buffer[64];
        if (what.protocol == 17 && recv(udp, buffer, sizeof(buffer), 0) >= 0)
            return "datagram";
        if (got.empty() || to_host(tcp_of(got)->source_port) == what.from)
            return got.empty() ? "" : device_names[where];
        if (out_answer)
            *out_answer = got;
        return tcp_of(got)->flags == (SYN | ACK) ? "answer" : "refused";
    }
    inline static int udp;
};

} // namespace

TEST_F(Sorting, PacketsGoWhereTheyShould) {
    using W = wanted_sorting;
    static const auto pass_group_5 = [](W &w) {
        w.groups[0].mask = {5, 0, 0, 0};
        w.groups[0].pass_marks = {0, 0, 0, PASSED_ON};
    };
    static const auto choose_passing = [](W &w) {
        pass_group_5(w);
        w.members.swap(w.passing);
    };
    static const auto pass_answers = [](W &w) {
        w.groups[1].rules = {};
        w.groups[1].mask = {0, 4, 0, 0};
        w.groups[1].pass_ports = {{79, 80}, {80, 81}};
        w.groups[1].pass_marks = {0, PASSED_ON};
    };
    static const auto take_all_ports = [](W &w) { w.groups[0].rules.ports.clear(); };
    static const auto return_by_gre = [](W &w) { w.l2_into_gre = {{"lan0", MARK_RETURN}}; };
    static const auto bypass_client = [](W &w) { w.bypasses = {{CLIENT, 32}}; };
    static const auto bypass_all = [](W &w) { w.bypasses = {{0, 0}}; };
    static const auto end_proxy = [](W &w) { w.groups[0].condition.proxy_up = false; };
    static const auto end_last_proxy = [](W &w) { w.groups[2].condition.proxy_up = false; };
    static const auto deactivate = [](W &w) { w.groups[0].condition.active = false; };
    static const auto use_free_port = [](W &w) { w.groups[0].rules.to = 3999; };
    static const auto use_loopback = [](W &w) { w.groups[0].rules.to = 3129; };
    static const auto forward_rest = [](W &w) {
        for (auto &g : w.groups)
            g.rules.rest = leftover::forward;
    };
    static const auto drop_rest = [](W &w) { w.groups[0].rules.rest = leftover::drop; };
    static const auto drop_beside_idle = [](W &w) {
        w.groups[0].rules.rest = leftover::drop;
        w.groups[1].rules.to = 0;
        w.groups[1].interfaces = {"lan0"};
    };
    static const auto pass_slot_15 = [](W &w) { // by port 80, the source port, 4 and 1
        w.groups[0].mask = {1, 4, 0x8000, 16};
        w.groups[0].pass_marks.assign(16, 0);
        w.groups[0].pass_marks[15] = PASSED_ON;
    };
    static const auto pass_everything = [](W &w) { w.groups[0].pass_marks = {PASSED_ON}; };
    static const auto clear_groups = [](W &w) { w.groups.clear(); };
    const auto from_port = [](uint16_t port) { return packet{.flags = ACK, .port = 50000, .from = port}; };
    const struct {
        const char *what;
        packet given;
        device by;
        const char *outcome;
        sorted_as way;
        int group; // that counts it as well; 0: none
        std::function<void(W &)> change = [](W &) {};
    } rows[] = {
        {"a new flow", {}, LINK, "answer", TO_PROXY, 5},
        {"taken by the first group", {.port = 8040}, LINK, "answer", TO_PROXY, 5},
        {"left for the second", {.port = 8100}, LINK, "answer", TO_PROXY, 7},
        {"a datagram", {.protocol = 17, .port = 53}, LINK, "datagram", TO_PROXY, 6},
        {"another port", {.port = 443}, LINK, "wccp0", RETURNED, 0},
        {"another protocol", {.protocol = 47}, LINK, "wccp0", RETURNED, 0},
        {"an older flow", {.flags = ACK}, LINK, "wccp0", RETURNED, 5},
        {"all ports", {.port = 65535}, LINK, "answer", TO_PROXY, 5, take_all_ports},
        {"by L2", {}, LAN, "answer", TO_PROXY, 5},
        {"by L2, another port", {.port = 443}, LAN, "out0", RETURNED, 5},
        {"by L2, back through GRE", {.port = 443}, LAN, "wccp0", RETURNED, 5, return_by_gre},
        {"by L2, to this host", {.destination = OWN}, LAN, "refused", SORTED_WAYS, 0},
        {"a spared server", {.destination = SPARED}, LINK, "wccp0", SORTED_BYPASSED, 5},
        {"a spared client", {.source = SPARED}, LINK, "wccp0", SORTED_BYPASSED, 5},
        {"a bypassed server", {.destination = BYPASSED}, LINK, "wccp0", SORTED_BYPASSED, 0},
        {"no bypass any more", {.source = BYPASSED}, LINK, "answer", TO_PROXY, 5, bypass_client},
        {"everything is bypassed", {}, LINK, "wccp0", SORTED_BYPASSED, 0, bypass_all},
        {"proxy down", {.port = 8100}, LINK, "wccp0", SORTED_DOWN, 7, end_last_proxy},
        {"fail closed", {}, LINK, "", SORTED_DOWN, 5, end_proxy},
        {"not active", {}, LINK, "wccp0", SORTED_DOWN, 5, deactivate},
        {"nobody listens", {}, LINK, "wccp0", RETURNED, 5, use_free_port},
        {"a proxy on loopback", {}, LINK, "answer", TO_PROXY, 5, use_loopback},
        {"own traffic", {.source = OWN}, LINK, "wccp0", SORTED_OWN, 0},
        {"forwarded", {.port = 443}, LINK, "out0", SORTED_FORWARDED, 0, forward_rest},
        {"dropped", {.port = 443}, LAN, "", SORTED_DROPPED, 5, drop_rest},
        {"not all groups drop", {.port = 443}, LINK, "wccp0", RETURNED, 0, drop_rest},
        {"one without an intercept", {.port = 443}, LAN, "out0", RETURNED, 0, drop_beside_idle},
        {"a flow to be passed on", {.flags = ACK}, LINK, "wccp9", SORTED_PASSED, 5, pass_group_5},
        {"the same by L2", {.flags = ACK}, LAN, "wccp9", SORTED_PASSED, 5, pass_group_5},
        {"of another slot", {.source = CLIENT - 1, .flags = ACK}, LINK, "wccp0", RETURNED, 5, pass_group_5},
        {"a new flow in that slot", {}, LINK, "answer", TO_PROXY, 5, pass_group_5},
        {"passed on to this appliance", {.flags = ACK}, MEMBER, "wccp0", RETURNED, 0, pass_group_5},
        {"chosen by the plane", {.flags = ACK}, MEMBER, "wccp0", SORTED_PASSED, 0, choose_passing},
        {"by all four fields", {.flags = ACK, .from = 40000}, LINK, "wccp9", SORTED_PASSED, 5, pass_slot_15},
        {"one slot for all", {.flags = ACK}, LINK, "wccp9", SORTED_PASSED, 5, pass_everything},
        {"an answer", from_port(81), LINK, "wccp9", SORTED_PASSED, 6, pass_answers},
        {"another answer", from_port(82), LINK, "wccp0", RETURNED, 0, pass_answers},
        {"no groups", {}, LINK, "wccp0", RETURNED, 0, clear_groups},
    };
    for (const auto &row : rows) {
        SCOPED_TRACE(row.what);
        wanted_sorting wanted = make_wanted();
        wanted.groups[0].rules.drop_when_down = true;
        row.change(wanted);
        apply(wanted);
        sorting_counters before = counters();
        EXPECT_EQ(send(row.given, row.by), row.outcome);
        sorting_counters after = counters();
        for (int way = 0; way < SORTED_WAYS; way++) {
            const bool counted = row.way != SORTED_WAYS && (way == SORTED_IN || way == row.way);
            const char *name = device_names[row.by];
            EXPECT_EQ(after.interfaces[name][way].packets - before.interfaces[name][way].packets, counted)
                << sorted_words[way];
            for (const sorted_group &group : wanted.groups)
                EXPECT_EQ(after.groups[group.group][way].packets - before.groups[group.group][way].packets,
                          counted && group.group == row.group)
                    << sorted_words[way] << " of group " << static_cast<int>(group.group);
        }
    }
}

TEST_F(Sorting, AFlowStaysWithItsSocket) {
    const int listener = listen_on(SOCK_STREAM, INADDR_ANY, 3130);
    wanted_sorting wanted = make_wanted();
    wanted.groups[0].rules.to = 3130;
    apply(wanted);
    const packet first;
    bytes answer;
    ASSERT_EQ(send(first, LINK, &answer), "answer");
    EXPECT_EQ(bytes(answer.begin() + 40, answer.end()), hex("0204 0578").bytes); // fits the tunnel: 1400
    EXPECT_GE(counters().clamped, 1); // more when a socket repeats its answer
    const uint32_t next = to_host(tcp_of(answer)->sequence) + 1;
    // Later packets of the flow don't depend on the group's rules.
    wanted.groups[0].condition.proxy_up = false;
    wanted.bypasses = {{0, 0}};
    wanted.groups[0].pass_marks = {PASSED_ON};
    apply(wanted);
    packet later = {.flags = ACK, .from = first.from, .sequence = 2, .acknowledged = next};
    EXPECT_EQ(send(later, MEMBER), ""); // from another appliance
    EXPECT_EQ(counters().interfaces["wccp9"][TO_PROXY].packets, 1);
    later.text = "hello";
    EXPECT_EQ(send(later), "refused"); // acknowledged
    const int flow = accept(listener, nullptr, nullptr);
    char buffer[16];
    EXPECT_EQ(recv(flow, buffer, sizeof(buffer), 0), 5);
    EXPECT_EQ(counters().interfaces["wccp0"][TO_PROXY].packets, 2);
    // The proxy closes first, which leaves a TIME_WAIT socket: the client's FIN belongs to it. A new flow
    // from the same port goes to the proxy, too, or gets an acknowledgement of the old flow.
    close(flow);
    send({.flags = FIN | ACK, .from = first.from, .sequence = 7, .acknowledged = next + 1});
    EXPECT_EQ(counters().interfaces["wccp0"][TO_PROXY].packets, 3);
    const packet again = {.from = first.from, .sequence = 100007};
    EXPECT_EQ(send(again), "refused");
    wanted = make_wanted();
    wanted.groups[0].rules.to = 3130;
    apply(wanted);
    EXPECT_EQ(send(again), "answer");
    close(listener);
}

TEST_F(Sorting, OuterPacketsAreCounted) {
    wanted_sorting wanted = make_wanted();
    bytes gre = hex("0000 0800").bytes, inner = make_bytes({}), junk(64, 'x');
    gre.insert(gre.end(), inner.begin(), inner.end());
    const auto is_icmp = [](const bytes &each) { return each[9] == 1; };
    device where;
    for (const bool drop : {false, true}) {
        wanted.drop_outer_gre = drop;
        apply(wanted);
        drain_devices();
        write_to_device(OUT, make_ip_packet(PROTOCOL_GRE, ROUTER, OWN, gre));
        EXPECT_EQ(take_packet(is_icmp, &where).empty(), drop); // protocol unreachable: this kernel has no GRE
        write_to_device(OUT, make_ip_packet(PROTOCOL_GRE, ROUTER + 1, OWN, gre));
        write_to_device(OUT, make_ip_packet(PROTOCOL_GRE, ROUTER, OWN, junk, 0x2000));
        write_to_device(OUT, make_ip_packet(PROTOCOL_GRE, ROUTER, OWN, junk, 8));
    }
    sorting_counters read = counters();
    EXPECT_EQ(read.fragments, (std::map<tunnel_ends, uint64_t>{{{OWN, ROUTER}, 4}}));
    EXPECT_EQ(read.refused_sources, (std::map<uint32_t, uint64_t>{{ROUTER + 1, 1}}));
    wanted.ends.push_back({OWN, ROUTER + 1}); // now it is accepted
    apply(wanted);
    EXPECT_TRUE(counters().refused_sources.empty());
}

// The table of a killed tunneld is taken over with its counters. A change that the kernel refuses has no
// effect. A table that was removed is made again.
TEST_F(Sorting, ChangesAreWholeOrNone) {
    wanted_sorting wanted = make_wanted();
    wanted.members.clear();
    std::string error;
    remove_rules();
    run_program([&wanted] {
        wanted_sorting earlier = wanted;
        earlier.links = {"wccp0", "wccp9"};
        earlier.groups[0].interfaces.push_back("wccp9");
        earlier.groups.push_back(make_group(9, 6, {}));
        apply(earlier);
        EXPECT_EQ(send({.port = 443}), "answer");
        EXPECT_EQ(send({}), "answer");
    });
    next_port += 2;
    apply(wanted);
    sorting_counters read = counters();
    EXPECT_EQ(read.interfaces["wccp0"][TO_PROXY].packets, 2);
    EXPECT_EQ(read.groups[5][TO_PROXY].packets, 1);
    EXPECT_EQ(read.interfaces.size(), 2);
    EXPECT_FALSE(read.groups.contains(9));
    EXPECT_EQ(send({.port = 443}), "wccp0");

    wanted.groups[0].condition.proxy_up = false;
    ASSERT_EQ(seteuid(65534), 0);
    EXPECT_FALSE(apply_sorting_rules(wanted, &error));
    ASSERT_EQ(seteuid(0), 0);
    EXPECT_NE(error.find("Operation not permitted"), std::string::npos) << error;
    EXPECT_EQ(error.find('\n'), std::string::npos) << error;
    EXPECT_EQ(send({}), "answer");
    for (const char *name : {"a b", "x\"", "*", ""}) {
        wanted_sorting bad = wanted;
        bad.links.push_back(name);
        EXPECT_FALSE(apply_sorting_rules(bad, &error));
    }
    EXPECT_EQ(send({}), "answer");
    // With another mask, the map of passed-on packets has another type.
    wanted.groups[0].pass_marks = {0, PASSED_ON};
    for (const slot_mask mask : {slot_mask{1, 0, 0, 0}, slot_mask{0, 0, 0, 1}, slot_mask{0, 1, 0, 0}}) {
        wanted.groups[0].mask = mask;
        apply(wanted);
    }
    EXPECT_EQ(send({}), "wccp0");
    EXPECT_EQ(counters().groups[5][TO_PROXY].packets, 3);

    for (int round = 0; round < 2; round++) { // with a change of the rules, then without one
        ASSERT_TRUE(run_nft("flush ruleset", &error)) << error;
        wanted.groups[0].condition.proxy_up = true;
        apply(wanted);
        EXPECT_EQ(send({}), "answer");
    }
    // A table of the same name with other content is replaced.
    remove_rules();
    ASSERT_TRUE(run_nft("add table ip tunneld\nadd map ip tunneld arrivals { type ipv4_addr : verdict; }\n"
                        "add set ip tunneld classes { type mark; }\n",
                        &error))
        << error;
    apply(wanted);
    EXPECT_EQ(send({}), "answer");
    apply({});
    EXPECT_TRUE(counters().interfaces.empty());
    EXPECT_EQ(probe_sorting_rules(), "");
}

// First with the same groups for all links, then with different ones. Processor time, including the kernel's,
// does not depend on other programs.
TEST_F(Sorting, ManyLinksAndGroupsAreQuick) {
    for (const bool different : {false, true}) {
        wanted_sorting wanted = make_wanted();
        wanted.groups.clear();
        for (unsigned i = 0; i < 32; i++) {
            wanted.links.push_back("wccp" + std::to_string(i));
            wanted.ends.push_back({OWN, ROUTER + i});
        }
        for (unsigned i = 0; i < 256; i++) {
            const uint16_t port = static_cast<uint16_t>(1000 + 10 * i);
            wanted.groups.push_back(make_group(static_cast<uint8_t>(i), i % 4 ? 6 : 17, {{port, port}}));
            wanted.groups[i].rules.bypass = {{SPARED, 16}};
            wanted.groups[i].interfaces.clear();
            for (unsigned link = 0; link < 32; link++)
                if (!different || (i >> link % 8 & 1) != link / 8 % 2)
                    wanted.groups[i].interfaces.push_back("wccp" + std::to_string(link));
        }
        const auto timed = [&](const char *what, double limit_ms, const std::function<void()> &act) {
            const clock_t begin = clock();
            act();
            EXPECT_LT(1000.0 * static_cast<double>(clock() - begin) / CLOCKS_PER_SEC, limit_ms) << what;
        };
        const auto apply_it = [&] { apply(wanted); };
        timed("first", 1000, apply_it);
        EXPECT_EQ(send({.port = 1000 + 10 * 129}), "answer");
        for (const bool up : {false, true}) {
            wanted.groups[129].condition.proxy_up = up;
            timed("a proxy up or down", 300, apply_it);
        }
        EXPECT_EQ(send({.port = 1000 + 10 * 129}), "answer");
        wanted.bypasses.push_back({CLIENT, 32});
        timed("a bypass", 300, apply_it);
        EXPECT_EQ(send({.port = 1000 + 10 * 129}), "wccp0");
        timed("reading", 1000, [] { counters(); });
        remove_rules();
    }
}
