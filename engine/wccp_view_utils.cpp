// Views: which routers and appliances the routers of a group report, and what they assign to this appliance.
//
// There are two levels. Each sending router keeps its last report in arrays (view_routers, view_appliances).
// The group keeps the union over all its routers in lists (router_view, appliance_view); the reference count
// of an entry is the number of sending routers that report it. A new report is compared with the router's
// last one: an address that is new takes a reference in the union, one that is missing drops its reference.
// Either raises the change number and requests an election at the next tick. The first reference creates an
// entry, the last one frees it; nobody else keeps pointers to entries. A change of weight alone only makes
// the designated appliance compute its table again.
//
// Invariant: a router's array has exactly the addresses on which that router holds a reference. Otherwise a
// reference could be left over when the router is removed, and an appliance that nobody reports any more
// would block every later election. Therefore a repeated address in a report is skipped, and a failure does
// not end an update: an address that there was no memory for stays out of both, the rest is applied, and the
// failure is returned at the end. The next report adds the missing address.
//
// The engine lock is held throughout, by a receive thread, or by the timer thread when it removes a router
// that has timed out. In steady state a report repeats the last one; this case is tested first and costs one
// pass. Otherwise an address is looked for at its old position first, then everywhere.
//
// The last section derives the role of this appliance from what a router assigned before and assigns now.
#include "engine/wccp_view_utils.h"

#include <cstring>

#include "engine/wccp_alarms.h"
#include "engine/wccp_complaints.h"
#include "engine/wccp_pkt_unload.h"
#include "engine/wccp_router_utils.h"
#include "engine/wccp_state.h"
#include "engine/wccp_utils.h"
#include "runtime/list.h"

namespace {

constexpr uint32_t MARK = 1; // of an old entry that the new report has as well

// --- The unions

template <typename Entry>
Entry *find_view_entry(Entry *entry, be32 address) {
    while (entry && !(entry->ipa == address))
        entry = entry->next;
    return entry;
}

} // namespace

int wccp_view_list_add_appliance_sorted(wccp_service_group *group, wccp_view_appliance *entry) {
    wccp_view_appliance *head = group->appliance_view;
    if (!head) {
        list_push_head(&group->appliance_view, entry);
        return 0;
    }
    // Only the head's position is maintained: readers go through the whole list or sort for themselves.
    const bool above = entry->weight != head->weight ? entry->weight > head->weight
                                                     : to_host(entry->ipa) > to_host(head->ipa);
    if (above) {
        list_push_head(&group->appliance_view, entry);
        return 0;
    }
    list_insert_after(head, entry);
    if (entry->weight == head->weight && entry->ipa == head->ipa) { // it is inserted nevertheless
        QV_LOG(LC_LOG_ERR, "WCCP GRP %d: adding appliance sorted failed. appliance %s", group->id,
               addr_text(entry->ipa).s);
        return 1;
    }
    return 0;
}

namespace {

// False when there is no entry of that address.
template <typename Entry>
bool drop_reference(Entry *first, uint32_t *count, be32 address) {
    Entry *entry = find_view_entry(first, address);
    if (!entry)
        return false;
    if (--entry->ref_count == 0) {
        --*count;
        list_unlink(entry);
        wccp_free(entry);
    }
    return true;
}

} // namespace

int wccp_remove_router_from_view_list(wccp_service_group *group, be32 address) {
    if (drop_reference(group->router_view, &group->router_view_count, address))
        return 0;
    QV_LOG(LC_LOG_ERR,
           "WCCP GRP %d: removal of router failed. entry not found in router view list. router ip  %s",
           group->id, addr_text(address).s);
    return 1;
}

int wccp_remove_appliance_from_view_list(wccp_service_group *group, be32 address) {
    if (drop_reference(group->appliance_view, &group->appliance_view_count, address))
        return 0;
    QV_LOG(LC_LOG_ERR,
           "WCCP GRP %d: appliance remove failed. entry not found in appliance list. appliance ip %s",
           group->id, addr_text(address).s);
    return 1;
}

