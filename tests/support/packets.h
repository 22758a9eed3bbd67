// IPv4 packets for tests of tunneld.
#pragma once

#include <vector>

#include "peers/tunneld/coalesce.h"

using bytes = std::vector<uint8_t>;

inline ip4_wire_header *ip_of(uint8_t *packet) {
    return reinterpret_cast<ip4_wire_header *>(packet);
}

// The checksum field of TCP or UDP; nullptr if the packet has none.
inline be16 *transport_checksum(uint8_t *packet, size_t length) {
    const size_t header = ip4_header_length(*ip_of(packet));
    if (to_host(ip_of(packet)->fragment) & IP4_FRAGMENT)
        return nullptr;
    if (ip_of(packet)->protocol == PROTOCOL_TCP && length >= header + sizeof(tcp_wire_header))
        return &reinterpret_cast<tcp_wire_header *>(packet + header)->checksum;
    if (ip_of(packet)->protocol == PROTOCOL_UDP && length >= header + sizeof(udp_wire_header))
        return &reinterpret_cast<udp_wire_header *>(packet + header)->checksum;
    return nullptr;
}

// Corrects lengths and checksums, as far as the packet has the fields.
inline void mend_packet(uint8_t *packet, size_t length) {
    if (length < sizeof(ip4_wire_header) || length > IP4_MAX_PACKET)
        return;
    const size_t header = ip4_header_length(*ip_of(packet));
    if (header < sizeof(ip4_wire_header) || header > length)
        return;
    ip_of(packet)->total_length = to_be16(static_cast<uint16_t>(length));
    ip_of(packet)->checksum = {};
    ip_of(packet)->checksum = checksum_finish(checksum_add(0, packet, header));
    be16 *const checksum = transport_checksum(packet, length);
    if (!checksum)
        return;
    if (ip_of(packet)->protocol == PROTOCOL_UDP)
        reinterpret_cast<udp_wire_header *>(packet + header)->length =
            to_be16(static_cast<uint16_t>(length - header));
    *checksum = {};
    *checksum = checksum_finish(
        checksum_add(checksum_pseudo(*ip_of(packet), length - header), packet + header, length - header));
}

// Addresses are in host order, the TTL is 64.
inline bytes make_ip_packet(uint8_t protocol, uint32_t source, uint32_t destination, const bytes &body,
                            uint16_t fragment = 0) {
    bytes out(sizeof(ip4_wire_header));
    *ip_of(out.data()) = {0x45, 0,        {}, to_be16(7),      to_be16(fragment),
                          64,   protocol, {}, to_be32(source), to_be32(destination)};
    out.insert(out.end(), body.begin(), body.end());
    mend_packet(out.data(), out.size());
    return out;
}

// The packet that the coalescer outputs, without the header for the device.
inline bytes join_parts(const iovec *parts, size_t count) {
    bytes out;
    for (size_t i = 1; i < count; i++) {
        const auto *from = static_cast<const uint8_t *>(parts[i].iov_base);
        out.insert(out.end(), from, from + parts[i].iov_len);
    }
    return out;
}
inline bytes join_segment(const split_segment &segment) {
    bytes out(segment.header, segment.header + segment.header_length);
    out.insert(out.end(), segment.payload, segment.payload + segment.payload_length);
    return out;
}
