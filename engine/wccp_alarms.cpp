// Alarms of a service group: the adjacency alarm, for routers that are not two-way connected, and the
// assignment alarm, for routers that do not carry out the assignment.
//
// A bit in raised_alarms shows that an alarm is active. Each alarm has a check on a one-shot timer, which
// runs 60 seconds after the first reason to check; later reasons do not delay it unless they ask to. Nothing
// starts the timer again after the check; alarms of a group in which nothing happens therefore stay as they
// are. A router that is removed, or that stops listing this appliance, raises the adjacency alarm at once.
//
// Callers hold the engine lock, on the timer thread, a receive thread or the main thread. It guards the bits,
// the timers and the buffers below. Messages are sent directly on the alarm session, and nothing waits for an
// answer. A message that cannot be sent is lost: the bit changes nevertheless, and nothing is repeated.
#include "engine/wccp_alarms.h"

#include <cstdio>

#include "engine/wccp_router_utils.h"
#include "engine/wccp_utils.h"
#include "mgmt/node_paths.h"
#include "mgmt/owners.h"
#include "platform/qvcommon_transport.h"
#include "runtime/guards.h"

std::atomic<gcl_session *> qv_alm_mgmt_session;
pthread_mutex_t qv_alm_session_mutex = PTHREAD_MUTEX_INITIALIZER;

namespace {

constexpr uint32_t CHECK_DELAY = 60; // seconds

// --- Scheduling the checks

uint32_t arm_check_timer(wccp_timer *timer, int restart) {
    uint32_t length = CHECK_DELAY;
    if (!restart && timer->active == 1 && timer->countdown != 0)
        length = timer->countdown; // keeps the time of the scheduled check
    *timer = {.active = 1, .mode = WCCP_TIMER_COUNTS, .remaining = 1, .period = length, .countdown = length};
    return length;
}

} // namespace

void wccp_alarm_schedule_verify_router_connectivity_timer(wccp_service_group *group, int restart) {
    const uint32_t length = arm_check_timer(&group->router_alarm_timer, restart);
    group->alarm_router_sched++;
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: alarm: schedule router connectivity verify timer in %d seconds",
           group->id, static_cast<int>(length));
}

void wccp_alarm_schedule_verify_allocation_table_timer(wccp_service_group *group, int restart) {
    const uint32_t length = arm_check_timer(&group->assign_alarm_timer, restart);
    group->alarm_assign_sched++;
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: alarm: schedule assignment table verify timer in %d seconds", group->id,
           static_cast<int>(length));
}

namespace {

// --- Raising and clearing

struct alarm_kind {
    uint16_t bit; // of raised_alarms
    uint32_t type;
    const char *raised;
    const char *cleared;
};
const alarm_kind alarm_kinds[] = {
    {WCCP_ALARM_ADJACENCY, ALARM_TYPE_ADJACENCY, "WCCP GRP %d: alarm: raising adjacency down alarm",
     "WCCP GRP %d: alarm: clearing adjacency down alarm"},
    {WCCP_ALARM_ASSIGNMENT, ALARM_TYPE_ASSIGNMENT,
     "WCCP GRP %d: alarm: raising assignment table mismatch alarm",
     "WCCP GRP %d: alarm: clearing assignment table alarm"},
};
const alarm_kind *find_alarm_kind(uint16_t bit) {
    for (const alarm_kind &kind : alarm_kinds)
        if (kind.bit == bit)
            return &kind;
    return nullptr;
}

// Two texts of the message that is being built. Guarded by the engine lock.
char alarm_param_3[64];
char alarm_comment[64];

// A binding of an event.
struct event_field {
    const char *name;
    uint32_t type;
    const char *text;
};

// Sends an event on the alarm session without waiting for an answer. LC_NULL without a session: at exit it is
// freed before the engine's threads have ended.
template <size_t Count>
lc_status send_event(const char *event, const event_field (&fields)[Count]) {
    // Keeps the session from being freed while the message is sent.
    const mutex_guard guard(&qv_alm_session_mutex);
    if (!qv_alm_mgmt_session)
        return LC_NULL;
    owned_request msg;
    CHECK_QUIET(bn_event_request_msg_create(&msg.pointer, event));
    for (const event_field &field : fields)
        CHECK_QUIET(bn_event_request_msg_append_new_binding(msg.pointer, 0, field.name, field.type,
                                                            field.text, nullptr));
    CHECK_QUIET(bn_request_msg_send(qv_alm_mgmt_session, msg.pointer));
    return LC_OK;
}

void send_alarm(wccp_service_group *group, const alarm_kind *kind, const char *event, const char *text) {
    snprintf(alarm_param_3, sizeof alarm_param_3, "%s:grp:%d",
             group->interfaces[0] ? group->interfaces[0]->name : "", group->id);
    snprintf(alarm_comment, sizeof alarm_comment, text, group->id);
    QV_LOG(LC_LOG_INFO, "%s", alarm_comment);
    char type[16];
    snprintf(type, sizeof type, "%u", kind->type);
    const event_field fields[] = {
        {"alarm_type", bn_type_str, type},       {"param_1", bn_type_str, "0"},
        {"param_2", bn_type_str, "0"},           {"param_3", bn_type_str, alarm_param_3},
        {"comment", bn_type_str, alarm_comment},
    };
    const lc_status status = send_event(event, fields);
    if (status != LC_OK && status != LC_CANCELLED)
        QV_LOG(LC_LOG_ERR, "Error code %d returned", status);
}

void wccp_alarm_raise_alarm(wccp_service_group *group, uint16_t bit) {
    if (const alarm_kind *kind = find_alarm_kind(bit))
        send_alarm(group, kind, EVENT_RAISE_ALARM, kind->raised);
    group->raised_alarms |= bit; // whether or not the message could be sent
}

void wccp_alarm_clear_alarm(wccp_service_group *group, uint16_t bit) {
    if (const alarm_kind *kind = find_alarm_kind(bit))
        send_alarm(group, kind, EVENT_CLEAR_ALARM, kind->cleared);
    group->raised_alarms = static_cast<uint16_t>(group->raised_alarms & ~bit);
}

bool alarm_is_active(const wccp_service_group *group, uint16_t bit) {
    return (group->raised_alarms & bit) != 0;
}

} // namespace

