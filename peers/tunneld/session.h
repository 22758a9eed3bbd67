// The session with mgmtd: reads the configuration and follows its changes, answers queries about tunneld's
// state, and sends reports. While there is no session, tunneld continues with the last known configuration.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>

#include "peers/tunneld/view.h"
#include "runtime/loop_host.h"

// The configuration, together with what wccpd has reported about its groups.
struct configured_view {
    std::map<uint8_t, group_view> groups;
    std::map<uint8_t, intercept> intercepts;
    std::vector<bypass_entry> bypasses; // also expired ones
    std::vector<accepted_source> accepted;
    uint32_t protection_s = 300; // how long flows are passed on to the former owner of their slot; 0: never
    std::map<uint8_t, bool> drains; // by drained group: whether it has left its routers
    bool operator==(const configured_view &) const = default;
};

// A state node of tunneld: its full name, its type (bn_type_...) and its text.
struct state_node {
    std::string name;
    uint32_t type;
    std::string text;
};

struct session_callbacks {
    // Called when the configuration has been read in a new session, and after each change.
    std::function<void(const configured_view &view)> configured;
    // Returns all state nodes, in the order in which a walk lists them.
    std::function<std::vector<state_node>()> state;
    // Called with wccpd's text about the owners of a group's slots whenever it was queried; see
    // slot_owners.h.
    std::function<void(uint8_t group, const std::string &text)> owners;
};
struct mgmt_link; // released by mgmt_link_free()
// Tries to connect every second until there is a session. Null: out of memory.
mgmt_link *mgmt_link_new(lew *loop, session_callbacks callbacks);
void mgmt_link_free(mgmt_link *link);
bool mgmt_link_is_open(const mgmt_link *link);
// The number of sessions so far. The reports of an earlier session have to be sent again in a new one.
uint32_t mgmt_link_session(const mgmt_link *link);
// Queries wccpd's routers again soon. To be called when tunnels were added or deleted.
void mgmt_link_ask_routers(mgmt_link *link);
// Forgets the roles of the groups: the wccpd that has reported them has ended.
void mgmt_link_forget_roles(mgmt_link *link);
// Send an event; without a session it is dropped. In a new session the caller reports the groups that have
// left their routers again, when `configured` is called.
void mgmt_link_group_leaves(mgmt_link *link, uint8_t group, const std::string &reason);
void mgmt_link_group_joins(mgmt_link *link, uint8_t group);
void mgmt_link_weight_changed(mgmt_link *link, uint8_t group, uint32_t percent);
void mgmt_link_proxy_changed(mgmt_link *link, uint8_t group, bool up, const std::string &reason);
void mgmt_link_overload(mgmt_link *link, uint8_t group, bool overloaded, const std::string &text);
// `empty`: the group can leave its routers.
void mgmt_link_drain_progress(mgmt_link *link, uint8_t group, uint32_t flows, bool empty);
// Reports that tunneld ends in order and has removed its tunnels. mgmtd then does not wait for another
// tunneld to take them over.
void mgmt_link_ends(mgmt_link *link);
