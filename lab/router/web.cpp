// Blocking sockets with timeouts, and a thread for each connection.
#include "lab/router/web.h"

#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cmath>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <map>
#include <mutex>
#include <thread>

#include <CLI/CLI.hpp>
#include <nlohmann/json.hpp>

#include "lab/router/wire.h"
#include "runtime/ttime.h"

namespace lab {
namespace {

constexpr size_t PIECE = 65536;
constexpr size_t LONGEST_HEADER = 8192;

double wall_seconds() {
    return static_cast<double>(lt_monotonic_ns()) / 1e9;
}

// The byte at an offset of any body. Its period is not a power of two, so that lost or repeated packets show.
char content_at(uint64_t at) {
    return static_cast<char>('a' + at % 251 % 26);
}
// A piece of content that begins at any offset of the period.
const std::string &body_content() {
    static const std::string all = [] {
        std::string text(PIECE + 251, ' ');
        for (size_t i = 0; i < text.size(); i++)
            text[i] = content_at(i);
        return text;
    }();
    return all;
}

void set_limits(int fd, double seconds) {
    timeval limit = {};
    limit.tv_sec = static_cast<time_t>(seconds);
    limit.tv_usec = static_cast<suseconds_t>((seconds - static_cast<double>(limit.tv_sec)) * 1e6);
    setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
    setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit);
    const int one = 1;
    setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
}

bool send_all(int fd, const char *data, size_t size) {
    while (size > 0) {
        const ssize_t went = send(fd, data, size, MSG_NOSIGNAL);
        if (went <= 0)
            return false;
        data += went;
        size -= static_cast<size_t>(went);
    }
    return true;
}
bool send_body(int fd, uint64_t size) {
    for (uint64_t at = 0; at < size;) {
        const size_t piece = static_cast<size_t>(std::min<uint64_t>(PIECE, size - at));
        // The content repeats, so that one prepared piece serves all offsets.
        if (!send_all(fd, body_content().data() + at % 251, piece))
            return false;
        at += piece;
    }
    return true;
}

struct stream {
    int fd;
    std::string waiting; // received and not yet used
    const char *wrong = "";
    double rate = 0; // bytes per second to read, 0: no limit
};
void pause_for(double seconds) {
    if (seconds > 0)
        usleep(static_cast<useconds_t>(seconds * 1e6));
}
bool read_more(stream *in) {
    char part[PIECE];
    const ssize_t got = recv(in->fd, part, sizeof part, 0);
    if (got > 0) {
        in->waiting.append(part, static_cast<size_t>(got));
        if (in->rate > 0)
            pause_for(static_cast<double>(got) / in->rate);
        return true;
    }
    // With SO_RCVTIMEO, EAGAIN means that the time is over.
    in->wrong = got == 0 ? "closed" : errno == EAGAIN ? "timeout" : errno == ECONNRESET ? "reset" : "read";
    return false;
}
bool read_head(stream *in, std::string *head) {
    size_t end;
    while ((end = in->waiting.find("\r\n\r\n")) == std::string::npos) {
        if (in->waiting.size() > LONGEST_HEADER) {
            in->wrong = "header";
            return false;
        }
        if (!read_more(in))
            return false;
    }
    // With the line end of the last header, so that all of them end alike.
    *head = in->waiting.substr(0, end + 2);
    in->waiting.erase(0, end + 4);
    return true;
}
bool read_body(stream *in, uint64_t size) {
    for (uint64_t at = 0; at < size;) {
        if (in->waiting.empty() && !read_more(in))
            return false;
        const size_t piece = static_cast<size_t>(std::min<uint64_t>({in->waiting.size(), PIECE, size - at}));
        if (memcmp(in->waiting.data(), body_content().data() + at % 251, piece) != 0) {
            in->wrong = "content";
            return false;
        }
        in->waiting.erase(0, piece);
        at += piece;
    }
    return true;
}
std::string header_of(const std::string &head, const char *name) {
    const size_t length = strlen(name);
    for (size_t at = head.find("\r\n"); at != std::string::npos; at = head.find("\r\n", at)) {
        at += 2;
        if (head.size() <= at + length || head[at + length] != ':' ||
            strncasecmp(&head[at], name, length) != 0)
            continue;
        const size_t begins = head.find_first_not_of(' ', at + length + 1);
        return head.substr(begins, head.find("\r\n", begins) - begins);
    }
    return "";
}
uint64_t number_in(const std::string &text) {
    return strtoull(text.c_str(), nullptr, 10);
}

// --- The server

void serve_connection(int fd, address peer) {
    set_limits(fd, 60);
    stream in = {fd, "", ""};
    for (std::string head; read_head(&in, &head);) {
        const bool upload = head.starts_with("POST ");
        uint64_t size = 0;
        if (upload) {
            // Some clients wait for this before they send the body.
            if (strcasecmp(header_of(head, "Expect").c_str(), "100-continue") == 0)
                (void)send_all(fd, "HTTP/1.1 100 Continue\r\n\r\n", 25);
            if (!read_body(&in, number_in(header_of(head, "Content-Length"))))
                break;
        } else if (const size_t slash = head.find('/'); slash != std::string::npos) {
            size = number_in(head.substr(slash + 1, 20));
        }
        const std::string answer =
            "HTTP/1.1 200 OK\r\nContent-Type: text/plain\r\nContent-Length: " + std::to_string(size) +
            "\r\nX-Peer: " + text_of(peer) + "\r\n\r\n";
        if (!send_all(fd, answer.data(), answer.size()) || !send_body(fd, size) ||
            strcasecmp(header_of(head, "Connection").c_str(), "close") == 0)
            break;
    }
    close(fd);
}

void accept_connections(int listener) {
    for (;;) {
        sockaddr_in peer = {};
        socklen_t length = sizeof peer;
        const int fd = accept4(listener, reinterpret_cast<sockaddr *>(&peer), &length, SOCK_CLOEXEC);
        if (fd >= 0)
            // Nobody waits for it: the thread ends with its connection, which has a time limit.
            std::thread(serve_connection, fd, ntohl(peer.sin_addr.s_addr)).detach();
    }
}

} // namespace