void wccp_alarm_raise_router_down_alarm(wccp_service_group *group) {
    if (!alarm_is_active(group, WCCP_ALARM_ADJACENCY))
        wccp_alarm_raise_alarm(group, WCCP_ALARM_ADJACENCY);
    // The check that can clear the alarm again follows a full delay later.
    wccp_alarm_schedule_verify_router_connectivity_timer(group, 1);
}

void wccp_alarms_clear_all_raised_alarms(wccp_service_group *group) {
    group->router_alarm_timer.active = 0;
    group->assign_alarm_timer.active = 0;
    for (const alarm_kind &kind : alarm_kinds)
        if (alarm_is_active(group, kind.bit))
            wccp_alarm_clear_alarm(group, kind.bit);
}

void wccp_alarms_clear_all() {
    QV_LOG(LC_LOG_INFO, "WCCP: alarms: clearing all alarms.");
    const wccp_engine_lock lock;
    for (wccp_service_group *group = wccp_g.group_list; group; group = group->next)
        if (group->raised_alarms != 0)
            wccp_alarms_clear_all_raised_alarms(group);
}

// Called by the platform's library, which finds it by name, to transmit a state event. `one` is the first
// argument of qv_state_event_send.
int qv_state_event_transport(uint32_t one, const char *group_id, uint32_t role, const uint8_t *code,
                             gcl_session *) {
    char kind_text[12], role_text[12], code_text[12];
    snprintf(kind_text, sizeof kind_text, "%u", one);
    snprintf(role_text, sizeof role_text, "%u", role);
    snprintf(code_text, sizeof code_text, "%u", code ? *code : 0);
    const event_field fields[] = {
        {"kind", bn_type_uint32, kind_text},
        {"group", bn_type_str, group_id},
        {"role", bn_type_uint32, role_text},
        {"code", bn_type_uint32, code_text},
    };
    return send_event(EVENT_ROLE_CHANGE, fields) == LC_OK ? 0 : 1;
}

// --- The checks

int wccp_alarm_verify_router_connectivity(wccp_service_group *group) {
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: alarm: verify router connectivity.", group->id);
    uint32_t one_way, two_way;
    if (wccp_get_router_connection_stats(group, &one_way, &two_way)) {
        QV_LOG(LC_LOG_ERR, "WCCP GRP %d: alarm: get router connnection stats failed.", group->id);
        return 1;
    }
    // How many routers answer a multicast address is not known.
    const uint32_t expected = group->mcast_configured == 1 ? 1 : group->ucast_router_count;
    const bool healthy = one_way == 0 && two_way >= expected;
    // An alarm is sent only when it changes.
    const bool raised = alarm_is_active(group, WCCP_ALARM_ADJACENCY);
    if (healthy && raised) {
        QV_LOG(LC_LOG_INFO,
               "WCCP GRP %d: alarm: clearing router down alarm: routers one-way: %d two-way: %d configured: "
               "%d.",
               group->id, static_cast<int>(one_way), static_cast<int>(two_way), static_cast<int>(expected));
        wccp_alarm_clear_alarm(group, WCCP_ALARM_ADJACENCY);
    } else if (!healthy && !raised) {
        QV_LOG(
            LC_LOG_INFO,
            "WCCP GRP %d: alarm: raising router down alarm. routers configured: %d connections one-way: %d "
            "two-way: %d",
            group->id, static_cast<int>(expected), static_cast<int>(one_way), static_cast<int>(two_way));
        wccp_alarm_raise_alarm(group, WCCP_ALARM_ADJACENCY);
    } else if (healthy) {
        QV_LOG(LC_LOG_INFO,
               "WCCP GRP %d: alarm: router verification is ok. configured: %d one-way: %d two-way: %d",
               group->id, static_cast<int>(expected), static_cast<int>(one_way), static_cast<int>(two_way));
    }
    return 0;
}

