#include "peers/tunneld/coalesce.h"

#include <bit>
#include <cstring>

namespace {

const ip4_wire_header *ip_of(const uint8_t *packet) {
    return reinterpret_cast<const ip4_wire_header *>(packet);
}
// For packets without IP options. Others are not merged.
const tcp_wire_header *tcp_of(const uint8_t *packet) {
    return reinterpret_cast<const tcp_wire_header *>(packet + sizeof(ip4_wire_header));
}
const udp_wire_header *udp_of(const uint8_t *packet) {
    return reinterpret_cast<const udp_wire_header *>(packet + sizeof(ip4_wire_header));
}

// Whether the packet is TCP or UDP with its complete header, without IP options and not a fragment.
bool has_ports(const uint8_t *packet, size_t length) {
    const ip4_wire_header *ip = ip_of(packet);
    if (ip4_header_length(*ip) != sizeof *ip || (to_host(ip->fragment) & IP4_FRAGMENT))
        return false;
    return (ip->protocol == PROTOCOL_TCP && length >= sizeof *ip + sizeof(tcp_wire_header)) ||
           (ip->protocol == PROTOCOL_UDP && length >= sizeof *ip + sizeof(udp_wire_header));
}

// The length of both headers if the packet can be merged with others, otherwise 0.
size_t find_mergeable_headers(const coalescer *merger, const uint8_t *packet, size_t length) {
    // Fragments have been excluded before. The kernel's receive offload does not merge packets with the
    // reserved bit either.
    if (to_host(ip_of(packet)->fragment) & ~IP4_DONT_FRAGMENT)
        return 0;
    size_t headers = sizeof(ip4_wire_header);
    if (ip_of(packet)->protocol == PROTOCOL_UDP) {
        const udp_wire_header *udp = udp_of(packet);
        headers += sizeof *udp;
        // A merged packet always has a checksum, which its segments would then get as well.
        const bool has_checksum = to_host(udp->checksum) != 0;
        if (!merger->merge_udp || !has_checksum || to_host(udp->length) != length - sizeof(ip4_wire_header))
            return 0;
    } else {
        const tcp_wire_header *tcp = tcp_of(packet);
        headers += tcp_header_length(*tcp);
        // Any other flag applies to its own segment and not to the whole of a merged packet.
        if (tcp_header_length(*tcp) < sizeof *tcp || (tcp->flags & ~TCP_PSH) != TCP_ACK)
            return 0;
    }
    // The splitter, like the kernel, refuses smaller segments.
    return length >= headers + MIN_SEGMENT_SIZE ? headers : 0;
}

bool transport_is_right(const uint8_t *packet, size_t length) {
    const size_t transport = length - sizeof(ip4_wire_header);
    return checksum_is_right(checksum_add(checksum_pseudo(*ip_of(packet), transport),
                                          packet + sizeof(ip4_wire_header), transport));
}

size_t find_flow_slot(const void *target, const uint8_t *packet) {
    uint64_t addresses;
    memcpy(&addresses, &ip_of(packet)->source, sizeof addresses);
    uint32_t ports;
    memcpy(&ports, packet + sizeof(ip4_wire_header), sizeof ports);
    const uint64_t key = addresses ^ (uint64_t{ports} << 16) ^ reinterpret_cast<uintptr_t>(target);
    // Multiplicative hashing: the upper bits depend on all bits of the key, and six of them number 64 slots.
    return (key * 0x9e3779b97f4a7c15u) >> 58;
}

bool same_flow(const coalesced_flow &flow, const void *target, const uint8_t *packet) {
    return flow.target == target && ip_of(flow.first)->protocol == ip_of(packet)->protocol &&
           memcmp(&ip_of(flow.first)->source, &ip_of(packet)->source, 8) == 0 &&
           memcmp(flow.first + sizeof(ip4_wire_header), packet + sizeof(ip4_wire_header), 4) == 0;
}

// Whether the fields that all packets of a merged one have to share are the same.
bool same_headers(const coalesced_flow &flow, const uint8_t *packet) {
    const ip4_wire_header *a = ip_of(flow.first), *b = ip_of(packet);
    if (a->tos != b->tos || a->ttl != b->ttl || !(a->fragment == b->fragment))
        return false;
    if (a->protocol == PROTOCOL_UDP)
        return true;
    const tcp_wire_header *s = tcp_of(flow.first), *t = tcp_of(packet);
    // With timestamps among the options, only segments of the same tick of the sender's clock are merged.
    return s->acknowledgement == t->acknowledgement && s->data_offset == t->data_offset &&
           s->window == t->window && s->urgent == t->urgent &&
           memcmp(s + 1, t + 1, tcp_header_length(*s) - sizeof *s) == 0;
}

// When the kernel splits a packet, it numbers the ids of the segments consecutively. With DF the id has no
// meaning, and some senders use the same one for all.
bool id_follows(const coalesced_flow &flow, const uint8_t *packet) {
    const ip4_wire_header *ip = ip_of(packet);
    const uint16_t from_first = static_cast<uint16_t>(to_host(ip->id) - flow.first_id);
    // The second packet decides whether the ids of this flow advance by 1 or stay the same.
    if (flow.count == 1)
        return from_first == 1 || (from_first == 0 && (to_host(ip->fragment) & IP4_DONT_FRAGMENT));
    return from_first == static_cast<uint16_t>(flow.id_step * flow.count);
}

bool can_follow(coalesced_flow *flow, const uint8_t *packet, size_t length, size_t headers) {
    const size_t payload = length - headers;
    const bool tcp = ip_of(packet)->protocol == PROTOCOL_TCP;
    // One size describes all segments: only the last one may be shorter, and with UDP not even that.
    if (headers != flow->header_length || flow->pushed || flow->count == COALESCED_SEGMENTS ||
        payload > flow->segment_size || (!tcp && payload != flow->segment_size) ||
        headers + flow->payload + payload > IP4_MAX_PACKET || !same_headers(*flow, packet) ||
        (tcp && to_host(tcp_of(packet)->sequence) != flow->next_sequence) || !id_follows(*flow, packet))
        return false;
    // The merged packet gets a new checksum, which would hide that an old one was wrong.
    // The first packet is checked only now, since alone it would have kept its own checksum.
    if (!flow->verified && !transport_is_right(flow->first, flow->packet_length))
        return false;
    flow->verified = true;
    return transport_is_right(packet, length);
}

void write_unmerged(coalescer *merger, void *target, const uint8_t *packet, size_t length) {
    static const virtio_header plain = {};
    const iovec parts[2] = {{const_cast<virtio_header *>(&plain), sizeof plain},
                            {const_cast<uint8_t *>(packet), length}};
    merger->sink(target, parts, 2, 1);
}

// Writes the headers of the merged packet. The transport checksum is partial, as the TUN device expects it.
void write_merged_headers(const coalesced_flow &flow, uint8_t *out) {
    memcpy(out, flow.first, flow.header_length);
    auto *ip = reinterpret_cast<ip4_wire_header *>(out);
    const size_t total = flow.header_length + flow.payload, transport = total - sizeof *ip;
    ip->total_length = to_be16(static_cast<uint16_t>(total));
    ip->checksum = {};
    ip->checksum = checksum_finish(checksum_add(0, ip, sizeof *ip));
    // Only the sum of the pseudo-header. The kernel adds the rest when it splits the packet.
    const be16 partial = checksum_fold(checksum_pseudo(*ip, transport));
    if (ip->protocol == PROTOCOL_UDP) {
        auto *udp = reinterpret_cast<udp_wire_header *>(ip + 1);
        udp->length = to_be16(static_cast<uint16_t>(transport));
        udp->checksum = partial;
        return;
    }
    auto *tcp = reinterpret_cast<tcp_wire_header *>(ip + 1);
    if (flow.pushed)
        tcp->flags |= TCP_PSH;
    tcp->checksum = partial;
}

void flush_flow(coalescer *merger, coalesced_flow *flow) {
    merger->used &= ~(uint64_t{1} << (flow - merger->flows));
    if (flow->count == 1)
        return write_unmerged(merger, flow->target, flow->first, flow->packet_length);
    uint8_t headers[sizeof(ip4_wire_header) + TCP_MAX_HEADER];
    write_merged_headers(*flow, headers);
    const bool udp = ip_of(flow->first)->protocol == PROTOCOL_UDP;
    virtio_header virtio = {};
    virtio.flags = VIRTIO_NEEDS_CHECKSUM;
    virtio.gso_type = udp ? VIRTIO_LARGE_UDP : VIRTIO_LARGE_TCP4;
    virtio.header_length = static_cast<uint16_t>(flow->header_length);
    virtio.segment_size = static_cast<uint16_t>(flow->segment_size);
    virtio.checksum_start = sizeof(ip4_wire_header);
    virtio.checksum_offset = udp ? offsetof(udp_wire_header, checksum) : offsetof(tcp_wire_header, checksum);
    flow->parts[0] = {&virtio, sizeof virtio};
    flow->parts[1] = {headers, flow->header_length};
    merger->sink(flow->target, flow->parts, 2 + flow->count, flow->count);
}

void append_segment(coalesced_flow *flow, const uint8_t *packet, size_t length) {
    const size_t payload = length - flow->header_length;
    // begin_flow() appends the first packet, when the count is still 0.
    if (flow->count == 1)
        flow->id_step = static_cast<uint16_t>(to_host(ip_of(packet)->id) - flow->first_id);
    flow->parts[2 + flow->count++] = {const_cast<uint8_t *>(packet) + flow->header_length, payload};
    flow->payload += payload;
    flow->next_sequence += static_cast<uint32_t>(payload);
    if (ip_of(packet)->protocol == PROTOCOL_TCP)
        flow->pushed = tcp_of(packet)->flags & TCP_PSH;
}

void begin_flow(coalescer *merger, coalesced_flow *flow, void *target, const uint8_t *packet, size_t length,
                size_t headers) {
    flow->target = target;
    flow->first = packet;
    flow->header_length = headers;
    flow->packet_length = length;
    flow->payload = 0;
    flow->segment_size = length - headers;
    flow->count = 0;
    flow->first_id = to_host(ip_of(packet)->id);
    flow->id_step = 0;
    flow->verified = flow->pushed = false;
    if (ip_of(packet)->protocol == PROTOCOL_TCP)
        flow->next_sequence = to_host(tcp_of(packet)->sequence);
    append_segment(flow, packet, length);
    merger->used |= uint64_t{1} << (flow - merger->flows);
}

} // namespace

