// The engine in a test: without threads, on an interface whose other end is in another network namespace,
// where the test has the routers' sockets. Includes what most tests of the engine call.
#pragma once

#include <cstring>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "engine/cthread.h"
#include "engine/wccp_config.h"
#include "engine/wccp_host.h"
#include "engine/wccp_interface.h"
#include "engine/wccp_link_mgr.h"
#include "engine/wccp_mgr.h"
#include "engine/wccp_network.h"
#include "engine/wccp_utils.h"
#include "runtime/common.h"
#include "tests/support/log_lines.h"
#include "tests/support/peer_network.h"

// The result of wccp_is_system_in_bridge_mode.
extern int test_host_bridge_mode;

// Resets wccp_g to the state after a start, without interfaces.
void fresh_engine();
// Ends the engine's threads, groups, tunnels and sockets, and checks that all memory is freed.
void end_engine();
// Waits up to three seconds for the kernel to see that a link has changed.
bool link_becomes(const char *interface, uint32_t status);
// The number of threads whose name begins with this text. Waits a moment, because a thread sets its name when
// it first runs.
int threads_named(const std::string &name);

// A packet as a receive thread passes it on. The address sanitizer catches an access after `length`.
using received_packet = std::unique_ptr<wccp_pkt, void (*)(wccp_pkt *)>;
received_packet make_received(const std::vector<uint8_t> &bytes, be32 from);

// wan0 has 10.0.0.100/24 and open sockets; the routers are behind peer0.
struct engine_fixture {
    engine_fixture();
    ~engine_fixture();
    engine_fixture(const engine_fixture &) = delete;
    engine_fixture &operator=(const engine_fixture &) = delete;

    // An enabled group without tunnels: L2, either assignment, IOS, weight 100.
    static wccp_grp_config group_config(uint8_t id, const std::vector<std::string> &routers);
    wccp_service_group *add_group(const wccp_grp_config &config) const;
    // Adds an address on the routers' side and opens its socket on port 2048.
    int router_socket(const std::string &address);
    // The next datagram that the router of this address received, empty for none. Does not wait.
    std::vector<uint8_t> sent_to(const std::string &router);

    peer_network peer;
    wccp_interface *interface;
    std::map<std::string, int> sockets;
};
