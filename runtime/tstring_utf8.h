// Walks over UTF-8. Lead bytes are those below 0x80 and from 0xC0 to 0xFD.
#pragma once

#include <cstdint>

#include "runtime/common.h"

int32_t utf8_count(const char *text, int32_t bytes); // lead bytes
// LC_BAD_UTF8, with a line that lists the bytes.
lc_status utf8_check(const char *text, int32_t bytes);
lc_status utf8_skip(const char *text, int32_t bytes, int32_t characters, int32_t *out_bytes);
uint32_t utf8_decode(const char *text, int32_t bytes); // 0 for what isn't a character
int utf8_equal_ignoring_case(const char *a, const char *b);