void coalesce_packet(coalescer *merger, void *target, const uint8_t *packet, size_t length) {
    if (!has_ports(packet, length)) {
        const uint8_t protocol = ip_of(packet)->protocol;
        if (protocol == PROTOCOL_TCP || protocol == PROTOCOL_UDP)
            coalesce_flush(merger); // its flow is unknown, and the flow's earlier packets go first
        return write_unmerged(merger, target, packet, length);
    }
    coalesced_flow *flow = &merger->flows[find_flow_slot(target, packet)];
    const bool waiting = merger->used >> (flow - merger->flows) & 1;
    const size_t headers = find_mergeable_headers(merger, packet, length);
    if (waiting && headers && same_flow(*flow, target, packet) && can_follow(flow, packet, length, headers)) {
        append_segment(flow, packet, length);
    } else {
        if (waiting)
            flush_flow(merger, flow);
        if (!headers)
            return write_unmerged(merger, target, packet, length);
        begin_flow(merger, flow, target, packet, length, headers);
    }
    // PSH and a shorter segment end a merged packet.
    if (flow->pushed || length - headers < flow->segment_size)
        flush_flow(merger, flow);
}

void coalesce_flush(coalescer *merger) {
    while (merger->used)
        flush_flow(merger, &merger->flows[std::countr_zero(merger->used)]);
}

