// The load for bench/traffic.sh, one subcommand each:
//
// traffic_load router LOCAL REMOTE INTERFACE
//     provides the router's end of a GRE tunnel, as an interface, until SIGTERM
// traffic_load packets DEVICE MAC ADDRESS FLOWS RATE SECONDS
//     sends small UDP packets to ADDRESS, RATE a second (0: without a limit), in frames to MAC
// traffic_load sink PORT
//     accepts TCP connections, reads them to their end, and sends back the number of bytes
// traffic_load source ADDRESS PORT SECONDS BYTES
//     sends for a time or up to a size, whichever comes first (0: no limit)
// traffic_load split DEVICE
//     turns segmentation offload off: the device gets only packets of its MTU
//
// Results are printed as one JSON object. The address of the clients is in the network of the script.
//
// The router is the appliance's own user-space plane with its two ends exchanged: it splits the client's
// large segments into packets, completes their checksums, and leaves the fragmentation of large GRE packets
// to the kernel.

#include <arpa/inet.h>
#include <linux/ethtool.h>
#include <linux/if_ether.h>
#include <linux/if_packet.h>
#include <linux/sockios.h>
#include <net/if.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <map>
#include <string>
#include <vector>

#include "peers/tunneld/gre.h"
#include "peers/tunneld/ip_packet.h"
#include "peers/tunneld/plane.h"

