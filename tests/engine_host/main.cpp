// wccp_engine_host FILE: runs the engine without the daemon around it, for the time until there is one.
//
// Each line of FILE, and each command on the unix socket /run/wccpd/host.sock, is one of
//     add ID [interface eth0] [router ADDRESS]... [weight N] [password TEXT] [forward gre|l2|either]
//         [assign hash|mask|either] [priority N] [protocol N] [hash src_ip|dst_ip|src_port|dst_port]...
//         [mask_src_ip N] [mask_dst_ip N] [compat ios|nexus] [admin up|down]
//     set ID WORD VALUE      one of the above, while the group runs
//     del ID | show | dump | brief ID
// `show` gives one JSON object, `brief` one line: state, designated or -, seconds to the next table or 0,
// key. SIGTERM, SIGINT and SIGHUP end it as the daemon ends.
#include <arpa/inet.h>
#include <poll.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <functional>
#include <iostream>
#include <map>
#include <sstream>
#include <string>

#include <nlohmann/json.hpp>

#include "engine/wccp_alarms.h"
#include "engine/wccp_config.h"
#include "engine/wccp_debug_utils.h"
#include "engine/wccp_host.h"
#include "engine/wccpd_common.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

using json = nlohmann::ordered_json;

std::atomic<int32_t> wccpd_exiting;
uint32_t g_qv_encap_wccp_first = 10, g_qv_encap_wccp_last = 41;
char wccp_primary_wan_interface_name[32];
int32_t wccpd_shutdown_in_progress() {
    return wccpd_exiting;
}
lc_status wccp_init_primary_wan_interface() {
    strcpy(wccp_primary_wan_interface_name, "eth0");
    return LC_OK;
}
int wccp_is_system_in_bridge_mode() {
    return 0;
}

constexpr const char *SOCKET_PATH = "/run/wccpd/host.sock";
const std::map<std::string, uint32_t> METHODS = {{"gre", 1},   {"hash", 1}, {"ios", 1},
                                                 {"up", 1},    {"l2", 2},   {"mask", 2},
                                                 {"nexus", 2}, {"down", 2}, {"either", 3}};

static uint32_t number(const std::string &text) {
    const auto known = METHODS.find(text);
    return known != METHODS.end() ? known->second : static_cast<uint32_t>(strtoul(text.c_str(), nullptr, 0));
}

// A word of a group's line: its bit as a change, and the field that it fills.
struct word_row {
    uint32_t flag;
    std::function<void(wccp_grp_config *, const std::string &)> fill;
};
// clang-format off
#define FIELD(name) [](wccp_grp_config *c, const std::string &v) { c->name = static_cast<decltype(c->name)>(number(v)); }
static const std::map<std::string, word_row> WORDS = {
    {"interface", {0, [](wccp_grp_config *c, const std::string &v) { snprintf(c->interface, sizeof c->interface, "%s", v.c_str()); }}},
    {"router", {WCCP_CFG_ROUTERS, [](wccp_grp_config *c, const std::string &v) {
                    if (c->router_count < WCCP_MAX_ROUTERS)
                        c->routers[c->router_count++] = from_raw_word(inet_addr(v.c_str()));
                }}},
    {"password", {WCCP_CFG_PASSWORD, [](wccp_grp_config *c, const std::string &v) { snprintf(c->password, sizeof c->password, "%s", v == "none" ? "" : v.c_str()); }}},
    {"hash", {0, [](wccp_grp_config *c, const std::string &v) {
                  (v == "src_ip" ? c->hash_src_ip : v == "dst_ip" ? c->hash_dst_ip : v == "src_port" ? c->hash_src_port : c->hash_dst_port) = 1;
              }}},
    {"weight", {WCCP_CFG_WEIGHT, FIELD(weight)}},
    {"forward", {WCCP_CFG_FWD_METHOD, FIELD(fwd_method)}},
    {"assign", {WCCP_CFG_ASSIGN_METHOD, FIELD(assign_method)}},
    {"compat", {WCCP_CFG_COMPATIBILITY, FIELD(compatibility)}},
    {"admin", {WCCP_CFG_ADMIN, FIELD(admin)}},
    {"priority", {0, FIELD(priority)}},
    {"protocol", {0, FIELD(protocol)}},
    {"mask_src_ip", {WCCP_CFG_MASK_SRC_IP, FIELD(mask_src_ip)}},
    {"mask_dst_ip", {WCCP_CFG_MASK_DST_IP, FIELD(mask_dst_ip)}},
    {"mask_src_port", {WCCP_CFG_MASK_SRC_PORT, FIELD(mask_src_port)}},
    {"mask_dst_port", {WCCP_CFG_MASK_DST_PORT, FIELD(mask_dst_port)}},
    {"force_l2_return", {WCCP_CFG_FORCE_L2_RETURN, FIELD(force_l2_return)}},
};