bool large_packet_is_valid(const virtio_header &header, const uint8_t *packet, size_t length,
                           uint32_t *out_segments) {
    if (!ip4_is_valid(packet, length) || to_host(ip_of(packet)->total_length) != length ||
        (to_host(ip_of(packet)->fragment) & IP4_FRAGMENT) || header.segment_size < MIN_SEGMENT_SIZE ||
        !(header.flags & VIRTIO_NEEDS_CHECKSUM))
        return false;
    // Unlike packets that are merged here, these may have IP options.
    const size_t ip = ip4_header_length(*ip_of(packet));
    size_t headers = ip;
    uint16_t checksum_at = offsetof(udp_wire_header, checksum);
    if ((header.gso_type & ~VIRTIO_LARGE_ECN) == VIRTIO_LARGE_TCP4) {
        if (ip_of(packet)->protocol != PROTOCOL_TCP || length < ip + sizeof(tcp_wire_header))
            return false;
        const size_t tcp = tcp_header_length(*reinterpret_cast<const tcp_wire_header *>(packet + ip));
        if (tcp < sizeof(tcp_wire_header))
            return false;
        headers += tcp;
        checksum_at = offsetof(tcp_wire_header, checksum);
    } else if (header.gso_type == VIRTIO_LARGE_UDP) {
        if (ip_of(packet)->protocol != PROTOCOL_UDP)
            return false;
        headers += sizeof(udp_wire_header);
    } else {
        return false;
    }
    // Any other position would have the checksum overwrite something else.
    if (length <= headers || header.checksum_start != ip || header.checksum_offset != checksum_at)
        return false;
    *out_segments = static_cast<uint32_t>((length - headers + header.segment_size - 1) / header.segment_size);
    return true;
}

