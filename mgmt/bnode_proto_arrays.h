// The nodes of messages, as arrays: inside the message code only.
#pragma once

#include "mgmt/bnode_proto.h"
#include "mgmt/owners.h"

void bn_request_node_free(bn_request_node *node);
void bn_response_node_free(bn_response_node *node);
using owned_request_node = owned<bn_request_node, bn_request_node_free>;
using owned_response_node = owned<bn_response_node, bn_response_node_free>;
