// The failure checks and what they log, tables, strings, the owner-tracking lock, and times.
#include "runtime/common.h"

#include <gtest/gtest.h>

#include <regex>
#include <thread>

#include "runtime/guards.h"
#include "runtime/ttime.h"
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
    const auto expect = [this](lc_status result, lc_status expected, const std::string &lines) {
        EXPECT_EQ(result, expected);
        EXPECT_EQ(logged(), lines);
    };
    expect(check_outer(LC_NOT_FOUND), LC_NOT_FOUND,
           "check_inner: Error code 14004 (item not found) returned\n"
           "check_outer: Error code 14004 (item not found) returned\n");
    expect(check_inner('s', 14024), 14024, "check_inner: Error code 14024 returned\n");
    expect(check_inner('s', LC_CANCELLED), LC_CANCELLED, "");
    expect(check_inner('q', LC_NOT_FOUND), LC_NOT_FOUND, "");
    expect(check_inner('n', 1), LC_NULL, "check_inner: Unexpected NULL\n");
    expect(check_inner('c', 1), LC_ASSERTION, "check_inner: Required condition was not met\n");
    expect(check_inner('f', LC_IO_CLOSED), LC_IO_CLOSED,
           "check_inner: Bail forced with error code 14016 (IO source/sink is closed)\n");
    expect(check_inner('f', 3), 3, "check_inner: Bail forced with error code 3\n");
    expect(check_inner('s', LC_OK), LC_OK, "");
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
    EXPECT_TRUE(strlcpy(text, "12345678", sizeof text) == 8 && strlcpy(text, "ab", 0) == 2 &&
                std::string(text) == "1234567");
    EXPECT_TRUE(strlcpy(text, "abc", 4) == 3 && strlcat(text, "defgh", sizeof text) == 8 &&
                std::string(text) == "abcdefg");
    EXPECT_TRUE(strlcat(full, "12", sizeof full) == 6 && memcmp(full, "wxyz", 4) == 0);
    const std::string wanted(5000, 'x');
    uint32_t length = 1;
    EXPECT_EQ(text_of([&](char **out) { return snmprintf(out, &length, "%s", wanted.c_str()); }), wanted);
    EXPECT_EQ(length, wanted.size());
}

TEST(Lock, OwnersNestingAndRefusals) {
    lc_lock *lock = nullptr, *plain = nullptr;
    ASSERT_TRUE(lc_lock_init(&lock, 1) == 0 && lc_lock_init(&plain, 0) == 0 && lc_lock_unlock(lock) == 1);
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

// --- Times

struct Time : testing::Test {
    static void zone(const char *name) {
        setenv("TZ", name, 1);
        tzset();
    }
    void TearDown() override {
        unsetenv("TZ");
        tzset();
    }
};
#define TEXT(call) text_of([&](char **out) { return call; })

// Most forms are tested as values of bindings (mgmt_bindings_test).
TEST_F(Time, LimitsAndZones) {
    EXPECT_EQ(TEXT(lt_daytime_ms_to_str(250, out)), "00:00:00.250");
    zone("XYZ-2");
    EXPECT_EQ(TEXT(lt_datetime_us_to_str(250125, 1, out)), "1970/01/01 02:00:00.250125 +0200");
    EXPECT_EQ(TEXT(lt_datetime_sec_to_str(-1, 0, out)), "1970/01/01 01:59:59");
    char buffer[12];
    EXPECT_EQ(lt_daytime_us_to_buf(3661500000, 8, buffer), LC_ASSERTION);
    EXPECT_EQ(lt_daytime_us_to_buf(3661500000, 12, buffer), LC_OK); // no room for the fraction
    EXPECT_STREQ(buffer, "01:01:01");
    EXPECT_EQ(lt_dur_us_to_buf(1, 12, buffer), LC_ASSERTION);

    int64_t us = 0;
    int32_t seconds = 0;
    EXPECT_TRUE(lt_str_to_daytime_us("01:01", &us) == LC_OK && us == 3660000000);
    EXPECT_TRUE(lt_str_to_dur_us("-1.5 seconds", &us) == LC_OK && us == -1500000);
    EXPECT_EQ(lt_str_to_dur_sec("2147483647", &seconds), LC_OK);
    EXPECT_EQ(lt_str_to_dur_sec("2147483648", &seconds), LC_ASSERTION);
    for (const char *bad : {"nan", "1e300"})
        EXPECT_EQ(lt_str_to_dur_us(bad, &us), LC_BAD_TYPE) << bad;
    for (const char *bad : {"25:00", "1:2:3 x", "1:2:3.x", "1:2:3.5e3", "01"})
        EXPECT_EQ(lt_str_to_daytime_us(bad, &us), LC_BAD_TYPE) << bad;
    timeval value{};
    EXPECT_EQ(lt_time_ms_to_timeval(INT64_MIN, &value), LC_OK);
    EXPECT_TRUE(value.tv_sec == INT64_MIN / 1000 - 1 && value.tv_usec == 192000);
}

// What was written reads back, to the microsecond.
TEST_F(Time, ComesBack) {
    zone("CET-1CEST,M3.5.0,M10.5.0/3");
    int64_t back = 0;
    for (int64_t us = 1; us < 2000000000000000; us = us < 600 ? us + 1 : us * 2 + 29) {
        const int64_t time = us % 86400000000;
        const std::string text = TEXT(lt_datetime_us_to_str(us, 0, out)),
                          day = TEXT(lt_daytime_us_to_str(time, out)),
                          span = TEXT(lt_dur_us_to_str(time, out));
        EXPECT_TRUE(lt_str_to_datetime_us(text.c_str(), &back) == LC_OK && back == us) << text;
        EXPECT_TRUE(lt_str_to_daytime_us(day.c_str(), &back) == LC_OK && back == time) << day;
        EXPECT_TRUE(lt_str_to_dur_us(span.c_str(), &back) == LC_OK && back == time) << span;
    }
}

} // namespace
