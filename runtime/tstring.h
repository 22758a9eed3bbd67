// A growable, NUL-terminated string that knows its length. In a string that is marked UTF-8 the offsets and
// counts of all operations are characters, otherwise bytes. A null string is LC_NULL unless noted. Not
// locked: the owner's lock guards a string.
#pragma once

#include <cstdarg>
#include <cstdint>

#include "runtime/common.h"

struct tstr_array;

constexpr uint32_t ts_size_initial = 16;
constexpr uint32_t ts_resize_factor = 2;
constexpr uint32_t ts_size_max = 0x5000000;
constexpr uint32_t ts_size_max_extra_growth = 0x800000;

enum : uint8_t { ts_placed_record = 1, ts_placed_bytes = 2 };
struct tstring {
    char *buffer;
    uint8_t utf8;
    uint8_t placed;     // ts_placed_...: what belongs to somebody else, see ts_place
    int32_t length;     // bytes, without the NUL
    int32_t characters; // equals length when not UTF-8
    uint32_t size;      // allocated bytes
};

lc_status ts_new(tstring **out);
lc_status ts_new_size(tstring **out, uint32_t size);
lc_status ts_new_str(tstring **out, const char *text); // null: the empty string
lc_status ts_new_sprintf(tstring **out, const char *format, ...) __attribute__((format(printf, 2, 3)));
// Takes over a text in memory of malloc(); on failure it stays the caller's. `length` or `size` -1 means
// strlen. The utf8 form marks the string, and returns LC_BAD_UTF8 for text that isn't valid UTF-8.
lc_status ts_new_str_takeover(tstring **out, char **inout_text, int32_t length, int32_t size);
lc_status ts_new_str_takeover_utf8(tstring **out, char **inout_text, int32_t length, int32_t size);
// Initialises a string in a record and over bytes, ending in a NUL, that the caller owns and that must
// outlive it. All operations work on it: if it has to grow, it allocates bytes of its own, and freeing it
// frees only those.
inline void ts_place(tstring *record, char *bytes, int32_t length) {
    *record = {bytes,  0,      ts_placed_record | ts_placed_bytes,
               length, length, static_cast<uint32_t>(length) + 1};
}
lc_status ts_set_utf8(tstring *string, int on);
lc_status ts_free(tstring **inout);
lc_status ts_clear(tstring *string);           // frees memory that an empty string doesn't need
lc_status ts_clear_no_resize(tstring *string); // keeps it for the next text
// Frees the record and gives the text to the caller, who frees it with free().
lc_status ts_detach(tstring **inout, char **out_text, int32_t *out_length);
lc_status ts_dup(const tstring *string, tstring **out); // of null: an empty string
lc_status ts_dup_str(const tstring *string, char **out_text, int32_t *out_length);

// The length in bytes, -1 for null; and the text, null for null, which is logged with the caller's file and
// line. The text is valid until the string is changed. The forms with a trailing underscore are only called
// by the others.
int32_t ts_length_(const tstring *string, const char *file, int32_t line);
const char *ts_str_(const tstring *string, const char *file, int32_t line);
inline int32_t ts_length(const tstring *string, const char *file = __builtin_FILE(),
                         int32_t line = __builtin_LINE()) {
    return ts_length_(string, file, line);
}
inline const char *ts_str(const tstring *string, const char *file = __builtin_FILE(),
                          int32_t line = __builtin_LINE()) {
    return ts_str_(string, file, line);
}
inline const char *ts_str_maybe(const tstring *string) {
    return string ? string->buffer : nullptr;
}
int32_t ts_num_chars(const tstring *string); // -1 for null
// The character at that offset (its code point in a UTF-8 string), 0 beyond the end.
uint32_t ts_get_char(const tstring *string, int32_t offset);

