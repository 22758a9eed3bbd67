// Messages on the wire. All integers are big-endian; a string is a 4-byte length and that many bytes. A
// reader walks the received bytes and refuses to read past their end, so that no count that was announced is
// believed further than the bytes that came with it.
#include <cstdlib>
#include <cstring>

#include "mgmt/bnode_names.h"
#include "mgmt/bnode_proto.h"
#include "mgmt/bnode_proto_arrays.h"
#include "mgmt/bnode_types.h"
#include "runtime/byte_order.h"
#include "runtime/logging.h"

// The fixed parts, where their bytes lie.
struct bn_wire_request_header {
    be16 service_id;
    be16 msg_type;
    be32 length; // of the whole frame, frame header included
    be32 msg_id;
    be32 transaction_id;
};
struct bn_wire_response_header {
    be16 service_id;
    be16 msg_type;
    be32 length;
    be32 msg_id;
    be32 transaction_id;
    be32 response_to;
};
static_assert(sizeof(bn_wire_request_header) == 16 && offsetof(bn_wire_request_header, msg_type) == 2);
static_assert(offsetof(bn_wire_request_header, length) == 4 && offsetof(bn_wire_request_header, msg_id) == 8);
static_assert(offsetof(bn_wire_request_header, transaction_id) == 12);
static_assert(sizeof(bn_wire_response_header) == 20 && offsetof(bn_wire_response_header, response_to) == 16);

static void bn_byte_swap_request_header(const bn_request_msg *msg, bn_wire_request_header *out) {
    *out = {to_be16(msg->service_id), to_be16(msg->msg_type), to_be32(msg->length), to_be32(msg->msg_id),
            to_be32(msg->transaction_id)};
}
static void bn_byte_swap_request_header(const bn_wire_request_header *wire, bn_request_msg *msg) {
    msg->service_id = to_host(wire->service_id);
    msg->msg_type = to_host(wire->msg_type);
    msg->length = to_host(wire->length);
    msg->msg_id = to_host(wire->msg_id);
    msg->transaction_id = to_host(wire->transaction_id);
}
static void bn_byte_swap_response_header(const bn_response_msg *msg, bn_wire_response_header *out) {
    *out = {to_be16(msg->service_id), to_be16(msg->msg_type),       to_be32(msg->length),
            to_be32(msg->msg_id),     to_be32(msg->transaction_id), to_be32(msg->response_to)};
}
static void bn_byte_swap_response_header(const bn_wire_response_header *wire, bn_response_msg *msg) {
    msg->service_id = to_host(wire->service_id);
    msg->msg_type = to_host(wire->msg_type);
    msg->length = to_host(wire->length);
    msg->msg_id = to_host(wire->msg_id);
    msg->transaction_id = to_host(wire->transaction_id);
    msg->response_to = to_host(wire->response_to);
}

// --- Writing
// --------------------------------------------------------------------------------------------------------

static lc_status put_u32(tbuffer *buffer, uint32_t value) {
    const be32 wire = to_be32(value);
    CHECK_STATUS(tb_append_buf(buffer, wire.bytes, sizeof wire));
    return LC_OK;
}
static lc_status put_u32_at(tbuffer *buffer, uint32_t offset, uint32_t value) {
    const be32 wire = to_be32(value);
    CHECK_STATUS(tb_put_buf(buffer, offset, wire.bytes, sizeof wire));
    return LC_OK;
}
static lc_status put_string(tbuffer *buffer, const tstring *text) {
    const int32_t length = text ? ts_length(text) : 0;
    CHECK_STATUS(put_u32(buffer, static_cast<uint32_t>(length)));
    if (length > 0)
        CHECK_STATUS(tb_append_buf(buffer, ts_str(text), static_cast<uint32_t>(length)));
    return LC_OK;
}
static uint32_t used(const tbuffer *buffer) {
    return static_cast<uint32_t>(tb_length(buffer));
}

