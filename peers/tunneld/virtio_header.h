// The header that the kernel puts before a packet, in host order, for what is still to be done on it: a
// checksum to be completed, a large packet to be split. <linux/virtio_net.h> is no C++.
#pragma once

#include <cstdint>

struct virtio_header {
    uint8_t flags, gso_type;
    uint16_t header_length; // a hint
    uint16_t segment_size;  // of payload, for what is large
    uint16_t checksum_start, checksum_offset;
};
static_assert(sizeof(virtio_header) == 10);
constexpr uint8_t VIRTIO_NEEDS_CHECKSUM =
    1; // from checksum_start on; its field is checksum_offset after that
enum : uint8_t { VIRTIO_NOT_LARGE = 0, VIRTIO_LARGE_TCP4 = 1, VIRTIO_LARGE_UDP = 5, VIRTIO_LARGE_ECN = 0x80 };
