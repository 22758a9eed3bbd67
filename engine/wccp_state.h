// The timers of a group, the election of the designated appliance, and the state of this appliance (INIT,
// ACTIVE or BACKUP) with its role. Lock held throughout.
#pragma once

#include "engine/wccp_records.h"

// Why a table is computed.
enum : int { WCCP_ASSIGN_AFTER_ELECTION = 1, WCCP_ASSIGN_AFTER_WEIGHT_CHANGE = 2 };

// Does what is due in this tick. Call it once a tick for each enabled group; always 0.
int wccp_process_timers(wccp_service_group *group);
// Enter a state and publish its role. The first does nothing in INIT. Always 0.
int wccp_appliance_state_init(wccp_service_group *group);
int wccp_appliance_state_active(wccp_service_group *group);
int wccp_appliance_state_backup(wccp_service_group *group);
// Ends the transmission of the current assignment: no timer, no acknowledgements pending.
void wccp_clear_redirect_assign_states(wccp_service_group *group);
// Computes the table and starts its transmission if this appliance is designated. `reason` decides how soon
// the first Redirect-Assign is sent. 0, or 1 when no appliance can be redirected to.
int wccp_update_designated_redirect_assignment(wccp_service_group *group, int reason);
// Passes a role (WCCP_ROLE_*) on to the group's policy group and, until the exit begins, to mgmtd as a state
// event. 0, or 1 for an unknown role.
int wccp_set_role_and_send_event(uint8_t id, uint32_t role);
