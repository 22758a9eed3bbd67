// The session with mgmtd: reads the configuration and hears of its changes, answers queries of tunneld's
// state, and reports. mgmtd may come, go and come back: tunneld carries packets by what it heard last.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>

#include "peers/tunneld/view.h"
#include "runtime/loop_host.h"

// What the configuration and wccpd's state say.
struct configured_view {
    std::map<uint8_t, group_view> groups;
    std::map<uint8_t, intercept> intercepts;
    std::vector<bypass_entry> bypasses; // also those whose time is over
    std::vector<accepted_source> accepted;
    uint32_t protection_s = 300; // that flows are passed on to the former owner of their slot; 0: never
};

// A state node that tunneld answers for: its full name, its type (bn_type_...) and its text.
struct state_node {
    std::string name;
    uint32_t type;
    std::string text;
};

struct session_callbacks {
    std::function<void(const configured_view &view)> configured; // after the first reading and each change
    std::function<std::vector<state_node>()> state;              // all nodes, in the order of a walk
    // What wccpd says of the owners of a group's slots, as it comes: see slot_owners.h.
    std::function<void(uint8_t group, const std::string &text)> owners;
};
struct mgmt_link; // owned by whoever made it
// Connects when mgmtd is there, again every second while it isn't. Null: no memory.
mgmt_link *mgmt_link_new(lew *loop, session_callbacks callbacks);
void mgmt_link_free(mgmt_link *link);
bool mgmt_link_is_open(const mgmt_link *link);
// wccpd's routers are asked for again shortly: to call when tunnels have come or gone.
void mgmt_link_ask_routers(mgmt_link *link);
// Events, dropped while there is no session. After a new session has read the configuration, groups that are
// out of their routers are reported anew by the caller (`configured` is called then).
void mgmt_link_group_leaves(mgmt_link *link, uint8_t group, const std::string &reason);
void mgmt_link_group_joins(mgmt_link *link, uint8_t group);
void mgmt_link_proxy_changed(mgmt_link *link, uint8_t group, bool up, const std::string &reason);
// tunneld ends in order and has removed its tunnels. Whoever needs them has to be told at once: the next
// tunneld, if one comes, has none to take over.
void mgmt_link_ends(mgmt_link *link);
