// The messages of a router, component by component, for tests and benchmarks.
#pragma once

#include <cstdint>
#include <vector>

#include "runtime/byte_order.h"
#include "tests/support/wire_bytes.h"

struct hash_element { // of a router view, by hash assignment
    be32 appliance;
    uint32_t weight;
    wire_bytes buckets; // 32 bytes
};
// Each byte of the buckets is `bucket_byte`.
inline hash_element element_of(be32 appliance, uint32_t weight, uint32_t bucket_byte = 0) {
    return {appliance, weight, wire_bytes().fill(32, static_cast<uint8_t>(bucket_byte))};
}

// With MD5 the digest is zero.
inline wire_bytes security_info(bool md5 = false) {
    return md5 ? hex("0000 0014 00000001 00*16") : hex("0000 0004 00000000");
}
inline wire_bytes service_info(uint32_t id, uint32_t priority = 0, uint32_t protocol = 0,
                               uint32_t flags = 0) {
    return hex("0001 0018 01").u8(id).u8(priority).u8(protocol).u32(flags).zeros(16);
}
inline wire_bytes router_identity(be32 router, be32 appliance, uint32_t receive_id = 0xa1a2a3a4) {
    return hex("0002 0014").addr(router).u32(receive_id).addr(appliance).u32(1).addr(appliance);
}
inline wire_bytes router_view(const std::vector<be32> &routers, const std::vector<hash_element> &elements,
                              be32 key_address = {}, uint32_t key_change = 0) {
    wire_bytes out = hex("0004 0000 c1c2c3c4").addr(key_address).u32(key_change);
    out.u32(static_cast<uint32_t>(routers.size()));
    for (const be32 router : routers)
        out.addr(router);
    out.u32(static_cast<uint32_t>(elements.size()));
    for (const hash_element &each : elements)
        out.addr(each.appliance).u32(0).add(each.buckets).u16(each.weight).u16(0);
    return out.put16(2, static_cast<uint32_t>(out.size() - 4));
}
inline wire_bytes capability_info(uint32_t forwarding, uint32_t assignment, uint32_t ret) {
    return hex("0008 0018 0001 0004")
        .u32(forwarding)
        .hex("0002 0004")
        .u32(assignment)
        .hex("0003 0004")
        .u32(ret);
}
