// Growable strings.
//
// Every change of a text is one call of replace_bytes(), which replaces some bytes at one place by others.
// The buffer grows before the change and shrinks after it, so that a failed allocation leaves the text as it
// was.
//
// In a string that is marked UTF-8 offsets are characters. They are converted to byte offsets first, by
// stepping through the text, which fails on invalid UTF-8. Text that is added is checked as well; only single
// bytes are not, since a caller may assemble a character from them.
//
// A string doubles when it grows, by at most 8 MiB more than is needed, and halves while it is more than four
// times as large as needed. A string in a packed array or in a message's block (ts_place) owns neither record
// nor bytes until it grows.
#include "runtime/tstring.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "runtime/guards.h"
#include "runtime/logging.h"
#include "runtime/tstring_utf8.h"

// --- Size

namespace {

lc_status allocate_own_bytes(tstring *string, uint32_t size) {
    // Bytes inside a block can't be reallocated. They are copied, and stay in the block unused.
    const bool placed = string->placed & ts_placed_bytes;
    auto *buffer = static_cast<char *>(placed ? malloc(size) : realloc(string->buffer, size));
    CHECK_NULL(buffer);
    if (placed)
        memcpy(buffer, string->buffer, static_cast<size_t>(string->length) + 1);
    string->placed &= ts_placed_record;
    string->buffer = buffer;
    string->size = size;
    return LC_OK;
}
lc_status set_allocated_size(tstring *string, uint32_t size) {
    return size == string->size ? LC_OK : allocate_own_bytes(string, size);
}

// The size is halved while it is more than four times what is needed.
uint32_t shrunk_size(uint32_t size, uint64_t need) {
    while (size > 4 * need && size > ts_size_initial)
        size = std::max(size / ts_resize_factor, ts_size_initial);
    return size;
}

lc_status adapt_string_size(tstring *string, int64_t length) {
    // One byte more for the NUL; a string never has less than its first size.
    const int64_t need = std::max<int64_t>(length + 1, ts_size_initial);
    if (need > ts_size_max) {
        LC_LOG(LC_LOG_ERR, "maximum size exceeded: %d",
               static_cast<int32_t>(std::min<int64_t>(need, INT32_MAX)));
        return LC_ASSERTION;
    }
    if (string->size >= need)
        return set_allocated_size(string, shrunk_size(string->size, static_cast<uint64_t>(need)));
    uint64_t size = std::max(string->size, ts_size_initial);
    while (size < static_cast<uint64_t>(need))
        size *= ts_resize_factor;
    size = std::min<uint64_t>(size, ts_size_max);
    size = std::min(size, static_cast<uint64_t>(need) + ts_size_max_extra_growth);
    return set_allocated_size(string, static_cast<uint32_t>(size));
}

void end_string_at(tstring *string, int32_t length) {
    string->length = length;
    string->buffer[length] = 0;
    string->characters = string->utf8 ? utf8_count(string->buffer, length) : length;
}

// --- Replacing bytes

lc_status replace_bytes(tstring *string, int32_t at, int32_t removed, const char *bytes, int64_t added) {
    // The text may be part of the string itself (ts_append(s, s)), which moves when the buffer grows.
    owned_text copy;
    if (added > 0 && bytes >= string->buffer && bytes < string->buffer + string->size) {
        copy.pointer = static_cast<char *>(malloc(static_cast<size_t>(added)));
        CHECK_NULL(copy.pointer);
        memcpy(copy.pointer, bytes, static_cast<size_t>(added));
        bytes = copy.pointer;
    }
    const int64_t length = int64_t{string->length} - removed + added;
    if (length + 1 > string->size)
        CHECK_QUIET(adapt_string_size(string, length));
    const int32_t rest = string->length - at - removed;
    memmove(string->buffer + at + added, string->buffer + at + removed, static_cast<size_t>(rest));
    if (added > 0)
        memcpy(string->buffer + at, bytes, static_cast<size_t>(added));
    // Compared before the length is changed below.
    const bool shorter = length < string->length;
    end_string_at(string, static_cast<int32_t>(length));
    return shorter ? adapt_string_size(string, length) : LC_OK;
}

lc_status byte_offset(const tstring *string, int32_t offset, int32_t *out_bytes) {
    if (offset < 0 || offset > string->characters)
        FAIL_WITH(LC_NO_BUFFER_SPACE);
    if (!string->utf8) {
        *out_bytes = offset;
        return LC_OK;
    }
    return utf8_skip(string->buffer, string->length, offset, out_bytes);
}

// The number of bytes of `count` characters from byte `at` on, or of as many as there are.
lc_status bytes_of_characters(const tstring *string, int32_t at, int32_t count, int32_t *out_bytes) {
    const int32_t rest = string->length - at;
    if (!string->utf8) {
        *out_bytes = std::min(count, rest);
        return LC_OK;
    }
    return utf8_skip(string->buffer + at, rest, std::min(count, utf8_count(string->buffer + at, rest)),
                     out_bytes);
}

} // namespace

