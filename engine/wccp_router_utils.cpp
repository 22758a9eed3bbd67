// Sending routers: the routers from which a group has accepted an I-See-You.
//
// A record is created by a router's first I-See-You if its capabilities can be agreed. It lives until the
// router has sent none for 40 seconds or the group stops. The first router decides the group's forwarding,
// assignment and return methods; they stay in force until the last router is removed. The records belong to
// the group's list, as do the replies to Removal Queries, each a finished message with the number of its
// remaining transmissions. The number of queued replies is limited for each router.
//
// The engine lock is held throughout: by a receive thread for the creation, the capability decision and
// queries, by the timer thread for timeouts and replies. Creating and removing a router that uses GRE can
// wait for tunneld. Nothing here reads a message; views change only when a router that timed out drops its
// references.
#include "engine/wccp_router_utils.h"

#include "engine/wccp_alarms.h"
#include "engine/wccp_complaints.h"
#include "engine/wccp_pkt_mgr.h"
#include "engine/wccp_state.h"
#include "engine/wccp_tunnel.h"
#include "engine/wccp_utils.h"
#include "engine/wccp_view_utils.h"
#include "engine/wccp_wire.h"
#include "runtime/guards.h"
#include "runtime/list.h"

namespace {

constexpr uint32_t ROUTER_HOLD_SECONDS = 40; // without an I-See-You
constexpr uint8_t REPLY_TRANSMISSIONS = 3;
// For each router. A reply holds a packet of 4 KiB for three seconds, and anybody can send queries. With a
// limit for each router, forged queries of one router cannot keep the queries of others from being answered.
constexpr uint32_t MAX_REPLIES_WAITING = 8;

void free_router(wccp_sending_router *router) {
    wccp_free(router);
}
void free_reply(wccp_removal_reply *reply) {
    wccp_free(reply);
}

} // namespace

wccp_sending_router *wccp_find_sending_router(wccp_service_group *group, be32 router_id) {
    for (wccp_sending_router *router = group->sending_routers; router; router = router->next)
        if (router->router_id == router_id)
            return router;
    return nullptr;
}

namespace {

// --- The capability decision

using capabilities = wccp_rtr_capabilities;

// One of the three methods to agree on: its member, the code that is chosen when both sides support either,
// and what is returned, noted and logged when they have none in common.
struct capability_step {
    uint32_t capabilities::*word;
    uint32_t (*preferred)(const capabilities *agreed);
    int refusal;
    wccp_reason_code reason;
    const char *(*name)(uint32_t code);
    void (*complain)(int group, be32 router_id, const capabilities *local, const capabilities *offered);
};

// The low two bits of an offer, a bit set, have the same values as the method codes: 3 is either.
uint32_t get_offered_method(uint32_t word) {
    return word & WCCP_METHOD_EITHER;
}

const capability_step capability_steps[] = {
    {&capabilities::forwarding, [](const capabilities *) -> uint32_t { return WCCP_METHOD_L2; }, 0,
     WCCP_REASON_FORWARDING_NOT_OFFERED, wccp_method_name,
     [](int group, be32 router_id, const capabilities *local, const capabilities *offered) {
         WCCP_COMPLAIN(
             LC_LOG_WARNING,
             "WCCP GRP %d: incompatible capabilities (router id %s) : local: (fwd encap: %s ) router sent: "
             "(fwd: %s return: %s)",
             group, addr_text(router_id).s, wccp_method_name(local->forwarding),
             wccp_method_name(get_offered_method(offered->forwarding)),
             wccp_method_name(get_offered_method(offered->ret)));
     }},
    // With L2 forwarding mask is preferred, with GRE hash.
    {&capabilities::assignment,
     [](const capabilities *agreed) -> uint32_t {
         return agreed->forwarding == WCCP_METHOD_L2 ? WCCP_ASSIGN_MASK : WCCP_ASSIGN_HASH;
     },
     0, WCCP_REASON_ASSIGNMENT_NOT_OFFERED, wccp_assign_method_name,
     [](int group, be32 router_id, const capabilities *local, const capabilities *offered) {
         WCCP_COMPLAIN(
             LC_LOG_WARNING,
             "WCCP GRP %d: incompatible capabilities (router id %s) : local assign method: %s  router "
             "assign method: %s",
             group, addr_text(router_id).s, wccp_assign_method_name(local->assignment),
             wccp_assign_method_name(get_offered_method(offered->assignment)));
     }},
    {&capabilities::ret, [](const capabilities *) -> uint32_t { return WCCP_METHOD_GRE; }, 1,
     WCCP_REASON_RETURN_NOT_OFFERED, wccp_method_name,
     [](int group, be32 router_id, const capabilities *local, const capabilities *offered) {
         WCCP_COMPLAIN(
             LC_LOG_WARNING,
             "WCCP GRP %d: incompatible capabilities (router id %s) : local return method: %s  router "
             "return method: %s",
             group, addr_text(router_id).s, wccp_method_name(local->ret),
             wccp_method_name(get_offered_method(offered->ret)));
     }},
};

// The code that both sides support, 0 for none.
uint32_t choose_common_method(uint32_t local, uint32_t offered, uint32_t preferred) {
    if (local > WCCP_METHOD_EITHER) // not a valid configuration
        return WCCP_METHOD_NONE;
    const uint32_t common = local & get_offered_method(offered);
    return common == WCCP_METHOD_EITHER ? preferred : common;
}

} // namespace

