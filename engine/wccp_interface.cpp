// The table of interfaces, wccp_g.interfaces. Entries are added at start and by wccp_add_group and are never
// removed; a pointer to one therefore stays valid.

#include "engine/wccp_interface.h"

#include <algorithm>
#include <cstring>

#include "engine/wccp_host.h"
#include "engine/wccp_network.h"
#include "platform/limits.h"
#include "runtime/logging.h"

namespace {

uint32_t get_interface_limit() {
    return std::min(qv_max_interfaces(), WCCP_MAX_INTERFACES);
}

void clear_interface(wccp_interface *interface) {
    *interface = {};
    interface->ucast_fd = -1;
    interface->mcast_fd = -1;
}

} // namespace

void wccp_if_init_table() {
    for (uint32_t i = wccp_g.if_count; i < WCCP_MAX_INTERFACES; i++)
        clear_interface(&wccp_g.interfaces[i]);
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
    if (wccp_g.if_count >= get_interface_limit()) {
        QV_LOG(LC_LOG_ERR, "WCCP: interface add failed: Max Limit (%d)", wccp_g.if_count);
        return nullptr;
    }
    wccp_interface *interface = &wccp_g.interfaces[wccp_g.if_count];
    clear_interface(interface);
    // A name of 16 bytes or more is cut, and no device has it.
    strlcpy(interface->name, name, sizeof interface->name);
    const bool primary = strncmp(interface->name, wccp_primary_wan_interface_name, WCCP_IF_NAME_BYTES) == 0;
    interface->ipa = wccp_get_address(interface->name);
    // The primary interface is in the table even if no group uses it; a missing one is not worth a warning.
    if (!primary || wccp_get_device(interface->name) != 0)
        interface->link_up = wccp_get_if_status(interface->name);
    // The entry counts, and can be found, only from here on.
    wccp_g.if_count++;
    if (primary)
        wccp_g.primary_if = interface;
    if (interface->link_up)
        interface->ready_flags |= WCCP_LINK_READY;
    if (!is_zero(interface->ipa)) {
        interface->ready_flags |= WCCP_IPA_READY;
        // A failure is noted in the interface and tried again later.
        wccp_init_network_by_interface(interface);
    }
    return interface;
}

int wccp_if_add_group(wccp_service_group *group, wccp_interface *interface) {
    if (!group || !interface)
        return 1;
    if (group->if_count >= get_interface_limit()) {
        QV_LOG(LC_LOG_ERR, "WCCP GRP %d: max number of interfaces has reached for this group", group->id);
        return 1;
    }
    // By hand, because the list functions expect members called next and prev_link.
    group->if_next = interface->groups;
    group->if_prev_link = &interface->groups;
    if (interface->groups)
        interface->groups->if_prev_link = &group->if_next;
    interface->groups = group;
    group->interfaces[group->if_count++] = interface;
    return 0;
}

void wccp_if_remove_group(wccp_service_group *group) {
    if (!group->if_prev_link)
        return;
    *group->if_prev_link = group->if_next;
    if (group->if_next)
        group->if_next->if_prev_link = group->if_prev_link;
    group->if_next = nullptr;
    group->if_prev_link = nullptr;
}
