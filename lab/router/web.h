// The web server and client of the lab, as subcommands. Bodies have a known content, which both check.
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
// Runs until it is killed. GET /N is answered with N bytes, POST accepts a body; each answer has the header
// "X-Peer" with the client's address as the server sees it. Connections are kept open.
int run_web(const web_options &options);

struct fetch_options {
    std::string server;
    uint16_t port = 80;
    std::string from;        // first source address, empty: the kernel chooses
    uint32_t sources = 1;    // number of source addresses, used in turn
    uint32_t count = 1;      // number of fetches, each with a new connection
    uint32_t requests = 1;   // on each connection
    uint32_t parallel = 1;   // connections at a time
    uint64_t size = 1000;    // bytes to fetch with each request
    uint64_t upload = 0;     // if not 0: bytes to post instead
    double timeout = 5;      // of each step of a fetch, in seconds
    double seconds = 0;      // if not 0: continue for that long, regardless of `count`
    double pause = 0;        // seconds after each request
    double rate = 0;         // bytes per second that each connection reads, 0: no limit
    uint32_t long_lived = 0; // if not 0: keep that many connections open, with a request per second on each
    uint32_t life = 5;       // requests on each of them after SIGUSR1
};
void add_fetch_options(CLI::App *app, fetch_options *options);
// Prints a JSON object: {"fetched", "failed", "bytes", "seconds", "slowest", "longest_gap",
// "proxies": {NAME: COUNT}, "peers": {ADDRESS: COUNT}, "failures": {REASON: COUNT}}. NAME is from the header
// "X-Proxy", "" without one. Returns the exit status: 0 if nothing failed.
//
// With `long_lived` it keeps the connections open until `seconds` are over or SIGTERM arrives, and replaces
// each that ends. After SIGUSR1 they end one after the other, and new ones end after `life` requests. It
// prints a line for each event, {"asked": TIME, "what": "opened" | "ended" | "broken" | "unopened",
// "connection": NUMBER, "proxy": NAME, "answers": COUNT, "why": REASON}, and at the end {"what": "result",
// "connections", "opened", "ended", "broken", "broken_by": {NAME: COUNT}, "failures", "unopened", "answers",
// "slowest"}. A connection is broken if it is reset, closed without announcement, or gets no answer within
// `timeout`; "unopened" if it cannot be opened. Returns 0 if no connection was broken.
int run_fetch(const fetch_options &options);

} // namespace lab