namespace {

constexpr size_t CHUNK = 256 * 1024;
constexpr uint32_t CLIENT = 0x0a010080; // 10.1.0.128, the first of 64
constexpr size_t SMALL_PACKET = 46;     // an Ethernet frame of 64 bytes, with its checksum
constexpr uint16_t DISCARD_PORT = 9;

[[noreturn]] void die(const std::string &what) {
    fprintf(stderr, "traffic_load: %s: %s\n", what.c_str(), strerror(errno));
    exit(1);
}
double now_seconds() {
    timespec time = {};
    clock_gettime(CLOCK_MONOTONIC, &time);
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}
void sleep_for(double seconds) {
    const auto whole = static_cast<time_t>(seconds);
    const timespec time = {whole, static_cast<long>((seconds - static_cast<double>(whole)) * 1e9)};
    nanosleep(&time, nullptr);
}
uint32_t address_of(const char *text) {
    in_addr wire = {};
    if (inet_pton(AF_INET, text, &wire) != 1)
        die(text);
    return ntohl(wire.s_addr);
}

// --- The router

int run_router(char **words) {
    std::string error;
    uint32_t index = 0;
    sigset_t ends;
    sigemptyset(&ends);
    sigaddset(&ends, SIGTERM);
    // Before the plane starts its thread, which inherits the mask: SIGTERM has to wait for sigwait.
    sigprocmask(SIG_BLOCK, &ends, nullptr);
    const link_wish wish = {1, address_of(words[0]), address_of(words[1])};
    if (!user_plane.open(&error) || !user_plane.make_link(words[2], wish, &index, &error)) {
        fprintf(stderr, "traffic_load: %s\n", error.c_str());
        return 1;
    }
    puts("ready");
    // The script waits for this line in a file; output to files is buffered.
    fflush(stdout);
    int number = 0;
    sigwait(&ends, &number);
    plane_counters counters;
    user_plane.read_counters(&counters);
    const link_counters &link = counters.links[words[2]];
    printf("{\"sent\": %llu, \"came_back\": %llu, \"no_room\": %llu}\n",
           static_cast<unsigned long long>(link.packets_out),
           static_cast<unsigned long long>(link.packets_in),
           static_cast<unsigned long long>(link.refused[REFUSED_ROOM] + counters.refused[REFUSED_ROOM]));
    (void)user_plane.drop_link(words[2], &error);
    user_plane.close();
    return 0;
}

// --- Small packets

void append_bytes(std::vector<uint8_t> *to, const void *bytes, size_t length) {
    const auto *first = static_cast<const uint8_t *>(bytes);
    to->insert(to->end(), first, first + length);
}
ip4_wire_header udp_ip_header(uint32_t source, uint32_t destination, size_t payload) {
    ip4_wire_header ip = {};
    ip.version_ihl = 0x45;
    ip.total_length = to_be16(static_cast<uint16_t>(sizeof ip + payload));
    ip.fragment = to_be16(IP4_DONT_FRAGMENT); // as sockets send it unless asked otherwise
    ip.ttl = 64;
    ip.protocol = PROTOCOL_UDP;
    ip.source = to_be32(source);
    ip.destination = to_be32(destination);
    ip.checksum = checksum_finish(checksum_add(0, &ip, sizeof ip));
    return ip;
}
// An Ethernet frame of 64 bytes, counting its checksum.
std::vector<uint8_t> small_frame(uint32_t flow, const uint8_t *mac, uint32_t destination) {
    constexpr size_t length = SMALL_PACKET - sizeof(ip4_wire_header);
    const ip4_wire_header ip = udp_ip_header(CLIENT + flow % 64, destination, length);
    std::array<uint8_t, length> rest = {};
    udp_wire_header udp = {};
    udp.source_port = to_be16(static_cast<uint16_t>(1024 + flow));
    udp.destination_port = to_be16(DISCARD_PORT);
    udp.length = to_be16(static_cast<uint16_t>(length));
    memcpy(rest.data(), &udp, sizeof udp);
    // Computed while the field is 0, and copied again with its value.
    udp.checksum = checksum_finish(checksum_add(checksum_pseudo(ip, length), rest.data(), length));
    memcpy(rest.data(), &udp, sizeof udp);
    // 02:00:00:00:00:01, a locally administered address.
    const uint8_t source_and_type[] = {2, 0, 0, 0, 0, 1, ETH_P_IP >> 8, ETH_P_IP & 255};
    std::vector<uint8_t> frame;
    append_bytes(&frame, mac, ETH_ALEN);
    append_bytes(&frame, source_and_type, sizeof source_and_type);
    append_bytes(&frame, &ip, sizeof ip);
    append_bytes(&frame, rest.data(), length);
    return frame;
}
int open_device(const char *device) {
    const int fd = socket(AF_PACKET, SOCK_RAW | SOCK_CLOEXEC, 0);
    sockaddr_ll to = {};
    to.sll_family = AF_PACKET;
    to.sll_ifindex = static_cast<int>(if_nametoindex(device));
    constexpr int on = 1, buffer = 8 << 20;
    if (fd < 0 || to.sll_ifindex == 0 ||
        // Packets go straight to the device; a full one is reported as ENOBUFS.
        setsockopt(fd, SOL_PACKET, PACKET_QDISC_BYPASS, &on, sizeof on) != 0 ||
        setsockopt(fd, SOL_SOCKET, SO_SNDBUFFORCE, &buffer, sizeof buffer) != 0 ||
        bind(fd, reinterpret_cast<const sockaddr *>(&to), sizeof to) != 0)
        die(device);
    return fd;
}
int run_packets(char **words) {
    uint8_t mac[ETH_ALEN];
    if (sscanf(words[1], "%hhx:%hhx:%hhx:%hhx:%hhx:%hhx", &mac[0], &mac[1], &mac[2], &mac[3], &mac[4],
               &mac[5]) != ETH_ALEN)
        die(words[1]);
    const uint32_t destination = address_of(words[2]);
    const auto flows = static_cast<uint32_t>(strtoul(words[3], nullptr, 10));
    const double rate = strtod(words[4], nullptr), seconds = strtod(words[5], nullptr);
    const int fd = open_device(words[0]);
    constexpr uint32_t burst = 32;
    const uint32_t frames = std::max(flows, 1u);
    std::vector<std::vector<uint8_t>> made(frames);
    std::vector<iovec> parts(frames + burst);
    std::vector<mmsghdr> messages(frames + burst);
    for (uint32_t i = 0; i < frames + burst; i++) { // the first ones again, for a burst that wraps
        if (i < frames)
            made[i] = small_frame(i, mac, destination);
        parts[i] = {made[i % frames].data(), made[i % frames].size()};
        messages[i].msg_hdr.msg_iov = &parts[i];
        messages[i].msg_hdr.msg_iovlen = 1;
    }
    const double began = now_seconds();
    double time = began;
    uint64_t sent = 0, refused = 0; // refused: by a full queue of the receiver
    while (time - began < seconds) {
        // Packets that should have been sent by now. Without a rate a burst is always due.
        const double due = rate > 0 ? (time - began) * rate : static_cast<double>(sent + burst);
        if (due < static_cast<double>(sent + burst)) {
            sleep_for((static_cast<double>(sent + burst) - due) / rate);
        } else {
            for (uint32_t done = 0; done < burst;) {
                const int result = sendmmsg(fd, &messages[(sent + done) % frames], burst - done, 0);
                if (result <= 0 && errno != ENOBUFS)
                    die(words[0]);
                refused += result <= 0;
                // The packet that was refused is skipped, not repeated.
                done += result <= 0 ? 1 : static_cast<uint32_t>(result);
            }
            sent += burst;
        }
        time = now_seconds();
    }
    printf("{\"sent\": %llu, \"refused\": %llu, \"seconds\": %.3f}\n", static_cast<unsigned long long>(sent),
           static_cast<unsigned long long>(refused), time - began);
    return 0;
}

// --- TCP

// At the end of a connection the peer gets the number of bytes read, as 64 bits in host order.
bool read_connection(int fd, uint64_t *total, uint8_t *buffer) {
    const ssize_t got = recv(fd, buffer, CHUNK, MSG_DONTWAIT);
    if (got > 0) {
        *total += static_cast<uint64_t>(got);
        return true;
    }
    if (got < 0 && (errno == EAGAIN || errno == EINTR))
        return true;
    if (got == 0)
        // The client checks with it that nothing was lost.
        (void)!send(fd, total, sizeof *total, MSG_NOSIGNAL);
    return false;
}
int run_sink(char **words) {
    const int listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0), epoll = epoll_create1(EPOLL_CLOEXEC);
    sockaddr_in any = {};
    any.sin_family = AF_INET;
    any.sin_port = htons(static_cast<uint16_t>(atoi(words[0])));
    constexpr int on = 1;
    epoll_event event = {};
    event.events = EPOLLIN;
    event.data.fd = listener;
    if (setsockopt(listener, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on) != 0 ||
        // TPROXY delivers connections that are addressed to the server.
        setsockopt(listener, IPPROTO_IP, IP_TRANSPARENT, &on, sizeof on) != 0 ||
        bind(listener, reinterpret_cast<const sockaddr *>(&any), sizeof any) != 0 ||
        listen(listener, 100) != 0 || epoll_ctl(epoll, EPOLL_CTL_ADD, listener, &event) != 0)
        die(words[0]);
    std::map<int, uint64_t> totals;
    std::vector<uint8_t> buffer(CHUNK);
    for (;;) {
        epoll_event ready[16];
        const int count = epoll_wait(epoll, ready, 16, -1);
        for (int i = 0; i < count; i++) {
            const int fd = ready[i].data.fd;
            if (fd == listener) {
                event.data.fd = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
                if (event.data.fd >= 0 && epoll_ctl(epoll, EPOLL_CTL_ADD, event.data.fd, &event) == 0)
                    totals[event.data.fd] = 0;
            } else if (!read_connection(fd, &totals[fd], buffer.data())) {
                close(fd);
                totals.erase(fd);
            }
        }
    }
}

