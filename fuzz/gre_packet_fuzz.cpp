// Fuzzer for the packet path of the user-space data plane, without the kernel. Packets in GRE are read,
// merged, split again and compared with the originals; reads from a TUN device are split.
//
// An input is a mode byte, followed by frames or, if its lowest bit is set, by one read from a TUN device. A
// frame is a 16-bit length and that many bytes of GRE. A length with the highest bit set repeats the last
// frame as the next segments of its flow. All packets are in memory blocks of exactly their size.
#include <cstring>
#include <map>
#include <memory>

#include "fuzz/require.h"
#include "peers/tunneld/gre.h"
#include "peers/tunneld/passing.h"
#include "tests/support/packets.h"

namespace {

enum mode : uint8_t {
    TUN_READ = 1,
    MENDED = 2,     // corrects lengths and checksums as far as possible
    UDP_MERGED = 4, // the device accepts large UDP packets
    FLUSHED = 8,    // flushes after each fifth frame
};
constexpr size_t MAX_FRAMES = 300, MAX_FRAME_BYTES = 100000; // more than fits into one large packet

struct exact_memory {
    explicit exact_memory(const bytes &content) : length(content.size()), memory(new uint8_t[length]) {
        if (length)
            memcpy(memory.get(), content.data(), length);
    }
    size_t length;
    std::unique_ptr<uint8_t[]> memory;
};

// The offset of the inner packet after a typical GRE header.
size_t offset_of_packet(const bytes &gre) {
    if (gre.size() < 5)
        return gre.size();
    size_t at = gre[0] & 0x80 ? 8 : 4;
    if (gre[2] == 0x88 && at < gre.size() && gre[at] >> 4 != 4)
        at += 4;
    return at < gre.size() ? at : gre.size();
}

void mend_frame(bytes *gre) {
    const size_t at = offset_of_packet(*gre);
    mend_packet(gre->data() + at, gre->size() - at);
    if (gre->size() < 8 || !(gre->at(0) & 0x80))
        return;
    gre->at(4) = gre->at(5) = 0;
    const be16 sum = checksum_finish(checksum_add(0, gre->data(), gre->size()));
    memcpy(gre->data() + 4, &sum, sizeof sum);
}

// Turns the frame into the next segment of the same flow.
void advance_segment(bytes *gre) {
    const size_t at = offset_of_packet(*gre);
    if (gre->size() - at < sizeof(ip4_wire_header) + sizeof(tcp_wire_header))
        return;
    ip4_wire_header *ip = ip_of(gre->data() + at);
    ip->id = to_be16(static_cast<uint16_t>(to_host(ip->id) + 1));
    auto *tcp = reinterpret_cast<tcp_wire_header *>(ip + 1);
    const size_t headers = sizeof *ip + tcp_header_length(*tcp);
    if (ip->protocol == PROTOCOL_TCP && gre->size() - at > headers)
        tcp->sequence = to_be32(static_cast<uint32_t>(to_host(tcp->sequence) + gre->size() - at - headers));
}

// Packets in order, by flow, or by addresses if there are no ports. The order is kept only within these.
using flow_table = std::map<bytes, std::vector<bytes>>;
void keep_packet(flow_table *table, bytes packet) {
    ip4_wire_header *ip = ip_of(packet.data());
    bytes key(packet.begin() + 9, packet.begin() + 10);
    key.insert(key.end(), packet.begin() + 12, packet.begin() + 20);
    be16 *const checksum = transport_checksum(packet.data(), packet.size());
    if (checksum && ip4_header_length(*ip) == sizeof *ip)
        key.insert(key.end(), packet.begin() + 20, packet.begin() + 24);
    if (checksum && to_host(*checksum) == 0 && ip->protocol == PROTOCOL_TCP)
        *checksum = to_be16(0xffff); // another representation of 0
    if (to_host(ip->fragment) & IP4_DONT_FRAGMENT)
        ip->id = ip->checksum = {}; // merging may change the ids
    (*table)[key].push_back(std::move(packet));
}

flow_table packets_in, packets_out;
uint64_t packets_written;

void split_and_keep(const virtio_header &header, const bytes &content) {
    exact_memory packet(content);
    packet_split split;
    REQUIRE(split_begin(&split, header, packet.memory.get(), packet.length));
    for (split_segment segment; split_next(&split, &segment);)
        keep_packet(&packets_out, join_segment(segment));
}

void check_write(void *, const iovec *parts, size_t count, uint32_t packets) {
    REQUIRE(count >= 2 && count <= 2 + COALESCED_SEGMENTS && packets >= 1);
    REQUIRE(parts[0].iov_len == sizeof(virtio_header));
    virtio_header header;
    memcpy(&header, parts[0].iov_base, sizeof header);
    const bytes packet = join_parts(parts, count);
    REQUIRE(packet.size() <= IP4_MAX_PACKET && ip4_is_valid(packet.data(), packet.size()));
    uint32_t segments = 1;
    if (packets > 1)
        REQUIRE(large_packet_is_valid(header, packet.data(), packet.size(), &segments));
    REQUIRE(segments == packets && (header.gso_type != VIRTIO_NOT_LARGE) == (packets > 1));
    packets_written += packets;
    split_and_keep(header, packet);
}

// A table by which all packets are passed on to another member.
const passing_lookup &make_passing_lookup() {
    static const passing_lookup *const lookup = [] {
        passing_table table;
        for (uint32_t service = 0; service < 256; service++)
            table[static_cast<uint8_t>(service)] = {1, service % 2 == 0, {}, std::vector<uint32_t>(256, 2)};
        auto *made = new passing_lookup;
        fill_passing_lookup(table, made);
        return made;
    }();
    return *lookup;
}

// Reads a frame and gives its inner packet, in the memory of `frame`, to the coalescer; false if it is
// refused.
bool read_frame(coalescer *merger, exact_memory *frame) {
    gre_outer outer;
    if (read_gre_outer(frame->memory.get(), frame->length, &outer) != REFUSALS)
        return false;
    REQUIRE(outer.local == 0x0a000002 && outer.remote == 0x0a000001);
    gre_content content;
    if (read_gre_payload(outer.payload, outer.length, false, &content) != REFUSALS)
        return false;
    REQUIRE(ip4_is_valid(content.packet, content.length));
    uint32_t local = 0;
    if (find_passing_member(make_passing_lookup(), content, &local))
        REQUIRE(content.has_redirect && local == 1);
    keep_packet(&packets_in, bytes(content.packet, content.packet + content.length));
    coalesce_packet(merger, nullptr, content.packet, content.length);
    return true;
}

void fuzz_frames(uint8_t mode, const uint8_t *data, size_t size) {
    static coalescer merger;
    merger.sink = check_write;
    merger.merge_udp = mode & UDP_MERGED;
    packets_in.clear();
    packets_out.clear();
    packets_written = 0;
    std::vector<exact_memory> frames; // the coalescer refers to them until the flush
    bytes gre;
    uint64_t accepted = 0;
    size_t carried = 0;
    while (size >= 2 && frames.size() < MAX_FRAMES) {
        const size_t head = static_cast<size_t>(data[0]) << 8 | data[1];
        data += 2;
        size -= 2;
        size_t times = 1;
        if (head & 0x8000) {
            times = (head & 0x7f) + 1;
        } else {
            const size_t length = head < size ? head : size;
            gre.assign(data, data + length);
            data += length;
            size -= length;
        }
        for (; times > 0 && frames.size() < MAX_FRAMES && carried < MAX_FRAME_BYTES; times--) {
            carried += gre.size();
            if (head & 0x8000)
                advance_segment(&gre);
            if (mode & MENDED)
                mend_frame(&gre);
            frames.emplace_back(make_ip_packet(PROTOCOL_GRE, 0x0a000001, 0x0a000002, gre));
            accepted += read_frame(&merger, &frames.back());
            if ((mode & FLUSHED) && frames.size() % 5 == 0)
                coalesce_flush(&merger);
        }
    }
    coalesce_flush(&merger);
    REQUIRE(merger.used == 0 && packets_written == accepted);
    REQUIRE(packets_in == packets_out);
}

void fuzz_tun_read(uint8_t mode, const uint8_t *data, size_t size) {
    virtio_header header;
    if (size < sizeof header)
        return;
    memcpy(&header, data, sizeof header);
    bytes content(data + sizeof header, data + size);
    if (mode & MENDED)
        mend_packet(content.data(), content.size());
    exact_memory packet(content);
    packet_split split;
    if (!split_begin(&split, header, packet.memory.get(), packet.length))
        return;
    const size_t headers = split.header_length;
    size_t payload = 0, segments = 0;
    for (split_segment segment; split_next(&split, &segment); segments++) {
        payload += segment.payload_length;
        bytes one = join_segment(segment);
        REQUIRE(segment.header_length == headers && one.size() <= packet.length);
        if (header.gso_type == VIRTIO_NOT_LARGE)
            continue;
        REQUIRE(ip4_is_valid(one.data(), one.size()) && segment.payload_length <= header.segment_size);
        const size_t ip = ip4_header_length(*ip_of(one.data()));
        REQUIRE(checksum_is_right(checksum_add(checksum_pseudo(*ip_of(one.data()), one.size() - ip),
                                               one.data() + ip, one.size() - ip)));
    }
    REQUIRE(headers + payload <= packet.length && segments <= packet.length / MIN_SEGMENT_SIZE + 1);
    REQUIRE(header.gso_type == VIRTIO_NOT_LARGE || headers + payload == packet.length);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size == 0)
        return 0;
    if (data[0] & TUN_READ)
        fuzz_tun_read(data[0], data + 1, size - 1);
    else
        fuzz_frames(data[0], data + 1, size - 1);
    return 0;
}
