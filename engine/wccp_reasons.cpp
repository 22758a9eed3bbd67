// The tables of reasons. They are arrays in the engine's records: a group's table is created zeroed and freed
// with the group, and nothing here allocates memory. Searches are linear over at most 40 entries, which costs
// little compared with a packet.
#include "engine/wccp_reasons.h"

#include <cstdarg>
#include <cstdio>

#include "engine/wccp_records.h"

namespace {

// When a reason ends.
enum class ending {
    step,       // with the step that succeeds
    acceptance, // with the next I-See-You of its sender that is accepted
    time,       // when nothing has repeated it for REPEATED_WITHIN
    acceptance_or_time,
};
struct code_row {
    const char *word;
    ending ends;
};
constexpr uint32_t REPEATED_WITHIN = 60; // seconds; a refused router repeats its packet after ten

// Indexed by wccp_reason_code.
constexpr code_row code_rows[] = {
    {"", ending::step},
    {"message-length", ending::time},
    {"message-version", ending::acceptance_or_time},
    {"message-type", ending::acceptance_or_time},
    {"message-malformed", ending::time},
    {"view-length", ending::time},
    {"group-unknown", ending::acceptance_or_time},
    {"group-disabled", ending::acceptance_or_time},
    {"group-stopped", ending::acceptance_or_time},
    {"security-missing", ending::acceptance_or_time},
    {"security-unwanted", ending::acceptance_or_time},
    {"password-mismatch", ending::acceptance_or_time},
    {"service-mismatch", ending::acceptance_or_time},
    {"forwarding-not-offered", ending::acceptance_or_time},
    {"assignment-not-offered", ending::acceptance_or_time},
    {"return-not-offered", ending::acceptance_or_time},
    {"router-id-zero", ending::acceptance_or_time},
    {"routers-exhausted", ending::acceptance_or_time},
    {"query-refused", ending::acceptance_or_time},
    {"not-in-view", ending::acceptance_or_time},
    {"router-silent", ending::acceptance},
    {"election-blocked", ending::step},
    {"method-differs", ending::acceptance_or_time},
    {"mask-differs", ending::acceptance_or_time},
    {"assignment-unreadable", ending::acceptance_or_time},
    {"assignment-differs", ending::step},
    {"not-acknowledged", ending::step},
    {"appliance-left-out", ending::step},
    {"no-memory", ending::acceptance_or_time},
    {"here-i-am-not-built", ending::step},
    {"table-not-built", ending::step},
    {"send-failed", ending::step},
    {"interface-missing", ending::step},
    {"interface-down", ending::step},
    {"interface-no-address", ending::step},
    {"port-taken", ending::step},
    {"socket-failed", ending::step},
    {"join-failed", ending::step},
    {"tunnel-refused", ending::acceptance_or_time},
    {"tunnel-timeout", ending::acceptance_or_time},
    {"tunnel-ids-exhausted", ending::acceptance_or_time},
    {"tunneld-silent", ending::acceptance},
    {"mailbox-missing", ending::acceptance_or_time},
    {"restart-needed", ending::step},
};
static_assert(sizeof code_rows / sizeof *code_rows == WCCP_REASON_CODES);

bool group_has_router(const wccp_service_group *group, be32 address) {
    if (!group)
        return false;
    // A sender can be a configured address, a router's id, or the address that its packets come from.
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

thread_local be32 packet_source; // of the packet that this thread processes; 0.0.0.0 outside of that

} // namespace

wccp_packet_source_scope::wccp_packet_source_scope(be32 source) {
    packet_source = source;
}

wccp_packet_source_scope::~wccp_packet_source_scope() {
    packet_source = {};
}

const char *wccp_reason_word(uint32_t code) {
    return code < WCCP_REASON_CODES ? code_rows[code].word : "";
}

bool wccp_reason_holds(const wccp_reason *reason) {
    const code_row *row = &code_rows[reason->code];
    // A reason is not removed when its time is up; it only no longer counts.
    const bool by_time = row->ends == ending::acceptance_or_time || row->ends == ending::time;
    return reason->code != WCCP_REASON_NONE && (!by_time || wccp_g.seconds - reason->last <= REPEATED_WITHIN);
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

bool wccp_note_reason(wccp_service_group *group, wccp_reason_code code, be32 sender,
                      const wccp_reason_text &offered, const wccp_reason_text &wanted) {
    wccp_reason *reason = find_reason(group, code, sender);
    const bool is_new = !reason || !wccp_reason_holds(reason);
    // A reason that has expired starts again; its count and first time belong to the earlier occurrence.
    if (is_new) {
        if (!reason)
            reason = find_place_for_reason(group);
        *reason = {};
        reason->code = code;
        reason->sender = sender;
        reason->first = wccp_g.seconds;
        // Strangers are replaced first, so that their packets cannot displace reasons about own routers.
        reason->stranger = !is_zero(sender) && !group_has_router(group, sender);
    }
    reason->count++;
    reason->last = wccp_g.seconds;
    // The sender may be an id from the packet; the source is where the packet came from.
    reason->source = packet_source;
    reason->offered = offered;
    reason->wanted = wanted;
    return is_new;
}

void wccp_forget_reason(wccp_service_group *group, wccp_reason_code code, be32 sender) {
    // An entry without a code is free.
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
    // What was noted in this second is about the accepted message itself.
    for (wccp_reason &each : group->reasons)
        if ((code_rows[each.code].ends == ending::acceptance_or_time ||
             code_rows[each.code].ends == ending::acceptance) &&
            each.last != wccp_g.seconds && (each.sender == router_id || each.sender == source))
            each.code = WCCP_REASON_NONE;
}