// A pause: a time without acknowledgements while bytes are outstanding.
struct progress {
    uint64_t acknowledged = 0;
    double at = 0, longest_pause = 0;
};
void note_progress(progress *all, int fd, uint64_t written) {
    int waiting = 0;
    // Bytes that have not been acknowledged, sent or not.
    if (ioctl(fd, SIOCOUTQ, &waiting) != 0)
        die("SIOCOUTQ");
    const uint64_t acknowledged = written - static_cast<uint64_t>(waiting);
    const double time = now_seconds();
    all->longest_pause = std::max(all->longest_pause, time - all->at);
    if (acknowledged != all->acknowledged || waiting == 0)
        all->at = time;
    all->acknowledged = acknowledged;
}
int connect_to(const char *address, const char *port) {
    const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in to = {};
    to.sin_family = AF_INET;
    to.sin_addr.s_addr = htonl(address_of(address));
    to.sin_port = htons(static_cast<uint16_t>(atoi(port)));
    if (fd < 0 || connect(fd, reinterpret_cast<const sockaddr *>(&to), sizeof to) != 0)
        die(std::string(address) + ":" + port);
    return fd;
}
int run_source(char **words) {
    const double limit = strtod(words[2], nullptr);
    const uint64_t size = strtoull(words[3], nullptr, 10);
    const int fd = connect_to(words[0], words[1]);
    const std::vector<uint8_t> chunk(CHUNK, 'x');
    progress all;
    const double began = all.at = now_seconds();
    double looked_at = began;
    uint64_t written = 0;
    while ((limit == 0 || now_seconds() - began < limit) && (size == 0 || written < size)) {
        const size_t length = size ? std::min<uint64_t>(CHUNK, size - written) : CHUNK;
        // Without blocking, so that progress is noted even while nothing moves.
        const ssize_t got = send(fd, chunk.data(), length, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (got < 0 && errno != EAGAIN)
            die("send");
        if (got > 0)
            written += static_cast<uint64_t>(got);
        pollfd writable = {fd, POLLOUT, 0};
        if (got < 0)
            poll(&writable, 1, 10);
        if (now_seconds() - looked_at > 0.01)
            note_progress(&all, fd, written), looked_at = now_seconds();
    }
    shutdown(fd, SHUT_WR);
    uint64_t total = 0;
    pollfd readable = {fd, POLLIN, 0};
    // Until the other side has read everything; a pause may be at the very end.
    while (poll(&readable, 1, 10) == 0)
        note_progress(&all, fd, written);
    if (recv(fd, &total, sizeof total, MSG_WAITALL) != sizeof total || total != written)
        die("the other side has not got all");
    tcp_info info = {};
    socklen_t length = sizeof info;
    getsockopt(fd, IPPROTO_TCP, TCP_INFO, &info, &length);
    printf(
        "{\"bytes\": %llu, \"seconds\": %.3f, \"longest_pause\": %.3f, \"mss\": %u, \"retransmitted\": %u}\n",
        static_cast<unsigned long long>(written), now_seconds() - began, all.longest_pause, info.tcpi_snd_mss,
        info.tcpi_total_retrans);
    return 0;
}

// --- The device

int run_split(char **words) {
    const int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    constexpr uint32_t commands[] = {ETHTOOL_STSO, ETHTOOL_SGSO, ETHTOOL_STXCSUM};
    for (const uint32_t command : commands) {
        ethtool_value off = {command, 0};
        ifreq request = {};
        snprintf(request.ifr_name, sizeof request.ifr_name, "%s", words[0]);
        request.ifr_data = reinterpret_cast<char *>(&off);
        if (ioctl(fd, SIOCETHTOOL, &request) != 0)
            die(words[0]);
    }
    return 0;
}

} // namespace

int main(int argc, char **argv) {
    static const struct {
        const char *name;
        int words;
        int (*run)(char **words);
    } commands[] = {{"router", 3, run_router},
                    {"packets", 6, run_packets},
                    {"sink", 1, run_sink},
                    {"source", 4, run_source},
                    {"split", 1, run_split}};
    for (const auto &command : commands)
        if (argc == command.words + 2 && strcmp(argv[1], command.name) == 0)
            return command.run(argv + 2);
    fputs("traffic_load: see bench/traffic_load.cpp\n", stderr);
    return 2;
}
