#include "peers/tunneld/redirect_memory.h"

#include <cstring>

#include "peers/tunneld/ip_packet.h"

namespace {

remembered_redirect read_flow(uint64_t link, const uint8_t *packet, size_t length) {
    const auto *ip = reinterpret_cast<const ip4_wire_header *>(packet);
    const size_t header = ip4_header_length(*ip);
    remembered_redirect flow;
    flow.link = link;
    // A packet that is returned still has the addresses and ports with which it arrived: nothing is reversed.
    memcpy(&flow.addresses, &ip->source, sizeof flow.addresses);
    flow.protocol = ip->protocol;
    const bool has_ports = ip->protocol == PROTOCOL_TCP || ip->protocol == PROTOCOL_UDP;
    if (has_ports && !(to_host(ip->fragment) & IP4_FRAGMENT) && length >= header + sizeof flow.ports)
        memcpy(&flow.ports, packet + header, sizeof flow.ports);
    return flow;
}

remembered_redirect *find_slot(const redirect_memory &memory, const remembered_redirect &flow) {
    const uint64_t key = (flow.addresses ^ (uint64_t{flow.ports} << 16) ^ flow.link) + flow.protocol;
    return &memory.slots[(key * 0x9e3779b97f4a7c15u) >> (64 - REDIRECT_SLOT_BITS)];
}

} // namespace

void remember_redirect(redirect_memory *memory, uint64_t link, const gre_content &content) {
    remembered_redirect flow = read_flow(link, content.packet, content.length);
    // Found by the real link, before 0 marks the slot as empty.
    remembered_redirect *slot = find_slot(*memory, flow);
    if (!content.has_redirect)
        flow.link = 0;
    flow.header = content.redirect;
    *slot = flow;
}

const gre_wire_redirect *recall_redirect(const redirect_memory &memory, uint64_t link, const uint8_t *packet,
                                         size_t length) {
    const remembered_redirect flow = read_flow(link, packet, length);
    const remembered_redirect *slot = find_slot(memory, flow);
    const bool same = slot->link == flow.link && slot->addresses == flow.addresses &&
                      slot->ports == flow.ports && slot->protocol == flow.protocol;
    return same ? &slot->header : nullptr;
}