// A part of a name, without its escapes.
static lc_status put_escaped_part(tbuffer *buffer, const char *part, const char *end) {
    const uint32_t length_at = used(buffer);
    CHECK_STATUS(put_u32(buffer, 0));
    const char *run = part;
    for (; part < end; part++)
        if (bn_escapes(part)) {
            CHECK_STATUS(tb_append_buf(buffer, run, static_cast<uint32_t>(part - run)));
            run = ++part; // begins with the character that was escaped
        }
    CHECK_STATUS(tb_append_buf(buffer, run, static_cast<uint32_t>(end - run)));
    CHECK_STATUS(put_u32_at(buffer, length_at, used(buffer) - length_at - 4));
    return LC_OK;
}
// Every message writes a name for each of its bindings, so the parts are taken out of the text in place.
static lc_status put_name_text(tbuffer *buffer, const char *name) {
    const bool absolute = *name == '/';
    CHECK_STATUS(tb_append_uint8(buffer, absolute));
    const uint32_t count_at = used(buffer);
    CHECK_STATUS(put_u32(buffer, 0));
    const char *part = name + absolute;
    uint32_t count = 0;
    for (const char *end; *part || count; part = end + 1) {
        end = bn_part_end(part);
        CHECK_STATUS(put_escaped_part(buffer, part, end));
        count++;
        if (!*end)
            break;
    }
    CHECK_STATUS(put_u32_at(buffer, count_at, count));
    return LC_OK;
}
static lc_status put_name(tbuffer *buffer, const bn_binding *binding) {
    const tstr_array *parts = nullptr;
    int absolute = 0;
    CHECK_STATUS(bn_binding_get_name_parts_const(binding, &parts, &absolute));
    if (!parts)
        return put_name_text(buffer, bn_binding_get_name_quick(binding));
    CHECK_STATUS(tb_append_uint8(buffer, absolute != 0));
    const uint32_t count = tstr_array_length_quick(parts);
    CHECK_STATUS(put_u32(buffer, count));
    for (uint32_t i = 0; i < count; i++)
        CHECK_STATUS(put_string(buffer, tstr_array_get_quick(parts, i)));
    return LC_OK;
}

static lc_status put_attributes(tbuffer *buffer, const bn_binding *binding) {
    const uint32_t count_at = used(buffer);
    CHECK_STATUS(put_u32(buffer, 0));
    uint32_t written = 0;
    const bn_attrib_array *attributes = binding->attributes;
    const uint32_t slots = bn_attrib_array_length_quick(attributes);
    for (uint32_t id = 0; id < slots; id++) {
        const bn_attrib *attribute = bn_attrib_array_get_quick(attributes, id);
        if (!attribute)
            continue;
        CHECK_STATUS(bn_attrib_append_wire(attribute, buffer));
        written++;
    }
    CHECK_STATUS(put_u32_at(buffer, count_at, written));
    return LC_OK;
}

static lc_status put_subop(tbuffer *buffer, const bn_request_node *node) {
    CHECK_STATUS(put_u32(buffer, node->subop));
    CHECK_STATUS(put_u32(buffer, node->flags));
    return LC_OK;
}
static lc_status put_set_node(tbuffer *buffer, const bn_request_node *node) {
    CHECK_STATUS(put_subop(buffer, node));
    if (node->subop != bn_set_reparent)
        return LC_OK;
    CHECK_STATUS(put_string(buffer, node->source));
    CHECK_STATUS(put_string(buffer, node->target));
    return LC_OK;
}
static lc_status put_no_node(tbuffer *, const bn_request_node *) {
    return LC_OK;
}

// Query: flags, database, revision condition. Set: commit flags, text, number.
static lc_status put_options(tbuffer *buffer, const bn_request_msg *msg) {
    CHECK_STATUS(put_u32(buffer, msg->flags));
    CHECK_STATUS(put_string(buffer, msg->text));
    CHECK_STATUS(put_u32(buffer, msg->number));
    return LC_OK;
}
static lc_status put_no_message(tbuffer *, const bn_request_msg *) {
    return LC_OK;
}
static lc_status put_message_name(tbuffer *buffer, const bn_request_msg *msg) {
    CHECK_STATUS(put_string(buffer, msg->text));
    return LC_OK;
}

// --- Reading
// --------------------------------------------------------------------------------------------------------

struct wire_reader {
    const tbuffer *buffer;
    uint32_t offset;
};

