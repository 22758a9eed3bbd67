// The router's data path: what arrives on an interface that redirects is sent to the appliance that owns its
// bucket, and what appliances return is routed on.
//
// Each redirecting interface NAME has a TUN device "to-NAME", into which the lab's routing rules send all
// that the router would forward from there. What is not redirected is written back into the device, and the
// kernel routes it: it has then come in by another interface, to which the rules do not apply. What
// appliances return in GRE takes the same way. What they return by L2 the kernel routes alone.
#pragma once

#include <string>
#include <vector>

#include "lab/router/router.h"

namespace lab {

// What the header of an IPv4 packet says; ports are 0 in all but first fragments.
struct packet_fields {
    address src = 0, dst = 0;
    uint16_t src_port = 0, dst_port = 0;
    uint8_t protocol = 0;
    size_t length = 0; // total, of the header
};
bool read_packet(const uint8_t *data, size_t size, packet_fields *fields);

struct verdict {
    address owner = 0; // of the bucket or value, 0: the packet is routed
    const group *in = nullptr;
    uint8_t bucket = 0;  // 0 when assigned by mask
    uint32_t method = 0; // 1 GRE, 2 L2
};
// The matching service of highest priority decides; a group without a table leaves the packet to the others.
verdict find_owner(const router &self, const std::set<uint8_t> &services, const packet_fields &packet);
// The GRE header with the redirect header, as the options say.
bytes gre_header(const router &self, const verdict &found);
// Where the carried packet begins in GRE from an appliance, without the outer IP header; 0 when it is
// refused.
size_t carried_at(const uint8_t *gre, size_t size);

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
// "eth0=51,52"; false when it makes no sense.
bool read_redirecting(const std::string &text, redirecting *out);
// "" or what went wrong.
std::string open_forwarder(forwarder *path);
// Descriptors to poll, and what to do when one of them can be read.
std::vector<int> forwarder_descriptors(const forwarder &path);
void forward_packets(forwarder *path, int descriptor);

} // namespace lab
