// Protection of flows whose slot has moved: what wccpd says of the owners of slots, kept beyond the life of
// the process, and what follows from it for the view.
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

// What an earlier tunneld has kept. A file that is missing or bad is an empty table. The kernel keeps what it
// passes on itself; for the user-space plane it is the second.
owners_table load_owners();
passing_table load_passing();
void save_passing(const passing_table &table);
// Takes in wccpd's text about a group and keeps what has changed. True when something has.
bool take_owners(owners_table *owners, uint8_t group, const std::string &text, uint32_t protection_s);
// Drops groups that are no longer configured.
void keep_owners_of(owners_table *owners, const std::map<uint8_t, group_view> &groups);
// Of the groups whose address and members are known. None when the time is 0.
std::map<uint8_t, group_protection> find_protections(const owners_table &owners,
                                                     const std::map<uint8_t, group_view> &groups,
                                                     uint32_t protection_s);

// Of a group that has an intercept, or whose table is known: why its flows are not protected, "" where they
// are, and how many slots have packets passed on.
struct group_cover {
    std::string reason;
    size_t slots = 0;
};
// `has_redirect_headers`: what routers have sent in GRE so far has come with one. Nothing for no group.
std::map<uint8_t, group_cover> find_covers(const appliance_view &view, bool user_space, bool enabled,
                                           bool has_redirect_headers);
