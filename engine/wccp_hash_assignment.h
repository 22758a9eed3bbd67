#pragma once

#include "engine/wccp_records.h"

// Index and count of each bucket's owner, from bucket_ipa. Lock held.
void wccp_hash_assignment_assign_hash_buckets(wccp_service_group *group);
