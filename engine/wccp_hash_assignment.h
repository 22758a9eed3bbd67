// Hash assignment: the buckets of the designated appliance's table.
#pragma once

#include "engine/wccp_records.h"

// Sets bucket_index and the counts in dsg_appliances from bucket_ipa. Lock held.
void wccp_hash_assignment_assign_hash_buckets(wccp_service_group *group);
