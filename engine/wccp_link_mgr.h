// Follows the kernel's link and address notifications: stops and starts the groups of an interface.
#pragma once

#include "engine/wccp_records.h"
#include "platform/qvcommon.h"

// Main thread, lock not held. Adds the primary interface and registers the callbacks below. Asks mgmtd for
// the primary interface, which runs the event loop. 0, or the status of the platform call that failed.
int wccp_init_link_mgr();
void wccp_deinit_link_mgr(); // closes all sockets; takes the lock
// Sets the appliance address of this group and of those after it on its interface. Lock held.
void wccp_link_update_group_ipa(wccp_service_group *first, be32 ipa);
// The notification callbacks. The platform calls them on its notifier thread; both take the lock.
void wccp_process_if_state_change(const void *info); // a qv_if_state_info
void wccp_process_if_ipa_update(const void *name);   // the interface's name, NUL-terminated
