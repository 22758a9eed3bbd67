// The engine's face towards configuration and monitoring: groups are added, deleted, modified, started and
// stopped here, and the monitoring tree's questions answered.
#pragma once

#include "engine/wccp_mgr.h"

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

struct wccp_grp_list {
    uint32_t count;
    uint8_t ids[WCCP_MAX_GROUPS];
};
struct wccp_grp_info {
    be32 appliance_ipa;
    uint32_t num_routers;
    uint32_t num_appliances;
    uint32_t num_view_routers;
    uint32_t uptime; // seconds
    char oper[128];
};
struct wccp_grp_router_info {
    uint32_t router_num; // in, from 1
    be32 router_id;
    be32 src_ipa;
    uint32_t conn_time; // seconds
    char fwd[8];
    char ret[8];
    char assign[8];
    char state[32];
};
struct wccp_grp_appliance_info {
    uint32_t appliance_num; // in, from 1
    be32 ipa;
    uint32_t weight;
};
struct wccp_router_list {
    uint32_t group_id; // in
    uint32_t count;
    uint32_t router_nums[WCCP_MAX_ROUTERS];
};
struct wccp_router_appliance_list {
    uint32_t group_id;   // in
    uint32_t router_num; // in
    uint32_t count;
    be32 ipa[WCCP_MAX_APPLIANCES];
};
struct wccp_router_appliance_info {
    uint32_t group_id;   // in
    uint32_t router_num; // in
    be32 ipa;            // in
    uint32_t load_percent;
};

// These take the lock themselves.
int wccp_add_group(const wccp_grp_config *config);
int wccp_del_group(int id);
int wccp_del_all_groups();
int wccp_modify_grp(const wccp_grp_config *config);
int wccp_set_mcast_ttl(uint32_t ttl);
int wccp_get_grp_list(wccp_grp_list *list);
int wccp_get_grp_info(int id, wccp_grp_info *info);
int wccp_get_grp_router_info(int id, wccp_grp_router_info *info);
int wccp_get_grp_appliance_info(int id, wccp_grp_appliance_info *info);
int wccp_get_router_list(wccp_router_list *list);
int wccp_get_router_appliance_list(wccp_router_appliance_list *list);
int wccp_get_router_appliance_info(wccp_router_appliance_info *info);

// Lock held.
void wccp_start_service_group(wccp_service_group *group);
void wccp_stop_service_group(wccp_service_group *group);
int wccp_stop_all_service_groups();
void wccp_start_service_groups_by_interface(wccp_interface *interface);
void wccp_stop_service_groups_by_interface(wccp_interface *interface);
int wccp_notify_service_group_shutdown(wccp_service_group *group);
int wccp_flush_group_lists(wccp_service_group *group);
wccp_sending_router *wccp_find_router_instance(int id, uint32_t router_num);
