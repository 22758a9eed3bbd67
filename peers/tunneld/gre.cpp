#include "peers/tunneld/gre.h"

#include <cstring>

#include "peers/tunneld/ip_packet.h"

namespace {

// Distinguishes a packet from a redirect header, whose first byte has no bits set but 0x80 and 0x40.
bool looks_like_ip4(const uint8_t *bytes, size_t length) {
    if (length < sizeof(ip4_wire_header))
        return false;
    const auto *ip = reinterpret_cast<const ip4_wire_header *>(bytes);
    // The header's checksum is not verified here: a damaged packet must not be taken for a redirect header.
    const size_t header = ip4_header_length(*ip), total = to_host(ip->total_length);
    return ip->version_ihl >> 4 == 4 && header >= sizeof *ip && total >= header && total <= length;
}

} // namespace

refusal read_gre_outer(uint8_t *bytes, size_t length, gre_outer *out) {
    *out = {};
    if (!looks_like_ip4(bytes, length))
        return REFUSED_LENGTH;
    const auto *ip = reinterpret_cast<const ip4_wire_header *>(bytes);
    const size_t header = ip4_header_length(*ip);
    // Everything but the checksum has been verified by now.
    if (!ip4_is_valid(bytes, length))
        return REFUSED_CHECKSUM;
    if (ip->protocol != PROTOCOL_GRE)
        return REFUSED_PROTOCOL;
    // The kernel reassembles fragments before the ring. This one came before reassembly was switched on.
    if (to_host(ip->fragment) & IP4_FRAGMENT)
        return REFUSED_LENGTH;
    // Ethernet pads short packets: the length is that of the header.
    *out = {to_host(ip->destination), to_host(ip->source), bytes + header,
            to_host(ip->total_length) - header};
    return REFUSALS;
}

refusal read_gre_payload(uint8_t *bytes, size_t length, bool merged, gre_content *out) {
    *out = {};
    if (length < sizeof(gre_wire_header))
        return REFUSED_LENGTH;
    const auto *gre = reinterpret_cast<const gre_wire_header *>(bytes);
    const uint16_t flags = to_host(gre->flags), type = to_host(gre->type);
    if (flags & GRE_REFUSED_FLAGS)
        return REFUSED_FLAGS;
    size_t at = sizeof *gre;
    if (flags & GRE_CHECKSUM) {
        if (length < at + sizeof(gre_wire_checksum))
            return REFUSED_LENGTH;
        // The checksum covers the GRE header and all that follows it.
        if (!merged && !checksum_is_right(checksum_add(0, bytes, length)))
            return REFUSED_CHECKSUM;
        at += sizeof(gre_wire_checksum);
    }
    if (type != GRE_TYPE_IPV4 && type != GRE_TYPE_REDIRECT)
        return REFUSED_PROTOCOL;
    // Not every router that uses this type sends a redirect header.
    if (type == GRE_TYPE_REDIRECT && !looks_like_ip4(bytes + at, length - at)) {
        if (length - at < sizeof(gre_wire_redirect))
            return REFUSED_LENGTH;
        out->has_redirect = true;
        memcpy(&out->redirect, bytes + at, sizeof out->redirect);
        at += sizeof out->redirect;
    }
    if (length - at < sizeof(ip4_wire_header))
        return REFUSED_LENGTH;
    if (!ip4_is_valid(bytes + at, length - at))
        return REFUSED_INNER;
    out->packet = bytes + at;
    // Bytes after the inner packet are padding.
    out->length = to_host(reinterpret_cast<const ip4_wire_header *>(out->packet)->total_length);
    return REFUSALS;
}

size_t write_gre_header(uint8_t *out, const gre_wire_redirect *redirect) {
    const gre_wire_header gre = {to_be16(0), to_be16(redirect ? GRE_TYPE_REDIRECT : GRE_TYPE_IPV4)};
    memcpy(out, &gre, sizeof gre);
    if (!redirect)
        return sizeof gre;
    memcpy(out + sizeof gre, redirect, sizeof *redirect);
    return sizeof gre + sizeof *redirect;
}
