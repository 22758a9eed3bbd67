// The timers of a group, the election of the designated appliance, and the state of this appliance with its
// role.
//
// The timer thread calls wccp_process_timers once a second for each enabled group and holds the engine lock
// for the whole tick. There is no other clock. The table of steps at the end lists what a tick does, in
// order. A step that fails is logged and the next one runs: a message that could not be sent is sent again
// after its period, and an election that selected nobody waits for the next change of a view.
//
// The election exchanges no messages. Every appliance applies the same rule to the same views: the appliance
// with the lowest address is designated, provided that every router that any router reports is two-way
// connected. Being designated and being ACTIVE are independent of each other.
//
// The state functions run in a tick or on a receive thread. Each entry into a state passes its role on to the
// policy groups and sends a state event, even if the role has not changed. During the exit the role is still
// passed on, but no event is sent.
#include "engine/wccp_state.h"

#include <cstdio>

#include "engine/wccp_alarms.h"
#include "engine/wccp_assignment.h"
#include "engine/wccp_complaints.h"
#include "engine/wccp_host.h"
#include "engine/wccp_pkt_mgr.h"
#include "engine/wccp_router_utils.h"
#include "engine/wccp_utils.h"
#include "engine/wccp_view_utils.h"
#include "engine/wccp_wire.h"
#include "engine/wccpd_common.h"
#include "platform/qvcommon.h"

namespace {

// Seconds.
constexpr uint32_t ASSIGN_PERIOD = 10;
constexpr uint32_t ASSIGN_DELAY_ELECTION = 16; // until the routers' views have settled
constexpr uint32_t ASSIGN_DELAY_WEIGHT_CHANGE = 1;
constexpr uint32_t LEFT_OUT_LOG_PERIOD = 60;

} // namespace

// --- The state

int wccp_set_role_and_send_event(uint8_t id, uint32_t role) {
    static const uint8_t event_code = 237; // passed by reference to the platform's library
    const int result = wccp_set_role(id, role);
    if (wccpd_shutdown_in_progress() == 1) // the alarm session is closed, or about to be
        return result;
    char text[8];
    snprintf(text, sizeof text, "%d", id);
    if (role > WCCP_ROLE_UNKNOWN)
        return 1;
    qv_state_event_send(1, text, role, &event_code, qv_alm_mgmt_session);
    return result;
}

namespace {

void set_only_state(wccp_service_group *group, uint32_t state) {
    group->state_flags = (group->state_flags & ~WCCP_STATE_MASK) | state;
}

} // namespace

int wccp_appliance_state_init(wccp_service_group *group) {
    // Unlike the other states, INIT is not entered again: removing the last router may ask for it twice.
    if (group->state_flags & WCCP_STATE_INIT)
        return 0;
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: appliance state : INIT", group->id);
    wccp_set_role_and_send_event(group->id, WCCP_ROLE_BACKUP); // there is no role for INIT
    set_only_state(group, WCCP_STATE_INIT);
    return 0;
}

int wccp_appliance_state_active(wccp_service_group *group) {
    if (group->state_flags & WCCP_STATE_ACTIVE) // unexpected, but the entry is carried out again
        QV_LOG(LC_LOG_WARNING, "WCCP GRP %d: is already ACTIVE.", group->id);
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: appliance state : ACTIVE", group->id);
    wccp_set_role_and_send_event(group->id, WCCP_ROLE_ACTIVE);
    group->transitions++;
    set_only_state(group, WCCP_STATE_ACTIVE);
    group->state_time = wccp_g.seconds;
    return 0;
}

int wccp_appliance_state_backup(wccp_service_group *group) {
    if (group->state_flags & WCCP_STATE_BACKUP)
        QV_LOG(LC_LOG_WARNING, "WCCP GRP %d: is already BACKUP", group->id);
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: appliance state : BACKUP", group->id);
    wccp_set_role_and_send_event(group->id, WCCP_ROLE_BACKUP);
    group->transitions++;
    set_only_state(group, WCCP_STATE_BACKUP);
    group->state_time = wccp_g.seconds;
    return 0;
}

// --- The assignment that the designated appliance sends

void wccp_clear_redirect_assign_states(wccp_service_group *group) {
    group->assign_timer.active = 0;
    group->pending_acks = 0;
    wccp_forget_reasons(group, WCCP_REASON_NOT_ACKNOWLEDGED);
    for (wccp_sending_router *router = group->sending_routers; router; router = router->next) {
        router->flags &= ~WCCP_RTR_ASSIGN_UNACKED;
        router->assign_tx_count = 0;
    }
}

