// The engine in a test: a host whose answers the test sets, and an engine without threads on an interface
// whose other end lies in a network of its own, where the test plays the routers with sockets.
#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "engine/wccp_records.h"
#include "tests/support/peer_network.h"

// What wccp_is_system_in_bridge_mode answers. The host's other names are in engine/wccp_host.h.
extern int test_host_bridge_mode;

// The engine's record as its start leaves it: mcast_ttl 5, no interface, no group, no thread.
void fresh_engine();
// Ends the threads, groups, tunnels and sockets of the engine; whatever was allocated must be free again.
void end_engine();
// False when it takes more than three seconds: the kernel sees a link come and go some time after the fact.
bool link_becomes(const char *interface, uint32_t status);
// How many threads of this process have a name that begins so; a thread names itself when it first runs.
int threads_named(const std::string &name);

// A packet as a receive thread hands it on. Under the address sanitizer nothing after `length` can be
// touched.
using received_packet = std::unique_ptr<wccp_pkt, void (*)(wccp_pkt *)>;
received_packet make_received(const std::vector<uint8_t> &bytes, be32 from);

// Engine and network of a test: wan0 here has 10.0.0.100/24 and open sockets, peer0 there the routers.
struct engine_fixture {
    engine_fixture();
    ~engine_fixture();
    engine_fixture(const engine_fixture &) = delete;
    engine_fixture &operator=(const engine_fixture &) = delete;

    // Group `id`, enabled and started, that does without tunnels: L2 with either assignment, IOS, weight 100.
    static wccp_grp_config group_config(uint8_t id, const std::vector<std::string> &routers);
    wccp_service_group *add_group(const wccp_grp_config &config) const;
    // The address on the peer's side, and its socket on port 2048.
    int router_socket(const std::string &address);
    // The next datagram that the router of this address got from wan0; empty when there is none. What was
    // sent before the call is there already: nothing waits.
    std::vector<uint8_t> sent_to(const std::string &router);

    peer_network peer;
    wccp_interface *interface;
    std::map<std::string, int> sockets;
};
