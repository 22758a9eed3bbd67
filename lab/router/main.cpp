// wccp_router: one or more simulated routers, each on an address of its own, and small programs for the lab
// as subcommands.
//
// This file has the sockets, the clock and the command line; the router itself is in router.cpp. A single
// thread polls a socket for each router's address, another for its multicast address, the control socket,
// standard input, a signal descriptor, and the descriptors of the data path (forward.cpp) if there is one.
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <iterator>
#include <sstream>

#include <CLI/CLI.hpp>

#include "lab/router/forward.h"
#include "lab/router/router.h"
#include "lab/router/tools.h"
#include "lab/router/web.h"
#include "runtime/ttime.h"
#include "runtime/version.h"

using namespace lab;

namespace {

constexpr uint16_t PORT = 2048;
constexpr int TICK_MS = 200;

struct station {
    router machine;
    int unicast = -1;
    int multicast = -1;
};
struct lab_process {
    std::vector<station> stations;
    forwarder path; // in use only with a single router
    bool as_json = false;
    double began = 0;
};

double seconds_now() {
    return static_cast<double>(lt_monotonic_ns()) / 1e9;
}

sockaddr_in make_sockaddr(address where) {
    sockaddr_in name = {};
    name.sin_family = AF_INET;
    name.sin_port = htons(PORT);
    name.sin_addr.s_addr = htonl(where);
    return name;
}

int open_socket(address where) {
    const int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    const int shared = IN_MULTICAST(where); // a unicast address has one program
    const sockaddr_in name = make_sockaddr(where);
    if (fd < 0 || setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &shared, sizeof shared) != 0 ||
        bind(fd, reinterpret_cast<const sockaddr *>(&name), sizeof name) != 0) {
        fprintf(stderr, "wccp_router: %s: %s\n", text_of(where).c_str(), strerror(errno));
        exit(1);
    }
    // All groups of an appliance send Here-I-Am at the same time.
    const int buffer = 4 << 20;
    if (setsockopt(fd, SOL_SOCKET, SO_RCVBUFFORCE, &buffer, sizeof buffer) != 0)
        (void)setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &buffer, sizeof buffer);
    return fd;
}

void open_station(station *one) {
    const router_options &options = one->machine.options;
    one->unicast = open_socket(options.self);
    if (options.group == 0)
        return;
    one->multicast = open_socket(options.group);
    const in_addr self = {htonl(options.self)};
    // Messages to the group are received on the other socket and sent from this router's own address.
    const ip_mreq membership = {{htonl(options.group)}, self};
    const uint8_t ttl = 5, off = 0;
    if (setsockopt(one->multicast, IPPROTO_IP, IP_ADD_MEMBERSHIP, &membership, sizeof membership) != 0 ||
        setsockopt(one->unicast, IPPROTO_IP, IP_MULTICAST_IF, &self, sizeof self) != 0 ||
        setsockopt(one->unicast, IPPROTO_IP, IP_MULTICAST_TTL, &ttl, sizeof ttl) != 0 ||
        setsockopt(one->unicast, IPPROTO_IP, IP_MULTICAST_LOOP, &off, sizeof off) != 0) {
        fprintf(stderr, "wccp_router: multicast on %s: %s\n", text_of(options.self).c_str(), strerror(errno));
        exit(1);
    }
}

void send_output(const lab_process &all, station *one, const output &out) {
    for (const datagram &packet : out.send) {
        const sockaddr_in name = make_sockaddr(packet.to);
        if (sendto(one->unicast, packet.data.data(), packet.data.size(), 0,
                   reinterpret_cast<const sockaddr *>(&name), sizeof name) < 0)
            count_event(&one->machine, "tx_failures");
    }
    for (const json &event : out.events)
        puts((all.as_json ? event.dump() : event_line(event)).c_str());
    if (!out.events.empty())
        fflush(stdout);
}

