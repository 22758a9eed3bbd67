// IPv4, TCP and UDP headers on the wire, and their checksums.
#pragma once

#include <bit>
#include <cstddef>
#include <cstdint>

#include "runtime/byte_order.h"

constexpr uint8_t PROTOCOL_TCP = 6, PROTOCOL_UDP = 17, PROTOCOL_GRE = 47;

struct ip4_wire_header {
    uint8_t version_ihl, tos;
    be16 total_length, id, fragment;
    uint8_t ttl, protocol;
    be16 checksum;
    be32 source, destination;
};
static_assert(sizeof(ip4_wire_header) == 20 && alignof(ip4_wire_header) == 1);
constexpr uint16_t IP4_FRAGMENT = 0x3fff, IP4_DONT_FRAGMENT = 0x4000; // of `fragment`: more, offset; DF

struct tcp_wire_header {
    be16 source_port, destination_port;
    be32 sequence, acknowledgement;
    uint8_t data_offset, flags;
    be16 window, checksum, urgent;
};
static_assert(sizeof(tcp_wire_header) == 20 && alignof(tcp_wire_header) == 1);
enum : uint8_t {
    TCP_FIN = 0x01,
    TCP_SYN = 0x02,
    TCP_RST = 0x04,
    TCP_PSH = 0x08,
    TCP_ACK = 0x10,
    TCP_CWR = 0x80,
};

struct udp_wire_header {
    be16 source_port, destination_port, length, checksum;
};
static_assert(sizeof(udp_wire_header) == 8 && alignof(udp_wire_header) == 1);

constexpr size_t IP4_MAX_HEADER = 60, TCP_MAX_HEADER = 60, IP4_MAX_PACKET = 65535;

// The length of the header in bytes, from its own field; the caller has checked that the fixed part is there.
constexpr size_t ip4_header_length(const ip4_wire_header &ip) {
    return (ip.version_ihl & 0x0fu) * 4u;
}
constexpr size_t tcp_header_length(const tcp_wire_header &tcp) {
    return (tcp.data_offset >> 4) * 4u;
}

// Adds bytes to a one's complement sum. It is computed with words in the machine's byte order, which gives
// the right bytes when the result is stored. Only the last piece of a sum may have an odd length; all of it
// is at most a packet.
uint64_t checksum_add(uint64_t sum, const void *bytes, size_t length);
be16 checksum_fold(uint64_t sum);     // 16 bits: the form of a partial checksum
be16 checksum_finish(uint64_t sum);   // their complement: the form of a complete checksum
bool checksum_is_right(uint64_t sum); // of a sum that includes the checksum
// The sum of the pseudo-header for `length` bytes after the IP header.
uint64_t checksum_pseudo(const ip4_wire_header &ip, size_t length);

// Whether the bytes begin with a complete IPv4 header with a right checksum, and hold the whole packet.
bool ip4_is_valid(const uint8_t *bytes, size_t length);
