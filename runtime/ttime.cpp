// Times and their conversion from and to text. The conversions are written for microseconds. To text, seconds
// and milliseconds are converted to microseconds first; from text, the result in microseconds is divided,
// after a check that it is not negative and in range.
#include "runtime/ttime.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

constexpr int64_t US_PER_SEC = 1000000;
constexpr int64_t US_PER_MS = 1000;
constexpr int64_t NS_PER_SEC = 1000000000;
constexpr int64_t NS_PER_MS = 1000000;
constexpr int64_t SEC_LIMIT_US = 0x7a12000000000; // 2^31 seconds
constexpr uint32_t TEXT_SIZE = 36;                // of the texts that the _to_str forms allocate

// --- Clocks and records

lt_time_us lt_curr_time_us() {
    timeval now{};
    gettimeofday(&now, nullptr);
    return int64_t{now.tv_sec} * US_PER_SEC + now.tv_usec;
}
lt_time_ms lt_curr_time_ms() {
    return lt_curr_time_us() / US_PER_MS;
}
lt_time_sec lt_curr_time() {
    return static_cast<lt_time_sec>(lt_curr_time_us() / US_PER_SEC);
}

int64_t lt_monotonic_ns() {
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    return int64_t{now.tv_sec} * NS_PER_SEC + now.tv_nsec;
}
int64_t lt_monotonic_ms() {
    return lt_monotonic_ns() / NS_PER_MS;
}

lc_status lt_time_sec_to_tm(lt_time_sec seconds, tm *out) {
    CHECK_NULL(out);
    const time_t value = seconds;
    CHECK_NULL(localtime_r(&value, out));
    return LC_OK;
}
lc_status lt_time_sec_to_tm_utc(lt_time_sec seconds, tm *out) {
    CHECK_NULL(out);
    const time_t value = seconds;
    CHECK_NULL(gmtime_r(&value, out));
    return LC_OK;
}
lt_time_us lt_tm_to_time_us(const tm *local) {
    if (!local) {
        (void)lc_check_null(__func__, LC_FILE_NAME, __LINE__);
        return 0;
    }
    // mktime normalises the record that it is given.
    tm copy = *local;
    return int64_t{mktime(&copy)} * US_PER_SEC;
}
lt_time_sec lt_tm_utc_to_time_sec(const tm *utc) {
    if (!utc) {
        (void)lc_check_null(__func__, LC_FILE_NAME, __LINE__);
        return 0;
    }
    tm copy = *utc;
    return static_cast<lt_time_sec>(timegm(&copy));
}
lc_status lt_time_sec_to_timeval(lt_time_sec seconds, timeval *out) {
    CHECK_NULL(out);
    *out = {seconds, 0};
    return LC_OK;
}
lc_status lt_time_ms_to_timeval(lt_time_ms ms, timeval *out) {
    CHECK_NULL(out);
    const int64_t rest = ms % 1000; // the microseconds of a timeval are never negative
    *out = {ms / 1000 - (rest < 0), (rest < 0 ? rest + 1000 : rest) * US_PER_MS};
    return LC_OK;
}
lt_time_sec lt_timeval_to_time_sec(const timeval *value) {
    if (!value) {
        (void)lc_check_null(__func__, LC_FILE_NAME, __LINE__);
        return 0;
    }
    return static_cast<lt_time_sec>(value->tv_sec);
}
lt_time_ms lt_timeval_to_time_ms(const timeval *value) {
    if (!value) {
        (void)lc_check_null(__func__, LC_FILE_NAME, __LINE__);
        return 0;
    }
    return int64_t{value->tv_sec} * 1000 + value->tv_usec / US_PER_MS;
}

// --- To text

