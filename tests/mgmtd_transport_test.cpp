// The provider's side of sessions, byte by byte: clients here are raw sockets that share no code with it.
#include <deque>
#include <fstream>

#include <grp.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/wait.h>

#include "peers/mgmtd/transport.h"
#include "runtime/ttime.h"
#include "tests/support/gcl_provider.h" // wire, be, padded, frame_bytes, number_at
#include "tests/support/texts.h"

namespace {
const std::string DIRECTORY = "/tmp/gcl-socks", SOCKET = DIRECTORY + "/uds-provider-mgmtd";

struct raw_client {
    int fd = -1;
    wire got;
    bool closed = false;

    raw_client() {
        fd = socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        strcpy(address.sun_path, SOCKET.c_str());
        const auto length = static_cast<socklen_t>(strlen(address.sun_path) + 3);
        EXPECT_EQ(connect(fd, reinterpret_cast<sockaddr *>(&address), length), 0) << strerror(errno);
    }
    ~raw_client() { close(fd); }
    raw_client(const raw_client &) = delete;
    raw_client &operator=(const raw_client &) = delete;
    void put(const wire &bytes) const {
        EXPECT_EQ(send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL), static_cast<ssize_t>(bytes.size()));
    }
    void read_all() {
        char bytes[65536];
        ssize_t now;
        while ((now = recv(fd, bytes, sizeof bytes, 0)) > 0)
            got.append(bytes, static_cast<size_t>(now));
        closed = closed || now == 0 || errno == ECONNRESET;
    }
    wire take() {
        if (got.size() < 32 || got.size() < number_at(got, 12))
            return {};
        const wire frame = got.substr(0, number_at(got, 12));
        got.erase(0, frame.size());
        return frame;
    }
};

wire greeting_response(const wire &name, uint32_t uid = geteuid()) {
    return frame_bytes(1, 2,
                       be(2, 2) + be(0, 4) + be(0, 4) + be(0, 4) + padded(name, 32) + be(uid, 4) +
                           be(getegid(), 4) + padded("root", 32) + be(0, 4),
                       2000001);
}
wire open_service(uint32_t service, uint32_t protocol = 2) {
    return frame_bytes(1, 3, be(5, 4) + be(6, 4) + be(protocol, 4) + be(service, 4) + padded("", 32),
                       2000002);
}
wire text_on_wire(const wire &text) {
    return be(text.size(), 4) + text;
}
// A query with one node, told by its parts.
wire query_frame(const std::vector<wire> &parts, uint32_t subop, uint32_t flags) {
    wire body = be(2, 2) + be(1, 2) + be(0, 4) + be(9, 4) + be(10, 4) + text_on_wire("") + be(1, 4) +
                be(1000, 4) + be(1, 1) + be(parts.size(), 4);
    for (const wire &part : parts)
        body += text_on_wire(part);
    body += be(0, 4) + be(subop, 4) + be(flags, 4) + be(0, 4) + text_on_wire("") + be(0, 4);
    return frame_bytes(2, 1, body, 2000003);
}

wire query_for_mode() {
    return query_frame({"qv", "tunneld", "system", "config", "mode"}, 1, 0);
}

struct Transport : testing::Test {
    server daemon;
    transport sockets;
    strings lines;
    int64_t now = 0;

    void SetUp() override {
        daemon.now_ms = [this] { return now; };
        daemon.say = [this](const std::string &line) { lines.push_back(line); };
        tree_refresh(&daemon.tree);
        listen();
    }
    void listen() {
        std::string error;
        ASSERT_TRUE(transport_listen(&sockets, &daemon, &error)) << error;
    }
    void TearDown() override { transport_close(&sockets); }
    void round() {
        std::vector<pollfd> none;
        transport_round(&sockets, &none, 5);
    }
    // Until nothing happens any more.
    void pump(raw_client *client = nullptr) {
        for (int quiet = 0; quiet < 3; quiet++) {
            size_t before = client ? client->got.size() : 0;
            round();
            if (client)
                client->read_all();
            if (client && client->got.size() != before)
                quiet = 0;
        }
    }
    void open(raw_client *client, const wire &name) {
        pump(client);
        client->put(greeting_response(name) + open_service(2));
        pump(client);
        EXPECT_TRUE(!client->take().empty() && !client->take().empty());
        EXPECT_EQ(lines.back(), "session of " + name + " open");
    }
    wire ask_for_mode(raw_client *client) {
        client->put(query_for_mode());
        pump(client);
        return client->take();
    }
};
} // namespace

