// The engine's interface to configuration: adds, deletes, modifies, starts and stops groups.
#pragma once

#include "engine/wccp_records.h"

// Which field a modification changes: one bit, in config_flags. Of several, wccp_modify_grp acts on one.
enum : uint32_t {
    WCCP_CFG_ROUTERS = 0x0001,
    WCCP_CFG_ADMIN = 0x0002,
    WCCP_CFG_WEIGHT = 0x0004,
    WCCP_CFG_PASSWORD = 0x0008,
    WCCP_CFG_FWD_METHOD = 0x0010,
    WCCP_CFG_FORCE_L2_RETURN = 0x0020,
    WCCP_CFG_ASSIGN_METHOD = 0x0040,
    WCCP_CFG_COMPATIBILITY = 0x0080,
    WCCP_CFG_HASH_SRC_IP = 0x0100,
    WCCP_CFG_HASH_DST_IP = 0x0200,
    WCCP_CFG_HASH_SRC_PORT = 0x0400,
    WCCP_CFG_HASH_DST_PORT = 0x0800,
    WCCP_CFG_MASK_SRC_IP = 0x1000,
    WCCP_CFG_MASK_DST_IP = 0x2000,
    WCCP_CFG_MASK_SRC_PORT = 0x4000,
    WCCP_CFG_MASK_DST_PORT = 0x8000,
};

// Main thread; these take the engine lock. 0, or 1 with a line in the log.

// Adds a group and starts it if it is enabled and its interface is ready. Adds the interface if necessary.
// When the multicast address cannot be joined the result is 1, but the group has been added and starts later.
int wccp_add_group(const wccp_grp_config *config);
int wccp_del_group(int id);
int wccp_del_all_groups(); // at exit; clears no alarms; always 0
// Changes the one field that config_flags names, without restarting the group. Also 0 when it names none, and
// when a group that does not exist is enabled or disabled.
int wccp_modify_grp(const wccp_grp_config *config);
// Sets the TTL of multicast transmissions to the low 8 bits of `ttl`; 0 means 33. Also 1 when a socket
// refuses.
int wccp_set_mcast_ttl(uint32_t ttl);

// Lock held. Starting and stopping may wait for tunneld.

// Starts the group afresh, in INIT. If it is disabled or its interface is not ready, no timers are started.
void wccp_start_service_group(wccp_service_group *group);
// Sends the shutdown message, drops everything learned from routers, and enters INIT.
void wccp_stop_service_group(wccp_service_group *group);
int wccp_stop_all_service_groups(); // all enabled groups; always 0
// Count the call on the interface, and start or stop its enabled groups. Nothing is started until it is
// ready.
void wccp_start_service_groups_by_interface(wccp_interface *interface);
void wccp_stop_service_groups_by_interface(wccp_interface *interface);
// Starts the enabled groups of a ready interface that are not running.
void wccp_start_waiting_groups(wccp_interface *interface);
// Repeats the part of the interface's socket set-up that failed and, if it succeeds now, starts those groups.
void wccp_recover_interface(wccp_interface *interface);
// The same for every interface whose set-up failed, that an enabled group needs, and whose last attempt was
// at least 30 seconds ago. Once a tick.
void wccp_recover_interfaces_due();
// Sends a Here-I-Am with the shutdown command, unless the group is in INIT. 0, or the status of the
// transmission.
int wccp_notify_service_group_shutdown(wccp_service_group *group);
// Frees the sending routers, with their tunnel references, both views, and the queued removal replies. Always
// 0.
int wccp_flush_group_lists(wccp_service_group *group);
