// tunneld's session with mgmtd and its health checks, with real sockets. mgmtd's server runs on the same
// loop.
#include <filesystem>

#include <gtest/gtest.h>
#include <sys/stat.h>

#include "peers/mgmtd/transport.h"
#include "peers/tunneld/course.h"
#include "peers/tunneld/flow_count.h"
#include "peers/tunneld/health.h"
#include "peers/tunneld/link_names.h"
#include "peers/tunneld/session_config.h"
#include "peers/tunneld/slot_owners.h"
#include "runtime/ttime.h"
#include "tests/support/mgmtd_fixture.h"
#include "tests/support/test_host.h"

// --- Configuration as text

static event_field make_field(const std::string &name, const std::string &text) {
    return {name, {bn_type_str, text}};
}

TEST(Configuration, BadValuesAreBoundedAndLeftOut) {
    const std::string one = NODE_INTERCEPT_CONFIG "/51", two = NODE_INTERCEPT_CONFIG "/7";
    std::vector<event_field> nodes = {
        make_field(NODE_GROUP_CONFIG "/51/interface", "eth0"),
        make_field(NODE_GROUP_CONFIG "/51/policy_grp", "70000"),
        make_field(NODE_GROUP_CONFIG "/51/force_l2_return", "true"),
        make_field(NODE_GROUP_CONFIG "/52/interface", "../../eth0"),
        make_field(NODE_GROUP_CONFIG "/256/interface", "eth0"),
        make_field(one + "/protocol", "udp"),
        make_field(one + "/ports", "53 8000-8080"),
        make_field(one + "/to", "3128"),
        make_field(one + "/bypass", "10.1.2.3/8 10.0.0.300 192.0.2.1"),
        make_field(one + "/check", "http"),
        make_field(one + "/check_argument", "/health"),
        make_field(one + "/interval", "0"),
        make_field(one + "/down", "drop"),
        make_field(two + "/protocol", "tcp"),
        make_field(two + "/ports", "all"), // without a port of a proxy
        make_field(NODE_BYPASS_CONFIG "/10.0.0.0\\/8", "10.0.0.0/8"),
        make_field(NODE_BYPASS_CONFIG "/10.0.0.0\\/8/until", "99"),
        make_field(NODE_BYPASS_CONFIG "/10.0.0.0\\/33", "10.0.0.0/33"),
        make_field(NODE_ACCEPT_CONFIG "/192.0.2.9", "192.0.2.9"),
        make_field(NODE_ACCEPT_CONFIG "/192.0.2.9/router", "192.0.2.1"),
        make_field(NODE_ACCEPT_CONFIG "/somewhere", "somewhere"),
        make_field(NODE_PROTECTION_TIME, "60"),
    };
    strings complaints;
    configured_view expected;
    expected.groups = {{51, {"eth0", 0, 0, true, {}}}, {52, {}}};
    expected.intercepts[51] = {.protocol = 17,
                               .ports = {{53, 53}, {8000, 8080}},
                               .to = 3128,
                               .bypass = {{0x0a000000, 8}, {0xc0000201, 32}},
                               .drop_when_down = true,
                               .check = {check_kind::http, "/health"}};
    expected.bypasses = {{{0x0a000000, 8}, 99}};
    expected.accepted = {{0xc0000209, 0xc0000201}};
    expected.protection_s = 60;
    EXPECT_EQ(read_configuration(nodes, &complaints), expected);
    EXPECT_EQ(complaints.size(), 7u) << testing::PrintToString(complaints);

    // The name of a command's file may contain blanks, which mgmtd allows; the path of a page may not.
    nodes[10].value.text = "/opt/a check";
    EXPECT_FALSE(read_configuration(nodes, &complaints).intercepts.contains(51));
    nodes[9].value.text = "command";
    EXPECT_EQ(read_configuration(nodes, &complaints).intercepts[51].check.argument, "/opt/a check");

    // With bad ports the intercept is ignored, since the default would be all ports.
    for (const char *ports : {"", "80 0", "8080-8000", "65536", "80;443", "-80"}) {
        nodes[6].value.text = ports;
        EXPECT_FALSE(read_configuration(nodes, &complaints).intercepts.contains(51)) << ports;
    }
    for (uint32_t i = 0; i < BYPASSES_MAX + 9; i++)
        nodes.push_back(make_field(NODE_BYPASS_CONFIG "/" + address_text(0x0a010000 + i) + "\\/32", ""));
    EXPECT_EQ(read_configuration(nodes, &complaints).bypasses.size(), BYPASSES_MAX);
    EXPECT_EQ(complaints.size(), COMPLAINTS_MAX);
}