static lc_status get_bytes(wire_reader *reader, void *out, uint32_t count) {
    const uint32_t length = used(reader->buffer);
    CHECK_CONDITION(reader->offset <= length && count <= length - reader->offset);
    memcpy(out, tb_buf(reader->buffer) + reader->offset, count);
    reader->offset += count;
    return LC_OK;
}
static lc_status get_u32(wire_reader *reader, uint32_t *out) {
    be32 wire = {};
    CHECK_STATUS(get_bytes(reader, wire.bytes, sizeof wire));
    *out = to_host(wire);
    return LC_OK;
}
// An absent string and one of length 0 are the same on the wire; both come back as an empty one.
static lc_status get_string(wire_reader *reader, tstring **out) {
    uint32_t length = 0;
    CHECK_STATUS(get_u32(reader, &length));
    if (length > used(reader->buffer) - reader->offset)
        CHECK_STATUS(LC_NO_BUFFER_SPACE);
    owned_tstring text;
    CHECK_STATUS(ts_new_size(&text.pointer, length + 1));
    if (length > 0)
        CHECK_STATUS(ts_append_str_frag(
            text.pointer, reinterpret_cast<const char *>(tb_buf(reader->buffer)) + reader->offset, 0,
            static_cast<int32_t>(length)));
    reader->offset += length;
    *out = text.take();
    return LC_OK;
}

static lc_status get_parts(wire_reader *reader, tstr_array **out) {
    uint32_t count = 0;
    CHECK_STATUS(get_u32(reader, &count));
    owned_tstr_array parts;
    CHECK_STATUS(tstr_array_new(&parts.pointer, nullptr));
    for (uint32_t i = 0; i < count; i++) {
        owned_tstring part;
        CHECK_STATUS(get_string(reader, &part.pointer));
        CHECK_STATUS(tstr_array_append_takeover(parts.pointer, &part.pointer));
    }
    *out = parts.take();
    return LC_OK;
}

static lc_status get_attribute(wire_reader *reader, bn_binding *binding) {
    owned_attrib attribute;
    uint32_t count = 0;
    CHECK_STATUS(bn_attrib_read_wire(reader->buffer, reader->offset, &attribute.pointer, &count));
    reader->offset += count;
    CHECK_STATUS(bn_binding_set_attrib_takeover(binding, &attribute.pointer));
    return LC_OK;
}

static lc_status get_binding(wire_reader *reader, bn_binding **out) {
    uint8_t absolute = 0;
    CHECK_STATUS(get_bytes(reader, &absolute, sizeof absolute));
    owned_tstr_array parts;
    CHECK_STATUS(get_parts(reader, &parts.pointer));
    tstring *name = nullptr;
    owned_binding binding;
    CHECK_STATUS(bn_binding_new_parts_components_takeover(&binding.pointer, &name, &parts.pointer,
                                                          absolute ? 1 : 0, nullptr));
    // The name has them all, and they take more memory than everything else of a binding. What begins with an
    // empty part reads as an absolute name from here on.
    CHECK_STATUS(bn_binding_drop_name_parts(binding.pointer));
    binding.pointer->absolute = bn_binding_get_name_quick(binding.pointer)[0] == '/';
    uint32_t count = 0;
    CHECK_STATUS(get_u32(reader, &count));
    for (uint32_t i = 0; i < count; i++)
        CHECK_STATUS(get_attribute(reader, binding.pointer));
    *out = binding.take();
    return LC_OK;
}

static lc_status get_subop(wire_reader *reader, bn_request_node *node) {
    CHECK_STATUS(get_u32(reader, &node->subop));
    CHECK_STATUS(get_u32(reader, &node->flags));
    return LC_OK;
}
static lc_status get_set_node(wire_reader *reader, bn_request_node *node) {
    CHECK_STATUS(get_subop(reader, node));
    if (node->subop != bn_set_reparent)
        return LC_OK;
    CHECK_STATUS(get_string(reader, &node->source));
    CHECK_STATUS(get_string(reader, &node->target));
    return LC_OK;
}
static lc_status get_no_node(wire_reader *, bn_request_node *) {
    return LC_OK;
}
static lc_status get_options(wire_reader *reader, bn_request_msg *msg) {
    CHECK_STATUS(get_u32(reader, &msg->flags));
    CHECK_STATUS(get_string(reader, &msg->text));
    CHECK_STATUS(get_u32(reader, &msg->number));
    return LC_OK;
}
static lc_status get_no_message(wire_reader *, bn_request_msg *) {
    return LC_OK;
}
static lc_status get_message_name(wire_reader *reader, bn_request_msg *msg) {
    CHECK_STATUS(get_string(reader, &msg->text));
    return LC_OK;
}

