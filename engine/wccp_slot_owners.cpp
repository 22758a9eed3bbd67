#include "engine/wccp_slot_owners.h"

wccp_dsg_appliance *wccp_find_dsg_appliance(wccp_service_group *group, uint32_t count, be32 address) {
    for (uint32_t i = 0; i < count; i++)
        if (group->dsg_appliances[i].ipa == address)
            return &group->dsg_appliances[i];
    return nullptr;
}

void wccp_count_slots_by_owner(wccp_service_group *group, uint8_t *out_index) {
    for (uint32_t i = 0; i < group->dsg_active_count; i++)
        group->dsg_appliances[i].assigned = 0;
    wccp_dsg_appliance *owner = nullptr;
    for (uint32_t slot = 0; slot < group->bucket_count; slot++) {
        const be32 address = group->bucket_ipa[slot];
        if (slot == 0 || !(address == group->bucket_ipa[slot - 1])) // an appliance's slots are consecutive
            owner = wccp_find_dsg_appliance(group, group->dsg_active_count, address);
        // A slot of an earlier table, whose appliance has left.
        if (!owner)
            continue;
        owner->assigned++;
        if (out_index)
            out_index[slot] = static_cast<uint8_t>(owner - group->dsg_appliances);
    }
}
