// The configuration nodes of a service group: the name of each, the field of wccp_grp_config that it fills,
// and the policy group that a service group belongs to. Main thread only.
#pragma once

#include <cstdint>
#include <span>

#include "engine/wccp_records.h"
#include "mgmt/bnode.h"
#include "runtime/common.h"

constexpr const char *CONFIG_LOG_PREFIX = "WCCP config: ";

// The numbers are those that wccpd_config_update_group_binding takes; there is no 12.
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

struct group_node_words; // the words that a node's value may be, and what each means

struct group_node {
    group_node_kind kind;
    const char *name; // below the group's root; null for a router's address, whose name has a number in it
    bool changes;     // a change of this node alone is applied to a running group
    uint32_t flag;    // of config_flags; 0 for none
    // Fills the field from the binding, as wccpd_config_update_group_binding does; the rest is for its use.
    lc_status (*take)(const group_node *node, wccp_grp_config *config, const bn_binding *binding);
    void (*set)(wccp_grp_config *config, uint32_t value);
    void (*log)(const char *text, uint32_t value);
    const group_node_words *words;
};

// One row for each node, in the order in which the nodes of a new group are read.
extern const std::span<const group_node> group_nodes;

// Fills the field of that kind of node from the binding. A binding of the wrong type gives a status.
lc_status wccpd_config_update_group_binding(wccp_grp_config *config, const bn_binding *binding, int kind);

// The policy group of each service group, 0 for none. Kept here as well as in the engine, because taking a
// service group out of a policy group needs the old number.
void forget_policy_memberships();
void leave_policy_group(uint8_t group_id);
void move_policy_members(uint16_t from, uint16_t to);
