// The router's data path: sends packets that arrive on a redirecting interface to the appliance that owns
// their bucket, and routes packets that appliances return.
//
// Each redirecting interface NAME has a TUN device "to-NAME". The lab's routing rules send into it all
// packets from NAME that the router would forward. Packets that are not redirected are written back into the
// device, and the kernel routes them, because the rules do not apply to packets from to-NAME. The same
// happens to packets that appliances return in GRE. Packets returned by L2 are routed by the kernel directly.
#pragma once

#include <string>
#include <vector>

#include "lab/router/router.h"

namespace lab {

// Header fields of an IPv4 packet. Ports are 0 without TCP or UDP, and in fragments other than the first.
struct packet_fields {
    address src = 0, dst = 0;
    uint16_t src_port = 0, dst_port = 0;
    uint8_t protocol = 0;
    size_t length = 0; // total length, from the header
};
bool read_packet(const uint8_t *data, size_t size, packet_fields *fields);

struct verdict {
    address owner = 0; // of the bucket or value, 0: route the packet
    const group *in = nullptr;
    uint8_t bucket = 0;  // 0 if assigned by mask
    uint32_t method = 0; // 1 GRE, 2 L2
};
// The matching service with the highest priority decides. Groups without a table are skipped.
verdict find_owner(const router &self, const std::set<uint8_t> &services, const packet_fields &packet);
// The GRE header, and the redirect header in the format "redirect".
bytes gre_header(const router &self, const verdict &found);
// The offset of the inner packet in GRE from an appliance (which begins after the outer IP header); 0:
// refused.
size_t inner_offset(const uint8_t *gre, size_t size);

struct redirecting {
    std::string interface;
    std::set<uint8_t> services;
    int tun = -1;
};
struct forwarder {
    router *self = nullptr;
    std::vector<redirecting> from;
    int raw = -1;    // GRE from and to the router's id
    int source = -1; // GRE from another address
    int link = -1;   // L2
};
// Parses "eth0=51,52"; false if it is invalid.
bool read_redirecting(const std::string &text, redirecting *out);
// Returns "" or an error message.
std::string open_forwarder(forwarder *path);
// The descriptors to poll; call forward_packets with each that is readable.
std::vector<int> forwarder_descriptors(const forwarder &path);
void forward_packets(forwarder *path, int descriptor);

} // namespace lab
