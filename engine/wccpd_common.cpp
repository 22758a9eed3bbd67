// wccpd's side of the mailbox to tunneld, and the policy groups whose roles it publishes there.
//
// The mailbox. One mutex, behind every other lock of the engine and in front of none, keeps commands apart:
// it is held from the first input to the end of the wait, so two commands never overlap, whichever of the
// engine's locks their callers hold. `command` is taken to 0 before an input is touched, because a delete or
// an L2 return that timed out is still pending and tunneld may be reading it; it is written last, with
// release order, and the answer is looked for with acquire order.
//
// The wait is a poll of one millisecond, two thousand times. Between two polls, once there is no answer yet,
// it is a cancellation point: an answer that has come is taken, and a thread cancelled before lets go of the
// mutex on its way out and withdraws an add, as after a time-out, since nobody would know the tunnel that
// came of it.
//
// The reset at exit runs on the main thread while an engine thread may be waiting. It raises `abandon`, which
// ends a wait at its next look with the result of a time-out, then waits for the mutex, and only then
// clears the header: a waiter never sees a `command` that the reset has cleared. Commands after the reset
// (the tunnels deleted at exit) are given as ever. The memberships go before the roles are reset: an engine
// thread that still changes state then reaches no policy group, and tunneld is left with UNKNOWN for all.
//
// Policy groups. A second small mutex, also a leaf, keeps the management thread, which changes membership,
// from the engine's threads, which change roles. A table of 65536 bit sets would be 2 MB of locked memory for
// what is at most a few hundred memberships, so `policy_grp_members` holds the sets that are not empty, in no
// order, and grows when one more is needed. Where it can't grow, the membership isn't taken, the caller is
// told, and what was there stays.

#include "engine/wccpd_common.h"

#include <poll.h>
#include <pthread.h>

#include <cstdlib>
#include <cstring>

#include "runtime/cmem.h"
#include "runtime/guards.h"
#include "runtime/logging.h"

static pthread_mutex_t mailbox_mutex = PTHREAD_MUTEX_INITIALIZER;
static std::atomic<bool> abandon;

static constexpr int ANSWER_POLLS = 2000;

// mailbox_mutex held.
static void reset_block(wccp_tunnel_mailbox *mailbox, uint32_t index) {
    mailbox->command.store(MAILBOX_IDLE, std::memory_order_release);
    mailbox_put(mailbox->tunnel_id, uint16_t{0});
    mailbox_put(mailbox->status, 0u);
    mailbox_put(mailbox->local_ip, 0u);
    mailbox_put(mailbox->remote_ip, 0u);
    mailbox_put(mailbox->fmst_index, index);
    mailbox_put(mailbox->l2_group, uint8_t{0});
    memset(mailbox->padding, 0, sizeof mailbox->padding);
    mailbox_put(mailbox->l2_value, 0u);
    for (uint32_t i = 0; i < WCCP_POLICY_GROUPS; i++) {
        wccp_policy_role *entry = &mailbox->policy_roles[i];
        mailbox_put(entry->policy_group, static_cast<uint16_t>(i));
        entry->padding = 0;
        entry->role.store(2, std::memory_order_relaxed);
    }
}

int wccp_init_shmem() {
    constexpr uint32_t length = sizeof(wccp_tunnel_mailbox);
    auto *mailbox = static_cast<wccp_tunnel_mailbox *>(cmem_create_block(length, WCCP_MAILBOX_NAME));
    if (!mailbox) {
        QV_LOG(LC_LOG_ERR, "WCCP: Failed to create shared memory of size %u bytes", length);
        return 1;
    }
    {
        const mutex_guard guard(&mailbox_mutex);
        reset_block(mailbox, WCCP_NO_INDEX);
        mailbox_put(wccp_mailbox_roles, &mailbox->policy_roles[0]);
        mailbox_put(wccp_mailbox, mailbox);
    }
    wccp_init_policy_grp_mgr();
    QV_LOG(LC_LOG_DEBUG, "WCCP: Created shared memory of size: %u bytes", length);
    return 0;
}

int wccp_cleanup_shmem() {
    wccp_tunnel_mailbox *mailbox = mailbox_get(wccp_mailbox);
    if (!mailbox)
        return 0;
    wccp_init_policy_grp_mgr();
    abandon.store(true, std::memory_order_release);
    const mutex_guard guard(&mailbox_mutex);
    reset_block(mailbox, 0);
    abandon.store(false, std::memory_order_release);
    return 0;
}

