// The header, in host order, by which a TUN device and a packet socket describe what remains to be done with
// a packet: complete its checksum, split it. <linux/virtio_net.h> does not compile as C++.
#pragma once

#include <cstdint>

struct virtio_header {
    uint8_t flags, gso_type;
    uint16_t header_length; // only a hint
    uint16_t segment_size;  // payload of each segment of a large packet
    uint16_t checksum_start, checksum_offset;
};
static_assert(sizeof(virtio_header) == 10);
// The checksum covers the bytes from checksum_start on, and its field is checksum_offset bytes further.
constexpr uint8_t VIRTIO_NEEDS_CHECKSUM = 1;
enum : uint8_t { VIRTIO_NOT_LARGE = 0, VIRTIO_LARGE_TCP4 = 1, VIRTIO_LARGE_UDP = 5, VIRTIO_LARGE_ECN = 0x80 };
