// The failure checks and what they log, tables, strings, the environment, the owner-tracking lock.
#include "runtime/common.h"

#include <gtest/gtest.h>
#include <malloc.h>

#include <csignal>
#include <thread>

#include "runtime/guards.h"
#include "runtime/logging.h"
#include "tests/support/log_daemon.h"

static lc_status fails_with(lc_status status) {
    CHECK_STATUS(status);
    return LC_OK;
}
static lc_status quietly(lc_status status) {
    CHECK_QUIET(status);
    return LC_OK;
}
static lc_status outer(lc_status status) {
    CHECK_STATUS(fails_with(status));
    return LC_OK;
}
static lc_status needs(const void *pointer) {
    CHECK_NULL(pointer);
    return LC_OK;
}
static lc_status requires_that(bool condition) {
    CHECK_CONDITION(condition);
    return LC_OK;
}
static lc_status forced(lc_status status) {
    FAIL_WITH(status);
}

struct Checks : testing::Test {
    log_daemon daemon;
    void SetUp() override { ASSERT_EQ(lc_log_init("check", nullptr, 0, 0x1060000, 7, 136, 1), LC_OK); }
    void TearDown() override { (void)lc_log_close(); }
    // Lines from their "[wccpd." on, with line numbers off.
    std::vector<std::string> told() {
        std::vector<std::string> lines = daemon.take();
        for (std::string &line : lines) {
            line = line.substr(line.find("[wccpd."));
            const size_t number = line.find(".cpp:");
            if (number != std::string::npos)
                line.erase(number + 5, line.find(',', number) - number - 5);
        }
        return lines;
    }
};

TEST_F(Checks, EachLevelOfAFailureHasItsLine) {
    EXPECT_EQ(outer(LC_NOT_FOUND), LC_NOT_FOUND);
    EXPECT_EQ(outer(14024), 14024);
    EXPECT_EQ(told(), (std::vector<std::string>{
                          "[wccpd.ERR]: fails_with(), runtime_common_test.cpp:, build 1: Error code 14004 "
                          "(item not found) returned\n",
                          "[wccpd.ERR]: outer(), runtime_common_test.cpp:, build 1: Error code 14004 "
                          "(item not found) returned\n",
                          "[wccpd.ERR]: fails_with(), runtime_common_test.cpp:, build 1: Error code 14024 "
                          "returned\n",
                          "[wccpd.ERR]: outer(), runtime_common_test.cpp:, build 1: Error code 14024 "
                          "returned\n"}));
}

TEST_F(Checks, WhatWasCancelledOrExpectedHasNone) {
    EXPECT_EQ(outer(LC_CANCELLED), LC_CANCELLED);
    EXPECT_EQ(quietly(LC_NOT_FOUND), LC_NOT_FOUND);
    EXPECT_EQ(outer(LC_OK), LC_OK);
    EXPECT_EQ(daemon.take().size(), 0u);
}

TEST_F(Checks, TheOtherChecks) {
    EXPECT_EQ(needs(nullptr), LC_NULL);
    EXPECT_EQ(requires_that(false), LC_ASSERTION);
    EXPECT_EQ(forced(LC_IO_CLOSED), LC_IO_CLOSED);
    EXPECT_EQ(forced(3), 3);
    const std::string at = "(), runtime_common_test.cpp:, build 1: ";
    EXPECT_EQ(told(), (std::vector<std::string>{
                          "[wccpd.ERR]: needs" + at + "Unexpected NULL\n",
                          "[wccpd.ERR]: requires_that" + at + "Required condition was not met\n",
                          "[wccpd.ERR]: forced" + at +
                              "Bail forced with error code 14016 (IO source/sink is closed)\n",
                          "[wccpd.ERR]: forced" + at + "Bail forced with error code 3\n"}));
}

TEST_F(Checks, TablesGiveNamesAndValues) {
    EXPECT_STREQ(lc_enum_to_string(lc_log_level_table, 7), "debug");
    EXPECT_STREQ(lc_enum_to_string_quiet(lc_log_level_table, 8), "ERROR-NO-MAP");
    EXPECT_STREQ(lc_enum_to_string_quiet(nullptr, 0), "ERROR-NO-MAP");
    EXPECT_EQ(lc_enum_to_string_quiet_null(lc_status_table, 14024), nullptr);
    int32_t value = 9;
    EXPECT_EQ(lc_string_to_enum(lc_log_level_table, "Debug", &value), LC_BAD_TYPE);
    EXPECT_EQ(value, 0);
    EXPECT_EQ(lc_string_to_enum(lc_log_level_table, "err", &value), LC_OK);
    EXPECT_EQ(value, 3);
    EXPECT_EQ(daemon.take().size(), 0u);

    EXPECT_STREQ(lc_enum_to_string(lc_log_level_table, 8), "ERROR-NO-MAP");
    EXPECT_NE(daemon.one().find("Could not find a mapping for enum value 8"), std::string::npos);
    EXPECT_EQ(lc_enum_to_string_quiet_null(nullptr, 1), nullptr);
    EXPECT_NE(daemon.one().find("Unexpected NULL"), std::string::npos);
    EXPECT_EQ(lc_string_to_enum(nullptr, "err", &value), LC_NULL);
    EXPECT_NE(daemon.one().find("Unexpected NULL"), std::string::npos);
}