int wccp_process_router_capabilities(wccp_service_group *group, be32 router_id,
                                     const wccp_rtr_capabilities *offered, wccp_rtr_capabilities *out_agreed,
                                     uint32_t *out_compatible) {
    *out_compatible = 0;
    *out_agreed = {};
    // The return method is not configurable.
    const capabilities configured = {group->cfg_fwd_method, group->cfg_assign_method, WCCP_METHOD_EITHER};
    const capabilities in_force = {group->fwd_method, group->assign_method, group->ret_method};
    // Once the first router has decided, the configuration no longer matters.
    const capabilities *local = group->state_flags & WCCP_CAPABILITIES_SET ? &in_force : &configured;
    capabilities agreed = {};
    // The order matters: which assignment is preferred depends on the forwarding agreed before.
    for (const capability_step &step : capability_steps) {
        agreed.*step.word =
            choose_common_method(local->*step.word, offered->*step.word, step.preferred(&agreed));
        if (agreed.*step.word == WCCP_METHOD_NONE) {
            step.complain(group->id, router_id, local, offered);
            wccp_note_reason(group, step.reason, router_id,
                             wccp_reason_value("%s", step.name(get_offered_method(offered->*step.word))),
                             wccp_reason_value("%s", step.name(local->*step.word)));
            return step.refusal;
        }
    }
    *out_agreed = agreed;
    *out_compatible = 1;
    return 0;
}

void wccp_check_offered_methods(wccp_service_group *group, be32 router_id,
                                const wccp_rtr_capabilities *offered) {
    const capabilities in_force = {group->fwd_method, group->assign_method, group->ret_method};
    // Only noted: a router that has a record keeps it, whatever it offers later.
    for (const capability_step &step : capability_steps)
        if (in_force.*step.word != WCCP_METHOD_NONE && (in_force.*step.word & offered->*step.word) == 0)
            wccp_note_reason(group, step.reason, router_id,
                             wccp_reason_value("%s", step.name(get_offered_method(offered->*step.word))),
                             wccp_reason_value("%s", step.name(in_force.*step.word)));
}

