// Sending routers: their records, the capability decision, timeouts, and Removal Queries. Lock held
// throughout. Router ids are as on the wire.
#pragma once

#include "engine/wccp_pkt_unload.h"
#include "engine/wccp_records.h"

wccp_sending_router *wccp_find_sending_router(wccp_service_group *group, be32 router_id); // null: unknown
// Decides the methods for a new router: against what has been agreed with earlier routers, or if nothing has,
// against the configuration. `out_compatible` is 1 and the result 0 when all three can be agreed. Otherwise a
// line is logged and a reason noted; the result is then 1 only for the return method.
int wccp_process_router_capabilities(wccp_service_group *group, be32 router_id,
                                     const wccp_rtr_capabilities *offered, wccp_rtr_capabilities *out_agreed,
                                     uint32_t *out_compatible);
// For a router with a record: notes as a reason each method that the group uses and the router no longer
// offers.
void wccp_check_offered_methods(wccp_service_group *group, be32 router_id,
                                const wccp_rtr_capabilities *offered);
// Creates a record with the agreed methods, and for GRE a tunnel, which may wait for tunneld for some 2
// seconds. The group owns it. Null, logged and noted, when the id is 0.0.0.0, the group has 32 routers, there
// is no memory, or the tunnel could not be created.
wccp_sending_router *wccp_create_sending_router(wccp_service_group *group, be32 router_id,
                                                const wccp_rtr_capabilities *offered,
                                                const wccp_rtr_capabilities *agreed);
// Queues a Here-I-Am as the reply. 0, also for a router that is unknown or one-way and gets none; another
// value when the reply could not be queued.
int wccp_process_router_removal_query(wccp_service_group *group, be32 router_id, be32 receive_id);
// Sends each queued reply once, and frees those that have been sent three times. Once a tick; always 0.
int wccp_send_router_removal_query_reply(wccp_service_group *group);
// Removes the routers that have sent no I-See-You for 40 seconds. May wait for tunneld. Always 0.
int wccp_monitor_sending_routers(wccp_service_group *group);
// 1 when a router other than this one assigns something to another appliance, otherwise 0.
int wccp_any_routers_redirecting_to_other_appliances(wccp_service_group *group,
                                                     const wccp_sending_router *router);
// These two: 0, or 1 for a null argument, and the second also when the router does not list the appliance.
int wccp_get_router_connection_stats(wccp_service_group *group, uint32_t *out_one_way, uint32_t *out_two_way);
int wccp_get_router_assignment(wccp_service_group *group, wccp_sending_router *router, be32 appliance,
                               uint32_t *out_buckets);
