// The engine's face towards configuration: groups are added, deleted, modified, started and stopped here.
#pragma once

#include "engine/wccp_records.h"

// Which field an update carries. One bit at a time; the first match in the order of wccp_modify_grp acts.
enum : uint32_t {
    WCCP_CFG_ROUTERS = 0x0001,
    WCCP_CFG_ADMIN = 0x0002,
    WCCP_CFG_WEIGHT = 0x0004,
    WCCP_CFG_PASSWORD = 0x0008,
    WCCP_CFG_FWD_METHOD = 0x0010,
    WCCP_CFG_FORCE_L2_RETURN = 0x0020,
    WCCP_CFG_ASSIGN_METHOD = 0x0040,
    WCCP_CFG_COMPATIBILITY = 0x0080,
    WCCP_CFG_HASH_SRC_IP = 0x0100,
    WCCP_CFG_HASH_DST_IP = 0x0200,
    WCCP_CFG_HASH_SRC_PORT = 0x0400,
    WCCP_CFG_HASH_DST_PORT = 0x0800,
    WCCP_CFG_MASK_SRC_IP = 0x1000,
    WCCP_CFG_MASK_DST_IP = 0x2000,
    WCCP_CFG_MASK_SRC_PORT = 0x4000,
    WCCP_CFG_MASK_DST_PORT = 0x8000,
};

// These take the lock themselves.
int wccp_add_group(const wccp_grp_config *config);
int wccp_del_group(int id);
int wccp_del_all_groups();
int wccp_modify_grp(const wccp_grp_config *config);
int wccp_set_mcast_ttl(uint32_t ttl);

// Lock held.
void wccp_start_service_group(wccp_service_group *group);
void wccp_stop_service_group(wccp_service_group *group);
int wccp_stop_all_service_groups();
void wccp_start_service_groups_by_interface(wccp_interface *interface);
void wccp_stop_service_groups_by_interface(wccp_interface *interface);
// Starts the enabled groups of a ready interface that are not running.
void wccp_start_waiting_groups(wccp_interface *interface);
// Retries what the socket set-up of the interface could not do. If that succeeds, starts those groups.
void wccp_recover_interface(wccp_interface *interface);
// Does so for each interface that lacks something an enabled group needs, every 30 seconds.
void wccp_recover_interfaces_due();
int wccp_notify_service_group_shutdown(wccp_service_group *group);
int wccp_flush_group_lists(wccp_service_group *group);
