// Hash assignment: the table of 256 buckets in the form in which it is sent, an index for each bucket, and
// how many buckets each appliance holds. Runs at the end of a computation, under the engine lock.
//
// A bucket whose appliance is no active entry keeps its previous index. That happens only when the table
// could not be computed for lack of memory, and the sum of the counts then shows it.
#include "engine/wccp_hash_assignment.h"

#include "engine/wccp_slot_owners.h"

void wccp_hash_assignment_assign_hash_buckets(wccp_service_group *group) {
    wccp_count_slots_by_owner(group, group->bucket_index);
}
