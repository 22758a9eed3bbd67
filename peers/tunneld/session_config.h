// What mgmtd's answers say, as tunneld's own records. Pure functions: the session asks and logs.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "peers/nodes/binding_text.h"
#include "peers/tunneld/session.h"

// Of what is configured, so much is taken over at most; the rest is left out with a complaint.
constexpr size_t PORT_RANGES_MAX = 64;         // of an intercept
constexpr size_t INTERCEPT_BYPASSES_MAX = 256; // of an intercept
constexpr size_t BYPASSES_MAX = 4096;          // beside those
constexpr size_t ACCEPTED_MAX = 256;           // further sources
constexpr size_t GROUP_ROUTERS_MAX = 32;       // of a group
constexpr size_t COMPLAINTS_MAX = 16;          // of one reading

// "all", or ports and ranges separated by blanks: "80 443 8000-8080". False for anything else, "" among it.
bool parse_ports(const std::string &text, std::vector<port_range> *out);
// "10.1.0.0/16", or an address alone. Bits beyond the length are cleared.
bool parse_prefix(const std::string &text, ip_prefix *out);
bool parse_address(const std::string &text, uint32_t *out);

// Groups come without `local` and `routers`. A value that is bad, or one too many, is ignored with a
// complaint, a line without its end; an intercept whose port or protocol is bad or missing is left out as a
// whole, since a default could intercept what nobody meant.
configured_view read_configuration(const std::vector<event_field> &nodes,
                                   std::vector<std::string> *out_complaints);
// The number of routers that the configuration names for each group that is up.
std::map<uint8_t, size_t> count_configured_routers(const std::vector<event_field> &nodes);

// From wccpd's answer: its text about the owners of slots, by group.
std::map<uint8_t, std::string> read_group_owners(const std::vector<event_field> &nodes);
// From wccpd's answer about groups: whether a router assigns to this appliance, and whether there is another.
struct group_role {
    bool active = false, alone = false;
};
std::map<uint8_t, group_role> read_group_roles(const std::vector<event_field> &nodes);
// From the same answer: routers that have answered it, by group. Methods that are not negotiated
// are unknown.
std::map<uint8_t, std::vector<group_router>> read_group_routers(const std::vector<event_field> &nodes);
