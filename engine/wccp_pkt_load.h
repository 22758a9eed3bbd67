// The writer's side of the wire format. Each load tests that its component fits, writes it at the cursor and
// moves on; 1 leaves the packet as it was. The buffer is all zero before the first load. Lock held.
#pragma once

#include "engine/wccp_records.h"

int wccp_pkt_load_msg_header(wccp_pkt *pkt, uint32_t type);
int wccp_pkt_load_security_info_component(wccp_service_group *group, wccp_pkt *pkt, uint8_t **out_digest);
int wccp_pkt_load_service_info_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_load_web_cache_identity_info_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_load_web_cache_view_info_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_load_assignment_info_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_load_mask_assignment_info_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_load_capability_info_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_load_command_ext_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_finish(wccp_service_group *group, wccp_pkt *pkt, uint8_t *digest);
// MD5 over the 8 bytes of the password and the message, whose digest bytes are zero.
void wccp_pkt_digest(const wccp_service_group *group, const wccp_pkt *pkt, uint8_t digest[16]);
