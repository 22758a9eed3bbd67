// Service groups as configuration sees them: added, deleted, enabled, modified, started and stopped.
//
// The record of a group is linked from wccp_g.groups, wccp_g.group_list and its interface's list. Only the
// main thread adds and deletes groups; therefore a new record is filled without the engine lock and linked
// with it held. Groups are also started and stopped by the notifier thread (wccp_link_mgr.cpp), and started
// by a tick when their sockets have been recovered; the caller then holds the lock. Nothing keeps a pointer
// into a wccp_grp_config.
//
// Shutdown message. A group whose routers have learned of it sends a last Here-I-Am with the shutdown
// command. It is sent while addresses, sockets and methods are still those that the routers know. A group in
// INIT has nothing to withdraw and sends none, which makes it safe to stop a group twice.
//
// A multicast group that cannot join its address, for example on an interface that has no address yet, is
// reported as a failure but stays in the tables. It starts when the interface gets its address or when a
// retry of the socket set-up succeeds.

#include "engine/wccp_config.h"

#include <netinet/in.h>
#include <sys/socket.h>

#include <bit>
#include <cstdio>
#include <cstring>

#include "engine/wccp_alarms.h"
#include "engine/wccp_interface.h"
#include "engine/wccp_network.h"
#include "engine/wccp_pkt_mgr.h"
#include "engine/wccp_state.h"
#include "engine/wccp_tunnel.h"
#include "engine/wccp_utils.h"
#include "engine/wccp_wire.h"
#include "engine/wccpd_common.h"
#include "runtime/list.h"
#include "runtime/logging.h"

