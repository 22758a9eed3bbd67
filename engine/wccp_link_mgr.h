// Follows the kernel's link and address notifications: stops and starts the groups of an interface.
#pragma once

#include "engine/wccp_records.h"
#include "platform/qvcommon.h"

int wccp_init_link_mgr();    // takes the lock; 0, or the failing platform status
void wccp_deinit_link_mgr(); // takes the lock
// The address of this group and of those after it on its interface. Lock held.
void wccp_link_update_group_ipa(wccp_service_group *first, be32 ipa);
// The two notification callbacks; on the platform's thread, each takes the lock.
void wccp_process_if_state_change(const void *info); // qv_if_state_info
void wccp_process_if_ipa_update(const void *name);   // interface name
