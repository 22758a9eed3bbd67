// GRE as routers send redirected packets in it: version 0, with or without a checksum, and the type of IPv4
// or 0x883E, after which a redirect header of four bytes may stand before the packet.
#pragma once

#include <cstddef>
#include <cstdint>

#include "peers/tunneld/plane.h"
#include "runtime/byte_order.h"

constexpr uint16_t GRE_TYPE_IPV4 = 0x0800, GRE_TYPE_REDIRECT = 0x883E;
constexpr uint16_t GRE_CHECKSUM = 0x8000;
// Routing, key, sequence number, strict source route, recursion and version: zero in what is taken. The bits
// between them are ignored, as RFC 2784 asks.
constexpr uint16_t GRE_REFUSED_FLAGS = 0x7c07;

struct gre_wire_header {
    be16 flags, type;
};
struct gre_wire_checksum { // after the header when GRE_CHECKSUM is set
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

// The outer IP packet: where it came from and what it carries.
struct gre_outer {
    uint32_t local, remote; // host order: its destination and its source
    uint8_t *payload;
    size_t length;
};
// What the payload carries: a whole IPv4 packet with a right header.
struct gre_content {
    uint8_t *packet;
    size_t length; // its total length, without anything that follows it
    bool has_redirect;
    gre_wire_redirect redirect;
};

// Both give REFUSALS when there is nothing to refuse, otherwise why. What they give points into the bytes.
refusal read_gre_outer(uint8_t *bytes, size_t length, gre_outer *out);
// `merged`: the kernel has put it together from several packets, whose checksums it has verified. The one
// that is left in the header is that of the first.
refusal read_gre_payload(uint8_t *bytes, size_t length, bool merged, gre_content *out);
// Writes the header, of type 0x883E where there is a redirect header. At most GRE_MAX_WRITTEN bytes.
size_t write_gre_header(uint8_t *out, const gre_wire_redirect *redirect);
