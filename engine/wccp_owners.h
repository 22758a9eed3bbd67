// Which appliance has which slot of a group's table, as one line of text for the data plane.
//
//   hash members A B owners A*128 B*128
//   mask SRC_IP DST_IP SRC_PORT DST_PORT members A B owners A*21 B*43
//
// Masks are hexadecimal without a prefix. Members are the appliances of the view. Owners are in the order of
// the slots, each with the length of its run; 0.0.0.0 is nobody. Slot i of a mask is value i in the order of
// wccp_mask_assignment.h. Owners are those of the table that this appliance has computed while it is
// designated, otherwise those that the routers report. They are left out where nothing of that is known.
#pragma once

#include "engine/wccp_pkt_unload.h"
#include "engine/wccp_records.h"
#include "runtime/csys.h"

// Longest text: 32 members, 256 runs, and the words.
constexpr uint32_t WCCP_OWNERS_BYTES = 8192;

// Takes the engine lock. The text is empty before the group has agreed on a kind of table. 0, or 1 when there
// is no such group or the text did not fit.
int wccp_print_owners(int id, csys_display_buf *buffer);

// Whether a router's map has this group's masks, and its values in this group's order. Lock held.
bool wccp_map_is_in_order(const wccp_service_group *group, const wccp_assign_map_info *map);
