// Processes received packets, and builds and transmits those that are sent. Lock held throughout.
#pragma once

#include "engine/wccp_records.h"
#include "engine/wccp_wire.h"

// Processes one datagram, `length` bytes with the source in `ipa`; the digest in it is zeroed. 0 when it was
// handled or dropped, also when the processing of its contents failed; 1 when it was refused: malformed
// before its group was known, of an unknown group, or with the wrong security.
int wccp_process_received_packet(wccp_pkt *pkt);
// These two process the components after the Service Info. 0, or another value for a failure, which has been
// logged and noted as a reason; what was updated before the failure stays.
int wccp_pkt_process_i_see_you(wccp_service_group *group, wccp_pkt *pkt,
                               const wccp_wire_service_info *service);
int wccp_pkt_process_removal_query(wccp_service_group *group, wccp_pkt *pkt);
// These two write a whole message into a zeroed packet. 0, or the status of the step that failed.
int wccp_pkt_build_here_i_am(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_build_redirect_assign(wccp_service_group *group, wccp_pkt *pkt);
// Sends a packet of kind WCCP_HERE_I_AM or WCCP_REDIRECT_ASSIGN, which it clears and builds first, or of kind
// WCCP_REMOVAL_REPLY, which it sends unchanged. 0, also when the group's interface is not ready and nothing
// is sent; another value when the packet could not be built or nothing was sent.
int wccp_transmit_packet(wccp_service_group *group, wccp_pkt *pkt, uint32_t kind);
wccp_pkt *wccp_pkt_alloc();       // zeroed, or null without memory; owned by the caller
int wccp_pkt_free(wccp_pkt *pkt); // null: nothing; always 0
