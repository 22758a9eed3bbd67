// Which of the active appliances serves each slot of the table, for hash buckets and mask values alike. Lock
// held.
#pragma once

#include "engine/wccp_records.h"

// The entry of an address among the first `count` of dsg_appliances, or null.
wccp_dsg_appliance *wccp_find_dsg_appliance(wccp_service_group *group, uint32_t count, be32 address);

// Sets `assigned` of each active appliance to the number of slots that it serves. If `out_index`, of
// bucket_count entries, is not null, also stores each slot's index in dsg_appliances. A slot whose address is
// not that of an active appliance is not counted and keeps its index.
void wccp_count_slots_by_owner(wccp_service_group *group, uint8_t *out_index);
