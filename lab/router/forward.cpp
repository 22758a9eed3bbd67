#include "lab/router/forward.h"

#include <fcntl.h>
#include <linux/if.h>
#include <linux/if_packet.h>
#include <linux/if_tun.h>
#include <net/ethernet.h>
#include <netinet/in.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <fstream>
#include <sstream>

#include "runtime/ttime.h"

namespace lab {
namespace {

constexpr size_t LINK_BYTES = 1500;
constexpr size_t OUTER_BYTES = 20;
constexpr int AT_ONCE = 64; // packets from one descriptor before the others are read
enum : uint8_t { TCP = 6, UDP = 17 };
enum : uint16_t { GRE_IPV4 = 0x0800, GRE_REDIRECTED = 0x883e };
enum : uint8_t { METHOD_GRE = 1, METHOD_L2 = 2 };
// Flags of a service: the fields that are hashed, and the meaning of its ports.
enum : uint32_t {
    BY_SRC_IP = 1,
    BY_DST_IP = 2,
    BY_SRC_PORT = 4,
    BY_DST_PORT = 8,
    HAS_PORTS = 16,
    PORTS_ARE_SOURCES = 32
};
constexpr uint8_t WELL_KNOWN_WEB = 0; // service id; it implies TCP port 80
constexpr uint8_t DYNAMIC_SERVICE = 0x80;

uint16_t read_u16(const uint8_t *at) {
    return static_cast<uint16_t>(at[0] << 8 | at[1]);
}
uint32_t read_u32(const uint8_t *at) {
    return static_cast<uint32_t>(read_u16(at)) << 16 | read_u16(at + 2);
}

} // namespace

bool read_packet(const uint8_t *data, size_t size, packet_fields *fields) {
    if (size < 20 || data[0] >> 4 != 4)
        return false;
    const size_t header = 4U * (data[0] & 15);
    const size_t total = read_u16(data + 2);
    // More bytes than the total length are padding of the link.
    if (header < 20 || total < header || total > size)
        return false;
    *fields = {read_u32(data + 12), read_u32(data + 16), 0, 0, data[9], total};
    // Only the first fragment has the ports.
    const bool first = (read_u16(data + 6) & 0x1fff) == 0;
    if (first && (data[9] == TCP || data[9] == UDP) && total >= header + 4) {
        fields->src_port = read_u16(data + header);
        fields->dst_port = read_u16(data + header + 2);
    }
    return true;
}

// --- Which appliance gets a packet

namespace {

bool matches_service(const service_info &service, const packet_fields &packet) {
    if (service.type == 0 && service.id == WELL_KNOWN_WEB)
        return packet.protocol == TCP && packet.dst_port == 80;
    if (service.protocol != 0 && service.protocol != packet.protocol)
        return false;
    if (!(service.flags & HAS_PORTS))
        return true;
    const uint16_t port = service.flags & PORTS_ARE_SOURCES ? packet.src_port : packet.dst_port;
    // Unused places in the list of ports are 0.
    return port != 0 && std::find(service.ports.begin(), service.ports.end(), port) != service.ports.end();
}

// The bucket of a single field does not depend on which field it is: a service that hashes sources and one
// that hashes destinations send both directions of a flow to the same appliance, if their tables are the
// same.
uint8_t bucket_of(const service_info &service, const packet_fields &packet) {
    const uint32_t flags =
        service.type == 0 && service.id == WELL_KNOWN_WEB ? uint32_t{BY_DST_IP} : service.flags;
    uint64_t mixed = 0;
    const auto mix = [&](uint32_t bit, uint32_t value) {
        if (flags & bit)
            mixed = (mixed ^ value) * 0x9e3779b97f4a7c15;
    };
    mix(BY_SRC_IP, packet.src);
    mix(BY_DST_IP, packet.dst);
    mix(BY_SRC_PORT, packet.src_port);
    mix(BY_DST_PORT, packet.dst_port);
    // The upper bits of a product depend on all bits of its factors.
    return static_cast<uint8_t>(mixed >> 56);
}

address owner_by_mask(const std::vector<mask_set> &sets, const packet_fields &packet) {
    for (const mask_set &set : sets) {
        const mask_fields wanted = {packet.src & set.mask.src_ip, packet.dst & set.mask.dst_ip,
                                    static_cast<uint16_t>(packet.src_port & set.mask.src_port),
                                    static_cast<uint16_t>(packet.dst_port & set.mask.dst_port)};
        // The values of a set are already masked.
        for (const mask_value &value : set.values)
            if (value.match == wanted)
                return value.owner;
    }
    return 0;
}

verdict ask_group(const group &in, const packet_fields &packet) {
    verdict found;
    found.in = &in;
    if (in.current.by == kind::hash) {
        found.bucket = bucket_of(in.service, packet);
        found.owner = in.current.buckets[found.bucket];
    } else {
        found.owner = owner_by_mask(in.current.sets, packet);
    }
    const auto place = in.members.find(found.owner);
    // An owner that has left: the packet is routed, as without an owner.
    if (place == in.members.end() || !place->second.usable)
        found.owner = 0;
    else
        found.method = place->second.chosen.forward;
    return found;
}

} // namespace

verdict find_owner(const router &self, const std::set<uint8_t> &services, const packet_fields &packet) {
    const group *best = nullptr;
    for (const auto &[id, in] : self.groups)
        if (services.contains(id) && in.defined && in.current.by != kind::none &&
            matches_service(in.service, packet) && (!best || in.service.priority > best->service.priority))
            best = &in;
    return best ? ask_group(*best, packet) : verdict{};
}

bytes gre_header(const router &self, const verdict &found) {
    const std::string &form = self.options.gre_format;
    if (form == "ip")
        return {0, 0, GRE_IPV4 >> 8, GRE_IPV4 & 0xff};
    bytes header = {0, 0, GRE_REDIRECTED >> 8, GRE_REDIRECTED & 0xff};
    if (form == "plain")
        return header;
    const service_info &service = found.in->service;
    // The redirect header: flags, service, alternative bucket, bucket.
    header.insert(header.end(),
                  {service.type == 0 ? uint8_t{0} : DYNAMIC_SERVICE, service.id, 0, found.bucket});
    return header;
}

size_t inner_offset(const uint8_t *gre, size_t size) {
    if (size < 8 || read_u16(gre) != 0) // appliances use no keys, sequence numbers and checksums
        return 0;
    const uint16_t type = read_u16(gre + 2);
    // The first four bits of a redirect header are never 4, the version of an inner packet without one.
    if (type == GRE_IPV4 || (type == GRE_REDIRECTED && gre[4] >> 4 == 4))
        return 4;
    return type == GRE_REDIRECTED ? 8 : 0;
}

// --- Sockets and devices

namespace {

int open_tun(const std::string &interface, std::string *wrong) {
    const int fd = open("/dev/net/tun", O_RDWR | O_CLOEXEC | O_NONBLOCK);
    ifreq wish = {};
    snprintf(wish.ifr_name, sizeof wish.ifr_name, "to-%s", interface.c_str());
    wish.ifr_flags = IFF_TUN | IFF_NO_PI;
    // Any socket will do: the interface is named in the request.
    const int control = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    // The device, with the routes through it, outlives this program.
    if (fd < 0 || ioctl(fd, TUNSETIFF, &wish) != 0 || ioctl(fd, TUNSETPERSIST, 1) != 0 ||
        ioctl(control, SIOCGIFFLAGS, &wish) != 0 ||
        (wish.ifr_flags |= IFF_UP, ioctl(control, SIOCSIFFLAGS, &wish) != 0))
        *wrong = std::string("to-") + interface + ": " + strerror(errno);
    // The kernel queues packets in the device until this program reads them; bursts of many clients need
    // room.
    wish.ifr_qlen = 4000;
    (void)ioctl(control, SIOCSIFTXQLEN, &wish);
    close(control);
    return fd;
}

int open_gre(address own, std::string *wrong) {
    const int fd = socket(AF_INET, SOCK_RAW | SOCK_CLOEXEC | SOCK_NONBLOCK, IPPROTO_GRE);
    sockaddr_in place = {};
    place.sin_family = AF_INET;
    place.sin_addr.s_addr = htonl(own);
    // Redirected packets of full size don't fit with their new headers; the kernel fragments them, as a
    // router does.
    const int fragments = IP_PMTUDISC_DONT, room = 8 << 20, one = 1;
    // The interface with the address may be created later.
    if (fd < 0 || setsockopt(fd, IPPROTO_IP, IP_FREEBIND, &one, sizeof one) != 0 ||
        bind(fd, reinterpret_cast<const sockaddr *>(&place), sizeof place) != 0 ||
        setsockopt(fd, IPPROTO_IP, IP_MTU_DISCOVER, &fragments, sizeof fragments) != 0)
        *wrong = "GRE at " + text_of(own) + ": " + strerror(errno);
    for (const int which : {SO_RCVBUFFORCE, SO_SNDBUFFORCE})
        (void)setsockopt(fd, SOL_SOCKET, which, &room, sizeof room);
    return fd;
}

} // namespace

bool read_redirecting(const std::string &text, redirecting *out) {
    const size_t equals = text.find('=');
    out->interface = text.substr(0, equals);
    // "to-", the name and a NUL have to fit.
    if (equals == std::string::npos || out->interface.empty() || out->interface.size() > IFNAMSIZ - 4)
        return false;
    std::istringstream in(text.substr(equals + 1));
    for (std::string word; std::getline(in, word, ',');) {
        unsigned id = 0;
        const auto [end, error] = std::from_chars(word.data(), word.data() + word.size(), id);
        if (error != std::errc() || end != word.data() + word.size() || id > 255)
            return false;
        out->services.insert(static_cast<uint8_t>(id));
    }
    return !out->services.empty();
}

std::string open_forwarder(forwarder *path) {
    std::string wrong;
    const router_options &options = path->self->options;
    for (redirecting &one : path->from)
        one.tun = open_tun(one.interface, &wrong);
    path->raw = open_gre(options.self, &wrong);
    if (options.gre_source != 0)
        path->source = open_gre(options.gre_source, &wrong);
    path->link = socket(AF_PACKET, SOCK_DGRAM | SOCK_CLOEXEC, 0); // protocol 0: it only sends
    if (path->link < 0)
        wrong = std::string("packet socket: ") + strerror(errno);
    return wrong;
}

std::vector<int> forwarder_descriptors(const forwarder &path) {
    std::vector<int> all;
    for (const redirecting &one : path.from)
        all.push_back(one.tun);
    all.push_back(path.raw);
    all.push_back(path.source);
    return all;
}

// --- Forwarding

namespace {

// The link address of an appliance from the neighbour table, cached for a second.
const sockaddr_ll *find_neighbour(address who) {
    static std::map<address, std::pair<int64_t, sockaddr_ll>> known;
    const int64_t now = lt_monotonic_ns();
    auto &[looked_up, place] = known[who];
    if (looked_up != 0 && now - looked_up < 1'000'000'000)
        return place.sll_halen ? &place : nullptr;
    looked_up = now;
    place = {};
    // The messages of the protocol keep the kernel's entry alive, so that no ARP request has to be sent here.
    std::ifstream table("/proc/net/arp");
    std::string line, own, kind, flags, mac, mask, device;
    while (std::getline(table, line)) {
        std::istringstream in(line);
        in >> own >> kind >> flags >> mac >> mask >> device;
        if (own != text_of(who) || flags == "0x0" || mac.size() != 17)
            continue;
        place.sll_family = AF_PACKET;
        place.sll_protocol = htons(ETH_P_IP);
        place.sll_halen = ETH_ALEN;
        for (size_t i = 0; i < ETH_ALEN; i++)
            (void)std::from_chars(&mac[3 * i], &mac[3 * i] + 2, place.sll_addr[i], 16);
        ifreq wish = {};
        snprintf(wish.ifr_name, sizeof wish.ifr_name, "%s", device.c_str());
        const int control = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        if (ioctl(control, SIOCGIFINDEX, &wish) == 0)
            place.sll_ifindex = wish.ifr_ifindex;
        close(control);
    }
    return place.sll_halen ? &place : nullptr;
}

bool send_by_gre(const forwarder &path, const verdict &found, const uint8_t *data, size_t size) {
    bytes header = gre_header(*path.self, found);
    sockaddr_in place = {};
    place.sin_family = AF_INET;
    place.sin_addr.s_addr = htonl(found.owner);
    iovec parts[] = {{header.data(), header.size()}, {const_cast<uint8_t *>(data), size}};
    msghdr message = {};
    message.msg_name = &place;
    message.msg_namelen = sizeof place;
    message.msg_iov = parts;
    message.msg_iovlen = 2;
    if (OUTER_BYTES + header.size() + size > LINK_BYTES)
        path.self->traffic.fragmented++;
    return sendmsg(path.source >= 0 ? path.source : path.raw, &message, 0) >= 0;
}

bool send_by_l2(const forwarder &path, address owner, const uint8_t *data, size_t size) {
    const sockaddr_ll *place = find_neighbour(owner);
    return place &&
           sendto(path.link, data, size, 0, reinterpret_cast<const sockaddr *>(place), sizeof *place) >= 0;
}

uint64_t flow_key(const packet_fields &packet, address owner) {
    uint64_t key = owner;
    for (const uint32_t word : {packet.src, packet.dst, uint32_t{packet.src_port} << 16 | packet.dst_port,
                                uint32_t{packet.protocol}})
        key = (key ^ word) * 0x9e3779b97f4a7c15 + (key >> 32);
    return key;
}

void redirect_packet(const forwarder &path, const redirecting &from, const uint8_t *data, size_t size) {
    traffic &counted = path.self->traffic;
    packet_fields packet;
    const bool sound = read_packet(data, size, &packet);
    // A stopped router still routes: only the protocol and the redirection have ended.
    const verdict found =
        sound && !path.self->stopped ? find_owner(*path.self, from.services, packet) : verdict{};
    if (found.owner == 0) {
        counted.routed++;
        (void)write(from.tun, data, size);
        return;
    }
    const bool went = found.method == METHOD_L2 ? send_by_l2(path, found.owner, data, packet.length)
                                                : send_by_gre(path, found, data, packet.length);
    if (!went) {
        counted.lost++;
        return;
    }
    appliance_traffic &one = counted.appliances[found.owner];
    one.packets++;
    one.bytes += packet.length;
    if (counted.flows.insert(flow_key(packet, found.owner)).second)
        one.flows++;
}

bool is_member(const router &self, address who) {
    return std::any_of(self.groups.begin(), self.groups.end(),
                       [who](const auto &entry) { return entry.second.members.contains(who); });
}

void accept_return(const forwarder &path, const uint8_t *data, size_t size) {
    traffic &counted = path.self->traffic;
    packet_fields outer, inner;
    // A raw socket delivers the outer header too, and reassembled packets.
    const size_t header = size > 0 ? 4U * (data[0] & 15) : 0;
    if (!read_packet(data, size, &outer) || !is_member(*path.self, outer.src)) {
        counted.refused_returns++;
        return;
    }
    const uint8_t *gre = data + header;
    const size_t rest = outer.length - header, begins = inner_offset(gre, rest);
    if (begins == 0 || !read_packet(gre + begins, rest - begins, &inner)) {
        counted.refused_returns++;
        return;
    }
    appliance_traffic &one = counted.appliances[outer.src];
    one.returned++;
    if (read_u16(gre + 2) == GRE_REDIRECTED)
        one.returned_redirected++;
    // Any of the devices will do: packets from all of them are routed and not redirected again.
    (void)write(path.from.front().tun, gre + begins, inner.length);
}

} // namespace

void forward_packets(forwarder *path, int descriptor) {
    uint8_t data[65536];
    const auto from = std::find_if(path->from.begin(), path->from.end(),
                                   [=](const redirecting &one) { return one.tun == descriptor; });
    for (int i = 0; i < AT_ONCE; i++) {
        const ssize_t got = read(descriptor, data, sizeof data);
        if (got <= 0)
            return;
        if (from != path->from.end())
            redirect_packet(*path, *from, data, static_cast<size_t>(got));
        else
            accept_return(*path, data, static_cast<size_t>(got));
    }
}

} // namespace lab
