// The user-space data plane: reading GRE, merging and splitting, and the complete plane between two network
// namespaces.

#include <gtest/gtest.h>
#include <net/ethernet.h>
#include <netpacket/packet.h>
#include <poll.h>
#include <sched.h>

#include <ctime>

#include "peers/tunneld/gre.h"
#include "peers/tunneld/kernel_state.h"
#include "peers/tunneld/netlink.h"
#include "peers/tunneld/passing.h"
#include "peers/tunneld/user_shortcut.h"
#include "peers/tunneld/user_tun.h"
#include "tests/support/packets.h"
#include "tests/support/test_host.h"

namespace {

template <typename Header>
Header *header_at(bytes *packet, size_t offset) {
    return reinterpret_cast<Header *>(packet->data() + offset);
}
ip4_wire_header *ip_header(bytes *packet) {
    return ip_of(packet->data());
}
tcp_wire_header *tcp_header(bytes *packet) {
    return header_at<tcp_wire_header>(packet, sizeof(ip4_wire_header));
}
void fix_checksums(bytes *packet) {
    mend_packet(packet->data(), packet->size());
}

// A packet's id, content and, with the payload's size, sequence number follow from its number.
bytes make_packet(uint8_t protocol, uint32_t number, size_t payload, uint32_t destination = 0xcb007101) {
    const size_t transport = protocol == PROTOCOL_TCP ? 32 : sizeof(udp_wire_header);
    bytes packet =
        make_ip_packet(protocol, 0xc6336401, destination, bytes(transport + payload), IP4_DONT_FRAGMENT);
    ip_header(&packet)->id = to_be16(static_cast<uint16_t>(0xfffe + number));
    ip_header(&packet)->ttl = 60;
    tcp_wire_header *header = tcp_header(&packet);
    header->source_port = to_be16(40000);
    header->destination_port = to_be16(80);
    if (protocol == PROTOCOL_TCP) {
        header->sequence = to_be32(0xfffffff0 + number * 100);
        header->data_offset = 0x80; // with 12 bytes of options
        header->flags = TCP_ACK;
        packet[40] = 1;
    }
    for (size_t i = packet.size() - payload; i < packet.size(); i++)
        packet[i] = static_cast<uint8_t>(i * 7 + number);
    fix_checksums(&packet);
    return packet;
}

const bytes REDIRECT = {0x80, 51, 7, 200}; // flags, service, alternative and primary bucket

bytes wrap_in_gre(uint16_t flags, uint16_t type, const bytes &content, const bytes &between = {}) {
    bytes out(sizeof(gre_wire_header));
    *header_at<gre_wire_header>(&out, 0) = {to_be16(flags), to_be16(type)};
    if (flags & GRE_CHECKSUM)
        out.resize(out.size() + sizeof(gre_wire_checksum));
    out.insert(out.end(), between.begin(), between.end());
    out.insert(out.end(), content.begin(), content.end());
    if (flags & GRE_CHECKSUM)
        header_at<gre_wire_checksum>(&out, 4)->checksum =
            checksum_finish(checksum_add(0, out.data(), out.size()));
    return out;
}

TEST(ip_packet, checksums_are_sums_of_words) {
    bytes memory(1700, 0xff);
    for (size_t i = 0; i < 600; i++)
        memory[i * 2] = static_cast<uint8_t>(i * 31);
    for (size_t start = 0; start < 3; start++)
        for (size_t length = 0; start + length <= memory.size(); length += length < 300 ? 1 : 97) {
            uint32_t sum = 0;
            for (size_t i = 0; i < length; i++)
                sum += uint32_t{memory[start + i]} << (i % 2 ? 0 : 8);
            while (sum >> 16)
                sum = (sum & 0xffff) + (sum >> 16);
            ASSERT_EQ(to_host(checksum_fold(checksum_add(0, &memory[start], length))), sum) << length;
        }
}

TEST(gre, headers_are_taken_or_refused) {
    const bytes packet = make_packet(PROTOCOL_UDP, 1, 31);
    bytes wrong = packet, cut = packet, corrupt = wrap_in_gre(GRE_CHECKSUM, GRE_TYPE_IPV4, packet);
    wrong[8]++; // TTL, under the header's checksum
    cut.pop_back();
    corrupt.back()++;
    bytes stale = wrap_in_gre(GRE_CHECKSUM, GRE_TYPE_IPV4, packet);
    stale[4]++;
    const struct {
        const char *what;
        bytes payload;
        refusal why;
        bool has_redirect = false, merged = false;
    } rows[] = {
        {"plain", wrap_in_gre(0, GRE_TYPE_IPV4, packet), REFUSALS},
        {"padded", wrap_in_gre(0, GRE_TYPE_IPV4, bytes(6), packet), REFUSALS},
        {"redirected", wrap_in_gre(0, GRE_TYPE_REDIRECT, packet, REDIRECT), REFUSALS, true},
        {"redirected without header", wrap_in_gre(0, GRE_TYPE_REDIRECT, packet), REFUSALS},
        {"checksum", wrap_in_gre(GRE_CHECKSUM, GRE_TYPE_REDIRECT, packet, REDIRECT), REFUSALS, true},
        {"reserved bits", wrap_in_gre(0x03f8, GRE_TYPE_IPV4, packet), REFUSALS},
        {"wrong checksum", corrupt, REFUSED_CHECKSUM},
        {"checksum of the first of several", stale, REFUSALS, false, true},
        {"checksum cut", {0x80, 0, 8, 0, 0, 0}, REFUSED_LENGTH},
        {"routing", wrap_in_gre(0x4000, GRE_TYPE_IPV4, packet), REFUSED_FLAGS},
        {"key", wrap_in_gre(0x2000, GRE_TYPE_IPV4, packet, {0, 0, 0, 1}), REFUSED_FLAGS},
        {"sequence", wrap_in_gre(0x1000, GRE_TYPE_IPV4, packet, {0, 0, 0, 1}), REFUSED_FLAGS},
        {"version 1", wrap_in_gre(1, GRE_TYPE_IPV4, packet), REFUSED_FLAGS},
        {"IPv6", wrap_in_gre(0, 0x86dd, packet), REFUSED_PROTOCOL},
        {"header cut", {0, 0, 8}, REFUSED_LENGTH},
        {"redirect header cut", wrap_in_gre(0, GRE_TYPE_REDIRECT, {}, {0x80, 51, 7}), REFUSED_LENGTH},
        {"nothing inside", wrap_in_gre(0, GRE_TYPE_REDIRECT, {}, REDIRECT), REFUSED_LENGTH},
        {"redirect header under IPv4", wrap_in_gre(0, GRE_TYPE_IPV4, packet, REDIRECT), REFUSED_INNER},
        {"inner checksum", wrap_in_gre(0, GRE_TYPE_IPV4, wrong), REFUSED_INNER},
        {"inner length", wrap_in_gre(0, GRE_TYPE_IPV4, cut), REFUSED_INNER},
    };
    for (bytes payload; const auto &row : rows) {
        SCOPED_TRACE(row.what);
        payload = row.payload;
        gre_content content;
        ASSERT_EQ(read_gre_payload(payload.data(), payload.size(), row.merged, &content), row.why);
        if (row.why != REFUSALS)
            continue;
        EXPECT_EQ(bytes(content.packet, content.packet + content.length), packet);
        EXPECT_EQ(content.has_redirect, row.has_redirect);
        EXPECT_TRUE(!row.has_redirect || memcmp(&content.redirect, REDIRECT.data(), REDIRECT.size()) == 0);
    }
}

TEST(gre, buckets_choose_who_gets_a_packet) {
    constexpr uint32_t MEMBER = 0x0a000066, HERE = 0x0a000065;
    constexpr size_t WHOLE = 20 + 32 + 31;
    passing_table table;
    table[51] = {HERE, false, {{79, 80}, {443, 443}}, std::vector<uint32_t>(256, 0)};
    table[51].members[200] = MEMBER;
    table[52] = {HERE, true, {}, std::vector<uint32_t>(256, MEMBER)};
    EXPECT_EQ(read_passing_file(passing_file_text(table) + "51 10.0.0.1 source 80 257*0.0.0.0\n7 x\n"),
              table);
    passing_lookup lookup;
    fill_passing_lookup(table, &lookup);
    const struct {
        const char *what;
        bytes redirect;
        uint32_t member;
        size_t at = WHOLE; // of other bytes, or if there are none, where the packet ends
        bytes other = {};
    } rows[] = {
        {"its bucket", REDIRECT, MEMBER},
        {"the alternative bucket", {0xc0, 51, 200, 7}, MEMBER},
        {"the other of the two", {0xc0, 51, 7, 200}, 0},
        {"nobody's bucket", {0x80, 51, 200, 7}, 0},
        {"another service", {0x80, 50, 200, 200}, 0},
        {"another port", REDIRECT, 0, 23, {81}},
        {"from any port", {0x80, 52, 7, 200}, MEMBER, 20, {0, 0}},
        {"a new flow", REDIRECT, 0, 33, {TCP_SYN}},
        {"its answer", REDIRECT, MEMBER, 33, {TCP_SYN | TCP_ACK}},
        {"a fragment", REDIRECT, 0, 6, {0x20}},
        {"a datagram", REDIRECT, 0, 9, {PROTOCOL_UDP}},
        {"cut within its header", REDIRECT, 0, 39},
        {"no redirect header", {}, 0},
    };
    for (const auto &row : rows) {
        SCOPED_TRACE(row.what);
        bytes packet = make_packet(PROTOCOL_TCP, 1, 31);
        packet.resize(row.other.empty() ? row.at : WHOLE);
        std::copy(row.other.begin(), row.other.end(), packet.begin() + static_cast<std::ptrdiff_t>(row.at));
        fix_checksums(&packet);
        bytes payload = wrap_in_gre(0, GRE_TYPE_REDIRECT, packet, row.redirect);
        gre_content content;
        ASSERT_EQ(read_gre_payload(payload.data(), payload.size(), false, &content), REFUSALS);
        uint32_t local = 0;
        EXPECT_EQ(find_passing_member(lookup, content, &local), row.member);
        EXPECT_EQ(local, row.member ? HERE : 0);
    }
}

struct one_write {
    virtio_header header;
    bytes packet;
    uint32_t packets;
};
std::vector<one_write> writes;
void keep_write(void *, const iovec *parts, size_t count, uint32_t packets) {
    const auto *header = static_cast<const virtio_header *>(parts[0].iov_base);
    writes.push_back({*header, join_parts(parts, count), packets});
}

// Packets through the coalescer into `writes`.
void merge_packets(const std::vector<bytes> &packets, bool udp = true) {
    static coalescer merger;
    merger.sink = keep_write;
    merger.merge_udp = udp;
    writes.clear();
    for (const bytes &packet : packets)
        coalesce_packet(&merger, nullptr, packet.data(), packet.size());
    coalesce_flush(&merger);
}

// Splits all writes.
std::vector<bytes> split_writes() {
    std::vector<bytes> out;
    for (one_write &write : writes) {
        packet_split split;
        EXPECT_TRUE(split_begin(&split, write.header, write.packet.data(), write.packet.size()));
        for (split_segment segment; split_next(&split, &segment);)
            out.push_back(join_segment(segment));
    }
    return out;
}

TEST(coalesce, merges_what_receive_offload_would_and_nothing_else) {
    const struct {
        const char *what;
        std::function<void(bytes *second)> change;
        size_t expected = 2; // writes
        uint8_t protocol = PROTOCOL_TCP;
        bool mended = true; // after the change
    } rows[] = {
        {"next segment", [](bytes *) {}, 1},
        {"next segment with PSH", [](bytes *p) { tcp_header(p)->flags |= TCP_PSH; }, 1},
        {"shorter", [](bytes *p) { p->resize(p->size() - 50); }, 1},
        {"same id under DF", [](bytes *p) { ip_header(p)->id = to_be16(0xfffe); }, 1},
        {"longer", [](bytes *p) { p->resize(p->size() + 1); }},
        {"no payload", [](bytes *p) { p->resize(52); }},
        {"source", [](bytes *p) { ip_header(p)->source.bytes[3]++; }},
        {"destination", [](bytes *p) { ip_header(p)->destination.bytes[3]++; }},
        {"source port", [](bytes *p) { tcp_header(p)->source_port.bytes[1]++; }},
        {"destination port", [](bytes *p) { tcp_header(p)->destination_port.bytes[1]++; }},
        {"acknowledgement", [](bytes *p) { tcp_header(p)->acknowledgement.bytes[3]++; }},
        {"gap", [](bytes *p) { tcp_header(p)->sequence.bytes[3]++; }},
        {"window", [](bytes *p) { tcp_header(p)->window.bytes[1]++; }},
        {"id", [](bytes *p) { ip_header(p)->id.bytes[1]++; }},
        {"TTL", [](bytes *p) { ip_header(p)->ttl--; }},
        {"TOS", [](bytes *p) { ip_header(p)->tos = 3; }},
        {"DF", [](bytes *p) { ip_header(p)->fragment = to_be16(0); }},
        {"fragment", [](bytes *p) { ip_header(p)->fragment = to_be16(0x2000); }},
        {"TCP options", [](bytes *p) { (*p)[51]++; }},
        {"length of TCP options", [](bytes *p) { tcp_header(p)->data_offset = 0x70; }},
        {"FIN", [](bytes *p) { tcp_header(p)->flags |= TCP_FIN; }},
        {"ECN echo", [](bytes *p) { tcp_header(p)->flags |= 0x40; }},
        {"urgent", [](bytes *p) { tcp_header(p)->urgent = to_be16(1); }},
        {"IP options",
         [](bytes *p) {
             ip_header(p)->version_ihl = 0x46;
             p->insert(p->begin() + 20, 4, 1);
         }},
        {"TCP checksum", [](bytes *p) { p->back()++; }, 2, PROTOCOL_TCP, false},
        {"next datagram", [](bytes *) {}, 1, PROTOCOL_UDP},
        {"shorter datagram", [](bytes *p) { p->pop_back(); }, 2, PROTOCOL_UDP},
        {"no UDP checksum", [](bytes *p) { (*p)[26] = (*p)[27] = 0; }, 2, PROTOCOL_UDP, false},
        {"UDP checksum", [](bytes *p) { p->back()++; }, 2, PROTOCOL_UDP, false},
    };
    for (const auto &row : rows) {
        SCOPED_TRACE(row.what);
        std::vector<bytes> packets = {make_packet(row.protocol, 0, 100), make_packet(row.protocol, 1, 100)};
        row.change(&packets[1]);
        if (row.mended)
            fix_checksums(&packets[1]);
        merge_packets(packets);
        ASSERT_EQ(writes.size(), row.expected);
        EXPECT_TRUE(row.expected == 1 || writes[0].packet == packets[1] || writes[1].packet == packets[1]);
        // In reverse order: the properties of the first packet matter as well.
        merge_packets({packets[1], packets[0]});
        EXPECT_EQ(writes.size(), 2u);
    }
    // A first packet with a wrong checksum is not merged, but the others are.
    bytes first = make_packet(PROTOCOL_TCP, 0, 100);
    first.back()++;
    merge_packets({first, make_packet(PROTOCOL_TCP, 1, 100), make_packet(PROTOCOL_TCP, 2, 100)});
    ASSERT_EQ(writes.size(), 2u);
    EXPECT_EQ(writes[0].packet, first);
    EXPECT_EQ(writes[1].packets, 2u);
    merge_packets({make_packet(PROTOCOL_UDP, 0, 100), make_packet(PROTOCOL_UDP, 1, 100)}, false);
    EXPECT_EQ(writes.size(), 2u);
}

TEST(coalesce, splitting_gives_back_what_was_merged) {
    for (const uint8_t protocol : {PROTOCOL_TCP, PROTOCOL_UDP}) {
        std::vector<bytes> packets;
        for (uint32_t i = 0; i < 150; i++) // more than one large packet holds; ids and sequence numbers wrap
            packets.push_back(make_packet(protocol, i, 100));
        bytes other = make_packet(protocol, 0, 100); // another flow in between
        ip_header(&other)->source.bytes[0] = 9;
        fix_checksums(&other);
        merge_packets(packets);
        ASSERT_EQ(writes.size(), 3u);
        EXPECT_EQ(split_writes(), packets);
        merge_packets({packets[0], other, packets[1], packets[2]});
        ASSERT_EQ(writes.size(), 2u);
        EXPECT_EQ(writes[0].packets + writes[1].packets, 4u);
    }
    // PSH and a short segment end a merged packet. CWR and FIN of a large packet appear in one segment only.
    std::vector<bytes> packets;
    for (uint32_t i = 0; i < 5; i++)
        packets.push_back(make_packet(PROTOCOL_TCP, i, i == 4 ? 30 : 100));
    tcp_header(&packets[1])->flags |= TCP_PSH;
    fix_checksums(&packets[1]);
    merge_packets(packets);
    ASSERT_EQ(writes.size(), 2u);
    EXPECT_EQ(split_writes(), packets);
    tcp_header(&writes[1].packet)->flags |= TCP_FIN | TCP_CWR;
    const std::vector<bytes> split = split_writes();
    const auto flags = [&split](size_t i) { return split[i][33]; };
    ASSERT_EQ(split.size(), 5u);
    EXPECT_EQ(std::vector<int>({flags(2), flags(3), flags(4)}),
              std::vector<int>({TCP_ACK | TCP_CWR, TCP_ACK, TCP_ACK | TCP_FIN}));

    // The partial checksum of a packet that is not large is completed; one beyond the packet's end is
    // refused.
    bytes packet = make_packet(PROTOCOL_TCP, 1, 11), partial = packet;
    tcp_header(&partial)->checksum =
        checksum_fold(checksum_pseudo(*ip_header(&partial), partial.size() - 20));
    writes = {{{VIRTIO_NEEDS_CHECKSUM, 0, 0, 0, 20, 16}, partial, 1}};
    EXPECT_EQ(split_writes(), std::vector<bytes>({packet}));
    const virtio_header hostile[] = {
        {VIRTIO_NEEDS_CHECKSUM, 0, 0, 0, 20, 43},  {VIRTIO_NEEDS_CHECKSUM, 0, 0, 0, 65535, 65535},
        {VIRTIO_NEEDS_CHECKSUM, 1, 0, 0, 20, 16},  {VIRTIO_NEEDS_CHECKSUM, 1, 0, 100, 20, 6},
        {VIRTIO_NEEDS_CHECKSUM, 5, 0, 100, 20, 6}, {VIRTIO_NEEDS_CHECKSUM, 3, 0, 100, 20, 16},
        {0, VIRTIO_LARGE_TCP4, 0, 100, 20, 16},
    };
    for (const virtio_header &header : hostile) {
        packet_split ignored;
        EXPECT_FALSE(split_begin(&ignored, header, partial.data(), partial.size()));
    }
}

// --- Live: this process is the appliance, and the router is in another network namespace

constexpr uint32_t APPLIANCE = 0x0a000001, ROUTER = 0x0a000002, STRANGER = 0x0a000003;
constexpr uint32_t AT_LINK = 0xc0a80901; // the link's address here
constexpr size_t LARGE_DATAGRAM = 30000, PARTIAL_DATAGRAM = 501;

void run_shell(const std::string &command) {
    ASSERT_EQ(system(command.c_str()), 0) << command;
}

void send_gre(uint32_t source, const bytes &payload) {
    const int fd = socket(AF_INET, SOCK_RAW, IPPROTO_GRE);
    const sockaddr_in to = address_of(APPLIANCE);
    EXPECT_EQ(bind_to(fd, source), 0);
    EXPECT_EQ(
        sendto(fd, payload.data(), payload.size(), 0, reinterpret_cast<const sockaddr *>(&to), sizeof to),
        static_cast<ssize_t>(payload.size()));
    close(fd);
}

// The next packet from a socket, or bytes from a pipe; empty: there are none.
bytes receive_packet(int fd, int ms = 3000) {
    pollfd comes = {fd, POLLIN, 0};
    bytes got(LARGE_DATAGRAM + 1);
    const ssize_t length = poll(&comes, 1, ms) == 1 ? read(fd, got.data(), got.size()) : 0;
    got.resize(static_cast<size_t>(std::max<ssize_t>(length, 0)));
    return got;
}

// Sends packets of each kind as the router, and checks the one that is returned.
void send_by_hand() {
    const int back = socket(AF_INET, SOCK_RAW, IPPROTO_GRE);
    bytes packet = make_packet(PROTOCOL_UDP, 1, 1472);
    // Larger than a frame of the ring.
    const bytes large = make_packet(PROTOCOL_UDP, 2, LARGE_DATAGRAM, AT_LINK);
    send_gre(STRANGER, wrap_in_gre(0, GRE_TYPE_IPV4, packet));
    send_gre(ROUTER, wrap_in_gre(0x2000, GRE_TYPE_IPV4, packet, {0, 0, 0, 1}));
    send_gre(ROUTER, wrap_in_gre(GRE_CHECKSUM, GRE_TYPE_IPV4, large));
    send_gre(ROUTER, wrap_in_gre(0, GRE_TYPE_REDIRECT, packet, REDIRECT));
    const bytes got = receive_packet(back);
    close(back);
    ip_header(&packet)->ttl--;
    fix_checksums(&packet);
    ASSERT_GE(got.size(), 20u);
    EXPECT_EQ(bytes(got.begin() + 20, got.end()), wrap_in_gre(0, GRE_TYPE_REDIRECT, packet, REDIRECT));
}

// Sends a datagram as a kernel on the same machine does, with a checksum that the device would complete.
void send_partial() {
    bytes inner = make_packet(PROTOCOL_UDP, 3, PARTIAL_DATAGRAM, AT_LINK);
    header_at<udp_wire_header>(&inner, 20)->checksum =
        checksum_fold(checksum_pseudo(*ip_header(&inner), inner.size() - 20));
    bytes packet = make_ip_packet(PROTOCOL_GRE, ROUTER, APPLIANCE, wrap_in_gre(0, GRE_TYPE_IPV4, inner));
    ether_header ether = {{2, 0, 0, 0, 0, 1}, {2, 0, 0, 0, 0, 2}, htons(ETHERTYPE_IP)};
    virtio_header header = {VIRTIO_NEEDS_CHECKSUM, 0, 0, 0, sizeof ether + 20 + 4 + 20, 6};
    iovec parts[] = {{&header, sizeof header}, {&ether, sizeof ether}, {packet.data(), packet.size()}};
    sockaddr_ll device = {};
    device.sll_family = AF_PACKET;
    device.sll_ifindex = static_cast<int>(if_nametoindex("vr"));
    const int fd = socket(AF_PACKET, SOCK_RAW, 0), on = 1;
    EXPECT_EQ(setsockopt(fd, SOL_PACKET, PACKET_VNET_HDR, &on, sizeof on), 0);
    EXPECT_EQ(bind(fd, reinterpret_cast<const sockaddr *>(&device), sizeof device), 0);
    EXPECT_GT(writev(fd, parts, 3), 0);
    close(fd);
}

// Three packets that may take the shortcut, of 36, 37 and 38 bytes, and some that may not.
void send_for_shortcut() {
    const bytes plain = make_packet(PROTOCOL_UDP, 1, 8, AT_LINK);
    bytes corrupt = plain, fragment = plain, cut = plain;
    ip_header(&corrupt)->ttl--;
    ip_header(&fragment)->fragment = to_be16(0x2000);
    fix_checksums(&fragment);
    cut.pop_back();
    for (const bytes &content : {corrupt, fragment, cut, make_packet(PROTOCOL_TCP, 1, 8, AT_LINK)})
        send_gre(ROUTER, wrap_in_gre(0, GRE_TYPE_REDIRECT, content, REDIRECT));
    send_gre(ROUTER, wrap_in_gre(GRE_CHECKSUM, GRE_TYPE_IPV4, plain));
    send_gre(ROUTER, wrap_in_gre(0, 0x86dd, plain));
    send_gre(STRANGER, wrap_in_gre(0, GRE_TYPE_IPV4, plain));
    send_gre(ROUTER, wrap_in_gre(0, GRE_TYPE_IPV4, plain));
    send_gre(ROUTER, wrap_in_gre(0, GRE_TYPE_REDIRECT, make_packet(PROTOCOL_UDP, 1, 9, AT_LINK)));
    send_gre(ROUTER, wrap_in_gre(0, GRE_TYPE_REDIRECT, make_packet(PROTOCOL_UDP, 1, 10, AT_LINK), REDIRECT));
}

// Makes this process the appliance `self`, which takes `other` for the owner of all flows.
bool believe_in_other(uint32_t self, uint32_t other, bool by_mask) {
    appliance_view view;
    view.tunnels[1] = {self, ROUTER};
    view.groups[51] = {"", self, 0, false, {{ROUTER, ROUTER, travel::gre, travel::gre}}};
    view.intercepts[51].to = 3128;
    view.protections[51] = {by_mask, {}, {other}, std::vector<uint32_t>(by_mask ? 1 : 256, other)};
    std::map<std::string, uint32_t> indices;
    std::string error;
    const bool done = user_plane.open(&error) &&
                      reconcile_kernel_state(user_plane, make_wanted_state(view, {}, true), &indices, &error);
    EXPECT_TRUE(done) << error;
    return done;
}

struct live_plane : testing::Test {
    const int home = open("/proc/self/ns/net", O_RDONLY), datagrams = socket(AF_INET, SOCK_DGRAM, 0);
    int router = -1; // its namespace
    std::string error;

