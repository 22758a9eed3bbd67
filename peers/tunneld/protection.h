// Flow protection: keeps what wccpd reports about the owners of slots, in files that outlive the process, and
// derives from it which packets are passed on to other appliances.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "peers/tunneld/plane.h"
#include "peers/tunneld/session.h"
#include "peers/tunneld/slot_owners.h"
#include "peers/tunneld/view.h"

constexpr const char *OWNERS_FILE = "/run/tunneld/owners";
constexpr const char *PASSING_FILE = "/run/tunneld/passing";

// Load the file that an earlier tunneld has saved; a missing or damaged file is an empty table. The passing
// table is that of the data plane `user`: with the plane `kernel`, the rules in the kernel outlive the
// process by themselves.
owners_table load_owners();
passing_table load_passing();
void save_passing(const passing_table &table);
// Updates the table with wccpd's text about a group, and saves it if it has changed. True when it has.
bool take_owners(owners_table *owners, uint8_t group, const std::string &text, uint32_t protection_s);
// Drops the groups that are not in `groups`, and saves the table if there were any.
void keep_owners_of(owners_table *owners, const std::map<uint8_t, group_view> &groups);
// The protection of each group whose local address and owners are known. Empty when the time is 0.
std::map<uint8_t, group_protection> find_protections(const owners_table &owners,
                                                     const std::map<uint8_t, group_view> &groups,
                                                     uint32_t protection_s);

// Whether the flows of a group are protected.
struct group_cover {
    std::string reason; // why not, or ""
    size_t slots = 0;   // whose packets are passed on
};
// For groups that have an intercept, or whose owners are known. `has_redirect_headers`: the GRE packets of
// the routers have redirect headers.
std::map<uint8_t, group_cover> find_covers(const appliance_view &view, bool user_space, bool enabled,
                                           bool has_redirect_headers);
