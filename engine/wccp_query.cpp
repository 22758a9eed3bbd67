// The queries of the monitoring tree. Each public function takes the engine lock, copies, and releases it.

#include "engine/wccp_query.h"

#include <cstring>

#include "engine/wccp_utils.h"
#include "runtime/common.h"
#include "runtime/logging.h"

namespace {

template <size_t Size>
void copy_text(char (&field)[Size], const char *text) {
    strlcpy(field, text, Size);
}

// The word for a value; "unknown" for a value past the table.
template <size_t Count>
const char *find_word(const char *const (&words)[Count], uint32_t value) {
    return value < Count ? words[value] : "unknown";
}

// The record at a place of a list, counted from 1. If there is none, logs `absent`, a format for group id and
// place.
template <typename T>
T *find_nth_or_log(T *head, uint32_t place, const char *absent, int id) {
    for (uint32_t i = 1; head; head = head->next, i++)
        if (i == place)
            return head;
    QV_LOG(LC_LOG_INFO, absent, id, static_cast<int>(place));
    return nullptr;
}

wccp_service_group *find_group_or_log(int id) {
    wccp_service_group *group = wccp_find_group(id);
    if (!group)
        QV_LOG(LC_LOG_ERR, "WCCP GRP %d: cannot find group", id);
    return group;
}

} // namespace

int wccp_get_grp_list(wccp_grp_list *list) {
    if (!list)
        return 1;
    const wccp_engine_lock lock;
    list->count = 0;
    for (uint32_t id = 0; id < WCCP_MAX_GROUPS; id++)
        if (wccp_g.groups[id])
            list->ids[list->count++] = static_cast<uint8_t>(id);
    return 0;
}

int wccp_get_grp_info(int id, wccp_grp_info *info) {
    // Indexed by the three state bits.
    static constexpr const char *state_words[] = {"not-set", "INIT",    "ACTIVE", "unknown",
                                                  "BACKUP",  "unknown", "uknown", "unknown"};
    if (!info)
        return 1;
    const wccp_engine_lock lock;
    const wccp_service_group *group = find_group_or_log(id);
    if (!group)
        return 1;
    info->appliance_ipa = group->appliance_ipa;
    info->num_routers = group->sending_router_count;
    info->num_appliances = group->appliance_view_count;
    info->num_view_routers = group->router_view_count;
    info->since = wccp_g.seconds - group->start_time;
    info->pending_acks = group->pending_acks;
    // In INIT, state_time still has the time of an earlier state.
    const bool timed = (group->state_flags & (WCCP_STATE_ACTIVE | WCCP_STATE_BACKUP)) != 0;
    info->uptime = timed ? wccp_g.seconds - group->state_time : 0;
    copy_text(info->oper, state_words[group->state_flags & WCCP_STATE_MASK]);
    if (group->designated == 1)
        strlcat(info->oper, ", DESIGNATED", sizeof info->oper);
    return 0;
}

int wccp_get_grp_router_info(int id, wccp_grp_router_info *info) {
    static constexpr const char *method_words[] = {"not set", "GRE", "L2"};
    static constexpr const char *assign_words[] = {"not set", "HASH", "MASK"};
    if (!info)
        return 1;
    const wccp_engine_lock lock;
    const wccp_service_group *group = find_group_or_log(id);
    if (!group)
        return 1;
    const wccp_sending_router *router = find_nth_or_log(group->sending_routers, info->router_num,
                                                        "WCCP GRP %d: Router number %d not present", id);
    // A router that has left since its number was listed is not a failure; the fields stay empty.
    if (!router)
        return 0;
    info->router_id = router->router_id;
    info->src_ipa = router->src_ipa;
    info->conn_time = wccp_g.seconds - router->state_time;
    info->heard = wccp_g.seconds - router->last_icu_time;
    // The methods are the group's: all routers use those that the first one has agreed on.
    const bool agreed = (group->state_flags & WCCP_CAPABILITIES_SET) != 0;
    copy_text(info->fwd, agreed ? find_word(method_words, group->fwd_method) : "not-set");
    copy_text(info->ret, agreed ? find_word(method_words, group->ret_method) : "not-set");
    copy_text(info->assign, agreed ? find_word(assign_words, group->assign_method) : "not-set");
    copy_text(info->state, router->flags & WCCP_RTR_TWO_WAY   ? "TWO-WAY connected"
                           : router->flags & WCCP_RTR_ONE_WAY ? "ONE-WAY connected"
                                                              : "unknown");
    return 0;
}

