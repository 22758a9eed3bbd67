// The designated appliance's table.
//
// wccp_state.cpp collects the appliances that all routers report (start, add for each, finish). finish turns
// their weights into a table of slots, each of which names one appliance: 256 hash buckets, or the values of
// the mask. The slots are split in proportion to the weights over the appliances in sorted order, so that
// each has one run of slots. The order is that of the C library's qsort with a comparison that takes
// addresses as 32-bit words in memory order and returns their difference, which can wrap around. When it
// does, the comparison is not transitive and the order depends on the library; it is the same whenever the
// input is the same.
//
// An appliance that has just left is a down entry. For one computation it keeps its place, and only its run
// is split among the others, so that no other slot moves. It is removed right after, and the next computation
// splits everything over the rest. Between computations dsg_appliances has the active appliances in the order
// of their first arrival; bucket_index refers to this order.
//
// dsg_appliances has 32 entries. A report that replaces many appliances at once can need more, because down
// entries are still in it. Down entries are then dropped, first the one with the fewest slots; slots of
// others may move in this case. An appliance is added only if every router reports it, and a router reports
// at most 32; therefore the active ones always fit.
//
// Everything runs with the engine lock held, in a tick or on a receive thread. The only memory allocated are
// the work arrays of a computation. Nothing depends on a clock or on random numbers: the seed is always 0.
#include "engine/wccp_assignment.h"

#include <cassert>
#include <cstdlib>
#include <cstring>

#include "engine/wccp_complaints.h"
#include "engine/wccp_hash_assignment.h"
#include "engine/wccp_mask_assignment.h"
#include "engine/wccp_slot_owners.h"
#include "engine/wccp_utils.h"
#include "runtime/guards.h"

namespace {

constexpr uint16_t FALLBACK_WEIGHT = 100;

} // namespace

void wccp_designated_appliance_assignment_start(wccp_service_group *group) {
    group->bucket_count = 0;
    for (uint32_t i = 0; i < group->dsg_appliance_count; i++)
        group->dsg_appliances[i].up = 0; // until it is added again
}

namespace {

// Removes the down entry with the fewest slots, the last one of several. False when no entry is down.
bool drop_smallest_down_entry(wccp_service_group *group) {
    wccp_dsg_appliance *const entries = group->dsg_appliances;
    uint32_t least = WCCP_MAX_APPLIANCES;
    for (uint32_t i = 0; i < group->dsg_appliance_count; i++)
        if (!entries[i].up &&
            (least == WCCP_MAX_APPLIANCES || entries[i].assigned <= entries[least].assigned))
            least = i;
    if (least == WCCP_MAX_APPLIANCES)
        return false;
    group->dsg_appliance_count--;
    memmove(&entries[least], &entries[least + 1],
            (group->dsg_appliance_count - least) * sizeof(wccp_dsg_appliance));
    return true;
}

} // namespace

void wccp_designated_appliance_assignment_add(wccp_service_group *group,
                                              const wccp_view_appliance *appliance) {
    if (wccp_dsg_appliance *entry =
            wccp_find_dsg_appliance(group, group->dsg_appliance_count, appliance->ipa)) {
        entry->up = 1;
        entry->weight = appliance->weight;
        return;
    }
    if (group->dsg_appliance_count >= WCCP_MAX_APPLIANCES && !drop_smallest_down_entry(group)) {
        QV_LOG(
            LC_LOG_WARNING,
            "WCCP GRP %d: DSG event: NO redirect. appliance (ipa  %s weight %d) exceeds the maximum of 32.",
            group->id, addr_text(appliance->ipa).s, appliance->weight);
        return;
    }
    group->dsg_appliances[group->dsg_appliance_count++] = {
        .ipa = appliance->ipa, .up = 1, .weight = appliance->weight, .assigned = 0};
}

