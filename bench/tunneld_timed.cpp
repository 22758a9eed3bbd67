// Times of tunneld, in an appliance of its own (lab/in-appliance):
//
// tunneld_timed orders TUNNELD COUNT QUIET
//     plays wccpd and a router: orders COUNT tunnels one by one, each after QUIET seconds without a command,
//     and sends GRE packets until one is returned. Prints a line for each tunnel: milliseconds to the answer
//     of the order, and to the returned packet
// tunneld_timed reconcile PLANE TUNNELS GROUPS
//     how long it takes to make the kernel state, to reconcile it again without changes, and to take it over
//     in another process
//
// Without a configuration all redirected packets are returned: a returned packet has passed the whole plane.

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <map>
#include <string>

#include "peers/tunneld/gre.h"
#include "peers/tunneld/ip_packet.h"
#include "peers/tunneld/kernel_state.h"
#include "platform/tunnel_mailbox.h"
#include "runtime/cmem.h"

namespace {

constexpr uint32_t APPLIANCE = 0x0a000065, ROUTER = 0x0a000001; // 10.0.0.101, 10.0.0.1
constexpr double LIMIT = 5;                                     // seconds; of each wait

[[noreturn]] void die(const std::string &what) {
    fprintf(stderr, "tunneld_timed: %s: %s\n", what.c_str(), strerror(errno));
    exit(1);
}
double seconds_now() {
    timespec time = {};
    clock_gettime(CLOCK_MONOTONIC, &time);
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}
void sleep_for(double seconds) {
    const auto whole = static_cast<time_t>(seconds);
    const timespec time = {whole, static_cast<long>((seconds - static_cast<double>(whole)) * 1e9)};
    nanosleep(&time, nullptr);
}
void run_command(const std::string &command) {
    if (system(command.c_str()) != 0)
        die(command);
}

// --- The router: a process in its own network namespace

struct shared_times {
    std::atomic<bool> sends;         // packets are to be sent
    std::atomic<double> returned_at; // when the first one came back, 0 before
};
shared_times *times;

void fill_packet(uint8_t *packet, size_t *out_length) {
    const gre_wire_redirect redirect = {0x80, 51, 0, 0};
    size_t length = write_gre_header(packet, &redirect);
    ip4_wire_header ip = {};
    ip.version_ihl = 0x45;
    ip.total_length = to_be16(sizeof ip + sizeof(udp_wire_header));
    ip.ttl = 64;
    ip.protocol = PROTOCOL_UDP;
    ip.source = to_be32(0x0a010080);
    ip.destination = to_be32(0x0a020002);
    ip.checksum = checksum_finish(checksum_add(0, &ip, sizeof ip));
    memcpy(packet + length, &ip, sizeof ip);
    length += sizeof ip;
    const udp_wire_header udp = {to_be16(1024), to_be16(80), to_be16(sizeof(udp_wire_header)), {}};
    memcpy(packet + length, &udp, sizeof udp);
    *out_length = length + sizeof udp;
}
[[noreturn]] void be_router(int ready) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (unshare(CLONE_NEWNET) != 0)
        die("network of the router");
    const int fd = socket(AF_INET, SOCK_RAW | SOCK_NONBLOCK | SOCK_CLOEXEC, IPPROTO_GRE);
    // The namespace exists now, and the link can be moved into it.
    (void)!write(ready, "", 1);
    uint8_t packet[128];
    size_t length = 0;
    fill_packet(packet, &length);
    sockaddr_in to = {};
    to.sin_family = AF_INET;
    to.sin_addr.s_addr = htonl(APPLIANCE);
    for (;;) {
        uint8_t came[2048];
        // Everything that waits is read first: an old packet must not count for the next tunnel.
        while (recv(fd, came, sizeof came, 0) > 0)
            if (times->sends && times->returned_at == 0)
                times->returned_at = seconds_now();
        if (times->sends)
            (void)!sendto(fd, packet, length, 0, reinterpret_cast<const sockaddr *>(&to), sizeof to);
        // The interval limits how exactly the first packet is timed.
        sleep_for(times->sends ? 0.0002 : 0.001);
    }
}
void start_router() {
    int ready[2];
    char nothing;
    if (pipe(ready) != 0)
        die("pipe");
    const pid_t router = fork();
    if (router == 0)
        be_router(ready[1]);
    if (router < 0 || read(ready[0], &nothing, 1) != 1)
        die("router");
    const std::string pid = std::to_string(router), in = "nsenter -t " + pid + " --net ip ";
    run_command("ip link add eth0 type veth peer name eth0 netns " + pid);
    run_command("ip address add 10.0.0.101/24 dev eth0 && ip link set eth0 up");
    run_command(in + "address add 10.0.0.1/24 dev eth0 && " + in + "link set eth0 up");
}

