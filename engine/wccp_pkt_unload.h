// The reader's side of the wire format: checks, moves the cursor, hands out places in the packet. Changes
// nothing in a group but rx_unknown_capabilities. What a result points to is valid until the next receive.
#pragma once

#include "engine/wccp_records.h"
#include "engine/wccp_wire.h"

struct wccp_rtr_view_info {
    be32 change_number;
    be32 key_ipa;
    be32 key_change;
    uint32_t router_count;
    uint32_t appliance_count;
    const be32 *routers;
    const uint8_t *appliances; // first web-cache element
};
struct wccp_assign_map_info { // zeroed by the caller
    uint32_t present;
    uint32_t element_count;
    uint32_t value_count; // of the last mask element
    const wccp_wire_mask_element *masks;
    const wccp_wire_value_element *values; // of the last mask element
};
struct wccp_rtr_capabilities {
    uint32_t forwarding;
    uint32_t assignment;
    uint32_t ret;
};
struct wccp_command_info {
    uint16_t command;
    uint32_t data;
};

int wccp_pkt_unload_msg_header(wccp_pkt *pkt, const wccp_wire_msg_header **out);
int wccp_pkt_unload_security_info_component(wccp_pkt *pkt, const wccp_wire_security_info **out,
                                            uint8_t **out_digest);
int wccp_pkt_unload_service_info_component(wccp_pkt *pkt, const wccp_wire_service_info **out);
int wccp_pkt_unload_router_identity_info_component(wccp_service_group *group, wccp_pkt *pkt,
                                                   const wccp_wire_router_identity **out);
int wccp_pkt_unload_router_view_component(wccp_service_group *group, wccp_pkt *pkt, wccp_rtr_view_info *out);
int wccp_pkt_unload_assignment_map_component(wccp_service_group *group, wccp_pkt *pkt,
                                             wccp_assign_map_info *out);
int wccp_pkt_unload_capability_info_component(wccp_service_group *group, wccp_pkt *pkt,
                                              wccp_rtr_capabilities *out);
int wccp_pkt_unload_command_ext_component(wccp_service_group *group, wccp_pkt *pkt, wccp_command_info *out);
int wccp_pkt_unload_router_query_component(wccp_service_group *group, wccp_pkt *pkt,
                                           const wccp_wire_router_query **out);
int wccp_pkt_unload_unknown_component(wccp_service_group *group, wccp_pkt *pkt);
