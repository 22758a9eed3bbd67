// Messages byte by byte, what is refused when they are read, and how they reach the callback of a session.
#include <gtest/gtest.h>
#include <malloc.h>

#include <sstream>

#include "tests/support/gcl_log.h"
#include "tests/support/hand_session.h"
#include "tests/support/mgmt_owners.h"
#include "tests/support/texts.h"

namespace {

using ids_owner = owner<uint32_array, uint32_array_free>;

// Part of a message: a number in as many bytes as its type has, a text with its length, or bytes as they are.
struct part {
    wire bytes;
    template <typename Number, typename = std::enable_if_t<!std::is_convertible_v<Number, wire>>>
    part(Number number) : bytes(be(static_cast<uint64_t>(number), sizeof number)) {}
    part(const char *text) : bytes(be(strlen(text), 4) + text) {}
    part(const wire &raw) : bytes(raw) {}
};
template <typename... Parts>
wire pack_parts(const Parts &...parts) {
    return (part(parts).bytes + ...);
}
constexpr uint8_t relative = 0, absolute = 1;
// Kind, id, type and flags, and the value with its length.
wire text_attribute(uint32_t id, uint32_t type, const wire &text) {
    return pack_parts(4, id, type, 0, static_cast<uint32_t>(text.size()), text);
}
const wire room(32, '\0');
wire request_frame(uint16_t type, const wire &rest) {
    return pack_parts(uint16_t{2}, type, static_cast<uint32_t>(48 + rest.size()), 7, 8, rest);
}
wire response_frame(uint16_t type, const wire &rest) {
    return pack_parts(uint16_t{2}, type, static_cast<uint32_t>(52 + rest.size()), 7, 8, 41, rest);
}

template <typename Message>
lc_status parse_with(lc_status (*from)(const tbuffer *, uint32_t, Message **), const wire &bytes,
                     Message **out) {
    buffer_owner buffer;
    EXPECT_EQ(tb_new_buf(&buffer, bytes.data(), static_cast<int32_t>(bytes.size())), 0);
    return from(buffer, 32, out);
}
lc_status read_request(const wire &bytes, bn_request_msg **out) {
    return parse_with(bn_request_msg_deserialize, room + bytes, out);
}
lc_status read_response(const wire &bytes, bn_response_msg **out) {
    return parse_with(bn_response_msg_deserialize, room + bytes, out);
}

// The message is written as these bytes, also after reading them; anything shorter is refused.
template <typename Owner, typename Message>
void expect_bytes(Message *msg, const wire &golden, lc_status (*to)(Message *, uint32_t, tbuffer **),
                  lc_status (*from)(const wire &, Message **)) {
    buffer_owner written, again;
    msg->service_id = 2;
    msg->msg_id = 7;
    msg->transaction_id = 8;
    ASSERT_EQ(to(msg, 32, &written), 0);
    ASSERT_EQ(bytes_of(written), room + golden);
    EXPECT_EQ(msg->length, 32 + golden.size());
    Owner copy;
    ASSERT_EQ(from(golden, &copy), 0);
    ASSERT_EQ(to(copy, 32, &again), 0);
    EXPECT_EQ(bytes_of(again), room + golden);
    for (size_t length = 0; length < golden.size(); length++) {
        Owner cut;
        const lc_status status = from(golden.substr(0, length), &cut);
        EXPECT_TRUE(status == LC_ASSERTION || status == LC_NO_BUFFER_SPACE) << length << ": " << status;
        EXPECT_EQ(cut.pointer, nullptr);
    }
}
void expect_request(bn_request_msg *msg, uint16_t type, const wire &rest) {
    expect_bytes<request_owner>(msg, request_frame(type, rest), bn_request_msg_serialize, read_request);
}
void expect_response(bn_response_msg *msg, uint16_t type, const wire &rest) {
    expect_bytes<response_owner>(msg, response_frame(type, rest), bn_response_msg_serialize, read_response);
}

TEST(messages, request_bytes) {
    request_owner query, set, action, event;
    binding_owner binding, mask;
    uint32_t id = 0, next = 0;
    ASSERT_EQ(bn_binding_new_uint32(&mask, "/m", bn_attrib_capability_mask, 0, 6), 0);
    ASSERT_EQ(bn_query_request_msg_create(&query, 0, nullptr), 0);
    ASSERT_EQ(bn_query_request_msg_append_str(query, bn_query_get, 0, "/a/b", &id), 0);
    ASSERT_EQ(bn_query_request_msg_append_str(query, bn_query_iterate, 0x3000, "/x\\/y", &next), 0);
    EXPECT_TRUE(id == 1000 && next == 1001);
    // A query asks for attributes by id; a registration contains them.
    for (const uint32_t subop : {bn_query_get, bn_query_registration_info})
        ASSERT_EQ(bn_query_request_msg_append_with_attribs(query, subop, 0, "/a", mask->attributes, &id), 0);
    expect_request(query, 1,
                   pack_parts("", 4, 1000, absolute, 2, "a", "b", 0, 1, 0) +
                       pack_parts(1001, absolute, 1, "x/y", 0, 2, 0x3000) +
                       pack_parts(1002, absolute, 1, "a", 1, 1, 69, bn_type_none, 0, 0, 1, 0) +
                       pack_parts(1003, absolute, 1, "a", 1, 1, 69, bn_type_uint32, 0, 4, 6, 3, 0) +
                       pack_parts(0, "", 0));

    ASSERT_EQ(bn_set_request_msg_create(&set, 5), 0);
    ASSERT_EQ(bn_binding_new_str(&binding, "/n", bn_attrib_value, bn_type_str, 0, "v"), 0);
    ASSERT_EQ(bn_binding_set_str(binding, bn_attrib_revision_id, bn_type_str, 0, "r"), 0);
    ASSERT_EQ(bn_set_request_msg_append_binding_takeover(set, bn_set_reparent, 9, &binding.pointer, &id), 0);
    EXPECT_EQ(binding.pointer, nullptr);
    expect_request(set, 3,
                   pack_parts("", 1, 1000, absolute, 1, "n", 2, text_attribute(1, bn_type_str, "v"),
                              text_attribute(129, bn_type_str, "r"), 5, 9, "", "", 5, "", 0));

    ASSERT_EQ(bn_action_request_msg_create(&action, "/do"), 0);
    ASSERT_EQ(bn_action_request_msg_append_new_binding(action, 0, "event_name", bn_type_name, "/e", &id), 0);
    expect_request(
        action, 5,
        pack_parts("", 1, 1000, relative, 1, "event_name", 1, text_attribute(1, bn_type_name, "/e"), "/do"));

    ASSERT_EQ(bn_event_request_msg_create(&event, "/happened"), 0);
    expect_request(event, 7, pack_parts("", 0, "/happened"));
    string_owner name;
    EXPECT_EQ(bn_action_request_msg_get_action_name(event, &name), LC_ASSERTION);
    ASSERT_EQ(bn_event_request_msg_get_event_name(event, &name), 0);
    EXPECT_STREQ(ts_str(name), "/happened");
    EXPECT_EQ(bn_query_request_msg_append_str(event, bn_query_get, 0, "/a", nullptr), LC_ASSERTION);
}

// Messages that were built and messages that were received are read in the same way.
TEST(messages, response_bytes_and_reading) {
    response_owner msg, copy;
    ASSERT_EQ(bn_query_response_msg_create(&msg, 41, 3, "no"), 0);
    msg->db_revision_id = 99;
    binding_owner binding;
    ASSERT_EQ(bn_binding_new_str(&binding, "/n", bn_attrib_value, bn_type_str, 0, "v"), 0);
    ASSERT_EQ(bn_binding_name_to_parts("/n", &binding.pointer->parts, nullptr), 0);
    ASSERT_EQ(bn_query_response_msg_append_binding_takeover(msg, &binding.pointer, 1004), 0);
    const wire bytes =
        pack_parts(3, "no", 1, 1004, absolute, 1, "n", 1, text_attribute(1, bn_type_str, "v"), 99);
    expect_response(msg, 2, bytes);
    ASSERT_EQ(bn_response_msg_dup(msg, &copy), 0);
    for (const bool received : {false, true})
        for (const int keep : {0, 1}) {
            response_owner from;
            ASSERT_EQ(
                (received ? read_response(response_frame(2, bytes), &from) : bn_response_msg_dup(msg, &from)),
                0);
            for (const uint32_t round : {0u, 1u, 2u}) { // by copy, by takeover, and from what is left
                uint32_t code = 0;
                string_owner message;
                bindings_owner bindings;
                ids_owner ids;
                ASSERT_EQ(round == 0 ? bn_response_get(from, &code, &message, keep, &bindings, &ids)
                                     : bn_response_get_takeover(from, &code, &message, keep, &bindings, &ids),
                          0);
                EXPECT_TRUE(code == 3 && ts_equal_str(message, "no", 0));
                ASSERT_EQ(bn_binding_array_length_quick(bindings), round < 2 ? 1u : 0u);
                if (round == 2)
                    continue;
                const bn_binding *got = bn_binding_array_get_quick(bindings, 0);
                EXPECT_STREQ(bn_binding_get_name_quick(got), "/n");
                ASSERT_EQ(got->parts != nullptr, keep != 0) << received << round;
                EXPECT_STREQ(keep ? tstr_array_get_str_quick(got->parts, 0) : "n", "n");
                EXPECT_EQ(uint32_array_get_quick(ids, 0), 1004u);
            }
        }
    EXPECT_NE(bn_response_per_node_array_get_quick(copy->nodes, 0)->binding, nullptr);

    for (const uint16_t type : {bn_msg_set_response, bn_msg_action_response, bn_msg_event_ack}) {
        response_owner other;
        uint32_t revision = 0;
        ASSERT_EQ(bn_response_msg_create(&other, type, 41, 0, nullptr), 0);
        expect_response(other, type, pack_parts(0, "", 0, type == 4 ? pack_parts(0) : wire()));
        EXPECT_EQ(bn_query_response_msg_append_binding_takeover(other, &binding.pointer, 0), LC_ASSERTION);
        EXPECT_EQ(bn_query_response_msg_get_db_revision_id(other, &revision), LC_ASSERTION);
    }
}

// Lengths without the bytes, and malformed values.
TEST(messages, false_fields_are_refused) {
    const wire start = request_frame(7, pack_parts("")), node = pack_parts(start, 1, 1000, absolute),
               named = pack_parts(node, 1, "n");
    for (const wire &body : {start, node, named, request_frame(7, ""), pack_parts(named, 1, 4),
                             pack_parts(named, 1, 4, 1, bn_type_str, 0)}) {
        request_owner msg;
        EXPECT_NE(read_request(pack_parts(body, UINT32_MAX, bn_type_str, 0, "v", wire(8, '\0')), &msg), 0);
        EXPECT_EQ(msg.pointer, nullptr);
    }
}

// In each text of a message; binary values may contain any bytes.
TEST(messages, a_nul_in_a_text_is_refused) {
    gcl_log log;
    for (const wire &bytes : {wire("a?b"), wire("a\0b", 3)}) {
        const wire text = pack_parts(3, bytes), start = pack_parts("", 1, 1000, absolute),
                   value = pack_parts(start, 1, "n", 1), moved = pack_parts(start, 0, 0, bn_set_reparent, 0),
                   options = pack_parts(0, "", 0);
        const lc_status expected = bytes[1] ? LC_OK : LC_ASSERTION;
        for (const wire &each : {
                 request_frame(7, pack_parts(text, 0, "e")),
                 request_frame(7, pack_parts("", 0, text)),
                 request_frame(7, pack_parts(start, 2, text, "c", 0, "e")),
                 request_frame(7, pack_parts(value, text_attribute(1, bn_type_str, bytes), "e")),
                 request_frame(7, pack_parts(value, text_attribute(1, bn_type_uri, bytes), "e")),
                 request_frame(3, pack_parts(moved, text, "", options)),
                 request_frame(3, pack_parts(moved, "", text, options)),
             }) {
            request_owner msg;
            EXPECT_EQ(read_request(each, &msg), expected) << testing::PrintToString(each);
        }
        request_owner binary;
        response_owner answer;
        const wire bare = text_attribute(1, bn_type_binary, bytes);
        ASSERT_EQ(read_request(request_frame(7, pack_parts(value, bare, "e")), &binary), 0);
        const bn_request_node *node = bn_request_per_node_array_get_quick(binary->nodes, 0);
        EXPECT_EQ(bytes_of(bn_attrib_array_get_quick(node->binding->attributes, 1)->value.binary), bytes);
        EXPECT_EQ(read_response(response_frame(6, pack_parts(0, text, 0)), &answer), expected);
        EXPECT_EQ(log.count("Received string of 3 bytes contains a NUL at offset 1"), bytes[1] ? 0 : 8);
    }
}

// ---- Memory

size_t allocated_bytes() {
    const struct mallinfo2 info = mallinfo2();
    return info.uordblks + info.hblkhd;
}
// A received message, and each copy of its bindings, takes at most eight times its bytes, whatever it
// contains; the parts of the names, if they are wanted, at most nine.
TEST(messages, received_messages_are_bounded) {
    const wire name = pack_parts(absolute, 1, "n"), none = pack_parts(1, 130, bn_type_none, 0, 0);
    const auto times = [](size_t count, const wire &piece) {
        wire all;
        while (count--)
            all += piece;
        return all;
    };
    // `node` from its name on.
    const auto check = [&](const char *what, uint32_t count, const wire &node) {
        SCOPED_TRACE(what);
        const wire nodes = pack_parts(count, times(count, pack_parts(1000, node)));
        const wire request = request_frame(7, pack_parts("", nodes, "e"));
        const wire response = response_frame(2, pack_parts(0, "", nodes, 0));
        request_owner asked;
        response_owner answered, copy;
        bindings_owner bindings, parts, more_parts;
        ids_owner ids;
        bn_node_info *info = nullptr;
        const auto take = [](size_t limit, auto step) {
            const size_t before = allocated_bytes();
            ASSERT_EQ(step(), 0);
            EXPECT_LE(allocated_bytes() - before, limit + 2048) << limit;
        };
        take(8 * request.size(), [&] { return read_request(request, &asked); });
        take(8 * request.size(),
             [&] { return bn_request_get(asked, nullptr, nullptr, 0, &bindings, &ids, &info); });
        take(17 * request.size(),
             [&] { return bn_request_get(asked, nullptr, nullptr, 1, &parts, nullptr, nullptr); });
        take(8 * response.size(), [&] { return read_response(response, &answered); });
        take(8 * response.size(), [&] { return bn_response_msg_dup(answered, &copy); });
        take(10 * response.size(),
             [&] { return bn_response_get_takeover(answered, nullptr, nullptr, 1, &more_parts, nullptr); });
        free(info);
    };
    check("nothing", 4000, pack_parts(relative, 0, 0));
    check("name of one character", 4000, pack_parts(name, 0));
    check("a part of one slash", 4000, pack_parts(relative, 1, "/", 0));
    check("three empty parts", 4000, pack_parts(relative, 3, "", "", "", 0));
    check("last attribute, no value", 2000, pack_parts(relative, 0, 1, none));
    check("empty text", 2000, pack_parts(name, 1, text_attribute(1, bn_type_str, "")));
    check("empty bytes", 2000, pack_parts(name, 1, text_attribute(1, bn_type_binary, "")));
    check("one attribute again and again", 1, pack_parts(name, 2000, times(2000, none)));
    check("empty parts", 1, pack_parts(absolute, 20000, times(20000, pack_parts("")), 0));
    check("slashes", 1, pack_parts(absolute, 1, 50000, wire(50000, '/'), 0));
    check("an ordinary node", 500,
          pack_parts(absolute, 4, "qv", "wccpd", "config", "51", 1, text_attribute(1, bn_type_str, "value")));
}

// A received binding can outlive its message, be changed and copied, and give away its name and attributes.
TEST(messages, received_bindings_can_be_kept) {
    const wire node = pack_parts(1000, absolute, 1, "n", 3, text_attribute(1, bn_type_str, "v"),
                                 text_attribute(65, bn_type_binary, "b"), 1, 129, bn_type_uint32, 0, 4, 7);
    const wire bare = pack_parts(1000, absolute, 0, 0);
    response_owner msg;
    bindings_owner bindings;
    ASSERT_EQ(read_response(response_frame(2, pack_parts(0, "", 5, node, node, node, bare, bare, 0)), &msg),
              0);
    ASSERT_EQ(bn_response_get_takeover(msg, nullptr, nullptr, 0, &bindings, nullptr), 0);
    const auto value_of = [](const bn_binding *binding) {
        return text_of([&](char **out) { return bn_binding_get_str(binding, 1, 0, nullptr, out); });
    };
    binding_owner kept, changed, emptied, first, second, copy, given;
    for (bn_binding **out :
         {&kept.pointer, &changed.pointer, &emptied.pointer, &first.pointer, &second.pointer})
        ASSERT_EQ(bn_binding_array_remove(bindings, 0, out), 0);
    msg.reset();
    bindings.reset();

    ASSERT_EQ(bn_binding_set_name(changed, "/other"), 0);
    ASSERT_EQ(bn_binding_set_str(changed, 1, bn_type_str, 0, "w"), 0);
    ASSERT_EQ(bn_binding_set_uint32(changed, 2, 0, 9), 0);
    bn_attrib *binary = bn_attrib_array_get_quick(changed->attributes, 65);
    ASSERT_EQ(bn_attrib_set_str(binary, 65, bn_type_str, 0, "x"), 0);
    ASSERT_EQ(bn_binding_dup(changed, &copy), 0);
    changed.reset();
    EXPECT_EQ(value_of(copy), "w");
    EXPECT_EQ(bn_attrib_array_length_quick(copy->attributes), 130u);
    EXPECT_STREQ(ts_str(bn_attrib_array_get_quick(copy->attributes, 65)->value.string), "x");
    EXPECT_STREQ(bn_binding_get_name_quick(copy), "/other");

    bn_attrib_array **attributes = &emptied->attributes;
    ASSERT_EQ(bn_binding_new_parts_components_takeover(&given, &emptied->name, nullptr, 1, attributes), 0);
    emptied.reset();
    EXPECT_TRUE(bn_binding_get_name_quick(given) == wire("/n") && value_of(given) == "v");
    ASSERT_EQ(bn_binding_set_name(first, "/renamed"), 0);
    EXPECT_STREQ(bn_binding_get_name_quick(second), "/");

    request_owner forwarded;
    ASSERT_EQ(bn_event_request_msg_create(&forwarded, "/e"), 0);
    ASSERT_EQ(bn_event_request_msg_append_binding_takeover(forwarded, 0, &kept.pointer, nullptr), 0);
    expect_request(forwarded, 7, pack_parts("", 1, node, "/e"));
}

TEST(messages, odd_messages_are_read) {
    request_owner twice, unknown; // an attribute given twice: the later one counts
    const wire both = text_attribute(1, bn_type_str, "v") + text_attribute(1, bn_type_str, "w");
    ASSERT_EQ(read_request(request_frame(7, pack_parts("", 1, 1000, absolute, 1, "n", 2, both, "e")), &twice),
              0);
    string_owner value;
    const bn_request_node *node = bn_request_per_node_array_get_quick(twice->nodes, 0);
    ASSERT_EQ(bn_binding_get_tstr(node->binding, 1, 0, nullptr, &value), 0);
    EXPECT_STREQ(ts_str(value), "w");

    gcl_log log;
    ASSERT_EQ(read_request(request_frame(9, pack_parts("", 0)), &unknown), 0);
    EXPECT_EQ(log.count("illegal messsage of type 9"), 1);
    EXPECT_EQ(bn_request_get(unknown, nullptr, nullptr, 0, nullptr, nullptr, nullptr), LC_UNEXPECTED_CASE);
    EXPECT_EQ(bn_request_msg_response_msg_type(2), 0);
    EXPECT_EQ(log.count("Request message had unrecognized message type: 2"), 1);
}

// ---- Over a session

struct MessageSession : testing::Test {
    gcl_log log;
    hand_session with;
    std::string calls;

