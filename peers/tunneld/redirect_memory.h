// Remembers the redirect header of each flow, for routers that want it back on the packets that are returned
// to them. The memory has a fixed size: a newer flow can replace an older one, whose packets are then
// returned without a redirect header.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>

#include "peers/tunneld/gre.h"

struct remembered_redirect {
    uint64_t link = 0;      // 0: the slot is empty
    uint64_t addresses = 0; // as on the wire, like the ports
    uint32_t ports = 0;
    uint8_t protocol = 0;
    gre_wire_redirect header = {};
};
constexpr size_t REDIRECT_SLOT_BITS = 14;
struct redirect_memory { // by a hash of the flow
    std::unique_ptr<remembered_redirect[]> slots =
        std::make_unique<remembered_redirect[]>(size_t{1} << REDIRECT_SLOT_BITS);
};

// `link`: a number that is not 0, of the link by which the packet came. A packet that came without a redirect
// header makes the memory forget the one of its flow.
void remember_redirect(redirect_memory *memory, uint64_t link, const gre_content &content);
// The redirect header of the packet's flow, or null. `packet` begins with an IPv4 header that ip4_is_valid().
const gre_wire_redirect *recall_redirect(const redirect_memory &memory, uint64_t link, const uint8_t *packet,
                                         size_t length);