// --- Creation and release

lc_status ts_new_size(tstring **out, uint32_t size) {
    CHECK_NULL(out);
    *out = nullptr;
    if (size > ts_size_max) {
        LC_LOG(LC_LOG_ERR, "maximum size exceeded: %d", static_cast<int32_t>(std::min(size, 0x7fffffffu)));
        return LC_ASSERTION;
    }
    size = std::max(size, ts_size_initial);
    auto *string = static_cast<tstring *>(calloc(1, sizeof(tstring)));
    CHECK_NULL(string);
    string->buffer = static_cast<char *>(malloc(size));
    if (!string->buffer) {
        free(string);
        FAIL_WITH(LC_NULL);
    }
    string->size = size;
    end_string_at(string, 0);
    *out = string;
    return LC_OK;
}
lc_status ts_new(tstring **out) {
    return ts_new_size(out, ts_size_initial);
}
lc_status ts_new_str(tstring **out, const char *text) {
    owned<tstring, ts_release> string;
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_STATUS(ts_new(&string.pointer));
    if (text)
        CHECK_STATUS(ts_append_str(string.pointer, text));
    *out = string.take();
    return LC_OK;
}
lc_status ts_new_sprintf(tstring **out, const char *format, ...) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(format);
    va_list arguments;
    va_start(arguments, format);
    owned_text text(vsmprintf(format, arguments));
    va_end(arguments);
    CHECK_NULL(text.pointer);
    CHECK_STATUS(ts_new_str(out, text.pointer));
    return LC_OK;
}

namespace {

lc_status take_over_text(tstring **out, char **inout_text, int32_t length, int32_t size, bool utf8) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(inout_text);
    CHECK_NULL(*inout_text);
    if (length < 0)
        length = static_cast<int32_t>(strlen(*inout_text));
    if (size < 0)
        size = length + 1;
    CHECK_CONDITION(size > length && (*inout_text)[length] == 0);
    if (utf8)
        CHECK_STATUS(utf8_check(*inout_text, length));
    auto *string = static_cast<tstring *>(calloc(1, sizeof(tstring)));
    owned<tstring, ts_release> guard(string);
    CHECK_NULL(string);
    // Every string has at least this size, which the growth by doubling relies on.
    if (size < static_cast<int32_t>(ts_size_initial)) {
        auto *enlarged = static_cast<char *>(realloc(*inout_text, ts_size_initial));
        CHECK_NULL(enlarged);
        *inout_text = enlarged;
        size = ts_size_initial;
    }
    string->buffer = *inout_text;
    string->size = static_cast<uint32_t>(size);
    string->utf8 = utf8;
    end_string_at(string, length);
    *inout_text = nullptr;
    *out = guard.take();
    return LC_OK;
}

} // namespace