// --- Requests
// -------------------------------------------------------------------------------------------------------

// What a request of each type has behind its nodes and behind itself.
struct request_trailers {
    uint16_t msg_type;
    lc_status (*put_node)(tbuffer *buffer, const bn_request_node *node);
    lc_status (*get_node)(wire_reader *reader, bn_request_node *node);
    lc_status (*put_message)(tbuffer *buffer, const bn_request_msg *msg);
    lc_status (*get_message)(wire_reader *reader, bn_request_msg *msg);
};
static const request_trailers request_types[] = {
    {bn_msg_query_request, put_subop, get_subop, put_options, get_options},
    {bn_msg_set_request, put_set_node, get_set_node, put_options, get_options},
    {bn_msg_action_request, put_no_node, get_no_node, put_message_name, get_message_name},
    {bn_msg_event, put_no_node, get_no_node, put_message_name, get_message_name},
};

// A message of another type is told in the log and has no trailers; who receives one refuses it by its type,
// and the session goes on.
static const request_trailers *trailers_of(uint16_t type) {
    static const request_trailers none = {0, put_no_node, get_no_node, put_no_message, get_no_message};
    for (const request_trailers &known : request_types)
        if (known.msg_type == type)
            return &known;
    LC_LOG(LC_LOG_ERR, "illegal messsage of type %d", type);
    return &none;
}

static lc_status start_buffer(uint32_t header_bytes, owned_tbuffer *out) {
    CHECK_STATUS(tb_new(&out->pointer));
    const uint8_t zero = 0;
    if (header_bytes > 0)
        CHECK_STATUS(tb_put_buf(out->pointer, header_bytes - 1, &zero, 1));
    return LC_OK;
}

lc_status bn_request_msg_serialize(bn_request_msg *msg, uint32_t header_bytes, tbuffer **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(msg);
    const request_trailers *trailers = trailers_of(msg->msg_type);
    owned_tbuffer buffer;
    CHECK_STATUS(start_buffer(header_bytes, &buffer));
    tbuffer *bytes = buffer.pointer;
    bn_wire_request_header header = {};
    msg->length = 0;
    CHECK_STATUS(tb_append_buf(bytes, &header, sizeof header));
    CHECK_STATUS(put_string(bytes, msg->audit_user));
    const uint32_t count_at = used(bytes);
    CHECK_STATUS(put_u32(bytes, 0));
    uint32_t written = 0;
    const uint32_t count = bn_request_per_node_array_length_quick(msg->nodes);
    for (uint32_t i = 0; i < count; i++) {
        const bn_request_node *node = bn_request_per_node_array_get_quick(msg->nodes, i);
        if (!node || !node->binding)
            continue;
        CHECK_STATUS(put_u32(bytes, node->node_id));
        CHECK_STATUS(put_name(bytes, node->binding));
        CHECK_STATUS(put_attributes(bytes, node->binding));
        CHECK_STATUS(trailers->put_node(bytes, node));
        written++;
    }
    CHECK_STATUS(put_u32_at(bytes, count_at, written));
    CHECK_STATUS(trailers->put_message(bytes, msg));
    msg->length = used(bytes);
    bn_byte_swap_request_header(msg, &header);
    CHECK_STATUS(tb_put_buf(bytes, header_bytes, &header, sizeof header));
    *out = buffer.take();
    return LC_OK;
}

