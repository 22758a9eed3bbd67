// wccpd's side of the tunnel mailbox, and the policy groups whose roles it publishes there.
#pragma once

#include <cstdint>

#include "engine/wccp_reasons.h"
#include "platform/tunnel_mailbox.h"

// Creates the block, or takes over the one of a wccpd that has gone. 1, with an error line, when it cannot,
// as while another wccpd lives; this process then commands and publishes nothing.
int wccp_init_shmem();
// Resets what this process has created; the block stays. 0.
int wccp_cleanup_shmem();

// Commands: each waits for tunneld's answer, up to about 2 seconds. After one that timed out, adds and L2
// returns fail at once for up to 10 seconds, and further deletes are given but not waited for; during the
// exit nothing is waited for after a time-out. Addresses in host order. tunneld's status, in which 1 is
// failure; 1 as well without an answer.
int wccp_add_tunnel_encap(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                          uint32_t *inout_index);
// The same add; `out_failure` is the reason when it has failed.
int wccp_add_tunnel_or_say_why(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                               uint32_t *inout_index, wccp_reason_code *out_failure);
int wccp_del_tunnel_encap(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                          uint32_t *inout_index);
int wccp_set_L2_return(uint8_t group_id, uint32_t value);

// Clears all memberships and roles.
int wccp_init_policy_grp_mgr();
// 1 when there is no memory for a membership, else 0.
int wccp_add_policy_grp(uint16_t policy, uint32_t count, const uint8_t *ids);
int wccp_remove_policy_grp(uint16_t policy, uint8_t id);
int wccp_del_entire_policy_grp(uint16_t policy);
int wccp_check_policy_group(uint16_t policy, uint8_t id);
int wccp_set_role(uint8_t id, uint32_t role);

// Writes the role of a policy group to the mailbox; false when this process has none.
bool wccp_publish_policy_role(uint16_t policy, uint32_t role);