wccp_sending_router *wccp_create_sending_router(wccp_service_group *group, be32 router_id,
                                                const wccp_rtr_capabilities *offered,
                                                const wccp_rtr_capabilities *agreed) {
    if (is_zero(router_id)) {
        WCCP_COMPLAIN(LC_LOG_WARNING, "WCCP GRP %d: invalid router id in ICU. 0.0.0.0", group->id);
        wccp_note_reason(group, WCCP_REASON_ROUTER_ID_ZERO, {}, {}, {});
        return nullptr;
    }
    if (group->sending_router_count >= WCCP_MAX_ROUTERS) {
        WCCP_COMPLAIN(LC_LOG_WARNING, "WCCP GRP %d: Router Maximum (%d) reached", group->id,
                      static_cast<int>(WCCP_MAX_ROUTERS));
        wccp_note_reason(group, WCCP_REASON_ROUTERS_EXHAUSTED, router_id, {},
                         wccp_reason_value("%u routers at most", WCCP_MAX_ROUTERS));
        return nullptr;
    }
    owned<wccp_sending_router, free_router> made(
        static_cast<wccp_sending_router *>(wccp_malloc(sizeof(wccp_sending_router))));
    if (!made.pointer) {
        QV_LOG(LC_LOG_ERR, "WCCP GRP %d: sending router creation failed. router id %s ", group->id,
               addr_text(router_id).s);
        wccp_note_reason(group, WCCP_REASON_NO_MEMORY, router_id, wccp_reason_value("its record"), {});
        return nullptr;
    }
    uint32_t flags = WCCP_RTR_ONE_WAY;
    // Packets that are returned in GRE need a tunnel even if they arrive by L2.
    if (agreed->forwarding == WCCP_METHOD_GRE || agreed->ret == WCCP_METHOD_GRE) {
        if (wccp_add_tunnel(group->id, group->appliance_ipa, router_id))
            return nullptr; // the router's next I-See-You tries again
        flags |= WCCP_RTR_HAS_TUNNEL;
    }
    wccp_sending_router *router = made.take();
    router->router_id = router_id;
    router->flags = flags;
    router->state_time = wccp_g.seconds;
    // Kept for the dumps; decisions use the agreed methods of the group.
    router->cap_fwd = static_cast<uint8_t>(offered->forwarding & 0xff);
    router->cap_assign = static_cast<uint8_t>(offered->assignment & 0xff);
    router->cap_ret = static_cast<uint8_t>(offered->ret & 0xff);
    group->sending_router_count++;
    list_push_head(&group->sending_routers, router);
    if (!(group->state_flags & WCCP_CAPABILITIES_SET)) {
        group->fwd_method = agreed->forwarding;
        group->assign_method = agreed->assignment;
        group->ret_method = agreed->ret;
        group->state_flags |= WCCP_CAPABILITIES_SET;
        QV_LOG(LC_LOG_INFO,
               "WCCP GRP %d: agreed capabilities: fwd: %d assign: %d return: %d deciding rtr id %s",
               group->id, static_cast<int>(group->fwd_method), static_cast<int>(group->assign_method),
               static_cast<int>(group->ret_method), addr_text(router_id).s);
    }
    wccp_alarm_schedule_verify_router_connectivity_timer(group, 0);
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: created ICU sending router %s ", group->id, addr_text(router_id).s);
    return router;
}