// clang-format on

static std::string text_of(be32 ipa) {
    char text[INET_ADDRSTRLEN];
    return inet_ntop(AF_INET, ipa.bytes, text, sizeof text);
}

static json group_state(const wccp_service_group &group) {
    json routers = json::array(), appliances = json::array(), table = json::array();
    for (const wccp_sending_router *r = group.sending_routers; r; r = r->next)
        routers.push_back({{"id", text_of(r->router_id)},
                           {"two_way", (r->flags & WCCP_RTR_TWO_WAY) != 0},
                           {"acked", (r->flags & WCCP_RTR_ASSIGN_UNACKED) == 0},
                           {"tunnel", (r->flags & WCCP_RTR_HAS_TUNNEL) != 0},
                           {"self", r->self_buckets},
                           {"total", r->total_buckets}});
    for (const wccp_view_appliance *a = group.appliance_view; a; a = a->next)
        appliances.push_back({{"address", text_of(a->ipa)}, {"weight", a->weight}});
    for (uint32_t i = 0; i < group.dsg_active_count; i++)
        table.push_back({{"address", text_of(group.dsg_appliances[i].ipa)},
                         {"assigned", group.dsg_appliances[i].assigned}});
    const char *states[] = {"not-set", "INIT", "ACTIVE", "?", "BACKUP", "?", "?", "?"};
    return {{"state", states[group.state_flags & WCCP_STATE_MASK]},
            {"designated", group.designated != 0},
            {"forward", group.fwd_method},
            {"assign", group.assign_method},
            {"return", group.ret_method},
            {"key_change", group.dsg_key_change},
            {"change_number", group.change_number},
            {"pending_acks", group.pending_acks},
            {"next_here_i_am", group.hia_timer.active ? group.hia_timer.countdown : 0},
            {"next_assign", group.assign_timer.active ? group.assign_timer.countdown : 0},
            {"routers", routers},
            {"appliances", appliances},
            {"table", table},
            {"rx_icus", group.rx_icus},
            {"rx_icu_failures", group.rx_icu_failures},
            {"rx_failures", group.rx_failures},
            {"tx_failures", group.tx_failures},
            {"tx_redirect_assign", group.tx_redirect_assign},
            {"rx_service_mismatches", group.rx_service_mismatches}};
}

