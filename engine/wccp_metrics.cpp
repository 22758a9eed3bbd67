// Prints the numbers of a group. Lock held, except in wccp_print_metrics.
#include "engine/wccp_metrics.h"

#include "engine/wccp_debug_pieces.h"
#include "engine/wccp_query.h"
#include "engine/wccp_reasons.h"
#include "engine/wccp_utils.h"

namespace {

constexpr struct {
    const char *word;
    uint32_t (*value)(const wccp_service_group *group);
} gauges[] = {
    {"enabled",
     [](const wccp_service_group *group) -> uint32_t { return group->admin_state == WCCP_ADMIN_UP; }},
    {"active",
     [](const wccp_service_group *group) -> uint32_t {
         return (group->state_flags & WCCP_STATE_ACTIVE) != 0;
     }},
    {"designated", [](const wccp_service_group *group) -> uint32_t { return group->designated == 1; }},
    {"uptime_seconds",
     [](const wccp_service_group *group) -> uint32_t {
         // In INIT, state_time still has the time of an earlier state.
         const bool timed = (group->state_flags & (WCCP_STATE_ACTIVE | WCCP_STATE_BACKUP)) != 0;
         return timed ? wccp_g.seconds - group->state_time : 0;
     }},
    {"weight", [](const wccp_service_group *group) -> uint32_t { return group->weight; }},
    {"configured_routers",
     [](const wccp_service_group *group) -> uint32_t { return group->ucast_router_count; }},
    {"routers", [](const wccp_service_group *group) { return group->sending_router_count; }},
    {"appliances", [](const wccp_service_group *group) { return group->appliance_view_count; }},
    {"pending_acks", [](const wccp_service_group *group) -> uint32_t { return group->pending_acks; }},
};

int print_group_numbers(const wccp_service_group *group, wccp_piece *piece) {
    for (const auto &gauge : gauges)
        wccp_piece_add(piece, "gauge %s %u\n", gauge.word, gauge.value(group));
    for (uint32_t i = 0; wccp_counter_word(i); i++)
        wccp_piece_add(piece, "counter %s %u\n", wccp_counter_word(i), wccp_read_counter(group, i));
    return wccp_piece_flush(piece);
}

int print_router_numbers(const wccp_sending_router *router, wccp_piece *piece) {
    // Id, source, two-way, seconds since its I-See-You and its state, buckets of this appliance and of all.
    wccp_piece_add(piece, "router %s %s %d %u %u %u %u\n", addr_text(router->router_id).s,
                   addr_text(router->src_ipa).s, (router->flags & WCCP_RTR_TWO_WAY) != 0,
                   wccp_g.seconds - router->last_icu_time, wccp_g.seconds - router->state_time,
                   router->self_buckets, router->total_buckets);
    return wccp_piece_flush(piece);
}

// Of a group, or for null of no group.
int print_reasons(wccp_service_group *group, wccp_piece *piece) {
    uint32_t places;
    const wccp_reason *const table = wccp_reasons_of(group, &places);
    for (uint32_t i = 0; i < places; i++) {
        if (!wccp_reason_holds(&table[i]))
            continue;
        wccp_piece_add(piece, "reason %s %s %u %u\n", wccp_reason_word(table[i].code),
                       addr_text(table[i].sender).s, table[i].count, wccp_g.seconds - table[i].last);
        WCCP_BAIL_ON_ZERO(wccp_piece_flush(piece));
    }
    return 0;
}

} // namespace

int wccp_print_metrics(int id, csys_display_buf *buffer) {
    if (!buffer)
        return 1;
    const wccp_engine_lock lock;
    wccp_service_group *group = wccp_find_group(id);
    if (!group)
        return 1;
    // The buffer is shared with the assignment text; the lock guards both.
    wccp_piece piece = wccp_assignment_piece(buffer);
    WCCP_BAIL_ON_ZERO(print_group_numbers(group, &piece));
    for (const wccp_sending_router *router = group->sending_routers; router; router = router->next)
        WCCP_BAIL_ON_ZERO(print_router_numbers(router, &piece));
    for (const wccp_view_appliance *member = group->appliance_view; member; member = member->next) {
        wccp_piece_add(&piece, "appliance %s %u\n", addr_text(member->ipa).s, member->weight);
        WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    }
    return print_reasons(group, &piece);
}

int wccp_print_global_metrics(csys_display_buf *buffer) {
    if (!buffer)
        return 1;
    const wccp_engine_lock lock;
    wccp_piece piece = wccp_assignment_piece(buffer);
    wccp_piece_add(&piece,
                   "counter rx_failures %u\ncounter allocations %u\ncounter frees %u\n"
                   "counter allocation_failures %u\n",
                   wccp_g.rx_failures, wccp_g.stat_allocs.load(), wccp_g.stat_frees.load(),
                   wccp_g.stat_alloc_fails.load());
    WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    for (uint32_t i = 0; i < wccp_g.if_count; i++) {
        const wccp_interface *of = &wccp_g.interfaces[i];
        wccp_piece_add(&piece, "interface %.*s %d %u %u %u %u\n", static_cast<int>(sizeof of->name), of->name,
                       of->ready_flags == WCCP_ALL_READY, of->start_count, of->stop_count,
                       of->link_down_count, of->ipa_change_count);
        WCCP_BAIL_ON_ZERO(wccp_piece_flush(&piece));
    }
    return print_reasons(nullptr, &piece);
}
