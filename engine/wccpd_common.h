// wccpd's side of the tunnel mailbox, and the policy groups whose roles it publishes there.
#pragma once

#include <cstdint>

#include "platform/tunnel_mailbox.h"

int wccp_init_shmem();
int wccp_cleanup_shmem();

// Commands: each waits for tunneld's answer, up to about 2 seconds. Addresses in host order.
int wccp_add_tunnel_encap(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                          uint32_t *inout_index);
int wccp_del_tunnel_encap(uint16_t tunnel_id, mailbox_address local, mailbox_address remote,
                          uint32_t *inout_index);
int wccp_set_L2_return(uint8_t group_id, uint32_t value);

int wccp_init_policy_grp_mgr();
int wccp_add_policy_grp(uint16_t policy, uint32_t count, const uint8_t *ids);
int wccp_remove_policy_grp(uint16_t policy, uint8_t id);
int wccp_del_entire_policy_grp(uint16_t policy);
int wccp_check_policy_group(uint16_t policy, uint8_t id);
int wccp_set_role(uint8_t id, uint32_t role);
