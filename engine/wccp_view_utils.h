// Router and appliance views, per router and as a union, and the role that follows from what routers assign.
// Lock held throughout.
#pragma once

#include "engine/wccp_records.h"

struct wccp_assign_summary;

int wccp_update_router_view(wccp_service_group *group, wccp_sending_router *router, uint32_t count,
                            const be32 *addresses);
int wccp_update_appliance_view(wccp_service_group *group, wccp_sending_router *router, uint32_t count,
                               const wccp_rtr_view_appliance *decoded);
int wccp_update_appliance_redirect_status(wccp_service_group *group, wccp_sending_router *router,
                                          const wccp_assign_summary *hash, const wccp_assign_summary *mask);
int wccp_view_list_add_appliance_sorted(wccp_service_group *group, wccp_view_appliance *entry);
int wccp_remove_router_from_view_list(wccp_service_group *group, be32 address);
int wccp_remove_appliance_from_view_list(wccp_service_group *group, be32 address);
int wccp_appliance_is_reported_by_all_senders(wccp_service_group *group, be32 address);
wccp_rtr_view_appliance *wccp_get_router_appliance_view_element(wccp_sending_router *router, be32 address);
