// Decodes the components of received messages. Each function checks the component at the packet's cursor and,
// if it is valid, moves the cursor past it. Pointers in results point into the packet.
//
// All return 0, or 1 when the component is refused; the cursor then stays where it was. Nothing in a group
// changes except rx_unknown_capabilities and the reasons. Lock held.
#pragma once

#include "engine/wccp_records.h"
#include "engine/wccp_wire.h"

// The web-cache elements of a Router View, as received.
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
    uint32_t present;         // 1
    uint32_t element_count;
    uint32_t value_count; // of the last mask element
    const wccp_wire_mask_element *masks;
    const wccp_wire_value_element *values; // of the last mask element
};
// What a router offers, as bit sets: bit 0 is method 1, bit 1 method 2. Or what was agreed, as method codes.
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
    uint16_t self_count;     // buckets or values that the router assigns to this appliance
    uint16_t total_count;    // buckets or values that it assigns to any appliance
    uint32_t mask_forms = 0; // in the hash summary: bit i is set when element i has a form of mask assignment
};

// The form of a web-cache element of a Router View, which follows from its flags and, for a redirecting
// router, from the group's compatibility mode.
enum wccp_element_form : uint8_t { WCCP_ELEMENT_HASH, WCCP_ELEMENT_NO_REDIRECT, WCCP_ELEMENT_REDIRECT };
struct wccp_element_shape {
    wccp_element_form form;
    uint32_t size;      // bytes
    uint32_t weight_at; // offset in bytes
};
wccp_element_shape wccp_view_element_shape(uint16_t flags, uint32_t compat_mode);

int wccp_pkt_unload_msg_header(wccp_pkt *pkt, const wccp_wire_msg_header **out);
// `out_digest`: the 16 bytes of the digest in the packet, or null without one.
int wccp_pkt_unload_security_info_component(wccp_pkt *pkt, const wccp_wire_security_info **out,
                                            uint8_t **out_digest);
int wccp_pkt_unload_service_info_component(wccp_pkt *pkt, const wccp_wire_service_info **out);
int wccp_pkt_unload_router_identity_info_component(wccp_service_group *group, wccp_pkt *pkt,
                                                   const wccp_wire_router_identity **out);
int wccp_pkt_unload_router_view_component(wccp_service_group *group, wccp_pkt *pkt, wccp_rtr_view_info *out);
// A map without mask elements is accepted; `values` is null then. Of two maps in a message the last one
// counts.
int wccp_pkt_unload_assignment_map_component(wccp_service_group *group, wccp_pkt *pkt,
                                             wccp_assign_map_info *out);
// Overwrites in `out` the values that the component has; the caller initialises it with the defaults.
int wccp_pkt_unload_capability_info_component(wccp_service_group *group, wccp_pkt *pkt,
                                              wccp_rtr_capabilities *out);
int wccp_pkt_unload_command_ext_component(wccp_service_group *group, wccp_pkt *pkt, wccp_command_info *out);
int wccp_pkt_unload_router_query_component(wccp_service_group *group, wccp_pkt *pkt,
                                           const wccp_wire_router_query **out);
// The type of the component at the cursor, 0 when fewer than two bytes are left.
uint16_t wccp_pkt_next_component_type(const wccp_pkt *pkt);
// Skips a component of any type.
int wccp_pkt_unload_unknown_component(wccp_service_group *group, wccp_pkt *pkt);
// Decodes `count` web-cache elements in their order and adds up what those of hash assignment assign.
// `decoded` has WCCP_MAX_APPLIANCES entries, which the caller has zeroed. Also 1 for a null argument.
// `hash_summary` is not valid when an element indicates that the assignment is in a map.
int wccp_process_router_view_web_cache_id_elements(wccp_service_group *group, uint32_t count,
                                                   wccp_view_elements elements,
                                                   wccp_rtr_view_appliance *decoded,
                                                   wccp_assign_summary *hash_summary);
