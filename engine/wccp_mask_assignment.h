#pragma once

#include "engine/wccp_records.h"

// The values that the group's mask spans, and their owners from bucket_ipa. Lock held.
void wccp_mask_assignment_calculate_value_table(wccp_service_group *group);
int wccp_mask_assignment_assign_mask_values(wccp_service_group *group);

// The mask that the assignment works with, of 7 bits at most: the configured one, or the one that replaces a
// longer one.
wccp_mask wccp_mask_of_assignment(const wccp_service_group *group);