// --- Owners of slots

TEST(SlotOwners, TextIsReadWholeOrNotAtAll) {
    owners_report report;
    ASSERT_TRUE(
        parse_owners("mask 3 0 0 8000 members 10.0.0.2 10.0.0.1 owners 10.0.0.2*7 0.0.0.0*1", &report));
    EXPECT_TRUE(report.by_mask && report.mask == (slot_mask{3, 0, 0, 0x8000}));
    EXPECT_EQ(report.members, (std::vector<uint32_t>{0x0a000001, 0x0a000002}));
    EXPECT_TRUE(report.owners.size() == 8 && report.owners[6] == 0x0a000002 && report.owners[7] == 0);
    EXPECT_EQ(slot_value(report.mask, 5), (slot_mask{2, 0, 0, 0x8000}));
    EXPECT_TRUE(parse_owners("hash members", &report) && report.owners.empty());
    std::string many = "hash members";
    for (int i = 0; i < 33; i++)
        many += " 10.0.0.1";
    for (const std::string &bad :
         strings{"", "hash", "hash members 0.0.0.0", many, "hash members 10.0.0.1 owners 10.0.0.1*255",
                 "hash members 10.0.0.1 owners 10.0.0.1*256 10.0.0.1*1",
                 "hash members 10.0.0.1 owners 10.0.0.1*-1", "mask ff 0 0 0 members 10.0.0.1",
                 "mask 1 0 0 10000 members 10.0.0.1", "mask 1 0 0 members 10.0.0.1"})
        EXPECT_FALSE(parse_owners(bad, &report)) << bad;
}

TEST(SlotOwners, PacketsGoToTheOwnerOrToTheOneWhoHadMostFlows) {
    constexpr uint32_t A = 0x0a000001, B = 0x0a000002, C = 0x0a000003, NOBODY = 0;
    constexpr int64_t START = 100000, TIME = 300;
    struct report {
        int64_t after;
        uint32_t owner;
        std::vector<uint32_t> members = {A, B, C};
    };
    const struct {
        const char *what;
        std::vector<report> reports;
        int64_t asked_after;
        uint32_t self, target;
    } rows[] = {
        {"nothing has changed", {{0, A}}, 5, A, NOBODY},
        {"stale: the owner is another one", {{0, A}}, 5, B, A},
        {"the owner has left", {{0, A}, {5, A, {B, C}}}, 6, B, NOBODY},
        {"moved here", {{0, A}, {10, B}}, 10, B, A},
        {"at the one that had it", {{0, A}, {10, B}}, 10, A, B},
        {"nobody has it for a time", {{0, A}, {10, NOBODY}, {20, B}}, 30, B, A},
        {"moved here long ago", {{0, A}, {10, B}}, 310, B, NOBODY},
        {"just before that", {{0, A}, {10, B}}, 309, B, A},
        {"the former owner has left", {{0, A}, {10, B, {B, C}}}, 20, B, NOBODY},
        {"and comes back", {{0, A}, {10, B, {B, C}}, {50, B}}, 60, B, A},
        {"there and back", {{0, A}, {10, B}, {20, A}}, 30, A, B},
        {"a short stay at B: most flows are A's", {{0, A}, {10, B}, {40, C}}, 50, C, A},
        {"a long stay: A's flows have ended", {{0, A}, {10, B}, {280, C}}, 285, C, B},
        {"A's time is over", {{0, A}, {10, B}, {200, C}}, 320, C, B},
    };
    for (const auto &row : rows) {
        SCOPED_TRACE(row.what);
        owners_table table;
        for (const report &each : row.reports) {
            owners_report now = {true, {}, each.members, {each.owner}};
            EXPECT_TRUE(note_owners(&table, 51, now, START + each.after, TIME) || each.owner == NOBODY);
            EXPECT_FALSE(note_owners(&table, 51, now, START + each.after, TIME)) << "the same again";
        }
        // The file gives the next process the same table.
        const owners_table read = read_owners_file(owners_file_text(table), START + row.asked_after);
        EXPECT_EQ(read, table);
        EXPECT_EQ(slot_targets(read.at(51), row.self, START + row.asked_after, TIME),
                  std::vector<uint32_t>{row.target});
    }

    // A wccpd that has just started changes nothing. When the kind of assignment changes, the history is
    // lost.
    owners_table table;
    note_owners(&table, 0, {false, {}, {A, B}, std::vector<uint32_t>(SLOTS_MAX, A)}, START, TIME);
    note_owners(&table, 0, {false, {}, {A, B}, std::vector<uint32_t>(SLOTS_MAX, B)}, START + 1, TIME);
    EXPECT_FALSE(note_owners(&table, 0, {true, {1, 0, 0, 0}, {}, {}}, START, TIME));
    const std::string text = owners_file_text(table);
    EXPECT_EQ(text, "0 hash members 10.0.0.1 10.0.0.2 slots 256*10.0.0.2,100001;10.0.0.1,0,100001\n");
    EXPECT_TRUE(note_owners(&table, 0, {true, {1, 0, 0, 0}, {A, B}, {A, B}}, START + 2, TIME));
    EXPECT_TRUE(table[0].slots[0].former.empty());
    // Bad lines of a file are skipped, and times in the future are corrected.
    const owners_table odd = read_owners_file("300 hash members slots\n" + text +
                                                  "7 hash members 10.0.0.1 slots 255*10.0.0.1,0\n" +
                                                  text.substr(0, text.size() - 7) + "x\n9 hash members",
                                              START - 5);
    ASSERT_EQ(odd.size(), 1u);
    EXPECT_EQ(odd.at(0).slots[255].former, (std::vector<former_owner>{{A, 0, START - 5}}));
}

