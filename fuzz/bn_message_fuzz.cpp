// Fuzzer for the bodies of management messages, requests and responses.
//
// An input is a mode byte, followed by a message from its service id on. A message that can be read must take
// at most eight times its size in memory, have attributes with valid ids only, and be the same after it is
// written and read again. It is then passed to all users of messages: readers that copy and that take over,
// the dump, the answer to a monitoring query, the change event and the walk by pattern.
#include <cstring>
#include <string>

#include <sanitizer/allocator_interface.h>

#include "fuzz/require.h"
#include "mgmt/bnode_proto.h"
#include "mgmt/mdc_main.h"
#include "mgmt/owners.h"
#include "runtime/logging.h"

namespace {

enum mode : uint8_t {
    RESPONSE = 1,
    LOGGED = 2, // formats all log lines, which takes most of the time
    OFFSET_SHIFT = 6,
};
constexpr size_t MEMORY_PER_BYTE = 8, MEMORY_PER_MESSAGE = 1024;

std::string text_of(const tstring *text) {
    return text ? std::string(text->buffer, static_cast<size_t>(text->length)) : std::string();
}
bool same_beside_nodes(const bn_request_msg *a, const bn_request_msg *b) {
    return a->transaction_id == b->transaction_id && a->flags == b->flags && a->number == b->number &&
           text_of(a->text) == text_of(b->text) && text_of(a->audit_user) == text_of(b->audit_user);
}
bool same_beside_nodes(const bn_response_msg *a, const bn_response_msg *b) {
    return a->response_to == b->response_to && a->return_code == b->return_code &&
           a->db_revision_id == b->db_revision_id && text_of(a->return_message) == text_of(b->return_message);
}
bool same_beside_binding(const bn_request_node *a, const bn_request_node *b) {
    return a->subop == b->subop && a->flags == b->flags && text_of(a->source) == text_of(b->source) &&
           text_of(a->target) == text_of(b->target);
}
bool same_beside_binding(const bn_response_node *, const bn_response_node *) {
    return true;
}

void check_binding(const bn_binding *binding) {
    REQUIRE(binding && binding->name);
    REQUIRE((binding->absolute != 0) == (binding->name->buffer[0] == '/'));
    const bn_attrib_array *attributes = binding->attributes;
    REQUIRE(bn_attrib_array_length_quick(attributes) <= BN_ATTRIB_LAST + 1);
    for (uint32_t id = 0; id < bn_attrib_array_length_quick(attributes); id++)
        if (const bn_attrib *attribute = bn_attrib_array_get_quick(attributes, id)) {
            REQUIRE(attribute->attribute_id == id && bn_attrib_id_valid(id));
            REQUIRE(lc_enum_to_string_quiet_null(bn_type_table, static_cast<int32_t>(attribute->type)) &&
                    (attribute->type_flags & BN_TYPE_MASK) == 0);
        }
}

void check_same(const bn_binding *a, const bn_binding *b) {
    REQUIRE(strcmp(a->name->buffer, b->name->buffer) == 0 && a->absolute == b->absolute);
    const uint32_t slots = bn_attrib_array_length_quick(a->attributes);
    REQUIRE(slots == bn_attrib_array_length_quick(b->attributes));
    for (uint32_t id = 0; id < slots; id++) {
        const bn_attrib *left = bn_attrib_array_get_quick(a->attributes, id);
        const bn_attrib *right = bn_attrib_array_get_quick(b->attributes, id);
        int order = 1;
        REQUIRE(bn_attrib_compare(left, right, &order) == LC_OK && (order == 0 || (!left && !right)));
        REQUIRE(!left || (left->type_flags == right->type_flags && left->value_size == right->value_size));
    }
}

// Reads the message, writes it and reads it again.
template <auto Read, auto Write, auto CountNodes, auto GetNode, typename Owner>
bool read_message(const tbuffer *buffer, uint32_t offset, Owner *out) {
    const size_t before = __sanitizer_get_current_allocated_bytes();
    const lc_status status = Read(buffer, offset, &out->pointer);
    const size_t taken = __sanitizer_get_current_allocated_bytes() - before;
    if (status != LC_OK) {
        REQUIRE(!out->pointer);
        return false;
    }
    REQUIRE(taken <= MEMORY_PER_BYTE * buffer->length + MEMORY_PER_MESSAGE);
    auto *msg = out->pointer;
    const auto node_of = [](const auto *of, uint32_t i) { return GetNode(of->nodes, i); };
    const uint32_t count = CountNodes(msg->nodes);
    bool stable = true; // writing an absolute name whose first part is empty drops that part
    for (uint32_t i = 0; i < count; i++) {
        check_binding(node_of(msg, i)->binding);
        stable = stable && strncmp(node_of(msg, i)->binding->name->buffer, "//", 2) != 0;
    }
    if (!stable)
        return true;

    owned_tbuffer written, again;
    Owner copy;
    REQUIRE(Write(msg, 0, &written.pointer) == LC_OK);
    REQUIRE(msg->length == written.pointer->length && msg->length <= buffer->length);
    REQUIRE(Read(written.pointer, 0, &copy.pointer) == LC_OK);
    REQUIRE(Write(copy.pointer, 0, &again.pointer) == LC_OK);
    REQUIRE(written.pointer->length == again.pointer->length);
    REQUIRE(memcmp(written.pointer->buffer, again.pointer->buffer, again.pointer->length) == 0);
    REQUIRE(msg->msg_type == copy.pointer->msg_type && msg->msg_id == copy.pointer->msg_id);
    REQUIRE(same_beside_nodes(msg, copy.pointer) && count == CountNodes(copy.pointer->nodes));
    for (uint32_t i = 0; i < count; i++) {
        REQUIRE(node_of(msg, i)->node_id == node_of(copy.pointer, i)->node_id);
        REQUIRE(same_beside_binding(node_of(msg, i), node_of(copy.pointer, i)));
        check_same(node_of(msg, i)->binding, node_of(copy.pointer, i)->binding);
    }
    return true;
}

lc_status get_one(const char *name, const tstr_array *, void *, bn_binding_array *out) {
    owned_binding binding;
    CHECK_STATUS(bn_binding_new_uint32(&binding.pointer, name, bn_attrib_value, 0, 1));
    CHECK_STATUS(bn_binding_array_append_takeover(out, &binding.pointer));
    return LC_OK;
}
// Few children, and none below the third level, because each wildcard multiplies them.
lc_status list_children(const char *, const tstr_array *parts, void *, tstr_array *out) {
    if (tstr_array_length_quick(parts) > 2)
        return LC_OK;
    for (const char *child : {"1", "a/b"})
        CHECK_STATUS(tstr_array_append_str(out, child));
    return LC_OK;
}
lc_status ignore_binding(const bn_binding_array *, uint32_t, bn_binding *, const tstring *,
                         const tstr_array *, const tstring *, const tstring *, void *) {
    return LC_OK;
}

void use_bindings(bn_binding_array *bindings) {
    owned_bindings before, after;
    (void)mdc_foreach_binding_prequeried(bindings, "/a/**", nullptr, ignore_binding, nullptr, nullptr);
    const lc_status status = mdc_event_config_change_notif_extract(bindings, &before.pointer, &after.pointer);
    REQUIRE((status == LC_OK) == (before.pointer != nullptr && after.pointer != nullptr));
}

void use_request(const tbuffer *buffer, uint32_t offset) {
    owned_request msg;
    if (!read_message<bn_request_msg_deserialize, bn_request_msg_serialize,
                      bn_request_per_node_array_length_quick, bn_request_per_node_array_get_quick>(
            buffer, offset, &msg))
        return;
    const uint32_t count = bn_request_per_node_array_length_quick(msg.pointer->nodes);
    bn_request_msg_dump(nullptr, msg.pointer, LC_LOG_DEBUG, "FUZZ");
    uint16_t type = 0;
    owned_bindings bindings, copies;
    owned_uint32_array ids;
    owned_node_info info;
    const size_t before = __sanitizer_get_current_allocated_bytes();
    if (bn_request_get(msg.pointer, &type, nullptr, 0, &copies.pointer, nullptr, nullptr) == LC_OK)
        REQUIRE(__sanitizer_get_current_allocated_bytes() - before <=
                MEMORY_PER_BYTE * buffer->length + MEMORY_PER_MESSAGE);
    if (bn_request_get(msg.pointer, &type, nullptr, 1, &bindings.pointer, &ids.pointer, &info.pointer) !=
        LC_OK)
        return;
    REQUIRE(bn_binding_array_length_quick(bindings.pointer) == count);
    REQUIRE(uint32_array_length_quick(ids.pointer) == count);
    if (type == bn_msg_query_request)
        (void)mdc_dispatch_mon_request(nullptr, msg.pointer, get_one, nullptr, list_children, nullptr);
    else
        use_bindings(bindings.pointer);
}

void use_response(const tbuffer *buffer, uint32_t offset) {
    owned_response msg, copy;
    if (!read_message<bn_response_msg_deserialize, bn_response_msg_serialize,
                      bn_response_per_node_array_length_quick, bn_response_per_node_array_get_quick>(
            buffer, offset, &msg))
        return;
    bn_response_msg_dump(nullptr, msg.pointer, LC_LOG_DEBUG, "FUZZ");
    REQUIRE(bn_response_msg_dup(msg.pointer, &copy.pointer) == LC_OK);
    for (const bool take : {false, true}) {
        owned_bindings bindings;
        owned_uint32_array ids;
        uint32_t code = 0;
        const lc_status status =
            take ? bn_response_get_takeover(copy.pointer, &code, nullptr, 0, &bindings.pointer, &ids.pointer)
                 : bn_response_get(copy.pointer, &code, nullptr, 1, &bindings.pointer, &ids.pointer);
        REQUIRE(status == LC_OK);
        REQUIRE(code == msg.pointer->return_code);
        REQUIRE(bn_binding_array_length_quick(bindings.pointer) ==
                bn_response_per_node_array_length_quick(msg.pointer->nodes));
        use_bindings(bindings.pointer);
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *input, size_t size);
extern "C" int LLVMFuzzerTestOneInput(const uint8_t *input, size_t size) {
    if (size < 1 || size > 1u << 20)
        return 0;
    const uint8_t mode = *input;
    const uint32_t offset = mode >> OFFSET_SHIFT; // tests different alignments
    G_log_level = mode & LOGGED ? LC_LOG_DEBUG : -1;
    owned_tbuffer buffer;
    REQUIRE(tb_new_buf_const(&buffer.pointer, input + 1, static_cast<uint32_t>(size - 1)) == LC_OK);
    (mode & RESPONSE ? use_response : use_request)(buffer.pointer, offset);
    return 0;
}