namespace {

constexpr uint32_t HERE_I_AM_SECONDS = 10;
constexpr uint32_t MONITOR_SECONDS = 5;
constexpr uint32_t NETWORK_RETRY_SECONDS = 30;
constexpr uint8_t MCAST_TTL_FOR_ZERO = 33;

// The bit of service_flags for each hash field.
struct hash_row {
    uint32_t config_flag;
    uint32_t service_flag;
    uint32_t wccp_grp_config::*value;
};
constexpr hash_row hash_rows[] = {
    {WCCP_CFG_HASH_SRC_IP, 0x1, &wccp_grp_config::hash_src_ip},
    {WCCP_CFG_HASH_DST_IP, 0x2, &wccp_grp_config::hash_dst_ip},
    {WCCP_CFG_HASH_SRC_PORT, 0x4, &wccp_grp_config::hash_src_port},
    {WCCP_CFG_HASH_DST_PORT, 0x8, &wccp_grp_config::hash_dst_port},
};
constexpr uint32_t ANY_HASH =
    WCCP_CFG_HASH_SRC_IP | WCCP_CFG_HASH_DST_IP | WCCP_CFG_HASH_SRC_PORT | WCCP_CFG_HASH_DST_PORT;
constexpr uint32_t ANY_MASK =
    WCCP_CFG_MASK_SRC_IP | WCCP_CFG_MASK_DST_IP | WCCP_CFG_MASK_SRC_PORT | WCCP_CFG_MASK_DST_PORT;

void set_hash_bit(wccp_service_group *group, const hash_row *row, const wccp_grp_config *config) {
    if (config->*row->value == 1)
        group->service_flags |= row->service_flag;
    else
        group->service_flags &= ~row->service_flag;
}

void set_masks(wccp_service_group *group, const wccp_grp_config *config, uint32_t which) {
    if (which & WCCP_CFG_MASK_SRC_IP)
        group->mask_src_ip = config->mask_src_ip;
    if (which & WCCP_CFG_MASK_DST_IP)
        group->mask_dst_ip = config->mask_dst_ip;
    if (which & WCCP_CFG_MASK_SRC_PORT)
        group->mask_src_port = config->mask_src_port;
    if (which & WCCP_CFG_MASK_DST_PORT)
        group->mask_dst_port = config->mask_dst_port;
    const wccp_mask mask = {group->mask_src_ip, group->mask_dst_ip, group->mask_src_port,
                            group->mask_dst_port};
    group->mask_bits = util_wccp_mask_get_bits_set(&mask);
}

void set_password(wccp_service_group *group, const wccp_grp_config *config) {
    memset(group->password, 0, sizeof group->password);
    group->security_option = config->password[0] ? 1 : 0;
    // The configured password has been padded with zeros; its ninth byte, a NUL, is not copied.
    if (group->security_option)
        memcpy(group->password, config->password, sizeof group->password);
}

void set_routers(wccp_service_group *group, const wccp_grp_config *config) {
    for (uint32_t i = 0; i < config->router_count && i < WCCP_MAX_ROUTERS; i++) {
        const be32 address = config->routers[i];
        if ((address.bytes[0] & 0xf0) == 0xe0) { // 224.0.0.0/4: the first one ends the list
            group->mcast_ipa = address;
            group->mcast_configured = 1;
            return;
        }
        group->ucast_routers[group->ucast_router_count++] = address;
    }
}

void start_timer(wccp_timer *timer, uint32_t period, uint32_t countdown) {
    *timer = {
        .active = 1, .mode = WCCP_TIMER_REPEATS, .remaining = 0, .period = period, .countdown = countdown};
}

// Clears what the group has agreed with its routers and computed for them.
void clear_agreement(wccp_service_group *group) {
    group->designated = 0;
    group->fwd_method = WCCP_METHOD_NONE;
    group->assign_method = WCCP_ASSIGN_NONE;
    group->ret_method = WCCP_METHOD_NONE;
    group->change_number = 0;
    // All of them: the state, the agreement, and a pending election.
    group->state_flags = 0;
    wccp_clear_assignment_block(group);
    group->redirecting_routers = 0;
}

template <typename T>
void free_records(T **head, uint32_t *count) {
    // Each unlink advances the head.
    while (T *record = *head) {
        list_unlink(record);
        wccp_free(record);
    }
    *count = 0;
}

void free_group(wccp_service_group *group) {
    wccp_pkt_free(group->tx_pkt);
    wccp_free(group);
}

// Configuration may add hundreds of groups to an interface in one second; one attempt is enough for all.
void recover_once_per_second(wccp_interface *interface) {
    if (interface->network_tried != wccp_g.seconds)
        wccp_recover_interface(interface);
}

bool interface_is_needed(const wccp_interface *interface) {
    if (!wccp_if_is_ready(interface))
        return false;
    for (const wccp_service_group *group = interface->groups; group; group = group->if_next)
        if (group->admin_state == WCCP_ADMIN_UP)
            return true;
    return false;
}

wccp_interface *find_or_add_interface(const wccp_grp_config *config) {
    char name[WCCP_IF_NAME_BYTES];
    snprintf(name, sizeof name, "%.*s", static_cast<int>(sizeof name - 1), config->interface);
    const wccp_engine_lock lock;
    wccp_interface *interface = wccp_if_find_interface(name);
    // A new group is a reason to try a failed set-up again.
    if (interface)
        recover_once_per_second(interface);
    else
        interface = wccp_if_add_interface(name);
    if (!interface)
        QV_LOG(LC_LOG_ERR, "WCCP:wccp_add_group: interface %s add failed.", name);
    return interface;
}

// A new group except for its appliance address: without the lock the interface's address may still change.
wccp_service_group *build_group(const wccp_grp_config *config) {
    auto *group = static_cast<wccp_service_group *>(wccp_malloc(sizeof(wccp_service_group)));
    if (!group) {
        QV_LOG(LC_LOG_ERR, "WCCP:wccp_add_group: Can't alloc memory");
        return nullptr;
    }
    group->id = config->group_id;
    group->priority = config->priority;
    group->protocol = config->protocol;
    for (const hash_row &row : hash_rows)
        set_hash_bit(group, &row, config);
    set_masks(group, config, ANY_MASK);
    set_password(group, config);
    set_routers(group, config);
    group->weight = config->weight;
    group->cfg_fwd_method = config->fwd_method;
    group->cfg_assign_method = config->assign_method;
    group->admin_state = config->admin;
    group->force_l2_return = config->force_l2_return;
    group->compat_mode = config->compatibility;
    if (group->compat_mode != WCCP_COMPAT_IOS && group->compat_mode != WCCP_COMPAT_NEXUS) {
        QV_LOG(LC_LOG_WARNING, "WCCP GRP: %d. %s bad compatibility mode (%d). using %d", group->id,
               "wccp_add_group", static_cast<int>(group->compat_mode), static_cast<int>(WCCP_COMPAT_IOS));
        group->compat_mode = WCCP_COMPAT_IOS;
    }
    group->tx_pkt = wccp_pkt_alloc();
    if (!group->tx_pkt) {
        QV_LOG(LC_LOG_ERR, "WCCP GRP %d allocating transmit packet FAILED.", group->id);
        wccp_free(group);
        return nullptr;
    }
    return group;
}

} // namespace

