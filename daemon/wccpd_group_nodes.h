// The configuration nodes of a service group: the name of each and the field of wccp_grp_config that it sets;
// and the table of policy memberships. Main thread only.
#pragma once

#include <cstdint>
#include <span>

#include "engine/wccp_records.h"
#include "mgmt/bnode.h"
#include "runtime/common.h"

constexpr const char *CONFIG_LOG_PREFIX = "WCCP config: ";

// The kinds of nodes, as wccpd_config_update_group_binding takes them. There is no 12.
enum group_node_kind : int {
    GROUP_NODE_ADMIN = 1,
    GROUP_NODE_ROUTER = 2,
    GROUP_NODE_PROTOCOL = 3,
    GROUP_NODE_PRIORITY = 4,
    GROUP_NODE_ENCAP = 5,
    GROUP_NODE_WEIGHT = 6,
    GROUP_NODE_PASSWORD = 7,
    GROUP_NODE_POLICY_GRP = 8,
    GROUP_NODE_INTERFACE = 9,
    GROUP_NODE_FORCE_L2_RETURN = 10,
    GROUP_NODE_ASSIGN_METHOD = 11,
    GROUP_NODE_HASH_SRC_IP = 13,
    GROUP_NODE_HASH_DST_IP = 14,
    GROUP_NODE_HASH_SRC_PORT = 15,
    GROUP_NODE_HASH_DST_PORT = 16,
    GROUP_NODE_MASK_SRC_IP = 17,
    GROUP_NODE_MASK_DST_IP = 18,
    GROUP_NODE_MASK_SRC_PORT = 19,
    GROUP_NODE_MASK_DST_PORT = 20,
    GROUP_NODE_COMPATIBILITY = 21,
};

struct group_node_words; // the words that are valid for a node, and their values

struct group_node {
    group_node_kind kind;
    const char *name; // below the group's root; null for a router's address, whose name contains a number
    bool changes;     // a change of this node can be applied to a running group
    uint32_t flag;    // WCCP_CFG_*, 0 for none
    // Sets the field from the binding, like wccpd_config_update_group_binding. The members below are for its
    // use.
    lc_status (*take)(const group_node *node, wccp_grp_config *config, const bn_binding *binding);
    void (*set)(wccp_grp_config *config, uint32_t value);
    void (*log)(const char *text, uint32_t value);
    const group_node_words *words;
};

// One row for each node, in the order in which the nodes of a new group are read.
extern const std::span<const group_node> group_nodes;

// Sets the field for a kind of node from the binding. An invalid word is logged and replaced; an unknown kind
// is logged. Only a binding of the wrong type gives a failure.
lc_status wccpd_config_update_group_binding(wccp_grp_config *config, const bn_binding *binding, int kind);

// The policy group of each service group, 0 for none. The table is kept here besides the engine's, because
// removing a service group from its policy group needs the policy group's number.
void forget_policy_memberships();          // clears the table
void leave_policy_group(uint8_t group_id); // removes the service group from its policy group
void move_policy_members(uint16_t from, uint16_t to);
