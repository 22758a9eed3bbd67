// Reacts to the kernel's link and address notifications. An interface is ready when it has a link and an
// address; its groups run only then.
//
// The two callbacks run on the platform's notifier thread and take the engine lock for all their work. They
// alone change the state of an interface once it is in the table. Each checks for the exit twice, before it
// takes the lock and again once it has it: a callback that waited while the groups were deleted must not open
// sockets or create a receive thread after all threads have been joined. The notifier thread outlives the
// engine; therefore nothing that the callbacks use has a destructor.
//
// The order of steps matters when an address changes. The shutdown messages of the groups need the old
// sockets and address, and their tunnel references are found by the old address. New sockets, the groups' new
// address and their start follow. When the address is removed, the ready bit is cleared first, so that no
// shutdown message is sent from an address that is gone.
//
// An address notification only says that something has changed. The present address is read from the kernel;
// therefore notifications that are late, duplicate or out of order have the same result. There is one case
// that the address does not show: while a callback waits for the lock, an interface can be deleted and
// created again with the same name and address. The multicast memberships of its socket were lost with the
// old device. Therefore the interface keeps the index of the device that its sockets were opened on, and they
// are opened again when that has changed.

#include "engine/wccp_link_mgr.h"

#include <cstdio>
#include <cstring>

#include "engine/wccp_config.h"
#include "engine/wccp_host.h"
#include "engine/wccp_interface.h"
#include "engine/wccp_network.h"
#include "engine/wccp_packet_io.h"
#include "engine/wccp_utils.h"
#include "runtime/logging.h"

int wccp_init_link_mgr() {
    {
        const wccp_engine_lock lock;
        wccp_if_init_table();
    }
    // No lock here: this asks mgmtd and runs the event loop while it waits.
    wccp_init_primary_wan_interface();
    {
        const wccp_engine_lock lock;
        if (!wccp_if_add_interface(wccp_primary_wan_interface_name))
            QV_LOG(LC_LOG_ERR, "WCCP: network init: %s add interface failed.",
                   wccp_primary_wan_interface_name);
    }
    // Only now, because callbacks may run at once, on another thread.
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

void wccp_link_update_group_ipa(wccp_service_group *first, be32 ipa) {
    for (wccp_service_group *group = first; group; group = group->if_next) {
        if (group->appliance_ipa != ipa)
            wccp_flush_group_lists(group); // drops its tunnel references, which need the old address
        group->appliance_ipa = ipa;
    }
}

void wccp_process_if_state_change(const void *argument) {
    const auto *info = static_cast<const qv_if_state_info *>(argument);
    if (wccpd_shutdown_in_progress() == 1 || !info)
        return;
    const wccp_engine_lock lock;
    if (wccpd_shutdown_in_progress() == 1)
        return;
    char name[sizeof info->name + 1]; // the platform's name may lack the terminating NUL
    snprintf(name, sizeof name, "%.*s", static_cast<int>(sizeof info->name), info->name);
    wccp_interface *interface = wccp_if_find_interface(name);
    if (!interface) {
        QV_LOG(LC_LOG_INFO, "WCCP Link event for %s is ignored.", name);
        return;
    }
    // Both are needed: a link without IFF_UP carries nothing.
    const uint32_t up = info->admin_up && info->link_up ? 1 : 0;
    if (interface->link_up == up) { // still a chance to repeat a failed set-up
        wccp_recover_interface(interface);
        return;
    }
    interface->link_up = up;
    QV_LOG(LC_LOG_NOTICE, up ? "WCCP: Interface %s is UP" : "WCCP: Interface %s is DOWN", interface->name);
    if (up) {
        interface->ready_flags |= WCCP_LINK_READY;
        // Groups are started whether or not this succeeds; their reasons show what failed.
        wccp_retry_network(interface);
        wccp_start_service_groups_by_interface(interface);
    } else {
        interface->link_down_count++;
        interface->ready_flags &= ~WCCP_LINK_READY;
        wccp_stop_service_groups_by_interface(interface);
    }
}

namespace {

void handle_lost_address(wccp_interface *interface) {
    interface->ready_flags &= ~WCCP_IPA_READY; // first, so that no shutdown message is sent
    wccp_stop_service_groups_by_interface(interface);
    wccp_link_update_group_ipa(interface->groups, interface->ipa);
}

void handle_first_address(wccp_interface *interface) {
    interface->ready_flags |= WCCP_IPA_READY;
    wccp_link_update_group_ipa(interface->groups, interface->ipa);
    wccp_init_network_by_interface(interface);
    wccp_start_service_groups_by_interface(interface);
}

void handle_changed_address(wccp_interface *interface) {
    interface->ready_flags |= WCCP_IPA_READY;
    wccp_stop_service_groups_by_interface(interface); // sends from the old address
    wccp_init_network_by_interface(interface);
    wccp_link_update_group_ipa(interface->groups, interface->ipa);
    wccp_start_service_groups_by_interface(interface);
}

// The device may have been created again, or the socket set-up may be incomplete.
void handle_same_address(wccp_interface *interface) {
    if (is_zero(interface->ipa))
        return;
    // An index that has changed means another device of the same name.
    if (interface->device == wccp_get_device(interface->name)) {
        wccp_recover_interface(interface);
        return;
    }
    QV_LOG(LC_LOG_INFO, "WCCP: Interface %s was created again; opening its sockets again", interface->name);
    if (wccp_init_network_by_interface(interface) == 0)
        wccp_start_waiting_groups(interface);
}

} // namespace

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
    // The notification has only a name; the present address is asked for.
    const be32 old_ipa = interface->ipa, new_ipa = wccp_get_address(interface->name);
    if (old_ipa == new_ipa) {
        handle_same_address(interface);
        return;
    }
    interface->ipa_change_count++;
    interface->ipa = new_ipa;
    if (is_zero(new_ipa)) {
        QV_LOG(LC_LOG_WARNING, "WCCP: Interface %s has no IP address old %s new %s", interface->name,
               addr_text(old_ipa).s, addr_text(new_ipa).s);
        handle_lost_address(interface);
        return;
    }
    const bool replaced = !is_zero(old_ipa);
    QV_LOG(replaced ? LC_LOG_NOTICE : LC_LOG_INFO, "WCCP Interface %s IP address change: %s --> %s",
           interface->name, addr_text(old_ipa).s, addr_text(new_ipa).s);
    if (replaced)
        handle_changed_address(interface);
    else
        handle_first_address(interface);
}