int wccp_add_group(const wccp_grp_config *config) {
    if (!config) {
        QV_LOG(LC_LOG_ERR, "WCCP:wccp_add_group: Null parameter ptr");
        return 1;
    }
    wccp_interface *interface = find_or_add_interface(config);
    if (!interface)
        return 1;
    if (wccp_find_group(config->group_id)) { // without the lock: only this thread adds and deletes groups
        QV_LOG(LC_LOG_ERR, "WCCP:wccp_add_group: Group %d already exists", config->group_id);
        return 1;
    }
    wccp_service_group *group = build_group(config);
    if (!group)
        return 1;

    const wccp_engine_lock lock;
    group->appliance_ipa = interface->ipa; // from now on the link manager keeps it up to date
    wccp_g.groups[group->id] = group;
    list_push_head(&wccp_g.group_list, group);
    wccp_g.group_count++;
    wccp_if_add_group(group, interface);
    // A failed join is not undone: the group stays and is started when a later attempt succeeds.
    if (group->mcast_configured && wccp_join_mc_grp(interface, group->mcast_ipa)) {
        wccp_note_network(group);
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: cannot join %s on interface %s yet", group->id,
               addr_text(group->mcast_ipa).s, interface->name);
        return 1;
    }
    wccp_start_service_group(group);
    return 0;
}

void wccp_start_service_group(wccp_service_group *group) {
    group->assign_timer.active = 0;
    wccp_flush_group_lists(group); // a group that is running already starts afresh
    clear_agreement(group);
    wccp_forget_all_reasons(group);
    group->start_time = wccp_g.seconds;
    // The state was cleared above; therefore this always enters INIT and reports its role.
    wccp_appliance_state_init(group);
    if (group->admin_state != WCCP_ADMIN_UP) {
        QV_LOG(LC_LOG_NOTICE, "WCCP GRP %d: not started (admin disabled)", group->id);
        return;
    }
    // Also for a group that cannot start yet: its routers are missing all the same.
    wccp_alarm_schedule_verify_router_connectivity_timer(group, 0);
    wccp_note_network(group);
    if (!wccp_if_is_ready(group->interfaces[0])) {
        QV_LOG(LC_LOG_NOTICE, "WCCP GRP %d: not launched (links are not ready)", group->id);
        return;
    }
    start_timer(&group->hia_timer, HERE_I_AM_SECONDS, 1); // the first Here-I-Am is sent in the next tick
    start_timer(&group->monitor_timer, MONITOR_SECONDS, MONITOR_SECONDS);
    if (wccp_set_L2_return(group->id, group->force_l2_return) != 0 && group->force_l2_return)
        wccp_note_reason(group, WCCP_REASON_TUNNELD_SILENT, {}, {}, wccp_reason_value("return by L2"));
}

