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
    uint32_t protection_s = 300;    // that flows are passed on to the former owner of their slot; 0: never
    std::map<uint8_t, bool> drains; // that an operator has asked for, by group: whether it has left
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
// The number of sessions that have been opened: what was reported in an earlier one has to be reported again.
uint32_t mgmt_link_session(const mgmt_link *link);
// wccpd's routers are asked for again shortly: to call when tunnels have come or gone.
void mgmt_link_ask_routers(mgmt_link *link);
// Events, dropped while there is no session. After a new session has read the configuration, groups that are
// out of their routers are reported anew by the caller (`configured` is called then).
void mgmt_link_group_leaves(mgmt_link *link, uint8_t group, const std::string &reason);
void mgmt_link_group_joins(mgmt_link *link, uint8_t group);
void mgmt_link_weight_changed(mgmt_link *link, uint8_t group, uint32_t percent);
// `empty`: it may leave its routers.
void mgmt_link_drain_progress(mgmt_link *link, uint8_t group, uint32_t flows, bool empty);
void mgmt_link_overload(mgmt_link *link, uint8_t group, bool overloaded, const std::string &text);
// What is known of the groups' roles is of a wccpd that is gone.
void mgmt_link_forget_roles(mgmt_link *link);
void mgmt_link_proxy_changed(mgmt_link *link, uint8_t group, bool up, const std::string &reason);
// tunneld ends in order and has removed its tunnels. Whoever needs them has to be told at once: the next
// tunneld, if one comes, has none to take over.
void mgmt_link_ends(mgmt_link *link);