int run_web(const web_options &options) {
    std::vector<std::thread> listeners;
    for (const uint16_t port : options.ports) {
        const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        const int one = 1;
        sockaddr_in place = {};
        place.sin_family = AF_INET;
        place.sin_port = htons(port);
        setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
        setsockopt(fd, IPPROTO_IP, IP_TRANSPARENT, &one, sizeof one); // for connections that TPROXY redirects
        if (fd < 0 || bind(fd, reinterpret_cast<const sockaddr *>(&place), sizeof place) != 0 ||
            listen(fd, 1024) != 0) {
            perror("web");
            _exit(1);
        }
        listeners.emplace_back(accept_connections, fd);
    }
    for (std::thread &one : listeners)
        one.join();
    return 0;
}

// --- The client

namespace {

struct fetched {
    const char *wrong = nullptr; // why it failed
    std::string proxy, peer;
    bool last = false; // the server closes the connection after this answer
    double took = 0;
};
const char *connect_from(int fd, const fetch_options &options, uint32_t source) {
    sockaddr_in place = {};
    place.sin_family = AF_INET;
    if (!options.from.empty()) {
        // Port 0: the kernel chooses one.
        place.sin_addr.s_addr = htonl(address_of(options.from).value_or(0) + source);
        if (bind(fd, reinterpret_cast<const sockaddr *>(&place), sizeof place) != 0)
            return "bind";
    }
    place.sin_port = htons(options.port);
    place.sin_addr.s_addr = htonl(address_of(options.server).value_or(0));
    if (connect(fd, reinterpret_cast<const sockaddr *>(&place), sizeof place) == 0)
        return nullptr;
    // SO_SNDTIMEO limits connect as well, which then fails with EINPROGRESS.
    return errno == EINPROGRESS ? "connect timeout" : errno == ECONNREFUSED ? "refused" : "connect";
}
std::string make_request(const fetch_options &options) {
    const bool post = options.upload > 0;
    return std::string(post ? "POST /upload" : "GET /" + std::to_string(options.size)) +
           " HTTP/1.1\r\nHost: " + options.server + "\r\n" +
           (post ? "Content-Length: " + std::to_string(options.upload) + "\r\n" : "") + "\r\n";
}
// Sends a request and reads the answer; the result is nullptr, or why it failed.
const char *exchange_request(stream *in, const std::string &request, const fetch_options &options,
                             fetched *out) {
    std::string head;
    // For the two sends, which don't set a reason.
    in->wrong = "send";
    if (!send_all(in->fd, request.data(), request.size()) || !send_body(in->fd, options.upload) ||
        !read_head(in, &head))
        return in->wrong;
    if (!head.starts_with("HTTP/1.1 200"))
        return "status";
    if (options.upload == 0 && number_in(header_of(head, "Content-Length")) != options.size)
        return "length";
    if (!read_body(in, number_in(header_of(head, "Content-Length"))))
        return in->wrong;
    out->proxy = header_of(head, "X-Proxy");
    out->peer = header_of(head, "X-Peer");
    out->last = strcasecmp(header_of(head, "Connection").c_str(), "close") == 0;
    return nullptr;
}
fetched fetch_once(const fetch_options &options, uint32_t source) {
    fetched one;
    const double began = wall_seconds();
    const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    set_limits(fd, options.timeout);
    const int small = 32768; // makes the sender wait for a slow reader
    // Before connect, where the window scale is agreed.
    if (options.rate > 0)
        setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &small, sizeof small);
    one.wrong = connect_from(fd, options, source);
    stream in = {fd, "", "", options.rate};
    const std::string request = make_request(options);
    for (uint32_t i = 0; i < options.requests && !one.wrong; i++) {
        if (i > 0)
            pause_for(options.pause);
        one.wrong = exchange_request(&in, request, options, &one);
    }
    close(fd);
    one.took = wall_seconds() - began;
    return one;
}

