// Strings, tokens and buffers.
#include <gtest/gtest.h>

#include "tests/support/log_lines.h"
#include "tests/support/runtime_owners.h"

namespace {

// What an operation leaves: the text or the size, or the number of the failure.
std::string status_and_text(lc_status status, const tstring *string) {
    return status == LC_OK ? text(string) : std::to_string(status);
}
template <typename Object>
uint32_t size_left(lc_status status, const Object &object) {
    return status == LC_OK ? object->size : static_cast<uint32_t>(status);
}

TEST(Strings, GrowAndShrink) {
    const std::string many(1000, 'y'), piece(0x1000000, 'b');
    string_owner string;
    ASSERT_EQ(ts_new(&string), LC_OK);
    for (int i = 0; i < 15; i++)
        EXPECT_EQ(size_left(ts_append_char(string, 'x'), string), 16u);
    EXPECT_EQ(size_left(ts_append_char(string, 'x'), string), 32u);
    EXPECT_EQ(size_left(ts_append_str(string, many.c_str() + 916), string), 128u);
    EXPECT_EQ(size_left(ts_clear_no_resize(string), string), 128u);
    EXPECT_EQ(status_and_text(ts_append_str(string, "z"), string), "z");
    EXPECT_EQ(size_left(ts_clear(string), string), 16u);
    EXPECT_EQ(size_left(ts_append_str(string, many.c_str()), string), 1024u);
    EXPECT_EQ(size_left(ts_copy_str(string, 20, "end"), string), 64u); // stops at four times what is needed
    EXPECT_EQ(text(string), std::string(20, 'y') + "end");

    ASSERT_EQ(ts_new_str(&string, piece.c_str()), LC_OK);
    EXPECT_EQ(string->size, 0x1000001u + 0x800000u); // not doubled any more
    for (int i = 0; i < 3; i++)
        ASSERT_EQ(ts_append_str(string, piece.c_str()), LC_OK);
    log_lines log;
    EXPECT_EQ(ts_append_str(string, piece.c_str()), LC_ASSERTION); // would be 0x5000000 bytes
    EXPECT_TRUE(log.say("maximum size exceeded: 83886081") && string->length == 0x4000000);
    EXPECT_EQ(size_left(ts_append_str(string, piece.c_str() + 1), string), 0x5000000u);
}

TEST(Strings, OffsetsAndTheirLimits) {
    string_owner string, piece;
    ASSERT_EQ(ts_new_str(&string, "abcdef"), LC_OK);
    EXPECT_EQ(status_and_text(ts_put_str(string, 2, "XY"), string), "abXYef");
    EXPECT_EQ(status_and_text(ts_put_str(string, 5, "12"), string), "abXYe12");
    EXPECT_EQ(status_and_text(ts_put_char(string, 99, 'd'), string), "abXYe12d"); // past the end appends
    EXPECT_EQ(status_and_text(ts_copy_str(string, 1, "cd"), string), "acd");
    EXPECT_EQ(status_and_text(ts_insert_char(string, 1, 'b'), string), "abcd");
    EXPECT_EQ(status_and_text(ts_append(string, string), string), "abcdabcd"); // itself
    EXPECT_EQ(status_and_text(ts_append_str_frag(string, "0123456", 2, 3), string), "abcdabcd234");
    EXPECT_EQ(status_and_text(ts_append_str_frag(string, "0123456", 5, -1), string), "abcdabcd23456");
    EXPECT_EQ(status_and_text(ts_append_sprintf(string, "-%d", 7), string), "abcdabcd23456-7");
    for (const lc_status status : {ts_insert_char(string, 16, 'x'), ts_put_str(string, 16, "x"),
                                   ts_copy_str(string, -1, "x"), ts_append_str_frag(string, "012", 4, 1)})
        EXPECT_EQ(status, LC_NO_BUFFER_SPACE);
    EXPECT_TRUE(ts_append_char(string, 0) == LC_ASSERTION && ts_get_char(string, 15) == 0);
    EXPECT_EQ(ts_substr(string, 16, 1, &piece), LC_ASSERTION);
    int32_t at = 0;
    EXPECT_TRUE(ts_rfind_char(string, 3, 'a', &at) == LC_OK && at == 0);
    ASSERT_EQ(ts_new_str(&piece, "  a b //"), LC_OK);
    EXPECT_EQ(status_and_text(ts_trim(piece, ' ', '/'), piece), "a b ");
}

TEST(Strings, NullsTakeoverAndOrder) {
    string_owner string, other;
    log_lines log;
    EXPECT_TRUE(!ts_str(nullptr) && log.say("runtime_strings_test.cpp"));
    EXPECT_TRUE(ts_length(nullptr) == -1 && ts_append_str(nullptr, "x") == LC_NULL);
    char *given = strdup("taken");
    EXPECT_TRUE(ts_new_str_takeover(&string, &given, -1, -1) == LC_OK && !given);
    EXPECT_EQ(ts_append_str(string, " and longer than it was"), LC_OK);
    EXPECT_EQ(text_of([&](char **out) { return ts_detach(&string.pointer, out, nullptr); }),
              "taken and longer than it was");
    ASSERT_TRUE(ts_new_str(&string, "Name") == LC_OK && ts_new_str(&other, "name") == LC_OK);
    EXPECT_TRUE(ts_equal(nullptr, nullptr) && !ts_equal(string, nullptr) && !ts_equal(string, other));
    EXPECT_TRUE(ts_cmp(string, other) < 0 && ts_equal_str(string, "nAME", 1) &&
                !ts_equal_str(string, "nAME", 0));
}

// In memory of somebody else, strings and arrays of them take any operation and leave that memory alone.
TEST(Strings, PackedInOneAllocation) {
    const auto check = [](lc_status (*change)(tstring *), const char *expected) {
        tokens_owner array;
        tstring *records = nullptr, *one = nullptr;
        char *bytes = nullptr;
        ASSERT_EQ(tstr_array_new_packed(&array, 2, 6, &records, &bytes), LC_OK);
        memcpy(bytes, "ab\0cd", 6);
        ts_place(&records[0], bytes, 2);
        ts_place(&records[1], bytes + 3, 2);
        EXPECT_EQ(status_and_text(change(records), records), expected);
        ASSERT_EQ(tstr_array_append_str(array, "more"), LC_OK); // moves the slots
        EXPECT_STREQ(tstr_array_get_str_quick(array, 1), "cd");
        ASSERT_EQ(tstr_array_remove(array, 0, &one), LC_OK);
        EXPECT_EQ(text_of([&](char **out) { return ts_detach(&one, out, nullptr); }), expected);
    };
    check([](tstring *string) { return ts_append_str(string, "cdefghijklmnopq"); }, "abcdefghijklmnopq");
    check([](tstring *string) { return ts_copy_str(string, 1, "c"); }, "ac");
    check([](tstring *string) { return ts_trim(string, 'a', 0); }, "b");
    check([](tstring *string) { return ts_set_utf8(string, 1); }, "ab");
    check(ts_clear, "");
}

TEST(Strings, CharactersOfUtf8) {
    string_owner string, piece;
    ASSERT_EQ(ts_new_str(&string, "a\xc3\xa4z"), LC_OK); // a, a umlaut, z
    EXPECT_TRUE(ts_num_chars(string) == 4 && ts_set_utf8(string, 1) == LC_OK && ts_num_chars(string) == 3);
    EXPECT_TRUE(ts_get_char(string, 1) == 0xe4 && ts_equal_str(string, "A\xc3\x84Z", 1));
    EXPECT_TRUE(ts_substr(string, 1, 1, &piece) == LC_OK && text(piece) == "\xc3\xa4");
    EXPECT_EQ(status_and_text(ts_put_str(string, 1, "\xe2\x82\xac"), string),
              "a\xe2\x82\xacz"); // one for one
    int32_t at = 0;
    EXPECT_TRUE(ts_find_char(string, 0, 'z', &at) == LC_OK && at == 2);
    log_lines log;
    EXPECT_TRUE(ts_append_str(string, "b\xff") == LC_BAD_UTF8 && log.say("98 *** 255 ***"));
    EXPECT_EQ(ts_num_chars(string), 3);
}

// --- Tokens

std::string split_tokens(const char *given, char separator, char escape, char quote, uint32_t flags) {
    tokens_owner array;
    if (ts_tokenize_str(given, separator, escape, quote, flags, &array) != LC_OK)
        return "(failed)";
    std::string all = array.pointer ? "" : "(null)";
    for (const std::string &token : list_of(array))
        all += "[" + token + "]";
    return all;
}
std::string joined_text(const std::vector<const char *> &parts, char separator, char escape, uint32_t flags) {
    tokens_owner array;
    string_owner string;
    EXPECT_EQ(tstr_array_new(&array, nullptr), LC_OK);
    for (const char *part : parts)
        EXPECT_EQ(tstr_array_append_str(array, part), LC_OK);
    return ts_join_tokens(array, separator, escape, 0, flags, &string) == LC_OK ? text(string) : "(failed)";
}

TEST(Tokens, SplitAndJoin) {
    log_lines log;
    EXPECT_EQ(split_tokens("/a//b", '/', 0, 0, 0x8), "[a][b]");
    EXPECT_EQ(split_tokens("a\\b/c\\\\d\\/\\", '/', '\\', 0, 0), "[a\\b][c\\d/\\]");
    EXPECT_EQ(split_tokens("a 'b c' 'd e", ' ', 0, '\'', 0x1), "[a]['b c']['d e']");
    EXPECT_EQ(split_tokens("a/b/", '/', 0, 0, 0x14), "[a][b]");
    EXPECT_EQ(split_tokens("/", '/', 0, 0, 0x2c), "(null)");
    EXPECT_EQ(split_tokens("a", '/', '\\', '\\', 0), "(failed)");
    EXPECT_TRUE(log.say("called with invalid chars: 47 92 92"));
    EXPECT_EQ(joined_text({"a", "b"}, '/', 0, 0x100), "/a/b");
    EXPECT_EQ(joined_text({"a", "", "b"}, '/', 0, 0x600), "a/b/");
    EXPECT_EQ(joined_text({"a\\b", "c\\\\d"}, '/', '\\', 0), "a\\b/c\\\\\\d");
    EXPECT_EQ(joined_text({"a"}, 0, 0, 0x100), "(failed)");
    // An escape at the end of a part must not swallow the separator after it.
    for (const char *part : {"a\\", "\\\\", "\\/", "/", "x\\/\\"}) {
        const std::string name = joined_text({part, part, "end"}, '/', '\\', 0x100);
        EXPECT_EQ(split_tokens(name.c_str(), '/', '\\', 0, 0x2c),
                  std::string("[") + part + "][" + part + "][end]");
    }
}

// --- Buffers

TEST(Buffers, SizesGapsAndLimits) {
    buffer_owner buffer, constant;
    ASSERT_EQ(tb_new(&buffer), LC_OK);
    EXPECT_EQ(size_left(tb_append_buf(buffer, std::string(127, 'x').data(), 127), buffer), 128u);
    EXPECT_EQ(size_left(tb_append_uint8(buffer, 'y'), buffer), 512u);
    EXPECT_EQ(size_left(tb_ensure_size(buffer, 3000), buffer), 3072u);   // a multiple of 128
    EXPECT_EQ(size_left(tb_ensure_size(buffer, 12300), buffer), 16384u); // four times, in pages
    EXPECT_EQ(size_left(tb_ensure_size(buffer, 0x1000000), buffer), 0x1000000u);
    EXPECT_EQ(size_left(tb_ensure_size(buffer, 0x1000001), buffer), 0x1000001u + 0x800000u + 0xfffu);
    EXPECT_EQ(tb_ensure_size(buffer, 0x10000001), LC_ASSERTION);
    buffer->auto_shrink = 1;
    EXPECT_TRUE(tb_append_uint8(buffer, 'z') == LC_OK &&
                size_left(tb_set_length(buffer, 128), buffer) == 256);
    EXPECT_EQ(tb_buf(buffer)[127], 'y');

    ASSERT_TRUE(tb_new(&buffer) == LC_OK && tb_put_buf(buffer, 10, "ab", 2) == LC_OK);
    EXPECT_EQ(bytes_of(buffer), std::string(10, '\0') + "ab");
    EXPECT_EQ(tb_delete_bytes(buffer, 0, 10), LC_OK);
    EXPECT_STREQ(reinterpret_cast<char *>(tb_buf(buffer)), "ab");
    for (const uint32_t offset : {1u, 0xffffffffu})
        EXPECT_EQ(tb_delete_bytes(buffer, offset, 2), LC_NO_BUFFER_SPACE);
    EXPECT_EQ(tb_set_length(buffer, 129), LC_GENERIC);
    EXPECT_TRUE(tb_set_length(buffer, 128) == LC_OK &&
                tb_buf(buffer)[128] == 0); // full, with the NUL after it
    uint32_t number = 7;
    EXPECT_TRUE(tb_get_uint32(buffer, 124, &number) == LC_OK && number == 0);
    for (const uint32_t offset : {125u, 0xfffffffeu})
        EXPECT_EQ(tb_get_uint32(buffer, offset, &number), LC_ASSERTION) << offset;
    ASSERT_EQ(tb_new_buf_const(&constant, "fixed", 5), LC_OK);
    EXPECT_TRUE(tb_append_uint8(constant, 1) == LC_ASSERTION && tb_clear(constant) == LC_ASSERTION);
}

} // namespace
