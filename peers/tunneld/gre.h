// GRE in the forms in which routers send redirected packets: version 0, with or without a checksum, and with
// the protocol type of IPv4 or 0x883E. With 0x883E, a redirect header of four bytes can come before the
// packet.
#pragma once

#include <cstddef>
#include <cstdint>

#include "peers/tunneld/plane.h"
#include "runtime/byte_order.h"

constexpr uint16_t GRE_TYPE_IPV4 = 0x0800, GRE_TYPE_REDIRECT = 0x883E;
constexpr uint16_t GRE_CHECKSUM = 0x8000;
// Routing, key, sequence number, strict source route, recursion and version: packets with any of these are
// refused. The remaining bits are ignored, as RFC 2784 requires.
constexpr uint16_t GRE_REFUSED_FLAGS = 0x7c07;

struct gre_wire_header {
    be16 flags, type;
};
struct gre_wire_checksum { // follows the header when GRE_CHECKSUM is set
    be16 checksum, reserved;
};
struct gre_wire_redirect {
    uint8_t flags; // 0x80: a dynamic service, 0x40: the alternative bucket was used
    uint8_t service;
    uint8_t alternative_bucket, primary_bucket;
};
static_assert(sizeof(gre_wire_header) == 4 && alignof(gre_wire_header) == 1);
static_assert(sizeof(gre_wire_checksum) == 4 && sizeof(gre_wire_redirect) == 4);
constexpr size_t GRE_MAX_WRITTEN = sizeof(gre_wire_header) + sizeof(gre_wire_redirect);

// The outer IP packet.
struct gre_outer {
    uint32_t local, remote; // its destination and its source, in host order
    uint8_t *payload;       // from the GRE header on
    size_t length;
};
// The inner packet: a complete IPv4 packet for which ip4_is_valid().
struct gre_content {
    uint8_t *packet;
    size_t length; // its total length, without padding after it
    bool has_redirect;
    gre_wire_redirect redirect;
};

// Both return REFUSALS for a good packet, otherwise the reason for refusing it. The results point into the
// bytes.
refusal read_gre_outer(uint8_t *bytes, size_t length, gre_outer *out);
// `merged`: the kernel has merged several packets and verified their checksums. The GRE checksum that is left
// is that of the first one and is not checked.
refusal read_gre_payload(uint8_t *bytes, size_t length, bool merged, gre_content *out);
// Writes the header, with type 0x883E if `redirect` is not null. Returns its length, at most GRE_MAX_WRITTEN.
size_t write_gre_header(uint8_t *out, const gre_wire_redirect *redirect);