namespace {

// Adds the appliances that all routers list to the assignment. Outputs how many are left out, and how many of
// these have been logged before.
void collect_eligible_appliances(wccp_service_group *group, uint32_t *out_left_out, uint32_t *out_logged) {
    *out_left_out = *out_logged = 0;
    for (wccp_view_appliance *entry = group->appliance_view; entry; entry = entry->next) {
        if (wccp_appliance_is_reported_by_all_senders(group, entry->ipa)) {
            entry->listing = WCCP_LISTED_BY_ALL;
            wccp_designated_appliance_assignment_add(group, entry);
            continue;
        }
        if (entry->listing == WCCP_LISTED_BY_ALL) // NOT_LISTED_LOGGED stays as it is
            entry->listing = WCCP_NOT_LISTED_BY_ALL;
        wccp_note_reason(group, WCCP_REASON_APPLIANCE_LEFT_OUT, entry->ipa,
                         wccp_reason_value("%u", entry->ref_count),
                         wccp_reason_value("%u", group->sending_router_count));
        ++*out_left_out;
        *out_logged += entry->listing == WCCP_NOT_LISTED_LOGGED;
    }
    wccp_forget_older_reasons(group, WCCP_REASON_APPLIANCE_LEFT_OUT);
}

// One I-See-You can cause 32 computations, each of which can leave out a thousand appliances. Therefore an
// appliance that is left out is logged once. All of them are logged again when their set changes, at most
// once a second, and otherwise every minute.
void log_appliances_left_out(wccp_service_group *group, uint32_t left_out, uint32_t logged) {
    // The first test finds new appliances in the set, the second one those that have left it.
    const bool changed = logged != left_out || logged != group->not_listed_count;
    const uint32_t age = wccp_g.seconds - group->not_listed_time;
    const bool again = age >= LEFT_OUT_LOG_PERIOD || (changed && age != 0);
    group->not_listed_count = left_out;
    if (again)
        group->not_listed_time = wccp_g.seconds;
    else if (logged == left_out)
        return;
    for (wccp_view_appliance *entry = group->appliance_view; entry; entry = entry->next) {
        const bool due =
            entry->listing == WCCP_NOT_LISTED_BY_ALL || (again && entry->listing == WCCP_NOT_LISTED_LOGGED);
        if (!due)
            continue;
        WCCP_COMPLAIN(
            LC_LOG_WARNING,
            "WCCP GRP %d: DSG event: NO redirect. appliance (ipa  %s weight %d) is not in all sending "
            "router views). CHECK configuration.",
            group->id, addr_text(entry->ipa).s, entry->weight);
        entry->listing = WCCP_NOT_LISTED_LOGGED;
    }
}

} // namespace

int wccp_update_designated_redirect_assignment(wccp_service_group *group, int reason) {
    if (group->designated != 1) {
        QV_LOG(LC_LOG_WARNING,
               "WCCP GRP %d: DSG event: redirect assign  ignored. appliance is not the designated.",
               group->id);
        return 0;
    }
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: DSG event: redirect assign selection", group->id);
    wccp_designated_appliance_assignment_start(group);
    uint32_t left_out, logged;
    collect_eligible_appliances(group, &left_out, &logged);
    log_appliances_left_out(group, left_out, logged);
    wccp_designated_appliance_assignment_finish(group);
    if (group->dsg_active_count == 0) {
        WCCP_COMPLAIN(LC_LOG_WARNING,
                      "WCCP GRP %d: DSG event: NO redirect eligible appliances. CHECK configuration.",
                      group->id);
        wccp_designated_appliance_assignment_cleanup(group);
        return 1;
    }
    group->dsg_key_change++; // the routers report it when they have the new table
    // At most 32, so that the 8 bits suffice.
    group->pending_acks = static_cast<uint8_t>(group->sending_router_count & 0xff);
    for (wccp_sending_router *router = group->sending_routers; router; router = router->next) {
        router->flags |= WCCP_RTR_ASSIGN_UNACKED;
        router->assign_tx_count = 0;
    }
    QV_LOG(LC_LOG_INFO,
           "WCCP GRP %d: DSG event: redirect SELECTED. active appliances %d ICU TX routers %u redirect "
           "assignment key 0x%x",
           group->id, static_cast<int>(group->dsg_active_count), group->sending_router_count,
           group->dsg_key_change);
    group->assign_timer = {
        .active = 1,
        .mode = WCCP_TIMER_REPEATS,
        .remaining = 0,
        .period = ASSIGN_PERIOD,
        .countdown =
            reason == WCCP_ASSIGN_AFTER_ELECTION ? ASSIGN_DELAY_ELECTION : ASSIGN_DELAY_WEIGHT_CHANGE,
    };
    return 0;
}

// --- The election

