// Encodes the components of messages. Each function writes its component at the packet's cursor and advances
// the cursor. The buffer must be all zero before the first one. 0, or 1 when the component does not fit in
// 4096 bytes or cannot be built; the packet is then unchanged. Lock held.
#pragma once

#include "engine/wccp_records.h"

int wccp_pkt_load_msg_header(wccp_pkt *pkt, uint32_t type);
// `out_digest`: the place of the 16 digest bytes in the packet, for wccp_pkt_finish; null without security.
int wccp_pkt_load_security_info_component(wccp_service_group *group, wccp_pkt *pkt, uint8_t **out_digest);
int wccp_pkt_load_service_info_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_load_web_cache_identity_info_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_load_web_cache_view_info_component(wccp_service_group *group, wccp_pkt *pkt);
// These two count the message in assign_tx_count of each router that they name.
int wccp_pkt_load_assignment_info_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_load_mask_assignment_info_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_load_capability_info_component(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_load_command_ext_component(wccp_service_group *group, wccp_pkt *pkt);
// Writes the length into the message header and, with security, the digest. Always 0.
int wccp_pkt_finish(wccp_service_group *group, wccp_pkt *pkt, uint8_t *digest);
// Computes MD5 (RFC 1321) over the 8 bytes of the group's password and the whole message, in which the digest
// bytes must be zero.
void wccp_pkt_digest(const wccp_service_group *group, const wccp_pkt *pkt, uint8_t digest[16]);
