#include <gtest/gtest.h>

#include <string>

#include "mgmt/bnode_proto.h"
#include "tests/support/log_lines.cpp" // this program is linked without the engine's helpers
#include "tests/support/owners.h"

using request_owner = owner<bn_request_msg, bn_request_msg_free>;
using response_owner = owner<bn_response_msg, bn_response_msg_free>;
using binding_owner = owner<bn_binding, bn_binding_free>;
using bindings_owner = owner<bn_binding_array, bn_binding_array_free>;
using ids_owner = owner<uint32_array, uint32_array_free>;
using string_owner = owner<tstring, ts_free>;
using buffer_owner = owner<tbuffer, tb_free>;

static std::string u8(uint32_t value) {
    return std::string(1, static_cast<char>(value));
}
static std::string u16(uint32_t value) {
    return u8(value >> 8) + u8(value & 255);
}
static std::string u32(uint32_t value) {
    return u16(value >> 16) + u16(value & 0xffff);
}
static std::string str(const std::string &text) {
    return u32(static_cast<uint32_t>(text.size())) + text;
}
// Kind, id, type and flags, and the value with its length.
static std::string text_attribute(uint32_t id, uint32_t type, const std::string &text) {
    return u32(4) + u32(id) + u32(type) + u32(0) + str(text);
}
static const std::string room(32, '\0');

static std::string bytes_of(const tbuffer *buffer) {
    return {reinterpret_cast<const char *>(tb_buf(buffer)), static_cast<size_t>(tb_length(buffer))};
}
static void fill(tbuffer **out, const std::string &bytes) {
    ASSERT_EQ(tb_new(out), 0);
    ASSERT_EQ(tb_append_buf(*out, bytes.data(), static_cast<uint32_t>(bytes.size())), 0);
}
static lc_status read_request(const std::string &bytes, bn_request_msg **out) {
    buffer_owner buffer;
    fill(&buffer, bytes);
    return bn_request_msg_deserialize(buffer, 32, out);
}
static lc_status read_response(const std::string &bytes, bn_response_msg **out) {
    buffer_owner buffer;
    fill(&buffer, bytes);
    return bn_response_msg_deserialize(buffer, 32, out);
}

// Reads back what was written, byte for byte, and refuses everything shorter.
static void expect_request(bn_request_msg *msg, const std::string &golden) {
    buffer_owner written;
    ASSERT_EQ(bn_request_msg_serialize(msg, 32, &written), 0);
    ASSERT_EQ(bytes_of(written), room + golden);
    EXPECT_EQ(msg->length, 32 + golden.size());
    request_owner read;
    ASSERT_EQ(read_request(room + golden, &read), 0);
    buffer_owner again;
    ASSERT_EQ(bn_request_msg_serialize(read, 32, &again), 0);
    EXPECT_EQ(bytes_of(again), room + golden);
    for (size_t length = 0; length < golden.size(); length++) {
        request_owner cut;
        const lc_status status = read_request(room + golden.substr(0, length), &cut);
        EXPECT_TRUE(status == LC_ASSERTION || status == LC_NO_BUFFER_SPACE) << length << ": " << status;
        EXPECT_EQ(cut.pointer, nullptr);
    }
}
static void expect_response(bn_response_msg *msg, const std::string &golden) {
    buffer_owner written;
    ASSERT_EQ(bn_response_msg_serialize(msg, 32, &written), 0);
    ASSERT_EQ(bytes_of(written), room + golden);
    response_owner read;
    ASSERT_EQ(read_response(room + golden, &read), 0);
    buffer_owner again;
    ASSERT_EQ(bn_response_msg_serialize(read, 32, &again), 0);
    EXPECT_EQ(bytes_of(again), room + golden);
    for (size_t length = 0; length < golden.size(); length++) {
        response_owner cut;
        const lc_status status = read_response(room + golden.substr(0, length), &cut);
        EXPECT_TRUE(status == LC_ASSERTION || status == LC_NO_BUFFER_SPACE) << length << ": " << status;
    }
}
static std::string request_header(uint32_t type, size_t rest) {
    return u16(100) + u16(type) + u32(static_cast<uint32_t>(48 + rest)) + u32(7) + u32(8);
}
static void number(bn_request_msg *msg) {
    msg->service_id = 100;
    msg->msg_id = 7;
    msg->transaction_id = 8;
}

