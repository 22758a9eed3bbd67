// The failure checks and what they log, tables, strings, the owner-tracking lock.
#include "runtime/common.h"

#include <gtest/gtest.h>

#include <regex>
#include <thread>

#include "runtime/guards.h"
#include "tests/support/log_lines.h"
#include "tests/support/owners.h"

namespace {

lc_status check_inner(char check, lc_status status) {
    if (check == 'q')
        CHECK_QUIET(status);
    if (check == 'n')
        CHECK_NULL(status ? nullptr : "");
    if (check == 'c')
        CHECK_CONDITION(!status);
    if (check == 'f')
        FAIL_WITH(status);
    CHECK_STATUS(status);
    return LC_OK;
}
lc_status check_outer(lc_status status) {
    CHECK_STATUS(check_inner('s', status));
    return LC_OK;
}

struct Checks : testing::Test {
    log_lines log;
    // Function and text of each line, without its place.
    std::string logged() {
        static const std::regex form(
            ".*\\[wccpd\\.ERR\\]: wccpd: (.*)\\(\\), [a-z_]+\\.cpp:\\d+, build 1: (.*\n)\n");
        return std::regex_replace(log.take(), form, "$1: $2");
    }
};

TEST_F(Checks, EachFailureHasItsLineAtEachLevel) {
    EXPECT_EQ(check_outer(LC_NOT_FOUND), LC_NOT_FOUND);
    EXPECT_EQ(logged(), "check_inner: Error code 14004 (item not found) returned\n"
                        "check_outer: Error code 14004 (item not found) returned\n");
    const std::tuple<char, lc_status, lc_status, std::string> cases[] = {
        {'s', 14024, 14024, "check_inner: Error code 14024 returned\n"},
        {'s', LC_CANCELLED, LC_CANCELLED, ""},
        {'q', LC_NOT_FOUND, LC_NOT_FOUND, ""},
        {'n', 1, LC_NULL, "check_inner: Unexpected NULL\n"},
        {'c', 1, LC_ASSERTION, "check_inner: Required condition was not met\n"},
        {'f', LC_IO_CLOSED, LC_IO_CLOSED,
         "check_inner: Bail forced with error code 14016 (IO source/sink is closed)\n"},
        {'f', 3, 3, "check_inner: Bail forced with error code 3\n"},
        {'s', LC_OK, LC_OK, ""},
    };
    for (const auto &[check, status, result, lines] : cases) {
        EXPECT_EQ(check_inner(check, status), result);
        EXPECT_EQ(logged(), lines) << status;
    }
}

TEST_F(Checks, TablesAndWords) {
    int32_t value = 9;
    EXPECT_TRUE(lc_string_to_enum(lc_log_level_table, "Debug", &value) == LC_BAD_TYPE && value == 0);
    EXPECT_STREQ(lc_enum_to_string_quiet(nullptr, 0), "ERROR-NO-MAP");
    EXPECT_TRUE(lc_str_to_bool("ON", &value) == LC_OK && value == 1);
    EXPECT_TRUE(lc_str_to_bool("f", &value) == LC_OK && value == 0);
    for (const char *neither : {"1", "0", "True", "", "yes"})
        EXPECT_EQ(lc_str_to_bool(neither, &value), LC_BAD_TYPE) << neither;
    EXPECT_TRUE(lc_is_prefix("/QV", "/qv/wccpd", 1) && lc_is_suffix("/STATE", "a/state", 1));
    EXPECT_FALSE(lc_is_prefix("/QV", "/qv/wccpd", 0) || lc_is_prefix("longer", "long", 0) ||
                 lc_is_suffix("a long", "long", 0) || lc_is_suffix("x", nullptr, 0));
    EXPECT_EQ(logged(), "");
    EXPECT_STREQ(lc_enum_to_string(lc_log_level_table, 8), "ERROR-NO-MAP");
    EXPECT_NE(logged().find("Could not find a mapping for enum value 8"), std::string::npos);
    EXPECT_EQ(lc_string_to_enum(nullptr, "err", &value), LC_NULL);
    EXPECT_NE(logged().find("Unexpected NULL"), std::string::npos);
}

TEST(Strings, BoundedCopiesAndFormattedTexts) {
    char text[8] = "abcdefg", full[4] = {'w', 'x', 'y', 'z'};
    EXPECT_TRUE(strlcpy(text, "12345678", sizeof text) == 8 && strlcpy(text, "ab", 0) == 2);
    EXPECT_STREQ(text, "1234567");
    EXPECT_TRUE(strlcpy(text, "abc", 4) == 3 && strlcat(text, "defgh", sizeof text) == 8);
    EXPECT_STREQ(text, "abcdefg");
    EXPECT_TRUE(strlcat(full, "12", sizeof full) == 6 && memcmp(full, "wxyz", 4) == 0);
    const std::string wanted(5000, 'x');
    uint32_t length = 1;
    EXPECT_EQ(text_of([&](char **out) { return snmprintf(out, &length, "%s", wanted.c_str()); }), wanted);
    EXPECT_EQ(length, wanted.size());
}

TEST(Lock, OwnersNestingAndRefusals) {
    lc_lock *lock = nullptr, *plain = nullptr;
    ASSERT_TRUE(lc_lock_init(&lock, 1) == 0 && lc_lock_init(&plain, 0) == 0);
    EXPECT_EQ(lc_lock_unlock(lock), 1);
    EXPECT_TRUE(lc_lock_lock(lock) == 0 && lc_lock_lock(lock) == 0 && lc_lock_unlock(lock) == 0);
    std::thread([lock] { EXPECT_EQ(lc_lock_unlock(lock), 1); }).join();
    EXPECT_TRUE(lc_lock_deinit(&lock) == 1 && lc_lock_unlock(lock) == 0); // still locked
    // A thread that ends while it holds locks releases them at every level.
    std::thread([lock, plain] {
        lc_lock_lock(lock);
        lc_lock_lock(lock);
        lc_lock_lock(plain);
    }).join();
    for (lc_lock **each : {&lock, &plain}) {
        EXPECT_TRUE(lc_lock_lock(*each) == 0 && lc_lock_unlock(*each) == 0);
        EXPECT_TRUE(lc_lock_deinit(each) == 0 && *each == nullptr);
    }
    EXPECT_TRUE(lc_lock_lock(nullptr) == 1 && lc_lock_unlock(nullptr) == 1 && lc_lock_deinit(&lock) == 1);
}

} // namespace