// --- wccpd's side of the mailbox

wccp_tunnel_mailbox *mailbox;

// Gives a command as wccpd does; false if it fails or is not answered.
bool run_mailbox_command(uint16_t code, uint16_t id) {
    mailbox->tunnel_id = id;
    mailbox->local_ip = APPLIANCE;
    mailbox->remote_ip = ROUTER;
    mailbox->fmst_index = WCCP_NO_INDEX;
    // Last: the command is valid once its number is there, and tunneld clears it when it has answered.
    mailbox->command = code;
    wccp_wake_tunneld();
    for (const double end = seconds_now() + LIMIT; mailbox->command != 0;) {
        if (seconds_now() > end)
            return false;
        sleep_for(0.0002);
    }
    return mailbox->status != 1;
}
void make_mailbox() {
    const std::filesystem::path conf = CMEM_CONF_PATH;
    std::filesystem::create_directories(conf.parent_path());
    std::ofstream(conf) << WCCP_MAILBOX_NAME << " local normal 0x51520001\n";
    mailbox =
        static_cast<wccp_tunnel_mailbox *>(cmem_create_block(sizeof(wccp_tunnel_mailbox), WCCP_MAILBOX_NAME));
    if (!mailbox)
        die("mailbox");
    for (wccp_policy_role &role : mailbox->policy_roles)
        // UNKNOWN.
        role.role = 2;
}