TEST(messages, query_request_bytes) {
    request_owner msg;
    ASSERT_EQ(bn_query_request_msg_create(&msg, 0, nullptr), 0);
    number(msg);
    uint32_t id = 0;
    ASSERT_EQ(bn_query_request_msg_append_str(msg, bn_query_get, 0, "/a/b", &id), 0);
    EXPECT_EQ(id, 1000u);
    ASSERT_EQ(bn_query_request_msg_append_str(msg, bn_query_iterate, 0x3000, "/x\\/y", &id), 0);
    EXPECT_EQ(id, 1001u);
    const std::string rest = str("") + u32(2) + u32(1000) + u8(1) + u32(2) + str("a") + str("b") + u32(0) +
                             u32(1) + u32(0) + u32(1001) + u8(1) + u32(1) + str("x/y") + u32(0) + u32(2) +
                             u32(0x3000) + u32(0) + str("") + u32(0);
    expect_request(msg, request_header(1, rest.size()) + rest);
}

TEST(messages, set_action_and_event_bytes) {
    request_owner set;
    ASSERT_EQ(bn_set_request_msg_create(&set, 5), 0);
    number(set);
    binding_owner binding;
    ASSERT_EQ(bn_binding_new_str(&binding, "/n", bn_attrib_value, bn_type_str, 0, "v"), 0);
    ASSERT_EQ(bn_binding_set_str(binding, bn_attrib_revision_id, bn_type_str, 0, "r"), 0);
    ASSERT_EQ(bn_set_request_msg_append_binding_takeover(set, bn_set_reparent, 9, &binding.pointer, nullptr),
              0);
    EXPECT_EQ(binding.pointer, nullptr);
    std::string rest = str("") + u32(1) + u32(1000) + u8(1) + u32(1) + str("n") + u32(2) +
                       text_attribute(1, bn_type_str, "v") + text_attribute(129, bn_type_str, "r") + u32(5) +
                       u32(9) + str("") + str("") + u32(5) + str("") + u32(0);
    expect_request(set, request_header(3, rest.size()) + rest);

    request_owner action;
    ASSERT_EQ(bn_action_request_msg_create(&action, "/do"), 0);
    number(action);
    ASSERT_EQ(bn_action_request_msg_append_new_binding(action, 0, "event_name", bn_type_name, "/e", nullptr),
              0);
    rest = str("") + u32(1) + u32(1000) + u8(0) + u32(1) + str("event_name") + u32(1) +
           text_attribute(1, bn_type_name, "/e") + str("/do");
    expect_request(action, request_header(5, rest.size()) + rest);

    request_owner event;
    ASSERT_EQ(bn_event_request_msg_create(&event, "/happened"), 0);
    number(event);
    rest = str("") + u32(0) + str("/happened");
    expect_request(event, request_header(7, rest.size()) + rest);
    string_owner name;
    EXPECT_EQ(bn_action_request_msg_get_action_name(event, &name), LC_ASSERTION);
    ASSERT_EQ(bn_event_request_msg_get_event_name(event, &name), 0);
    EXPECT_STREQ(ts_str(name), "/happened");
    EXPECT_EQ(bn_query_request_msg_append_str(event, bn_query_get, 0, "/a", nullptr), LC_ASSERTION);
}

TEST(messages, response_bytes_and_reading) {
    response_owner msg, copy;
    ASSERT_EQ(bn_query_response_msg_create(&msg, 41, 3, "no"), 0);
    msg->service_id = 100;
    msg->msg_id = 7;
    msg->transaction_id = 8;
    msg->db_revision_id = 99;
    binding_owner binding;
    ASSERT_EQ(bn_binding_new_str(&binding, "/n", bn_attrib_value, bn_type_str, 0, "v"), 0);
    ASSERT_EQ(bn_query_response_msg_append_binding_takeover(msg, &binding.pointer, 1004), 0);
    const std::string rest = u32(3) + str("no") + u32(1) + u32(1004) + u8(1) + u32(1) + str("n") + u32(1) +
                             text_attribute(1, bn_type_str, "v") + u32(99);
    expect_response(msg, u16(100) + u16(2) + u32(static_cast<uint32_t>(52 + rest.size())) + u32(7) + u32(8) +
                             u32(41) + rest);
    ASSERT_EQ(bn_response_msg_dup(msg, &copy), 0);
    uint32_t code = 0;
    string_owner message;
    for (int round = 0; round < 3; round++) { // by copy, by takeover, from what that left
        bindings_owner bindings;
        ids_owner ids;
        ASSERT_EQ(round == 0 ? bn_response_get(msg, &code, &message, 1, &bindings, &ids)
                             : bn_response_get_takeover(msg, &code, &message, 0, &bindings, &ids),
                  0);
        EXPECT_EQ(code, 3u);
        EXPECT_STREQ(ts_str(message), "no");
        ASSERT_EQ(bn_binding_array_length_quick(bindings), round < 2 ? 1u : 0u);
        if (round == 2)
            continue;
        const bn_binding *got = bn_binding_array_get_quick(bindings, 0);
        EXPECT_STREQ(bn_binding_get_name_quick(got), "/n");
        EXPECT_EQ(got->parts != nullptr, round == 0);
        EXPECT_EQ(uint32_array_get_quick(ids, 0), 1004u);
    }
    EXPECT_EQ(bn_response_per_node_array_length_quick(copy->nodes), 1u);
    EXPECT_NE(bn_response_per_node_array_get_quick(copy->nodes, 0)->binding, nullptr);

    response_owner acknowledged;
    ASSERT_EQ(bn_response_msg_create(&acknowledged, bn_msg_event_ack, 1, 0, nullptr), 0);
    expect_response(acknowledged,
                    u16(0) + u16(8) + u32(64) + u32(0) + u32(0) + u32(1) + u32(0) + str("") + u32(0));
    EXPECT_EQ(bn_query_response_msg_append_binding_takeover(acknowledged, &binding.pointer, 0), LC_ASSERTION);
    uint32_t revision = 0;
    EXPECT_EQ(bn_query_response_msg_get_db_revision_id(acknowledged, &revision), LC_ASSERTION);
}