namespace {

// The number of slots for the agreed method, 0 when none has been agreed. For mask, computes the values.
uint32_t count_slots_of_method(wccp_service_group *group) {
    switch (group->assign_method) {
    case WCCP_ASSIGN_HASH:
        return WCCP_MAX_BUCKETS;
    case WCCP_ASSIGN_MASK:
        wccp_mask_assignment_calculate_value_table(group);
        return group->mask_value_count;
    default:
        QV_LOG(LC_LOG_WARNING,
               "WCCP GRP %d: calculate assignment buckets: assignment method (%d) is not set (yet)",
               group->id, static_cast<int>(group->assign_method));
        return 0;
    }
}

void compute_group_table(wccp_service_group *group) {
    wccp_dsg_appliance entries[WCCP_MAX_APPLIANCES]; // sorted, while dsg_appliances keeps its order
    memcpy(entries, group->dsg_appliances, group->dsg_appliance_count * sizeof entries[0]);
    for (uint32_t i = 0; i < group->dsg_appliance_count; i++)
        group->dsg_active_count += entries[i].up == 1;
    if (group->dsg_active_count == 0) {
        WCCP_COMPLAIN(
            LC_LOG_ERR,
            "WCCP GRP %d: DSG event: cannot find any appliances to redirect traffic to. #of apps: %d, "
            "#of active apps: %d",
            group->id, static_cast<int>(group->dsg_appliance_count),
            static_cast<int>(group->dsg_active_count));
        return;
    }
    // From here on the table counts as computed, even if there is no memory for it.
    group->bucket_count = count_slots_of_method(group);
    if (group->bucket_count != 0)
        wccp_compute_assignment_table(group->dsg_appliance_count, entries, group->bucket_count,
                                      group->bucket_ipa, 0);
}

// Keeps the active entries, in their order, and returns their number.
uint32_t remove_down_entries(wccp_service_group *group) {
    uint32_t kept = 0;
    for (uint32_t i = 0; i < group->dsg_appliance_count; i++)
        if (group->dsg_appliances[i].up == 1)
            group->dsg_appliances[kept++] = group->dsg_appliances[i];
    for (uint32_t i = kept; i < group->dsg_appliance_count; i++)
        group->dsg_appliances[i] = {};
    return kept;
}

} // namespace

void wccp_designated_appliance_assignment_finish(wccp_service_group *group) {
    group->bucket_count = 0;
    group->dsg_active_count = 0;
    compute_group_table(group); // with the down entries, which are removed only then
    const uint32_t kept = remove_down_entries(group);
    if (kept == 0) {
        wccp_designated_appliance_assignment_cleanup(group);
        return;
    }
    group->dsg_appliance_count = kept;
    group->dsg_active_count = kept;
    if (group->assign_method == WCCP_ASSIGN_HASH)
        wccp_hash_assignment_assign_hash_buckets(group);
    else if (group->assign_method == WCCP_ASSIGN_MASK)
        (void)wccp_mask_assignment_assign_mask_values(group);
}

void wccp_designated_appliance_assignment_cleanup(wccp_service_group *group) {
    memset(group->bucket_ipa, 0, sizeof group->bucket_ipa);
    memset(group->bucket_index, 0, sizeof group->bucket_index);
    for (uint32_t i = 0; i < group->dsg_appliance_count; i++)
        group->dsg_appliances[i] = {};
    group->bucket_count = 0;
    group->dsg_appliance_count = 0;
    group->dsg_active_count = 0;
}

// --- The computation

namespace {

void free_address_array(be32 *words) {
    wccp_free(words);
}
void free_weight_array(uint16_t *weights) {
    wccp_free(weights);
}
void free_number_array(uint32_t *numbers) {
    wccp_free(numbers);
}
using owned_address_array = owned<be32, free_address_array>;
using owned_weight_array = owned<uint16_t, free_weight_array>;
using owned_number_array = owned<uint32_t, free_number_array>;

template <typename T>
T *allocate_work_array(uint32_t count) {
    return static_cast<T *>(wccp_calloc(count, sizeof(T)));
}

int compare_address_words(const void *first, const void *second) {
    be32 a, b;
    memcpy(&a, first, sizeof a);
    memcpy(&b, second, sizeof b);
    return static_cast<int>(raw_word(a) - raw_word(b)); // may wrap around, see above
}
static_assert(offsetof(wccp_dsg_appliance, ipa) == 0);

// The slots of an entry. They are consecutive.
struct slot_run {
    uint32_t begin, length;
};
slot_run find_slot_run(const be32 *table, uint32_t slots, be32 address) {
    slot_run run = {0, 0};
    while (run.begin < slots && !(table[run.begin] == address))
        run.begin++;
    while (run.begin + run.length < slots && table[run.begin + run.length] == address)
        run.length++;
    return run;
}

} // namespace

