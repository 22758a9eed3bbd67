// Messages on the wire. All integers are big-endian; a string is a 4-byte length and that many bytes, without
// a NUL.
//
//   header (below); request: audit user, string; response: return code, and return message, string
//   node count, then for each node:
//     id; absolute, 1 byte; number of name parts; each part as a string, without escapes
//     number of attributes; each attribute (bnode_attrib_wire.cpp); node trailer by message type
//   message trailer by message type
//
// A received message is read twice. The first pass checks every field against the bytes received and adds up
// the memory that the nodes need; the second pass fills a block (bnode_block.h) of that size. Both passes
// read with the same functions and therefore can't disagree. A message with a false count or length is
// refused before anything is allocated for it. A node takes at most eight times its bytes on the wire.
#include <cstdlib>
#include <cstring>

#include "mgmt/bnode_block.h"
#include "mgmt/bnode_names.h"
#include "mgmt/bnode_proto.h"
#include "mgmt/bnode_proto_arrays.h"
#include "mgmt/bnode_rows.h"
#include "runtime/byte_order.h"
#include "runtime/logging.h"

namespace {

// The headers, which follow the frame header.
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

void bn_byte_swap_request_header(const bn_request_msg *msg, bn_wire_request_header *out) {
    *out = {to_be16(msg->service_id), to_be16(msg->msg_type), to_be32(msg->length), to_be32(msg->msg_id),
            to_be32(msg->transaction_id)};
}
void bn_byte_swap_request_header(const bn_wire_request_header *wire, bn_request_msg *msg) {
    msg->service_id = to_host(wire->service_id);
    msg->msg_type = to_host(wire->msg_type);
    msg->length = to_host(wire->length);
    msg->msg_id = to_host(wire->msg_id);
    msg->transaction_id = to_host(wire->transaction_id);
}
void bn_byte_swap_response_header(const bn_response_msg *msg, bn_wire_response_header *out) {
    *out = {to_be16(msg->service_id), to_be16(msg->msg_type),       to_be32(msg->length),
            to_be32(msg->msg_id),     to_be32(msg->transaction_id), to_be32(msg->response_to)};
}
void bn_byte_swap_response_header(const bn_wire_response_header *wire, bn_response_msg *msg) {
    msg->service_id = to_host(wire->service_id);
    msg->msg_type = to_host(wire->msg_type);
    msg->length = to_host(wire->length);
    msg->msg_id = to_host(wire->msg_id);
    msg->transaction_id = to_host(wire->transaction_id);
    msg->response_to = to_host(wire->response_to);
}

// --- Writing

lc_status put_u32(tbuffer *buffer, uint32_t value) {
    const be32 wire = to_be32(value);
    CHECK_STATUS(tb_append_buf(buffer, wire.bytes, sizeof wire));
    return LC_OK;
}
lc_status put_u32_at(tbuffer *buffer, uint32_t offset, uint32_t value) {
    const be32 wire = to_be32(value);
    CHECK_STATUS(tb_put_buf(buffer, offset, wire.bytes, sizeof wire));
    return LC_OK;
}
lc_status put_string(tbuffer *buffer, const tstring *text) {
    const int32_t length = text ? ts_length(text) : 0;
    CHECK_STATUS(put_u32(buffer, static_cast<uint32_t>(length)));
    if (length > 0)
        CHECK_STATUS(tb_append_buf(buffer, ts_str(text), static_cast<uint32_t>(length)));
    return LC_OK;
}
uint32_t bytes_used(const tbuffer *buffer) {
    return static_cast<uint32_t>(tb_length(buffer));
}

// Writes one part of a name without its escapes, in runs of bytes that need no change.
lc_status put_unescaped_part(tbuffer *buffer, const char *part, const char *end) {
    // The length is known only after the escapes have been removed.
    const uint32_t length_at = bytes_used(buffer);
    CHECK_STATUS(put_u32(buffer, 0));
    const char *run = part;
    for (; part < end; part++)
        if (bn_escapes(part)) {
            CHECK_STATUS(tb_append_buf(buffer, run, static_cast<uint32_t>(part - run)));
            run = ++part; // begins with the character that was escaped
        }
    CHECK_STATUS(tb_append_buf(buffer, run, static_cast<uint32_t>(end - run)));
    CHECK_STATUS(put_u32_at(buffer, length_at, bytes_used(buffer) - length_at - 4));
    return LC_OK;
}
// Splits the name while it writes it, since making an array of parts for each binding of a message would be
// slow.
lc_status put_name_text(tbuffer *buffer, const char *name) {
    const bool absolute = *name == '/';
    CHECK_STATUS(tb_append_uint8(buffer, absolute));
    const uint32_t count_at = bytes_used(buffer);
    CHECK_STATUS(put_u32(buffer, 0));
    const char *part = name + absolute;
    uint32_t count = 0;
    // `*part || count`: an empty name has no parts, but a name that ends with a separator has an empty last
    // one.
    for (const char *end; *part || count; part = end + 1) {
        end = bn_part_end(part);
        CHECK_STATUS(put_unescaped_part(buffer, part, end));
        count++;
        if (!*end)
            break;
    }
    CHECK_STATUS(put_u32_at(buffer, count_at, count));
    return LC_OK;
}
lc_status put_name(tbuffer *buffer, const bn_binding *binding) {
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

lc_status put_attributes(tbuffer *buffer, const bn_binding *binding) {
    const uint32_t count_at = bytes_used(buffer);
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

// The fields between the header and the nodes.
lc_status put_message_head(tbuffer *buffer, const bn_request_msg *msg) {
    CHECK_STATUS(put_string(buffer, msg->audit_user));
    return LC_OK;
}
lc_status put_message_head(tbuffer *buffer, const bn_response_msg *msg) {
    CHECK_STATUS(put_u32(buffer, msg->return_code));
    CHECK_STATUS(put_string(buffer, msg->return_message));
    return LC_OK;
}

lc_status put_subop(tbuffer *buffer, const bn_request_node *node) {
    CHECK_STATUS(put_u32(buffer, node->subop));
    CHECK_STATUS(put_u32(buffer, node->flags));
    return LC_OK;
}
lc_status put_set_node(tbuffer *buffer, const bn_request_node *node) {
    CHECK_STATUS(put_subop(buffer, node));
    if (node->subop != bn_set_reparent)
        return LC_OK;
    CHECK_STATUS(put_string(buffer, node->source));
    CHECK_STATUS(put_string(buffer, node->target));
    return LC_OK;
}
// For a query the flags, database name and revision condition; for a set request the commit flags, text and
// number.
lc_status put_options(tbuffer *buffer, const bn_request_msg *msg) {
    CHECK_STATUS(put_u32(buffer, msg->flags));
    CHECK_STATUS(put_string(buffer, msg->text));
    CHECK_STATUS(put_u32(buffer, msg->number));
    return LC_OK;
}
lc_status put_message_name(tbuffer *buffer, const bn_request_msg *msg) {
    CHECK_STATUS(put_string(buffer, msg->text));
    return LC_OK;
}
lc_status put_revision(tbuffer *buffer, const bn_response_msg *msg) {
    CHECK_STATUS(put_u32(buffer, msg->db_revision_id));
    return LC_OK;
}

// --- Reading

struct wire_reader {
    const tbuffer *buffer;
    const uint8_t *at, *end;
};
// A string in the buffer.
struct wire_text {
    const uint8_t *bytes;
    uint32_t length;
};

size_t bytes_left(const wire_reader *reader) {
    return static_cast<size_t>(reader->end - reader->at);
}
lc_status get_bytes(wire_reader *reader, void *out, size_t count) {
    CHECK_CONDITION(count <= bytes_left(reader));
    memcpy(out, reader->at, count);
    reader->at += count;
    return LC_OK;
}
lc_status get_u32(wire_reader *reader, uint32_t *out) {
    be32 wire = {};
    CHECK_STATUS(get_bytes(reader, wire.bytes, sizeof wire));
    *out = to_host(wire);
    return LC_OK;
}
lc_status locate_text(wire_reader *reader, wire_text *out) {
    CHECK_STATUS(get_u32(reader, &out->length));
    if (out->length > bytes_left(reader))
        CHECK_STATUS(LC_NO_BUFFER_SPACE);
    out->bytes = reader->at;
    reader->at += out->length;
    return LC_OK;
}
lc_status locate_checked_text(wire_reader *reader, wire_text *out) {
    CHECK_STATUS(locate_text(reader, out));
    CHECK_STATUS(bn_check_text(out->bytes, out->length));
    CHECK_CONDITION(out->length < ts_size_max);
    return LC_OK;
}
// A null string is sent as one of length 0, and is received as an empty one.
lc_status get_string(wire_reader *reader, tstring **out) {
    wire_text found = {};
    CHECK_STATUS(locate_checked_text(reader, &found));
    CHECK_STATUS(ts_new_size(out, found.length + 1));
    // This would stop at a NUL, but a checked text contains none.
    CHECK_STATUS(ts_append_str_frag(*out, reinterpret_cast<const char *>(found.bytes), 0,
                                    static_cast<int32_t>(found.length)));
    return LC_OK;
}

lc_status get_message_head(wire_reader *reader, bn_request_msg *msg) {
    CHECK_STATUS(get_string(reader, &msg->audit_user));
    return LC_OK;
}
lc_status get_message_head(wire_reader *reader, bn_response_msg *msg) {
    CHECK_STATUS(get_u32(reader, &msg->return_code));
    CHECK_STATUS(get_string(reader, &msg->return_message));
    return LC_OK;
}
lc_status get_options(wire_reader *reader, bn_request_msg *msg) {
    CHECK_STATUS(get_u32(reader, &msg->flags));
    CHECK_STATUS(get_string(reader, &msg->text));
    CHECK_STATUS(get_u32(reader, &msg->number));
    return LC_OK;
}
lc_status get_message_name(wire_reader *reader, bn_request_msg *msg) {
    CHECK_STATUS(get_string(reader, &msg->text));
    return LC_OK;
}
lc_status get_revision(wire_reader *reader, bn_response_msg *msg) {
    CHECK_STATUS(get_u32(reader, &msg->db_revision_id));
    return LC_OK;
}

// --- Reading nodes: measure_... are the first pass, place_... the second

// A name in the buffer, and its form as text: its parts are escaped and joined. An absolute name begins with
// a separator; if its first part is empty it has one already, and none is added.
struct wire_name {
    const uint8_t *first; // where its first part begins
    uint32_t parts;
    bool leading;  // a separator is added
    bool absolute; // begins with a separator
    bool bare;     // is "" or "/"
    size_t length; // of the text, in bytes
};
// The results of the first pass, for the second.
struct message_extent {
    bn_block_size size;
    bool escapes; // some name has a character that must be escaped
    bool checked; // the first pass is complete
};

// Without a branch in the loop, so that the compiler can vectorise it: this looks at every byte of every
// name.
bool has_special(const wire_text *part) {
    bool special = false;
    for (uint32_t i = 0; i < part->length; i++) {
        const uint8_t byte = part->bytes[i];
        special |= byte == 0 || byte == '/' || byte == '\\';
    }
    return special;
}
// Writes a part with its escapes, and returns its length; with a null `out` it only counts. A backslash is
// escaped before another backslash and before a slash, also before the separator that follows the part
// (`separated`).
size_t write_escaped(const wire_text *part, bool separated, char *out) {
    const uint8_t *at = part->bytes, *end = at + part->length;
    size_t length = 0;
    for (; at < end; at++) {
        const uint8_t next = at + 1 < end ? at[1] : separated ? '/' : 0;
        const bool escaped = *at == '/' || (*at == '\\' && (next == '/' || next == '\\'));
        if (out && escaped)
            out[length] = '\\';
        length += escaped;
        if (out)
            out[length] = static_cast<char>(*at);
        length++;
    }
    return length;
}
lc_status measure_part(const wire_text *part, bool separated, message_extent *extent, size_t *inout_length) {
    // Only the first pass looks for them. From the first name with a special character on, lengths are
    // counted with escapes; for all other names that makes no difference.
    if (!extent->checked && has_special(part)) {
        CHECK_STATUS(bn_check_text(part->bytes, part->length));
        extent->escapes = true;
    }
    *inout_length += extent->escapes ? write_escaped(part, separated, nullptr) : part->length;
    return LC_OK;
}
// Reads the name and advances the reader past it.
lc_status measure_name(wire_reader *reader, message_extent *extent, wire_name *out) {
    uint8_t absolute = 0;
    CHECK_STATUS(get_bytes(reader, &absolute, sizeof absolute));
    CHECK_STATUS(get_u32(reader, &out->parts));
    out->first = reader->at;
    // One separator between two parts.
    out->length = out->parts ? out->parts - 1 : 0;
    bool first_is_empty = false;
    // The number of parts may be false, but each takes at least its length word: the loop ends with the
    // buffer.
    for (uint32_t i = 0; i < out->parts; i++) {
        wire_text part = {};
        CHECK_STATUS(locate_text(reader, &part));
        CHECK_STATUS(measure_part(&part, i + 1 < out->parts, extent, &out->length));
        first_is_empty = i ? first_is_empty : part.length == 0;
    }
    const bool begins_with_separator = out->parts > 1 && first_is_empty;
    out->leading = absolute && !begins_with_separator;
    out->absolute = absolute || begins_with_separator;
    out->length += out->leading;
    out->bare = out->length == (out->absolute ? 1 : 0);
    CHECK_CONDITION(out->length < ts_size_max);
    return LC_OK;
}
lc_status write_name(const wire_reader *reader, const wire_name *name, bool escapes, char *out) {
    // The room at `out` is what measure_name has counted, with the same escapes.
    wire_reader parts = {reader->buffer, name->first, reader->end};
    if (name->leading)
        *out++ = '/';
    for (uint32_t i = 0; i < name->parts; i++) {
        wire_text part = {};
        CHECK_STATUS(locate_text(&parts, &part));
        if (i)
            *out++ = '/';
        if (!escapes)
            memcpy(out, part.bytes, part.length);
        out += escapes ? write_escaped(&part, i + 1 < name->parts, out) : part.length;
    }
    return LC_OK;
}

// Locates an attribute and advances the reader past it.
lc_status locate_attribute(wire_reader *reader, bn_wire_attrib *out) {
    const auto offset = static_cast<uint32_t>(reader->at - reader->buffer->buffer);
    CHECK_STATUS(bn_wire_locate(reader->buffer, offset, 0, out));
    reader->at += out->used;
    return LC_OK;
}
lc_status measure_binding(wire_reader *reader, message_extent *extent) {
    bn_block_size *size = &extent->size;
    wire_name name = {};
    uint32_t count = 0;
    CHECK_STATUS(measure_name(reader, extent, &name));
    CHECK_STATUS(get_u32(reader, &count));
    for (uint32_t i = 0; i < count; i++) {
        bn_wire_attrib found = {};
        CHECK_STATUS(locate_attribute(reader, &found));
        if (bn_wire_has_text(&found))
            bn_size_text(size, found.length);
    }
    bn_size_binding(size, name.length, name.bare, count);
    return LC_OK;
}
lc_status place_attribute(wire_reader *reader, bn_block_builder *builder, bn_attrib_array *array) {
    bn_wire_attrib found = {};
    CHECK_STATUS(locate_attribute(reader, &found));
    auto *attrib = static_cast<bn_attrib *>(bn_place_record(builder, sizeof(bn_attrib)));
    CHECK_NULL(attrib);
    char *text = nullptr;
    if (bn_wire_has_text(&found)) {
        text = bn_place_text(builder, found.length);
        CHECK_NULL(text);
        memcpy(text, found.value, found.length);
    }
    bn_wire_fill(&found, text, attrib);
    // If the id occurs twice, the later attribute counts, and the earlier record stays in the block unused.
    CHECK_STATUS(bn_attrib_array_put_placed(array, found.id, attrib));
    return LC_OK;
}
lc_status place_binding(wire_reader *reader, message_extent *extent, bn_block_builder *builder,
                        bn_binding **out) {
    wire_name name = {};
    uint32_t count = 0;
    CHECK_STATUS(measure_name(reader, extent, &name));
    CHECK_STATUS(get_u32(reader, &count));
    owned_binding binding;
    char *text = nullptr;
    CHECK_STATUS(
        bn_place_binding(builder, name.length, name.bare, name.absolute, count, &binding.pointer, &text));
    // A bare name has been written already.
    if (text)
        CHECK_STATUS(write_name(reader, &name, extent->escapes, text));
    for (uint32_t i = 0; i < count; i++)
        CHECK_STATUS(place_attribute(reader, builder, binding.pointer->attributes));
    *out = binding.take();
    return LC_OK;
}

lc_status skip_subop(wire_reader *reader, uint32_t *out_subop) {
    uint32_t flags = 0;
    CHECK_STATUS(get_u32(reader, out_subop));
    CHECK_STATUS(get_u32(reader, &flags));
    return LC_OK;
}
lc_status measure_query_node(wire_reader *reader, bn_block_size *) {
    uint32_t subop = 0;
    return skip_subop(reader, &subop);
}
lc_status measure_set_node(wire_reader *reader, bn_block_size *size) {
    uint32_t subop = 0;
    CHECK_STATUS(skip_subop(reader, &subop));
    for (int i = 0; i < 2 && subop == bn_set_reparent; i++) {
        wire_text text = {};
        CHECK_STATUS(locate_checked_text(reader, &text));
        bn_size_record(size, sizeof(tstring));
        bn_size_text(size, text.length);
    }
    return LC_OK;
}
lc_status place_query_node(wire_reader *reader, bn_block_builder *, bn_request_node *node) {
    CHECK_STATUS(get_u32(reader, &node->subop));
    CHECK_STATUS(get_u32(reader, &node->flags));
    return LC_OK;
}
lc_status place_string(wire_reader *reader, bn_block_builder *builder, tstring **out) {
    wire_text text = {};
    CHECK_STATUS(locate_checked_text(reader, &text));
    CHECK_STATUS(bn_place_string(builder, reinterpret_cast<const char *>(text.bytes), text.length, out));
    return LC_OK;
}
lc_status place_set_node(wire_reader *reader, bn_block_builder *builder, bn_request_node *node) {
    CHECK_STATUS(place_query_node(reader, builder, node));
    if (node->subop != bn_set_reparent)
        return LC_OK;
    CHECK_STATUS(place_string(reader, builder, &node->source));
    CHECK_STATUS(place_string(reader, builder, &node->target));
    return LC_OK;
}

// --- The two kinds of message

// How the trailers of a message type are written and read; null functions for a type without that trailer.
template <typename Message, typename Node>
struct message_trailers {
    uint16_t msg_type;
    lc_status (*put_node)(tbuffer *buffer, const Node *node);
    lc_status (*measure_node)(wire_reader *reader, bn_block_size *size);
    lc_status (*place_node)(wire_reader *reader, bn_block_builder *builder, Node *node);
    lc_status (*put_message)(tbuffer *buffer, const Message *msg);
    lc_status (*get_message)(wire_reader *reader, Message *msg);
};
using request_trailers = message_trailers<bn_request_msg, bn_request_node>;
using response_trailers = message_trailers<bn_response_msg, bn_response_node>;
const request_trailers request_types[] = {
    {bn_msg_query_request, put_subop, measure_query_node, place_query_node, put_options, get_options},
    {bn_msg_set_request, put_set_node, measure_set_node, place_set_node, put_options, get_options},
    {bn_msg_action_request, nullptr, nullptr, nullptr, put_message_name, get_message_name},
    {bn_msg_event, nullptr, nullptr, nullptr, put_message_name, get_message_name},
};
const response_trailers response_types[] = {
    {bn_msg_query_response, nullptr, nullptr, nullptr, put_revision, get_revision},
    {bn_msg_set_response, nullptr, nullptr, nullptr, put_revision, get_revision},
};

template <typename Trailers, size_t Count>
Trailers find_trailers(const Trailers (&types)[Count], uint16_t type) {
    for (const Trailers &known : types)
        if (known.msg_type == type)
            return known;
    return {};
}

struct request_kind {
    using message = bn_request_msg;
    using node = bn_request_node;
    using owner = owned_request;
    using header = bn_wire_request_header;
    static constexpr auto node_count = bn_request_per_node_array_length_quick;
    static constexpr auto node_at = bn_request_per_node_array_get_quick;
    static constexpr auto append = bn_request_per_node_array_append_takeover;
    // Another type is logged and read without trailers. The receive path then refuses it by its type, without
    // ending the session.
    static request_trailers trailers_of(uint16_t type) {
        const request_trailers found = find_trailers(request_types, type);
        if (!found.msg_type)
            LC_LOG(LC_LOG_ERR, "illegal messsage of type %d", type);
        return found;
    }
    static constexpr auto new_message = bn_request_msg_new;
    static constexpr auto new_nodes = bn_request_nodes_new;
    static void swap(const message *msg, header *out) { bn_byte_swap_request_header(msg, out); }
    static void swap(const header *wire, message *out) { bn_byte_swap_request_header(wire, out); }
};
struct response_kind {
    using message = bn_response_msg;
    using node = bn_response_node;
    using owner = owned_response;
    using header = bn_wire_response_header;
    static constexpr auto node_count = bn_response_per_node_array_length_quick;
    static constexpr auto node_at = bn_response_per_node_array_get_quick;
    static constexpr auto append = bn_response_per_node_array_append_takeover;
    static response_trailers trailers_of(uint16_t type) { return find_trailers(response_types, type); }
    static constexpr auto new_message = bn_response_msg_new;
    static constexpr auto new_nodes = bn_response_nodes_new;
    static void swap(const message *msg, header *out) { bn_byte_swap_response_header(msg, out); }
    static void swap(const header *wire, message *out) { bn_byte_swap_response_header(wire, out); }
};

lc_status start_buffer(uint32_t header_bytes, owned_tbuffer *out) {
    CHECK_STATUS(tb_new(&out->pointer));
    const uint8_t zero = 0;
    // Writing the last byte fills everything before it with zeros.
    if (header_bytes > 0)
        CHECK_STATUS(tb_put_buf(out->pointer, header_bytes - 1, &zero, 1));
    return LC_OK;
}

template <typename Kind>
lc_status serialize_message(typename Kind::message *msg, uint32_t header_bytes, tbuffer **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(msg);
    const auto trailers = Kind::trailers_of(msg->msg_type);
    owned_tbuffer buffer;
    CHECK_STATUS(start_buffer(header_bytes, &buffer));
    tbuffer *bytes = buffer.pointer;
    // Room for the header, which is written at the end, when the length is known.
    typename Kind::header header = {};
    msg->length = 0;
    CHECK_STATUS(tb_append_buf(bytes, &header, sizeof header));
    CHECK_STATUS(put_message_head(bytes, msg));
    // The count is filled in after the nodes, since not all of them may be written.
    const uint32_t count_at = bytes_used(bytes);
    CHECK_STATUS(put_u32(bytes, 0));
    uint32_t written = 0;
    const uint32_t count = Kind::node_count(msg->nodes);
    for (uint32_t i = 0; i < count; i++) {
        const auto *node = Kind::node_at(msg->nodes, i);
        // A node whose binding has been moved out is left out and not counted.
        if (!node || !node->binding)
            continue;
        CHECK_STATUS(put_u32(bytes, node->node_id));
        CHECK_STATUS(put_name(bytes, node->binding));
        CHECK_STATUS(put_attributes(bytes, node->binding));
        if (trailers.put_node)
            CHECK_STATUS(trailers.put_node(bytes, node));
        written++;
    }
    CHECK_STATUS(put_u32_at(bytes, count_at, written));
    if (trailers.put_message)
        CHECK_STATUS(trailers.put_message(bytes, msg));
    msg->length = bytes_used(bytes);
    Kind::swap(msg, &header);
    CHECK_STATUS(tb_put_buf(bytes, header_bytes, &header, sizeof header));
    *out = buffer.take();
    return LC_OK;
}

template <typename Kind, typename Trailers>
lc_status measure_nodes(wire_reader *reader, uint32_t count, const Trailers *trailers,
                        message_extent *extent) {
    for (uint32_t i = 0; i < count; i++) {
        uint32_t node_id = 0;
        bn_size_record(&extent->size, sizeof(typename Kind::node));
        CHECK_STATUS(get_u32(reader, &node_id));
        CHECK_STATUS(measure_binding(reader, extent));
        if (trailers->measure_node)
            CHECK_STATUS(trailers->measure_node(reader, &extent->size));
    }
    extent->checked = true;
    return LC_OK;
}
template <typename Kind, typename Trailers>
lc_status place_nodes(wire_reader *reader, uint32_t count, const Trailers *trailers, message_extent *extent,
                      typename Kind::message *msg) {
    bn_block_builder builder = {};
    CHECK_STATUS(bn_block_new(&extent->size, &builder));
    msg->block = builder.block;
    for (uint32_t i = 0; i < count; i++) {
        auto *node =
            static_cast<typename Kind::node *>(bn_place_record(&builder, sizeof(typename Kind::node)));
        CHECK_NULL(node);
        node->placed = true;
        node->msg_type = msg->msg_type;
        CHECK_STATUS(get_u32(reader, &node->node_id));
        CHECK_STATUS(place_binding(reader, extent, &builder, &node->binding));
        // The message owns the node from here on: a later failure frees it with the message.
        CHECK_STATUS(Kind::append(msg->nodes, &node));
        if (trailers->place_node)
            CHECK_STATUS(trailers->place_node(reader, &builder, Kind::node_at(msg->nodes, i)));
    }
    return LC_OK;
}

// Nodes are allocated only after all of them and the message trailer have been checked.
template <typename Kind>
lc_status deserialize_message(const tbuffer *buffer, uint32_t offset, typename Kind::message **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(buffer);
    CHECK_CONDITION(offset <= buffer->length);
    wire_reader reader = {buffer, buffer->buffer + offset, buffer->buffer + buffer->length};
    typename Kind::header header = {};
    CHECK_STATUS(get_bytes(&reader, &header, sizeof header));
    typename Kind::owner msg;
    CHECK_STATUS(Kind::new_message(&msg.pointer, to_host(header.msg_type)));
    Kind::swap(&header, msg.pointer);
    const auto trailers = Kind::trailers_of(msg.pointer->msg_type);
    CHECK_STATUS(get_message_head(&reader, msg.pointer));
    uint32_t count = 0;
    message_extent extent = {};
    CHECK_STATUS(get_u32(&reader, &count));
    // The second pass starts here as well.
    wire_reader nodes = reader;
    CHECK_STATUS(measure_nodes<Kind>(&reader, count, &trailers, &extent));
    if (trailers.get_message)
        CHECK_STATUS(trailers.get_message(&reader, msg.pointer));
    // The count can be trusted now: the first pass has read that many nodes.
    CHECK_STATUS(Kind::new_nodes(&msg.pointer->nodes, count));
    if (count)
        CHECK_STATUS(place_nodes<Kind>(&nodes, count, &trailers, &extent, msg.pointer));
    *out = msg.take();
    return LC_OK;
}

} // namespace

lc_status bn_request_msg_serialize(bn_request_msg *msg, uint32_t header_bytes, tbuffer **out) {
    return serialize_message<request_kind>(msg, header_bytes, out);
}
lc_status bn_response_msg_serialize(bn_response_msg *msg, uint32_t header_bytes, tbuffer **out) {
    return serialize_message<response_kind>(msg, header_bytes, out);
}
lc_status bn_request_msg_deserialize(const tbuffer *buffer, uint32_t offset, bn_request_msg **out) {
    return deserialize_message<request_kind>(buffer, offset, out);
}
lc_status bn_response_msg_deserialize(const tbuffer *buffer, uint32_t offset, bn_response_msg **out) {
    return deserialize_message<response_kind>(buffer, offset, out);
}
