#include "runtime/tstring_utf8.h"

#include <clocale>
#include <cstring>
#include <cwctype>

#include <pthread.h>

#include "runtime/guards.h"
#include "runtime/logging.h"
#include "runtime/tstring.h"

namespace {

// The length of the sequence that this lead byte begins; 0 for a continuation byte.
int32_t sequence_length(uint8_t lead) {
    if (lead < 0x80)
        return 1;
    if (lead < 0xc0 || lead > 0xfd)
        return 0;
    // Sequences of five and six bytes, which current UTF-8 no longer has, are accepted as well.
    return lead < 0xe0 ? 2 : lead < 0xf0 ? 3 : lead < 0xf8 ? 4 : lead < 0xfc ? 5 : 6;
}

int32_t character_length(const char *text, int32_t bytes) {
    const int32_t length = bytes > 0 ? sequence_length(static_cast<uint8_t>(text[0])) : 0;
    if (length > bytes)
        return 0;
    for (int32_t i = 1; i < length; i++)
        if ((static_cast<uint8_t>(text[i]) & 0xc0) != 0x80)
            return 0;
    return length;
}

void log_bytes(const char *text, int32_t bytes) {
    owned<tstring, ts_release> list;
    if (!lc_log_check_level(LC_LOG_WARNING) || ts_new(&list.pointer) != LC_OK)
        return;
    // The text comes from outside, and may be long.
    for (int32_t i = 0; i < bytes && ts_length(list.pointer) < 1024; i++) {
        const uint8_t byte = static_cast<uint8_t>(text[i]);
        const char *separator = i ? " " : "";
        const lc_status status = byte > 127 ? ts_append_sprintf(list.pointer, "%s*** %u ***", separator, byte)
                                            : ts_append_sprintf(list.pointer, "%s%u", separator, byte);
        if (status != LC_OK)
            return;
    }
    LC_LOG(LC_LOG_WARNING, "%s", ts_str(list.pointer));
}

} // namespace

int32_t utf8_count(const char *text, int32_t bytes) {
    int32_t count = 0;
    for (int32_t i = 0; i < bytes; i++)
        count += sequence_length(static_cast<uint8_t>(text[i])) != 0;
    return count;
}

namespace {

lc_status step_over_characters(const char *text, int32_t bytes, int32_t characters, int32_t *out_bytes) {
    int32_t at = 0;
    // A negative number of characters means all.
    for (int32_t i = 0; characters < 0 ? at < bytes : i < characters; i++) {
        const int32_t length = character_length(text + at, bytes - at);
        if (length == 0) {
            log_bytes(text, bytes);
            return LC_BAD_UTF8;
        }
        at += length;
    }
    *out_bytes = at;
    return LC_OK;
}

} // namespace

lc_status utf8_check(const char *text, int32_t bytes) {
    int32_t end = 0;
    return step_over_characters(text, bytes, -1, &end);
}
lc_status utf8_skip(const char *text, int32_t bytes, int32_t characters, int32_t *out_bytes) {
    return step_over_characters(text, bytes, characters, out_bytes);
}

uint32_t utf8_decode(const char *text, int32_t bytes) {
    const int32_t length = character_length(text, bytes);
    if (length <= 1)
        return length == 1 ? static_cast<uint8_t>(text[0]) : 0;
    // The lead byte of a sequence of n bytes has n ones and a zero before its payload.
    uint32_t value = static_cast<uint8_t>(text[0]) & (0x7fu >> length);
    for (int32_t i = 1; i < length; i++)
        value = (value << 6) | (static_cast<uint8_t>(text[i]) & 0x3f);
    return value;
}

namespace {

locale_t utf8_locale;
pthread_once_t utf8_locale_once = PTHREAD_ONCE_INIT;

uint32_t fold_case(uint32_t character) {
    // towlower() in the process's own locale, normally "C", would only know ASCII.
    pthread_once(&utf8_locale_once,
                 [] { utf8_locale = newlocale(LC_CTYPE_MASK, "C.UTF-8", static_cast<locale_t>(nullptr)); });
    return utf8_locale ? towlower_l(character, utf8_locale) : towlower(character);
}

} // namespace

int utf8_equal_ignoring_case(const char *a, const char *b) {
    while (*a && *b) {
        // No sequence is longer than six bytes, and one that is cut short ends at the NUL.
        const int32_t a_length = character_length(a, static_cast<int32_t>(strnlen(a, 6)));
        const int32_t b_length = character_length(b, static_cast<int32_t>(strnlen(b, 6)));
        if (!a_length || !b_length ||
            fold_case(utf8_decode(a, a_length)) != fold_case(utf8_decode(b, b_length)))
            return 0;
        a += a_length;
        b += b_length;
    }
    return *a == *b;
}