void wccp_compute_assignment_table(uint32_t count, wccp_dsg_appliance *entries, uint32_t slots, be32 *table,
                                   uint32_t seed) {
    if (count == 0)
        return;
    const owned_address_array all(allocate_work_array<be32>(count));
    const owned_weight_array all_weights(allocate_work_array<uint16_t>(count));
    const owned_address_array active(allocate_work_array<be32>(count));
    const owned_weight_array active_weights(allocate_work_array<uint16_t>(count));
    if (!all.pointer || !all_weights.pointer || !active.pointer || !active_weights.pointer) {
        QV_LOG(LC_LOG_ERR, "Computing assignment table failed: out of memory");
        return;
    }
    // The caller's array is a copy; the group's own entries keep the order that bucket_index refers to.
    qsort(entries, count, sizeof *entries, compare_address_words);
    uint32_t active_count = 0, active_weight = 0;
    be32 fallback = {};
    for (uint32_t i = 0; i < count; i++) {
        const wccp_dsg_appliance *entry = &entries[i];
        all.pointer[i] = entry->ipa;
        all_weights.pointer[i] = entry->weight;
        if (!entry->up)
            continue;
        active.pointer[active_count] = entry->ipa;
        active_weights.pointer[active_count++] = entry->weight;
        active_weight += entry->weight;
        // When all weights are 0, the appliance with the highest address word serves everything.
        if (entry->weight == 0 && raw_word(entry->ipa) > raw_word(fallback))
            fallback = entry->ipa;
    }
    if (active_count == 0)
        return;
    if (active_weight == 0) { // nothing to split by
        compute_u8_assignment_array(1, &fallback, &FALLBACK_WEIGHT, slots, table);
    } else {
        // Down entries take part, so that every slot lies where it lay while they were up.
        compute_u8_assignment_array(count, all.pointer, all_weights.pointer, slots, table);
        for (uint32_t i = 0; i < count; i++) { // only the runs of down entries are split again
            if (entries[i].up)
                continue;
            const slot_run run = find_slot_run(table, slots, entries[i].ipa);
            compute_u8_assignment_array(active_count, active.pointer, active_weights.pointer, run.length,
                                        table + run.begin);
        }
    }
    if (seed != 0)
        scramble_u8_array(slots, table, seed);
}

void compute_u8_assignment_array(uint32_t count, const be32 *identifiers, const uint16_t *weights,
                                 uint32_t slots, be32 *table) {
    if (count == 0)
        return;
    const owned_number_array shares(allocate_work_array<uint32_t>(count));
    if (!shares.pointer) {
        QV_LOG(LC_LOG_ERR, "WCCP assignment array calculation failed: out of memory");
        return;
    }
    uint32_t total_weight = 0;
    for (uint32_t i = 0; i < count; i++)
        total_weight += weights[i];
    if (total_weight == 0)
        return;
    const uint32_t num_buckets = slots;
    // At most 32 x 65535 x 256, which fits in 32 bits.
    uint32_t running = 0, k = 0;
    for (uint32_t i = 0; i < count; i++) {
        running += weights[i] * slots; // rounding each quotient down passes the remainder on to later entries
        const uint32_t quotient = running / total_weight;
        shares.pointer[i] = quotient - k;
        k = quotient;
    }
    // The texts that the assertions print are fixed, and clang-format would add spaces to them.
    // clang-format off
    assert(k==num_buckets);
    k = 0;
    for (uint32_t i = 0; i < count; i++)
        for (uint32_t left = shares.pointer[i]; left != 0; left--)
            table[k++] = identifiers[i];
    assert(k==num_buckets);
    // clang-format on
    (void)num_buckets; // otherwise unused with NDEBUG
}

void scramble_u8_array(uint32_t slots, be32 *table, uint32_t seed) {
    unsigned state = seed;
    for (uint32_t i = slots; i-- > 0;) {
        const uint64_t r = static_cast<uint64_t>(rand_r(&state));
        // The random number has 31 bits; therefore j is below i, or 0.
        const uint64_t j = (r * i) >> 31;
        const be32 moved = table[i];
        // For small values only: an address would lose all but its lowest byte.
        table[i] = from_raw_word(raw_word(table[j]) & 0xff);
        table[j] = moved;
    }
}