// --- A loop with a timer

namespace {
struct ticking_loop {
    lew *wrapper = nullptr;
    loop_context *loop = nullptr;
    loop_event *ticker = nullptr;
    std::function<void()> on_tick = [] {};

    ticking_loop() {
        EXPECT_EQ(lew_init(&wrapper), LC_OK);
        EXPECT_EQ(lew_get_event_context(wrapper, &loop), LC_OK);
        EXPECT_EQ(loop_event_new(loop, tick, this, &ticker), LC_OK);
        EXPECT_EQ(loop_event_set_timer(ticker, 2), LC_OK);
    }
    ~ticking_loop() {
        loop_event_free(&ticker);
        EXPECT_EQ(lew_deinit(&wrapper), LC_OK);
    }
    static void tick(int, short, void *data) {
        auto *self = static_cast<ticking_loop *>(data);
        self->on_tick();
        (void)loop_event_set_timer(self->ticker, 2);
    }
    bool wait_until(const std::function<bool()> &done, int64_t limit_ms = 5000) const {
        const int64_t end = lt_monotonic_ms() + limit_ms;
        while (!done() && lt_monotonic_ms() < end)
            (void)lew_dispatch_once(wrapper, nullptr, nullptr);
        return done();
    }
};

// --- The session

// mgmtd on the loop, and a wccpd that answers for one router of each of the groups 31 to 51.
struct Session : Mgmtd, ticking_loop {
    transport sockets;
    std::string method = "not-set";
    mgmt_link *link = nullptr;
    configured_view view;
    int readings = 0, owners_heard = 0;

