// The sockets of an interface, UDP port 2048, and its receive thread; queries of the kernel about an
// interface.
#pragma once

#include "engine/wccp_records.h"

// The first four: engine lock held, or at start before any thread exists.

// Closes both sockets, opens new ones on the interface's address, joins the multicast addresses of its
// groups, and starts the receive thread unless it was started before. 0, also without an address; 1, with a
// line in the log, when a step failed. Failures are remembered for wccp_retry_network.
int wccp_init_network_by_interface(wccp_interface *interface);
// Repeats the part of the last set-up that failed. True when there was one and everything has now succeeded.
bool wccp_retry_network(wccp_interface *interface);
// Joins a multicast address (IP_ADD_MEMBERSHIP); the first one also binds the socket. 0, also if it was
// joined before; 1 without a socket or an address, or, with a line in the log, when the kernel refuses.
int wccp_join_mc_grp(wccp_interface *interface, be32 address);
// Joins the multicast addresses of all groups of the interface. Always 0; failures are remembered as above.
int wccp_config_mcast(wccp_interface *interface);

// The body of a receive thread, a start function for cthread_init. Returns only when `interface` is null.
void *wccp_rx_thread_fn(void *interface);

// Records the reason why the group's interface cannot carry its packets, or removes it if it can. Lock held.
void wccp_note_network(wccp_service_group *group);

// These ask the kernel and need no lock.
be32 wccp_get_address(const char *name);       // IPv4 address, 0.0.0.0 for none
int32_t wccp_get_device(const char *name);     // interface index, 0 for none
uint32_t wccp_get_if_status(const char *name); // 1 when up and running, otherwise 0