bool complete_checksum(const virtio_header &header, uint8_t *packet, size_t length) {
    if (!(header.flags & VIRTIO_NEEDS_CHECKSUM))
        return true;
    const size_t at = size_t{header.checksum_start} + header.checksum_offset;
    if (header.checksum_start >= length || at + sizeof(be16) > length)
        return false;
    // The field holds the sum of the pseudo-header, which is thus included. A result of 0 is sent as 0xffff,
    // since 0 means "no checksum" in UDP.
    be16 sum =
        checksum_finish(checksum_add(0, packet + header.checksum_start, length - header.checksum_start));
    if (to_host(sum) == 0)
        sum = to_be16(0xffff);
    memcpy(packet + at, &sum, sizeof sum);
    return true;
}

bool split_begin(packet_split *split, const virtio_header &header, uint8_t *packet, size_t length) {
    *split = {};
    if (!ip4_is_valid(packet, length))
        return false;
    split->packet = packet;
    // The IP header decides: padding may follow the packet.
    split->length = to_host(ip_of(packet)->total_length);
    if (header.gso_type == VIRTIO_NOT_LARGE)
        return complete_checksum(header, packet, split->length);
    uint32_t segments;
    if (!large_packet_is_valid(header, packet, length, &segments))
        return false;
    split->ip_length = ip4_header_length(*ip_of(packet));
    split->header_length = split->ip_length;
    if (ip_of(packet)->protocol == PROTOCOL_UDP)
        split->header_length += sizeof(udp_wire_header);
    else
        split->header_length +=
            tcp_header_length(*reinterpret_cast<const tcp_wire_header *>(packet + split->ip_length));
    split->segment_size = header.segment_size;
    return true;
}

namespace {

void write_segment_headers(const packet_split &split, split_segment *out, bool last) {
    memcpy(out->header, split.packet, split.header_length);
    auto *ip = reinterpret_cast<ip4_wire_header *>(out->header);
    const size_t transport = split.header_length - split.ip_length + out->payload_length;
    ip->total_length = to_be16(static_cast<uint16_t>(split.ip_length + transport));
    // Consecutive ids, as the kernel assigns them when it splits a packet.
    ip->id = to_be16(static_cast<uint16_t>(to_host(ip->id) + split.index));
    ip->checksum = {};
    ip->checksum = checksum_finish(checksum_add(0, ip, split.ip_length));
    uint8_t *const after_ip = out->header + split.ip_length;
    be16 *checksum;
    if (ip->protocol == PROTOCOL_UDP) {
        auto *udp = reinterpret_cast<udp_wire_header *>(after_ip);
        udp->length = to_be16(static_cast<uint16_t>(transport));
        checksum = &udp->checksum;
    } else {
        auto *tcp = reinterpret_cast<tcp_wire_header *>(after_ip);
        tcp->sequence = to_be32(to_host(tcp->sequence) + static_cast<uint32_t>(split.at));
        // Like segmentation by a network card: FIN and PSH belong to the last segment, CWR to the first.
        if (!last)
            tcp->flags &= static_cast<uint8_t>(~(TCP_FIN | TCP_PSH));
        if (split.index > 0)
            tcp->flags &= static_cast<uint8_t>(~TCP_CWR);
        checksum = &tcp->checksum;
    }
    *checksum = {};
    const uint64_t sum =
        checksum_add(checksum_pseudo(*ip, transport), after_ip, split.header_length - split.ip_length);
    *checksum = checksum_finish(checksum_add(sum, out->payload, out->payload_length));
    if (ip->protocol == PROTOCOL_UDP && to_host(*checksum) == 0)
        *checksum = to_be16(0xffff);
}

} // namespace

bool split_next(packet_split *split, split_segment *out) {
    const size_t left = split->length - split->header_length - split->at;
    if (left == 0)
        return false;
    out->payload = split->packet + split->header_length + split->at;
    out->payload_length = left;
    out->header_length = split->header_length;
    // Otherwise the whole packet is the payload, and no header is written.
    if (split->segment_size) {
        if (left > split->segment_size)
            out->payload_length = split->segment_size;
        write_segment_headers(*split, out, out->payload_length == left);
    }
    split->at += out->payload_length;
    split->index++;
    return true;
}