struct tally {
    std::mutex lock;
    std::atomic<uint32_t> next = 0;
    uint64_t good = 0, failed = 0;
    double slowest = 0, last_good = 0, longest_gap = 0; // gap: a time without a completed fetch
    std::map<std::string, uint64_t> proxies, peers, failures;
};
void fetch_many(const fetch_options &options, double began, tally *all) {
    for (;;) {
        // Each thread takes the next number; the order of the fetches doesn't matter.
        const uint32_t number = all->next++;
        if (options.seconds > 0 ? wall_seconds() - began >= options.seconds : number >= options.count)
            return;
        const fetched one = fetch_once(options, number % options.sources);
        {
            const std::lock_guard guard(all->lock);
            if (one.wrong) {
                all->failed++;
                all->failures[one.wrong]++;
            } else {
                const double now = wall_seconds();
                all->good++;
                all->proxies[one.proxy]++;
                all->peers[one.peer]++;
                all->slowest = std::max(all->slowest, one.took);
                all->longest_gap = std::max(all->longest_gap, now - all->last_good);
                all->last_good = now;
            }
        }
        pause_for(options.pause);
    }
}

// --- Long connections

struct connection_pool {
    const fetch_options &options;
    const std::string request;
    double until = 0;                // in wall_seconds(); 0: until SIGTERM
    std::atomic<bool> over = false;  // every connection ends after its next answer
    std::atomic<bool> aging = false; // after SIGUSR1
    std::mutex lock = {};            // for the members below and for standard output
    uint64_t opened = 0, ended = 0, broken = 0, unopened = 0, answers = 0;
    double slowest = 0;
    std::map<std::string, uint64_t> broken_by = {}, failures = {};
};
struct long_connection {
    uint32_t number;
    stream in;
    uint64_t answers = 0;
    std::string proxy;
};

