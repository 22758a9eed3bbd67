// Microseconds are the base: the second and millisecond forms multiply to them on the way to text and divide
// on the way back.
#include "runtime/ttime.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "runtime/guards.h"
#include "runtime/logging.h"

constexpr uint32_t TEXT_BYTES = 36;
constexpr uint32_t FRACTION_ROOM = 9; // a fraction is left out when the text ends closer to the buffer's end
constexpr int64_t US = 1000000;
constexpr int64_t MS_TO_US = 1000;
constexpr int64_t SECONDS_LIMIT_US = 0x7a12000000000;

lt_time_us lt_curr_time_us() {
    timeval now;
    gettimeofday(&now, nullptr);
    return static_cast<int64_t>(now.tv_sec) * US + now.tv_usec;
}
lt_time_ms lt_curr_time_ms() {
    return lt_curr_time_us() / MS_TO_US;
}
lt_time_sec lt_curr_time() {
    return static_cast<lt_time_sec>(lt_curr_time_us() / US);
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
lt_time_us lt_tm_to_time_us(const tm *value) {
    if (!value) {
        (void)lc_check_null(__func__, LC_FILE_NAME, __LINE__);
        return 0;
    }
    tm copy = *value;
    return static_cast<int64_t>(mktime(&copy)) * US;
}
lt_time_sec lt_tm_utc_to_time_sec(const tm *value) {
    if (!value) {
        (void)lc_check_null(__func__, LC_FILE_NAME, __LINE__);
        return 0;
    }
    tm copy = *value;
    return static_cast<lt_time_sec>(timegm(&copy));
}
lc_status lt_time_sec_to_timeval(lt_time_sec seconds, timeval *out) {
    CHECK_NULL(out);
    *out = {seconds, 0};
    return LC_OK;
}
lc_status lt_time_ms_to_timeval(lt_time_ms milliseconds, timeval *out) {
    CHECK_NULL(out);
    *out = {milliseconds / 1000, milliseconds % 1000 * MS_TO_US};
    return LC_OK;
}
lt_time_sec lt_timeval_to_time_sec(const timeval *value) {
    return value ? static_cast<lt_time_sec>(value->tv_sec) : 0;
}
lt_time_ms lt_timeval_to_time_ms(const timeval *value) {
    return value ? static_cast<int64_t>(value->tv_sec) * 1000 + value->tv_usec / MS_TO_US : 0;
}

// --- To text
// --------------------------------------------------------------------------------------------------------

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
static lc_status put_time(const tm *value, const char *form, uint32_t size, char *buffer,
                          uint32_t *out_length) {
    CHECK_NULL(buffer);
    const size_t length = size > 0 ? strftime(buffer, size, form, value) : 0;
    CHECK_CONDITION(length > 0);
    *out_length = static_cast<uint32_t>(length);
    return LC_OK;
}
#pragma GCC diagnostic pop

// Whole seconds, parts of a second from 0 up, also for times before 1970.
struct split_time {
    time_t seconds;
    int64_t us;
};
static split_time split(int64_t us) {
    int64_t rest = us % US;
    if (rest < 0)
        rest += US;
    return {static_cast<time_t>((us - rest) / US), rest};
}

static lc_status add_fraction(int64_t us, uint32_t size, char *buffer, uint32_t *length) {
    if (us == 0 || *length + FRACTION_ROOM > size)
        return LC_OK;
    char fraction[16];
    const double part = static_cast<double>(us) / static_cast<double>(US);
    snprintf(fraction, sizeof fraction, us % MS_TO_US == 0 ? "%.3lf" : "%.6lf", part);
    CHECK_CONDITION(strlcpy(buffer + *length, fraction + 1, size - *length) < size - *length);
    *length += static_cast<uint32_t>(strlen(fraction + 1));
    return LC_OK;
}

lc_status lt_date_to_buf(lt_date value, uint32_t size, char *buffer, uint32_t *out_length) {
    uint32_t length = 0;
    const time_t seconds = value;
    tm parts = {};
    CHECK_NULL(gmtime_r(&seconds, &parts));
    CHECK_STATUS(put_time(&parts, "%Y/%m/%d", size, buffer, &length));
    if (out_length)
        *out_length = length;
    return LC_OK;
}

lc_status lt_daytime_us_to_buf(lt_time_us value, uint32_t size, char *buffer) {
    const split_time time = split(value);
    uint32_t length = 0;
    tm parts = {};
    CHECK_NULL(gmtime_r(&time.seconds, &parts));
    CHECK_STATUS(put_time(&parts, "%H:%M:%S", size, buffer, &length));
    CHECK_STATUS(add_fraction(time.us, size, buffer, &length));
    return LC_OK;
}

lc_status lt_datetime_us_to_buf(lt_time_us value, int with_zone, uint32_t size, char *buffer) {
    const split_time time = split(value);
    uint32_t length = 0, zone = 0;
    tm parts = {};
    CHECK_NULL(localtime_r(&time.seconds, &parts));
    CHECK_STATUS(put_time(&parts, "%Y/%m/%d %H:%M:%S", size, buffer, &length));
    CHECK_STATUS(add_fraction(time.us, size, buffer, &length));
    if (with_zone)
        CHECK_STATUS(put_time(&parts, " %z", size - length, buffer + length, &zone));
    return LC_OK;
}

lc_status lt_dur_us_to_buf(lt_dur_us value, uint32_t size, char *buffer) {
    CHECK_NULL(buffer);
    const int length =
        snprintf(buffer, size, "%lf seconds", static_cast<double>(value) / static_cast<double>(US));
    CHECK_CONDITION(length >= 0 && static_cast<uint32_t>(length) < size);
    return LC_OK;
}

static lc_status lt_datetime_us_no_zone(lt_time_us value, uint32_t size, char *buffer) {
    return lt_datetime_us_to_buf(value, 0, size, buffer);
}
static lc_status lt_date_us(int64_t value, uint32_t size, char *buffer) {
    return lt_date_to_buf(static_cast<lt_date>(value), size, buffer, nullptr);
}

static lc_status new_text(lc_status (*to_buf)(int64_t, uint32_t, char *), int64_t value, char **out) {
    CHECK_NULL(out);
    *out = nullptr;
    owned_text text(static_cast<char *>(malloc(TEXT_BYTES)));
    CHECK_NULL(text.pointer);
    CHECK_STATUS(to_buf(value, TEXT_BYTES, text.pointer));
    *out = text.take();
    return LC_OK;
}

lc_status lt_date_to_str(lt_date value, char **out) {
    return new_text(lt_date_us, value, out);
}

// The three widths of a family, each by way of microseconds.
#define WIDTHS_TO_TEXT(family, type_sec, type_ms, to_buf)                                                    \
    lc_status lt_##family##_sec_to_str(type_sec value, char **out) {                                         \
        return new_text(to_buf, value * US, out);                                                            \
    }                                                                                                        \
    lc_status lt_##family##_ms_to_str(type_ms value, char **out) {                                           \
        return new_text(to_buf, value * MS_TO_US, out);                                                      \
    }                                                                                                        \
    lc_status lt_##family##_us_to_str(type_ms value, char **out) {                                           \
        return new_text(to_buf, value, out);                                                                 \
    }
