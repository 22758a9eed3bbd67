// The two ends of the lab's web traffic, as subcommands: a server, and a client that counts. Bodies have a
// known content, and both ends check it.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace CLI {
class App;
}
namespace lab {

struct web_options {
    std::vector<uint16_t> ports;
};
// Serves until it is ended. GET /N gives N bytes, POST takes a body; each answer has "X-Peer", the address
// that the server saw. Connections are kept.
int run_web(const web_options &options);

struct fetch_options {
    std::string server;
    uint16_t port = 80;
    std::string from;      // first source address, empty: the kernel chooses
    uint32_t sources = 1;  // that many addresses, one after the other
    uint32_t count = 1;    // fetches, each by a connection of its own
    uint32_t requests = 1; // on each connection
    uint32_t parallel = 1;
    uint64_t size = 1000;    // bytes that are asked for
    uint64_t upload = 0;     // bytes that are posted instead
    double timeout = 5;      // of each step of a fetch, in seconds
    double seconds = 0;      // go on for so long, whatever `count` says
    double pause = 0;        // seconds after each request
    double rate = 0;         // bytes a second that each connection reads, 0: as they come
    uint32_t long_lived = 0; // connections that last instead of fetches, with a request per second on each
    uint32_t life = 5;       // requests on each of them once SIGUSR1 has come
};
void add_fetch_options(CLI::App *app, fetch_options *options);
// One JSON object to standard output: {"fetched", "failed", "bytes", "seconds", "slowest", "longest_gap",
// "proxies": {NAME: COUNT}, "peers": {ADDRESS: COUNT}, "failures": {WHY: COUNT}}. "proxies" goes by
// "X-Proxy", "" is none. 0 when nothing has failed.
//
// With `long_lived` it keeps so many connections until `seconds` are over or SIGTERM comes, and replaces each
// that ends. After SIGUSR1 they end one after the other, and the new ones as well after `life` requests.
// There is a line for each event, {"asked": TIME, "what": "opened" | "ended" | "broken" | "unopened",
// "connection": NUMBER, "proxy": NAME, "answers": COUNT, "why": WHY}, and a last one: {"what": "result",
// "connections", "opened", "ended", "broken", "broken_by": {NAME: COUNT}, "failures", "unopened", "answers",
// "slowest"}. Broken is what was reset, closed without announcement or left without an answer for `timeout`;
// a connection that cannot be opened is "unopened". 0 when none was broken.
int run_fetch(const fetch_options &options);

} // namespace lab
