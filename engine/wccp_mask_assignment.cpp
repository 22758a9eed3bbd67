// Mask assignment: the values of the group's mask, and the appliance that serves each value.
//
// A router ANDs fields of a packet with the mask and looks the result up among the values. The bits of the
// mask are numbered in a fixed order over the fields; value k has those bits set whose number is a set bit of
// k. Thus 7 bits give 128 values, and a mask of 0 gives the single value 0. A mask of more bits is not used
// for the assignment: four bits of the destination address replace it. The configured mask remains, and
// Here-I-Am continues to carry it.
//
// Runs during a computation of the table, with the engine lock held: first the values, which are the slots of
// the table, and at the end their owners. Masks and values are in host order.
#include "engine/wccp_mask_assignment.h"

#include <cstring>

#include "engine/wccp_complaints.h"
#include "engine/wccp_slot_owners.h"
#include "engine/wccp_utils.h"

namespace {

constexpr uint32_t DEFAULT_DST_IP_MASK = 0xF00;

void wccp_mask_assignment_set_bit_array_element(wccp_service_group *group, const wccp_mask &bit) {
    // Not expected: a mask of more bits has been replaced by the default one.
    if (group->mask_bit_count >= WCCP_MAX_MASK_BITS) {
        QV_LOG(LC_LOG_ERR, "WCCP GRP %d: mask assignment: bit array: is full (%d)", group->id,
               static_cast<int>(group->mask_bit_count));
        return;
    }
    group->mask_bit_array[group->mask_bit_count++] = bit;
}

void build_bit_array(wccp_service_group *group) {
    enum { DST_PORT, SRC_PORT, DST_IP, SRC_IP, FIELDS }; // the order in which bits are numbered
    const wccp_mask &mask = group->mask_in_use;
    const uint32_t fields[FIELDS] = {mask.dst_port, mask.src_port, mask.dst_ip, mask.src_ip};
    for (uint32_t field = 0; field < FIELDS; field++) {
        // Each round isolates the lowest bit that is left, and clears it.
        for (uint32_t left = fields[field]; left != 0; left &= left - 1) {
            uint32_t alone[FIELDS] = {};
            alone[field] = left & (~left + 1);
            wccp_mask_assignment_set_bit_array_element(group,
                                                       {
                                                           .src_ip = alone[SRC_IP],
                                                           .dst_ip = alone[DST_IP],
                                                           .src_port = static_cast<uint16_t>(alone[SRC_PORT]),
                                                           .dst_port = static_cast<uint16_t>(alone[DST_PORT]),
                                                       });
        }
    }
}

// Value k is the value of k without its lowest set bit, with the mask bit of that number added.
void wccp_mask_assignment_generate_values(wccp_service_group *group) {
    const uint32_t count = 1u << group->mask_bit_count;
    group->mask_values[0] = {};
    for (uint32_t k = 1; k < count; k++) {
        // The value without the lowest bit of k has been computed before: its index is smaller.
        const wccp_mask &bit = group->mask_bit_array[__builtin_ctz(k)];
        wccp_mask_value value = group->mask_values[k & (k - 1)];
        value.src_ip |= bit.src_ip;
        value.dst_ip |= bit.dst_ip;
        value.src_port = static_cast<uint16_t>(value.src_port | bit.src_port);
        value.dst_port = static_cast<uint16_t>(value.dst_port | bit.dst_port);
        group->mask_values[k] = value;
    }
    group->mask_value_count = count;
}

} // namespace

wccp_mask wccp_mask_of_assignment(const wccp_service_group *group) {
    const wccp_mask configured = {group->mask_src_ip, group->mask_dst_ip, group->mask_src_port,
                                  group->mask_dst_port};
    return util_wccp_mask_get_bits_set(&configured) > WCCP_MAX_MASK_BITS
               ? wccp_mask{0, DEFAULT_DST_IP_MASK, 0, 0}
               : configured;
}

void wccp_mask_assignment_calculate_value_table(wccp_service_group *group) {
    group->mask_bit_count = 0;
    memset(group->mask_bit_array, 0, sizeof group->mask_bit_array);
    group->mask_value_count = 0;
    memset(group->mask_values, 0, sizeof group->mask_values);
    // A copy, because the configured mask can change before the table is computed again.
    wccp_mask *const mask = &group->mask_in_use;
    *mask = {group->mask_src_ip, group->mask_dst_ip, group->mask_src_port, group->mask_dst_port};
    group->mask_value_bits = group->mask_bits;
    if (group->mask_value_bits > WCCP_MAX_MASK_BITS) {
        WCCP_COMPLAIN(
            LC_LOG_WARNING,
            "WCCP GRP %d: mask assignment: too many bits (%d) set in mask: sip 0x%x dip 0x%x sport 0x%x "
            "dport 0x%x . using defaultdestination MASK 0x%x",
            group->id, static_cast<int>(group->mask_value_bits), mask->src_ip, mask->dst_ip, mask->src_port,
            mask->dst_port, DEFAULT_DST_IP_MASK);
        *mask = wccp_mask_of_assignment(group);
        group->mask_value_bits = util_wccp_mask_get_bits_set(mask);
    }
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: mask assignment: bits set: %d sip 0x%x dip 0x%x sport 0x%x dport 0x%x ",
           group->id, static_cast<int>(group->mask_value_bits), mask->src_ip, mask->dst_ip, mask->src_port,
           mask->dst_port);
    build_bit_array(group);
    wccp_mask_assignment_generate_values(group);
}

int wccp_mask_assignment_assign_mask_values(wccp_service_group *group) {
    if (group->mask_value_count != group->bucket_count) {
        QV_LOG(LC_LOG_ERR,
               "WCCP GRP %d: mask assignment: mask values (%d) and number of buckets (%d) mismatch.",
               group->id, static_cast<int>(group->mask_value_count), static_cast<int>(group->bucket_count));
        return 1;
    }
    for (uint32_t i = 0; i < group->mask_value_count; i++)
        group->mask_values[i].appliance_ipa = group->bucket_ipa[i];
    wccp_count_slots_by_owner(group, nullptr);
    const wccp_mask &mask = group->mask_in_use;
    QV_LOG(LC_LOG_INFO,
           "WCCP GRP %d: mask assign. values/appliance ids added. mask: sip 0x%x dip 0x%x sport 0x%x dport "
           "0x%x values: %d active appliances: %d",
           group->id, mask.src_ip, mask.dst_ip, mask.src_port, mask.dst_port,
           static_cast<int>(group->mask_value_count), static_cast<int>(group->dsg_active_count));
    return 0;
}
