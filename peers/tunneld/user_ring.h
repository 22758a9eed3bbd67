// The packet ring by which GRE packets come in, from all interfaces, whole: the kernel puts outer fragments
// together first. Its frames are handed to the reader one by one as they arrive (TPACKET_V2): with blocks of
// frames a packet on a quiet line would wait for the block's timer.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

#include "peers/tunneld/virtio_header.h"

struct packet_ring {
    int fd = -1;
    uint8_t *memory = nullptr;
    uint8_t *large = nullptr;    // for the packet that doesn't fit a frame
    uint32_t next = 0, held = 0; // frames; held ones lie before `next`
};
struct ring_packet {
    uint8_t *bytes; // from the IP header on
    size_t length;
    virtio_header header; // its checksum_start counts from `bytes`
    bool shared;          // in the one place for large packets: the next ring_next() may overwrite it
    bool lost;            // too large for the frame, and there was no room elsewhere
};

bool ring_open(packet_ring *ring, std::string *out_error);
void ring_close(packet_ring *ring);
// The next packet, which may be changed in place and stays until ring_release(). False when there is none, or
// when all frames are held.
bool ring_next(packet_ring *ring, ring_packet *out);
void ring_release(packet_ring *ring);
// Packets that found no free frame since the last call.
uint32_t ring_take_losses(packet_ring *ring);
