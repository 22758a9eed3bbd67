// wccpd's side of the tunnel mailbox, and the policy groups, whose roles it publishes there. No lock needs to
// be held; the functions take the mailbox mutex or the policy mutex, which come after the engine lock.
#pragma once

#include <cstdint>

#include "engine/wccp_reasons.h"
#include "platform/tunnel_mailbox.h"

// Creates the shared memory block, or takes over that of an earlier wccpd. 0, or 1, with a line in the log,
// when it cannot, for example because another wccpd is running; this process then sends no commands and
// publishes nothing.
int wccp_init_shmem();
// Resets the block if this process has created it, and ends waits for tunneld. The block stays. Always 0.
int wccp_cleanup_shmem();

// Commands. Each waits up to about 2 seconds for tunneld's answer. After one that timed out, adds and L2
// returns fail at once for up to 10 seconds; after a delete that timed out, further deletes are sent without
// waiting for their answers. During the exit nothing is waited for after the first time-out. Addresses are in
// host order. They return tunneld's status, in which 1 is failure, or 1 without an answer. `inout_index` is
// the data plane's index of the tunnel and is changed by an answer only; an add that is answered with
// WCCP_NO_INDEX has failed.
int wccp_add_tunnel_encap(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                          uint32_t *inout_index);
// The same; when it fails, `out_failure` is the reason.
int wccp_add_tunnel_or_say_why(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                               uint32_t *inout_index, wccp_reason_code *out_failure);
int wccp_del_tunnel_encap(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                          uint32_t *inout_index);
int wccp_set_L2_return(uint8_t group_id, uint32_t value);

// Policy groups. A policy group is ACTIVE when all of its service groups are, UNKNOWN when it has none,
// otherwise BACKUP. Each change of a membership or a role publishes the role of the policy group again.

// Removes all memberships and sets all roles of service groups to UNKNOWN. Always 0.
int wccp_init_policy_grp_mgr();
// Adds `count` service groups. 0, or 1, with a line in the log, when there is no memory for one of them.
int wccp_add_policy_grp(uint16_t policy, uint32_t count, const uint8_t *ids);
int wccp_remove_policy_grp(uint16_t policy, uint8_t id);  // always 0
int wccp_del_entire_policy_grp(uint16_t policy);          // removes all members; always 0
int wccp_check_policy_group(uint16_t policy, uint8_t id); // 1 for a member, otherwise 0
int wccp_set_role(uint8_t id, uint32_t role);             // of a service group, WCCP_ROLE_*; always 0

// Writes the role of a policy group to the mailbox. False when this process has not created it. Policy mutex
// held.
bool wccp_publish_policy_role(uint16_t policy, uint32_t role);
