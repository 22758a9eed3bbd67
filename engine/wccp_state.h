// The heartbeat of a group: timers, election, and the three-valued state. Lock held throughout.
#pragma once

#include "engine/wccp_records.h"

enum : int { WCCP_ASSIGN_AFTER_ELECTION = 1, WCCP_ASSIGN_AFTER_WEIGHT_CHANGE = 2 };

int wccp_process_timers(wccp_service_group *group); // once per tick
int wccp_appliance_state_init(wccp_service_group *group);
int wccp_appliance_state_active(wccp_service_group *group);
int wccp_appliance_state_backup(wccp_service_group *group);
void wccp_clear_redirect_assign_states(wccp_service_group *group);
int wccp_update_designated_redirect_assignment(wccp_service_group *group, int reason);
int wccp_set_role_and_send_event(uint8_t id, uint32_t role);
