// Owners of bindings and messages.
#pragma once

#include "mgmt/bnode_proto.h"
#include "tests/support/runtime_owners.h"

using attrib_owner = owner<bn_attrib, bn_attrib_free>;
using binding_owner = owner<bn_binding, bn_binding_free>;
using bindings_owner = owner<bn_binding_array, bn_binding_array_free>;
using request_owner = owner<bn_request_msg, bn_request_msg_free>;
using response_owner = owner<bn_response_msg, bn_response_msg_free>;