namespace {

void note_view_change(wccp_service_group *group, const wccp_sending_router *router, const char *line) {
    group->change_number++;
    group->state_flags |= WCCP_DESG_ELECT_PENDING;
    QV_LOG(LC_LOG_INFO, line, group->id, addr_text(router->router_id).s,
           static_cast<int>(group->change_number));
}

// --- Comparing a report with the last one

be32 get_address(be32 address) {
    return address;
}
be32 get_address(const wccp_rtr_view_appliance &element) {
    return element.ipa;
}

// Bit i of the result: no item before item i has the same address.
template <typename Item>
uint32_t find_first_occurrences(const Item *items, uint32_t count) {
    static_assert(WCCP_MAX_ROUTERS <= 32 && WCCP_MAX_APPLIANCES <= 32);
    uint32_t bits = 0;
    for (uint32_t i = 0; i < count; i++) {
        uint32_t earlier = 0;
        while (earlier < i && !(get_address(items[earlier]) == get_address(items[i])))
            earlier++;
        if (earlier == i)
            bits |= 1u << i;
    }
    return bits;
}

// The entry of an address in the last report, or null. `place` is its index in the new report.
template <typename Entry>
Entry *find_reported_entry(Entry *entries, uint32_t count, uint32_t place, be32 address) {
    if (place < count && entries[place].ipa == address)
        return &entries[place];
    for (uint32_t i = 0; i < count; i++)
        if (entries[i].ipa == address)
            return &entries[i];
    return nullptr;
}

template <typename Entry>
void clear_marks(Entry *old, uint32_t count) {
    for (uint32_t i = 0; i < count; i++)
        old[i].flags &= ~MARK;
}

// The marks that a comparison leaves when every address is known. They show in the diagnostic dump.
template <typename Entry>
void set_marks(Entry *old, uint32_t count) {
    for (uint32_t i = 0; i < count; i++)
        old[i].flags |= MARK;
}

// --- The routers of a report

// Adds a reference on the union's entry of a router. False when there is no memory for a new entry.
bool add_router_reference(wccp_service_group *group, be32 address) {
    wccp_view_router *entry = find_view_entry(group->router_view, address);
    if (!entry) {
        entry = static_cast<wccp_view_router *>(wccp_malloc(sizeof *entry));
        if (!entry) {
            QV_LOG(LC_LOG_ERR, "WCCP GRP %d: adding router view failed. out of memory. router ipa %s",
                   group->id, addr_text(address).s);
            wccp_note_reason(group, WCCP_REASON_NO_MEMORY, address, wccp_reason_value("a router"), {});
            return false;
        }
        entry->ipa = address;
        group->router_view_count++;
        list_push_head(&group->router_view, entry);
    }
    entry->ref_count++;
    return true;
}

bool repeats_last_report(const wccp_sending_router *router, uint32_t count, const be32 *addresses) {
    if (count != router->view_router_count)
        return false;
    for (uint32_t i = 0; i < count; i++)
        if (!(router->view_routers[i].ipa == addresses[i]))
            return false;
    return true;
}

} // namespace

int wccp_update_router_view(wccp_service_group *group, wccp_sending_router *router, uint32_t count,
                            const be32 *addresses) {
    if (count > WCCP_MAX_ROUTERS)
        return 1;
    if (repeats_last_report(router, count, addresses)) {
        set_marks(router->view_routers, count);
        return 0;
    }
    const uint32_t old_count = router->view_router_count;
    uint32_t taken = find_first_occurrences(addresses, count); // bit i: entry i is part of the new report
    bool changed = false;
    int status = 0;
    clear_marks(router->view_routers, old_count);
    // New addresses take a reference, known ones are marked.
    for (uint32_t i = 0; i < count; i++) {
        if (!(taken >> i & 1))
            continue;
        if (wccp_rtr_view_router *known =
                find_reported_entry(router->view_routers, old_count, i, addresses[i])) {
            known->flags |= MARK;
        } else if (add_router_reference(group, addresses[i])) {
            changed = true;
        } else { // left out of the report, so that the next one tries again
            taken &= ~(1u << i);
            status = 1;
        }
    }
    // Old addresses without a mark are missing from the report: their references are dropped.
    for (uint32_t i = 0; i < old_count; i++) {
        if (router->view_routers[i].flags & MARK)
            continue;
        wccp_remove_router_from_view_list(group, router->view_routers[i].ipa);
        changed = true;
    }
    // Only now may the old entries be overwritten.
    router->view_router_count = 0;
    // Marks stay with their places in the array; each comparison clears them first.
    for (uint32_t i = 0; i < count; i++)
        if (taken >> i & 1)
            router->view_routers[router->view_router_count++].ipa = addresses[i];
    if (changed)
        note_view_change(group, router,
                         "WCCP GRP %d: router view has changed. sending router %s local change number %d");
    return status;
}

