// The reasons why a group does not work: the latest refusals of packets and the latest failures of steps,
// with the values that differed, for monitoring. The log has the same events in its own words; nobody has to
// parse it.
//
// A reason is identified by its code and its sender; when it occurs again, its count rises and its values are
// replaced. Each group has a table, and one more table in wccp_g is for packets that belong to no group. The
// tables are arrays of a fixed size in those records. When a table is full, a new reason replaces the oldest
// one, and those of unknown senders before those of the group's routers, because anybody can send packets.
//
// Reasons that come from a router's packets end when an I-See-You of that router is accepted, and most of
// them also after a minute without a repetition. Those about the form of a packet end only after that minute:
// a router whose table cannot be read also sends messages without one, and these are accepted. All other
// reasons end when the step that failed succeeds.
//
// Lock held for all functions except wccp_reason_word and wccp_reason_value.
#pragma once

#include <cstdint>

#include "runtime/byte_order.h"

struct wccp_service_group;

constexpr uint32_t WCCP_GROUP_REASONS = 40;
constexpr uint32_t WCCP_OTHER_REASONS = 16; // of packets that belong to no group
constexpr uint32_t WCCP_REASON_BYTES = 64;  // of a value as text, with the terminating NUL

enum wccp_reason_code : uint8_t {
    WCCP_REASON_NONE,
    // A packet was refused.
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
    // A router reports something unexpected, or reports nothing.
    WCCP_REASON_NOT_IN_VIEW,
    WCCP_REASON_ROUTER_SILENT,
    WCCP_REASON_ELECTION_BLOCKED,
    WCCP_REASON_METHOD_DIFFERS,
    WCCP_REASON_MASK_DIFFERS,
    WCCP_REASON_ASSIGNMENT_UNREADABLE,
    WCCP_REASON_ASSIGNMENT_DIFFERS,
    WCCP_REASON_NOT_ACKNOWLEDGED,
    WCCP_REASON_APPLIANCE_LEFT_OUT,
    // This appliance failed to do something.
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
    WCCP_REASON_RESTART_NEEDED, // a change takes effect only when the group starts again
    WCCP_REASON_CODES,          // the number of codes
};

struct wccp_reason_text {
    char s[WCCP_REASON_BYTES];
};
struct wccp_reason {
    wccp_reason_code code; // NONE: this entry is free
    bool stranger;         // the sender is not a router of the group
    be32 sender;           // router id, source, appliance or destination; 0.0.0.0 for none
    be32 source;           // of the last packet that caused it; 0.0.0.0 if no packet did
    uint32_t count;
    uint32_t first, last;             // times of the first and last occurrence
    wccp_reason_text offered, wanted; // either may be empty
};

// Sets `source` of the reasons that the calling thread notes while this object exists. Scopes do not nest.
struct wccp_packet_source_scope {
    explicit wccp_packet_source_scope(be32 source);
    ~wccp_packet_source_scope();
    wccp_packet_source_scope(const wccp_packet_source_scope &) = delete;
    wccp_packet_source_scope &operator=(const wccp_packet_source_scope &) = delete;
};

// The stable word of a code, such as "password-mismatch"; "" for none.
const char *wccp_reason_word(uint32_t code);
// Whether the reason is active: false for a free entry, and for a packet's reason that was not repeated.
bool wccp_reason_holds(const wccp_reason *reason);
// Formats a value; a longer text is truncated.
__attribute__((format(printf, 1, 2))) wccp_reason_text wccp_reason_value(const char *format, ...);
// Adds or repeats a reason. Null group: the table for packets that belong to no group. True for a new reason,
// false for another occurrence of an active one.
bool wccp_note_reason(wccp_service_group *group, wccp_reason_code code, be32 sender,
                      const wccp_reason_text &offered, const wccp_reason_text &wanted);
void wccp_forget_reason(wccp_service_group *group, wccp_reason_code code, be32 sender); // null group as above
void wccp_forget_reasons(wccp_service_group *group, wccp_reason_code code);             // of all senders
// Removes those of all senders that were not noted in this second. For a check that looks at all senders and
// has just noted what it found.
void wccp_forget_older_reasons(wccp_service_group *group, wccp_reason_code code);
void wccp_forget_all_reasons(wccp_service_group *group);
// Call it when an I-See-You was accepted: removes the reasons that came from earlier packets with this router
// id or source. Those noted in this second stay, because they may be about this packet.
void wccp_forget_refusals(wccp_service_group *group, be32 router_id, be32 source);
// The table of a group, or with null that of packets of no group, and its number of entries.
wccp_reason *wccp_reasons_of(wccp_service_group *group, uint32_t *out_count);