namespace {

struct mailbox_inputs {
    uint16_t tunnel_id;
    uint32_t local_ip, remote_ip, fmst_index;
    uint8_t l2_group;
    uint32_t l2_value;
};

// What is left of a command that nobody waits for any more: an add is withdrawn, the others stay pending.
struct pending_command {
    ~pending_command() {
        if (!answered && code == MAILBOX_ADD_TUNNEL)
            mailbox->command.store(MAILBOX_IDLE, std::memory_order_release);
    }
    wccp_tunnel_mailbox *mailbox;
    uint16_t code;
    bool answered;
};

// Each command, and the line that tells of its time-out.
struct command_kind {
    uint16_t code;
    int32_t time_out_level;
    const char *time_out_line;
};
const command_kind add_tunnel = {MAILBOX_ADD_TUNNEL, LC_LOG_NOTICE, "GRE tunnel add timed out"};
const command_kind delete_tunnel = {MAILBOX_DELETE_TUNNEL, LC_LOG_DEBUG, "GRE tunnel delete timed out"};
const command_kind set_l2_return = {MAILBOX_L2_RETURN, LC_LOG_ERR, "GRE tunnel L2 return add timed out"};

// Gives the command and waits. True when tunneld has answered; the answer then stands in the outputs.
bool give_command(const command_kind *kind, const mailbox_inputs *inputs, uint32_t *out_status,
                  uint32_t *out_index) {
    const mutex_guard guard(&mailbox_mutex);
    wccp_tunnel_mailbox *mailbox = mailbox_get(wccp_mailbox);
    if (!mailbox)
        return false;
    mailbox->command.store(MAILBOX_IDLE, std::memory_order_release);
    if (kind->code == MAILBOX_L2_RETURN) {
        mailbox_put(mailbox->l2_group, inputs->l2_group);
        mailbox_put(mailbox->l2_value, inputs->l2_value);
    } else {
        mailbox_put(mailbox->tunnel_id, inputs->tunnel_id);
        mailbox_put(mailbox->local_ip, inputs->local_ip);
        mailbox_put(mailbox->remote_ip, inputs->remote_ip);
        mailbox_put(mailbox->fmst_index, inputs->fmst_index);
    }
    pending_command pending = {mailbox, kind->code, false};
    mailbox->command.store(kind->code, std::memory_order_release);
    for (int i = 0; i < ANSWER_POLLS; i++) {
        {
            const cancel_off_guard whole;
            poll(nullptr, 0, 1);
        }
        if (mailbox->command.load(std::memory_order_acquire) == MAILBOX_IDLE) {
            pending.answered = true;
            *out_status = mailbox_get(mailbox->status);
            *out_index = mailbox_get(mailbox->fmst_index);
            return true;
        }
        if (abandon.load(std::memory_order_acquire))
            return false;
        pthread_testcancel();
    }
    QV_LOG(kind->time_out_level, "%s", kind->time_out_line);
    return false;
}

mailbox_inputs tunnel_inputs(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                             uint32_t index) {
    return {.tunnel_id = tunnel_id,
            .local_ip = static_cast<uint32_t>(local.words[0]),
            .remote_ip = static_cast<uint32_t>(remote.words[0]),
            .fmst_index = index,
            .l2_group = 0,
            .l2_value = 0};
}

} // namespace

int wccp_add_tunnel_encap(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                          uint32_t *inout_index) {
    const mailbox_inputs inputs = tunnel_inputs(tunnel_id, local, remote, *inout_index);
    uint32_t status, index;
    if (!give_command(&add_tunnel, &inputs, &status, &index))
        return 1;
    *inout_index = index;
    return index == WCCP_NO_INDEX ? 1 : static_cast<int>(status);
}

int wccp_del_tunnel_encap(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                          uint32_t *inout_index) {
    const mailbox_inputs inputs = tunnel_inputs(tunnel_id, local, remote, *inout_index);
    uint32_t status, index;
    if (!give_command(&delete_tunnel, &inputs, &status, &index))
        return 1;
    *inout_index = index;
    return static_cast<int>(status);
}

int wccp_set_L2_return(uint8_t group_id, uint32_t value) {
    mailbox_inputs inputs = {};
    inputs.l2_group = group_id;
    inputs.l2_value = value;
    uint32_t status, index;
    if (!give_command(&set_l2_return, &inputs, &status, &index))
        return 1;
    return static_cast<int>(status);
}

// Policy groups.

