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
    uint64_t size = 1000; // bytes that are asked for
    uint64_t upload = 0;  // bytes that are posted instead
    double timeout = 5;   // of each step of a fetch, in seconds
    double seconds = 0;   // go on for so long, whatever `count` says
    double pause = 0;     // seconds after each fetch
};
void add_fetch_options(CLI::App *app, fetch_options *options);
// One JSON object to standard output: {"fetched", "failed", "bytes", "seconds", "slowest", "longest_gap",
// "proxies": {NAME: COUNT}, "peers": {ADDRESS: COUNT}, "failures": {WHY: COUNT}}. "proxies" goes by
// "X-Proxy", "" is none. 0 when nothing has failed.
int run_fetch(const fetch_options &options);

} // namespace lab