namespace {

lc_status format_time(char *buffer, uint32_t size, size_t at, const char *format, const tm *parts,
                      size_t *out_end) {
    CHECK_CONDITION(at < size);
    const size_t written = strftime(buffer + at, size - at, format, parts);
    CHECK_CONDITION(written > 0);
    *out_end = at + written;
    return LC_OK;
}

// Appends the fraction of a second as ".250" or ".250125", if there is one and the buffer has room for it.
void append_fraction(char *buffer, uint32_t size, size_t *at, int64_t value) {
    // Also of a negative value the fraction counts forward from the whole second before it.
    const int64_t fraction = ((value % US_PER_SEC) + US_PER_SEC) % US_PER_SEC;
    // The longest fraction takes seven characters; a buffer that is nearly full does without.
    if (fraction == 0 || *at + 9 > size)
        return;
    char text[16];
    const double seconds = static_cast<double>(fraction) / static_cast<double>(US_PER_SEC);
    const int length = snprintf(text, sizeof text, fraction % US_PER_MS ? "%.6lf" : "%.3lf", seconds);
    // Without the "0" before the point; the NUL is copied as well.
    memcpy(buffer + *at, text + 1, static_cast<size_t>(length));
    *at += static_cast<size_t>(length) - 1;
}

// Rounds down, also for negative values.
int64_t whole_seconds(int64_t us) {
    return us / US_PER_SEC - (us % US_PER_SEC < 0);
}

lc_status time_to_text(int64_t us, bool local, const char *format, bool with_zone, uint32_t size,
                       char *buffer) {
    CHECK_NULL(buffer);
    const time_t seconds = whole_seconds(us);
    tm parts{};
    CHECK_NULL(local ? localtime_r(&seconds, &parts) : gmtime_r(&seconds, &parts));
    size_t at = 0;
    CHECK_STATUS(format_time(buffer, size, at, format, &parts, &at));
    append_fraction(buffer, size, &at, us);
    if (with_zone)
        CHECK_STATUS(format_time(buffer, size, at, " %z", &parts, &at));
    return LC_OK;
}

} // namespace

lc_status lt_date_to_buf(lt_date value, uint32_t size, char *buffer, uint32_t *out_length) {
    CHECK_NULL(buffer);
    const time_t seconds = value;
    tm parts{};
    CHECK_NULL(gmtime_r(&seconds, &parts));
    size_t end = 0;
    CHECK_STATUS(format_time(buffer, size, 0, "%Y/%m/%d", &parts, &end));
    if (out_length)
        *out_length = static_cast<uint32_t>(end);
    return LC_OK;
}
lc_status lt_daytime_us_to_buf(lt_time_us value, uint32_t size, char *buffer) {
    return time_to_text(value, false, "%H:%M:%S", false, size, buffer);
}
lc_status lt_datetime_us_to_buf(lt_time_us value, int with_zone, uint32_t size, char *buffer) {
    return time_to_text(value, true, "%Y/%m/%d %H:%M:%S", with_zone != 0, size, buffer);
}
lc_status lt_dur_us_to_buf(lt_dur_us value, uint32_t size, char *buffer) {
    CHECK_NULL(buffer);
    const double seconds = static_cast<double>(value) / static_cast<double>(US_PER_SEC);
    const int length = snprintf(buffer, size, "%lf seconds", seconds);
    CHECK_CONDITION(length >= 0 && static_cast<uint32_t>(length) < size);
    return LC_OK;
}

namespace {

// To microseconds. LC_ASSERTION on overflow.
lc_status scale_to_us(int64_t value, int64_t factor, int64_t *out) {
    CHECK_CONDITION(!__builtin_mul_overflow(value, factor, out));
    return LC_OK;
}

} // namespace

// Defines lt_daytime_sec_to_buf for example, by way of lt_daytime_us_to_buf. `parameters` and `arguments` are
// the further parameters of the functions of a kind, in parentheses.
#define LT_COARSER(kind, unit, type, factor, parameters, arguments)                                          \
    lc_status lt_##kind##_##unit##_to_buf(type value, LT_UNPAREN parameters uint32_t size, char *buffer) {   \
        int64_t us = 0;                                                                                      \
        CHECK_STATUS(scale_to_us(value, factor, &us));                                                       \
        return lt_##kind##_us_to_buf(us, LT_UNPAREN arguments size, buffer);                                 \
    }