    void SetUp() override {
        Mgmtd::SetUp();
        daemon.now_ms = lt_monotonic_ms;
        sockets.next_id = 100; // the fixture has sessions without sockets, among them wccpd's
        session_callbacks callbacks;
        callbacks.configured = [this](const configured_view &read) {
            view = read;
            readings++;
        };
        callbacks.state = [] {
            return std::vector<state_node>{{NODE_PLANE_STATE "/name", bn_type_str, "table"},
                                           {NODE_TUNNEL_STATE "/3/index", bn_type_uint32, "7"},
                                           {NODE_TUNNEL_STATE "/12/index", bn_type_uint32, "8"},
                                           {NODE_PROTECTION_STATE "/group/51/slots", bn_type_uint32, "9"}};
        };
        callbacks.owners = [this](uint8_t group, const std::string &text) {
            owners_heard += group == 51 && text == "hash members 192.0.2.3";
        };
        link = mgmt_link_new(wrapper, callbacks);
    }
    ~Session() override {
        mgmt_link_free(link);
        stop_mgmtd();
    }
    void start_mgmtd() {
        const auto keep = daemon.send;
        std::string error;
        ASSERT_TRUE(transport_listen(&sockets, &daemon, &error)) << error;
        const auto send = daemon.send;
        daemon.send = [=](uint32_t peer_id, uint16_t mtype, tbuffer *frame) {
            (peer_id < 100 ? keep : send)(peer_id, mtype, frame);
        };
        on_tick = [this] {
            std::vector<pollfd> none;
            transport_round(&sockets, &none, 0);
            answer_for_wccpd();
        };
    }
    void stop_mgmtd() {
        transport_close(&sockets);
        on_tick = [] {};
    }
    void answer_for_wccpd() {
        for (size_t i = 0; i < sent.size(); i++) {
            if (std::exchange(sent[i].mtype, 0) != bn_msg_query_request)
                continue;
            const bn_request_msg *msg = sent[i].request;
            std::vector<event_field> fields;
            const auto add = [&fields](const std::string &name, const std::string &text) {
                fields.push_back(make_field(name, text));
            };
            int walks = 0;
            for (const auto &[name, value] : fields_of(msg)) {
                for (int group = 31; group <= 51 && name == NODE_GROUP_STATE; group++)
                    add(name + "/" + std::to_string(group), std::to_string(group));
                if (name == NODE_GROUP_STATE "/51/owners")
                    add(name, "hash members 192.0.2.3");
                if (name.ends_with("/router")) {
                    add(name + "/1/id", "192.0.2.1");
                    add(name + "/1/ipaddr", "192.0.2.2");
                    add(name + "/1/fwd_method", method == "L2" ? "GRE" : method);
                    add(name + "/1/ret_method", method);
                    walks++;
                }
            }
            EXPECT_LE(walks, 8) << "wccpd is kept busy for long";
            answer_query(1, msg->msg_id, last_node(msg)->node_id, 0, fields);
        }
    }
};
} // namespace

TEST_F(Session, FollowsMgmtdThroughItsAbsences) {
    EXPECT_FALSE(wait_until([&] { return mgmt_link_is_open(link); }, 50));
    start_mgmtd();
    ASSERT_TRUE(wait_until([&] { return readings == 1; })) << said;
    EXPECT_TRUE(view.groups.empty());
    EXPECT_EQ(set("+interface=lo +router/1/ipaddr=192.0.2.2 +31/interface=lo +" NODE_INTERCEPT_CONFIG
                  "/51/ports=80 +" NODE_INTERCEPT_CONFIG "/51/to=3128"),
              0u);
    ASSERT_TRUE(wait_until([&] {
        return view.intercepts.size() == 1 && view.groups[51].routers.size() == 1 &&
               view.groups[31].routers.size() == 1;
    })) << said;
    EXPECT_EQ(view.intercepts[51].to, 3128);
    EXPECT_EQ(view.groups[51].local, INADDR_LOOPBACK);
    EXPECT_EQ(view.groups[51].routers[0], (group_router{0xc0000201, 0xc0000202}));

    // tunneld asks for the owners of slots regularly, but only with flow protection.
    ASSERT_TRUE(wait_until([&] { return owners_heard > 0; }));
    const int heard = owners_heard;
    EXPECT_TRUE(wait_until([&] { return owners_heard >= heard + 2; }));
    EXPECT_EQ(set("+" NODE_PROTECTION_TIME "=0"), 0u);
    ASSERT_TRUE(wait_until([&] { return view.protection_s == 0; }));
    owners_heard = 0;
    EXPECT_FALSE(wait_until([&] { return owners_heard > 1; }, 2500));

    // Only real changes are reported. Negotiated methods are kept when they are no longer known.
    method = "L2";
    int before = readings;
    mgmt_link_ask_routers(link);
    ASSERT_TRUE(wait_until([&] { return readings > before; }));
    const group_router known = {0xc0000201, 0xc0000202, travel::gre, travel::l2};
    EXPECT_EQ(view.groups[51].routers[0], known);
    method = "not-set";
    before = readings;
    mgmt_link_ask_routers(link);
    EXPECT_FALSE(wait_until([&] { return readings > before; }, 600));

    // After a refusal, the configuration is requested again.
    int refusals = 0;
    daemon.fits = [&](uint32_t peer_id, size_t) { return peer_id < 100 || refusals++ > 0; };
    EXPECT_EQ(set("+policy_grp=7"), 0u);
    EXPECT_TRUE(wait_until([&] { return view.groups[51].policy_group == 7; }));
    EXPECT_GT(refusals, 0);
    before = readings;

    // Without mgmtd the view stays as it is, and a new mgmtd is found.
    stop_mgmtd();
    ASSERT_TRUE(wait_until([&] { return !mgmt_link_is_open(link); }));
    mgmt_link_group_leaves(link, 51, "without a session");
    EXPECT_EQ(set("-" NODE_INTERCEPT_CONFIG "/51"), 0u);
    EXPECT_EQ(readings, before);
    start_mgmtd();
    ASSERT_TRUE(wait_until([&] { return readings > before; })) << "given anew, for it may have to report";
    EXPECT_TRUE(view.intercepts.empty());
    EXPECT_EQ(view.groups[51].routers, std::vector<group_router>{known});
}

