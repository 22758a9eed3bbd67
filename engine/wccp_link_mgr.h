// The interface table, and the reactions to the kernel's link and address notifications.
#pragma once

#include "engine/wccp_records.h"
#include "platform/qvcommon.h"

int wccp_init_link_mgr();
void wccp_deinit_link_mgr();
wccp_interface *wccp_if_find_interface(const char *name);
wccp_interface *wccp_if_add_interface(const char *name);
int wccp_if_add_group(wccp_service_group *group, wccp_interface *interface);
void wccp_link_update_group_ipa(wccp_service_group *first, be32 ipa);
// The two notification callbacks; on the platform's thread, each takes the lock.
void wccp_process_if_state_change(const void *info); // qv_if_state_info
void wccp_process_if_ipa_update(const void *name);   // interface name