// --- The appliances of a report

namespace {

// A router reports another weight than in its last report.
int apply_reported_weight(wccp_service_group *group, const wccp_rtr_view_appliance *element) {
    wccp_view_appliance *entry = find_view_entry(group->appliance_view, element->ipa);
    if (!entry) {
        QV_LOG(LC_LOG_ERR, "WCCP GRP %d: update appliance view list failed. cannot find appliance %s",
               group->id, addr_text(element->ipa).s);
        return 1;
    }
    if (entry->weight == element->weight) // another router has reported the new weight before
        return 0;
    QV_LOG(LC_LOG_INFO,
           "WCCP GRP %d: appliance %s weight change detected (%d -> %d). triggering redirect assignment "
           "check.",
           group->id, addr_text(entry->ipa).s, entry->weight, element->weight);
    list_unlink(entry); // its place depends on the weight
    entry->weight = element->weight;
    if (wccp_view_list_add_appliance_sorted(group, entry))
        return 1;
    // The designated appliance sees the change in the reports that it receives itself.
    if (group->designated != 1)
        return 0;
    // A change of weight needs no election, only a new table.
    wccp_clear_redirect_assign_states(group);
    wccp_alarm_schedule_verify_allocation_table_timer(group, 0);
    return wccp_update_designated_redirect_assignment(group, WCCP_ASSIGN_AFTER_WEIGHT_CHANGE) ? 1 : 0;
}

// Adds a reference on the union's entry of an appliance. False when there is no memory for a new entry.
bool add_appliance_reference(wccp_service_group *group, const wccp_rtr_view_appliance *element) {
    wccp_view_appliance *entry = find_view_entry(group->appliance_view, element->ipa);
    if (!entry) {
        entry = static_cast<wccp_view_appliance *>(wccp_malloc(sizeof *entry));
        if (!entry) {
            QV_LOG(LC_LOG_ERR, "WCCP GRP %d: adding appliance view failed. out of memory. appliance ipa %s",
                   group->id, addr_text(element->ipa).s);
            wccp_note_reason(group, WCCP_REASON_NO_MEMORY, element->ipa, wccp_reason_value("an appliance"),
                             {});
            return false;
        }
        entry->ipa = element->ipa;
        entry->weight = element->weight;
        group->appliance_view_count++;
        // This fails only for an address that is in the list.
        (void)wccp_view_list_add_appliance_sorted(group, entry);
    }
    // A known entry keeps its weight, even if this router reports another one.
    entry->ref_count++;
    return true;
}

void set_two_way(wccp_service_group *group, wccp_sending_router *router) {
    router->flags = (router->flags & ~WCCP_RTR_ONE_WAY) | WCCP_RTR_TWO_WAY;
    router->state_time = wccp_g.seconds;
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: router id %s is TWO-WAY connected.", group->id,
           addr_text(router->router_id).s);
    // The alarm is cleared by the check: the other routers must be two-way as well.
    wccp_alarm_schedule_verify_router_connectivity_timer(group, 0);
}

void set_one_way(wccp_service_group *group, wccp_sending_router *router) {
    router->flags = (router->flags & ~WCCP_RTR_TWO_WAY) | WCCP_RTR_ONE_WAY;
    router->state_time = wccp_g.seconds;
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d router id %s is ONE-WAY connected.", group->id,
           addr_text(router->router_id).s);
    wccp_alarm_raise_router_down_alarm(group);
}

// The same appliances with the same weights in the same order. What is assigned to them may differ.
bool repeats_last_report(const wccp_sending_router *router, uint32_t count,
                         const wccp_rtr_view_appliance *decoded) {
    if (count != router->view_appliance_count)
        return false;
    for (uint32_t i = 0; i < count; i++) {
        const wccp_rtr_view_appliance *old = &router->view_appliances[i];
        if (!(old->ipa == decoded[i].ipa) || old->weight != decoded[i].weight)
            return false;
    }
    return true;
}

// Stores the elements whose bit is set in `taken` as the router's last report.
void store_appliance_report(wccp_sending_router *router, uint32_t count,
                            const wccp_rtr_view_appliance *decoded, uint32_t taken) {
    router->view_appliance_count = 0;
    for (uint32_t i = 0; i < count; i++) {
        if (!(taken >> i & 1))
            continue;
        wccp_rtr_view_appliance *entry = &router->view_appliances[router->view_appliance_count++];
        entry->ipa = decoded[i].ipa;
        entry->weight = decoded[i].weight;
        entry->buckets_assigned = decoded[i].buckets_assigned;
        entry->buckets_total = decoded[i].buckets_total;
        if (decoded[i].buckets_assigned != 0) // otherwise the earlier bits stay
            memcpy(entry->bucket_bits, decoded[i].bucket_bits, sizeof entry->bucket_bits);
    }
}

