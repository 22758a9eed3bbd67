// Mask assignment: the mask values of the designated appliance's table.
#pragma once

#include "engine/wccp_records.h"

// Lock held. The first computes mask_in_use and mask_values. The second sets the owners of the values and the
// counts in dsg_appliances from bucket_ipa; 0, or 1, with a line in the log, when the table has another
// number of slots.
void wccp_mask_assignment_calculate_value_table(wccp_service_group *group);
int wccp_mask_assignment_assign_mask_values(wccp_service_group *group);

// The mask that the assignment uses: the configured one, or the default if that has more than 7 bits.
wccp_mask wccp_mask_of_assignment(const wccp_service_group *group);
