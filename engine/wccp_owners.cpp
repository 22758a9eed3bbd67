// Collects the owners of the slots and prints them. Lock held, except in wccp_print_owners.
#include "engine/wccp_owners.h"

#include <cstring>

#include "engine/wccp_debug_pieces.h"
#include "engine/wccp_mask_assignment.h"
#include "engine/wccp_utils.h"

namespace {

constexpr be32 NO_OWNER = {};

// Distributes the low bits of `*inout_index` over the set bits of `mask`, lowest first, and shifts them out.
uint32_t spread_index_bits(uint32_t mask, uint32_t *inout_index) {
    uint32_t value = 0;
    // Each round handles the lowest bit of the mask that is left, and clears it.
    for (; mask != 0; mask &= mask - 1, *inout_index >>= 1)
        if (*inout_index & 1)
            value |= mask & (~mask + 1);
    return value;
}

bool is_mask_value(const wccp_mask &mask, uint32_t index, const wccp_wire_mask &found) {
    // In the order in which the bits of the mask are numbered.
    return to_host(found.dst_port) == spread_index_bits(mask.dst_port, &index) &&
           to_host(found.src_port) == spread_index_bits(mask.src_port, &index) &&
           to_host(found.dst_ip) == spread_index_bits(mask.dst_ip, &index) &&
           to_host(found.src_ip) == spread_index_bits(mask.src_ip, &index);
}

// Whether a router assigns the slot to an appliance. With nothing assigned, the bits are those of an earlier
// report.
bool router_assigns_slot(const wccp_rtr_view_appliance *entry, bool by_mask, uint32_t slot) {
    if (entry->buckets_assigned == 0)
        return false;
    if (!by_mask) { // words are in host order; on the wire, bucket 0 is the lowest bit of the first byte
        const be32 word = to_be32(entry->bucket_bits[slot / 32]);
        return word.bytes[slot / 8 % 4] >> slot % 8 & 1;
    }
    const auto *bytes = reinterpret_cast<const uint8_t *>(entry->bucket_bits);
    return bytes[slot / 8] >> slot % 8 & 1;
}

void add_reported_owners(const wccp_sending_router *router, bool by_mask, uint32_t slots, be32 *owners) {
    // The first router that reports an owner of a slot decides.
    for (uint32_t i = 0; i < router->view_appliance_count; i++)
        for (uint32_t slot = 0; slot < slots; slot++)
            if (owners[slot] == NO_OWNER && router_assigns_slot(&router->view_appliances[i], by_mask, slot))
                owners[slot] = router->view_appliances[i].ipa;
}

// Returns `slots` when the owner of at least one slot is known, otherwise 0. A router whose values are in
// another order makes all reports unusable.
uint32_t find_slot_owners(const wccp_service_group *group, bool by_mask, uint32_t slots, be32 *owners) {
    memset(owners, 0, sizeof *owners * WCCP_MAX_BUCKETS);
    // A designated appliance without a table asks the routers, like any other.
    if (group->designated == 1 && group->bucket_count == slots && group->dsg_active_count != 0) {
        memcpy(owners, group->bucket_ipa, sizeof *owners * slots);
        return slots;
    }
    for (const wccp_sending_router *router = group->sending_routers; router; router = router->next)
        if (by_mask && router->total_buckets != 0 && !router->map_in_order)
            return 0;
    for (const wccp_sending_router *router = group->sending_routers; router; router = router->next)
        add_reported_owners(router, by_mask, slots, owners);
    for (uint32_t slot = 0; slot < slots; slot++)
        if (!(owners[slot] == NO_OWNER))
            return slots;
    return 0;
}

int print_table_kind(const wccp_service_group *group, bool by_mask, wccp_piece *piece) {
    const wccp_mask mask = wccp_mask_of_assignment(group);
    if (by_mask)
        wccp_piece_add(piece, "mask %x %x %x %x members", mask.src_ip, mask.dst_ip, mask.src_port,
                       mask.dst_port);
    else
        wccp_piece_add(piece, "hash members");
    for (const wccp_view_appliance *member = group->appliance_view; member; member = member->next)
        wccp_piece_add(piece, " %s", addr_text(member->ipa).s);
    return wccp_piece_flush(piece);
}

int print_owner_runs(const be32 *owners, uint32_t slots, wccp_piece *piece) {
    wccp_piece_add(piece, " owners");
    // Runs of slots with the same owner are printed as address*length.
    for (uint32_t first = 0, next; first < slots; first = next) {
        for (next = first + 1; next < slots && owners[next] == owners[first];)
            next++;
        wccp_piece_add(piece, " %s*%u", addr_text(owners[first]).s, next - first);
    }
    return wccp_piece_flush(piece);
}

int print_group_owners(const wccp_service_group *group, csys_display_buf *buffer) {
    const bool by_mask = group->assign_method == WCCP_ASSIGN_MASK;
    if (!by_mask && group->assign_method != WCCP_ASSIGN_HASH)
        return 0;
    wccp_piece piece = wccp_assignment_piece(buffer);
    WCCP_BAIL_ON_ZERO(print_table_kind(group, by_mask, &piece));
    const wccp_mask mask = wccp_mask_of_assignment(group);
    // The mask of an assignment never has more than 7 bits; 128 slots fit in the array.
    const uint32_t slots = by_mask ? 1u << util_wccp_mask_get_bits_set(&mask) : WCCP_MAX_BUCKETS;
    be32 owners[WCCP_MAX_BUCKETS];
    if (find_slot_owners(group, by_mask, slots, owners) != 0)
        WCCP_BAIL_ON_ZERO(print_owner_runs(owners, slots, &piece));
    return 0;
}

} // namespace

bool wccp_map_is_in_order(const wccp_service_group *group, const wccp_assign_map_info *map) {
    const wccp_mask mask = wccp_mask_of_assignment(group);
    const wccp_wire_mask &theirs = map->masks->mask;
    if (map->element_count != 1 || map->value_count > 1u << util_wccp_mask_get_bits_set(&mask) ||
        to_host(theirs.src_ip) != mask.src_ip || to_host(theirs.dst_ip) != mask.dst_ip ||
        to_host(theirs.src_port) != mask.src_port || to_host(theirs.dst_port) != mask.dst_port)
        return false;
    for (uint32_t i = 0; i < map->value_count; i++)
        if (!is_mask_value(mask, i, map->values[i].value))
            return false;
    return true;
}

int wccp_print_owners(int id, csys_display_buf *buffer) {
    if (!buffer)
        return 1;
    const wccp_engine_lock lock;
    const wccp_service_group *group = wccp_find_group(id);
    return group ? print_group_owners(group, buffer) : 1;
}
