// Alarms of a service group, and the session on which alarms and state events are sent.
#pragma once

#include <atomic>

#include "engine/wccp_records.h"
#include "runtime/common.h"

struct gcl_session;
// The session: null until it is open and again after qv_alm_mgmt_deinit. It changes with the mutex held, and
// senders hold the mutex, so that the session is not freed while they use it. The mutex is taken after the
// engine lock and before the session's own locks.
extern std::atomic<gcl_session *> qv_alm_mgmt_session;
extern pthread_mutex_t qv_alm_session_mutex;

// Lock held for these.

// Schedule a check in 60 seconds. If it is scheduled already, `restart` 0 leaves its time and 1 sets a new
// one.
void wccp_alarm_schedule_verify_router_connectivity_timer(wccp_service_group *group, int restart);
void wccp_alarm_schedule_verify_allocation_table_timer(wccp_service_group *group, int restart);
// The checks, which raise or clear their alarm. 0, or 1 when the routers could not be counted.
int wccp_alarm_verify_router_connectivity(wccp_service_group *group);
int wccp_alarms_verify_allocation_table(wccp_service_group *group);
// Raises the adjacency alarm if it is not active, and schedules its check again.
void wccp_alarm_raise_router_down_alarm(wccp_service_group *group);
// Clears the group's active alarms and stops both checks.
void wccp_alarms_clear_all_raised_alarms(wccp_service_group *group);

// The same for every group that has an active alarm. Takes the lock.
void wccp_alarms_clear_all();
