// Which appliance owns which slot of a group's table, as one line of text for the data plane:
//
//   hash members A B owners A*128 B*128
//   mask SRC_IP DST_IP SRC_PORT DST_PORT members A B owners A*21 B*43
//
// Masks are hexadecimal without a prefix. Members are the appliances of the view. Owners are listed in the
// order of the slots, each with the length of its run; 0.0.0.0 means no owner. Slot i of a mask is value i in
// the order of wccp_mask_assignment.cpp. The owners come from the table of this appliance if it is
// designated, otherwise from the routers' reports. They are omitted when neither is known.
#pragma once

#include "engine/wccp_pkt_unload.h"
#include "engine/wccp_records.h"
#include "runtime/csys.h"

// Bytes of the longest text: 32 members, 256 runs, and the words.
constexpr uint32_t WCCP_OWNERS_BYTES = 8192;

// Takes the engine lock. The text is empty until the group has agreed on an assignment method. 0, or 1 when
// `buffer` is null, there is no such group, or the text did not fit.
int wccp_print_owners(int id, csys_display_buf *buffer);

// Whether a router's Assignment Map has this group's mask and its values in this group's order. Lock held.
bool wccp_map_is_in_order(const wccp_service_group *group, const wccp_assign_map_info *map);
