// Sends and receives single datagrams on the two sockets of an interface, and owns the lock under which the
// sockets' descriptors change.
#pragma once

#include <netinet/in.h>

#include "engine/wccp_records.h"

constexpr uint16_t WCCP_PORT = 2048; // UDP

sockaddr_in wccp_socket_address(be32 address); // with that port

// These two alone change ucast_fd and mcast_fd of an interface. Engine lock held, or at start and exit.
void wccp_set_descriptor(int32_t *cell, int fd);
// Closes both sockets and clears ucast_bound and mcast_bound.
void wccp_close_sockets(wccp_interface *interface);

// Sends `pkt` to pkt->ipa; if that is 0.0.0.0, to the multicast address of the group, or without one to each
// of its unicast routers. Returns the sum of the results of sendto: bytes, in which a failed send counts as
// -1; 0 when there was no destination or the interface has no bound socket. Never blocks. Sets pkt->ipa to
// the last destination. Engine lock held.
int32_t wccp_tx_pkt(wccp_service_group *group, wccp_pkt *pkt);
// Waits up to a second for one datagram and stores at most `length` bytes of it in pkt->data and its source
// in pkt->ipa. Returns the bytes received, 0 or less for none. No lock held.
int32_t wccp_rx_pkt(wccp_interface *interface, wccp_pkt *pkt, uint32_t length);
