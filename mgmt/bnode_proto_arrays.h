// The arrays of a message's nodes, for mgmt/bnode_proto*.cpp only.
#pragma once

#include "mgmt/bnode_proto.h"
#include "mgmt/owners.h"

// Messages whose array of nodes is still missing, and arrays with room for `count` nodes.
lc_status bn_request_msg_new(bn_request_msg **out, uint16_t type);
lc_status bn_response_msg_new(bn_response_msg **out, uint16_t type);
lc_status bn_request_nodes_new(bn_request_per_node_array **out, uint32_t count);
lc_status bn_response_nodes_new(bn_response_per_node_array **out, uint32_t count);
void bn_request_node_free(bn_request_node *node);
void bn_response_node_free(bn_response_node *node);
using owned_request_node = owned<bn_request_node, bn_request_node_free>;
using owned_response_node = owned<bn_response_node, bn_response_node_free>;