lc_status ts_new_str_takeover(tstring **out, char **inout_text, int32_t length, int32_t size) {
    return take_over_text(out, inout_text, length, size, false);
}
lc_status ts_new_str_takeover_utf8(tstring **out, char **inout_text, int32_t length, int32_t size) {
    return take_over_text(out, inout_text, length, size, true);
}
lc_status ts_set_utf8(tstring *string, int on) {
    CHECK_NULL(string);
    if (on)
        CHECK_STATUS(utf8_check(string->buffer, string->length));
    string->utf8 = on ? 1 : 0;
    end_string_at(string, string->length);
    return LC_OK;
}
lc_status ts_free(tstring **inout) {
    CHECK_NULL(inout);
    if (*inout) {
        if (!((*inout)->placed & ts_placed_bytes))
            free((*inout)->buffer);
        if (!((*inout)->placed & ts_placed_record))
            free(*inout);
    }
    *inout = nullptr;
    return LC_OK;
}
lc_status ts_clear_no_resize(tstring *string) {
    CHECK_NULL(string);
    end_string_at(string, 0);
    return LC_OK;
}
lc_status ts_clear(tstring *string) {
    CHECK_NULL(string);
    end_string_at(string, 0);
    return set_allocated_size(string, shrunk_size(string->size, 1));
}
lc_status ts_detach(tstring **inout, char **out_text, int32_t *out_length) {
    CHECK_NULL(inout);
    CHECK_NULL(*inout);
    CHECK_NULL(out_text);
    tstring *string = *inout;
    // Bytes inside a block can't be freed by the caller; therefore they are copied.
    if (string->placed & ts_placed_bytes)
        CHECK_QUIET(allocate_own_bytes(string, std::max(string->size, ts_size_initial)));
    *out_text = string->buffer;
    if (out_length)
        *out_length = string->length;
    if (!(string->placed & ts_placed_record))
        free(string);
    *inout = nullptr;
    return LC_OK;
}
lc_status ts_dup(const tstring *string, tstring **out) {
    CHECK_NULL(out);
    *out = nullptr;
    if (!string)
        return ts_new(out);
    owned<tstring, ts_release> copy;
    CHECK_STATUS(ts_new(&copy.pointer));
    // Set first, so that the characters are counted when the bytes are copied.
    copy.pointer->utf8 = string->utf8;
    CHECK_STATUS(replace_bytes(copy.pointer, 0, 0, string->buffer, string->length));
    *out = copy.take();
    return LC_OK;
}
lc_status ts_dup_str(const tstring *string, char **out_text, int32_t *out_length) {
    CHECK_NULL(out_text);
    *out_text = nullptr;
    if (out_length)
        *out_length = 0;
    CHECK_NULL(string);
    *out_text = strdup(string->buffer);
    CHECK_NULL(*out_text);
    if (out_length)
        *out_length = string->length;
    return LC_OK;
}

// --- Reading

namespace {

const char *base_name(const char *file) {
    const char *slash = file ? strrchr(file, '/') : nullptr;
    return slash ? slash + 1 : file;
}

} // namespace

int32_t ts_length_(const tstring *string, const char *, int32_t) {
    return string ? string->length : -1;
}
const char *ts_str_(const tstring *string, const char *file, int32_t line) {
    if (!string)
        (void)lc_check_null("ts_str", base_name(file), line);
    return string ? string->buffer : nullptr;
}
int32_t ts_num_chars(const tstring *string) {
    return string ? string->characters : -1;
}
uint32_t ts_get_char(const tstring *string, int32_t offset) {
    int32_t at = 0;
    if (!string || offset < 0 || offset >= string->characters || byte_offset(string, offset, &at) != LC_OK)
        return 0;
    return string->utf8 ? utf8_decode(string->buffer + at, string->length - at)
                        : static_cast<uint8_t>(string->buffer[at]);
}
lc_status ts_substr(const tstring *string, int32_t start, int32_t count, tstring **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(string);
    CHECK_CONDITION(start >= 0 && start <= string->characters);
    int32_t at = 0, bytes = 0;
    CHECK_STATUS(byte_offset(string, start, &at));
    CHECK_STATUS(bytes_of_characters(string, at, count < 0 ? string->characters - start : count, &bytes));
    owned<tstring, ts_release> piece;
    CHECK_STATUS(ts_new(&piece.pointer));
    piece.pointer->utf8 = string->utf8;
    CHECK_STATUS(replace_bytes(piece.pointer, 0, 0, string->buffer + at, bytes));
    *out = piece.take();
    return LC_OK;
}