// Announcements that no bytes stand behind, and values that are no values.
TEST(messages, lies_are_refused) {
    const std::string start = room + request_header(7, 0) + str("");
    const std::string node = u32(1) + u32(1000) + u8(1);
    const std::string named = start + node + u32(1) + str("n");
    const std::string huge = u32(UINT32_MAX);
    const std::string bodies[] = {
        start + huge,
        start + node + huge,
        named + huge,
        room + request_header(7, 0) + huge,
        named + u32(1) + u32(4) + huge + u32(bn_type_str) + u32(0) + str("v"),
        named + u32(1) + u32(4) + u32(1) + u32(135) + u32(0) + str("v"),
        named + u32(1) + u32(4) + u32(1) + u32(0) + u32(0) + str("v"),
        named + u32(1) + u32(4) + u32(1) + u32(19) + u32(0) + str("v"),
        named + u32(1) + u32(4) + u32(1) + u32(bn_type_str) + u32(0) + huge + "v",
    };
    for (const std::string &body : bodies) {
        request_owner msg;
        EXPECT_NE(read_request(body + std::string(8, '\0'), &msg), 0);
        EXPECT_EQ(msg.pointer, nullptr);
    }
}

TEST(messages, odd_messages_are_read) {
    const std::string start = room + request_header(7, 0) + str("") + u32(1) + u32(1000);
    for (uint32_t absolute : {0u, 1u}) { // a name of no parts
        request_owner msg;
        ASSERT_EQ(read_request(start + u8(absolute) + u32(0) + u32(0) + str("e"), &msg), 0);
        bindings_owner bindings;
        ASSERT_EQ(bn_request_get(msg, nullptr, nullptr, 1, &bindings, nullptr, nullptr), 0);
        EXPECT_STREQ(bn_binding_get_name_quick(bn_binding_array_get_quick(bindings, 0)), absolute ? "/" : "");
    }
    request_owner twice; // an attribute given twice: the later one counts
    ASSERT_EQ(read_request(start + u8(1) + u32(1) + str("n") + u32(2) + text_attribute(1, bn_type_str, "v") +
                               text_attribute(1, bn_type_str, "w") + str("e"),
                           &twice),
              0);
    string_owner value;
    const bn_request_node *node = bn_request_per_node_array_get_quick(twice->nodes, 0);
    ASSERT_EQ(bn_binding_get_tstr(node->binding, 1, 0, nullptr, &value), 0);
    EXPECT_STREQ(ts_str(value), "w");

    log_lines log;
    request_owner unknown;
    ASSERT_EQ(read_request(room + request_header(9, 0) + str("") + u32(0), &unknown), 0);
    EXPECT_NE(log.take().find("illegal messsage of type 9"), std::string::npos);
    EXPECT_EQ(bn_request_get(unknown, nullptr, nullptr, 0, nullptr, nullptr, nullptr), LC_UNEXPECTED_CASE);
    EXPECT_EQ(bn_request_msg_response_msg_type(bn_msg_event), bn_msg_event_ack);
    EXPECT_EQ(bn_request_msg_response_msg_type(2), 0);
    EXPECT_NE(log.take().find("Request message had unrecognized message type: 2"), std::string::npos);
}