// Updates the union, and the router's connection state, by what is new in a report and what is missing.
// Outputs a bit for each element that was taken, and whether the view has changed.
int apply_appliance_report(wccp_service_group *group, wccp_sending_router *router, uint32_t count,
                           const wccp_rtr_view_appliance *decoded, uint32_t *out_taken, bool *out_changed) {
    const uint32_t old_count = router->view_appliance_count;
    wccp_rtr_view_appliance *const old = router->view_appliances;
    int status = 0;
    *out_taken = find_first_occurrences(decoded, count);
    clear_marks(old, old_count);
    // First what the report has: new appliances take a reference, known ones are marked.
    for (uint32_t i = 0; i < count; i++) {
        const wccp_rtr_view_appliance *element = &decoded[i];
        if (!(*out_taken >> i & 1))
            continue;
        if (wccp_rtr_view_appliance *known = find_reported_entry(old, old_count, i, element->ipa)) {
            known->flags |= MARK;
            if (known->weight != element->weight && apply_reported_weight(group, element))
                status = 1;
            continue;
        }
        if (!add_appliance_reference(group, element)) {
            *out_taken &= ~(1u << i);
            status = 1;
            continue;
        }
        *out_changed = true;
        // The router lists this appliance, therefore it receives our Here-I-Am.
        if (element->ipa == group->appliance_ipa)
            set_two_way(group, router);
    }
    // Then what it no longer has: entries without a mark drop their reference.
    for (uint32_t i = 0; i < old_count; i++) {
        if (old[i].flags & MARK)
            continue;
        wccp_remove_appliance_from_view_list(group, old[i].ipa);
        *out_changed = true;
        if (old[i].ipa == group->appliance_ipa)
            set_one_way(group, router);
    }
    return status;
}

} // namespace

int wccp_update_appliance_view(wccp_service_group *group, wccp_sending_router *router, uint32_t count,
                               const wccp_rtr_view_appliance *decoded) {
    if (count > WCCP_MAX_APPLIANCES)
        return 1;
    // A report that repeats the last one has no duplicates: they were removed when that one was stored.
    uint32_t taken = ~0u;
    bool changed = false;
    int status = 0;
    if (repeats_last_report(router, count, decoded))
        set_marks(router->view_appliances, count);
    else
        status = apply_appliance_report(group, router, count, decoded, &taken, &changed);
    // Stored even if it repeats the last one: what is assigned may differ.
    store_appliance_report(router, count, decoded, taken);
    if (changed)
        note_view_change(group, router,
                         "WCCP GRP %d: appliance view has changed. sending router %s local change number %d");
    return status;
}

wccp_rtr_view_appliance *wccp_get_router_appliance_view_element(wccp_sending_router *router, be32 address) {
    for (uint32_t i = 0; i < router->view_appliance_count; i++)
        if (router->view_appliances[i].ipa == address)
            return &router->view_appliances[i];
    return nullptr;
}

int wccp_appliance_is_reported_by_all_senders(wccp_service_group *group, be32 address) {
    for (wccp_sending_router *router = group->sending_routers; router; router = router->next)
        if (!wccp_get_router_appliance_view_element(router, address))
            return 0;
    return 1;
}

// --- The role

