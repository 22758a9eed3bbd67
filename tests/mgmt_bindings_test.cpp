#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "mgmt/bnode_proto.h"
#include "tests/support/log_lines.h"
#include "tests/support/owners.h"

namespace {

using attrib_owner = owner<bn_attrib, bn_attrib_free>;
using binding_owner = owner<bn_binding, bn_binding_free>;
using bindings_owner = owner<bn_binding_array, bn_binding_array_free>;
using parts_owner = owner<tstr_array, tstr_array_free>;
using string_owner = owner<tstring, ts_free>;
using buffer_owner = owner<tbuffer, tb_free>;

std::string text(const tstring *string) {
    return string ? std::string(string->buffer, static_cast<size_t>(string->length)) : "(null)";
}
using strings = std::vector<std::string>;
strings list_of(const tstr_array *parts) {
    strings all;
    for (uint32_t i = 0; i < tstr_array_length_quick(parts); i++)
        all.emplace_back(tstr_array_get_str_quick(parts, i));
    return all;
}

// --- Text

// Each type by its number, the wire form of its first text (the kind, and what follows id, type and flags),
// texts, with "in -> out" where one comes back as another, and texts that are refused, separated by "|";
// null: none.
const struct type_case {
    uint32_t type, kind;
    const char *bytes, *texts, *refused;
} type_cases[] = {
    {1, 1, "00000001 ff", "255|007 -> 7", "256|-1|+1| 1|1 |0x1"},
    {2, 1, "00000001 80", "-128", "|128|-129|--1|- 1"},
    {3, 1, "00000002 ffff", "65535|258", nullptr},
    {4, 1, "00000002 fffe", "-2|-32768", nullptr},
    {5, 1, "00000004 00000102", "258|4294967295", "12x|4294967296"},
    {6, 1, "00000004 80000000", "-2147483648", nullptr},
    {7, 1, "00000008 0102030405060708", "72623859790382856|18446744073709551615", "18446744073709551616|-1"},
    {8, 1, "00000008 8000000000000000", "-9223372036854775808|9223372036854775807", "9223372036854775808"},
    {9, 1, "00000004 00000001", "on -> true|F -> false", "1|True"},
    {20, 1, "00000004 3fc00000", "1.5 -> 1.500000000", "1e99"},
    {21, 1, "00000008 bfd0000000000000", "-0.25", "1.5x| 1"},
    {40, 1, "00000001 78", "x", "xy"},
    {50, 1, "04 000000000000000000000000 0302010a", "10.1.2.3", "10.0.0|1:2"},
    {50, 1, "06 0500000000000000 00000000 b80d0120", "2001:db8::5", nullptr},
    {51, 1, "04 10 000000000000000000000000 0000010a", "10.1.0.0/16|::1 -> ::1/0", "10.0.0.0/33|10.0.0.0/"},
    {60, 1, "00000004 c0a801ff", "192.168.1.255", "1.2.3.256|1.2.3.4.5|1.2.3.-4|1..3.4"},
    {61, 1, "00000008 0a010000 ffff0000", "10.1.0.0/16|0.0.0.0/0|1.2.3.4/32",
     "1.2.3.4|1.2.3.4/33|1.2.3.4/-1"},
    {62, 2, "00000006 001122aabbff", "00:11:22:AA:BB:FF|1:2:a:b:c:d -> 01:02:0A:0B:0C:0D",
     "00:11:22:33:44|00:11:22:33:44:55:66|00:11:22:33:44:|00112:233:4455"},
    {62, 2, "00000006 001122334455", "0011:2233:4455 -> 00:11:22:33:44:55", nullptr},
    {63, 1, "00000010 05000000000000000000 0000 b80d0120", "2001:db8::5", "10.0.0.1"},
    {64, 1, "00000011 000000000000000000000000 b80d0120 20", "2001:db8::/32", "::1|::1/129"},
    {70, 1, "00000004 00015180", "1970/01/02", "2020/1/2x"},
    {71, 1, "00000004 0000a8c1", "12:00:01", "25:00:00"},
    {72, 1, "00000008 00000000029332e2", "12:00:01.250", nullptr},
    {73, 1, "00000008 0000000a0efec34d", "12:00:01.250125", nullptr},
    {74, 1, "00000004 5e0d5da5", "2020/01/02 03:04:05", "2100/01/01 00:00:00"},
    {75, 1, "00000008 0000016f6435ce7c", "2020/01/02 03:04:05.5 -> 2020/01/02 03:04:05.500",
     "1960/01/01 00:00:00"},
    {76, 1, "00000008 00059b1f7226f341", "2020/01/02 03:04:05.000001", nullptr},
    {77, 1, "00000004 ffffffff", "4294967295", "-1|1.5"},
    {78, 1, "00000008 fffffffffffffffb", "-5", nullptr},
    {79, 1, "00000008 000000000016e360", "1500000", nullptr},
    {0x1004d, 1, "00000004 00000003", "3.9 -> 3.000000 seconds", "-1"},
    {0x1004f, 1, "00000008 000000000016e360", "1.5 seconds -> 1.500000 seconds", nullptr},
    {90, 1, "00000000", "anything -> ", nullptr},
    {92, 1, "00000004 0000003d", "ipv4prefix", "uint128"},
    {93, 1, "00000004 00000081", "revision_id", ""},
    {101, 4, "00000003 616263", "abc||any \xff text", nullptr},
    {102, 4, "00000002 c3a4", "\xc3\xa4", "\xc3"},
    {103, 4, "00000003 78797a", "xyz", nullptr},
    {105, 4, "00000002 2e31", ".1", nullptr},
    {120, 4, "00000001 61", "a", nullptr},
    {121, 4, "00000001 61", "a", nullptr},
    {130, 4, "0000000b 612d312e6578616d706c65", "a-1.example", "-a|a_b"},
    {131, 4, "00000001 61", "a", nullptr},
    {132, 4, "00000001 61", "a", nullptr},
    {133, 4, "00000001 61", "a", nullptr},
    {134, 4, "00000001 2a", "*", nullptr},
    {0x40005, 1, "00000004 00000000", "", nullptr},
    {0x180005, 1, "00000000", "", nullptr},
    {0x100065, 4, "00000000", "", nullptr},
    {0x1004e, 1, nullptr, nullptr, "soon"},
    {91, 1, nullptr, nullptr, ""},
};
std::vector<std::string> split(const char *texts) {
    std::vector<std::string> all;
    for (const char *end = texts; texts; texts = *end ? end + 1 : nullptr) {
        end = texts + strcspn(texts, "|");
        all.emplace_back(texts, end);
    }
    return all;
}
lc_status set_text(bn_attrib *attrib, uint32_t type, const std::string &in) {
    return bn_attrib_set_str(attrib, 1, type & BN_TYPE_MASK, type & ~BN_TYPE_MASK, in.c_str());
}
TEST(Texts, BecomeValuesAndTextsAgain) {
    log_lines log;
    for (const type_case &c : type_cases) {
        for (const std::string &row : split(c.texts)) {
            const size_t arrow = row.find(" -> ");
            attrib_owner attrib;
            ASSERT_EQ(bn_attrib_new(&attrib), LC_OK);
            ASSERT_EQ(set_text(attrib, c.type, row.substr(0, arrow)), LC_OK) << c.type << row;
            EXPECT_EQ(text_of([&](char **out) {
                          return bn_attrib_get_str(attrib, nullptr, attrib->type, nullptr, out);
                      }),
                      arrow == std::string::npos ? row : row.substr(arrow + 4));
        }
        for (const std::string &in : split(c.refused)) {
            SCOPED_TRACE(std::to_string(c.type) + " " + in);
            attrib_owner attrib;
            binding_owner binding;
            uint32_t kept = 0, word = 0;
            ASSERT_EQ(bn_attrib_new_uint32(&attrib, 1, 0, 77), LC_OK);
            EXPECT_EQ(set_text(attrib, c.type, in), LC_BAD_TYPE);
            EXPECT_EQ(bn_attrib_get_uint32(attrib, nullptr, nullptr, &kept), LC_OK);
            EXPECT_EQ(kept, 77u);
            EXPECT_EQ(bn_binding_new_str_autoinval(&binding, "/a", 1, c.type & BN_TYPE_MASK,
                                                   c.type & ~BN_TYPE_MASK, in.c_str()),
                      LC_OK);
            EXPECT_EQ(text_of([&](char **out) { return bn_binding_get_str(binding, 1, 0, &word, out); }), "");
            EXPECT_EQ(word, c.type | bn_flag_invalid);
            const std::string lines = log.take(); // only those with the bytes of bad UTF-8
            EXPECT_TRUE(lines.empty() || c.type == bn_type_utf8_string) << lines;
        }
    }
}
TEST(Texts, RefusedTypesAndIds) {
    attrib_owner attrib;
    EXPECT_EQ(bn_attrib_new_str(&attrib, 1, bn_type_any, 0, "x"), LC_UNEXPECTED_CASE);
    EXPECT_EQ(attrib.pointer, nullptr);
    EXPECT_EQ(bn_attrib_new_str(&attrib, 1, 30, 0, "x"), LC_ASSERTION);
    EXPECT_EQ(bn_attrib_new_str(&attrib, 1, bn_type_uint8, 0, nullptr), LC_NULL);
    for (const uint32_t id : {0u, 4u, 131u, 0xffffffffu})
        EXPECT_EQ(bn_attrib_new_uint32(&attrib, id, 0, 1), LC_ASSERTION) << id;
    EXPECT_EQ(bn_attrib_new_macaddr802(&attrib, 1, 0, nullptr), LC_NULL);
    EXPECT_EQ(bn_attrib_set_uint32(nullptr, 1, 0, 1), LC_NULL);

    binding_owner invalid, absent;
    ASSERT_EQ(bn_binding_new_str_autoinval(&invalid, "/a", 1, bn_type_uint32, 0, "abc"), LC_OK);
    const bn_attrib *given = nullptr;
    ASSERT_EQ(bn_binding_get_attrib(invalid, 1, &given), LC_OK);
    EXPECT_EQ(given->value_size, 4u);
    EXPECT_EQ(given->type_flags, static_cast<uint32_t>(bn_flag_invalid));
    ASSERT_EQ(bn_binding_new_str(&absent, "/a", 1, bn_type_str, bn_flag_deleted | bn_flag_absent, nullptr),
              LC_OK);
    uint32_t type = 0, flags = 0;
    EXPECT_EQ(bn_binding_get_type(absent, 1, &type, &flags), LC_OK);
    EXPECT_TRUE(type == bn_type_str && flags == 0x180000u && bn_type_string(type));
    EXPECT_FALSE(bn_type_string(type | flags));
}

// --- Wire: bytes written by hand

std::string from_hex(const char *hex) {
    std::string bytes;
    for (; *hex; hex++)
        if (*hex != ' ') {
            bytes += static_cast<char>(std::stoi(std::string(hex, 2), nullptr, 16));
            hex++;
        }
    return bytes;
}
std::string content(const tbuffer *buffer) {
    return std::string(reinterpret_cast<char *>(tb_buf(buffer)), static_cast<size_t>(tb_length(buffer)));
}

std::string golden_bytes(const type_case &c) {
    char header[64];
    snprintf(header, sizeof header, "%08x 00000001 %08x %08x", c.kind, c.type & BN_TYPE_MASK,
             c.type & ~BN_TYPE_MASK);
    return from_hex(header) + from_hex(c.bytes);
}

TEST(Wire, EachFamilyByteForByte) {
    for (const type_case &c : type_cases) {
        if (!c.bytes)
            continue;
        SCOPED_TRACE(c.type);
        attrib_owner attrib, back;
        buffer_owner buffer;
        const std::string golden = golden_bytes(c);
        ASSERT_EQ(tb_new(&buffer), LC_OK);
        ASSERT_EQ(tb_append_uint8(buffer, 0xee), LC_OK); // odd offsets
        ASSERT_EQ(bn_attrib_new(&attrib), LC_OK);
        const std::string first = split(c.texts)[0];
        ASSERT_EQ(set_text(attrib, c.type, first.substr(0, first.find(" -> "))), LC_OK);
        ASSERT_EQ(bn_attrib_append_wire(attrib, buffer), LC_OK);
        EXPECT_EQ(content(buffer).substr(1), golden);

        uint32_t used = 0;
        ASSERT_EQ(bn_attrib_read_wire(buffer, 1, &back, &used), LC_OK);
        EXPECT_EQ(used, golden.size());
        EXPECT_EQ(back->value_size, attrib->value_size);
        int order = 1;
        ASSERT_EQ(bn_attrib_compare(attrib, back, &order), LC_OK);
        EXPECT_EQ(order, 0);
        EXPECT_EQ(back->type | back->type_flags, c.type);

        for (size_t length = 1; length < golden.size(); length++) {
            // A buffer of exactly these bytes, so that the sanitizer sees a read past them.
            const std::vector<char> bytes(golden.data(), golden.data() + length);
            buffer_owner cut;
            attrib_owner none;
            ASSERT_EQ(tb_new_buf_const(&cut, bytes.data(), static_cast<uint32_t>(length)), LC_OK);
            EXPECT_NE(bn_attrib_read_wire(cut, 0, &none, &used), LC_OK) << length;
            EXPECT_EQ(none.pointer, nullptr);
        }
    }
}

lc_status read_hex(const char *hex, bn_attrib **out) {
    const std::string bytes = from_hex(hex);
    buffer_owner buffer;
    EXPECT_EQ(tb_new_buf(&buffer, bytes.data(), static_cast<int32_t>(bytes.size())), LC_OK);
    return bn_attrib_read_wire(buffer, 0, out, nullptr);
}
TEST(Wire, FalseFieldsAreRefused) {
    static const struct {
        const char *bytes;
        lc_status status;
    } cases[] = {
        {"00000001 ffffffff 00000005 00000000 00000004 00000001", LC_ASSERTION}, // ids
        {"00000001 00000000 00000005 00000000 00000004 00000001", LC_ASSERTION},
        {"00000001 00000004 00000005 00000000 00000004 00000001", LC_ASSERTION},
        {"00000001 00000083 00000005 00000000 00000004 00000001", LC_ASSERTION},
        {"00000001 00000001 00000000 00000000 00000004 00000001", LC_ASSERTION}, // types
        {"00000001 00000001 00000087 00000000 00000004 00000001", LC_ASSERTION},
        {"00000001 00000001 80000005 00000000 00000004 00000001", LC_ASSERTION},
        {"00000001 00000001 0000005b 00000000 00000004 00000001", LC_NULL},
        {"00000001 00000001 0000000b 00000000 00000004 00000001", LC_NULL},
        {"00000004 00000001 00000005 00000000 00000004 00000001", LC_GENERIC}, // another family's kind
        {"00000001 00000001 00000005 00000000 00000002 00000001", LC_GENERIC}, // sizes
        {"00000001 00000001 00000005 00000000 00000000 00000001", LC_GENERIC},
        {"00000001 00000001 00000005 00000000 ffffffff 00000001", LC_GENERIC},
        {"00000004 00000001 00000065 00000000 ffffffff 616263", LC_NO_BUFFER_SPACE}, // lengths
        {"00000004 00000001 00000067 00000000 00000004 616263", LC_NO_BUFFER_SPACE},
    };
    for (const auto &c : cases) {
        attrib_owner attrib;
        EXPECT_EQ(read_hex(c.bytes, &attrib), c.status) << c.bytes;
    }
    log_lines log;
    attrib_owner attrib;
    buffer_owner buffer;
    ASSERT_TRUE(tb_new(&buffer) == LC_OK && bn_attrib_new(&attrib) == LC_OK);
    attrib->type = bn_type_any;
    EXPECT_EQ(bn_attrib_append_wire(attrib, buffer), LC_NULL);
    EXPECT_NE(log.take().find("Couldn't get attrib copy out func for type any"), std::string::npos);
    attrib->type = 0;
    EXPECT_EQ(bn_attrib_append_wire(attrib, buffer), LC_ASSERTION);
    EXPECT_EQ(tb_length(buffer), 0);
}

TEST(Wire, InvalidUtf8StaysPlainText) {
    attrib_owner attrib;
    ASSERT_EQ(read_hex("00000004 00000001 00000066 00000000 00000002 61ff", &attrib), LC_OK);
    EXPECT_EQ(text(attrib->value.string), "a\xff");
    EXPECT_EQ(attrib->value.string->utf8, 0);
}

// --- Attributes and bindings

TEST(Attributes, Order) {
    static const struct {
        uint32_t type;
        const char *lower, *higher;
    } pairs[] = {
        {bn_type_int32, "-1", "1"},
        {bn_type_uint32, "1", "4294967295"},
        {bn_type_uint64, "9", "10"},
        {bn_type_float64, "-1.5", "0.5"},
        {bn_type_str, "10", "9"},
        {bn_type_binary, "ab", "abc"},
        {bn_type_ipaddr, "200.0.0.1", "::1"},
        {bn_type_ipv4addr, "9.9.9.9", "10.0.0.2"},
        {bn_type_ipprefix, "10.0.0.0/8", "10.0.0.0/16"},
    };
    attrib_owner number, invalid;
    ASSERT_EQ(bn_attrib_new_uint32(&number, 1, 0, 1), LC_OK);
    ASSERT_EQ(bn_attrib_new_str(&invalid, 1, bn_type_uint8, bn_flag_invalid, ""), LC_OK);
    const auto compare = [](const bn_attrib *a, const bn_attrib *b) {
        int order = 99;
        EXPECT_EQ(bn_attrib_compare(a, b, &order), LC_OK);
        return order;
    };
    for (const auto &[type, lower, higher] : pairs) {
        attrib_owner left, right, copy;
        ASSERT_EQ(bn_attrib_new_str(&left, 1, type, 0, lower), LC_OK);
        ASSERT_EQ(bn_attrib_new_str(&right, 1, type, 0, higher), LC_OK);
        ASSERT_EQ(bn_attrib_dup(left, &copy), LC_OK);
        EXPECT_TRUE(compare(left, right) < 0 && compare(right, left) > 0 && compare(left, copy) == 0)
            << lower;
        EXPECT_EQ(compare(left, number), type == bn_type_uint32 ? 0 : static_cast<int>(type) - 5);
    }
    EXPECT_TRUE(compare(number, invalid) < 0 && compare(invalid, invalid) == 0 &&
                compare(nullptr, number) > 0);
}

TEST(Bindings, TypedOperations) {
    binding_owner binding, address, bare;
    uint32_t type = 9, value = 42;
    int8_t small = 0;
    uint64_t first = 0, last = 0;
    ASSERT_EQ(bn_binding_new_uint32(&binding, "/a", 1, bn_flag_display | 7, 5), LC_OK);
    EXPECT_EQ(bn_binding_get_uint32(binding, 1, &type, &value), LC_OK);
    EXPECT_TRUE(value == 5 && type == (bn_type_uint32 | bn_flag_display));
    EXPECT_EQ(bn_binding_get_uint32(binding, 0, &type, &value), LC_OK); // an empty slot
    EXPECT_TRUE(value == 5 && type == 0);
    EXPECT_EQ(bn_binding_set_uint64(binding, 129, 0, 1ull << 40), LC_OK);
    EXPECT_EQ(bn_binding_set_int8(binding, 1, 0, -1), LC_OK);
    EXPECT_TRUE(bn_binding_get_int8(binding, 1, nullptr, &small) == LC_OK && small == -1);
    ASSERT_EQ(bn_binding_new_ipv6addr(&address, "/b", 1, 0, 1, 2), LC_OK);
    EXPECT_EQ(bn_binding_get_ipv6addr(address, 1, nullptr, &first, &last), LC_OK);
    EXPECT_TRUE(first == 1 && last == 2);
    ASSERT_EQ(bn_binding_new_named(&bare, "/c"), LC_OK);
    log_lines log;
    char *given = nullptr;
    const auto expect = [&](lc_status got, lc_status wanted, const char *line) {
        EXPECT_EQ(got, wanted) << line;
        const std::string lines = log.take();
        EXPECT_TRUE(*line ? lines.find(line) != std::string::npos : lines.empty()) << line << lines;
    };
    expect(bn_binding_get_uint32(nullptr, 1, nullptr, &value), LC_NULL, "NULL binding passed");
    expect(bn_binding_get_uint32(bare, 1, nullptr, &value), LC_NULL, "Unexpected NULL");
    expect(bn_binding_get_uint32(binding, 1, nullptr, &value), LC_ASSERTION,
           "Tried to get a int8 attribute as a uint32");
    expect(bn_binding_get_uint32(address, 129, nullptr, &value), LC_NOT_FOUND, "Error code 14004");
    expect(bn_binding_get_type(bare, 1, &type, nullptr), LC_NULL, "Unexpected NULL");
    expect(bn_binding_get_str(bare, 1, 0, nullptr, &given), LC_NULL,
           "Can't get attribute value of binding /c");
    expect(bn_binding_get_str(binding, 1, bn_type_str, nullptr, &given), LC_ASSERTION, "Error code");
    expect(bn_binding_get_str(address, 0, 0, nullptr, &given), LC_OK, "");
    EXPECT_EQ(given, nullptr);
}

TEST(Bindings, NamesAndParts) {
    const struct {
        const char *name;
        int absolute;
        strings parts;
    } cases[] = {
        {"a/b", 0, {"a", "b"}},
        {"/a//b", 1, {"a", "", "b"}},
        {"/a/", 1, {"a", ""}},
        {"/", 1, {}},
        {"", 0, {}},
        {"a\\b", 0, {"a\\b"}},
        {"/a\\/b/c", 1, {"a/b", "c"}},
    };
    for (const auto &c : cases) { // and back, in the test of the matchers
        parts_owner parts;
        int absolute = -1;
        ASSERT_EQ(bn_binding_name_to_parts(c.name, &parts, &absolute), LC_OK);
        EXPECT_EQ(absolute, c.absolute) << c.name;
        EXPECT_EQ(list_of(parts), c.parts) << c.name;
    }
    const char *syslog = "/logging/syslog/action/file/\\/var\\/log\\/messages/facility/all/min_priority";
    binding_owner binding, from_parts, copy;
    parts_owner parts;
    ASSERT_EQ(bn_binding_new_named(&binding, syslog), LC_OK);
    ASSERT_EQ(bn_binding_get_name_parts(binding, &parts), LC_OK);
    EXPECT_EQ(list_of(parts).at(4), "/var/log/messages");
    ASSERT_EQ(bn_binding_new_parts_components(&from_parts, nullptr, parts, 1, nullptr), LC_OK);
    EXPECT_STREQ(bn_binding_get_name_quick(from_parts), syslog);
    const tstr_array *kept = nullptr;
    ASSERT_EQ(bn_binding_dup(from_parts, &copy), LC_OK);
    ASSERT_EQ(bn_binding_get_name_parts_const(copy, &kept, nullptr), LC_OK);
    EXPECT_EQ(tstr_array_length_quick(kept), 8u);
    ASSERT_EQ(bn_binding_set_name(copy, "relative"), LC_OK);
    ASSERT_EQ(bn_binding_get_name_parts_const(copy, &kept, nullptr), LC_OK);
    EXPECT_EQ(kept, nullptr);
    EXPECT_EQ(bn_binding_get_name_parts(copy, &parts), LC_ASSERTION);
}

TEST(Bindings, Patterns) {
    static const struct {
        const char *pattern, *matching, *other; // null: none
    } cases[] = {
        {"/config/*", "/config/51", "/config/51/weight"},
        {"/logging/**", "/logging/a", "/logging"},
        {"/logging/**", "/logging/a/b/c", nullptr},
        {"/a/**/b", "/a/x/y", "/a/x"},
        {"/a/b", "/a/b", "a/b"},
        {"/a/b", nullptr, "/a/bc"},
        {"a/b", "a/b", "/a/b"},
        {"/a/bc", nullptr, "/a/b"},
        {"/a/*/c", "/a/x\\/y/c", nullptr},
        {"/a\\/b/*", "/a\\/b/c", nullptr},
        {"/a/*", "/a/", nullptr},
        {"/", "/", "/a"},
        {"/*", nullptr, "/"},
        {"/a//b", "/a//b", nullptr},
        {"/a\\b", "/a\\b", nullptr},
    };
    for (const auto &[pattern, matching, other] : cases) {
        EXPECT_TRUE(!matching || bn_binding_name_pattern_match(matching, pattern)) << pattern;
        EXPECT_FALSE(other && bn_binding_name_pattern_match(other, pattern)) << pattern;
    }
}

// All short patterns with all short names: matching the text and matching the parts agree, a name is sent
// with the same bytes from its text and from its parts, and a received one is the same text again.
TEST(Bindings, BothMatchersAgreeEverywhere) {
    static const char *pieces[] = {"a", "*", "**", "\\/", "\\\\", "", "ab"};
    std::vector<std::string> names = {"", "/"};
    for (const char *lead : {"", "/"})
        for (const char *one : pieces)
            for (const char *two : pieces) {
                names.push_back(std::string(lead) + one + "/" + two);
                names.push_back(std::string(lead) + one + two);
                names.push_back(std::string(lead) + one + "/" + two + "/a");
            }
    for (const std::string &name : names) {
        parts_owner parts;
        int absolute = 0;
        ASSERT_EQ(bn_binding_name_to_parts(name.c_str(), &parts, &absolute), LC_OK);
        std::string bytes[2];
        for (const bool from_parts : {false, true}) {
            owner<bn_request_msg, bn_request_msg_free> msg;
            binding_owner binding;
            buffer_owner buffer;
            ASSERT_EQ(bn_event_request_msg_create(&msg, "e"), LC_OK);
            ASSERT_EQ(bn_binding_new_named(&binding, name.c_str()), LC_OK);
            if (from_parts) {
                ASSERT_EQ(tstr_array_duplicate(parts, &binding->parts), LC_OK);
            }
            ASSERT_EQ(bn_event_request_msg_append_binding_takeover(msg, 0, &binding.pointer, nullptr), LC_OK);
            ASSERT_EQ(bn_request_msg_serialize(msg, 0, &buffer), LC_OK);
            bytes[from_parts] = content(buffer);
            owner<bn_request_msg, bn_request_msg_free> read;
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

void append(bn_binding_array *array, const std::string &name, uint32_t value) {
    binding_owner binding;
    ASSERT_EQ(bn_binding_new_uint32(&binding, name.c_str(), 1, 0, value), LC_OK);
    ASSERT_EQ(bn_binding_array_append_takeover(array, &binding.pointer), LC_OK);
    ASSERT_EQ(binding.pointer, nullptr);
}
TEST(BindingArrays, FindByNameAndPattern) {
    for (const bool sorted : {false, true}) {
        bindings_owner array;
        ASSERT_EQ(bn_binding_array_new(&array), LC_OK);
        for (const char *name :
             {"/c/2/router/1", "/c/1", "/c/1/router/3", "/c/1/router/1", "/c-x", "/c/1/router"})
            append(array, name, 7);
        if (sorted) {
            ASSERT_EQ(bn_binding_array_sort(array), LC_OK);
        }
        const bn_binding *found = nullptr;
        string_owner value, name;
        uint32_t type = 0;
        int32_t index = 0;
        parts_owner parts;
        binding_owner detached;
        EXPECT_EQ(bn_binding_array_get_binding_by_name_rel(array, "/c/1", "router/1", &found), LC_OK);
        ASSERT_NE(found, nullptr);
        EXPECT_STREQ(bn_binding_get_name_quick(found), "/c/1/router/1");
        EXPECT_EQ(bn_binding_array_get_value_tstr_by_name(array, "/c/1", &type, &value), LC_OK);
        EXPECT_TRUE(text(value) == "7" && type == bn_type_uint32);
        EXPECT_EQ(bn_binding_array_get_value_tstr_by_name_rel(array, "/c", "9", &type, &value), LC_OK);
        EXPECT_EQ(value.pointer, nullptr);

        EXPECT_EQ(bn_binding_array_get_name_part_tstr_array(array, "/c/*/router/*", 1, &parts), LC_OK);
        EXPECT_EQ(list_of(parts), sorted ? strings({"1", "1", "2"}) : strings({"2", "1", "1"}));
        EXPECT_NE(bn_binding_array_get_name_part_tstr_array(array, "/c/1", 2, &parts), LC_OK);
        EXPECT_EQ(
            bn_binding_array_get_first_matching_value_tstr(array, "/c/*/router/*", 0, &index, &name, &value),
            LC_OK);
        EXPECT_EQ(text(name), sorted ? "/c/1/router/1" : "/c/2/router/1");
        const auto next = static_cast<uint32_t>(index) + 1;
        EXPECT_EQ(bn_binding_array_get_first_matching_binding(array, "/c/*/router/*", next, &index, &found),
                  LC_OK);
        EXPECT_STREQ(bn_binding_get_name_quick(found), "/c/1/router/3");

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
        append(array, "/n/" + std::to_string(i), 0);
    int32_t index = -1;
    ASSERT_EQ(bn_binding_array_get_index_by_name(array, "/n/5", &index), LC_OK);
    EXPECT_EQ(index, 35);
    EXPECT_NE(array->list->index, nullptr); // the search uses the index
    ASSERT_EQ(bn_binding_set_name(bn_binding_array_get_quick(array, 35), "/m"), LC_OK);
    ASSERT_EQ(bn_binding_array_get_index_by_name(array, "/n/5", &index), LC_OK);
    EXPECT_EQ(index, -1);
    ASSERT_EQ(bn_binding_array_get_index_by_name(array, "/m", &index), LC_OK);
    EXPECT_EQ(index, 35);
    append(array, "/a", 0);
    ASSERT_EQ(bn_binding_array_get_index_by_name(array, "/a", &index), LC_OK);
    EXPECT_EQ(index, 40);
}

} // namespace