#define LT_UNPAREN(...) __VA_ARGS__ __VA_OPT__(, )
LT_COARSER(daytime, sec, lt_time_sec, US_PER_SEC, (), ())
LT_COARSER(daytime, ms, lt_time_ms, US_PER_MS, (), ())
LT_COARSER(datetime, sec, lt_time_sec, US_PER_SEC, (int with_zone), (with_zone))
LT_COARSER(datetime, ms, lt_time_ms, US_PER_MS, (int with_zone), (with_zone))
LT_COARSER(dur, sec, lt_dur_sec, US_PER_SEC, (), ())
LT_COARSER(dur, ms, lt_dur_ms, US_PER_MS, (), ())

namespace {

template <typename Write>
lc_status new_time_text(char **out, Write write) {
    CHECK_NULL(out);
    *out = nullptr;
    auto *text = static_cast<char *>(malloc(TEXT_SIZE));
    CHECK_NULL(text);
    const lc_status status = write(text);
    if (status != LC_OK)
        free(text);
    CHECK_STATUS(status);
    *out = text;
    return LC_OK;
}

} // namespace

lc_status lt_date_to_str(lt_date value, char **out) {
    return new_time_text(out, [&](char *text) { return lt_date_to_buf(value, TEXT_SIZE, text, nullptr); });
}
// Defines lt_daytime_sec_to_str for example, by way of lt_daytime_sec_to_buf.
#define LT_TO_STR(name, type, parameters, arguments)                                                         \
    lc_status lt_##name##_to_str(type value, LT_UNPAREN parameters char **out) {                             \
        return new_time_text(out, [&](char *text) {                                                          \
            return lt_##name##_to_buf(value, LT_UNPAREN arguments TEXT_SIZE, text);                          \
        });                                                                                                  \
    }
LT_TO_STR(daytime_sec, lt_time_sec, (), ())
LT_TO_STR(daytime_ms, lt_time_ms, (), ())
LT_TO_STR(daytime_us, lt_time_us, (), ())
LT_TO_STR(datetime_sec, lt_time_sec, (int with_zone), (with_zone))
LT_TO_STR(datetime_ms, lt_time_ms, (int with_zone), (with_zone))
LT_TO_STR(datetime_us, lt_time_us, (int with_zone), (with_zone))
LT_TO_STR(dur_sec, lt_dur_sec, (), ())
LT_TO_STR(dur_ms, lt_dur_ms, (), ())
LT_TO_STR(dur_us, lt_dur_us, (), ())

// --- From text

namespace {

// Truncates to microseconds. Most decimal fractions have no exact representation as a double: 0.000249 would
// become 248 microseconds; the correction is far below a microsecond, and makes every text that lt_..._to_str
// writes read back as the same value.
int64_t truncate_to_us(double seconds) {
    const double us = seconds * static_cast<double>(US_PER_SEC);
    return static_cast<int64_t>(us + us * 1e-15);
}

lc_status fraction_from_text(const char *text, int64_t *out_us) {
    double fraction = 0;
    if (*text == 0)
        return LC_OK;
    if (*text != '.' || sscanf(text, "%lf", &fraction) != 1 || !(fraction >= 0 && fraction < 1))
        return LC_BAD_TYPE;
    *out_us = truncate_to_us(fraction);
    return LC_OK;
}

lc_status time_from_text(const char *text, bool local, lt_time_us *out) {
    CHECK_NULL(out);
    *out = 0;
    CHECK_NULL(text);
    tm parts{};
    const char *rest = strptime(text, "%Y/%m/%d %H:%M:%S", &parts);
    if (!rest) {
        parts = tm{};
        rest = strptime(text, "%Y/%m/%d %H:%M", &parts);
    }
    int64_t fraction = 0;
    if (!rest || fraction_from_text(rest, &fraction) != LC_OK)
        return LC_BAD_TYPE;
    // strptime leaves the flag at 0, which would mean "no daylight saving time" to mktime.
    parts.tm_isdst = -1;
    const time_t seconds = local ? mktime(&parts) : timegm(&parts);
    *out = int64_t{seconds} * US_PER_SEC + fraction;
    return LC_OK;
}

} // namespace