TEST_F(Session, AnswersForItsStateAndReports) {
    start_mgmtd();
    ASSERT_TRUE(wait_until([&] { return readings == 1; })) << said;
    const auto ask = [&](const std::string &name, uint32_t subop, uint32_t flags) {
        clear();
        query(3, name, subop, flags);
        EXPECT_TRUE(wait_until([&] { return code() == 0; })) << name;
        return found();
    };
    EXPECT_EQ(ask(NODE_TUNNEL_STATE "/12/index", bn_query_get, 0), strings{NODE_TUNNEL_STATE "/12/index=8"});
    EXPECT_EQ(ask(NODE_PROTECTION_STATE "/group", bn_query_iterate, bn_qf_subtree),
              (strings{NODE_PROTECTION_STATE "/group/51=51", NODE_PROTECTION_STATE "/group/51/slots=9"}));
    EXPECT_EQ(ask(NODE_TUNNEL_STATE, bn_query_iterate, 0),
              (strings{NODE_TUNNEL_STATE "/3=3", NODE_TUNNEL_STATE "/12=12"}));
    EXPECT_EQ(ask(NODE_TUNNEL_STATE, bn_query_iterate, bn_qf_subtree | bn_qf_leaves_only),
              (strings{NODE_TUNNEL_STATE "/3/index=7", NODE_TUNNEL_STATE "/12/index=8"}));
    for (const char *none : {NODE_TUNNEL_STATE "/4/index", NODE_TUNNEL_STATE})
        EXPECT_EQ(ask(none, bn_query_get, 0), strings());

    // A query for nodes of both daemons.
    const strings all = ask("/qv", bn_query_iterate, bn_qf_subtree | bn_qf_leaves_only);
    EXPECT_EQ(std::count(all.begin(), all.end(), NODE_PLANE_STATE "/name=table"), 1);
    EXPECT_EQ(std::count(all.begin(), all.end(), NODE_TUNNEL_STATE "/3/index=7"), 1);

    // mgmtd reports an orderly end, unless it has started the process and sees the end itself.
    const auto is_reported = [&] {
        return bool(contains(said, "process tunneld: " EVENT_PROCESS_TERMINATE));
    };
    mgmt_link_ends(link);
    EXPECT_TRUE(wait_until(is_reported)) << said;
    said.clear();
    bool asked_whether = false;
    daemon.is_news = [&](const std::string &process) {
        return (asked_whether = process == "tunneld", false);
    };
    mgmt_link_ends(link);
    EXPECT_TRUE(wait_until([&] { return asked_whether; }) && !is_reported()) << said;
}

// --- Health

namespace {
// With a proxy on loopback that answers each request with `answer`, unless that is empty.
struct Health : testing::Test, ticking_loop {
    const int listener = socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    uint16_t port = 0;
    std::string answer, heard;
    std::vector<int> clients;
    int resets = 0;
    health_monitor *monitor = nullptr;
    size_t changes = 0;
    const std::string directory = "/tmp/health/";