namespace {

bool all_routers_are_two_way(wccp_service_group *group) {
    bool all = true;
    // router_view also has the routers that other routers report and that have sent nothing themselves.
    for (const wccp_view_router *entry = group->router_view; entry; entry = entry->next) {
        const wccp_sending_router *router = wccp_find_sending_router(group, entry->ipa);
        if (router && router->flags & WCCP_RTR_TWO_WAY)
            continue;
        all = false; // continue, so that a reason is noted for each of them
        wccp_note_reason(group, WCCP_REASON_ELECTION_BLOCKED, entry->ipa,
                         wccp_reason_value("%s", router ? "one-way" : "no I-See-You"),
                         wccp_reason_value("two-way"));
    }
    wccp_forget_older_reasons(group, WCCP_REASON_ELECTION_BLOCKED);
    return all;
}

bool has_lower_appliance(const wccp_service_group *group) {
    const uint32_t own = to_host(group->appliance_ipa); // compared as numbers, therefore in host order
    for (const wccp_view_appliance *entry = group->appliance_view; entry; entry = entry->next)
        if (to_host(entry->ipa) < own)
            return true;
    return false;
}

int wccp_elect_designated_appliance(wccp_service_group *group) {
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: DSG event: new designated selection.", group->id);
    group->state_flags &= ~WCCP_DESG_ELECT_PENDING;
    const uint32_t was_designated = group->designated;
    group->designated = 0; // until this election has selected this appliance again
    wccp_forget_reasons(group, WCCP_REASON_APPLIANCE_LEFT_OUT);
    wccp_clear_redirect_assign_states(group);
    // Postponed: the routers need time to adopt a new table.
    wccp_alarm_schedule_verify_allocation_table_timer(group, 1);
    // No timer repeats an election: the next change of a view requests another one.
    if (group->appliance_view_count == 0) {
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: DSG event: appliance view is empty. try later.", group->id);
        return 0;
    }
    if (!all_routers_are_two_way(group)) {
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: DSG event: not selected (no ICUs)", group->id);
        return 0;
    }
    if (has_lower_appliance(group)) {
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: DSG event: not selected (not the lowest ipa %s)", group->id,
               addr_text(group->appliance_ipa).s);
        return 0;
    }
    group->designated = 1;
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: DSG event: DSG SELECTED (%s) dsg key : 0x%x", group->id,
           addr_text(group->appliance_ipa).s, group->dsg_key_change);
    if (was_designated == 0) // key numbers start again at 1
        wccp_clear_assignment_block(group);
    // Without an appliance to redirect to it stays designated and waits for the next change of a view.
    wccp_update_designated_redirect_assignment(group, WCCP_ASSIGN_AFTER_ELECTION);
    return 0;
}

// --- The tick

// A step is due when its timer expires, or if it has no timer, when `pending` returns true. `words` is the
// log line's name of the step; null for a step that cannot fail.
struct tick_step {
    wccp_timer wccp_service_group::*timer;
    bool (*pending)(const wccp_service_group *group);
    const char *words;
    int (*action)(wccp_service_group *group);
};

const tick_step tick_steps[] = {
    {nullptr, [](const wccp_service_group *group) { return group->removal_reply_count != 0; },
     "sending Router Query Reply", wccp_send_router_removal_query_reply},
    {&wccp_service_group::hia_timer, nullptr, "sending HERE_I_AM ",
     [](wccp_service_group *group) { return wccp_transmit_packet(group, group->tx_pkt, WCCP_HERE_I_AM); }},
    {nullptr,
     [](const wccp_service_group *group) { return (group->state_flags & WCCP_DESG_ELECT_PENDING) != 0; },
     nullptr, wccp_elect_designated_appliance},
    {&wccp_service_group::assign_timer, nullptr, "sending REDIRECT ASSGN",
     [](wccp_service_group *group) {
         return wccp_transmit_packet(group, group->tx_pkt, WCCP_REDIRECT_ASSIGN);
     }},
    // A router that this step removes requests an election, which is held in the next tick.
    {&wccp_service_group::monitor_timer, nullptr, "monitor sending routers", wccp_monitor_sending_routers},
    {&wccp_service_group::router_alarm_timer, nullptr, "alarm verify routers",
     wccp_alarm_verify_router_connectivity},
    {&wccp_service_group::assign_alarm_timer, nullptr, "alarm assignment mismatch",
     wccp_alarms_verify_allocation_table},
};

bool count_down_timer(wccp_timer *timer) {
    if (timer->active != 1)
        return false;
    // A countdown of 0 expires like one of 1: in this tick.
    if (timer->countdown > 1) {
        timer->countdown--;
        return false;
    }
    timer->countdown = timer->period;
    if (timer->mode == WCCP_TIMER_COUNTS) { // the last expiry runs the action, too
        if (timer->remaining != 0)
            timer->remaining--;
        if (timer->remaining == 0)
            timer->active = 0;
    }
    return true;
}

} // namespace

int wccp_process_timers(wccp_service_group *group) {
    for (const tick_step &step : tick_steps) {
        // Timers count down as their turn comes: one that an earlier step has set counts this tick already.
        const bool due = step.timer ? count_down_timer(&(group->*step.timer)) : step.pending(group);
        if (due && step.action(group) && step.words)
            QV_LOG(LC_LOG_ERR, "WCCP GRP %u: %s failed.", group->id, step.words);
    }
    return 0;
}
