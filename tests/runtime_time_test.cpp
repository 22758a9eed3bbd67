#include <gtest/gtest.h>

#include "runtime/ttime.h"
#include "tests/support/owners.h"

namespace {

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
