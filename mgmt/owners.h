// Names for the scope guards of the management code's objects, owned_binding for example.
#pragma once

#include <cstdlib>

#include "mgmt/bnode.h"
#include "mgmt/bnode_proto.h"
#include "runtime/guards.h"
#include "runtime/tbuffer.h"
#include "runtime/tstr_array.h"
#include "runtime/tstring.h"

inline void bn_release_request(bn_request_msg *msg) {
    (void)bn_request_msg_free(&msg);
}
inline void bn_release_response(bn_response_msg *msg) {
    (void)bn_response_msg_free(&msg);
}
inline void bn_release_node_info(bn_node_info *info) {
    free(info);
}
inline void bn_free_memory(void *memory) {
    free(memory);
}

using owned_tstring = owned<tstring, ts_release>;
using owned_tbuffer = owned<tbuffer, tb_release>;
using owned_tstr_array = owned<tstr_array, tstr_array_release>;
using owned_uint32_array = owned<uint32_array, uint32_array_release>;
using owned_attrib = owned<bn_attrib, bn_release_attrib>;
using owned_attribs = owned<bn_attrib_array, bn_attrib_array_release>;
using owned_binding = owned<bn_binding, bn_release_binding>;
using owned_bindings = owned<bn_binding_array, bn_binding_array_release>;
using owned_request = owned<bn_request_msg, bn_release_request>;
using owned_response = owned<bn_response_msg, bn_release_response>;
using owned_node_info = owned<bn_node_info, bn_release_node_info>;