int wccp_get_grp_appliance_info(int id, wccp_grp_appliance_info *info) {
    if (!info)
        return 1;
    const wccp_engine_lock lock;
    const wccp_service_group *group = wccp_find_group(id);
    // Likewise, a group or an appliance that has left is not a failure.
    if (!group)
        return 0;
    const wccp_view_appliance *appliance = find_nth_or_log(
        group->appliance_view, info->appliance_num, "WCCP GRP %d: appliance number %d not present", id);
    if (!appliance)
        return 0;
    info->ipa = appliance->ipa;
    info->weight = appliance->weight;
    return 0;
}

wccp_sending_router *wccp_find_router_instance(int id, uint32_t router_num) {
    const wccp_service_group *group = wccp_find_group(id);
    if (!group) {
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: find router: cannot find group id %d", id, id);
        return nullptr;
    }
    return find_nth_or_log(group->sending_routers, router_num,
                           "WCCP GRP %d: find router: router number %d not present", id);
}

int wccp_get_router_list(wccp_router_list *list) {
    if (!list)
        return 1;
    const wccp_engine_lock lock;
    const wccp_service_group *group = find_group_or_log(static_cast<int>(list->group_id));
    if (!group)
        return 1;
    // Numbers are places in the list, counted from 1.
    list->count = 0;
    for (const wccp_sending_router *router = group->sending_routers; router && list->count < WCCP_MAX_ROUTERS;
         router = router->next) {
        list->router_nums[list->count] = list->count + 1;
        list->count++;
    }
    return 0;
}

int wccp_get_router_appliance_list(wccp_router_appliance_list *list) {
    if (!list)
        return 1;
    const wccp_engine_lock lock;
    const wccp_sending_router *router =
        wccp_find_router_instance(static_cast<int>(list->group_id), list->router_num);
    if (!router)
        return 1;
    list->count = router->view_appliance_count;
    for (uint32_t i = 0; i < list->count; i++)
        list->ipa[i] = router->view_appliances[i].ipa;
    return 0;
}

int wccp_get_router_appliance_info(wccp_router_appliance_info *info) {
    if (!info)
        return 1;
    const wccp_engine_lock lock;
    const int id = static_cast<int>(info->group_id);
    const wccp_sending_router *router = wccp_find_router_instance(id, info->router_num);
    if (!router)
        return 1;
    for (uint32_t i = 0; i < router->view_appliance_count; i++) {
        const wccp_rtr_view_appliance *appliance = &router->view_appliances[i];
        if (appliance->ipa != info->ipa)
            continue;
        // The total is 0 where neither bits nor values have been read.
        info->load_percent =
            appliance->buckets_total ? appliance->buckets_assigned * 100u / appliance->buckets_total : 0;
        return 0;
    }
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: find appliance: appliance id %s not present in router %d", id,
           addr_text(info->ipa).s, static_cast<int>(info->router_num));
    return 1;
}

// --- Reasons and counters

namespace {

// The table of a group, or with WCCP_NO_GROUP that of packets of no group; null for an unknown group. Lock
// held.
const wccp_reason *find_reason_table(int id, uint32_t *out_places) {
    wccp_service_group *group = id == WCCP_NO_GROUP ? nullptr : wccp_find_group(id);
    return group || id == WCCP_NO_GROUP ? wccp_reasons_of(group, out_places) : nullptr;
}

} // namespace

