// A growable text that knows its length. The bytes always end in a NUL. A string marked UTF-8 counts its
// characters too, and offsets in its operations are then characters.
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
    uint8_t placed;     // ts_placed_...: what lies in memory that isn't the string's own, see ts_place
    int32_t length;     // bytes, without the NUL
    int32_t characters; // equals length when not UTF-8
    uint32_t size;      // allocated bytes
};

lc_status ts_new(tstring **out);
lc_status ts_new_size(tstring **out, uint32_t size);
lc_status ts_new_str(tstring **out, const char *text); // null: the empty string
lc_status ts_new_sprintf(tstring **out, const char *format, ...) __attribute__((format(printf, 2, 3)));
// Takes a heap text over; -1 for `length` or `size` asks for strlen.
lc_status ts_new_str_takeover(tstring **out, char **inout_text, int32_t length, int32_t size);
lc_status ts_new_str_takeover_utf8(tstring **out, char **inout_text, int32_t length, int32_t size);
// Makes a string in memory that belongs to something else, and has to outlive the string. All operations
// work: a string that has to grow gets bytes of its own, and freeing it frees those only. `bytes` ends in a
// NUL.
inline void ts_place(tstring *record, char *bytes, int32_t length) {
    *record = {bytes,  0,      ts_placed_record | ts_placed_bytes,
               length, length, static_cast<uint32_t>(length) + 1};
}
lc_status ts_set_utf8(tstring *string, int on);
lc_status ts_free(tstring **inout);
lc_status ts_clear(tstring *string);
lc_status ts_clear_no_resize(tstring *string);
// Frees the record; the buffer is the caller's, to free with free().
lc_status ts_detach(tstring **inout, char **out_text, int32_t *out_length);
lc_status ts_dup(const tstring *string, tstring **out); // null: a copy that is empty
lc_status ts_dup_str(const tstring *string, char **out_text, int32_t *out_length);

// A null string gives -1, and from ts_str null with a line that names the caller's place.
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
int32_t ts_num_chars(const tstring *string);
// The character at that offset, 0 beyond the end.
uint32_t ts_get_char(const tstring *string, int32_t offset);

// LC_NO_BUFFER_SPACE for an offset beyond the number of characters, unless told otherwise.
lc_status ts_put_char(tstring *string, int32_t offset, char byte); // at or past the end: appends
lc_status ts_append_char(tstring *string, char byte);
lc_status ts_insert_char(tstring *string, int32_t offset, char byte);
lc_status ts_append(tstring *string, const tstring *other);
lc_status ts_append_str(tstring *string, const char *text);
lc_status ts_append_sprintf(tstring *string, const char *format, ...) __attribute__((format(printf, 2, 3)));
lc_status ts_put_str(tstring *string, int32_t offset, const char *text);
lc_status ts_copy_str(tstring *string, int32_t offset, const char *text); // the text is the string's new end
// `count` bytes of `text` from `start`; -1 is all the rest. The _utf8 forms count characters.
lc_status ts_put_str_frag(tstring *string, int32_t offset, const char *text, int32_t start, int32_t count);
lc_status ts_append_str_frag(tstring *string, const char *text, int32_t start, int32_t count);
lc_status ts_put_str_frag_utf8(tstring *string, int32_t offset, const char *text, int32_t start,
                               int32_t count);
lc_status ts_append_str_frag_utf8(tstring *string, const char *text, int32_t start, int32_t count);
lc_status ts_substr(const tstring *string, int32_t start, int32_t count, tstring **out);
lc_status ts_trim(tstring *string, char head, char tail);
lc_status ts_trim_tail(tstring *string, char tail);

// -1 in `out_offset` when absent.
lc_status ts_find_char(const tstring *string, int32_t start, char byte, int32_t *out_offset);
lc_status ts_rfind_char(const tstring *string, int32_t start, char byte, int32_t *out_offset);
int ts_equal(const tstring *a, const tstring *b);
int ts_equal_str(const tstring *a, const char *text, int ignore_case);
int ts_cmp(const tstring *a, const tstring *b); // a null sorts after a string

enum : uint32_t {
    ts_tok_keep_quotes = 0x1,
    ts_tok_keep_empty = 0x4,
    ts_tok_skip_leading = 0x8,
    ts_tok_skip_trailing = 0x10,
    ts_tok_empty_is_null = 0x20,
    ts_join_leading = 0x100,
    ts_join_trailing = 0x200,
    ts_join_skip_empty = 0x400,
};
// `escape` and `quote` may be 0 for none.
lc_status ts_tokenize_str(const char *text, char separator, char escape, char quote, uint32_t flags,
                          tstr_array **out);
lc_status ts_tokenize_str_utf8(const char *text, char separator, char escape, char quote, uint32_t flags,
                               tstr_array **out);
lc_status ts_join_tokens(const tstr_array *array, char separator, char escape, char quote, uint32_t flags,
                         tstring **out);
lc_status ts_join_tokens_utf8(const tstr_array *array, char separator, char escape, char quote,
                              uint32_t flags, tstring **out);

// Owner for a scope.
inline void ts_release(tstring *string) {
    (void)ts_free(&string);
}
