// One datagram at a time on the two sockets of an interface, and the lock under which their descriptors
// change.
#pragma once

#include <netinet/in.h>

#include "engine/wccp_records.h"

constexpr uint16_t WCCP_PORT = 2048;

sockaddr_in wccp_socket_address(be32 address); // with the port above

// The two writers of an interface's ucast_fd and mcast_fd. Engine lock held, or at start and exit.
void wccp_set_descriptor(int32_t *cell, int fd);
// Closes both sockets and clears the fields that describe them.
void wccp_close_sockets(wccp_interface *interface);

// Engine lock held. The result is what sendto gave, summed over the routers that the packet goes to: bytes,
// 0 when there was nobody to send to. `pkt->ipa` is the last destination afterwards.
int32_t wccp_tx_pkt(wccp_service_group *group, wccp_pkt *pkt);
// No lock held; waits for at most about a second. Bytes received, 0 or less for nothing; `pkt->ipa` is the
// sender.
int32_t wccp_rx_pkt(wccp_interface *interface, wccp_pkt *pkt, uint32_t length);