void receive_from(const lab_process &all, station *one, int fd, address to) {
    for (;;) {
        uint8_t data[65536];
        sockaddr_in name = {};
        socklen_t length = sizeof name;
        const ssize_t got = recvfrom(fd, data, sizeof data, 0, reinterpret_cast<sockaddr *>(&name), &length);
        // The sockets don't block: everything that has arrived is read.
        if (got < 0)
            return;
        output out;
        router_receive(&one->machine, seconds_now() - all.began, ntohl(name.sin_addr.s_addr), to,
                       bytes(data, data + got), &out);
        send_output(all, one, out);
    }
}

std::string run_command(lab_process *all, const std::string &line) {
    std::istringstream in(line);
    std::vector<std::string> words{std::istream_iterator<std::string>(in), {}};
    std::optional<address> only;
    if (!words.empty() && words[0].starts_with('@')) {
        only = address_of(words[0].substr(1));
        words.erase(words.begin());
        if (!only)
            return "error: not an address\n";
    }
    std::string answers;
    for (station &one : all->stations) {
        if (only && one.machine.options.self != *only)
            continue;
        output out;
        const std::string answer = router_command(&one.machine, seconds_now() - all->began, words, &out);
        send_output(*all, &one, out);
        answers += answer + "\n";
        // The other routers would give the same error.
        if (answer.starts_with("error:"))
            return answer + "\n";
    }
    return answers.empty() ? "error: no such router\n" : answers;
}

void serve_control(lab_process *all, int listener) {
    const int fd = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0)
        return;
    // The routers wait while a command is served; a client that hangs may not stop them for long.
    const timeval limit = {1, 0};
    setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit);
    std::string line;
    char part[512];
    while (line.find('\n') == std::string::npos && line.size() < 65536) {
        const ssize_t got = read(fd, part, sizeof part);
        if (got <= 0)
            break;
        line.append(part, static_cast<size_t>(got));
    }
    const std::string answer = run_command(all, line);
    for (size_t sent = 0; sent < answer.size();) {
        const ssize_t went = send(fd, answer.data() + sent, answer.size() - sent, MSG_NOSIGNAL);
        if (went <= 0)
            break;
        sent += static_cast<size_t>(went);
    }
    close(fd);
}

int open_signals() {
    sigset_t set;
    sigemptyset(&set);
    for (const int number : {SIGTERM, SIGINT, SIGHUP, SIGUSR1})
        sigaddset(&set, number);
    sigprocmask(SIG_BLOCK, &set, nullptr);
    return signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK);
}

void run_loop(lab_process *all, int control) {
    const int signals = open_signals();
    std::string typed;
    std::vector<pollfd> fds = {{signals, POLLIN, 0}, {control, POLLIN, 0}, {STDIN_FILENO, POLLIN, 0}};
    for (const station &one : all->stations) {
        fds.push_back({one.unicast, POLLIN, 0});
        fds.push_back({one.multicast, POLLIN, 0});
    }
    const size_t path_at = fds.size();
    if (!all->path.from.empty())
        for (const int fd : forwarder_descriptors(all->path))
            fds.push_back({fd, POLLIN, 0});
    for (;;) {
        // Signals are blocked, so that poll isn't interrupted and always sets `revents`. Descriptors of -1
        // are ignored.
        (void)poll(fds.data(), fds.size(), TICK_MS);
        if (fds[0].revents) {
            signalfd_siginfo info;
            if (read(signals, &info, sizeof info) == sizeof info) {
                if (info.ssi_signo != SIGUSR1)
                    return;
                fputs(run_command(all, "show").c_str(), stdout);
                fflush(stdout);
            }
        }
        if (fds[1].revents)
            serve_control(all, control);
        if (fds[2].revents) {
            char part[512];
            const ssize_t got = read(STDIN_FILENO, part, sizeof part);
            if (got <= 0)
                // At the end of standard input the router continues without it.
                fds[2].fd = -1;
            else
                typed.append(part, static_cast<size_t>(got));
            for (size_t end; (end = typed.find('\n')) != std::string::npos; typed.erase(0, end + 1)) {
                if (typed.starts_with("quit"))
                    return;
                fputs(run_command(all, typed.substr(0, end)).c_str(), stdout);
                fflush(stdout);
            }
        }
        for (size_t i = 0; i < all->stations.size(); i++) {
            station &one = all->stations[i];
            if (fds[3 + 2 * i].revents)
                receive_from(*all, &one, one.unicast, one.machine.options.self);
            if (fds[4 + 2 * i].revents)
                receive_from(*all, &one, one.multicast, one.machine.options.group);
            output out;
            // In each round, at least every TICK_MS.
            router_tick(&one.machine, seconds_now() - all->began, &out);
            send_output(*all, &one, out);
        }
        for (size_t i = path_at; i < fds.size(); i++)
            if (fds[i].revents)
                forward_packets(&all->path, fds[i].fd);
    }
}