TEST_F(Transport, OpeningByTheByte) {
    raw_client client;
    pump(&client);
    const wire name = "mgmtd-" + std::to_string(getpid());
    const wire greeting = client.take();
    ASSERT_EQ(greeting.size(), 32u + 86u);
    EXPECT_EQ(greeting.substr(0, 32), wire("GCLF3210") + be(1, 4) + be(118, 4) + be(32, 2) + be(0, 2) +
                                          be(1000001, 4) + be(1, 2) + be(1, 2) + be(86, 4));
    EXPECT_EQ(greeting.substr(32, 2), be(2, 2));
    EXPECT_EQ(greeting.substr(42, 32), padded(name, 32));
    EXPECT_EQ(number_at(greeting, 74), geteuid());

    client.put(greeting_response("mgmtctl-5"));
    client.put(open_service(5));
    pump(&client);
    const wire refusal = client.take();
    EXPECT_EQ(refusal, frame_bytes(1, 4,
                                   be(1, 4) + be(6, 4) + be(5, 4) + padded("mgmtd", 32) + be(1, 4) +
                                       be(31, 4) + wire("Bad service id in service open.") + wire(1, '\0'),
                                   1000002));
    client.put(open_service(2));
    pump(&client);
    EXPECT_EQ(number_at(client.take(), 32 + 44), 0u) << "granted";

    // In two pieces, and two at once.
    const wire query = query_for_mode();
    client.put(query.substr(0, 20));
    pump();
    client.put(query.substr(20));
    client.put(query + query);
    pump(&client);
    const wire response = client.take();
    const wire body = be(2, 2) + be(2, 2) + be(response.size(), 4) + be(1, 4) + be(10, 4) + be(9, 4) +
                      be(0, 4) + text_on_wire("") + be(1, 4) + be(1000, 4) + be(1, 1) + be(5, 4) +
                      text_on_wire("qv") + text_on_wire("tunneld") + text_on_wire("system") +
                      text_on_wire("config") + text_on_wire("mode") + be(1, 4) + be(4, 4) + be(1, 4) +
                      be(101, 4) + be(0, 4) + text_on_wire("router") + be(1, 4);
    EXPECT_EQ(response, frame_bytes(2, 2, body, 1000004));
    EXPECT_TRUE(!client.take().empty() && !client.take().empty() && client.take().empty());
}

TEST_F(Transport, WhatCantBeTrueEndsItsSessionAndNoOther) {
    raw_client bystander;
    open(&bystander, "wccpd-1");
    const wire sound = query_frame({"a"}, 1, 0);
    const auto with_total = [&](uint32_t total) {
        return sound.substr(0, 12) + be(total, 4) + sound.substr(16);
    };
    const auto check = [&](const char *what, bool opened, const wire &bytes) {
        raw_client client;
        if (opened)
            open(&client, "mgmtctl-2");
        pump(&client);
        client.put(bytes);
        pump(&client);
        EXPECT_TRUE(client.closed) << what;
        EXPECT_EQ(sockets.sessions.size(), 1u) << what;
    };
    check("a length of 31", true, with_total(31));
    check("a length of 4 GiB", true, with_total(UINT32_MAX));
    check("another ident", true, "X" + sound.substr(1));
    check("another version", true, sound.substr(0, 8) + be(2, 4) + sound.substr(12));
    check("a node count without nodes", true,
          frame_bytes(2, 1,
                      be(2, 2) + be(1, 2) + be(0, 4) + be(9, 4) + be(10, 4) + be(0, 4) + be(UINT32_MAX, 4)));
    check("an unknown protocol", true, frame_bytes(9, 1, "x"));
    check("a query before the service is open", false, sound);
    check("a name of no characters", false, greeting_response(""));
    check("somebody else's user", false, greeting_response("mgmtctl-1", geteuid() + 1));
    check("a service before the greeting", false, open_service(2));
    check("a large frame before the service is open", false, with_total(OPENING_FRAME_MAX + 1));
    EXPECT_FALSE(ask_for_mode(&bystander).empty());
}

