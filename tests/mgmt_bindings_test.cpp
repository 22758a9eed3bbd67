#include <gtest/gtest.h>

#include "tests/support/log_lines.h"
#include "tests/support/mgmt_owners.h"
#include "tests/support/texts.h"
#include "tests/support/wire_bytes.h"

namespace {

// --- Text

// Each type by its number, the wire form of its first text (the kind, and what follows id, type and flags;
// null: not checked), texts, with "in -> out" where one comes back as another, and texts that are refused.
const struct type_case {
    uint32_t type, kind;
    const char *bytes;
    strings texts, refused = {};
} type_cases[] = {
    {1, 1, "00000001 ff", {"255", "007 -> 7"}, {"256", "-1", "+1", " 1", "1 ", "0x1"}},
    {2, 1, "00000001 80", {"-128"}, {"", "128", "-129", "--1", "- 1"}},
    {3, 1, "00000002 ffff", {"65535", "258"}},
    {4, 1, "00000002 fffe", {"-2", "-32768"}},
    {5, 1, "00000004 00000102", {"258", "4294967295"}, {"12x", "4294967296"}},
    {6, 1, "00000004 80000000", {"-2147483648"}},
    {7, 1, "00000008 0102030405060708", {"72623859790382856"}, {"-1"}},
    {7, 1, nullptr, {"18446744073709551615"}, {"18446744073709551616"}},
    {8, 1, "00000008 80 00*7", {"-9223372036854775808", "9223372036854775807"}, {"9223372036854775808"}},
    {9, 1, "00000004 00000001", {"on -> true", "F -> false"}, {"1", "True"}},
    {20, 1, "00000004 3fc00000", {"1.5 -> 1.500000000"}, {"1e99"}},
    {21, 1, "00000008 bfd0000000000000", {"-0.25"}, {"1.5x", " 1"}},
    {40, 1, "00000001 78", {"x"}, {"xy"}},
    {50, 1, "04 000000000000000000000000 0302010a", {"10.1.2.3"}, {"10.0.0", "1:2"}},
    {50, 1, "06 0500000000000000 00000000 b80d0120", {"2001:db8::5"}},
    {51, 1, "04 10 00*12 0000010a", {"10.1.0.0/16", "::1 -> ::1/0"}, {"10.0.0.0/33", "10.0.0.0/"}},
    {60, 1, "00000004 c0a801ff", {"192.168.1.255"}, {"1.2.3.256", "1.2.3.4.5", "1.2.3.-4", "1..3.4"}},
    {61, 1, "00000008 0a010000 ffff0000", {"10.1.0.0/16"}, {"1.2.3.4", "1.2.3.4/33", "1.2.3.4/-1"}},
    {61, 1, nullptr, {"0.0.0.0/0", "1.2.3.4/32"}},
    {62, 2, "00000006 001122aabbff", {"00:11:22:AA:BB:FF", "1:2:a:b:c:d -> 01:02:0A:0B:0C:0D"}},
    {62, 2, nullptr, {}, {"00:11:22:33:44", "00:11:22:33:44:55:66", "00:11:22:33:44:"}},
    {62, 2, "00000006 001122334455", {"0011:2233:4455 -> 00:11:22:33:44:55"}, {"00112:233:4455"}},
    {63, 1, "00000010 05000000000000000000 0000 b80d0120", {"2001:db8::5"}, {"10.0.0.1"}},
    {64, 1, "00000011 000000000000000000000000 b80d0120 20", {"2001:db8::/32"}, {"::1", "::1/129"}},
    {70, 1, "00000004 00015180", {"1970/01/02"}, {"2020/1/2x"}},
    {71, 1, "00000004 0000a8c1", {"12:00:01"}, {"25:00:00"}},
    {72, 1, "00000008 00000000029332e2", {"12:00:01.250"}},
    {73, 1, "00000008 0000000a0efec34d", {"12:00:01.250125"}},
    {74, 1, "00000004 5e0d5da5", {"2020/01/02 03:04:05"}, {"2100/01/01 00:00:00"}},
    {75, 1, "00000008 0000016f6435ce7c", {"2020/01/02 03:04:05.5 -> 2020/01/02 03:04:05.500"}},
    {75, 1, nullptr, {}, {"1960/01/01 00:00:00"}},
    {76, 1, "00000008 00059b1f7226f341", {"2020/01/02 03:04:05.000001"}},
    {77, 1, "00000004 ffffffff", {"4294967295"}, {"-1", "1.5"}},
    {78, 1, "00000008 fffffffffffffffb", {"-5"}},
    {79, 1, "00000008 000000000016e360", {"1500000"}},
    {0x1004d, 1, "00000004 00000003", {"3.9 -> 3.000000 seconds"}, {"-1"}},
    {0x1004f, 1, "00000008 000000000016e360", {"1.5 seconds -> 1.500000 seconds"}},
    {90, 1, "00000000", {"anything -> "}},
    {92, 1, "00000004 0000003d", {"ipv4prefix"}, {"uint128"}},
    {93, 1, "00000004 00000081", {"revision_id"}, {""}},
    {101, 4, "00000003 616263", {"abc", "", "any \xff text"}},
    {102, 4, "00000002 c3a4", {"\xc3\xa4"}, {"\xc3"}},
    {103, 4, "00000003 78797a", {"xyz"}},
    {105, 4, "00000002 2e31", {".1"}},
    {120, 4, "00000001 61", {"a"}},
    {130, 4, "0000000b 612d312e6578616d706c65", {"a-1.example"}, {"-a", "a_b"}},
    {131, 4, "00000001 61", {"a"}},
    {134, 4, "00000001 2a", {"*"}},
    {0x40005, 1, "00000004 00000000", {""}},
    {0x180005, 1, "00000000", {""}},
    {0x100065, 4, "00000000", {""}},
    {0x1004e, 1, nullptr, {}, {"soon"}},
    {91, 1, nullptr, {}, {""}},
};
std::string packed(const wire_bytes &all) {
    return {all.bytes.begin(), all.bytes.end()};
}
std::string value_of(const bn_attrib *from) {
    return text_of([&](char **out) { return bn_attrib_get_str(from, nullptr, from->type, nullptr, out); });
}
// From a buffer of exactly these bytes, so that the sanitizer sees a read past them.
lc_status read_bytes(const std::string &bytes, bn_attrib **out) {
    const std::vector<char> exact(bytes.begin(), bytes.end());
    buffer_owner buffer;
    EXPECT_EQ(tb_new_buf_const(&buffer, exact.data(), static_cast<uint32_t>(exact.size())), LC_OK);
    return bn_attrib_read_wire(buffer, 0, out, nullptr);
}
// The attribute is written and read as these bytes, at an odd offset; anything shorter is refused.
void expect_bytes(const bn_attrib *attrib, const std::string &golden) {
    attrib_owner back;
    buffer_owner buffer;
    uint32_t used = 0;
    int order = 1;
    ASSERT_TRUE(tb_new(&buffer) == LC_OK && tb_append_uint8(buffer, 0xee) == LC_OK);
    ASSERT_EQ(bn_attrib_append_wire(attrib, buffer), LC_OK);
    EXPECT_EQ(bytes_of(buffer).substr(1), golden);
    ASSERT_EQ(bn_attrib_read_wire(buffer, 1, &back, &used), LC_OK);
    EXPECT_TRUE(used == golden.size() && back->value_size == attrib->value_size);
    EXPECT_TRUE(bn_attrib_compare(attrib, back, &order) == LC_OK && order == 0);
    EXPECT_EQ(back->type | back->type_flags, attrib->type | attrib->type_flags);
    for (size_t length = 1; length < golden.size(); length++) {
        attrib_owner none;
        EXPECT_NE(read_bytes(golden.substr(0, length), &none), LC_OK) << length;
        EXPECT_EQ(none.pointer, nullptr);
    }
}
TEST(Values, TextsAndBytes) {
    for (const type_case &c : type_cases) {
        const uint32_t type = c.type & BN_TYPE_MASK, flags = c.type & ~BN_TYPE_MASK;
        for (const std::string &row : c.texts) {
            SCOPED_TRACE(std::to_string(c.type) + " " + row);
            const size_t arrow = row.find(" -> ");
            attrib_owner attrib;
            ASSERT_EQ(bn_attrib_new(&attrib), LC_OK);
            ASSERT_EQ(bn_attrib_set_str(attrib, 1, type, flags, row.substr(0, arrow).c_str()), LC_OK);
            EXPECT_EQ(value_of(attrib), arrow == std::string::npos ? row : row.substr(arrow + 4));
            wire_bytes bytes;
            bytes.u32(c.kind).u32(1).u32(type).u32(flags);
            if (c.bytes && &row == &c.texts[0])
                expect_bytes(attrib, packed(bytes.hex(c.bytes)));
        }
        for (const std::string &in : c.refused) {
            SCOPED_TRACE(std::to_string(c.type) + " " + in);
            log_lines log;
            attrib_owner attrib;
            binding_owner binding;
            uint32_t word = 0;
            ASSERT_EQ(bn_attrib_new_uint32(&attrib, 1, 0, 77), LC_OK);
            EXPECT_EQ(bn_attrib_set_str(attrib, 1, type, flags, in.c_str()), LC_BAD_TYPE);
            EXPECT_EQ(value_of(attrib), "77"); // as before
            EXPECT_EQ(bn_binding_new_str_autoinval(&binding, "/a", 1, type, flags, in.c_str()), LC_OK);
            EXPECT_EQ(text_of([&](char **out) { return bn_binding_get_str(binding, 1, 0, &word, out); }), "");
            EXPECT_EQ(word, c.type | bn_flag_invalid);
            const std::string lines = log.take(); // only those with the bytes of bad UTF-8
            EXPECT_TRUE(lines.empty() || c.type == bn_type_utf8_string) << lines;
        }
    }
}
TEST(Values, RefusedTypesAndIds) {
    attrib_owner attrib;
    EXPECT_EQ(bn_attrib_new_str(&attrib, 1, bn_type_any, 0, "x"), LC_UNEXPECTED_CASE);
    EXPECT_EQ(attrib.pointer, nullptr);
    EXPECT_EQ(bn_attrib_new_str(&attrib, 1, 30, 0, "x"), LC_ASSERTION);
    EXPECT_EQ(bn_attrib_new_str(&attrib, 1, bn_type_uint8, 0, nullptr), LC_NULL);
    for (const uint32_t id : {0u, 4u, 131u, 0xffffffffu})
        EXPECT_EQ(bn_attrib_new_uint32(&attrib, id, 0, 1), LC_ASSERTION) << id;
    EXPECT_EQ(bn_attrib_new_macaddr802(&attrib, 1, 0, nullptr), LC_NULL);
    EXPECT_EQ(bn_attrib_set_uint32(nullptr, 1, 0, 1), LC_NULL);

    EXPECT_TRUE(bn_type_string(bn_type_str));
    EXPECT_FALSE(bn_type_string(bn_type_str | bn_flag_absent));
}

TEST(Wire, FalseFieldsAreRefused) {
    attrib_owner attrib;
    buffer_owner buffer;
    const auto check = [&](const char *bytes, lc_status status) {
        EXPECT_EQ(read_bytes(packed(hex(bytes)), &attrib), status) << bytes;
    };
    check("00000001 00000000 00000005 00000000 00000004 00000001", LC_ASSERTION); // ids
    check("00000001 00000083 00000005 00000000 00000004 00000001", LC_ASSERTION);
    check("00000001 00000001 00000000 00000000 00000004 00000001", LC_ASSERTION); // types
    check("00000001 00000001 00000087 00000000 00000004 00000001", LC_ASSERTION);
    check("00000001 00000001 80000005 00000000 00000004 00000001", LC_ASSERTION);
    check("00000001 00000001 0000005b 00000000 00000004 00000001", LC_NULL);
    check("00000001 00000001 0000000b 00000000 00000004 00000001", LC_NULL);
    check("00000004 00000001 00000005 00000000 00000004 00000001", LC_GENERIC); // another family's kind
    check("00000001 00000001 00000005 00000000 00000002 00000001", LC_GENERIC); // sizes
    check("00000001 00000001 00000005 00000000 00000000 00000001", LC_GENERIC);
    check("00000001 00000001 00000005 00000000 ffffffff 00000001", LC_GENERIC);
    check("00000004 00000001 00000065 00000000 ffffffff 616263", LC_NO_BUFFER_SPACE); // lengths
    check("00000004 00000001 00000067 00000000 00000004 616263", LC_NO_BUFFER_SPACE);
    check("00000004 00000001 00000066 00000000 00000002 61ff", LC_OK); // bad UTF-8 stays plain text
    EXPECT_EQ(text(attrib->value.string), "a\xff");
    EXPECT_EQ(attrib->value.string->utf8, 0);
    log_lines log;
    ASSERT_TRUE(tb_new(&buffer) == LC_OK && bn_attrib_new(&attrib) == LC_OK);
    attrib->type = bn_type_any;
    EXPECT_EQ(bn_attrib_append_wire(attrib, buffer), LC_NULL);
    EXPECT_TRUE(log.say("Couldn't get attrib copy out func for type any"));
    attrib->type = 0;
    EXPECT_EQ(bn_attrib_append_wire(attrib, buffer), LC_ASSERTION);
    EXPECT_EQ(tb_length(buffer), 0);
}

// --- Attributes and bindings

TEST(Attributes, Order) {
    attrib_owner left, right, number;
    ASSERT_EQ(bn_attrib_new_uint32(&number, 1, 0, 1), LC_OK);
    const auto compare = [](const bn_attrib *a, const bn_attrib *b) {
        int order = 99;
        EXPECT_EQ(bn_attrib_compare(a, b, &order), LC_OK);
        return order;
    };
    const auto check = [&](uint32_t type, const char *lower, const char *higher) {
        ASSERT_EQ(bn_attrib_new_str(&left, 1, type, 0, lower), LC_OK);
        ASSERT_EQ(bn_attrib_new_str(&right, 1, type, 0, higher), LC_OK);
        EXPECT_TRUE(compare(left, right) < 0 && compare(right, left) > 0) << type;
        EXPECT_EQ(compare(left, number), type == bn_type_uint32 ? 0 : static_cast<int>(type) - 5);
    };
    check(bn_type_int32, "-1", "1");
    check(bn_type_uint32, "1", "4294967295");
    check(bn_type_float64, "-1.5", "0.5");
    check(bn_type_str, "10", "9");
    check(bn_type_binary, "ab", "abc");
    check(bn_type_ipaddr, "200.0.0.1", "::1");
    check(bn_type_ipv4addr, "9.9.9.9", "10.0.0.2");
    check(bn_type_ipprefix, "10.0.0.0/8", "10.0.0.0/16");
    EXPECT_GT(compare(nullptr, number), 0);
}

TEST(Bindings, TypedOperations) {
    binding_owner binding, bare, address;
    uint32_t type = 9, value = 42;
    uint64_t first = 0, last = 0;
    ASSERT_EQ(bn_binding_new_uint32(&binding, "/a", 1, bn_flag_display | 7, 5), LC_OK);
    EXPECT_EQ(bn_binding_get_uint32(binding, 1, &type, &value), LC_OK);
    EXPECT_TRUE(value == 5 && type == (bn_type_uint32 | bn_flag_display));
    EXPECT_EQ(bn_binding_get_uint32(binding, 0, &type, &value), LC_OK); // an empty slot
    EXPECT_TRUE(value == 5 && type == 0);
    EXPECT_EQ(bn_binding_set_int8(binding, 1, 0, -1), LC_OK);
    ASSERT_EQ(bn_binding_new_ipv6addr(&address, "/b", 1, 0, 1, 2), LC_OK);
    EXPECT_EQ(bn_binding_get_ipv6addr(address, 1, nullptr, &first, &last), LC_OK);
    EXPECT_TRUE(first == 1 && last == 2);
    ASSERT_EQ(bn_binding_new_named(&bare, "/c"), LC_OK);
    log_lines log;
    char *given = nullptr;
    EXPECT_EQ(bn_binding_get_str(binding, 0, 0, nullptr, &given), LC_OK);
    EXPECT_TRUE(given == nullptr && log.take().empty());
    const auto expect = [&](lc_status got, lc_status wanted, const char *line) {
        EXPECT_EQ(got, wanted) << line;
        EXPECT_TRUE(log.say(line)) << line;
    };
    expect(bn_binding_get_uint32(nullptr, 1, nullptr, &value), LC_NULL, "NULL binding passed");
    expect(bn_binding_get_uint32(bare, 1, nullptr, &value), LC_NULL, "Unexpected NULL");
    expect(bn_binding_get_uint32(binding, 1, nullptr, &value), LC_ASSERTION, "a int8 attribute as a uint32");
    expect(bn_binding_get_uint32(binding, 129, nullptr, &value), LC_NOT_FOUND, "Error code 14004");
    expect(bn_binding_get_type(bare, 1, &type, nullptr), LC_NULL, "Unexpected NULL");
    expect(bn_binding_get_str(bare, 1, 0, nullptr, &given), LC_NULL, "attribute value of binding /c");
    expect(bn_binding_get_str(binding, 1, bn_type_str, nullptr, &given), LC_ASSERTION, "Error code");
}

TEST(Bindings, NamesAndParts) {
    tokens_owner parts;
    const auto check = [&](const char *name, int expected, const strings &list) {
        int absolute = -1; // and back, in the test of the matchers
        ASSERT_EQ(bn_binding_name_to_parts(name, &parts, &absolute), LC_OK);
        EXPECT_TRUE(absolute == expected && list_of(parts) == list) << name;
    };
    check("a/b", 0, {"a", "b"});
    check("/a//b", 1, {"a", "", "b"});
    check("/a/", 1, {"a", ""});
    check("/", 1, {});
    check("", 0, {});
    check("a\\b", 0, {"a\\b"});
    check("/a\\/b/c", 1, {"a/b", "c"});
    binding_owner binding, copy;
    ASSERT_EQ(bn_binding_new_named(&binding, "/file/\\/var\\/log/all"), LC_OK);
    ASSERT_EQ(bn_binding_name_to_parts("/file/\\/var\\/log/all", &binding->parts, nullptr), LC_OK);
    ASSERT_EQ(bn_binding_dup(binding, &copy), LC_OK);
    EXPECT_EQ(list_of(copy->parts), (strings{"file", "/var/log", "all"}));
    ASSERT_EQ(bn_binding_set_name(copy, "relative"), LC_OK);
    EXPECT_EQ(bn_binding_get_name_parts(copy, &parts), LC_ASSERTION); // not the earlier ones
}

TEST(Bindings, Patterns) {
    // A pattern, a match, none; null: not given.
    const auto check = [](const char *pattern, const char *matching, const char *other) {
        EXPECT_TRUE(!matching || bn_binding_name_pattern_match(matching, pattern)) << pattern;
        EXPECT_FALSE(other && bn_binding_name_pattern_match(other, pattern)) << pattern;
    };
    check("/config/*", "/config/51", "/config/51/weight");
    check("/logging/**", "/logging/a", "/logging");
    check("/logging/**", "/logging/a/b/c", nullptr);
    check("/a/**/b", "/a/x/y", "/a/x");
    check("/a/b", "/a/b", "a/b");
    check("/a/bc", nullptr, "/a/b");
    check("/a/*/c", "/a/x\\/y/c", nullptr);
    check("/a\\/b/*", "/a\\/b/c", nullptr);
    check("/a/*", "/a/", nullptr);
    check("/*", nullptr, "/");
    check("/a//b", "/a//b", "/a/bc");
}

// All short patterns with all short names: matching the text and matching the parts agree, a name is sent
// with the same bytes from its text and from its parts, and a received one is the same text again.
TEST(Bindings, BothMatchersAgreeEverywhere) {
    static const char *pieces[] = {"a", "*", "**", "\\/", "\\\\", "", "ab"};
    strings names = {"", "/"};
    for (const std::string lead : {"", "/"})
        for (const char *one : pieces)
            for (const std::string two : pieces)
                for (const std::string &rest : {"/" + two, two, "/" + two + "/a"})
                    names.push_back(lead + one + rest);
    for (const std::string &name : names) {
        tokens_owner parts;
        int absolute = 0;
        ASSERT_EQ(bn_binding_name_to_parts(name.c_str(), &parts, &absolute), LC_OK);
        std::string bytes[2];
        for (const bool from_parts : {false, true}) {
            request_owner msg, read;
            binding_owner binding;
            buffer_owner buffer;
            ASSERT_EQ(bn_event_request_msg_create(&msg, "e"), LC_OK);
            ASSERT_EQ(bn_binding_new_named(&binding, name.c_str()), LC_OK);
            ASSERT_EQ(from_parts ? tstr_array_duplicate(parts, &binding->parts) : LC_OK, LC_OK);
            ASSERT_EQ(bn_event_request_msg_append_binding_takeover(msg, 0, &binding.pointer, nullptr), LC_OK);
            ASSERT_EQ(bn_request_msg_serialize(msg, 0, &buffer), LC_OK);
            bytes[from_parts] = bytes_of(buffer);
            ASSERT_EQ(bn_request_msg_deserialize(buffer, 0, &read), LC_OK);
            EXPECT_EQ(
                text_of([&](char **out) { return bn_binding_name_parts_to_name(parts, absolute, out); }),
                bn_binding_get_name_quick(bn_request_per_node_array_get_quick(read->nodes, 0)->binding));
        }
        EXPECT_EQ(bytes[0], bytes[1]) << name;
        for (const std::string &pattern : names)
            ASSERT_EQ(bn_binding_name_pattern_match(name.c_str(), pattern.c_str()),
                      bn_binding_name_parts_pattern_match(parts, absolute, pattern.c_str()))
                << "name " << name << " pattern " << pattern;
    }
}

// --- Arrays

void append_names(bn_binding_array *array, const strings &names) {
    for (const std::string &name : names) {
        binding_owner binding;
        EXPECT_EQ(bn_binding_new_uint32(&binding, name.c_str(), 1, 0, 7), LC_OK);
        EXPECT_EQ(bn_binding_array_append_takeover(array, &binding.pointer), LC_OK);
        EXPECT_EQ(binding.pointer, nullptr);
    }
}
TEST(BindingArrays, FindByNameAndPattern) {
    for (const bool sorted : {false, true}) {
        bindings_owner array;
        ASSERT_EQ(bn_binding_array_new(&array), LC_OK);
        append_names(array,
                     {"/c/2/router/1", "/c/1", "/c/1/router/3", "/c/1/router/1", "/c-x", "/c/1/router"});
        ASSERT_EQ(sorted ? bn_binding_array_sort(array) : LC_OK, LC_OK);
        const bn_binding *found = nullptr;
        string_owner value, name;
        uint32_t type = 0;
        int32_t index = 0;
        tokens_owner parts;
        binding_owner detached;
        EXPECT_EQ(bn_binding_array_get_binding_by_name_rel(array, "/c/1", "router/1", &found), LC_OK);
        EXPECT_STREQ(bn_binding_get_name_quick(found), "/c/1/router/1");
        EXPECT_EQ(bn_binding_array_get_value_tstr_by_name_rel(array, "/c", "1", &type, &value), LC_OK);
        EXPECT_TRUE(text(value) == "7" && type == bn_type_uint32);
        EXPECT_EQ(bn_binding_array_get_value_tstr_by_name_rel(array, "/c", "9", &type, &value), LC_OK);
        EXPECT_EQ(value.pointer, nullptr);
        const char *pattern = "/c/*/router/*";
        EXPECT_EQ(bn_binding_array_get_name_part_tstr_array(array, pattern, 1, &parts), LC_OK);
        EXPECT_EQ(list_of(parts), sorted ? strings({"1", "1", "2"}) : strings({"2", "1", "1"}));
        EXPECT_NE(bn_binding_array_get_name_part_tstr_array(array, "/c/1", 2, &parts), LC_OK);
        EXPECT_EQ(bn_binding_array_get_first_matching_value_tstr(array, pattern, 2, &index, &name, &value),
                  LC_OK);
        EXPECT_EQ(text(name), sorted ? "/c/1/router/1" : "/c/1/router/3");
        EXPECT_EQ(bn_binding_array_detach_binding_by_name(array, "/c-x", &detached), LC_OK);
        EXPECT_STREQ(bn_binding_get_name_quick(detached), "/c-x");
        EXPECT_EQ(bn_binding_array_length_quick(array), 5u);
        EXPECT_EQ(bn_binding_array_detach_binding_by_name(array, "/c-x", &detached), LC_OK);
        EXPECT_EQ(detached.pointer, nullptr);
    }
}

TEST(BindingArrays, RenamedBindingsAreFound) {
    bindings_owner array;
    ASSERT_EQ(bn_binding_array_new(&array), LC_OK);
    for (int i = 40; i > 0; i--)
        append_names(array, {"/n/" + std::to_string(i)});
    const auto expect_index = [&](const char *name, int32_t expected) {
        int32_t index = -2;
        EXPECT_EQ(bn_binding_array_get_index_by_name(array, name, &index), LC_OK);
        EXPECT_EQ(index, expected) << name;
    };
    expect_index("/n/5", 35);
    EXPECT_NE(array->list->index, nullptr); // the search uses the index
    ASSERT_EQ(bn_binding_set_name(bn_binding_array_get_quick(array, 35), "/m"), LC_OK);
    expect_index("/n/5", -1);
    expect_index("/m", 35);
    append_names(array, {"/a"});
    expect_index("/a", 40);
}

} // namespace
