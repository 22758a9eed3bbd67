// The designated appliance's table: which appliance serves which bucket or mask value. Lock held for what
// takes a group; the three computations work on their arguments alone.
#pragma once

#include "engine/wccp_records.h"

void wccp_designated_appliance_assignment_start(wccp_service_group *group);
void wccp_designated_appliance_assignment_add(wccp_service_group *group,
                                              const wccp_view_appliance *appliance);
void wccp_designated_appliance_assignment_finish(wccp_service_group *group);
void wccp_designated_appliance_assignment_cleanup(wccp_service_group *group);

// `table` holds address words as they lie in memory.
void wccp_compute_assignment_table(uint32_t count, wccp_dsg_appliance *entries, uint32_t slots, be32 *table,
                                   uint32_t seed);
void compute_u8_assignment_array(uint32_t count, const be32 *identifiers, const uint16_t *weights,
                                 uint32_t slots, be32 *table);
void scramble_u8_array(uint32_t slots, be32 *table, uint32_t seed);
