// Alarms of a service group, and the client session on which alarms and state events go.
#pragma once

#include <atomic>

#include "engine/wccp_records.h"
#include "runtime/common.h"

struct gcl_session;
// Null before it is open and after qv_alm_mgmt_deinit. Changes under the mutex below, which also guards the
// session against its end while somebody sends; taken after the engine lock and before the session's own
// locks.
extern std::atomic<gcl_session *> qv_alm_mgmt_session;
extern pthread_mutex_t qv_alm_session_mutex;

// Lock held.
void wccp_alarm_schedule_verify_router_connectivity_timer(wccp_service_group *group, int restart);
void wccp_alarm_schedule_verify_allocation_table_timer(wccp_service_group *group, int restart);
int wccp_alarm_verify_router_connectivity(wccp_service_group *group);
int wccp_alarms_verify_allocation_table(wccp_service_group *group);
void wccp_alarm_raise_router_down_alarm(wccp_service_group *group);
void wccp_alarms_clear_all_raised_alarms(wccp_service_group *group);
// Takes the lock.
void wccp_alarms_clear_all();
