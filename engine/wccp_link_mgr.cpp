// The interface table, and what becomes of the groups when an interface changes.
//
// Records: wccp_g.interfaces, taken slot by slot and never given back, so a pointer to one holds for the life
// of the engine. An interface is ready when it has a link and an address; its groups run only then.
//
// Who calls: the table grows at start and from wccp_add_group. The two callbacks run on the platform's
// notifier thread, take the engine lock for all their work, and are the only ones that change an interface
// afterwards. They look whether the daemon is exiting before they ask for the lock and again once they have
// it: a callback that waited through the stop of the groups must neither start them again nor make a receive
// thread behind the back of those who have just ended them all. The notifier's thread outlives the engine;
// what the callbacks touch has no destructor.
//
// Order matters on a change of address. The old sockets and the old address serve the farewells of the
// groups, and the tunnels given back are found by the old address; then come the new sockets, then the
// groups' own address, then the start. When the address goes, the ready bit goes first, so that no farewell
// is tried.
//
// A notification of an address tells only that something has changed. The kernel is asked for what holds now,
// so events that come late, twice or in another order end in the same place. One thing the address alone
// doesn't tell: while a callback waits for the lock, an interface can be deleted and made again under its
// name with its address. The memberships of its multicast socket went with the old device; so the sockets
// remember the device that they were opened on, and another one under the same address opens them again.

#include "engine/wccp_link_mgr.h"

#include <algorithm>
#include <cstdio>
#include <cstring>

#include "engine/wccp_config.h"
#include "engine/wccp_host.h"
#include "engine/wccp_network.h"
#include "engine/wccp_utils.h"
#include "platform/limits.h"
#include "runtime/logging.h"

static uint32_t interface_limit() {
    return std::min(qv_max_interfaces(), WCCP_MAX_INTERFACES);
}

static void clear_interface(wccp_interface *interface) {
    *interface = {};
    interface->ucast_fd = -1;
    interface->mcast_fd = -1;
}

int wccp_init_link_mgr() {
    {
        const wccp_engine_lock lock;
        // A change of configuration that came since the start began may have taken the first ones already.
        for (uint32_t i = wccp_g.if_count; i < WCCP_MAX_INTERFACES; i++)
            clear_interface(&wccp_g.interfaces[i]);
    }
    // Asks mgmtd and runs the event loop meanwhile: no lock here.
    wccp_init_primary_wan_interface();
    {
        const wccp_engine_lock lock;
        if (!wccp_if_add_interface(wccp_primary_wan_interface_name))
            QV_LOG(LC_LOG_ERR, "WCCP: network init: %s add interface failed.",
                   wccp_primary_wan_interface_name);
    }
    int result = qv_register_netlink_notifier(QV_NOTIFY_LINK_STATE, wccp_process_if_state_change);
    if (result != 0) {
        QV_LOG(LC_LOG_ERR, "WCCP: netlink link state registration failed.");
        return result;
    }
    if (qv_start_netlink_monitor(QV_NOTIFY_LINK_STATE) != 0)
        QV_LOG(LC_LOG_ERR, "WCCP: netlink link state start failed.");
    if (qv_register_netlink_notifier(QV_NOTIFY_IPA_CHANGE, wccp_process_if_ipa_update) != 0)
        QV_LOG(LC_LOG_ERR, "WCCP: netlink ip address change registration failed.");
    result = qv_start_netlink_monitor(QV_NOTIFY_IPA_CHANGE);
    if (result != 0)
        QV_LOG(LC_LOG_ERR, "WCCP: netlink ip address change start failed.");
    return result;
}

void wccp_deinit_link_mgr() {
    const wccp_engine_lock lock;
    for (wccp_interface &interface : wccp_g.interfaces)
        wccp_close_sockets(&interface);
}

wccp_interface *wccp_if_find_interface(const char *name) {
    for (uint32_t i = 0; i < wccp_g.if_count; i++)
        if (strncmp(wccp_g.interfaces[i].name, name, WCCP_IF_NAME_BYTES) == 0)
            return &wccp_g.interfaces[i];
    return nullptr;
}

wccp_interface *wccp_if_add_interface(const char *name) {
    if (wccp_interface *known = wccp_if_find_interface(name)) {
        QV_LOG(LC_LOG_NOTICE, "WCCP: interface add failed: %s exists", known->name);
        return known;
    }
    if (wccp_g.if_count >= interface_limit()) {
        QV_LOG(LC_LOG_ERR, "WCCP: interface add failed: Max Limit (%d)", wccp_g.if_count);
        return nullptr;
    }
    wccp_interface *interface = &wccp_g.interfaces[wccp_g.if_count];
    clear_interface(interface);
    strlcpy(interface->name, name, sizeof interface->name);
    interface->ipa = wccp_get_address(interface->name);
    interface->link_up = wccp_get_if_status(interface->name);
    wccp_g.if_count++;
    if (strncmp(interface->name, wccp_primary_wan_interface_name, WCCP_IF_NAME_BYTES) == 0)
        wccp_g.primary_if = interface;
    if (interface->link_up)
        interface->ready_flags |= WCCP_LINK_READY;
    if (!is_zero(interface->ipa)) {
        interface->ready_flags |= WCCP_IPA_READY;
        wccp_init_network_by_interface(interface);
    }
    return interface;
}