// Put overwrites from the offset on and extends the string if the text ends past its end; copy also ends the
// string at the end of the text. An offset beyond the end is LC_NO_BUFFER_SPACE, but ts_put_char then
// appends. A text that isn't valid UTF-8 is LC_BAD_UTF8 in a UTF-8 string; the single-byte operations don't
// check. On failure the string is unchanged.
lc_status ts_put_char(tstring *string, int32_t offset, char byte);
lc_status ts_append_char(tstring *string, char byte);
lc_status ts_insert_char(tstring *string, int32_t offset, char byte);
lc_status ts_append(tstring *string, const tstring *other);
lc_status ts_append_str(tstring *string, const char *text);
lc_status ts_append_sprintf(tstring *string, const char *format, ...) __attribute__((format(printf, 2, 3)));
lc_status ts_put_str(tstring *string, int32_t offset, const char *text);
lc_status ts_copy_str(tstring *string, int32_t offset, const char *text);
// `count` bytes of `text` from `start`; -1 means all the rest. The _utf8 forms count characters.
lc_status ts_put_str_frag(tstring *string, int32_t offset, const char *text, int32_t start, int32_t count);
lc_status ts_append_str_frag(tstring *string, const char *text, int32_t start, int32_t count);
lc_status ts_put_str_frag_utf8(tstring *string, int32_t offset, const char *text, int32_t start,
                               int32_t count);
lc_status ts_append_str_frag_utf8(tstring *string, const char *text, int32_t start, int32_t count);
lc_status ts_substr(const tstring *string, int32_t start, int32_t count, tstring **out);
// Removes a run of `head` from the start and of `tail` from the end; 0 removes nothing there.
lc_status ts_trim(tstring *string, char head, char tail);
lc_status ts_trim_tail(tstring *string, char tail);

// `out_offset` is -1 if the byte isn't found. The search goes from `start` to the end, or for the second one
// from `start` (or from the end, if it is out of range) back to the front.
lc_status ts_find_char(const tstring *string, int32_t start, char byte, int32_t *out_offset);
lc_status ts_rfind_char(const tstring *string, int32_t start, char byte, int32_t *out_offset);
// Comparison by bytes; a null equals only a null, and sorts after a string.
int ts_equal(const tstring *a, const tstring *b);
int ts_equal_str(const tstring *a, const char *text, int ignore_case);
int ts_cmp(const tstring *a, const tstring *b);

enum : uint32_t {
    ts_tok_keep_quotes = 0x1,    // quote characters stay in the tokens
    ts_tok_keep_empty = 0x4,     // otherwise a run of separators counts as one
    ts_tok_skip_leading = 0x8,   // ignore one separator at the start
    ts_tok_skip_trailing = 0x10, // ignore one separator at the end
    ts_tok_empty_is_null = 0x20, // null instead of an array without tokens, or with one empty token
    ts_join_leading = 0x100,     // begin with a separator
    ts_join_trailing = 0x200,    // end with a separator
    ts_join_skip_empty = 0x400,  // leave out empty tokens
};
// Splits a text at a separator, and joins tokens again. Separators inside quotes, and a separator, escape or
// quote after an escape, are ordinary characters; joining escapes them. `escape` and `quote` may be 0 for
// none. LC_GENERIC for a combination of characters that is ambiguous. The utf8 forms mark the strings that
// they make.
lc_status ts_tokenize_str(const char *text, char separator, char escape, char quote, uint32_t flags,
                          tstr_array **out);
lc_status ts_tokenize_str_utf8(const char *text, char separator, char escape, char quote, uint32_t flags,
                               tstr_array **out);
lc_status ts_join_tokens(const tstr_array *array, char separator, char escape, char quote, uint32_t flags,
                         tstring **out);
lc_status ts_join_tokens_utf8(const tstr_array *array, char separator, char escape, char quote,
                              uint32_t flags, tstring **out);

// For scope guards: owned<tstring, ts_release>.
inline void ts_release(tstring *string) {
    (void)ts_free(&string);
}