#define WIDTHS_TO_BUF(family, type_sec, type_ms)                                                             \
    lc_status lt_##family##_sec_to_buf(type_sec value, uint32_t size, char *buffer) {                        \
        return lt_##family##_us_to_buf(value * US, size, buffer);                                            \
    }                                                                                                        \
    lc_status lt_##family##_ms_to_buf(type_ms value, uint32_t size, char *buffer) {                          \
        return lt_##family##_us_to_buf(value * MS_TO_US, size, buffer);                                      \
    }
WIDTHS_TO_TEXT(daytime, lt_time_sec, lt_time_ms, lt_daytime_us_to_buf)
WIDTHS_TO_TEXT(datetime, lt_time_sec, lt_time_ms, lt_datetime_us_no_zone)
WIDTHS_TO_TEXT(dur, lt_dur_sec, lt_dur_ms, lt_dur_us_to_buf)
WIDTHS_TO_BUF(daytime, lt_time_sec, lt_time_ms)
WIDTHS_TO_BUF(dur, lt_dur_sec, lt_dur_ms)

lc_status lt_datetime_sec_to_buf(lt_time_sec value, int with_zone, uint32_t size, char *buffer) {
    return lt_datetime_us_to_buf(value * US, with_zone, size, buffer);
}
lc_status lt_datetime_ms_to_buf(lt_time_ms value, int with_zone, uint32_t size, char *buffer) {
    return lt_datetime_us_to_buf(value * MS_TO_US, with_zone, size, buffer);
}

