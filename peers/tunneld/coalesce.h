// Merges the segments of a flow into a large one before they are written to a TUN device, under the same
// conditions as the kernel's receive offload, and splits the large segments that are read from one. Nothing
// is allocated.
#pragma once

#include <sys/uio.h>

#include <cstddef>
#include <cstdint>

#include "peers/tunneld/ip_packet.h"
#include "peers/tunneld/virtio_header.h"

constexpr size_t COALESCED_FLOWS = 64, COALESCED_SEGMENTS = 64;

// Called for each write: parts[0] is the virtio header, and the others form an IPv4 packet, merged from
// `packets`.
using coalesced_sink = void (*)(void *target, const iovec *parts, size_t count, uint32_t packets);

// The segments of a flow that wait to be written. They stay where they were received.
struct coalesced_flow {
    void *target;
    const uint8_t *first; // the first packet, whose headers all others share
    size_t header_length, packet_length, payload, segment_size;
    uint32_t count, next_sequence;
    uint16_t first_id;
    uint16_t id_step; // the difference of the ids of two segments: 1, or 0 if all have the same id and DF
    bool verified;    // the checksum of the first packet was right
    bool pushed;      // the last segment has PSH
    iovec parts[2 + COALESCED_SEGMENTS];
};
struct coalescer {
    coalesced_sink sink;
    bool merge_udp; // the device takes large UDP packets
    uint64_t used;  // a bit for each of `flows`
    coalesced_flow flows[COALESCED_FLOWS];
};
static_assert(COALESCED_FLOWS == 64, "one bit each in coalescer::used");

// Takes a packet for which ip4_is_valid(), of exactly `length` bytes. It is given to the sink now or later,
// at the latest by coalesce_flush(), always after the earlier packets of its flow. Until then its memory has
// to stay.
void coalesce_packet(coalescer *merger, void *target, const uint8_t *packet, size_t length);
void coalesce_flush(coalescer *merger);

// Whether `header` describes a large TCP segment or a large UDP packet with a partial checksum, and fits the
// packet. `out_segments`: the number of packets into which it is split.
bool large_packet_is_valid(const virtio_header &header, const uint8_t *packet, size_t length,
                           uint32_t *out_segments);

// Completes the checksum if the virtio header says that it is partial. False when it would lie outside the
// packet.
bool complete_checksum(const virtio_header &header, uint8_t *packet, size_t length);

constexpr size_t MAX_HEADERS = IP4_MAX_HEADER + TCP_MAX_HEADER;
constexpr uint16_t MIN_SEGMENT_SIZE = 8; // the kernel makes no smaller ones
struct packet_split {
    const uint8_t *packet;
    size_t ip_length, header_length, length;
    size_t segment_size; // 0: the packet is not split
    size_t at;           // offset of the next segment in the payload
    uint32_t index;      // number of the next segment
};
struct split_segment {
    uint8_t header[MAX_HEADERS];
    size_t header_length;   // 0: `payload` is the whole packet
    const uint8_t *payload; // points into the packet that is split
    size_t payload_length;
};
// Begins to split a packet that was read from a TUN device. If it is not large, its checksum is completed in
// place. False when it is not IPv4, or does not fit its virtio header.
bool split_begin(packet_split *split, const virtio_header &header, uint8_t *packet, size_t length);
// Gives the next packet; false after the last one.
bool split_next(packet_split *split, split_segment *out);
