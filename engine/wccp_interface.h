// The table of interfaces, and which groups are on which interface. Engine lock held, or at start.
#pragma once

#include "engine/wccp_records.h"

// Empties the slots that are not in use yet.
void wccp_if_init_table();
wccp_interface *wccp_if_find_interface(const char *name); // null when it is not in the table
// The new entry, with its sockets open if it has an address; the known one if the name is in the table; null
// when the table is full.
wccp_interface *wccp_if_add_interface(const char *name);
// Membership of a group; 0, or 1 for a null argument or a group on too many interfaces.
int wccp_if_add_group(wccp_service_group *group, wccp_interface *interface);
void wccp_if_remove_group(wccp_service_group *group); // on no interface: nothing
