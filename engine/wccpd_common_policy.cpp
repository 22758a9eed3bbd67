// Policy groups: which service groups belong to each, and the role that follows from theirs.
//
// The policy mutex separates the main thread, which changes memberships, from the engine's threads, which
// change roles with the engine lock held. It is taken after the engine lock and covers the publication of a
// role.
//
// A table of bit sets for all 65536 policy groups would take 2 MB of locked memory for a few hundred
// memberships at most. Therefore `policy_grp_members` holds only the sets that are not empty, unsorted, and
// grows when one more is needed. When it cannot grow, the membership is refused and the table stays as it
// was.

#include "engine/wccpd_common.h"

#include <pthread.h>

#include <cstdlib>
#include <cstring>

#include "engine/wccp_records.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

namespace {

constexpr uint32_t SERVICE_GROUPS = 256;

struct policy_grp_set { // a policy group that has members
    uint16_t policy;
    uint8_t bits[SERVICE_GROUPS / 8]; // service group s is bit s % 8 of byte s / 8
};

struct service_roles {
    uint32_t of[SERVICE_GROUPS];
};
constexpr service_roles make_unknown_roles() {
    service_roles roles = {};
    for (uint32_t &role : roles.of)
        role = 2;
    return roles;
}

pthread_mutex_t policy_mutex = PTHREAD_MUTEX_INITIALIZER;
// Guarded by policy_mutex, which all functions below expect to be held.
service_roles svc_role = make_unknown_roles();
uint16_t svc_policy_grp[SERVICE_GROUPS]; // 0 for none
policy_grp_set *policy_grp_members;
uint32_t policy_grp_count, policy_grp_room;

policy_grp_set *find_member_set(uint16_t policy) {
    for (uint32_t i = 0; i < policy_grp_count; i++)
        if (policy_grp_members[i].policy == policy)
            return &policy_grp_members[i];
    return nullptr;
}

bool is_member(const policy_grp_set *set, uint32_t id) {
    return set && ((set->bits[id / 8] >> (id % 8)) & 1) != 0;
}

policy_grp_set *find_or_add_member_set(uint16_t policy) {
    if (policy_grp_set *set = find_member_set(policy))
        return set;
    if (policy_grp_count == policy_grp_room) {
        const uint32_t room = policy_grp_room ? policy_grp_room * 2 : 16;
        void *grown = realloc(policy_grp_members, room * sizeof(policy_grp_set));
        if (!grown) // the old array is still valid
            return nullptr;
        policy_grp_members = static_cast<policy_grp_set *>(grown);
        policy_grp_room = room;
    }
    policy_grp_set *set = &policy_grp_members[policy_grp_count++];
    *set = {};
    set->policy = policy;
    return set;
}

void remove_member_set(policy_grp_set *set) {
    *set = policy_grp_members[--policy_grp_count]; // the order does not matter
}

void remove_member(uint16_t policy, uint8_t id) {
    policy_grp_set *set = find_member_set(policy);
    if (!set)
        return;
    set->bits[id / 8] = static_cast<uint8_t>(set->bits[id / 8] & ~(1u << (id % 8)));
    for (const uint8_t byte : set->bits)
        if (byte)
            return;
    // The last member has left; sets without members are not kept.
    remove_member_set(set);
}

// A member whose role is UNKNOWN counts like one in BACKUP.
uint32_t derive_policy_role(const policy_grp_set *set) {
    if (!set)
        return WCCP_ROLE_UNKNOWN;
    for (uint32_t id = 0; id < SERVICE_GROUPS; id++)
        if (is_member(set, id) && svc_role.of[id] != WCCP_ROLE_ACTIVE)
            return WCCP_ROLE_BACKUP;
    return WCCP_ROLE_ACTIVE;
}

void update_policy_role(uint16_t policy) {
    static const char *const lines[] = {"WCCP: Update policy group %d role to ACTIVE",
                                        "WCCP: Update policy group %d role to BACKUP",
                                        "WCCP: Update policy group %d role to UNKNOWN"};
    const uint32_t role = derive_policy_role(find_member_set(policy));
    // With the mutex held: two changes must not publish their roles in the wrong order.
    if (wccp_publish_policy_role(policy, role))
        QV_LOG(LC_LOG_DEBUG, lines[role], policy);
}

} // namespace

int wccp_init_policy_grp_mgr() {
    const mutex_guard guard(&policy_mutex);
    free(policy_grp_members);
    policy_grp_members = nullptr;
    policy_grp_count = policy_grp_room = 0;
    svc_role = make_unknown_roles();
    memset(svc_policy_grp, 0, sizeof svc_policy_grp);
    return 0;
}

int wccp_add_policy_grp(uint16_t policy, uint32_t count, const uint8_t *ids) {
    const mutex_guard guard(&policy_mutex);
    int result = 0;
    for (uint32_t i = 0; i < count; i++) {
        const uint8_t id = ids[i];
        policy_grp_set *set = find_or_add_member_set(policy);
        if (!set) {
            QV_LOG(LC_LOG_ERR, "WCCP: No memory to add Service group %d to Policy group %d", id, policy);
            result = 1;
            continue;
        }
        set->bits[id / 8] = static_cast<uint8_t>(set->bits[id / 8] | (1u << (id % 8)));
        svc_policy_grp[id] = policy; // the bit in an earlier policy group stays
        QV_LOG(LC_LOG_DEBUG, "WCCP: Add Service group %d to Policy group %d", id, policy);
    }
    // Without ids this only publishes the role, UNKNOWN for a policy group that has no members yet.
    update_policy_role(policy);
    return result;
}

int wccp_remove_policy_grp(uint16_t policy, uint8_t id) {
    const mutex_guard guard(&policy_mutex);
    remove_member(policy, id);
    // Even if the group has joined another one since; therefore callers remove it before they add it.
    svc_policy_grp[id] = 0;
    QV_LOG(LC_LOG_DEBUG, "WCCP GRP %d: Remove Service group from Policy group %d", id, policy);
    update_policy_role(policy);
    return 0;
}

int wccp_del_entire_policy_grp(uint16_t policy) {
    const mutex_guard guard(&policy_mutex);
    if (policy_grp_set *set = find_member_set(policy)) {
        for (uint32_t id = 0; id < SERVICE_GROUPS; id++)
            if (is_member(set, id))
                svc_policy_grp[id] = 0;
        remove_member_set(set);
    }
    QV_LOG(LC_LOG_DEBUG, "WCCP: Delete Policy group %d", policy);
    update_policy_role(policy);
    return 0;
}

int wccp_check_policy_group(uint16_t policy, uint8_t id) {
    const mutex_guard guard(&policy_mutex);
    return is_member(find_member_set(policy), id) ? 1 : 0;
}

int wccp_set_role(uint8_t id, uint32_t role) {
    const mutex_guard guard(&policy_mutex);
    svc_role.of[id] = role;
    QV_LOG(LC_LOG_DEBUG, "WCCP GRP %d: Set internal service role to %d", id, static_cast<int>(role));
    if (svc_policy_grp[id] != 0)
        update_policy_role(svc_policy_grp[id]);
    return 0;
}