namespace {

bool lacks_its_share(const wccp_rtr_view_appliance *entry) {
    return entry->buckets_assigned == 0 && entry->weight != 0; // weight 0 asks for nothing
}

// Notes how much a router assigns to an appliance, or with 0.0.0.0 to all of them, and what was expected.
// `wanted` 1 means any amount.
void note_assignment_difference(wccp_service_group *group, const wccp_sending_router *router, be32 appliance,
                                uint32_t has, uint32_t wanted) {
    const wccp_addr_text who = addr_text(appliance);
    wccp_note_reason(group, WCCP_REASON_ASSIGNMENT_DIFFERS, router->router_id,
                     wccp_reason_value("%u buckets for %s", has, is_zero(appliance) ? "anybody" : who.s),
                     wanted == 1 ? wccp_reason_value("some") : wccp_reason_value("%u", wanted));
}

// For the designated appliance: compares its table with what each router reports.
bool routers_use_our_table(wccp_service_group *group) {
    for (uint32_t i = 0; i < WCCP_MAX_APPLIANCES; i++) {
        const wccp_dsg_appliance *asked = &group->dsg_appliances[i];
        // Entries that are not in use have 0 slots.
        if (asked->assigned == 0)
            continue;
        for (wccp_sending_router *router = group->sending_routers; router; router = router->next) {
            uint32_t buckets = 0; // also for a router that does not list the appliance
            wccp_get_router_assignment(group, router, asked->ipa, &buckets);
            QV_LOG(LC_LOG_INFO,
                   "WCCP GRP %d: alarm: verify allocation. appliance %s buckets dsg: %d router %s %d",
                   group->id, addr_text(asked->ipa).s, asked->assigned, addr_text(router->router_id).s,
                   static_cast<int>(buckets));
            if (buckets == asked->assigned)
                continue;
            QV_LOG(LC_LOG_WARNING,
                   "WCCP GRP %d: alarm: allocation mismatch. appliance %s buckets dsg: %d router %s %d",
                   group->id, addr_text(asked->ipa).s, asked->assigned, addr_text(router->router_id).s,
                   static_cast<int>(buckets));
            note_assignment_difference(group, router, asked->ipa, buckets, asked->assigned);
            return false;
        }
    }
    // The loop above has not compared appliances that the table leaves out.
    for (const wccp_sending_router *router = group->sending_routers; router; router = router->next) {
        for (uint32_t i = 0; i < router->view_appliance_count; i++) {
            const wccp_rtr_view_appliance *entry = &router->view_appliances[i];
            if (!lacks_its_share(entry))
                continue;
            QV_LOG(LC_LOG_WARNING,
                   "WCCP GRP %d: alarm: allocation mismatch. appliance %s weight : %d router %s buckets : %d",
                   group->id, addr_text(entry->ipa).s, entry->weight, addr_text(router->router_id).s,
                   entry->buckets_assigned);
            note_assignment_difference(group, router, entry->ipa, 0, 1);
            return false;
        }
    }
    return true;
}

// For any other appliance: whether each router redirects to every appliance that has a weight.
bool routers_redirect_without_holes(wccp_service_group *group) {
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: alarm: verify by non-designator.", group->id);
    for (const wccp_sending_router *router = group->sending_routers; router; router = router->next) {
        bool redirects = false;
        for (uint32_t i = 0; i < router->view_appliance_count; i++) {
            const wccp_rtr_view_appliance *entry = &router->view_appliances[i];
            redirects |= entry->buckets_assigned != 0;
            if (!lacks_its_share(entry))
                continue;
            QV_LOG(LC_LOG_WARNING,
                   "WCCP GRP %d: alarm: router %s is not redirecting to appliance (%s weight %d)", group->id,
                   addr_text(router->router_id).s, addr_text(entry->ipa).s, entry->weight);
            note_assignment_difference(group, router, entry->ipa, 0, 1);
            return false;
        }
        if (!redirects) { // also a router that lists no appliances
            QV_LOG(LC_LOG_WARNING, "WCCP GRP %d: alarm: router %s is not redirecting to ANY appliance.",
                   group->id, addr_text(router->router_id).s);
            note_assignment_difference(group, router, {}, 0, 1);
            return false;
        }
    }
    return true;
}

} // namespace

int wccp_alarms_verify_allocation_table(wccp_service_group *group) {
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: alarm: verify assignment table.", group->id);
    const bool in_order =
        group->designated == 1 ? routers_use_our_table(group) : routers_redirect_without_holes(group);
    const bool raised = alarm_is_active(group, WCCP_ALARM_ASSIGNMENT);
    wccp_forget_older_reasons(group, WCCP_REASON_ASSIGNMENT_DIFFERS); // those of this check stay
    if (in_order && raised)
        wccp_alarm_clear_alarm(group, WCCP_ALARM_ASSIGNMENT);
    else if (!in_order && !raised)
        wccp_alarm_raise_alarm(group, WCCP_ALARM_ASSIGNMENT);
    return 0;
}