int wccp_notify_service_group_shutdown(wccp_service_group *group) {
    if (group->state_flags & WCCP_STATE_INIT)
        return 0;
    group->state_flags |= WCCP_SHUTTING_DOWN; // adds the shutdown command to the message
    const int result = wccp_transmit_packet(group, group->tx_pkt, WCCP_HERE_I_AM);
    group->state_flags &= ~WCCP_SHUTTING_DOWN;
    if (result != 0)
        QV_LOG(LC_LOG_ERR, "WCCP GRP %u: %s failed.", group->id, "sending HERE_I_AM ");
    return result;
}

void wccp_stop_service_group(wccp_service_group *group) {
    wccp_notify_service_group_shutdown(group);
    group->hia_timer.active = 0;
    group->assign_timer.active = 0;
    group->monitor_timer.active = 0;
    wccp_flush_group_lists(group);
    clear_agreement(group);
    wccp_forget_all_reasons(group);
    wccp_note_network(group); // the interface may be the cause of the stop
    group->start_time = wccp_g.seconds;
    wccp_alarm_schedule_verify_router_connectivity_timer(group, 1);
    // As at the start, this always reports the role.
    wccp_appliance_state_init(group);
}

int wccp_flush_group_lists(wccp_service_group *group) {
    for (wccp_sending_router *router = group->sending_routers; router; router = router->next)
        if (router->flags & WCCP_RTR_HAS_TUNNEL) {
            router->flags &= ~WCCP_RTR_HAS_TUNNEL;
            wccp_del_tunnel(group->id, group->appliance_ipa, router->router_id, 0);
        }
    free_records(&group->sending_routers, &group->sending_router_count);
    free_records(&group->appliance_view, &group->appliance_view_count);
    free_records(&group->router_view, &group->router_view_count);
    free_records(&group->removal_replies, &group->removal_reply_count);
    return 0;
}

namespace {

// Removes the group from the engine and frees it. Lock held.
void remove_group(wccp_service_group *group, bool clear_alarms) {
    list_unlink(group);
    wccp_g.groups[group->id] = nullptr;
    wccp_notify_service_group_shutdown(group); // while it still has its interface and views
    wccp_if_remove_group(group);
    wccp_flush_group_lists(group);
    wccp_set_role_and_send_event(group->id, WCCP_ROLE_UNKNOWN);
    // At exit the alarms have been cleared before, on a session that has been closed since.
    if (clear_alarms)
        wccp_alarms_clear_all_raised_alarms(group);
    free_group(group);
    wccp_g.group_count--;
}

} // namespace

int wccp_del_group(int id) {
    const wccp_engine_lock lock;
    wccp_service_group *group = wccp_find_group(id);
    if (!group) {
        QV_LOG(LC_LOG_ERR, "WCCP:wccp_del_group: Group %d does not exists", id);
        return 1;
    }
    remove_group(group, true);
    return 0;
}

int wccp_del_all_groups() {
    const wccp_engine_lock lock;
    // By number, because each removal changes the list.
    for (wccp_service_group *group : wccp_g.groups)
        if (group)
            remove_group(group, false);
    return 0;
}