namespace {

constexpr uint32_t SERVICE_GROUPS = 256;

struct policy_grp_set { // one policy group with members
    uint16_t policy;
    uint8_t bits[SERVICE_GROUPS / 8]; // service group s is bit s % 8 of byte s / 8
};

struct service_roles {
    uint32_t of[SERVICE_GROUPS];
};
constexpr service_roles all_unknown() {
    service_roles roles = {};
    for (uint32_t &role : roles.of)
        role = 2;
    return roles;
}

pthread_mutex_t policy_mutex = PTHREAD_MUTEX_INITIALIZER;
// All below: policy_mutex.
service_roles svc_role = all_unknown();
uint16_t svc_policy_grp[SERVICE_GROUPS]; // 0 for none
policy_grp_set *policy_grp_members;
uint32_t policy_grp_count, policy_grp_room;

policy_grp_set *find_members(uint16_t policy) {
    for (uint32_t i = 0; i < policy_grp_count; i++)
        if (policy_grp_members[i].policy == policy)
            return &policy_grp_members[i];
    return nullptr;
}

bool is_member(const policy_grp_set *set, uint32_t id) {
    return set && ((set->bits[id / 8] >> (id % 8)) & 1) != 0;
}

policy_grp_set *find_or_make_members(uint16_t policy) {
    if (policy_grp_set *set = find_members(policy))
        return set;
    if (policy_grp_count == policy_grp_room) {
        const uint32_t room = policy_grp_room ? policy_grp_room * 2 : 16;
        void *grown = realloc(policy_grp_members, room * sizeof(policy_grp_set));
        if (!grown)
            return nullptr;
        policy_grp_members = static_cast<policy_grp_set *>(grown);
        policy_grp_room = room;
    }
    policy_grp_set *set = &policy_grp_members[policy_grp_count++];
    *set = {};
    set->policy = policy;
    return set;
}

void forget_members(policy_grp_set *set) {
    *set = policy_grp_members[--policy_grp_count];
}

void remove_member(uint16_t policy, uint8_t id) {
    policy_grp_set *set = find_members(policy);
    if (!set)
        return;
    set->bits[id / 8] = static_cast<uint8_t>(set->bits[id / 8] & ~(1u << (id % 8)));
    for (const uint8_t byte : set->bits)
        if (byte)
            return;
    forget_members(set);
}

void update_policy_role(uint16_t policy) {
    if (!wccp_attach_mailbox())
        return;
    std::atomic<uint32_t> *role = &wccp_mailbox_roles[policy].role;
    const policy_grp_set *set = find_members(policy);
    if (!set) {
        role->store(2, std::memory_order_relaxed);
        QV_LOG(LC_LOG_DEBUG, "WCCP: Update policy group %d role to UNKNOWN", policy);
        return;
    }
    for (uint32_t id = 0; id < SERVICE_GROUPS; id++) {
        if (!is_member(set, id) || svc_role.of[id] == 0)
            continue;
        role->store(1, std::memory_order_relaxed);
        QV_LOG(LC_LOG_DEBUG, "WCCP: Update policy group %d role to BACKUP", policy);
        return;
    }
    role->store(0, std::memory_order_relaxed);
    QV_LOG(LC_LOG_DEBUG, "WCCP: Update policy group %d role to ACTIVE", policy);
}

} // namespace

int wccp_init_policy_grp_mgr() {
    const mutex_guard guard(&policy_mutex);
    free(policy_grp_members);
    policy_grp_members = nullptr;
    policy_grp_count = policy_grp_room = 0;
    svc_role = all_unknown();
    memset(svc_policy_grp, 0, sizeof svc_policy_grp);
    return 0;
}

int wccp_add_policy_grp(uint16_t policy, uint32_t count, const uint8_t *ids) {
    const mutex_guard guard(&policy_mutex);
    int result = 0;
    for (uint32_t i = 0; i < count; i++) {
        const uint8_t id = ids[i];
        policy_grp_set *set = find_or_make_members(policy);
        if (!set) {
            QV_LOG(LC_LOG_ERR, "WCCP: No memory to add Service group %d to Policy group %d", id, policy);
            result = 1;
            continue;
        }
        set->bits[id / 8] = static_cast<uint8_t>(set->bits[id / 8] | (1u << (id % 8)));
        svc_policy_grp[id] = policy;
        QV_LOG(LC_LOG_DEBUG, "WCCP: Add Service group %d to Policy group %d", id, policy);
    }
    update_policy_role(policy);
    return result;
}

int wccp_remove_policy_grp(uint16_t policy, uint8_t id) {
    const mutex_guard guard(&policy_mutex);
    remove_member(policy, id);
    svc_policy_grp[id] = 0;
    QV_LOG(LC_LOG_DEBUG, "WCCP GRP %d: Remove Service group from Policy group %d", id, policy);
    update_policy_role(policy);
    return 0;
}

int wccp_del_entire_policy_grp(uint16_t policy) {
    const mutex_guard guard(&policy_mutex);
    if (policy_grp_set *set = find_members(policy)) {
        for (uint32_t id = 0; id < SERVICE_GROUPS; id++)
            if (is_member(set, id))
                svc_policy_grp[id] = 0;
        forget_members(set);
    }
    QV_LOG(LC_LOG_DEBUG, "WCCP: Delete Policy group %d", policy);
    update_policy_role(policy);
    return 0;
}

int wccp_check_policy_group(uint16_t policy, uint8_t id) {
    const mutex_guard guard(&policy_mutex);
    return is_member(find_members(policy), id) ? 1 : 0;
}

int wccp_set_role(uint8_t id, uint32_t role) {
    const mutex_guard guard(&policy_mutex);
    svc_role.of[id] = role;
    QV_LOG(LC_LOG_DEBUG, "WCCP GRP %d: Set internal service role to %d", id, static_cast<int>(role));
    if (svc_policy_grp[id] != 0)
        update_policy_role(svc_policy_grp[id]);
    return 0;
}
