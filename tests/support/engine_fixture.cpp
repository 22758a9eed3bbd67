#include "tests/support/engine_fixture.h"

#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <new>

#include "engine/wccp_tunnel.h"

#ifdef WCCP_SANITIZED
#include <sanitizer/asan_interface.h>
#else
#define ASAN_POISON_MEMORY_REGION(address, size) ((void)0)
#define ASAN_UNPOISON_MEMORY_REGION(address, size) ((void)0)
#endif

static void free_received(wccp_pkt *pkt) {
    ASAN_UNPOISON_MEMORY_REGION(pkt->data, sizeof pkt->data);
    delete pkt;
}

received_packet make_received(const std::vector<uint8_t> &bytes, be32 from) {
    received_packet pkt(new wccp_pkt{}, free_received);
    EXPECT_LE(bytes.size(), sizeof pkt->data);
    pkt->ipa = from;
    pkt->length = static_cast<uint32_t>(bytes.size());
    pkt->cursor = pkt->data;
    if (!bytes.empty())
        memcpy(pkt->data, bytes.data(), bytes.size());
    ASAN_POISON_MEMORY_REGION(pkt->data + bytes.size(), sizeof pkt->data - bytes.size());
    return pkt;
}

void fresh_engine() {
    wccpd_exiting = 0;
    new (&wccp_g) wccp_global{};
    wccp_g.mcast_ttl = 5;
    for (wccp_interface &each : wccp_g.interfaces)
        each.ucast_fd = each.mcast_fd = -1;
    wccp_init_network();
}

void end_engine() {
    cthread_cancel_all();
    wccpd_exiting = 0;
    wccp_del_all_groups();
    EXPECT_EQ(wccp_g.group_count, 0u);
    EXPECT_EQ(wccp_g.group_list, nullptr);
    wccp_del_all_tunnels();
    EXPECT_EQ(wccp_g.stat_allocs, wccp_g.stat_frees);
    wccp_deinit_link_mgr();
}

bool link_becomes(const char *interface, uint32_t status) {
    for (int i = 0; i < 300 && wccp_get_if_status(interface) != status; i++)
        usleep(10000);
    return wccp_get_if_status(interface) == status;
}

int threads_named(const std::string &name) {
    int count = 0;
    for (int i = 0; i < 100 && count == 0; i++, usleep(1000))
        for (const auto &entry : std::filesystem::directory_iterator("/proc/self/task")) {
            std::ifstream file(entry.path() / "comm");
            std::string line;
            count += std::getline(file, line) && line.rfind(name, 0) == 0;
        }
    return count;
}

engine_fixture::engine_fixture() {
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

engine_fixture::~engine_fixture() {
    end_engine();
    for (const auto &[address, fd] : sockets)
        close(fd);
    run_command("ip link del wan0");
}

wccp_grp_config engine_fixture::group_config(uint8_t id, const std::vector<std::string> &routers) {
    wccp_grp_config config = {};
    config.group_id = id;
    for (const std::string &router : routers)
        config.routers[config.router_count++] = ipa(router);
    config.weight = 100;
    config.admin = WCCP_ADMIN_UP;
    config.fwd_method = WCCP_METHOD_L2;
    config.assign_method = WCCP_ASSIGN_EITHER;
    config.interface_set = 1;
    strcpy(config.interface, "wan0");
    config.compatibility = WCCP_COMPAT_IOS;
    return config;
}

wccp_service_group *engine_fixture::add_group(const wccp_grp_config &config) const {
    EXPECT_EQ(wccp_add_group(&config), 0);
    return wccp_find_group(config.group_id);
}

int engine_fixture::router_socket(const std::string &address) {
    peer.run("ip addr add " + address + "/24 dev peer0");
    const int fd = peer.udp_socket(address, 2048);
    sockets[address] = fd;
    return fd;
}

std::vector<uint8_t> engine_fixture::sent_to(const std::string &router) {
    return receive_datagram(sockets.at(router), 0).bytes;
}
