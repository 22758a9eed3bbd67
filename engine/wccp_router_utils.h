// Sending routers: the capability decision, their records, inactivity, Removal Queries. Lock held throughout.
#pragma once

#include "engine/wccp_pkt_unload.h"
#include "engine/wccp_records.h"

wccp_sending_router *wccp_find_sending_router(wccp_service_group *group, be32 router_id);
int wccp_process_router_capabilities(wccp_service_group *group, be32 router_id,
                                     const wccp_rtr_capabilities *offered, wccp_rtr_capabilities *out_agreed,
                                     uint32_t *out_compatible);
wccp_sending_router *wccp_create_sending_router(wccp_service_group *group, be32 router_id,
                                                const wccp_rtr_capabilities *offered,
                                                const wccp_rtr_capabilities *agreed);
int wccp_process_router_removal_query(wccp_service_group *group, be32 router_id, be32 receive_id);
int wccp_send_router_removal_query_reply(wccp_service_group *group);
int wccp_monitor_sending_routers(wccp_service_group *group);
int wccp_any_routers_redirecting_to_other_appliances(wccp_service_group *group,
                                                     const wccp_sending_router *router);
int wccp_get_router_connection_stats(wccp_service_group *group, uint32_t *out_one_way, uint32_t *out_two_way);
int wccp_get_router_assignment(wccp_service_group *group, wccp_sending_router *router, be32 appliance,
                               uint32_t *out_buckets);