    Health() {
        sockaddr_in address = {};
        socklen_t length = sizeof address;
        EXPECT_EQ(bind_to(listener, INADDR_LOOPBACK), 0);
        EXPECT_EQ(listen(listener, 300), 0);
        EXPECT_EQ(getsockname(listener, reinterpret_cast<sockaddr *>(&address), &length), 0);
        port = ntohs(address.sin_port);
        on_tick = [this] { serve(); };
        monitor = health_new(loop, [this](uint8_t group) { changes += group == 51; });
        std::filesystem::create_directory(directory);
    }
    ~Health() override {
        health_free(monitor);
        end_clients();
        close(listener);
        std::filesystem::remove_all(directory);
    }
    void end_clients() {
        for (const int fd : std::exchange(clients, {}))
            close(fd);
    }
    void serve() {
        for (int fd; (fd = accept4(listener, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC)) >= 0;)
            clients.push_back(fd);
        char bytes[4096];
        for (const int fd : clients) {
            const ssize_t count = recv(fd, bytes, sizeof bytes, 0);
            resets += count < 0 && errno == ECONNRESET;
            if (count <= 0)
                continue;
            heard.assign(bytes, static_cast<size_t>(count));
            if (!answer.empty())
                (void)send(fd, answer.data(), answer.size(), MSG_NOSIGNAL);
        }
    }
    const proxy_health &state() const { return health_states(monitor).at(51); }
    void watch(const health_check &check) const {
        intercept rules;
        rules.to = port;
        rules.check = check;
        health_set_checks(monitor, {{51, rules}});
    }
    // Sets a check and returns the state after its first result.
    std::string first_result(const health_check &check) const {
        health_set_checks(monitor, {});
        watch(check);
        EXPECT_TRUE(wait_until([&] { return state().checks == 1; })) << check.argument;
        return state().state == proxy_health::up ? "up" : state().reason;
    }
    std::string result_of_script(const std::string &content) const {
        std::ofstream(directory + "check") << "#!/bin/sh\n" << content << "\n";
        chmod((directory + "check").c_str(), 0755);
        return first_result({check_kind::command, directory + "check", 1, 1, 1});
    }
};
} // namespace

TEST_F(Health, TheFirstResultSettlesAndLaterOnesHaveToAgree) {
    watch({check_kind::tcp, "", 1, 2, 2});
    EXPECT_EQ(state().state, proxy_health::unknown);
    ASSERT_TRUE(wait_until([&] { return changes == 1; }, 500)) << "at once";
    EXPECT_EQ(state().state, proxy_health::up);
    EXPECT_TRUE(wait_until([&] { return resets == 1; })) << "reset, not closed";
    watch({check_kind::tcp, "", 1, 2, 2});
    EXPECT_EQ(state().checks, 1u) << "the same check goes on";

    close(listener);
    ASSERT_TRUE(wait_until([&] { return state().failures == 1; }));
    EXPECT_EQ(state().state, proxy_health::up);
    ASSERT_TRUE(wait_until([&] { return changes == 2; }));
    EXPECT_EQ(state().state, proxy_health::down);
    EXPECT_EQ(state().failures, 2u);
    EXPECT_EQ(state().reason, "connection refused");
    health_set_checks(monitor, {});
    EXPECT_TRUE(health_states(monitor).empty());
}

TEST_F(Health, EachKindOfCheckHasItsReasons) {
    const health_check http = {check_kind::http, "/ok", 1, 1, 1};
    const std::pair<const char *, const char *> answers[] = {
        {"HTTP/1.1 204 No Content\r\n\r\n", "up"},
        {"HTTP/1.0 399 x\r\n", "up"},
        {"HTTP/1.1 503 Service Unavailable\r\n\r\n", "status 503"},
        {"SSH-2.0-x\r\n", "no HTTP answer"},
        {"", "no answer in 1000 ms"},
    };
    for (const auto &[given, result] : answers) {
        answer = given;
        EXPECT_EQ(first_result(http), result) << given;
        end_clients();
    }
    EXPECT_TRUE(heard.starts_with("GET /ok HTTP/1.0\r\nHost: 127.0.0.1:")) << heard;
    answer = std::string(1 << 20, 'x');
    EXPECT_EQ(first_result(http), "no HTTP answer");

    setenv("SECRET", "1", 1);
    EXPECT_EQ(result_of_script("test -z \"$SECRET\" && test ! -e /proc/self/fd/4"), "up");
    EXPECT_EQ(result_of_script("exit 3"), "exit status 3");
    EXPECT_EQ(result_of_script("kill -9 $$"), "ended by SIGKILL");
    EXPECT_EQ(first_result({check_kind::command, directory + "none", 1, 1, 1}),
              directory + "none" + ": No such file or directory");
    // A command's children are killed when it ends, and when its time is up.
    for (const auto &[after, result] : {std::pair{"", "up"}, {"; wait", "no answer in 1000 ms"}}) {
        EXPECT_EQ(result_of_script("sleep 100 & echo $! >" + directory + "pid" + after), result);
        const int pid = atoi(text_of_file(directory + "pid").c_str());
        ASSERT_GT(pid, 0);
        const auto gone = [pid] {
            const std::string stat = text_of_file("/proc/" + std::to_string(pid) + "/stat");
            return stat.empty() || contains(stat, ") Z ");
        };
        EXPECT_TRUE(wait_until(gone)) << pid;
    }
}

