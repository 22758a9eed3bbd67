// Which of the active appliances serves a slot of the table, for hash buckets and mask values alike. Lock
// held.
#pragma once

#include "engine/wccp_records.h"

// The entry of an address among the first `count` of dsg_appliances, or null.
wccp_dsg_appliance *wccp_find_dsg_appliance(wccp_service_group *group, uint32_t count, be32 address);

// Counts in `assigned` how many of the first bucket_count slots each active appliance serves. With
// `out_index` (bucket_count places) also writes the index of each slot's appliance; a slot whose address
// belongs to no active appliance isn't counted and keeps its index.
void wccp_count_slots_by_owner(wccp_service_group *group, uint8_t *out_index);
