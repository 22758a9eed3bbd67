// Merges segments of one flow into a large one on the way into a TUN device, under the conditions of the
// kernel's own receive offload, and splits the large segments that come out of one. Neither allocates.
#pragma once

#include <sys/uio.h>

#include <cstddef>
#include <cstdint>

#include "peers/tunneld/ip_packet.h"
#include "peers/tunneld/virtio_header.h"

constexpr size_t COALESCED_FLOWS = 64, COALESCED_SEGMENTS = 64;

// Takes one write: parts[0] is the virtio header, the others make an IPv4 packet, merged from `packets`.
using coalesced_sink = void (*)(void *target, const iovec *parts, size_t count, uint32_t packets);

// The segments of one flow that are waiting. They stay where they were received until the flush.
struct coalesced_flow {
    void *target;
    const uint8_t *first; // its headers stand for all
    size_t header_length, packet_length, payload, segment_size;
    uint32_t count, next_sequence;
    uint16_t first_id;
    uint16_t id_step; // from segment to segment: 1, or 0 where all carry the same under DF
    bool verified, pushed;
    iovec parts[2 + COALESCED_SEGMENTS];
};
struct coalescer {
    coalesced_sink sink;
    bool merge_udp; // the device takes large UDP packets
    uint64_t used;  // bit by flow
    coalesced_flow flows[COALESCED_FLOWS];
};
static_assert(COALESCED_FLOWS == 64, "one bit each in coalescer::used");

// Takes a packet that ip4_is_valid() and that has exactly `length` bytes. It goes into the sink at once or
// with the next flush at the latest, after what came before it of the same flow, and stays in place until
// then.
void coalesce_packet(coalescer *merger, void *target, const uint8_t *packet, size_t length);
void coalesce_flush(coalescer *merger);

// Whether `header` describes a large TCP segment, or a large UDP packet, with a partial checksum over exactly
// this packet: what a device has merged or has not split. `out_segments`: how many packets it stands for.
bool large_packet_is_valid(const virtio_header &header, const uint8_t *packet, size_t length,
                           uint32_t *out_segments);

// Completes the checksum that a virtio header says is partial. False where it lies outside of the packet.
bool complete_checksum(const virtio_header &header, uint8_t *packet, size_t length);

constexpr size_t MAX_HEADERS = IP4_MAX_HEADER + TCP_MAX_HEADER;
constexpr uint16_t MIN_SEGMENT_SIZE = 8; // the smallest that the kernel makes
struct packet_split {
    const uint8_t *packet;
    size_t ip_length, header_length, length;
    size_t segment_size; // 0: one packet as it is
    size_t at;           // of the payload
    uint32_t index;      // of the next segment
};
struct split_segment {
    uint8_t header[MAX_HEADERS];
    size_t header_length; // 0 when the payload is the packet
    const uint8_t *payload;
    size_t payload_length;
};
// Begins with a packet as it was read from a TUN device; its checksum is completed in place. False when
// header and packet don't agree, and for what isn't IPv4.
bool split_begin(packet_split *split, const virtio_header &header, uint8_t *packet, size_t length);
// The next packet, false after the last. Its payload lies in the packet that was read.
bool split_next(packet_split *split, split_segment *out);