TEST_F(Transport, AClientThatDoesNotReadLosesItsSessionOnly) {
    for (int group = 0; group < 256; group++) {
        const node_name name = {{"qv", "wccpd", "wccp", "srv_grp", "config", std::to_string(group)}};
        daemon.tree.set[name] = std::to_string(group);
    }
    tree_refresh(&daemon.tree);
    raw_client deaf, bystander;
    open(&deaf, "wccpd-1");
    open(&bystander, "wccpd-2");
    const wire all = query_frame({"qv", "wccpd"}, 2, 0x1000);
    const session &client = sockets.sessions.begin()->second;
    size_t before = 0, grown = 0;
    do { // until a refusal comes instead of the answer
        before = client.queued_bytes;
        (void)send(deaf.fd, all.data(), all.size(), MSG_NOSIGNAL);
        round();
        grown = client.queued_bytes - before;
    } while (grown > 1000);
    EXPECT_GT(before, QUEUE_MAX_BYTES * 9 / 10);
    EXPECT_TRUE(grown > 0 && before + grown <= QUEUE_MAX_BYTES);
    EXPECT_TRUE(contains(client.queue.back(), "Too much waits for you to read it"));
    tbuffer *event = nullptr; // which nobody waits for
    const auto left = static_cast<uint32_t>(QUEUE_MAX_BYTES - before);
    ASSERT_TRUE(tb_new_size(&event, left) == LC_OK && tb_set_length(event, left) == LC_OK);
    daemon.send(sockets.sessions.begin()->first, bn_msg_event, event);
    pump();
    EXPECT_EQ(sockets.sessions.size(), 1u);
    EXPECT_FALSE(ask_for_mode(&bystander).empty());
}

TEST_F(Transport, ClientsThatCrowdLeaveTheDaemonsTheirPlaces) {
    std::deque<raw_client> clients, silent, daemons;
    for (size_t i = 0; i < CLIENT_SESSIONS_MAX; i++)
        open(&clients.emplace_back(), "mgmtctl-1");
    raw_client late;
    pump(&late);
    late.put(greeting_response("mgmtctl-2"));
    pump(&late);
    EXPECT_TRUE(late.closed);
    while (sockets.sessions.size() < SESSIONS_MAX) {
        silent.emplace_back();
        pump();
    }
    for (int i = 0; i < 2; i++)
        open(&daemons.emplace_back(), "wccpd-3");
    EXPECT_FALSE(ask_for_mode(&clients.front()).empty());
    now += OPENING_MAX_MS;
    pump();
    EXPECT_EQ(sockets.sessions.size(), CLIENT_SESSIONS_MAX + 2) << "those that never greeted are gone";

    // Without descriptors a connection waits, and costs no more than a look each second.
    raw_client waiting;
    rlimit limit;
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &limit), 0);
    const rlimit few = {150, limit.rlim_max}; // poll wants the limit above the number of its descriptors
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &few), 0);
    std::vector<int> fillers;
    for (int fd; (fd = dup(STDERR_FILENO)) >= 0;)
        fillers.push_back(fd);
    round();
    const int64_t began = lt_monotonic_ms();
    round();
    EXPECT_GE(lt_monotonic_ms() - began, 4) << "the round waits";
    for (const int fd : fillers)
        close(fd);
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &limit), 0);
    now += ACCEPT_PAUSE_MS;
    open(&waiting, "wccpd-4");
}

// Of the group, by the first of their groups or by another one: they have few places, and a daemon's name is
// not for them.
TEST_F(Transport, MembersOfTheGroupMayLook) {
    const gid_t group = 1; // daemon
    const auto as_user = [](gid_t first, gid_t other, const std::function<void()> &connects) {
        const bool changed = setgroups(1, &other) == 0 && setegid(first) == 0 && seteuid(65534) == 0;
        if (changed)
            connects();
        EXPECT_TRUE(seteuid(0) == 0 && setegid(0) == 0);
        return changed;
    };
    if (getegid() != 0 || !as_user(65534, 65534, [] {}))
        GTEST_SKIP() << "only one user is known here";
    transport_close(&sockets);
    sockets.place.viewers_group = "daemon";
    listen();
    struct stat about;
    ASSERT_EQ(stat(SOCKET.c_str(), &about), 0);
    EXPECT_EQ(about.st_mode & 07777, 0660u);
    EXPECT_EQ(about.st_gid, group);

    std::deque<raw_client> viewers;
    const auto open_as = [&](gid_t first, gid_t other) -> raw_client & {
        as_user(first, other, [&] { viewers.emplace_back(); });
        pump(&viewers.back());
        return viewers.back();
    };
    EXPECT_EQ(number_at(open_as(65534, group).got, 78), group) << "a client compares it with the file's";
    viewers.back().put(greeting_response("mgmtctl-1", 65534) + open_service(2));
    pump();
    EXPECT_FALSE(daemon.peers.begin()->second.owner.may_change);
    open_as(group, 65534).put(greeting_response("wccpd-1", 65534));
    pump(&viewers.back());
    EXPECT_TRUE(viewers.back().closed);
    chmod(SOCKET.c_str(), 0666);
    EXPECT_TRUE(open_as(65534, 65534).closed);
    EXPECT_EQ(lines.back(), "session refused: user 65534");
    for (size_t i = 1; i <= VIEWER_SESSIONS_MAX; i++)
        EXPECT_EQ(open_as(group, 65534).closed, i == VIEWER_SESSIONS_MAX);
    raw_client ours;
    open(&ours, "mgmtctl-2");
    EXPECT_TRUE(daemon.peers.rbegin()->second.owner.may_change);
}