pid_t start_tunneld(const char *program) {
    const pid_t tunneld = fork();
    if (tunneld == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        // Its output must not be mixed with the results.
        if (!freopen("/dev/null", "w", stdout))
            _exit(1);
        execl(program, program, "--plane", "user", nullptr);
        _exit(127);
    }
    return tunneld;
}
void order_and_wait(uint16_t id) {
    times->returned_at = 0;
    times->sends = true;
    // Packets already arrive when the order is given, as in operation.
    sleep_for(0.002);
    times->returned_at = 0; // nothing is returned while the tunnel does not exist
    const double ordered = seconds_now();
    if (!run_mailbox_command(MAILBOX_ADD_TUNNEL, id) || mailbox->fmst_index == WCCP_NO_INDEX)
        die("the order is not answered");
    const double answered = seconds_now();
    while (times->returned_at == 0) {
        if (seconds_now() > ordered + LIMIT)
            die("no packet comes back");
        sleep_for(0.0002);
    }
    printf("%.1f %.1f\n", (answered - ordered) * 1e3, (times->returned_at - ordered) * 1e3);
    fflush(stdout);
    times->sends = false;
    if (!run_mailbox_command(MAILBOX_DELETE_TUNNEL, id))
        die("the tunnel is not removed");
    sleep_for(0.02);
}
int run_orders(char **words) {
    // Shared with the process of the router, which is forked later.
    times = static_cast<shared_times *>(
        mmap(nullptr, sizeof *times, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
    make_mailbox();
    start_router();
    const pid_t tunneld = start_tunneld(words[0]);
    // The first order waits until tunneld has found the mailbox and made its rules.
    if (!run_mailbox_command(MAILBOX_ADD_TUNNEL, 1) || !run_mailbox_command(MAILBOX_DELETE_TUNNEL, 1))
        die("tunneld takes no command");
    for (int i = 0; i < atoi(words[1]); i++) {
        sleep_for(strtod(words[2], nullptr));
        order_and_wait(static_cast<uint16_t>(2 + i));
    }
    int status = -1;
    kill(tunneld, SIGTERM);
    waitpid(tunneld, &status, 0);
    return status == 0 ? 0 : 1;
}

// --- Kernel state

appliance_view view_of(uint16_t tunnels, int groups) {
    appliance_view view;
    group_view group;
    group.interface = "eth0";
    group.local = APPLIANCE;
    for (uint16_t i = 0; i < tunnels; i++) {
        view.tunnels[i] = {APPLIANCE, ROUTER + i};
        group.routers.push_back({ROUTER + i, ROUTER + i, travel::gre, travel::gre});
    }
    for (int id = 0; id < groups; id++) {
        const auto number = static_cast<uint8_t>(id);
        intercept rules;
        rules.ports = {{static_cast<uint16_t>(1000 + id), static_cast<uint16_t>(1000 + id)}};
        rules.to = 3129;
        rules.bypass = {{0xc0000200 + number, 32}};
        view.groups[number] = group;
        view.intercepts[number] = rules;
        view.conditions[number] = {true, true};
    }
    view.own_addresses = {APPLIANCE};
    return view;
}
void reconcile_timed(const char *what, const data_plane &plane, const appliance_view &view, bool takes_over) {
    const double began = seconds_now();
    std::map<std::string, uint32_t> indices;
    std::string error;
    std::vector<wanted_link> found;
    if (takes_over)
        found = find_own_links();
    // As tunneld does at startup: links that exist are taken over before the state is compared.
    for (const wanted_link &link : found)
        if (!plane.make_link(link.name, link.wish, &indices[link.name], &error))
            die("take over: " + error);
    const wanted_state wanted = make_wanted_state(view, found, &plane == &user_plane);
    if (!reconcile_kernel_state(plane, wanted, &indices, &error) || indices.size() != view.tunnels.size())
        die("reconcile: " + error);
    printf("%s: %.0f ms\n", what, (seconds_now() - began) * 1e3);
    fflush(stdout);
}
int run_reconcile(char **words) {
    const data_plane *plane = nullptr;
    for (const data_plane *each : data_planes)
        if (strstr(each->name, words[0]))
            plane = each;
    if (!plane)
        die(words[0]);
    const auto view = view_of(static_cast<uint16_t>(atoi(words[1])), atoi(words[2]));
    run_command("ip link add eth0 type veth peer name other && ip address add 10.0.0.101/24 dev eth0 && "
                "ip link set other up && ip link set eth0 up");
    std::string error;
    const auto open = [&] {
        if (!plane->open(&error))
            die(error);
    };
    const pid_t first = fork(); // exits as if it were killed
    if (first == 0) {
        open();
        reconcile_timed("from nothing", *plane, view, false);
        reconcile_timed("again, all is there", *plane, view, true);
        // Without cleaning up: the state stays in the kernel, for the next process to find.
        _exit(0);
    }
    int status = -1;
    waitpid(first, &status, 0);
    if (status != 0)
        return 1;
    open();
    reconcile_timed("taken over by another process", *plane, view, true);
    if (!remove_kernel_state(*plane, &error))
        die("remove: " + error);
    plane->close();
    return 0;
}

} // namespace

int main(int argc, char **argv) {
    if (argc == 5 && strcmp(argv[1], "orders") == 0)
        return run_orders(argv + 2);
    if (argc == 5 && strcmp(argv[1], "reconcile") == 0)
        return run_reconcile(argv + 2);
    fputs("tunneld_timed: see bench/tunneld_timed.cpp\n", stderr);
    return 2;
}
