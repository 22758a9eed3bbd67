// Sockets and packet I/O of an interface: UDP port 2048, one unicast and one multicast socket.
#pragma once

#include "engine/wccp_records.h"

constexpr uint16_t WCCP_PORT = 2048;

int wccp_init_network_by_interface(wccp_interface *interface); // lock held, or at start; 0 or 1
int wccp_join_mc_grp(wccp_interface *interface, be32 address); // lock held; 0 or 1
// Closes both sockets and clears the fields that describe them. Lock held, or at exit.
void wccp_close_sockets(wccp_interface *interface);
int32_t wccp_tx_pkt(wccp_service_group *group, wccp_pkt *pkt); // lock held; bytes sent, 0 for nothing
// No lock held; blocks for about a second. Bytes received, 0 or less for nothing.
int32_t wccp_rx_pkt(wccp_interface *interface, wccp_pkt *pkt, uint32_t length);
be32 wccp_get_address(const char *name);       // 0 when it has none
int32_t wccp_get_device(const char *name);     // the kernel's index, 0 when there is none
uint32_t wccp_get_if_status(const char *name); // 1 up and running