    void SetUp() override {
        ASSERT_EQ(bind_to(datagrams, INADDR_ANY, 80), 0);
        ASSERT_EQ(unshare(CLONE_NEWNET), 0);
        router = open("/proc/self/ns/net", O_RDONLY);
        run_shell("ip link add vr type veth peer name va address 02:00:00:00:00:01 netns /proc/" +
                  std::to_string(getpid()) + "/fd/" + std::to_string(home));
        run_shell("ip addr add 10.0.0.2/24 dev vr && ip addr add 10.0.0.3/24 dev vr && ip link set vr up");
        ASSERT_EQ(setns(home, CLONE_NEWNET), 0);
        run_shell("ip addr add 10.0.0.1/24 dev va && ip link set va up");
    }
    void TearDown() override {
        user_plane.close();
        user_plane_settings = {};
        EXPECT_TRUE(user_plane.drop_link("wccp0", &error)) << error;
        EXPECT_EQ(if_nametoindex("wccp0"), 0u);
        run_shell("ip link del va");
        for (const int fd : {home, router, datagrams})
            close(fd);
    }
    void act_as_router(const std::function<void()> &steps) const {
        ASSERT_EQ(setns(router, CLONE_NEWNET), 0);
        steps();
        ASSERT_EQ(setns(home, CLONE_NEWNET), 0);
    }
    // Has wccp0 take the datagrams that send_...() send to it, and what they send elsewhere leave by it.
    static void use_link() {
        run_shell("ip addr add 192.168.9.1/24 dev wccp0 && ip link set wccp0 up && "
                  "ip route add 203.0.113.0/24 dev wccp0 && cd /proc/sys/net/ipv4/conf && "
                  "echo 0 >all/rp_filter && echo 0 >wccp0/rp_filter && echo 1 >wccp0/forwarding && "
                  "echo 0 >wccp0/send_redirects");
    }
};

// Connections through the plane: scenario_traffic.
TEST_F(live_plane, delivers_and_returns_packets_of_each_kind) {
    uint32_t index = 0;
    user_plane_settings.redirect_header = true;
    ASSERT_TRUE(user_plane.probe(&error)) << error;
    ASSERT_TRUE(user_plane.open(&error)) << error;
    const link_wish wish = {1, APPLIANCE, ROUTER};
    ASSERT_TRUE(user_plane.make_link("wccp0", wish, &index, &error)) << error;
    EXPECT_EQ(index, if_nametoindex("wccp0"));
    use_link();

    // A redirected packet that no proxy wants is returned with its redirect header.
    act_as_router(send_by_hand);
    plane_counters counters;
    user_plane.read_counters(&counters);
    link_counters link = counters.links["wccp0"];
    EXPECT_EQ(link.packets_in, 2u);
    EXPECT_EQ(link.bytes_in, 1500u + LARGE_DATAGRAM + 28);
    EXPECT_EQ(receive_packet(datagrams).size(), LARGE_DATAGRAM);
    EXPECT_EQ(link.packets_out, 1u);
    EXPECT_EQ(link.refused[REFUSED_FLAGS], 1u);
    EXPECT_EQ(counters.refused[REFUSED_SOURCE], 1u);
    EXPECT_EQ(counters.refused_sources, (std::map<uint32_t, uint64_t>{{STRANGER, 1}}));

    act_as_router(send_partial);
    EXPECT_EQ(receive_packet(datagrams).size(), PARTIAL_DATAGRAM);

    // An interface that was deleted is made again, and the thread does not spin until then.
    run_shell("ip link del wccp0");
    usleep(100000);
    const clock_t before = clock(); // processor time, of all threads
    usleep(300000);
    EXPECT_LT(clock() - before, CLOCKS_PER_SEC / 20);
    ASSERT_TRUE(user_plane.make_link("wccp0", wish, &index, &error)) << error;
    EXPECT_EQ(index, if_nametoindex("wccp0"));
    run_shell("ip link set wccp0 up");
}

TEST_F(live_plane, only_valid_udp_of_a_link_takes_the_shortcut) {
    packet_shortcut shortcut;
    tun_device tun;
    if (!shortcut_open(&shortcut, &error))
        GTEST_SKIP() << error;
    ASSERT_TRUE(tun_open("wccp0", &tun, &error)) << error;
    use_link();
    shortcut_follow_devices(&shortcut);
    EXPECT_EQ(shortcut.devices.size(), 2u); // va, wccp0
    shortcut_add_link(&shortcut, APPLIANCE, ROUTER, tun.index);
    for (const bool known : {true, false}) {
        act_as_router(send_for_shortcut);
        for (const size_t length : {8u, 9u, 10u})
            EXPECT_EQ(receive_packet(datagrams, known ? 3000 : 100).size(), known ? length : 0);
        const shortcut_link taken = shortcut_count(shortcut, APPLIANCE, ROUTER);
        EXPECT_EQ(taken.packets, known ? 3u : 0u);
        EXPECT_EQ(taken.bytes, known ? 36u + 37 + 38 : 0u);
        EXPECT_EQ(taken.redirect_headers, known ? 1u : 0u);
        shortcut_drop_link(&shortcut, APPLIANCE, ROUTER);
    }
    close(tun.fd);
    shortcut_close(&shortcut);
}

// The other one is a process in the router's namespace.
TEST_F(live_plane, two_that_take_each_other_for_the_owner_exchange_a_packet_once) {
    for (const bool by_mask : {true, false}) {
        SCOPED_TRACE(by_mask);
        int ready[2];
        ASSERT_EQ(pipe(ready), 0);
        const pid_t other = start_child([&] {
            close_kernel_socket(); // it belongs to the appliance's namespace
            const bool done =
                setns(router, CLONE_NEWNET) == 0 && unshare(CLONE_NEWNS) == 0 &&
                system("mount --make-rprivate / && mount -t tmpfs tmpfs /run && ip link set lo up") == 0 &&
                believe_in_other(STRANGER, APPLIANCE, by_mask);
            return done && write(ready[1], "", 1) == 1 ? pause() : 1;
        });
        close(ready[1]);
        EXPECT_EQ(receive_packet(ready[0]).size(), 1u) << "the other one has failed";
        close(ready[0]);
        EXPECT_TRUE(believe_in_other(APPLIANCE, STRANGER, by_mask));
        // A packet of a flow that neither appliance knows. The other one has to return it, once.
        act_as_router([] {
            const int back = socket(AF_INET, SOCK_RAW, IPPROTO_GRE);
            send_gre(ROUTER,
                     wrap_in_gre(0, GRE_TYPE_REDIRECT, make_packet(PROTOCOL_TCP, 1, 9), {0x80, 51, 0, 9}));
            bytes got = receive_packet(back);
            ASSERT_EQ(got.size(), 24 + 61u);
            EXPECT_EQ(to_host(ip_header(&got)->source), STRANGER);
            EXPECT_EQ(header_at<ip4_wire_header>(&got, 24)->ttl, 58);
            EXPECT_EQ(receive_packet(back, 300), bytes());
            close(back);
        });
        plane_counters counters;
        user_plane.read_counters(&counters);
        EXPECT_EQ(counters.links["wccp1"].packets_out, 1); // the member's
        EXPECT_EQ(counters.links["wccp1"].packets_in, 0);
        EXPECT_EQ(counters.links["wccp0"].packets_out, 0);
        EXPECT_TRUE(remove_kernel_state(user_plane, &error)) << error;
        user_plane.close();
        kill(other, SIGKILL);
        wait_for_child(other);
    }
}

} // namespace
