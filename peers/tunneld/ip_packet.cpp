#include "peers/tunneld/ip_packet.h"

#include <cstring>

namespace {

// 32 bits at a time into 64: 65535 bytes are far from an overflow.
uint64_t add_word(uint64_t sum, const uint8_t *at) {
    uint64_t word;
    memcpy(&word, at, sizeof word);
    return sum + (word & 0xffffffff) + (word >> 32);
}

uint16_t fold(uint64_t sum) {
    while (sum >> 16)
        sum = (sum & 0xffff) + (sum >> 16);
    return static_cast<uint16_t>(sum);
}

} // namespace

uint64_t checksum_add(uint64_t sum, const void *bytes, size_t length) {
    const uint8_t *at = static_cast<const uint8_t *>(bytes);
    uint64_t second = 0, third = 0, fourth = 0; // sums that don't wait for each other
    for (; length >= 32; at += 32, length -= 32) {
        sum = add_word(sum, at);
        second = add_word(second, at + 8);
        third = add_word(third, at + 16);
        fourth = add_word(fourth, at + 24);
    }
    sum += second + third + fourth;
    for (; length >= 8; at += 8, length -= 8)
        sum = add_word(sum, at);
    uint8_t rest[8] = {};
    memcpy(rest, at, length);
    return add_word(sum, rest);
}

be16 checksum_fold(uint64_t sum) {
    return std::bit_cast<be16>(fold(sum));
}

be16 checksum_finish(uint64_t sum) {
    return std::bit_cast<be16>(static_cast<uint16_t>(~fold(sum)));
}

bool checksum_is_right(uint64_t sum) {
    return fold(sum) == 0xffff;
}

uint64_t checksum_pseudo(const ip4_wire_header &ip, size_t length) {
    const be16 rest[2] = {to_be16(ip.protocol), to_be16(static_cast<uint16_t>(length))};
    return checksum_add(checksum_add(0, &ip.source, 8), rest, sizeof rest);
}

bool ip4_is_valid(const uint8_t *bytes, size_t length) {
    if (length < sizeof(ip4_wire_header))
        return false;
    const auto *ip = reinterpret_cast<const ip4_wire_header *>(bytes);
    const size_t header = ip4_header_length(*ip), total = to_host(ip->total_length);
    return ip->version_ihl >> 4 == 4 && header >= sizeof *ip && total >= header && total <= length &&
           checksum_is_right(checksum_add(0, bytes, header));
}