TEST_F(Transport, TheSocketIsOursAlone) {
    struct stat about;
    ASSERT_EQ(stat(SOCKET.c_str(), &about), 0);
    EXPECT_EQ(about.st_uid, geteuid());
    EXPECT_EQ(mode_of(SOCKET), 0600);
    EXPECT_EQ(mode_of(DIRECTORY), 0755);

    const auto attempt = [&] {
        server other;
        other.say = daemon.say;
        transport second;
        std::string error;
        const bool listens = transport_listen(&second, &other, &error);
        transport_close(&second);
        return listens ? "listens" : error;
    };
    EXPECT_EQ(attempt(), "another mgmtd runs");
    // Without the directory, or with somebody else's in its place.
    for (const char *command :
         {"rm -r /tmp/gcl-socks", "mv /tmp/gcl-socks /tmp/away && mkdir /tmp/gcl-socks"}) {
        ASSERT_EQ(system(command), 0);
        EXPECT_EQ(attempt(), "another mgmtd runs");
        now += LISTENER_CHECK_MS;
        pump();
        EXPECT_TRUE(contains(joined(lines, "\n"), SOCKET + " was removed and has been made again"))
            << command;
        lines.clear();
        raw_client client;
        open(&client, "wccpd-1");
    }
    transport_close(&sockets);
    EXPECT_EQ(mode_of(SOCKET), -1) << "removed at the end";
    // What can't be removed, and what one that was killed has left.
    ASSERT_EQ(system(("mkdir -p " + SOCKET + "/kept").c_str()), 0);
    EXPECT_EQ(attempt(), "listens");
    std::ofstream(SOCKET) << "";
    chmod(DIRECTORY.c_str(), 0777);
    EXPECT_EQ(attempt(), "listens");
    EXPECT_EQ(mode_of(DIRECTORY), 0755) << "what others could write to is closed";
    for (const char *aside : {"/tmp/gcl-socks.moved-1", "/tmp/gcl-socks.moved-2"})
        if (chown(DIRECTORY.c_str(), 1, 1) == 0) { // not where only one user is known
            EXPECT_EQ(attempt(), "listens");
            EXPECT_EQ(lines.back(), wire("/tmp/gcl-socks belonged to user 1, moved to ") + aside);
            ASSERT_EQ(stat(aside, &about), 0);
            EXPECT_EQ(about.st_uid, 1u);
        }
    ASSERT_EQ(system("mv /tmp/gcl-socks /tmp/elsewhere && ln -s /tmp/elsewhere /tmp/gcl-socks"), 0);
    EXPECT_EQ(attempt(), "/tmp/gcl-socks: Not a directory");
    unlink(DIRECTORY.c_str());
}

TEST_F(Transport, WhatKilledClientsLeftIsRemovedAndNothingElse) {
    const pid_t gone = fork();
    if (gone == 0)
        _exit(0);
    waitpid(gone, nullptr, 0);
    const wire clients = DIRECTORY + "/uds-client-", dead = clients + "wccpd-" + std::to_string(gone),
               alive = clients + "wccpd-" + std::to_string(getpid()),
               other = clients + "wccpd-x" + std::to_string(gone),
               file = clients + "file-" + std::to_string(gone);
    for (const wire &name : {dead, alive, other}) {
        const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        strcpy(address.sun_path, name.c_str());
        EXPECT_EQ(bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof address), 0);
        close(fd);
    }
    std::ofstream(file) << "";
    raw_client client;
    pump(&client);
    EXPECT_EQ(mode_of(dead), -1);
    for (const wire &name : {alive, other, file, SOCKET})
        EXPECT_NE(mode_of(name), -1) << name;
}
