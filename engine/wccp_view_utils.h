// Router and appliance views, per router and as a union, and the role that follows from what routers assign.
// Lock held throughout.
#pragma once

#include "engine/wccp_records.h"

struct wccp_assign_summary;

// Each takes a router's new report, `addresses` or `decoded` in its order and of `count` entries, and skips
// an address that occurs again. 1 when something of it failed, for lack of memory or because a changed weight
// left no appliance to redirect to; the rest of the report has been taken all the same. Nothing is taken of
// more than 32 entries, which is also 1.
int wccp_update_router_view(wccp_service_group *group, wccp_sending_router *router, uint32_t count,
                            const be32 *addresses);
int wccp_update_appliance_view(wccp_service_group *group, wccp_sending_router *router, uint32_t count,
                               const wccp_rtr_view_appliance *decoded);
// Works out the role from what the router now assigns; 1 when neither summary is valid.
int wccp_update_appliance_redirect_status(wccp_service_group *group, wccp_sending_router *router,
                                          const wccp_assign_summary *hash, const wccp_assign_summary *mask);
// Puts the entry at the head when it is above the head, by weight and then by address, else directly after
// it. 1 when the head has the same weight and address.
int wccp_view_list_add_appliance_sorted(wccp_service_group *group, wccp_view_appliance *entry);
// Give one reference back, the last one with its entry; 1 when there is no entry of this address.
int wccp_remove_router_from_view_list(wccp_service_group *group, be32 address);
int wccp_remove_appliance_from_view_list(wccp_service_group *group, be32 address);
// 1 or 0; 1 without sending routers.
int wccp_appliance_is_reported_by_all_senders(wccp_service_group *group, be32 address);
// The entry in the router's last report, or null.
wccp_rtr_view_appliance *wccp_get_router_appliance_view_element(wccp_sending_router *router, be32 address);
