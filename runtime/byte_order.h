// Network byte order as a type. A be16 or be32 holds its bytes in the order in which they are sent. It can be
// copied and compared for equality; for anything else it has to be converted with to_host(), and back with
// to_be16() or to_be32(). The alignment is 1, as is that of a layout made of these: it can be read at any
// offset of a packet.
#pragma once

#include <bit>
#include <cstdint>

struct be16 {
    uint8_t bytes[2];
};
struct be32 {
    uint8_t bytes[4];
};

constexpr uint16_t to_host(be16 wire) {
    return static_cast<uint16_t>((wire.bytes[0] << 8) | wire.bytes[1]);
}
constexpr uint32_t to_host(be32 wire) {
    return (static_cast<uint32_t>(wire.bytes[0]) << 24) | (static_cast<uint32_t>(wire.bytes[1]) << 16) |
           (static_cast<uint32_t>(wire.bytes[2]) << 8) | wire.bytes[3];
}
constexpr be16 to_be16(uint16_t host) {
    return {{static_cast<uint8_t>(host >> 8), static_cast<uint8_t>(host & 0xff)}};
}
constexpr be32 to_be32(uint32_t host) {
    return {{static_cast<uint8_t>(host >> 24), static_cast<uint8_t>((host >> 16) & 0xff),
             static_cast<uint8_t>((host >> 8) & 0xff), static_cast<uint8_t>(host & 0xff)}};
}

// The four bytes as one machine word, without a conversion: for in_addr and for the few places that are
// defined to order addresses by this word. Its value depends on the machine; it is not the number that the
// bytes represent.
constexpr uint32_t raw_word(be32 wire) {
    return std::bit_cast<uint32_t>(wire);
}
constexpr be32 from_raw_word(uint32_t word) {
    return std::bit_cast<be32>(word);
}

constexpr bool operator==(be16 a, be16 b) {
    return a.bytes[0] == b.bytes[0] && a.bytes[1] == b.bytes[1];
}
constexpr bool operator==(be32 a, be32 b) {
    return raw_word(a) == raw_word(b);
}
constexpr bool is_zero(be32 wire) {
    return raw_word(wire) == 0;
}

static_assert(sizeof(be16) == 2 && alignof(be16) == 1);
static_assert(sizeof(be32) == 4 && alignof(be32) == 1);
