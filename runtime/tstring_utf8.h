// UTF-8, in its original form with sequences of up to six bytes: lead bytes are those below 0x80 and from
// 0xC0 to 0xFD. Overlong forms and surrogates are accepted. Lengths are in bytes.
#pragma once

#include <cstdint>

#include "runtime/common.h"

// The number of lead bytes, which is that of characters in a valid text.
int32_t utf8_count(const char *text, int32_t bytes);
// Check the text, or step over some characters. LC_BAD_UTF8, with the bytes in the log, for a text that isn't
// valid.
lc_status utf8_check(const char *text, int32_t bytes);
lc_status utf8_skip(const char *text, int32_t bytes, int32_t characters, int32_t *out_bytes);
uint32_t utf8_decode(const char *text, int32_t bytes); // the first code point; 0 if there is none
// 1 or 0; simple case folding by the locale C.UTF-8, whatever the locale of the process is.
int utf8_equal_ignoring_case(const char *a, const char *b);