// Opens the data path, for a single router.
void open_path(lab_process *all, const std::vector<std::string> &redirect) {
    for (const std::string &text : redirect) {
        redirecting one;
        if (!read_redirecting(text, &one)) {
            fprintf(stderr, "wccp_router: --redirect %s: not INTERFACE=SERVICE[,SERVICE]\n", text.c_str());
            exit(2);
        }
        all->path.from.push_back(one);
    }
    if (redirect.empty())
        return;
    if (all->stations.size() != 1) {
        fputs("wccp_router: --redirect needs exactly one --router\n", stderr);
        exit(2);
    }
    // The vector doesn't grow any more: the pointer stays valid.
    all->path.self = &all->stations.front().machine;
    all->path.self->forwards = true;
    const std::string wrong = open_forwarder(&all->path);
    if (!wrong.empty()) {
        fprintf(stderr, "wccp_router: %s\n", wrong.c_str());
        exit(1);
    }
}

// "gre,l2" and "hash,mask" as bits.
uint32_t bits_of(const std::vector<std::string> &words, const char *first, const char *second) {
    uint32_t bits = 0;
    for (const std::string &word : words)
        bits |= word == first ? 1U : word == second ? 2U : 0U;
    return bits;
}

} // namespace

// NOLINTNEXTLINE(bugprone-exception-escape): this program may end when memory is exhausted
int main(int argc, char **argv) {
    CLI::App app("simulated WCCP version 2 routers");
    app.set_version_flag("--version", std::string("wccp_router ") + wccp_version());
    app.footer(std::string("Commands on standard input or the control socket:\n") + ROUTER_COMMANDS);
    app.require_subcommand(0, 1);
    std::vector<std::string> routers, redirect, forward = {"gre", "l2"}, giveback = {"gre", "l2"},
                                                assign = {"hash", "mask"};
    std::vector<uint16_t> services;
    std::string format = "ios", multicast, reply = "group", join = "echo", control_path, gre_source;
    router_options options;
    lab_process all;
    app.add_option("--router", routers, "address of a router; can be repeated")->delimiter(',');
    app.add_option("--format", format, "of the views")->check(CLI::IsMember({"ios", "nexus"}));
    app.add_option("--forward", forward, "methods offered")
        ->delimiter(',')
        ->check(CLI::IsMember({"gre", "l2"}));
    app.add_option("--return", giveback, "methods offered")
        ->delimiter(',')
        ->check(CLI::IsMember({"gre", "l2"}));
    app.add_option("--assign", assign, "methods offered")
        ->delimiter(',')
        ->check(CLI::IsMember({"hash", "mask"}));
    app.add_option("--password", options.password, "sign with MD5");
    app.add_option("--service", services, "service ids served (default: any)")
        ->delimiter(',')
        ->check(CLI::Range(0, 255));
    app.add_option("--group", multicast, "multicast address to join");
    app.add_option("--reply", reply, "destination of answers to multicast messages")
        ->check(CLI::IsMember({"group", "unicast"}));
    app.add_option(
           "--join", join,
           "when an appliance enters the view: at its first Here-I-Am, or once it has echoed a receive id")
        ->check(CLI::IsMember({"first", "echo"}));
    app.add_option("--query-after", options.query_after, "seconds without a message before a Removal Query");
    app.add_option("--drop-after", options.drop_after,
                   "seconds without a message before an appliance is dropped");
    app.add_option("--redirect", redirect,
                   "INTERFACE=SERVICE[,SERVICE]: redirect packets from this interface; can be repeated");
    app.add_option("--gre", options.gre_format,
                   "format of redirected packets: with redirect header, without it, type 0x0800")
        ->check(CLI::IsMember(std::vector<std::string>(std::begin(gre_formats), std::end(gre_formats))));
    app.add_option("--gre-source", gre_source,
                   "source address of redirected packets (default: the router's)");
    app.add_option("--control", control_path, "unix socket for commands");
    app.add_flag("--json", all.as_json, "one JSON object per message");

    std::string log_file, socket_path;
    std::vector<std::string> command;
    CLI::App *logd = app.add_subcommand("logd", "run a log daemon on /dev/log");
    logd->add_option("FILE", log_file, "file to append to; - for standard output")->required();
    CLI::App *ctl = app.add_subcommand("ctl", "send a command to a control socket");
    ctl->add_option("SOCKET", socket_path)->required();
    ctl->add_option("COMMAND", command)->required();
    web_options web;
    fetch_options fetch;
    CLI::App *server =
        app.add_subcommand("web", "run a web server: GET /N answers with N bytes, POST takes a body");
    server->add_option("--port", web.ports, "can be repeated")->required();
    CLI::App *client =
        app.add_subcommand("fetch", "fetch pages, and print the results and who answered as JSON");
    add_fetch_options(client, &fetch);
    CLI11_PARSE(app, argc, argv);

    if (*server)
        return run_web(web);
    if (*client)
        return run_fetch(fetch);
    if (*logd)
        return run_logd(log_file);
    if (*ctl) {
        std::string line;
        for (const std::string &word : command)
            line += (line.empty() ? "" : " ") + word;
        return run_ctl(socket_path, line);
    }
    options.nexus = format == "nexus";
    options.offer = {bits_of(forward, "gre", "l2"), bits_of(assign, "hash", "mask"),
                     bits_of(giveback, "gre", "l2")};
    options.reply_to_group = reply == "group";
    options.join_at_first = join == "first";
    for (const uint16_t id : services)
        options.services.insert(static_cast<uint8_t>(id));
    if (!multicast.empty()) {
        const auto group = address_of(multicast);
        if (!group || *group >> 28 != 0xe) {
            fprintf(stderr, "wccp_router: %s is not a multicast address\n", multicast.c_str());
            return 2;
        }
        options.group = *group;
    }
    if (!gre_source.empty()) {
        options.gre_source = address_of(gre_source).value_or(0);
        if (options.gre_source == 0) {
            fprintf(stderr, "wccp_router: %s is not an address\n", gre_source.c_str());
            return 2;
        }
    }
    for (const std::string &text : routers) {
        const auto self = address_of(text);
        if (!self) {
            fprintf(stderr, "wccp_router: %s is not an address\n", text.c_str());
            return 2;
        }
        // The other options are the same for all routers.
        options.self = *self;
        station one;
        one.machine.options = options;
        open_station(&one);
        all.stations.push_back(std::move(one));
    }
    if (all.stations.empty()) {
        fputs("wccp_router: --router is missing\n", stderr);
        return 2;
    }
    open_path(&all, redirect);
    const int control = control_path.empty() ? -1 : listen_at(control_path);
    if (!control_path.empty() && control < 0) {
        fprintf(stderr, "wccp_router: %s: %s\n", control_path.c_str(), strerror(errno));
        return 1;
    }
    all.began = seconds_now();
    run_loop(&all, control);
    if (control >= 0)
        unlink(control_path.c_str());
    return 0;
}