TEST(Words, BooleansPrefixesSignals) {
    int32_t value = 7;
    for (const char *yes : {"true", "TRUE", "t", "T", "on", "ON"}) {
        EXPECT_EQ(lc_str_to_bool(yes, &value), LC_OK);
        EXPECT_EQ(value, 1) << yes;
    }
    for (const char *no : {"false", "FALSE", "f", "F", "off", "OFF"}) {
        EXPECT_EQ(lc_str_to_bool(no, &value), LC_OK);
        EXPECT_EQ(value, 0) << no;
    }
    for (const char *neither : {"1", "0", "True", "", "yes"})
        EXPECT_EQ(lc_str_to_bool(neither, &value), LC_BAD_TYPE) << neither;

    EXPECT_TRUE(lc_is_prefix("/qv", "/qv/wccpd", 0) && lc_is_prefix("", "x", 0));
    EXPECT_FALSE(lc_is_prefix("/QV", "/qv/wccpd", 0));
    EXPECT_TRUE(lc_is_prefix("/QV", "/qv/wccpd", 1));
    EXPECT_FALSE(lc_is_prefix("longer", "long", 0) || lc_is_suffix("a long", "long", 0));
    EXPECT_TRUE(lc_is_suffix("/state", "a/state", 0) && lc_is_suffix("/STATE", "a/state", 1));
    EXPECT_FALSE(lc_is_prefix(nullptr, "x", 0) || lc_is_suffix("x", nullptr, 0));
    EXPECT_STREQ(lc_signal_num_to_name(SIGTERM), "SIGTERM");
    EXPECT_STREQ(lc_signal_num_to_name(SIGHUP), "SIGHUP");
}

TEST(Strings, BoundedCopiesTellTheLengthWithoutTheBound) {
    char text[8] = "abcdefg";
    EXPECT_EQ(strlcpy(text, "12345678", sizeof text), 8u);
    EXPECT_STREQ(text, "1234567");
    EXPECT_EQ(strlcpy(text, "ab", 0), 2u);
    EXPECT_STREQ(text, "1234567");
    EXPECT_EQ(strlcpy(text, "abc", 4), 3u);
    EXPECT_EQ(strlcat(text, "defgh", sizeof text), 8u);
    EXPECT_STREQ(text, "abcdefg");
    char full[4] = {'w', 'x', 'y', 'z'};
    EXPECT_EQ(strlcat(full, "12", sizeof full), 6u);
    EXPECT_EQ(memcmp(full, "wxyz", 4), 0);
}

TEST(Strings, FormattedTextsOfAnyLength) {
    for (const uint32_t length : {0u, 1u, 99u, 100u, 101u, 5000u}) {
        const std::string wanted(length, 'x');
        char *text = nullptr;
        uint32_t told = 1;
        ASSERT_EQ(snmprintf(&text, &told, "%s", wanted.c_str()), LC_OK);
        const owned_text owner(text);
        EXPECT_EQ(text, wanted);
        EXPECT_EQ(told, length);
    }
    char *text = const_cast<char *>("old");
    const char *volatile none = nullptr;
    EXPECT_EQ(snmprintf(&text, nullptr, none, 1), LC_NULL);
    EXPECT_EQ(text, nullptr);
    EXPECT_EQ(safe_strdup(nullptr), nullptr);
}

TEST(Environment, CopiesAndRefusals) {
    ASSERT_EQ(lc_init(), LC_OK);
    char *text = nullptr;
    EXPECT_EQ(lc_setenv("WCCP_TEST", "one", 1), LC_OK);
    EXPECT_EQ(lc_setenv("WCCP_TEST", "two", 0), LC_OK);
    EXPECT_EQ(lc_getenv_ts("WCCP_TEST", &text), LC_OK);
    EXPECT_STREQ(text, "one");
    free(text);
    EXPECT_EQ(lc_getenv_ts("WCCP_TEST_NONE", &text), LC_OK);
    EXPECT_EQ(text, nullptr);
    EXPECT_EQ(lc_setenv("A=B", "x", 1), LC_GENERIC);
    EXPECT_EQ(lc_devel_is_production(), 1);
    EXPECT_EQ(lc_setenv("PROD_DEV", "1", 1), LC_OK);
    EXPECT_EQ(lc_devel_is_production(), 0);
}

TEST(Lock, OwnersNestingAndRefusals) {
    lc_lock *lock = nullptr, *plain = nullptr;
    ASSERT_EQ(lc_lock_init(&lock, 1), 0);
    ASSERT_EQ(lc_lock_init(&plain, 0), 0);
    EXPECT_EQ(lc_lock_unlock(lock), 1);
    EXPECT_EQ(lc_lock_lock(lock), 0);
    EXPECT_EQ(lc_lock_lock(lock), 0);
    EXPECT_EQ(lc_lock_unlock(lock), 0);
    std::thread([lock] { EXPECT_EQ(lc_lock_unlock(lock), 1); }).join();
    EXPECT_EQ(lc_lock_deinit(&lock), 1); // still locked
    EXPECT_EQ(lc_lock_unlock(lock), 0);
    // A thread that ends while it holds locks leaves them free, however deep.
    std::thread([lock, plain] {
        lc_lock_lock(lock);
        lc_lock_lock(lock);
        lc_lock_lock(plain);
    }).join();
    for (lc_lock **each : {&lock, &plain}) {
        EXPECT_EQ(lc_lock_lock(*each), 0);
        EXPECT_EQ(lc_lock_unlock(*each), 0);
        EXPECT_EQ(lc_lock_deinit(each), 0);
        EXPECT_EQ(*each, nullptr);
    }
    EXPECT_TRUE(lc_lock_lock(nullptr) == 1 && lc_lock_unlock(nullptr) == 1 && lc_lock_deinit(&lock) == 1);
}
