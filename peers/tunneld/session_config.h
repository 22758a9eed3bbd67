// Turns mgmtd's answers into tunneld's records. The functions have no side effects: session.cpp sends the
// queries and logs the complaints.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "peers/nodes/binding_text.h"
#include "peers/tunneld/session.h"

// Bounds of the configuration; what exceeds them is left out with a complaint.
constexpr size_t PORT_RANGES_MAX = 64;         // of an intercept
constexpr size_t INTERCEPT_BYPASSES_MAX = 256; // of an intercept
constexpr size_t BYPASSES_MAX = 4096;          // of `mgmtctl bypass`
constexpr size_t ACCEPTED_MAX = 256;           // accepted sources
constexpr size_t GROUP_ROUTERS_MAX = 32;       // of a group
constexpr size_t COMPLAINTS_MAX = 16;          // of one reading

// "all", or ports and ranges separated by blanks: "80 443 8000-8080". False for any other text, also for "".
bool parse_ports(const std::string &text, std::vector<port_range> *out);
// "10.1.0.0/16", or a single address. Bits beyond the length are cleared.
bool parse_prefix(const std::string &text, ip_prefix *out);
bool parse_address(const std::string &text, uint32_t *out);

// The nodes whose subtrees read_configuration() takes.
std::vector<std::string> list_configuration_roots();
// Fills in groups without `local` and `routers`. A bad value, or one that exceeds a bound, is ignored with a
// complaint of one line. An intercept whose ports, protocol or proxy port are bad or missing is left out: a
// default could intercept traffic that nobody wants intercepted.
configured_view read_configuration(const std::vector<event_field> &nodes,
                                   std::vector<std::string> *out_complaints);
// The number of configured routers of each group that is administratively up.
std::map<uint8_t, size_t> count_configured_routers(const std::vector<event_field> &nodes);

// From wccpd's answer about groups: the text about the owners of their slots, by group.
std::map<uint8_t, std::string> read_group_owners(const std::vector<event_field> &nodes);
// From the same answer; see group_view.
struct group_role {
    bool active = false, alone = false;
};
std::map<uint8_t, group_role> read_group_roles(const std::vector<event_field> &nodes);
// From the same answer: the routers that have answered wccpd, by group. A method that is not negotiated yet
// is travel::unknown.
std::map<uint8_t, std::vector<group_router>> read_group_routers(const std::vector<event_field> &nodes);