namespace {

// --- Timeouts

void drop_view_references(wccp_service_group *group, wccp_sending_router *router) {
    for (uint32_t i = 0; i < router->view_router_count; i++)
        wccp_remove_router_from_view_list(group, router->view_routers[i].ipa);
    router->view_router_count = 0;
    for (uint32_t i = 0; i < router->view_appliance_count; i++)
        wccp_remove_appliance_from_view_list(group, router->view_appliances[i].ipa);
    router->view_appliance_count = 0;
}

void remove_silent_router(wccp_service_group *group, wccp_sending_router *router) {
    list_unlink(router); // so that the functions below do not find it; sending_router_count still counts it
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: removing router (router id: %s) due to inactivity.", group->id,
           addr_text(router->router_id).s);
    // Before the record is freed: its arrays are the only list of the references that it holds.
    drop_view_references(group, router);
    if (router->flags & WCCP_RTR_HAS_TUNNEL)
        wccp_del_tunnel(group->id, group->appliance_ipa, router->router_id, 0);
    if (group->sending_router_count == 1) { // it was the last one: the next router decides again
        group->fwd_method = WCCP_METHOD_NONE;
        group->assign_method = WCCP_ASSIGN_NONE;
        group->ret_method = WCCP_METHOD_NONE;
        wccp_appliance_state_init(group);
        group->state_flags &= ~WCCP_CAPABILITIES_SET;
        wccp_forget_reasons(group, WCCP_REASON_RESTART_NEEDED);
    }
    if (router->self_buckets != 0) { // it redirected to this appliance
        if (group->redirecting_routers != 0)
            group->redirecting_routers--;
        if (group->redirecting_routers == 0)
            wccp_appliance_state_init(group);
    }
    // Even if no reference was the last one, a router that has left is a change of the view.
    group->change_number++;
    group->state_flags |= WCCP_DESG_ELECT_PENDING;
    group->sending_router_count--;
    wccp_free(router);
}

} // namespace

int wccp_monitor_sending_routers(wccp_service_group *group) {
    wccp_sending_router *next;
    for (wccp_sending_router *router = group->sending_routers; router; router = next) {
        next = router->next;
        if (wccp_g.seconds - router->last_icu_time < ROUTER_HOLD_SECONDS)
            continue;
        const be32 id = router->router_id; // the record is freed
        remove_silent_router(group, router);
        wccp_alarm_raise_router_down_alarm(group);
        group->routers_timed_out++;
        wccp_note_reason(group, WCCP_REASON_ROUTER_SILENT, id, {},
                         wccp_reason_value("an I-See-You within %u s", ROUTER_HOLD_SECONDS));
    }
    return 0;
}

// --- Removal Queries

namespace {

uint32_t count_waiting_replies(const wccp_service_group *group, be32 router_id) {
    uint32_t count = 0;
    for (const wccp_removal_reply *reply = group->removal_replies; reply; reply = reply->next)
        count += reply->pkt.ipa == router_id;
    return count;
}

} // namespace

int wccp_process_router_removal_query(wccp_service_group *group, be32 router_id, be32 receive_id) {
    wccp_sending_router *router = wccp_find_sending_router(group, router_id);
    if (!router) {
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: removal query request. cannot find router. (router id %s)",
               group->id, addr_text(router_id).s);
        wccp_note_reason(group, WCCP_REASON_QUERY_REFUSED, router_id,
                         wccp_reason_value("a query before an I-See-You"), {});
        return 0;
    }
    if (!(router->flags & WCCP_RTR_TWO_WAY)) {
        QV_LOG(LC_LOG_INFO,
               "WCCP GRP %d: removal query request. router (router id %s) is not 2-way connected. igoring "
               "request",
               group->id, addr_text(router_id).s);
        wccp_note_reason(group, WCCP_REASON_QUERY_REFUSED, router_id,
                         wccp_reason_value("a query of a one-way router"), {});
        return 0;
    }
    router->receive_id = receive_id; // echoed by the reply
    if (count_waiting_replies(group, router_id) >= MAX_REPLIES_WAITING) {
        QV_LOG(LC_LOG_INFO,
               "WCCP GRP %d: removal query request. maximum of waiting replies (%d) reached. (router id %s)",
               group->id, static_cast<int>(MAX_REPLIES_WAITING), addr_text(router_id).s);
        wccp_note_reason(group, WCCP_REASON_QUERY_REFUSED, router_id, wccp_reason_value("one more query"),
                         wccp_reason_value("%u replies waiting at most", MAX_REPLIES_WAITING));
        return 1;
    }
    owned<wccp_removal_reply, free_reply> reply(
        static_cast<wccp_removal_reply *>(wccp_malloc(sizeof(wccp_removal_reply))));
    if (!reply.pointer) {
        QV_LOG(LC_LOG_INFO, "WCCP GRP %d: removal query request. cannot allocate pkt to send. (router id %s)",
               group->id, addr_text(router_id).s);
        wccp_note_reason(group, WCCP_REASON_NO_MEMORY, router_id, wccp_reason_value("a reply to its query"),
                         {});
        return 1;
    }
    // The record is zeroed, as the encoders expect.
    wccp_pkt *pkt = &reply.pointer->pkt;
    pkt->cursor = pkt->data;
    pkt->ipa = router_id; // only the querying router gets the reply
    if (const int status = wccp_pkt_build_here_i_am(group, pkt)) {
        QV_LOG(LC_LOG_INFO,
               "WCCP GRP %d: removal query request reply failed: building HERE_I_AM failed. (router id %s)",
               group->id, addr_text(router_id).s);
        return status;
    }
    reply.pointer->tx_left = REPLY_TRANSMISSIONS;
    list_push_head(&group->removal_replies, reply.take());
    group->removal_reply_count++;
    return 0;
}