bool is_over(const connection_pool &all) {
    return all.over || (all.until > 0 && wall_seconds() >= all.until);
}
// `asked` is the time of the last request before the event, in seconds since 1970.
void print_event(const char *what, const long_connection &one, double asked, const char *why) {
    nlohmann::ordered_json event = {{"asked", asked},
                                    {"what", what},
                                    {"connection", one.number},
                                    {"proxy", one.proxy},
                                    {"answers", one.answers}};
    if (why)
        event["why"] = why;
    puts(event.dump().c_str());
    fflush(stdout);
}
double seconds_since_1970() {
    timespec now = {};
    clock_gettime(CLOCK_REALTIME, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

// Sends a request; false if the connection has ended for any reason.
bool ask_again(connection_pool *all, long_connection *one, uint64_t last_answer) {
    fetched answer;
    const double asked = seconds_since_1970(), began = wall_seconds();
    const char *wrong = exchange_request(&one->in, all->request, all->options, &answer);
    const std::lock_guard guard(all->lock);
    if (wrong) {
        all->broken++;
        all->broken_by[one->proxy]++;
        all->failures[wrong]++;
        print_event("broken", *one, asked, wrong);
        return false;
    }
    all->answers++;
    all->slowest = std::max(all->slowest, wall_seconds() - began);
    one->proxy = answer.proxy;
    // Reported with the first answer, which names the proxy.
    if (one->answers++ == 0)
        print_event("opened", *one, asked, nullptr);
    // A connection whose end the server has announced is not broken.
    if (!answer.last && one->answers < last_answer)
        return true;
    all->ended++;
    print_event("ended", *one, asked, nullptr);
    return false;
}
// Runs an open connection until it ends. The requests of all connections are spread over each second.
void run_connection(connection_pool *all, long_connection *one) {
    const double phase = static_cast<double>(one->number) / all->options.long_lived;
    uint64_t last_answer = all->aging ? all->options.life : UINT64_MAX;
    while (!is_over(*all)) {
        // The ends of the open connections are spread over `life` seconds.
        if (all->aging && last_answer == UINT64_MAX)
            last_answer = one->answers + 1 + one->number % all->options.life;
        if (!ask_again(all, one, last_answer))
            return;
        const double now = wall_seconds();
        // Until this connection's place in the next second.
        usleep(static_cast<useconds_t>((std::floor(now - phase) + 1 + phase - now) * 1e6));
    }
}
void keep_connected(connection_pool *all, uint32_t number) {
    const fetch_options &options = all->options;
    // The connections are opened over a second, too.
    usleep(number * 1'000'000U / options.long_lived);
    while (!is_over(*all)) {
        long_connection one = {number, {socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0), "", ""}, 0, ""};
        set_limits(one.in.fd, options.timeout);
        const char *wrong = connect_from(one.in.fd, options, number % options.sources);
        {
            const std::lock_guard guard(all->lock);
            (wrong ? all->unopened : all->opened)++;
            if (wrong)
                print_event("unopened", one, seconds_since_1970(), wrong);
        }
        if (!wrong)
            run_connection(all, &one);
        close(one.in.fd);
        usleep(200'000);
    }
}

int keep_all_connected(const fetch_options &options) {
    connection_pool all = {options, make_request(options)};
    if (options.seconds > 0)
        all.until = wall_seconds() + options.seconds;
    sigset_t signals;
    sigemptyset(&signals);
    for (const int number : {SIGTERM, SIGINT, SIGUSR1})
        sigaddset(&signals, number);
    // The threads inherit the mask: only this thread takes the signals.
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    std::vector<std::thread> workers;
    for (uint32_t number = 0; number < options.long_lived; number++)
        workers.emplace_back(keep_connected, &all, number);
    while (!is_over(all)) {
        const timespec wait = {0, 100'000'000};
        const int number = sigtimedwait(&signals, nullptr, &wait);
        if (number == SIGUSR1)
            all.aging = true;
        else if (number > 0)
            all.over = true;
    }
    for (std::thread &one : workers)
        one.join();
    const nlohmann::ordered_json result = {{"what", "result"},         {"connections", options.long_lived},
                                           {"opened", all.opened},     {"ended", all.ended},
                                           {"broken", all.broken},     {"broken_by", all.broken_by},
                                           {"failures", all.failures}, {"unopened", all.unopened},
                                           {"answers", all.answers},   {"slowest", all.slowest}};
    puts(result.dump().c_str());
    return all.broken == 0 && all.answers > 0 ? 0 : 1;
}

} // namespace

void add_fetch_options(CLI::App *app, fetch_options *options) {
    app->add_option("SERVER", options->server)->required()->check(CLI::ValidIPV4);
    app->add_option("--port", options->port);
    app->add_option("--from", options->from, "first source address")->check(CLI::ValidIPV4);
    app->add_option("--sources", options->sources, "number of source addresses")->check(CLI::PositiveNumber);
    app->add_option("--count", options->count, "number of connections");
    app->add_option("--requests", options->requests, "on each connection");
    app->add_option("--parallel", options->parallel, "connections at a time")->check(CLI::Range(1, 4096));
    app->add_option("--size", options->size, "bytes to fetch");
    app->add_option("--upload", options->upload, "bytes to post instead");
    app->add_option("--timeout", options->timeout, "seconds that each step of a fetch may take");
    app->add_option("--seconds", options->seconds, "continue for that long, regardless of --count");
    app->add_option("--pause", options->pause, "seconds after each request");
    app->add_option("--rate", options->rate, "bytes per second that each connection reads");
    app->add_option("--long", options->long_lived,
                    "keep that many connections open, with a request per second on each")
        ->check(CLI::Range(1, 4096));
    app->add_option("--life", options->life, "requests on each of them after SIGUSR1")
        ->check(CLI::PositiveNumber);
}

int run_fetch(const fetch_options &options) {
    if (options.long_lived > 0)
        return keep_all_connected(options);
    tally all;
    const double began = all.last_good = wall_seconds();
    std::vector<std::thread> workers;
    for (uint32_t i = 0; i < options.parallel; i++)
        workers.emplace_back(fetch_many, std::cref(options), began, &all);
    for (std::thread &one : workers)
        one.join();
    const double finished = wall_seconds();
    const uint64_t each = (options.upload ? options.upload : options.size) * options.requests;
    const nlohmann::ordered_json result = {
        {"fetched", all.good},      {"failed", all.failed},
        {"bytes", all.good * each}, {"seconds", finished - began},
        {"slowest", all.slowest},   {"longest_gap", std::max(all.longest_gap, finished - all.last_good)},
        {"proxies", all.proxies},   {"peers", all.peers},
        {"failures", all.failures}};
    puts(result.dump().c_str());
    return all.failed == 0 && all.good > 0 ? 0 : 1;
}

} // namespace lab
