// Splitting a text at separators, and joining the pieces again. mgmt/bnode_names.cpp uses it for the names of
// nodes.
//
// Joining is the inverse of splitting for any tokens, if there is an escape: an escape character in a token
// is doubled where what follows would otherwise be read as escaped, also when that is the separator after the
// token.
#include <cstdlib>
#include <cstring>

#include "runtime/guards.h"
#include "runtime/logging.h"
#include "runtime/tstr_array.h"
#include "runtime/tstring.h"

namespace {

struct token_syntax {
    char separator;
    char escape;
    char quote;
    uint32_t flags;
    bool utf8;

    bool escapable(char next) const { return next && (next == separator || next == escape || next == quote); }
};

bool is_ambiguous(const token_syntax &syntax) {
    return !syntax.separator || syntax.separator == syntax.escape || syntax.separator == syntax.quote ||
           (syntax.escape && syntax.escape == syntax.quote);
}

lc_status add_token(const token_syntax &syntax, tstr_array *tokens, const char *bytes, size_t length) {
    if (length == 0 && !(syntax.flags & ts_tok_keep_empty))
        return LC_OK;
    owned<tstring, ts_release> token;
    CHECK_STATUS(ts_new_size(&token.pointer, static_cast<uint32_t>(length) + 1));
    memcpy(token.pointer->buffer, bytes, length);
    token.pointer->buffer[length] = 0;
    token.pointer->length = token.pointer->characters = static_cast<int32_t>(length);
    if (syntax.utf8)
        CHECK_STATUS(ts_set_utf8(token.pointer, 1));
    CHECK_STATUS(tstr_array_append_takeover(tokens, &token.pointer));
    return LC_OK;
}

lc_status scan_text(const token_syntax &syntax, const char *text, tstr_array *tokens) {
    const size_t size = strlen(text);
    if (size >= ts_size_max) // a token could be longer than a string can be
        FAIL_WITH(LC_ASSERTION);
    // One byte more, for the closing quote that a text which ends inside quotes gets.
    owned_text scratch(static_cast<char *>(malloc(size + 2)));
    CHECK_NULL(scratch.pointer);
    size_t length = 0;
    bool quoted = false, behind_separator = false;
    for (const char *at = text; *at; at++) {
        const char c = *at;
        behind_separator = false;
        // An escape at the end of the text has nothing to escape, and is an ordinary character.
        if (syntax.escape && c == syntax.escape && at[1]) {
            // Before any other character the escape itself is part of the token.
            if (!syntax.escapable(at[1]))
                scratch.pointer[length++] = c;
            scratch.pointer[length++] = *++at;
        } else if (syntax.quote && c == syntax.quote) {
            quoted = !quoted;
            if (syntax.flags & ts_tok_keep_quotes)
                scratch.pointer[length++] = c;
        } else if (c == syntax.separator && !quoted) {
            CHECK_STATUS(add_token(syntax, tokens, scratch.pointer, length));
            length = 0;
            behind_separator = true;
        } else {
            scratch.pointer[length++] = c;
        }
    }
    if (quoted && (syntax.flags & ts_tok_keep_quotes))
        scratch.pointer[length++] = syntax.quote;
    if (!(behind_separator && (syntax.flags & ts_tok_skip_trailing)))
        CHECK_STATUS(add_token(syntax, tokens, scratch.pointer, length));
    return LC_OK;
}

lc_status split_text(token_syntax syntax, const char *text, tstr_array **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(text);
    if (is_ambiguous(syntax)) {
        LC_LOG(LC_LOG_ERR, "called with invalid chars: %d %d %d\n", syntax.separator, syntax.escape,
               syntax.quote);
        return LC_GENERIC;
    }
    if ((syntax.flags & ts_tok_skip_leading) && text[0] == syntax.separator)
        text++;
    owned<tstr_array, tstr_array_release> tokens;
    CHECK_STATUS(tstr_array_new(&tokens.pointer, nullptr));
    if (!*text)
        syntax.flags |= ts_tok_keep_empty; // an empty text is one empty token
    CHECK_STATUS(scan_text(syntax, text, tokens.pointer));
    const uint32_t count = tstr_array_length_quick(tokens.pointer);
    const bool empty = count == 0 || (count == 1 && ts_length(tstr_array_get_quick(tokens.pointer, 0)) == 0);
    if (!(empty && (syntax.flags & ts_tok_empty_is_null)))
        *out = tokens.take();
    return LC_OK;
}

} // namespace