int wccp_if_add_group(wccp_service_group *group, wccp_interface *interface) {
    if (!group || !interface)
        return 1;
    if (group->if_count >= interface_limit()) {
        QV_LOG(LC_LOG_ERR, "WCCP GRP %d: max number of interfaces has reached for this group", group->id);
        return 1;
    }
    group->if_next = interface->groups;
    group->if_prev_link = &interface->groups;
    if (interface->groups)
        interface->groups->if_prev_link = &group->if_next;
    interface->groups = group;
    group->interfaces[group->if_count++] = interface;
    return 0;
}

void wccp_link_update_group_ipa(wccp_service_group *first, be32 ipa) {
    for (wccp_service_group *group = first; group; group = group->if_next)
        group->appliance_ipa = ipa;
}

void wccp_process_if_state_change(const void *argument) {
    const auto *info = static_cast<const qv_if_state_info *>(argument);
    if (wccpd_shutdown_in_progress() == 1 || !info)
        return;
    const wccp_engine_lock lock;
    if (wccpd_shutdown_in_progress() == 1)
        return;
    char name[sizeof info->name + 1];
    snprintf(name, sizeof name, "%.*s", static_cast<int>(sizeof info->name), info->name);
    wccp_interface *interface = wccp_if_find_interface(name);
    if (!interface) {
        QV_LOG(LC_LOG_INFO, "WCCP Link event for %s is ignored.", name);
        return;
    }
    const uint32_t up = info->admin_up && info->link_up ? 1 : 0;
    if (interface->link_up == up)
        return;
    interface->link_up = up;
    QV_LOG(LC_LOG_NOTICE, up ? "WCCP: Interface %s is UP" : "WCCP: Interface %s is DOWN", interface->name);
    if (up) {
        interface->ready_flags |= WCCP_LINK_READY;
        wccp_start_service_groups_by_interface(interface);
    } else {
        interface->link_down_count++;
        interface->ready_flags &= ~WCCP_LINK_READY;
        wccp_stop_service_groups_by_interface(interface);
    }
}

static void address_gone(wccp_interface *interface) {
    interface->ready_flags &= ~WCCP_IPA_READY;
    wccp_stop_service_groups_by_interface(interface);
    wccp_link_update_group_ipa(interface->groups, interface->ipa);
}

static void address_came(wccp_interface *interface) {
    interface->ready_flags |= WCCP_IPA_READY;
    wccp_link_update_group_ipa(interface->groups, interface->ipa);
    wccp_init_network_by_interface(interface);
    wccp_start_service_groups_by_interface(interface);
}

static void address_replaced(wccp_interface *interface) {
    interface->ready_flags |= WCCP_IPA_READY;
    wccp_stop_service_groups_by_interface(interface);
    wccp_init_network_by_interface(interface);
    wccp_link_update_group_ipa(interface->groups, interface->ipa);
    wccp_start_service_groups_by_interface(interface);
}

static void open_on_another_device(wccp_interface *interface) {
    if (is_zero(interface->ipa) || interface->device == wccp_get_device(interface->name))
        return;
    QV_LOG(LC_LOG_INFO, "WCCP: Interface %s was made again: its sockets are opened again", interface->name);
    wccp_init_network_by_interface(interface);
}

void wccp_process_if_ipa_update(const void *argument) {
    const auto *name = static_cast<const char *>(argument);
    if (wccpd_shutdown_in_progress() == 1 || !name)
        return;
    const wccp_engine_lock lock;
    if (wccpd_shutdown_in_progress() == 1)
        return;
    wccp_interface *interface = wccp_if_find_interface(name);
    if (!interface) {
        QV_LOG(LC_LOG_INFO, "WCCP Link IP address change event for %s is ignored.", name);
        return;
    }
    const be32 old_ipa = interface->ipa, new_ipa = wccp_get_address(interface->name);
    if (old_ipa == new_ipa) {
        open_on_another_device(interface);
        return;
    }
    interface->ipa_change_count++;
    interface->ipa = new_ipa;
    if (is_zero(new_ipa)) {
        QV_LOG(LC_LOG_WARNING, "WCCP: Interface %s has no IP address old %s new %s", interface->name,
               addr_text(old_ipa).s, addr_text(new_ipa).s);
        address_gone(interface);
        return;
    }
    const bool replaced = !is_zero(old_ipa);
    QV_LOG(replaced ? LC_LOG_NOTICE : LC_LOG_INFO, "WCCP Interface %s IP address change: %s --> %s",
           interface->name, addr_text(old_ipa).s, addr_text(new_ipa).s);
    if (replaced)
        address_replaced(interface);
    else
        address_came(interface);
}
