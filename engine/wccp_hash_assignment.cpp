// Hash assignment: derives from the table of 256 buckets the form in which it is sent, an index for each
// bucket, and the number of buckets of each appliance. Runs at the end of a computation, with the engine lock
// held.
//
// A bucket whose appliance is not an active entry keeps its index. That happens only when there was no memory
// to compute the table; the sum of the counts then differs from 256, which is logged when the table is sent.
#include "engine/wccp_hash_assignment.h"

#include "engine/wccp_slot_owners.h"

void wccp_hash_assignment_assign_hash_buckets(wccp_service_group *group) {
    wccp_count_slots_by_owner(group, group->bucket_index);
}