int wccp_send_router_removal_query_reply(wccp_service_group *group) {
    wccp_removal_reply *next;
    for (wccp_removal_reply *reply = group->removal_replies; reply; reply = next) {
        next = reply->next;
        if (wccp_transmit_packet(group, &reply->pkt, WCCP_REMOVAL_REPLY))
            QV_LOG(LC_LOG_ERR, "WCCP GRP %u: %s failed.", group->id, "sending Query Response HERE_I_AM ");
        // The reply is sent three times, since the network may lose it.
        if (--reply->tx_left == 0) { // failed transmissions count as well
            list_unlink(reply);
            group->removal_reply_count--;
            wccp_free(reply);
        }
    }
    return 0;
}

// --- Queries about the routers

namespace {

bool assigns_to_another_appliance(const wccp_service_group *group, const wccp_sending_router *router) {
    for (uint32_t i = 0; i < router->view_appliance_count; i++) {
        const wccp_rtr_view_appliance *entry = &router->view_appliances[i];
        if (!(entry->ipa == group->appliance_ipa) && entry->buckets_assigned != 0)
            return true;
    }
    return false;
}

} // namespace

int wccp_any_routers_redirecting_to_other_appliances(wccp_service_group *group,
                                                     const wccp_sending_router *router) {
    for (const wccp_sending_router *other = group->sending_routers; other; other = other->next)
        if (other != router && assigns_to_another_appliance(group, other))
            return 1;
    return 0;
}

int wccp_get_router_connection_stats(wccp_service_group *group, uint32_t *out_one_way,
                                     uint32_t *out_two_way) {
    if (!group || !out_one_way || !out_two_way)
        return 1;
    *out_one_way = *out_two_way = 0;
    for (const wccp_sending_router *router = group->sending_routers; router; router = router->next) {
        if (router->flags & WCCP_RTR_TWO_WAY)
            ++*out_two_way;
        else if (router->flags & WCCP_RTR_ONE_WAY)
            ++*out_one_way;
    }
    return 0;
}

int wccp_get_router_assignment(wccp_service_group *group, wccp_sending_router *router, be32 appliance,
                               uint32_t *out_buckets) {
    if (!group || !router || !out_buckets)
        return 1;
    *out_buckets = 0;
    const wccp_rtr_view_appliance *entry = wccp_get_router_appliance_view_element(router, appliance);
    if (!entry) {
        QV_LOG(LC_LOG_ERR,
               "WCCP GRP %d: get router assign. failed. cannot find appliance %s in router's view: %s",
               group->id, addr_text(appliance).s, addr_text(router->router_id).s);
        return 1;
    }
    *out_buckets = entry->buckets_assigned;
    return 0;
}