static std::string obey(const std::string &line) {
    std::istringstream in(line);
    std::string verb, word, value;
    uint32_t id = 0;
    in >> verb;
    if (verb.empty() || verb[0] == '#')
        return "ok";
    if (verb == "show") {
        mutex_guard held(&wccp_g.lock);
        json state = {
            {"seconds", wccp_g.seconds}, {"rx_failures", wccp_g.rx_failures}, {"groups", json::object()}};
        for (const wccp_service_group *group : wccp_g.groups)
            if (group)
                state["groups"][std::to_string(group->id)] = group_state(*group);
        return state.dump();
    }
    if (verb == "dump") {
        static char memory[WCCP_DUMP_ALL_BYTES];
        csys_display_buf *buffer = csys_create_safe_display_buf_desc(memory, sizeof memory);
        (void)wccp_print_all_wccp_info(buffer);
        return csys_display_buf_text(buffer);
    }
    in >> id;
    wccp_grp_config config = {};
    config.group_id = static_cast<uint8_t>(id);
    if (verb == "brief") {
        mutex_guard held(&wccp_g.lock);
        const wccp_service_group *group = wccp_find_group(static_cast<int>(id));
        if (!group)
            return "none - 0 0";
        const json state = group_state(*group);
        return state["state"].get<std::string>() + (group->designated ? " designated " : " - ") +
               state["next_assign"].dump() + " " + state["key_change"].dump();
    }
    if (verb == "del")
        return wccp_del_group(static_cast<int>(id)) == 0 ? "ok" : "error: no such group";
    if (verb == "add") {
        strcpy(config.interface, "eth0");
        config.interface_set = 1;
        config.weight = 100;
        config.admin = WCCP_ADMIN_UP;
        config.fwd_method = config.assign_method = WCCP_METHOD_EITHER;
        config.compatibility = WCCP_COMPAT_IOS;
    }
    while (in >> word >> value) {
        const auto row = WORDS.find(word);
        if (row == WORDS.end())
            return "error: " + word + "?";
        row->second.fill(&config, value);
        config.config_flags |= row->second.flag;
    }
    if (verb == "set")
        return wccp_modify_grp(&config) == 0 ? "ok" : "error: refused";
    config.config_flags = 0;
    return verb != "add" ? "error: " + verb + "?" : wccp_add_group(&config) == 0 ? "ok" : "error: refused";
}

static void serve(int listener) {
    const int fd = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    char line[1024];
    const ssize_t got = fd < 0 ? 0 : read(fd, line, sizeof line);
    if (got > 0) {
        const std::string answer = obey(std::string(line, static_cast<size_t>(got))) + "\n";
        (void)send(fd, answer.data(), answer.size(), MSG_NOSIGNAL);
    }
    if (fd >= 0)
        close(fd);
}

int main(int argc, char **argv) {
    sigset_t all, wanted;
    sigfillset(&all);
    sigprocmask(SIG_BLOCK, &all, nullptr);
    sigemptyset(&wanted);
    for (const int number : {SIGTERM, SIGINT, SIGHUP})
        sigaddset(&wanted, number);
    const int signals = signalfd(-1, &wanted, SFD_CLOEXEC);
    if (lc_init() != LC_OK || lc_log_init("wccpd", nullptr, 0, 0x1060000, LC_LOG_DEBUG, 24, 1) != LC_OK)
        return 1;
    (void)lc_log_set_daemon_log_level(getenv("HOST_LOG_LEVEL") ? atoi(getenv("HOST_LOG_LEVEL"))
                                                               : LC_LOG_INFO);
    sockaddr_un place = {AF_UNIX, {}};
    strcpy(place.sun_path, SOCKET_PATH);
    mkdir("/run/wccpd", 0755);
    unlink(SOCKET_PATH);
    const int listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (bind(listener, reinterpret_cast<sockaddr *>(&place), sizeof place) != 0 || listen(listener, 8) != 0 ||
        wccp_init_mgr() != 0) {
        fputs("wccp_engine_host: cannot start\n", stderr);
        return 1;
    }
    std::ifstream file(argc > 1 ? argv[1] : "/dev/null");
    for (std::string line; std::getline(file, line);)
        if (const std::string answer = obey(line); answer != "ok")
            std::cerr << line << ": " << answer << std::endl;
    pollfd fds[] = {{signals, POLLIN, 0}, {listener, POLLIN, 0}};
    while (poll(fds, 2, -1) >= 0 && !fds[0].revents)
        serve(listener);
    wccpd_exiting = 1;
    wccp_alarms_clear_all();
    (void)wccp_cleanup_shmem();
    (void)wccp_exit_mgr();
    (void)lc_log_close();
    return 0;
}