lc_status bn_request_msg_deserialize(const tbuffer *buffer, uint32_t offset, bn_request_msg **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(buffer);
    wire_reader reader = {buffer, offset};
    bn_wire_request_header header = {};
    CHECK_STATUS(get_bytes(&reader, &header, sizeof header));
    const request_trailers *trailers = trailers_of(to_host(header.msg_type));
    owned_request msg;
    CHECK_STATUS(bn_request_msg_create(&msg.pointer, to_host(header.msg_type)));
    bn_byte_swap_request_header(&header, msg.pointer);
    CHECK_STATUS(get_string(&reader, &msg.pointer->audit_user));
    uint32_t count = 0;
    CHECK_STATUS(get_u32(&reader, &count));
    for (uint32_t i = 0; i < count; i++) {
        owned_request_node node(static_cast<bn_request_node *>(calloc(1, sizeof(bn_request_node))));
        CHECK_NULL(node.pointer);
        node.pointer->msg_type = msg.pointer->msg_type;
        CHECK_STATUS(get_u32(&reader, &node.pointer->node_id));
        CHECK_STATUS(get_binding(&reader, &node.pointer->binding));
        CHECK_STATUS(trailers->get_node(&reader, node.pointer));
        CHECK_STATUS(bn_request_per_node_array_append_takeover(msg.pointer->nodes, &node.pointer));
    }
    CHECK_STATUS(trailers->get_message(&reader, msg.pointer));
    *out = msg.take();
    return LC_OK;
}

// --- Responses
// ------------------------------------------------------------------------------------------------------

static bool has_revision(uint16_t msg_type) {
    return msg_type == bn_msg_query_response || msg_type == bn_msg_set_response;
}

lc_status bn_response_msg_serialize(bn_response_msg *msg, uint32_t header_bytes, tbuffer **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(msg);
    owned_tbuffer buffer;
    CHECK_STATUS(start_buffer(header_bytes, &buffer));
    tbuffer *bytes = buffer.pointer;
    bn_wire_response_header header = {};
    msg->length = 0;
    CHECK_STATUS(tb_append_buf(bytes, &header, sizeof header));
    CHECK_STATUS(put_u32(bytes, msg->return_code));
    CHECK_STATUS(put_string(bytes, msg->return_message));
    const uint32_t count_at = used(bytes);
    CHECK_STATUS(put_u32(bytes, 0));
    uint32_t written = 0;
    const uint32_t count = bn_response_per_node_array_length_quick(msg->nodes);
    for (uint32_t i = 0; i < count; i++) {
        const bn_response_node *node = bn_response_per_node_array_get_quick(msg->nodes, i);
        if (!node || !node->binding)
            continue;
        CHECK_STATUS(put_u32(bytes, node->node_id));
        CHECK_STATUS(put_name(bytes, node->binding));
        CHECK_STATUS(put_attributes(bytes, node->binding));
        written++;
    }
    CHECK_STATUS(put_u32_at(bytes, count_at, written));
    if (has_revision(msg->msg_type))
        CHECK_STATUS(put_u32(bytes, msg->db_revision_id));
    msg->length = used(bytes);
    bn_byte_swap_response_header(msg, &header);
    CHECK_STATUS(tb_put_buf(bytes, header_bytes, &header, sizeof header));
    *out = buffer.take();
    return LC_OK;
}

lc_status bn_response_msg_deserialize(const tbuffer *buffer, uint32_t offset, bn_response_msg **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(buffer);
    wire_reader reader = {buffer, offset};
    bn_wire_response_header header = {};
    CHECK_STATUS(get_bytes(&reader, &header, sizeof header));
    owned_response msg;
    CHECK_STATUS(bn_response_msg_create(&msg.pointer, to_host(header.msg_type), 0, 0, nullptr));
    bn_byte_swap_response_header(&header, msg.pointer);
    CHECK_STATUS(get_u32(&reader, &msg.pointer->return_code));
    CHECK_STATUS(get_string(&reader, &msg.pointer->return_message));
    uint32_t count = 0;
    CHECK_STATUS(get_u32(&reader, &count));
    for (uint32_t i = 0; i < count; i++) {
        uint32_t node_id = 0;
        owned_binding binding;
        CHECK_STATUS(get_u32(&reader, &node_id));
        CHECK_STATUS(get_binding(&reader, &binding.pointer));
        CHECK_STATUS(bn_response_msg_append_binding_takeover(msg.pointer, &binding.pointer, node_id));
    }
    if (has_revision(msg.pointer->msg_type))
        CHECK_STATUS(get_u32(&reader, &msg.pointer->db_revision_id));
    *out = msg.take();
    return LC_OK;
}
