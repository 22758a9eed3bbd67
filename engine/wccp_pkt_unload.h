// The reader's side of the wire format: it checks, moves the cursor and hands out pointers into the packet,
// which are valid until the next receive. All of it returns 0, or 1 for what it refuses, and changes nothing
// in a group but rx_unknown_capabilities and the reasons. Lock held.
#pragma once

#include "engine/wccp_records.h"
#include "engine/wccp_wire.h"

// The web-cache elements of a Router View as they were received.
struct wccp_view_elements {
    const uint8_t *first;
    uint32_t size; // bytes
};
struct wccp_rtr_view_info {
    be32 change_number;
    be32 key_ipa;
    be32 key_change;
    uint32_t router_count;
    uint32_t appliance_count;
    const be32 *routers;
    wccp_view_elements appliances;
};
struct wccp_assign_map_info { // all zero when the message has no map
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

// What one router assigns to this appliance.
struct wccp_assign_summary {
    uint32_t valid;          // 1: this summary is the one to use
    uint16_t self_count;     // buckets or values that the router gives to this appliance
    uint16_t total_count;    // buckets or values that it gives to anybody
    uint32_t mask_forms = 0; // of the hash summary: bit i is set when element i has a form of the mask method
};

// Which of its forms a web-cache element of a Router View has: its flags and the group's compatibility mode
// decide.
enum wccp_element_form : uint8_t { WCCP_ELEMENT_HASH, WCCP_ELEMENT_NO_REDIRECT, WCCP_ELEMENT_REDIRECT };
struct wccp_element_shape {
    wccp_element_form form;
    uint32_t size;      // bytes
    uint32_t weight_at; // offset in bytes
};
wccp_element_shape wccp_view_element_shape(uint16_t flags, uint32_t compat_mode);

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
// The type of the component at the cursor, 0 when it was cut before the end of its type.
uint16_t wccp_pkt_next_component_type(const wccp_pkt *pkt);
int wccp_pkt_unload_unknown_component(wccp_service_group *group, wccp_pkt *pkt);
// Decodes `count` elements, in their order, and sums up what the hash forms assign. `decoded` has room for
// WCCP_MAX_APPLIANCES entries and is zeroed. Also 1 for a null group, `decoded` or `hash_summary`.
int wccp_process_router_view_web_cache_id_elements(wccp_service_group *group, uint32_t count,
                                                   wccp_view_elements elements,
                                                   wccp_rtr_view_appliance *decoded,
                                                   wccp_assign_summary *hash_summary);
