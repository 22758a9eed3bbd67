// Units of time and their conversion from and to text. A date is "%Y/%m/%d", a time of day "%H:%M:%S" with an
// optional fraction, a date and time both with a blank between them. Null pointers are LC_NULL.
#pragma once

#include <sys/time.h>

#include <cstdint>
#include <ctime>

#include "runtime/common.h"

using lt_date = uint32_t;    // midnight UTC of the date, in seconds since 1970
using lt_time_sec = int32_t; // since 1970-01-01 00:00:00 UTC, or since midnight
using lt_time_ms = int64_t;
using lt_time_us = int64_t;
using lt_dur_sec = int32_t;
using lt_dur_ms = int64_t;
using lt_dur_us = int64_t;

// The wall clock, which can be set and therefore jump.
lt_time_sec lt_curr_time();
lt_time_ms lt_curr_time_ms();
lt_time_us lt_curr_time_us();

// CLOCK_MONOTONIC, for timeouts and durations. It is never set, and stops while the machine is suspended.
int64_t lt_monotonic_ms();
int64_t lt_monotonic_ns();

// The tm is in local time, in the _utc forms in UTC. The forms that return a value log a null pointer and
// return 0.
lc_status lt_time_sec_to_tm(lt_time_sec seconds, tm *out);
lc_status lt_time_sec_to_tm_utc(lt_time_sec seconds, tm *out);
lt_time_us lt_tm_to_time_us(const tm *local);
lt_time_sec lt_tm_utc_to_time_sec(const tm *utc);
lc_status lt_time_sec_to_timeval(lt_time_sec seconds, timeval *out);
lc_status lt_time_ms_to_timeval(lt_time_ms ms, timeval *out);
lt_time_sec lt_timeval_to_time_sec(const timeval *value);
lt_time_ms lt_timeval_to_time_ms(const timeval *value);

// Value to text. The _to_buf forms write to a buffer of `size` bytes, and return LC_ASSERTION if the text
// doesn't fit. The _to_str forms allocate the text, and the caller frees it with free(). Dates and times of
// day are in UTC; a date and time is in local time, followed by " %z" if `with_zone` is set. A fraction has
// three digits if it is whole milliseconds, otherwise six; it is left out near the end of the buffer.
// Durations are "1.500000 seconds".
lc_status lt_date_to_buf(lt_date value, uint32_t size, char *buffer, uint32_t *out_length);
lc_status lt_date_to_str(lt_date value, char **out);
lc_status lt_daytime_sec_to_buf(lt_time_sec value, uint32_t size, char *buffer);
lc_status lt_daytime_ms_to_buf(lt_time_ms value, uint32_t size, char *buffer);
lc_status lt_daytime_us_to_buf(lt_time_us value, uint32_t size, char *buffer);
lc_status lt_daytime_sec_to_str(lt_time_sec value, char **out);
lc_status lt_daytime_ms_to_str(lt_time_ms value, char **out);
lc_status lt_daytime_us_to_str(lt_time_us value, char **out);
lc_status lt_datetime_sec_to_buf(lt_time_sec value, int with_zone, uint32_t size, char *buffer);
lc_status lt_datetime_ms_to_buf(lt_time_ms value, int with_zone, uint32_t size, char *buffer);
lc_status lt_datetime_us_to_buf(lt_time_us value, int with_zone, uint32_t size, char *buffer);
lc_status lt_datetime_sec_to_str(lt_time_sec value, int with_zone, char **out);
lc_status lt_datetime_ms_to_str(lt_time_ms value, int with_zone, char **out);
lc_status lt_datetime_us_to_str(lt_time_us value, int with_zone, char **out);
lc_status lt_dur_sec_to_buf(lt_dur_sec value, uint32_t size, char *buffer);
lc_status lt_dur_ms_to_buf(lt_dur_ms value, uint32_t size, char *buffer);
lc_status lt_dur_us_to_buf(lt_dur_us value, uint32_t size, char *buffer);
lc_status lt_dur_sec_to_str(lt_dur_sec value, char **out);
lc_status lt_dur_ms_to_str(lt_dur_ms value, char **out);
lc_status lt_dur_us_to_str(lt_dur_us value, char **out);

// Text to value. LC_BAD_TYPE, not logged, for a text that can't be parsed. The _sec and _ms forms return
// LC_ASSERTION for a negative value, and the _sec forms for one that doesn't fit in 32 bits. Text after the
// number of a duration is ignored.
lc_status lt_str_to_date(const char *text, lt_date *out);
lc_status lt_str_to_daytime_sec(const char *text, lt_time_sec *out);
lc_status lt_str_to_daytime_ms(const char *text, lt_time_ms *out);
lc_status lt_str_to_daytime_us(const char *text, lt_time_us *out);
lc_status lt_str_to_datetime_sec(const char *text, lt_time_sec *out);
lc_status lt_str_to_datetime_ms(const char *text, lt_time_ms *out);
lc_status lt_str_to_datetime_us(const char *text, lt_time_us *out);
lc_status lt_str_to_dur_sec(const char *text, lt_dur_sec *out);
lc_status lt_str_to_dur_ms(const char *text, lt_dur_ms *out);
lc_status lt_str_to_dur_us(const char *text, lt_dur_us *out);

// Makes the C library read the system's time zone again, after /etc/localtime has changed. Removes TZ from
// the environment.
lc_status lt_timezone_handle_changed();
