#include "peers/tunneld/ip_packet.h"

#include <cstring>

namespace {

// Sums 32 bits at a time into 64: a packet of 65535 bytes is far from an overflow.
uint64_t add_word(uint64_t sum, const uint8_t *at) {
    uint64_t word;
    memcpy(&word, at, sizeof word);
    return sum + (word & 0xffffffff) + (word >> 32);
}

// The same for whole blocks, as vectors of the compiler: it uses the processor's if there are any.
using lanes = uint64_t __attribute__((vector_size(32)));
constexpr size_t BLOCK_BYTES = 2 * sizeof(lanes);

__attribute__((always_inline)) inline uint64_t sum_lanes(const uint8_t *at, size_t blocks) {
    // Each lane adds values of 32 bits into 64 and cannot overflow.
    lanes sums[4] = {}; // additions that don't depend on each other
    for (; blocks > 0; blocks--, at += BLOCK_BYTES) {
        lanes first, second;
        memcpy(&first, at, sizeof first);
        memcpy(&second, at + sizeof first, sizeof second);
        sums[0] += first & 0xffffffff;
        sums[1] += first >> 32;
        sums[2] += second & 0xffffffff;
        sums[3] += second >> 32;
    }
    const lanes all = sums[0] + sums[1] + sums[2] + sums[3];
    return all[0] + all[1] + all[2] + all[3];
}

uint64_t sum_blocks(const uint8_t *at, size_t blocks) {
    return sum_lanes(at, blocks);
}

#if defined(__x86_64__)
// The processors that the program is built for have vectors of 16 bytes; most have 32.
__attribute__((target("avx2"))) uint64_t sum_blocks_avx2(const uint8_t *at, size_t blocks) {
    return sum_lanes(at, blocks);
}
uint64_t (*const best_sum_blocks)(const uint8_t *, size_t) = __builtin_cpu_supports("avx2") ? sum_blocks_avx2
                                                                                            : sum_blocks;
#else
constexpr auto best_sum_blocks = sum_blocks;
#endif

uint16_t fold_sum(uint64_t sum) {
    // End-around carry: what exceeds 16 bits is added again until nothing does.
    while (sum >> 16)
        sum = (sum & 0xffff) + (sum >> 16);
    return static_cast<uint16_t>(sum);
}

} // namespace

uint64_t checksum_add(uint64_t sum, const void *bytes, size_t length) {
    const uint8_t *at = static_cast<const uint8_t *>(bytes);
    if (length >= BLOCK_BYTES) {
        sum += best_sum_blocks(at, length / BLOCK_BYTES);
        at += length / BLOCK_BYTES * BLOCK_BYTES;
        length %= BLOCK_BYTES;
    }
    for (; length >= 8; at += 8, length -= 8)
        sum = add_word(sum, at);
    // An odd last byte is summed as if a zero byte followed it.
    uint8_t rest[8] = {};
    memcpy(rest, at, length);
    return add_word(sum, rest);
}

be16 checksum_fold(uint64_t sum) {
    return std::bit_cast<be16>(fold_sum(sum));
}

be16 checksum_finish(uint64_t sum) {
    return std::bit_cast<be16>(static_cast<uint16_t>(~fold_sum(sum)));
}

bool checksum_is_right(uint64_t sum) {
    return fold_sum(sum) == 0xffff;
}

uint64_t checksum_pseudo(const ip4_wire_header &ip, size_t length) {
    // After the two addresses, which follow each other in the header: a zero byte, the protocol and the
    // length.
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
