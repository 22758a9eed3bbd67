// The views of a group: what its routers report, each router's last report and the union over all routers,
// and the role that follows from what the routers assign. Lock held throughout.
#pragma once

#include "engine/wccp_records.h"

struct wccp_assign_summary;

// Both replace the router's last report by a new one of `count` entries, in its order, and update the union.
// Of entries with the same address only the first counts.
//
// 0, or 1 when something failed. More than 32 entries: nothing has changed. Otherwise the whole report has
// been applied except for the entries that there was no memory for; these are in neither the report nor the
// union; therefore the next report adds them. A changed weight that leaves the designated appliance without
// anybody to redirect to, and an appliance that is missing in the union, also give 1.
int wccp_update_router_view(wccp_service_group *group, wccp_sending_router *router, uint32_t count,
                            const be32 *addresses);
int wccp_update_appliance_view(wccp_service_group *group, wccp_sending_router *router, uint32_t count,
                               const wccp_rtr_view_appliance *decoded);
// Updates the role of this appliance from what the router assigns now: by `mask` if that is valid, otherwise
// by `hash`. 1, with a line in the log, when neither is valid.
int wccp_update_appliance_redirect_status(wccp_service_group *group, wccp_sending_router *router,
                                          const wccp_assign_summary *hash, const wccp_assign_summary *mask);
// Inserts an entry before the head of appliance_view if its weight, or with equal weights its address, is
// higher, otherwise directly after the head; so only the head is in its sorted place. 1, with a line in the
// log, when the head has the same weight and address.
int wccp_view_list_add_appliance_sorted(wccp_service_group *group, wccp_view_appliance *entry);
// Both drop one reference on the union's entry and free it with the last one. 1, with a line in the log, when
// the union has no such entry.
int wccp_remove_router_from_view_list(wccp_service_group *group, be32 address);
int wccp_remove_appliance_from_view_list(wccp_service_group *group, be32 address);
// 1 when the last reports of all sending routers have the address, also when there are none; otherwise 0.
int wccp_appliance_is_reported_by_all_senders(wccp_service_group *group, be32 address);
// The entry of an address in the router's last report, or null. It is valid until the next report.
wccp_rtr_view_appliance *wccp_get_router_appliance_view_element(wccp_sending_router *router, be32 address);