    template <typename Message>
    static lc_status note(gcl_session *, Message *msg, void *data) {
        auto *self = static_cast<MessageSession *>(data);
        self->calls += std::to_string(msg->msg_type) + " ";
        return LC_BAD_TYPE; // the result of a callback is ignored
    }
    static wire message(uint16_t type) {
        if (type % 2 == 0 && type >= 2 && type <= 8)
            return response_frame(type, pack_parts(0, "message", 0, type < 6 ? pack_parts(1) : wire()));
        return request_frame(type, pack_parts("", 0, type < 5 ? pack_parts(0, "", 0) : pack_parts("/name")));
    }
    bool receive(uint16_t type, const wire &body) { return with.deliver(frame_bytes(2, type, body)); }
};

TEST_F(MessageSession, EachTypeReachesItsCallbackOrIsLogged) {
    ASSERT_TRUE(with.open());
    bn_set_global_callback_query_request_msg(with.instance, note, this); // too late for this session
    const auto expect_line = [&](uint16_t type, const wire &body, const std::string &line) {
        EXPECT_TRUE(receive(type, body)) << line;
        EXPECT_EQ(log.count("session 1: " + line), 1) << line;
        log.clear();
    };
    uint16_t type = 1;
    for (const wire no : {"no query", "no set", "no action", "no event"}) {
        expect_line(type, message(type), "proto bnode: " + no + " request callback");
        type++;
        expect_line(type, message(type), "proto bnode: " + no + " response callback: code = 0 msg = message");
        type++;
    }
    for (const uint16_t bad : std::initializer_list<uint16_t>{0, 9, 10})
        expect_line(bad, message(bad), "proto bnode: invalid body message type " + std::to_string(bad));
    // The message's own type decides.
    expect_line(7, message(9), "proto bnode: invalid body message type 9");
    expect_line(9, message(7), "proto bnode: invalid body message type 9");
    expect_line(2, response_frame(10, pack_parts(0, "", 0)), "proto bnode: invalid body message type 10");
    expect_line(2, response_frame(7, pack_parts(0, "message", 0)),
                "proto bnode: no event response callback: code = 0 msg = message");
    expect_line(2, wire("\x00\x03", 2) + message(2).substr(2), "service 3 not open: 2");
    bn_set_session_callback_query_request_msg(with.session, note, this);
    bn_set_session_callback_query_response_msg(with.session, note, this);
    bn_set_session_callback_set_request_msg(with.session, note, this);
    bn_set_session_callback_set_response_msg(with.session, note, this);
    bn_set_session_callback_action_request_msg(with.session, note, this);
    bn_set_session_callback_action_response_msg(with.session, note, this);
    bn_set_session_callback_event_request_msg(with.session, note, this);
    bn_set_session_callback_event_response_msg(with.session, note, this);
    EXPECT_TRUE(receive(3, message(1)));
    for (type = 1; type <= 8; type++)
        EXPECT_TRUE(receive(type, message(type))) << type;
    EXPECT_EQ(calls, "1 1 2 3 4 5 6 7 8 ");
    EXPECT_EQ(log.count("Error code"), 0);
    EXPECT_FALSE(receive(7, request_frame(7, pack_parts("", 0, 9, wire("cut")))));
    EXPECT_GE(log.count("Error code 14011"), 1);
    EXPECT_EQ(log.count("session 1: closing after error condition"), 1);
    EXPECT_EQ(log.count("messsage"), 0);
}

// The peer gets a code and a message, also if the queue is completely full. That frames are dropped is logged
// once each time.
TEST_F(MessageSession, AResponseThatDoesNotFitIsReplaced) {
    ASSERT_TRUE(with.open());
    const auto answer = [&](size_t bytes) {
        response_owner response;
        binding_owner binding;
        ASSERT_EQ(bn_query_response_msg_create(&response, 41, 0, nullptr), 0);
        ASSERT_EQ(
            bn_binding_new_str(&binding, "/n", bn_attrib_value, bn_type_str, 0, wire(bytes, 'v').c_str()), 0);
        ASSERT_EQ(bn_query_response_msg_append_binding_takeover(response, &binding.pointer, 9), 0);
        EXPECT_EQ(bn_response_msg_send(with.session, response), 0);
    };
    const auto expect_refusal = [&](const wire &frame, const char *words) {
        EXPECT_EQ(frame.substr(frame.size() < 48 ? 0 : 48), pack_parts(41, LC_NO_BUFFER_SPACE, words, 0, 0));
    };
    answer(GCL_FRAME_MAX);
    expect_refusal(with.provider.take_frame(), "The answer is larger than a message: ask for less");
    EXPECT_EQ(log.count("session 1: message of 167773"), 1);

    uint32_t sequence = 2000004;
    for (int filling = 0; filling < 2; filling++) {
        log.clear();
        uint32_t waiting = 0, queued_bytes = 0;
        for (const uint32_t size : {65536u, 1u})
            while (gcl_session_send_frame_components(with.session, 2, 7, size, wire(size, 'q').data()) ==
                   LC_OK) {
                waiting++;
                queued_bytes += size + 32;
            }
        EXPECT_EQ(gcl_session_send_frame_components(with.session, 2, 7, 1, "q"), LC_CANCELLED);
        EXPECT_NEAR(queued_bytes, GCL_QUEUE_MAX_BYTES + 500000.0, 500000); // some are in the socket
        answer(1);
        EXPECT_EQ(log.count("output queue is full"), 1);
        for (uint32_t i = 0; i < waiting; i++) {
            wire frame;
            while ((frame = with.provider.take_frame(0)).empty())
                (void)gcl_session_fd_read_write_timeout_activity(0, FDIC_WRITABLE, with.session, nullptr);
            ASSERT_EQ(frame.back(), 'q');
            ASSERT_EQ(number_at(frame, 20), sequence++);
        }
        expect_refusal(with.provider.take_frame(),
                       "The session's output queue is full: ask for less, or try again later");
        sequence++;
        EXPECT_EQ(log.count("4 frames were dropped"), 1);
        EXPECT_EQ(log.count("Error code"), 0);
    }
}

TEST_F(MessageSession, SentMessagesAreNumberedAndLogged) {
    ASSERT_TRUE(with.open());
    ASSERT_EQ(lc_log_set_max_log_level("debug"), 0);
    // The log lines about a message that was sent, with this type, id and transaction.
    const auto dump_of = [&](lc_status status, uint32_t type, uint32_t id, uint32_t transaction) {
        EXPECT_EQ(status, 0);
        const wire frame = with.provider.take_frame();
        const wire both = be(0x20000u | type, 4); // protocol 2, and service 2
        EXPECT_EQ(frame.substr(24, 4), both);
        EXPECT_EQ(frame.substr(32, 16), both + be(frame.size(), 4) + be(id, 4) + be(transaction, 4));
        std::string dump;
        log.settle();
        std::istringstream all(log.lines);
        for (std::string line; std::getline(all, line);)
            if (const size_t at = line.find("SEND RE"); at != wire::npos)
                dump += line.substr(at) + "\n";
        log.clear();
        return dump;
    };
    const std::string names = " hand-" + std::to_string(getpid()) + " mgmtd-1 service 2 type ";
    request_owner set, event;
    binding_owner binding;
    ASSERT_EQ(bn_set_request_msg_create(&set, 0), 0);
    ASSERT_EQ(bn_binding_new_uint32(&binding, "/n", bn_attrib_value, 0, 7), 0);
    uint32_t id = 0;
    ASSERT_EQ(bn_set_request_msg_append_binding_takeover(set, bn_set_create, 9, &binding.pointer, &id), 0);
    EXPECT_EQ(dump_of(bn_request_msg_send(with.session, set), bn_msg_set_request, 1, 2),
              "SEND REQ:" + names + "3 (set_request) msg id 1\n" +
                  "SEND REQ: audit userinfo string - \nSEND REQ: num nodes: 1\n"
                  "SEND REQ: rn[0]: id 1000 /n\nSEND REQ: rn[0]: set subop: create flags: 00000009\n"
                  "SEND REQ: rn[0]: attrib 1(value) type 5(uint32) value \"7\"\n");
    ASSERT_EQ(bn_event_request_msg_create(&event, "/e"), 0);
    ASSERT_EQ(bn_request_set_transaction_id(event, 77), 0);
    for (int i = 0; i < 51; i++)
        ASSERT_EQ(bn_event_request_msg_append_new_binding(event, 0, "n", bn_type_str, "", nullptr), 0);
    const std::string dump = dump_of(bn_request_msg_send(with.session, event), bn_msg_event, 2, 77);
    EXPECT_TRUE(contains(dump, "event name: /e\n", "num nodes: 51 (but only logging the first 50)\n",
                         "rn[49]: id 1049 n\n"));
    EXPECT_TRUE(lacks(dump, "rn[50]"));
    response_owner answer;
    ASSERT_EQ(bn_action_response_msg_create(&answer, 41, 3, "no"), 0);
    EXPECT_EQ(dump_of(bn_response_msg_send(with.session, answer), bn_msg_action_response, 3, 4),
              "SEND RESP: ret code: 3 ret msg: \"no\"\nSEND RESP:" + names +
                  "6 (action_response) msg id 3 to 41\nSEND RESP: num nodes: 0\n");

    EXPECT_EQ(gcl_session_close(with.session, 0), 0);
    EXPECT_EQ(bn_request_msg_send(with.session, event), 0);
    EXPECT_EQ(log.count("Dropping request to non-connected session 1"), 1);
    EXPECT_EQ(bn_response_msg_send(with.session, answer), 0);
    EXPECT_EQ(log.count("Dropping response to non-connected session 1"), 1);
}

} // namespace