// --- Courses and flows

TEST(Course, WeightsLimitsAndDrainsFollowTheFacts) {
    using decisions = std::vector<std::pair<std::string, int>>; // and for how many seconds
    course one;
    int64_t at_s = 0;
    const auto look = [&](const std::vector<course_facts> &seconds) {
        decisions out;
        for (course_facts now : seconds) {
            now.now_ms = at_s++ * 1000;
            const course_decision decided = follow_course(&one, now);
            const std::string text = std::to_string(decided.weight_percent) +
                                     (decided.overloaded ? " overloaded" : "") +
                                     (decided.empty ? " empty" : "");
            if (out.empty() || out.back().first != text)
                out.push_back({text, 0});
            out.back().second++;
        }
        return out;
    };
    const auto facts = [](bool active, uint32_t flows = 0, bool draining = false, bool alone = false) {
        return course_facts{0, draining, false, active, alone, true, flows, 40, 100};
    };
    const course_facts idle = facts(false), works = facts(true), alone = facts(true, 0, true, true);
    course_facts proxy_down = works, without_start = works;
    proxy_down.proxy_up = false;
    without_start.slow_start_s = 0;
    // The first step lasts until the group is active.
    EXPECT_EQ(look({idle}), (decisions{{"20", 1}}));
    EXPECT_EQ(look({42, works}), (decisions{{"20", 10}, {"40", 10}, {"60", 10}, {"80", 10}, {"100", 2}}));
    // There is no slow start for a wccpd that is restarted in time, but there is one after the proxy was
    // down, unless none is configured.
    EXPECT_EQ(look({29, idle}), (decisions{{"100", 29}}));
    EXPECT_EQ(look({works, proxy_down, without_start, works}),
              (decisions{{"100", 1}, {"20", 1}, {"100", 2}}));
    // Overload begins above the limit and ends below 90 % of it.
    EXPECT_EQ(look({facts(true, 100), facts(true, 101), facts(true, 90), facts(true, 89)}),
              (decisions{{"100", 1}, {"100 overloaded", 2}, {"100", 1}}));
    // Empty: two counts of 0 after the table has changed, or after 20 s if that is not visible.
    EXPECT_EQ(
        look({facts(false, 1, true), facts(false, 0, true), facts(false, 0, true), facts(false, 1, true)}),
        (decisions{{"20", 2}, {"20 empty", 1}, {"20", 1}}));
    (void)look({works});
    EXPECT_EQ(look({2, alone}), (decisions{{"20", 1}, {"20 empty", 1}}));
    (void)look({works});
    EXPECT_EQ(look({22, facts(true, 0, true)}), (decisions{{"20", 21}, {"20 empty", 1}}));
    // A group that was active before tunneld started has no slow start.
    one = {};
    EXPECT_EQ(look({works}), (decisions{{"100", 1}}));
}

TEST(Flows, AreCountedOnceForEachGroup) {
    // If the proxy keeps the client's address, its sockets on both sides are transparent.
    const std::vector<flow_ends> made = {
        {0x0a020002, 0x0a010080, 80, 40000}, {0x0a020002, 0x0a010080, 80, 40001},
        {0x0a010080, 0x0a020002, 50000, 80}, {0x0a020002, 0x0a010081, 8080, 40000},
        {0x0a010082, 0x0a020002, 50000, 80},
    };
    std::map<uint8_t, intercept> intercepts = {{3, {}}};
    intercepts[1].ports = {{80, 80}, {8000, 9000}};
    intercepts[2].ports = {{80, 80}};
    intercepts[4].protocol = 17;
    EXPECT_EQ(count_flows(made, intercepts), (std::map<uint8_t, uint32_t>{{1, 3}, {2, 2}, {3, 4}}));
}
