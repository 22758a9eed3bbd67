// Hash assignment: the table of 256 buckets in the form that goes out, an index for each bucket, and how many
// buckets each appliance holds. Runs at the end of a computation, under the engine lock.
//
// A bucket whose appliance is no active entry keeps the index that it had: that is so only when the table
// could not be computed for want of memory, and the sum of the counts then tells.
#include "engine/wccp_hash_assignment.h"

#include "engine/wccp_assignment.h"

void wccp_hash_assignment_assign_hash_buckets(wccp_service_group *group) {
    for (uint32_t i = 0; i < group->dsg_active_count; i++)
        group->dsg_appliances[i].assigned = 0;
    wccp_dsg_appliance *owner = nullptr;
    for (uint32_t slot = 0; slot < group->bucket_count; slot++) {
        const be32 address = group->bucket_ipa[slot];
        if (slot == 0 || !(address == group->bucket_ipa[slot - 1])) // buckets come in runs
            owner = wccp_find_dsg_appliance(group, group->dsg_active_count, address);
        if (!owner)
            continue;
        group->bucket_index[slot] = static_cast<uint8_t>(owner - group->dsg_appliances);
        owner->assigned++;
    }
}
