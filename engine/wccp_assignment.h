// The designated appliance's table: which appliance serves which hash bucket or mask value. Lock held for the
// functions that take a group; the others use only their arguments.
#pragma once

#include "engine/wccp_records.h"

// A computation: start, add for each appliance that all routers list, finish. Afterwards dsg_active_count is
// the number of appliances in the table; with 0, call cleanup to clear it.
void wccp_designated_appliance_assignment_start(wccp_service_group *group);
void wccp_designated_appliance_assignment_add(wccp_service_group *group,
                                              const wccp_view_appliance *appliance);
void wccp_designated_appliance_assignment_finish(wccp_service_group *group);
void wccp_designated_appliance_assignment_cleanup(wccp_service_group *group);

// Fills `table`, of `slots` entries, in proportion to the weights of `entries`, which it sorts. The share of
// an entry that is down is split among the others. A `seed` other than 0 shuffles the table at the end.
// Without memory, and without an entry that is up, the table stays as it is.
void wccp_compute_assignment_table(uint32_t count, wccp_dsg_appliance *entries, uint32_t slots, be32 *table,
                                   uint32_t seed);
// The proportional split, in the order of the arguments. Nothing without weights or without memory.
void compute_u8_assignment_array(uint32_t count, const be32 *identifiers, const uint16_t *weights,
                                 uint32_t slots, be32 *table);
// A shuffle that keeps only the low 8 bits of each entry.
void scramble_u8_array(uint32_t slots, be32 *table, uint32_t seed);