namespace {

int32_t characters_before(const tstring *string, const char *place) {
    const auto bytes = static_cast<int32_t>(place - string->buffer);
    return string->utf8 ? utf8_count(string->buffer, bytes) : bytes;
}

} // namespace

lc_status ts_find_char(const tstring *string, int32_t start, char byte, int32_t *out_offset) {
    CHECK_NULL(out_offset);
    *out_offset = -1;
    CHECK_NULL(string);
    int32_t at = 0;
    if (start >= string->characters)
        return LC_OK;
    CHECK_STATUS(byte_offset(string, std::max(start, 0), &at));
    // memchr on a byte: in a UTF-8 string only ASCII characters can be found.
    const void *found = memchr(string->buffer + at, byte, static_cast<size_t>(string->length - at));
    if (found)
        *out_offset = characters_before(string, static_cast<const char *>(found));
    return LC_OK;
}
lc_status ts_rfind_char(const tstring *string, int32_t start, char byte, int32_t *out_offset) {
    CHECK_NULL(out_offset);
    *out_offset = -1;
    CHECK_NULL(string);
    int32_t end = string->length;
    // Up to the end of the character at `start`, which may be the one that is searched.
    if (start >= 0 && start < string->characters)
        CHECK_STATUS(byte_offset(string, start + 1, &end));
    const void *found = memrchr(string->buffer, byte, static_cast<size_t>(end));
    if (found)
        *out_offset = characters_before(string, static_cast<const char *>(found));
    return LC_OK;
}

// --- Writing

lc_status ts_put_char(tstring *string, int32_t offset, char byte) {
    CHECK_NULL(string);
    CHECK_CONDITION(byte != 0 && offset >= 0);
    int32_t at = string->length, removed = 0;
    if (offset < string->characters) {
        // In a UTF-8 string the character to replace may have several bytes.
        CHECK_STATUS(byte_offset(string, offset, &at));
        CHECK_STATUS(bytes_of_characters(string, at, 1, &removed));
    }
    CHECK_STATUS(replace_bytes(string, at, removed, &byte, 1));
    return LC_OK;
}
lc_status ts_append_char(tstring *string, char byte) {
    CHECK_NULL(string);
    CHECK_CONDITION(byte != 0);
    CHECK_STATUS(replace_bytes(string, string->length, 0, &byte, 1));
    return LC_OK;
}
lc_status ts_insert_char(tstring *string, int32_t offset, char byte) {
    CHECK_NULL(string);
    CHECK_CONDITION(byte != 0);
    int32_t at = 0;
    CHECK_STATUS(byte_offset(string, offset, &at));
    CHECK_STATUS(replace_bytes(string, at, 0, &byte, 1));
    return LC_OK;
}

namespace {

// Replaces as many characters as `text` has, or with `to_end` everything from the offset on.
lc_status write_checked_text(tstring *string, int32_t offset, const char *text, size_t length, bool to_end) {
    CHECK_CONDITION(length <= ts_size_max);
    const auto bytes = static_cast<int32_t>(length);
    int32_t at = 0, removed = 0;
    CHECK_STATUS(byte_offset(string, offset, &at));
    if (string->utf8)
        CHECK_STATUS(utf8_check(text, bytes));
    if (to_end)
        removed = string->length - at;
    else
        CHECK_STATUS(
            bytes_of_characters(string, at, string->utf8 ? utf8_count(text, bytes) : bytes, &removed));
    CHECK_STATUS(replace_bytes(string, at, removed, text, bytes));
    return LC_OK;
}

} // namespace

lc_status ts_put_str(tstring *string, int32_t offset, const char *text) {
    CHECK_NULL(string);
    CHECK_NULL(text);
    return write_checked_text(string, offset, text, strlen(text), false);
}
lc_status ts_copy_str(tstring *string, int32_t offset, const char *text) {
    CHECK_NULL(string);
    CHECK_NULL(text);
    return write_checked_text(string, offset, text, strlen(text), true);
}
lc_status ts_append_str(tstring *string, const char *text) {
    CHECK_NULL(string);
    return ts_put_str(string, string->characters, text);
}
lc_status ts_append(tstring *string, const tstring *other) {
    CHECK_NULL(string);
    CHECK_NULL(other);
    return write_checked_text(string, string->characters, other->buffer, static_cast<size_t>(other->length),
                              false);
}
lc_status ts_append_sprintf(tstring *string, const char *format, ...) {
    CHECK_NULL(string);
    CHECK_NULL(format);
    va_list arguments;
    va_start(arguments, format);
    owned_text text(vsmprintf(format, arguments));
    va_end(arguments);
    CHECK_NULL(text.pointer);
    return ts_append_str(string, text.pointer);
}