int wccp_get_reason_list(int id, wccp_reason_list *list) {
    if (!list)
        return 1;
    const wccp_engine_lock lock;
    uint32_t places;
    const wccp_reason *const table = find_reason_table(id, &places);
    if (!table)
        return 1;
    list->count = 0;
    // Places are counted from 1, like the numbers of routers.
    for (uint32_t i = 0; i < places; i++)
        if (wccp_reason_holds(&table[i]))
            list->places[list->count++] = static_cast<uint8_t>(i + 1);
    return 0;
}

int wccp_get_reason(int id, uint32_t place, wccp_reason_info *info) {
    if (!info)
        return 1;
    const wccp_engine_lock lock;
    uint32_t places;
    const wccp_reason *const table = find_reason_table(id, &places);
    if (!table)
        return 1;
    *info = {};
    // A reason that has ended since it was listed is not a failure: the answer then has the code NONE.
    if (place < 1 || place > places || !wccp_reason_holds(&table[place - 1]))
        return 0;
    info->reason = table[place - 1];
    info->first_before = wccp_g.seconds - info->reason.first;
    info->last_before = wccp_g.seconds - info->reason.last;
    return 0;
}

namespace {

constexpr struct {
    const char *word;
    uint32_t wccp_service_group::*member;
} counter_rows[] = {
    {"rx_icus", &wccp_service_group::rx_icus},
    {"rx_icu_failures", &wccp_service_group::rx_icu_failures},
    {"rx_removal_queries", &wccp_service_group::rx_removal_queries},
    {"rx_removal_failures", &wccp_service_group::rx_removal_failures},
    {"rx_failures", &wccp_service_group::rx_failures},
    {"rx_auth_failures", &wccp_service_group::rx_auth_failures},
    {"rx_auth_mismatches", &wccp_service_group::rx_auth_mismatches},
    {"rx_service_mismatches", &wccp_service_group::rx_service_mismatches},
    {"rx_unknown_capabilities", &wccp_service_group::rx_unknown_capabilities},
    {"tx_here_i_am", &wccp_service_group::tx_here_i_am},
    {"tx_redirect_assign", &wccp_service_group::tx_redirect_assign},
    {"tx_removal_replies", &wccp_service_group::tx_removal_replies},
    {"tx_failures", &wccp_service_group::tx_failures},
    {"tx_build_failures", &wccp_service_group::tx_build_failures},
    {"tx_send_errors", &wccp_service_group::tx_send_errors},
    {"tx_link_drops", &wccp_service_group::tx_link_drops},
    {"routers_timed_out", &wccp_service_group::routers_timed_out},
    {"transitions", &wccp_service_group::transitions},
    {"view_changes", &wccp_service_group::change_number},
    {"adjacency_checks", &wccp_service_group::alarm_router_sched},
    {"assignment_checks", &wccp_service_group::alarm_assign_sched},
};

} // namespace

const char *wccp_counter_word(uint32_t index) {
    return index < sizeof counter_rows / sizeof *counter_rows ? counter_rows[index].word : nullptr;
}

uint32_t wccp_read_counter(const wccp_service_group *group, uint32_t index) {
    return group->*counter_rows[index].member;
}

int wccp_get_counter(int id, const char *word, uint32_t *out) {
    if (!word || !out)
        return 1;
    const wccp_engine_lock lock;
    const wccp_service_group *group = wccp_find_group(id);
    for (const auto &row : counter_rows)
        if (group && strcmp(row.word, word) == 0) {
            *out = group->*row.member;
            return 0;
        }
    return 1;
}

int wccp_get_interface_info(uint32_t index, wccp_interface_info *info) {
    if (!info)
        return 1;
    const wccp_engine_lock lock;
    if (index >= wccp_g.if_count)
        return 1;
    const wccp_interface *from = &wccp_g.interfaces[index];
    copy_text(info->name, from->name);
    info->ipa = from->ipa;
    info->link_up = from->link_up;
    info->starts = from->start_count;
    info->stops = from->stop_count;
    info->link_downs = from->link_down_count;
    info->address_changes = from->ipa_change_count;
    return 0;
}
