// The table of interfaces, and which groups are on which interface. Lock held, or at start before any thread
// exists.
#pragma once

#include "engine/wccp_records.h"

void wccp_if_init_table(); // initialises the unused entries
// Compares at most 16 bytes of the names. Null when the interface is not in the table. Entries never move.
wccp_interface *wccp_if_find_interface(const char *name);
// Adds an entry with the address and link state from the kernel, and opens its sockets if it has an address.
// Returns the existing entry if there is one. Null, with a line in the log, when the table is full.
wccp_interface *wccp_if_add_interface(const char *name);
// Puts the group on the interface. 0, or 1 for a null argument or when the group has too many interfaces.
int wccp_if_add_group(wccp_service_group *group, wccp_interface *interface);
// Takes the group off its interface's list. Nothing if it is on none.
void wccp_if_remove_group(wccp_service_group *group);