namespace {

// Logs `line`, a format for the group's id and the router's id, and enters a state.
void enter_state(wccp_service_group *group, const wccp_sending_router *router, const char *line,
                 int (*enter)(wccp_service_group *)) {
    QV_LOG(LC_LOG_INFO, line, group->id, addr_text(router->router_id).s);
    enter(group);
}

void handle_redirect_here(wccp_service_group *group, const wccp_sending_router *router) {
    if (++group->redirecting_routers == 1) // only the first router changes the state
        enter_state(group, router, "WCCP GRP %d: redirect: first router to self (router id %s )",
                    wccp_appliance_state_active);
}

void handle_redirect_elsewhere(wccp_service_group *group, const wccp_sending_router *router) {
    // In ACTIVE, other routers still redirect here, and the group stays in it.
    if (group->state_flags & WCCP_STATE_INIT)
        enter_state(group, router,
                    "WCCP GRP %d: redirect: router id %s is redirecting to other  appliance(s).",
                    wccp_appliance_state_backup);
}

// `elsewhere`: it now redirects to other appliances. Otherwise it redirects to none.
void handle_end_of_redirect_here(wccp_service_group *group, const wccp_sending_router *router,
                                 bool elsewhere) {
    if (group->redirecting_routers != 0)
        group->redirecting_routers--;
    if (group->redirecting_routers != 0) // others still redirect here
        return;
    if (elsewhere)
        enter_state(group, router,
                    "WCCP GRP %d: redirect: last router stopped redirecting to self. (router id %s)",
                    wccp_appliance_state_backup);
    else if (wccp_any_routers_redirecting_to_other_appliances(group, router))
        enter_state(group, router,
                    "WCCP GRP %d: redirect: this rtr (id %s) does not redirect. but another router does",
                    wccp_appliance_state_backup);
    else
        enter_state(group, router,
                    "WCCP GRP %d: redirect: rtr does not redirect. no redirecting routers (router id %s)",
                    wccp_appliance_state_init);
}

void handle_end_of_redirect_elsewhere(wccp_service_group *group, const wccp_sending_router *router) {
    // The router itself does not count: it has just stopped.
    if (group->state_flags & WCCP_STATE_BACKUP &&
        !wccp_any_routers_redirecting_to_other_appliances(group, router))
        enter_state(group, router, "WCCP GRP %d: redirect: no routers redirecting to group (router id %s)",
                    wccp_appliance_state_init);
}

// The router's record has the new numbers. The arguments are the old ones, for this appliance and for all; at
// least one of them differs from the new one.
void apply_redirect_change(wccp_service_group *group, const wccp_sending_router *router, uint16_t self_before,
                           uint16_t total_before) {
    const bool here = router->self_buckets != 0, anywhere = router->total_buckets != 0;
    // A router may redirect both here and elsewhere. In that case only the part for this appliance matters.
    if (here) {
        if (self_before == 0)
            handle_redirect_here(group, router);
    } else if (anywhere && total_before == 0) {
        handle_redirect_elsewhere(group, router);
    } else if (self_before != 0) {
        handle_end_of_redirect_here(group, router, anywhere);
    } else if (!anywhere) {
        handle_end_of_redirect_elsewhere(group, router);
    }
}

} // namespace

int wccp_update_appliance_redirect_status(wccp_service_group *group, wccp_sending_router *router,
                                          const wccp_assign_summary *hash, const wccp_assign_summary *mask) {
    // A valid mask summary is from an Assignment Map, which overrides what the elements say.
    const wccp_assign_summary *now = mask->valid == 1 ? mask : hash;
    if (now->valid != 1) { // elements of mask assignment, but no Assignment Map
        WCCP_COMPLAIN(LC_LOG_WARNING,
                      "WCCP GRP %d: update redirect status: assign. info not found. sender rtr id: %s",
                      group->id, addr_text(router->router_id).s);
        wccp_note_reason(group, WCCP_REASON_ASSIGNMENT_UNREADABLE, router->router_id, {}, {});
        return 1;
    }
    const uint32_t method = now == mask ? WCCP_ASSIGN_MASK : WCCP_ASSIGN_HASH;
    // A router that assigns nothing uses no method.
    if (now->total_count != 0 && method != group->assign_method)
        wccp_note_reason(group, WCCP_REASON_METHOD_DIFFERS, router->router_id,
                         wccp_reason_value("%s by the router", wccp_assign_method_name(method)),
                         wccp_reason_value("%s", wccp_assign_method_name(group->assign_method)));
    QV_LOG(LC_LOG_INFO, "WCCP GRP %d: RX redirect status: rtr id: %s to self: %d/%d buckets (%s)", group->id,
           addr_text(router->router_id).s, now->self_count, now->total_count,
           now == mask ? "mask assign" : "hash assign");
    // In steady state nothing has changed, and the role is left alone.
    const uint16_t self_before = router->self_buckets, total_before = router->total_buckets;
    if (now->self_count == self_before && now->total_count == total_before)
        return 0;
    wccp_alarm_schedule_verify_allocation_table_timer(group, 0);
    router->self_buckets = now->self_count;
    router->total_buckets = now->total_count;
    apply_redirect_change(group, router, self_before, total_before);
    return 0;
}