namespace {

lc_status put_fragment(tstring *string, int32_t offset, const char *text, int32_t start, int32_t count,
                       bool by_characters) {
    CHECK_NULL(string);
    CHECK_NULL(text);
    CHECK_CONDITION(start >= 0 && count >= -1);
    size_t first = static_cast<size_t>(start), length;
    if (by_characters) {
        const auto bytes = static_cast<int32_t>(strlen(text));
        const int32_t all = utf8_count(text, bytes);
        int32_t skipped = 0, taken = 0;
        if (start > all)
            FAIL_WITH(LC_NO_BUFFER_SPACE);
        CHECK_STATUS(utf8_skip(text, bytes, start, &skipped));
        CHECK_STATUS(utf8_skip(text + skipped, bytes - skipped,
                               count < 0 ? all - start : std::min(count, all - start), &taken));
        first = static_cast<size_t>(skipped);
        length = static_cast<size_t>(taken);
    } else {
        // `text` may be shorter than `start`; strlen() alone would read past its end.
        if (strnlen(text, first) < first)
            FAIL_WITH(LC_NO_BUFFER_SPACE);
        length = count < 0 ? strlen(text + first) : strnlen(text + first, static_cast<size_t>(count));
    }
    return write_checked_text(string, offset, text + first, length, false);
}

} // namespace

lc_status ts_put_str_frag(tstring *string, int32_t offset, const char *text, int32_t start, int32_t count) {
    return put_fragment(string, offset, text, start, count, false);
}
lc_status ts_append_str_frag(tstring *string, const char *text, int32_t start, int32_t count) {
    CHECK_NULL(string);
    return put_fragment(string, string->characters, text, start, count, false);
}
lc_status ts_put_str_frag_utf8(tstring *string, int32_t offset, const char *text, int32_t start,
                               int32_t count) {
    return put_fragment(string, offset, text, start, count, true);
}
lc_status ts_append_str_frag_utf8(tstring *string, const char *text, int32_t start, int32_t count) {
    CHECK_NULL(string);
    return put_fragment(string, string->characters, text, start, count, true);
}

lc_status ts_trim(tstring *string, char head, char tail) {
    CHECK_NULL(string);
    int32_t first = 0, end = string->length;
    while (head && first < end && string->buffer[first] == head)
        first++;
    while (tail && end > first && string->buffer[end - 1] == tail)
        end--;
    // The tail first, so that `end` is still valid.
    CHECK_STATUS(replace_bytes(string, end, string->length - end, nullptr, 0));
    CHECK_STATUS(replace_bytes(string, 0, first, nullptr, 0));
    return LC_OK;
}
lc_status ts_trim_tail(tstring *string, char tail) {
    return ts_trim(string, 0, tail);
}

// --- Comparing

int ts_cmp(const tstring *a, const tstring *b) {
    if (!a || !b)
        return (a ? 0 : 1) - (b ? 0 : 1);
    // By bytes also in UTF-8, where that is the order of the code points.
    const int order = memcmp(a->buffer, b->buffer, static_cast<size_t>(std::min(a->length, b->length)));
    return order ? order : (a->length > b->length) - (a->length < b->length);
}
int ts_equal(const tstring *a, const tstring *b) {
    return ts_cmp(a, b) == 0;
}
int ts_equal_str(const tstring *a, const char *text, int ignore_case) {
    if (!a || !text)
        return !a && !text;
    if (!ignore_case)
        return strcmp(a->buffer, text) == 0;
    return a->utf8 ? utf8_equal_ignoring_case(a->buffer, text) : strcasecmp(a->buffer, text) == 0;
}
