// The engine in a test: without threads, on an interface whose other end is in another network namespace,
// where the test has the routers' sockets. Includes what most tests of the engine call.
#pragma once

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <new>

#include <gtest/gtest.h>

#include "engine/cthread.h"
#include "engine/wccp_config.h"
#include "engine/wccp_host.h"
#include "engine/wccp_interface.h"
#include "engine/wccp_link_mgr.h"
#include "engine/wccp_mgr.h"
#include "engine/wccp_network.h"
#include "engine/wccp_tunnel.h"
#include "engine/wccp_utils.h"
#include "runtime/common.h"
#include "tests/support/log_lines.h"
#include "tests/support/peer_network.h"

#ifdef WCCP_SANITIZED
#include <sanitizer/asan_interface.h>
#else
#define ASAN_POISON_MEMORY_REGION(address, size) ((void)0)
#define ASAN_UNPOISON_MEMORY_REGION(address, size) ((void)0)
#endif

// The result of wccp_is_system_in_bridge_mode.
extern int test_host_bridge_mode;

// Resets wccp_g to the state after a start, without interfaces.
inline void fresh_engine() {
    wccpd_exiting = 0;
    new (&wccp_g) wccp_global{};
    wccp_g.mcast_ttl = 5;
    for (wccp_interface &each : wccp_g.interfaces)
        each.ucast_fd = each.mcast_fd = -1;
    wccp_init_network();
}
// Ends the engine's threads, groups, tunnels and sockets, and checks that all memory is freed.
inline void end_engine() {
    wccpd_exiting = 0;
    wccp_del_all_groups(); // first: without groups no thread waits for tunneld while it is cancelled
    cthread_cancel_all();
    EXPECT_TRUE(wccp_g.group_count == 0 && !wccp_g.group_list);
    wccp_del_all_tunnels();
    EXPECT_EQ(wccp_g.stat_allocs, wccp_g.stat_frees);
    wccp_deinit_link_mgr();
}
// Waits up to three seconds for the kernel to see that a link has changed.
inline bool link_becomes(const char *interface, uint32_t status) {
    for (int i = 0; i < 300 && wccp_get_if_status(interface) != status; i++)
        usleep(10000);
    return wccp_get_if_status(interface) == status;
}
// The number of threads whose name begins with this text. Waits a moment, because a thread sets its name when
// it first runs.
inline int threads_named(const std::string &name) {
    int count = 0;
    for (int i = 0; i < 100 && count == 0; i++, usleep(1000))
        for (const auto &entry : std::filesystem::directory_iterator("/proc/self/task")) {
            std::ifstream file(entry.path() / "comm");
            std::string line;
            count += std::getline(file, line) && line.rfind(name, 0) == 0;
        }
    return count;
}
// The group in state ACTIVE, as if a router redirected to this appliance.
inline void make_active(wccp_service_group *group) {
    group->state_flags = (group->state_flags & ~WCCP_STATE_MASK) | WCCP_STATE_ACTIVE;
}

// A packet as a receive thread passes it on. The address sanitizer catches an access after `length`.
using received_packet = std::unique_ptr<wccp_pkt, void (*)(wccp_pkt *)>;
inline void free_received(wccp_pkt *pkt) {
    ASAN_UNPOISON_MEMORY_REGION(pkt->data, sizeof pkt->data);
    delete pkt;
}
inline received_packet make_received(const std::vector<uint8_t> &bytes, be32 from) {
    received_packet pkt(new wccp_pkt{}, free_received);
    EXPECT_LE(bytes.size(), sizeof pkt->data);
    pkt->ipa = from;
    pkt->length = static_cast<uint32_t>(bytes.size());
    pkt->cursor = pkt->data;
    std::copy(bytes.begin(), bytes.end(), pkt->data);
    ASAN_POISON_MEMORY_REGION(pkt->data + bytes.size(), sizeof pkt->data - bytes.size());
    return pkt;
}

// wan0 has 10.0.0.100/24 and open sockets; the routers are behind peer0.
struct engine_fixture {
    engine_fixture() {
        fresh_engine();
        peer.link("wan0", "10.0.0.100/24", "peer0", "");
        interface = &wccp_g.interfaces[wccp_g.if_count++];
        strcpy(interface->name, "wan0");
        interface->ipa = ipa("10.0.0.100");
        interface->link_up = 1;
        interface->ready_flags = WCCP_ALL_READY;
        // An interface that has a thread gets no second one: this one never gets its first.
        interface->rx_thread = reinterpret_cast<cthread *>(this);
        EXPECT_EQ(wccp_init_network_by_interface(interface), 0);
    }
    ~engine_fixture() {
        end_engine();
        for (const auto &[address, fd] : sockets)
            close(fd);
        run_command("ip link del wan0");
    }
    engine_fixture(const engine_fixture &) = delete;
    engine_fixture &operator=(const engine_fixture &) = delete;

    // An enabled group without tunnels: L2, either assignment, IOS, weight 100.
    static wccp_grp_config group_config(uint8_t id, const std::vector<std::string> &routers,
                                        const char *interface = "wan0") {
        wccp_grp_config config = {};
        config.group_id = id;
        for (const std::string &router : routers)
            config.routers[config.router_count++] = ipa(router);
        config.weight = 100;
        config.admin = WCCP_ADMIN_UP;
        config.fwd_method = WCCP_METHOD_L2;
        config.assign_method = WCCP_ASSIGN_EITHER;
        config.interface_set = 1;
        strlcpy(config.interface, interface, sizeof config.interface);
        config.compatibility = WCCP_COMPAT_IOS;
        return config;
    }
    wccp_service_group *add_group(const wccp_grp_config &config) const {
        EXPECT_EQ(wccp_add_group(&config), 0);
        return wccp_find_group(config.group_id);
    }
    static void set_admin(uint8_t id, uint32_t state) {
        wccp_grp_config update = {};
        update.group_id = id;
        update.config_flags = WCCP_CFG_ADMIN;
        update.admin = state;
        EXPECT_EQ(wccp_modify_grp(&update), 0);
    }
    // Adds an address on the routers' side and opens its socket on port 2048.
    int router_socket(const std::string &address) {
        peer.run("ip addr add " + address + "/24 dev peer0");
        const int fd = peer.udp_socket(address, 2048);
        sockets[address] = fd;
        return fd;
    }
    // The next datagram that the router of this address received, empty for none. Does not wait.
    std::vector<uint8_t> sent_to(const std::string &router) {
        return receive_datagram(sockets.at(router), 0).bytes;
    }

    peer_network peer;
    wccp_interface *interface;
    std::map<std::string, int> sockets;
};
