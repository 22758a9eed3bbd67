// The message loop in both directions. Lock held throughout.
#pragma once

#include "engine/wccp_records.h"
#include "engine/wccp_wire.h"

int wccp_process_received_packet(wccp_pkt *pkt); // 0 handled or dropped, 1 refused
int wccp_pkt_process_i_see_you(wccp_service_group *group, wccp_pkt *pkt,
                               const wccp_wire_service_info *service);
int wccp_pkt_process_removal_query(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_build_here_i_am(wccp_service_group *group, wccp_pkt *pkt);
int wccp_pkt_build_redirect_assign(wccp_service_group *group, wccp_pkt *pkt);
int wccp_transmit_packet(wccp_service_group *group, wccp_pkt *pkt, uint32_t kind);
wccp_pkt *wccp_pkt_alloc();
int wccp_pkt_free(wccp_pkt *pkt);