// --- From text
// ------------------------------------------------------------------------------------------------------

lc_status lt_str_to_date(const char *text, lt_date *out) {
    CHECK_NULL(out);
    *out = 0;
    CHECK_NULL(text);
    tm parts = {};
    const char *rest = strptime(text, "%Y/%m/%d", &parts);
    if (!rest || *rest)
        return LC_BAD_TYPE;
    *out = static_cast<lt_date>(timegm(&parts));
    return LC_OK;
}

static lc_status parse_datetime(const char *text, bool utc, int64_t *out) {
    tm parts = {};
    const char *rest = strptime(text, "%Y/%m/%d %H:%M:%S", &parts);
    if (!rest) {
        parts = {};
        rest = strptime(text, "%Y/%m/%d %H:%M", &parts);
    }
    if (!rest)
        return LC_BAD_TYPE;
    double fraction = 0;
    if (*rest && (*rest != '.' || sscanf(rest, "%lf", &fraction) != 1))
        return LC_BAD_TYPE;
    parts.tm_isdst = -1;
    const int64_t seconds = utc ? timegm(&parts) : mktime(&parts);
    *out = seconds * US + static_cast<int64_t>(fraction * static_cast<double>(US));
    return LC_OK;
}

lc_status lt_str_to_datetime_us(const char *text, lt_time_us *out) {
    CHECK_NULL(out);
    *out = 0;
    CHECK_NULL(text);
    return parse_datetime(text, false, out);
}

lc_status lt_str_to_daytime_us(const char *text, lt_time_us *out) {
    CHECK_NULL(out);
    *out = 0;
    CHECK_NULL(text);
    char full[64];
    if (static_cast<size_t>(snprintf(full, sizeof full, "1970/1/1 %s", text)) >= sizeof full)
        return LC_BAD_TYPE;
    return parse_datetime(full, true, out);
}

lc_status lt_str_to_dur_us(const char *text, lt_dur_us *out) {
    CHECK_NULL(out);
    *out = 0;
    CHECK_NULL(text);
    double seconds = 0;
    if (sscanf(text, "%lf", &seconds) != 1 || !(seconds > -9e12 && seconds < 9e12))
        return LC_BAD_TYPE;
    *out = static_cast<int64_t>(seconds * static_cast<double>(US));
    return LC_OK;
}

static lc_status from_us(lc_status (*parse)(const char *, int64_t *), const char *text, int64_t divisor,
                         int64_t *out) {
    int64_t us = 0;
    CHECK_QUIET(parse(text, &us));
    CHECK_CONDITION(us >= 0 && (divisor != US || us < SECONDS_LIMIT_US));
    *out = us / divisor;
    return LC_OK;
}
static lc_status seconds_from_us(lc_status (*parse)(const char *, int64_t *), const char *text,
                                 int32_t *out) {
    CHECK_NULL(out);
    *out = 0;
    int64_t seconds = 0;
    CHECK_QUIET(from_us(parse, text, US, &seconds));
    *out = static_cast<int32_t>(seconds);
    return LC_OK;
}
static lc_status ms_from_us(lc_status (*parse)(const char *, int64_t *), const char *text, int64_t *out) {
    CHECK_NULL(out);
    *out = 0;
    CHECK_QUIET(from_us(parse, text, MS_TO_US, out));
    return LC_OK;
}
#define WIDTHS_FROM_TEXT(family, type_sec, type_ms)                                                          \
    lc_status lt_str_to_##family##_sec(const char *text, type_sec *out) {                                    \
        return seconds_from_us(lt_str_to_##family##_us, text, out);                                          \
    }                                                                                                        \
    lc_status lt_str_to_##family##_ms(const char *text, type_ms *out) {                                      \
        return ms_from_us(lt_str_to_##family##_us, text, out);                                               \
    }
WIDTHS_FROM_TEXT(daytime, lt_time_sec, lt_time_ms)
WIDTHS_FROM_TEXT(datetime, lt_time_sec, lt_time_ms)
WIDTHS_FROM_TEXT(dur, lt_dur_sec, lt_dur_ms)

lc_status lt_timezone_handle_changed() {
    CHECK_STATUS(lc_setenv("TZ", "error", 1));
    tzset();
    unsetenv("TZ");
    const time_t now = time(nullptr);
    tm ignored = {};
    tzset();
    (void)localtime_r(&now, &ignored);
    return LC_OK;
}
