// Why a group does not work: the last refusals of packets and the last failures of steps, with the values
// that differed, for monitoring to read. The log has the same in its own words; nobody has to parse it.
//
// A reason is known by its code and its sender; another occurrence counts it up and replaces its values. Each
// group has a table, and the packets of no group share one. Tables have a fixed size and take no memory of
// their own: a full one gives up its oldest reason, that of a stranger before that of a known router, for
// anybody can send packets. Reasons that a router's packets give end when an I-See-You of that router is
// taken, or when no packet has repeated them for a minute; the others end with the step that succeeds.
//
// Engine lock held throughout.
#pragma once

#include <cstdint>

#include "runtime/byte_order.h"

struct wccp_service_group;

constexpr uint32_t WCCP_GROUP_REASONS = 40;
constexpr uint32_t WCCP_OTHER_REASONS = 16; // of packets of no group
constexpr uint32_t WCCP_REASON_BYTES = 64;  // of a value as text, with its end

enum wccp_reason_code : uint8_t {
    WCCP_REASON_NONE,
    // What is wrong with a packet.
    WCCP_REASON_MESSAGE_LENGTH,
    WCCP_REASON_MESSAGE_VERSION,
    WCCP_REASON_MESSAGE_TYPE,
    WCCP_REASON_MESSAGE_MALFORMED,
    WCCP_REASON_VIEW_LENGTH,
    WCCP_REASON_GROUP_UNKNOWN,
    WCCP_REASON_GROUP_DISABLED,
    WCCP_REASON_GROUP_STOPPED,
    WCCP_REASON_SECURITY_MISSING,
    WCCP_REASON_SECURITY_UNWANTED,
    WCCP_REASON_PASSWORD_MISMATCH,
    WCCP_REASON_SERVICE_MISMATCH,
    WCCP_REASON_FORWARDING_NOT_OFFERED,
    WCCP_REASON_ASSIGNMENT_NOT_OFFERED,
    WCCP_REASON_RETURN_NOT_OFFERED,
    WCCP_REASON_ROUTER_ID_ZERO,
    WCCP_REASON_ROUTERS_EXHAUSTED,
    WCCP_REASON_QUERY_REFUSED,
    // What a router reports, or does not.
    WCCP_REASON_NOT_IN_VIEW,
    WCCP_REASON_ROUTER_SILENT,
    WCCP_REASON_ELECTION_BLOCKED,
    WCCP_REASON_METHOD_DIFFERS,
    WCCP_REASON_MASK_DIFFERS,
    WCCP_REASON_ASSIGNMENT_UNREADABLE,
    WCCP_REASON_ASSIGNMENT_DIFFERS,
    WCCP_REASON_NOT_ACKNOWLEDGED,
    WCCP_REASON_APPLIANCE_LEFT_OUT,
    // What this appliance cannot do.
    WCCP_REASON_NO_MEMORY,
    WCCP_REASON_HERE_I_AM_NOT_BUILT,
    WCCP_REASON_TABLE_NOT_BUILT,
    WCCP_REASON_SEND_FAILED,
    WCCP_REASON_INTERFACE_MISSING,
    WCCP_REASON_INTERFACE_DOWN,
    WCCP_REASON_INTERFACE_NO_ADDRESS,
    WCCP_REASON_PORT_TAKEN,
    WCCP_REASON_SOCKET_FAILED,
    WCCP_REASON_JOIN_FAILED,
    WCCP_REASON_TUNNEL_REFUSED,
    WCCP_REASON_TUNNEL_TIMEOUT,
    WCCP_REASON_TUNNEL_IDS_EXHAUSTED,
    WCCP_REASON_TUNNELD_SILENT,
    WCCP_REASON_MAILBOX_MISSING,
    WCCP_REASON_CODES, // how many there are
};

struct wccp_reason_text {
    char s[WCCP_REASON_BYTES];
};
struct wccp_reason {
    wccp_reason_code code; // NONE: the place is free
    bool stranger;         // the sender is no router of the group
    be32 sender;           // router id, source, appliance or destination; 0.0.0.0 for none
    uint32_t count;
    uint32_t first, last; // wccp_g.seconds
    wccp_reason_text offered, wanted;
};

// The stable word of a code, such as "password-mismatch"; "" for none.
const char *wccp_reason_word(uint32_t code);
// False for a free place and for a reason that nothing has repeated.
bool wccp_reason_holds(const wccp_reason *reason);
// A value; what is too long is cut.
__attribute__((format(printf, 1, 2))) wccp_reason_text wccp_reason_value(const char *format, ...);
// A null group: of a packet that belongs to none.
void wccp_note_reason(wccp_service_group *group, wccp_reason_code code, be32 sender,
                      const wccp_reason_text &offered, const wccp_reason_text &wanted);
void wccp_forget_reason(wccp_service_group *group, wccp_reason_code code, be32 sender);
void wccp_forget_reasons(wccp_service_group *group, wccp_reason_code code); // of all senders
// The same but for what was noted in this second, by a check that has looked at all senders.
void wccp_forget_older_reasons(wccp_service_group *group, wccp_reason_code code);
void wccp_forget_all_reasons(wccp_service_group *group);
// An I-See-You was taken: what was wrong with earlier packets of that router, by its id and by their source,
// ends. What was noted in this second stays, since it may be about this very packet.
void wccp_forget_refusals(wccp_service_group *group, be32 router_id, be32 source);
// The table of a group, or of no group, and its size.
wccp_reason *wccp_reasons_of(wccp_service_group *group, uint32_t *out_count);
