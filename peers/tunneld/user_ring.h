// The packet ring through which GRE packets are received from all interfaces. The kernel reassembles outer
// fragments first. Frames are passed to the reader one by one as they arrive (TPACKET_V2): with TPACKET_V3,
// which passes blocks of frames, a single packet would wait for the block's timer.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

#include "peers/tunneld/virtio_header.h"

struct packet_ring {
    int fd = -1;
    uint8_t *memory = nullptr;
    uint8_t *large = nullptr;    // buffer for a packet that doesn't fit into a frame
    uint32_t next = 0, held = 0; // the next frame, and the number of held ones before it
};
struct ring_packet {
    uint8_t *bytes; // from the IP header on
    size_t length;
    virtio_header header; // its checksum_start counts from `bytes`
    bool shared;          // in the buffer for large packets: the next ring_next() can overwrite it
    bool lost;            // too large for a frame, and the socket's queue was full; there is nothing else
};

bool ring_open(packet_ring *ring, std::string *out_error);
void ring_close(packet_ring *ring);
// Gives the next packet, which may be changed in place and stays until ring_release(). False when there is
// none, or when all frames are held.
bool ring_next(packet_ring *ring, ring_packet *out);
void ring_release(packet_ring *ring);
// Packets that found no free frame since the last call.
uint32_t ring_take_losses(packet_ring *ring);