lc_status ts_tokenize_str(const char *text, char separator, char escape, char quote, uint32_t flags,
                          tstr_array **out) {
    return split_text({separator, escape, quote, flags, false}, text, out);
}
lc_status ts_tokenize_str_utf8(const char *text, char separator, char escape, char quote, uint32_t flags,
                               tstr_array **out) {
    return split_text({separator, escape, quote, flags, true}, text, out);
}

namespace {

// ts_append_char without its checks, while the presized buffer lasts.
lc_status append_byte(tstring *string, char c) {
    if (static_cast<uint32_t>(string->length) + 2 > string->size)
        return ts_append_char(string, c);
    string->buffer[string->length++] = c;
    string->buffer[string->length] = 0;
    string->characters = string->length;
    return LC_OK;
}

// `separated`: a separator follows the token, and an escape at its end has to be doubled.
lc_status write_token(const token_syntax &syntax, const tstring *token, bool separated, tstring *out) {
    for (const char *at = token->buffer; *at; at++) {
        const char c = *at;
        const char next = at[1] || !separated ? at[1] : syntax.separator;
        const bool special =
            (syntax.separator && c == syntax.separator) || (syntax.quote && c == syntax.quote);
        if (syntax.escape && (special || (c == syntax.escape && syntax.escapable(next))))
            CHECK_STATUS(append_byte(out, syntax.escape));
        CHECK_STATUS(append_byte(out, c));
    }
    return LC_OK;
}

lc_status write_tokens(const token_syntax &syntax, const tstr_array *array, tstring *out) {
    const uint32_t count = tstr_array_length_quick(array);
    bool first = true;
    for (uint32_t i = 0; i < count; i++) {
        const tstring *token = tstr_array_get_quick(array, i);
        if (!token || (token->length == 0 && (syntax.flags & ts_join_skip_empty)))
            continue;
        if (!first && syntax.separator)
            CHECK_STATUS(append_byte(out, syntax.separator));
        first = false;
        const bool separated = i + 1 < count || (syntax.flags & ts_join_trailing);
        CHECK_STATUS(write_token(syntax, token, separated && syntax.separator, out));
    }
    return LC_OK;
}

lc_status join_tokens(const token_syntax &syntax, const tstr_array *array, tstring **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(array);
    CHECK_CONDITION(syntax.separator || !syntax.flags);
    const uint32_t count = tstr_array_length_quick(array);
    // Room for all tokens and separators, and for one escape per 16 bytes. More escapes make the string grow.
    uint64_t sum = uint64_t{count} + 4;
    for (uint32_t i = 0; i < count; i++)
        if (const tstring *token = tstr_array_get_quick(array, i))
            sum += static_cast<uint32_t>(token->length);
    sum += sum / 16;
    CHECK_CONDITION(sum <= ts_size_max);
    owned<tstring, ts_release> string;
    CHECK_STATUS(ts_new_size(&string.pointer, static_cast<uint32_t>(sum)));
    CHECK_STATUS(write_tokens(syntax, array, string.pointer));
    // An empty first token has left a separator at the start already.
    if ((syntax.flags & ts_join_leading) && string.pointer->buffer[0] != syntax.separator)
        CHECK_STATUS(ts_insert_char(string.pointer, 0, syntax.separator));
    const int32_t length = string.pointer->length;
    if ((syntax.flags & ts_join_trailing) &&
        (length == 0 || string.pointer->buffer[length - 1] != syntax.separator))
        CHECK_STATUS(append_byte(string.pointer, syntax.separator));
    if (syntax.utf8)
        CHECK_STATUS(ts_set_utf8(string.pointer, 1));
    *out = string.take();
    return LC_OK;
}

} // namespace

lc_status ts_join_tokens(const tstr_array *array, char separator, char escape, char quote, uint32_t flags,
                         tstring **out) {
    return join_tokens({separator, escape, quote, flags, false}, array, out);
}
lc_status ts_join_tokens_utf8(const tstr_array *array, char separator, char escape, char quote,
                              uint32_t flags, tstring **out) {
    return join_tokens({separator, escape, quote, flags, true}, array, out);
}