namespace {

// --- Changes of one field

int wccp_enable_group(wccp_service_group *group, const wccp_grp_config *) {
    if (group->admin_state == WCCP_ADMIN_UP)
        return 0;
    if (group->interfaces[0]) // before it is enabled, so that it is started only once
        recover_once_per_second(group->interfaces[0]);
    group->admin_state = WCCP_ADMIN_UP;
    wccp_start_service_group(group);
    return 0;
}

int wccp_disable_group(wccp_service_group *group, const wccp_grp_config *) {
    if (group->admin_state != WCCP_ADMIN_UP)
        return 0;
    wccp_stop_service_group(group);
    wccp_alarms_clear_all_raised_alarms(group);
    group->admin_state = WCCP_ADMIN_DOWN;
    return 0;
}

int wccp_set_grp_weight(wccp_service_group *group, const wccp_grp_config *config) {
    // The next Here-I-Am carries it. The table changes when the routers report it back.
    group->weight = config->weight;
    return 0;
}

int wccp_set_grp_password(wccp_service_group *group, const wccp_grp_config *config) {
    set_password(group, config);
    return 0;
}

// Once the group has agreed on methods with a router, it keeps them until it starts again.
void note_kept_methods(wccp_service_group *group) {
    const struct {
        const char *what;
        uint32_t used, configured;
        const char *(*name)(uint32_t code);
    } methods[] = {
        {"forwarding", group->fwd_method, group->cfg_fwd_method, wccp_method_name},
        {"assignment", group->assign_method, group->cfg_assign_method, wccp_assign_method_name},
    };
    for (const auto &method : methods)
        if ((group->state_flags & WCCP_CAPABILITIES_SET) && !(method.used & method.configured)) {
            wccp_note_reason(group, WCCP_REASON_RESTART_NEEDED, {},
                             wccp_reason_value("%s by %s", method.what, method.name(method.used)),
                             wccp_reason_value("%s", method.name(method.configured)));
            return;
        }
    wccp_forget_reasons(group, WCCP_REASON_RESTART_NEEDED);
}

int wccp_set_fwd_method(wccp_service_group *group, const wccp_grp_config *config) {
    group->cfg_fwd_method = config->fwd_method;
    note_kept_methods(group);
    return 0;
}

int wccp_set_force_l2_rtn(wccp_service_group *group, const wccp_grp_config *config) {
    // The next start of the group passes it on to tunneld.
    group->force_l2_return = config->force_l2_return;
    return 0;
}

int wccp_set_assign_method(wccp_service_group *group, const wccp_grp_config *config) {
    group->cfg_assign_method = config->assign_method;
    note_kept_methods(group);
    return 0;
}

int wccp_set_hash(wccp_service_group *group, const wccp_grp_config *config) {
    for (const hash_row &row : hash_rows)
        if (config->config_flags == row.config_flag) {
            set_hash_bit(group, &row, config);
            return 0;
        }
    QV_LOG(LC_LOG_ERR, "wccp_set_hash: unknown config_flag 0x%x", config->config_flags);
    return 1;
}

int wccp_set_mask(wccp_service_group *group, const wccp_grp_config *config) {
    if (!std::has_single_bit(config->config_flags)) {
        QV_LOG(LC_LOG_ERR, "wccp_set_mask: unknown config_flag 0x%x", config->config_flags);
        return 1;
    }
    set_masks(group, config, config->config_flags);
    return 0;
}

int wccp_set_compatibility_mode(wccp_service_group *group, const wccp_grp_config *config) {
    group->compat_mode = config->compatibility;
    return 0;
}

// The action for each flag, in the order in which the flags are tested.
struct modify_row {
    uint32_t config_flags;
    bool (*applies)(const wccp_grp_config *config); // null: always
    int (*action)(wccp_service_group *group, const wccp_grp_config *config);
    int result_without_group;
    const char *message_without_group;
};
bool enables_group(const wccp_grp_config *config) {
    return config->admin == WCCP_ADMIN_UP;
}
const modify_row modify_rows[] = {
    {WCCP_CFG_ADMIN, enables_group, wccp_enable_group, 0, "WCCP GRP %d enabled failed. cannot find group."},
    {WCCP_CFG_ADMIN, nullptr, wccp_disable_group, 0, "WCCP GRP %d disable failed. cannot find group."},
    {WCCP_CFG_WEIGHT, nullptr, wccp_set_grp_weight, 1,
     "WCCP GRP %d setting weight failed. cannot find group."},
    {WCCP_CFG_PASSWORD, nullptr, wccp_set_grp_password, 1,
     "WCCP GRP %d setting password failed. cannot find group."},
    {WCCP_CFG_FWD_METHOD, nullptr, wccp_set_fwd_method, 1,
     "WCCP GRP %d setting fwd method failed. cannot find group."},
    {WCCP_CFG_FORCE_L2_RETURN, nullptr, wccp_set_force_l2_rtn, 1,
     "WCCP GRP %d setting force L2 return failed. cannot find group."},
    {WCCP_CFG_ASSIGN_METHOD, nullptr, wccp_set_assign_method, 1,
     "WCCP GRP %d setting assign method failed. cannot find group."},
    {ANY_HASH, nullptr, wccp_set_hash, 1, "WCCP GRP %d setting hash failed. cannot find group."},
    {ANY_MASK, nullptr, wccp_set_mask, 1, "WCCP GRP %d setting mask failed. cannot find group."},
    {WCCP_CFG_COMPATIBILITY, nullptr, wccp_set_compatibility_mode, 1,
     "WCCP GRP %d setting compatibility mode failed. cannot find group."},
};

} // namespace