lc_status lt_str_to_date(const char *text, lt_date *out) {
    CHECK_NULL(out);
    *out = 0;
    CHECK_NULL(text);
    tm parts{};
    const char *rest = strptime(text, "%Y/%m/%d", &parts);
    if (!rest || *rest)
        return LC_BAD_TYPE;
    const time_t seconds = timegm(&parts);
    if (seconds < 0 || seconds > UINT32_MAX)
        return LC_BAD_TYPE;
    *out = static_cast<lt_date>(seconds);
    return LC_OK;
}
lc_status lt_str_to_datetime_us(const char *text, lt_time_us *out) {
    return time_from_text(text, true, out);
}
lc_status lt_str_to_daytime_us(const char *text, lt_time_us *out) {
    CHECK_NULL(out);
    *out = 0;
    CHECK_NULL(text);
    char whole[64];
    // The first day of the epoch, read as UTC: the result is the offset from midnight.
    const int length = snprintf(whole, sizeof whole, "1970/1/1 %s", text);
    if (length < 0 || static_cast<size_t>(length) >= sizeof whole)
        return LC_BAD_TYPE;
    return time_from_text(whole, false, out);
}
lc_status lt_str_to_dur_us(const char *text, lt_dur_us *out) {
    CHECK_NULL(out);
    *out = 0;
    CHECK_NULL(text);
    double seconds = 0;
    if (sscanf(text, "%lf", &seconds) != 1)
        return LC_BAD_TYPE;
    // Would overflow as microseconds; the form of the test also refuses infinities and NaN.
    if (!(seconds > -9.2e12 && seconds < 9.2e12))
        return LC_BAD_TYPE;
    *out = truncate_to_us(seconds);
    return LC_OK;
}

namespace {

lc_status us_to_ms(lt_time_us us, int64_t *out) {
    CHECK_CONDITION(us >= 0);
    *out = us / US_PER_MS;
    return LC_OK;
}
lc_status us_to_sec(lt_time_us us, int32_t *out) {
    CHECK_CONDITION(us >= 0 && us < SEC_LIMIT_US);
    *out = static_cast<int32_t>(us / US_PER_SEC);
    return LC_OK;
}

} // namespace

// Defines lt_str_to_daytime_ms for example, by way of lt_str_to_daytime_us.
#define LT_FROM_STR(kind, unit, type)                                                                        \
    lc_status lt_str_to_##kind##_##unit(const char *text, type *out) {                                       \
        CHECK_NULL(out);                                                                                     \
        *out = 0;                                                                                            \
        lt_time_us us = 0;                                                                                   \
        CHECK_QUIET(lt_str_to_##kind##_us(text, &us));                                                       \
        return us_to_##unit(us, out);                                                                        \
    }
LT_FROM_STR(daytime, ms, lt_time_ms)
LT_FROM_STR(daytime, sec, lt_time_sec)
LT_FROM_STR(datetime, ms, lt_time_ms)
LT_FROM_STR(datetime, sec, lt_time_sec)
LT_FROM_STR(dur, ms, lt_dur_ms)
LT_FROM_STR(dur, sec, lt_dur_sec)

// The C library reads the zone file again only when TZ differs from the value that it used last. A file that
// has changed under the same name is therefore noticed only if TZ has had another value in between.
lc_status lt_timezone_handle_changed() {
    const lc_status status = lc_setenv("TZ", "error", 1);
    tzset();
    {
        lc_lock_guard guard(lc_env_lock);
        unsetenv("TZ");
    }
    const time_t now = time(nullptr);
    // Not localtime_r(), which need not look at TZ again.
    (void)localtime(&now);
    CHECK_STATUS(status);
    return LC_OK;
}
