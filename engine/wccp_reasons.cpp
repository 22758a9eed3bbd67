// The tables of reasons. They are arrays in the engine's records: a group's table is created zeroed and freed
// with the group, and nothing here allocates memory. Searches are linear over at most 40 entries, which costs
// little compared with a packet.
#include "engine/wccp_reasons.h"

#include <cstdarg>
#include <cstdio>

#include "engine/wccp_records.h"

namespace {

struct code_row {
    const char *word;
    bool of_packets;      // ends with the next I-See-You of the sender that is accepted
    bool lasting = false; // does not end after REPEATED_WITHIN either
};
constexpr uint32_t REPEATED_WITHIN = 60; // seconds; a refused router repeats its packet after ten

// Indexed by wccp_reason_code.
constexpr code_row code_rows[] = {
    {"", false},
    {"message-length", true},
    {"message-version", true},
    {"message-type", true},
    {"message-malformed", true},
    {"view-length", true},
    {"group-unknown", true},
    {"group-disabled", true},
    {"group-stopped", true},
    {"security-missing", true},
    {"security-unwanted", true},
    {"password-mismatch", true},
    {"service-mismatch", true},
    {"forwarding-not-offered", true},
    {"assignment-not-offered", true},
    {"return-not-offered", true},
    {"router-id-zero", true},
    {"routers-exhausted", true},
    {"query-refused", true},
    {"not-in-view", true},
    {"router-silent", true, true},
    {"election-blocked", false},
    {"method-differs", true},
    {"mask-differs", true},
    {"assignment-unreadable", true},
    {"assignment-differs", false},
    {"not-acknowledged", false},
    {"appliance-left-out", false},
    {"no-memory", true},
    {"here-i-am-not-built", false},
    {"table-not-built", false},
    {"send-failed", false},
    {"interface-missing", false},
    {"interface-down", false},
    {"interface-no-address", false},
    {"port-taken", false},
    {"socket-failed", false},
    {"join-failed", false},
    {"tunnel-refused", true},
    {"tunnel-timeout", true},
    {"tunnel-ids-exhausted", true},
    {"tunneld-silent", true, true},
    {"mailbox-missing", true},
};
static_assert(sizeof code_rows / sizeof *code_rows == WCCP_REASON_CODES);

bool group_has_router(const wccp_service_group *group, be32 address) {
    if (!group)
        return false;
    for (uint32_t i = 0; i < group->ucast_router_count; i++)
        if (group->ucast_routers[i] == address)
            return true;
    for (const wccp_sending_router *router = group->sending_routers; router; router = router->next)
        if (router->router_id == address || router->src_ipa == address)
            return true;
    return false;
}

// The entry to use for a new reason: a free one, otherwise the oldest, strangers first.
wccp_reason *find_place_for_reason(wccp_service_group *group) {
    uint32_t count;
    wccp_reason *const table = wccp_reasons_of(group, &count), *chosen = table;
    for (wccp_reason *each = table; each < table + count; each++) {
        if (each->code == WCCP_REASON_NONE)
            return each;
        const bool older = wccp_g.seconds - each->last > wccp_g.seconds - chosen->last;
        if (each->stranger != chosen->stranger ? each->stranger : older)
            chosen = each;
    }
    return chosen;
}

wccp_reason *find_reason(wccp_service_group *group, wccp_reason_code code, be32 sender) {
    uint32_t count;
    wccp_reason *const table = wccp_reasons_of(group, &count);
    for (wccp_reason *each = table; each < table + count; each++)
        if (each->code == code && each->sender == sender)
            return each;
    return nullptr;
}

} // namespace

const char *wccp_reason_word(uint32_t code) {
    return code < WCCP_REASON_CODES ? code_rows[code].word : "";
}

bool wccp_reason_holds(const wccp_reason *reason) {
    const code_row *row = &code_rows[reason->code];
    return reason->code != WCCP_REASON_NONE &&
           (!row->of_packets || row->lasting || wccp_g.seconds - reason->last <= REPEATED_WITHIN);
}

wccp_reason_text wccp_reason_value(const char *format, ...) {
    wccp_reason_text out;
    va_list list;
    va_start(list, format);
    vsnprintf(out.s, sizeof out.s, format, list);
    va_end(list);
    return out;
}

wccp_reason *wccp_reasons_of(wccp_service_group *group, uint32_t *out_count) {
    *out_count = group ? WCCP_GROUP_REASONS : WCCP_OTHER_REASONS;
    return group ? group->reasons : wccp_g.reasons;
}

void wccp_note_reason(wccp_service_group *group, wccp_reason_code code, be32 sender,
                      const wccp_reason_text &offered, const wccp_reason_text &wanted) {
    wccp_reason *reason = find_reason(group, code, sender);
    if (!reason) {
        reason = find_place_for_reason(group);
        *reason = {};
        reason->code = code;
        reason->sender = sender;
        reason->first = wccp_g.seconds;
        reason->stranger = !is_zero(sender) && !group_has_router(group, sender);
    }
    reason->count++;
    reason->last = wccp_g.seconds;
    reason->offered = offered;
    reason->wanted = wanted;
}

void wccp_forget_reason(wccp_service_group *group, wccp_reason_code code, be32 sender) {
    if (wccp_reason *reason = find_reason(group, code, sender))
        reason->code = WCCP_REASON_NONE;
}

void wccp_forget_reasons(wccp_service_group *group, wccp_reason_code code) {
    for (wccp_reason &each : group->reasons)
        if (each.code == code)
            each.code = WCCP_REASON_NONE;
}

void wccp_forget_older_reasons(wccp_service_group *group, wccp_reason_code code) {
    for (wccp_reason &each : group->reasons)
        if (each.code == code && each.last != wccp_g.seconds)
            each.code = WCCP_REASON_NONE;
}

void wccp_forget_all_reasons(wccp_service_group *group) {
    for (wccp_reason &each : group->reasons)
        each.code = WCCP_REASON_NONE;
}

void wccp_forget_refusals(wccp_service_group *group, be32 router_id, be32 source) {
    for (wccp_reason &each : group->reasons)
        if (code_rows[each.code].of_packets && each.last != wccp_g.seconds &&
            (each.sender == router_id || each.sender == source))
            each.code = WCCP_REASON_NONE;
}
