// The sockets of an interface, UDP port 2048, and its receive thread; what the kernel says about an
// interface.
#pragma once

#include "engine/wccp_records.h"

// Opens both sockets anew, joins the multicast addresses of the interface's groups, and starts the receive
// thread unless there is one. Engine lock held, or at start; 0, or 1 when a step failed. 0 without an
// address.
int wccp_init_network_by_interface(wccp_interface *interface);
// Does again what the last set-up of the interface could not do. True when there was such a thing and now
// nothing is missing. Engine lock held.
bool wccp_retry_network(wccp_interface *interface);
// Engine lock held; 0, or 1 when the interface has no socket or address, or the kernel refuses.
int wccp_join_mc_grp(wccp_interface *interface, be32 address);
// Joins the multicast addresses of all groups of the interface. Engine lock held, or at start; always 0.
int wccp_config_mcast(wccp_interface *interface);
// The body of a receive thread (cthread start function).
void *wccp_rx_thread_fn(void *interface);

// Notes why the group's interface cannot carry its packets, or that it can. Lock held.
void wccp_note_network(wccp_service_group *group);
be32 wccp_get_address(const char *name);       // 0 when it has none
int32_t wccp_get_device(const char *name);     // the kernel's index, 0 when there is none
uint32_t wccp_get_if_status(const char *name); // 1 up and running
