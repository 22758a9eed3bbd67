// The engine's answers to monitoring. Each function takes the engine lock, copies what was asked for into the
// caller's record, and releases the lock; nothing in a record points into the engine. Fields marked "in" are
// set by the caller. The result is 0, or 1 for a null record or an unknown group. If the router or the
// appliance does not exist, the functions that return info about one leave the record as it is and return 0;
// others return 1.
//
// Routers and appliances are numbered from 1 by their position in a list at the moment of the query.
#pragma once

#include "engine/wccp_records.h"

struct wccp_grp_list {
    uint32_t count;
    uint8_t ids[WCCP_MAX_GROUPS];
};
struct wccp_grp_info {
    be32 appliance_ipa;
    uint32_t num_routers;
    uint32_t num_appliances;
    uint32_t num_view_routers;
    uint32_t uptime; // seconds in ACTIVE or BACKUP, otherwise 0
    uint32_t since;  // seconds since it was last started or stopped
    uint32_t pending_acks;
    char oper[128];
};
struct wccp_grp_router_info {
    uint32_t router_num; // in, from 1
    be32 router_id;
    be32 src_ipa;
    uint32_t conn_time; // seconds since it became one-way or two-way
    uint32_t heard;     // seconds since its last I-See-You
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

// The reasons why something does not work (wccp_reasons.h). Places are numbered from 1. A reason keeps its
// place.
constexpr int WCCP_NO_GROUP = -1; // as a group id: packets that belong to no group
struct wccp_reason_list {
    uint32_t count;
    uint8_t places[WCCP_GROUP_REASONS];
};
struct wccp_reason_info {
    wccp_reason reason;                 // code NONE when the place is free
    uint32_t first_before, last_before; // seconds since the first and the last occurrence
};
struct wccp_interface_info {
    char name[WCCP_IF_NAME_BYTES];
    be32 ipa;
    uint32_t link_up, starts, stops, link_downs, address_changes;
};

int wccp_get_reason_list(int id, wccp_reason_list *list);
int wccp_get_reason(int id, uint32_t place, wccp_reason_info *info);
// The name of the counter with this index, from 0; null past the last one. No lock needed.
const char *wccp_counter_word(uint32_t index);
uint32_t wccp_read_counter(const wccp_service_group *group, uint32_t index); // index valid; lock held
int wccp_get_counter(int id, const char *word, uint32_t *out);               // also 1 for an unknown name
// The interface with this index, from 0; 1 past the last one.
int wccp_get_interface_info(uint32_t index, wccp_interface_info *info);

int wccp_get_grp_list(wccp_grp_list *list);
int wccp_get_grp_info(int id, wccp_grp_info *info);
int wccp_get_grp_router_info(int id, wccp_grp_router_info *info);
int wccp_get_grp_appliance_info(int id, wccp_grp_appliance_info *info);
int wccp_get_router_list(wccp_router_list *list);
int wccp_get_router_appliance_list(wccp_router_appliance_list *list);
int wccp_get_router_appliance_info(wccp_router_appliance_info *info);

// Null, with an information line in the log, when there is no such group or router. Lock held.
wccp_sending_router *wccp_find_router_instance(int id, uint32_t router_num);