int wccp_modify_grp(const wccp_grp_config *config) {
    if (!config)
        return 1;
    // A modification has a single flag, and the first row that matches is carried out.
    for (const modify_row &row : modify_rows) {
        if ((config->config_flags & row.config_flags) == 0 || (row.applies && !row.applies(config)))
            continue;
        const wccp_engine_lock lock;
        if (wccp_service_group *group = wccp_find_group(config->group_id))
            return row.action(group, config);
        QV_LOG(LC_LOG_ERR, row.message_without_group, config->group_id);
        return row.result_without_group;
    }
    return 0;
}

int wccp_set_mcast_ttl(uint32_t ttl) {
    // With a TTL of 0 the messages would not leave the host.
    const uint8_t wanted = (ttl & 0xff) ? static_cast<uint8_t>(ttl & 0xff) : MCAST_TTL_FOR_ZERO;
    const wccp_engine_lock lock;
    if (wanted == wccp_g.mcast_ttl)
        return 0;
    wccp_g.mcast_ttl = wanted;
    int result = 0;
    for (uint32_t i = 0; i < wccp_g.if_count; i++) {
        const wccp_interface *interface = &wccp_g.interfaces[i];
        if (interface->mcast_fd == -1 ||
            setsockopt(interface->mcast_fd, IPPROTO_IP, IP_MULTICAST_TTL, &wanted, sizeof wanted) == 0)
            continue;
        QV_LOG(LC_LOG_ERR, "WCCP: %s Cannot change mcast output TTL. error: %m", interface->name);
        result = 1;
    }
    return result;
}

int wccp_stop_all_service_groups() {
    for (wccp_service_group *group : wccp_g.groups)
        if (group && group->admin_state == WCCP_ADMIN_UP)
            wccp_stop_service_group(group);
    return 0;
}

void wccp_start_service_groups_by_interface(wccp_interface *interface) {
    interface->start_count++;
    if (!wccp_if_is_ready(interface))
        return;
    for (wccp_service_group *group = interface->groups; group; group = group->if_next)
        if (group->admin_state == WCCP_ADMIN_UP)
            wccp_start_service_group(group);
}

void wccp_start_waiting_groups(wccp_interface *interface) {
    if (!wccp_if_is_ready(interface))
        return;
    // Running groups are left alone, because a start would make them forget their routers.
    for (wccp_service_group *group = interface->groups; group; group = group->if_next)
        if (group->admin_state == WCCP_ADMIN_UP && !wccp_group_is_running(group))
            wccp_start_service_group(group);
}

void wccp_recover_interface(wccp_interface *interface) {
    if (wccp_retry_network(interface))
        wccp_start_waiting_groups(interface);
    for (wccp_service_group *group = interface->groups; group; group = group->if_next)
        wccp_note_network(group);
}

void wccp_recover_interfaces_due() {
    for (uint32_t i = 0; i < wccp_g.if_count; i++) {
        wccp_interface *interface = &wccp_g.interfaces[i];
        if (interface->network_flaws != 0 &&
            wccp_g.seconds - interface->network_tried >= NETWORK_RETRY_SECONDS &&
            interface_is_needed(interface))
            wccp_recover_interface(interface);
    }
}

void wccp_stop_service_groups_by_interface(wccp_interface *interface) {
    interface->stop_count++;
    for (wccp_service_group *group = interface->groups; group; group = group->if_next)
        if (group->admin_state == WCCP_ADMIN_UP)
            wccp_stop_service_group(group);
}
