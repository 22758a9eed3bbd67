// Growable byte buffers.
//
// One byte more than `size` is allocated, for the NUL that follows the last byte even of a full buffer. New
// memory is zeroed: tb_set_length may extend the length over bytes that were never written, which must not
// show what the memory held before. A count or length that is read from the bytes is checked against the
// bytes that follow it, before anything is allocated for it.
//
// A buffer grows by a factor of 4, and by at most 8 MiB more than is needed; 256 MiB is the limit. A change
// that fails leaves the buffer as it was.
#include "runtime/tbuffer.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "runtime/byte_order.h"
#include "runtime/guards.h"
#include "runtime/logging.h"
#include "runtime/tstr_array.h"

// --- Size

namespace {

// Up to a multiple of 4096 bytes, or of 128 for less than 4096.
uint64_t round_size(uint64_t size) {
    const uint64_t mask = size >= tb_size_chunk_size_mask + 1 ? tb_size_chunk_size_mask : tb_size_initial - 1;
    return std::min<uint64_t>((size + mask) & ~mask, tb_size_max);
}

uint64_t size_for_need(const tbuffer *buffer, uint64_t need) {
    uint64_t size = buffer->size;
    if (size < need) {
        size = uint64_t{std::max(buffer->size, tb_size_initial)} * tb_size_growth_factor;
        size = std::max(size, need);
        size = round_size(std::min(size, need + tb_size_max_extra_growth));
    }
    // More than the growth factor above the need, so that a buffer that has just grown doesn't shrink at
    // once.
    if (buffer->auto_shrink && size > (need * 3 + 3) * 2 + 1)
        size = round_size(need);
    return size;
}

lc_status adapt_buffer_size(tbuffer *buffer, uint64_t need) {
    CHECK_CONDITION(!buffer->constant);
    need = std::max<uint64_t>(need, tb_size_initial);
    if (need > tb_size_max) {
        LC_LOG(LC_LOG_ERR, "maximum size exceeded: %d",
               static_cast<int32_t>(std::min<uint64_t>(need, INT32_MAX)));
        return LC_ASSERTION;
    }
    const uint64_t size = size_for_need(buffer, need);
    if (size == buffer->size)
        return LC_OK;
    auto *bytes = static_cast<uint8_t *>(realloc(buffer->buffer, size + 1));
    CHECK_NULL(bytes);
    // All of the new memory, also the byte for the NUL.
    if (size > buffer->size)
        memset(bytes + buffer->size, 0, size + 1 - buffer->size);
    buffer->buffer = bytes;
    buffer->size = static_cast<uint32_t>(size);
    return LC_OK;
}

void end_buffer_at(tbuffer *buffer, uint32_t length) {
    buffer->length = length;
    buffer->buffer[length] = 0;
}

} // namespace

// --- Creation and release

lc_status tb_new_size(tbuffer **out, uint32_t size) {
    CHECK_NULL(out);
    *out = nullptr;
    owned<tbuffer, tb_release> buffer(static_cast<tbuffer *>(calloc(1, sizeof(tbuffer))));
    CHECK_NULL(buffer.pointer);
    size = std::max(size, tb_size_initial);
    if (size > tb_size_max) {
        LC_LOG(LC_LOG_ERR, "maximum size exceeded: %d", static_cast<int32_t>(std::min(size, 0x7fffffffu)));
        return LC_ASSERTION;
    }
    const uint64_t allocated = round_size(size);
    buffer.pointer->buffer = static_cast<uint8_t *>(calloc(1, allocated + 1));
    CHECK_NULL(buffer.pointer->buffer);
    buffer.pointer->size = static_cast<uint32_t>(allocated);
    *out = buffer.take();
    return LC_OK;
}
lc_status tb_new(tbuffer **out) {
    return tb_new_size(out, tb_size_initial);
}
lc_status tb_new_buf(tbuffer **out, const void *bytes, int32_t length) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(bytes);
    const size_t count = length < 0 ? strlen(static_cast<const char *>(bytes)) : static_cast<size_t>(length);
    CHECK_CONDITION(count < tb_size_max);
    owned<tbuffer, tb_release> buffer;
    CHECK_STATUS(tb_new_size(&buffer.pointer, static_cast<uint32_t>(count) + 1));
    CHECK_STATUS(tb_append_buf(buffer.pointer, bytes, static_cast<uint32_t>(count)));
    *out = buffer.take();
    return LC_OK;
}
lc_status tb_new_takeover(tbuffer **out, uint8_t **inout_bytes, uint32_t length, uint32_t size) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(inout_bytes);
    CHECK_NULL(*inout_bytes);
    CHECK_CONDITION(length <= size && size <= tb_size_max);
    owned<tbuffer, tb_release> buffer(static_cast<tbuffer *>(calloc(1, sizeof(tbuffer))));
    CHECK_NULL(buffer.pointer);
    // Enlarged for the NUL, for which the caller's memory has no room.
    auto *bytes = static_cast<uint8_t *>(realloc(*inout_bytes, size_t{size} + 1));
    CHECK_NULL(bytes);
    *inout_bytes = nullptr;
    buffer.pointer->buffer = bytes;
    buffer.pointer->size = size;
    end_buffer_at(buffer.pointer, length);
    *out = buffer.take();
    return LC_OK;
}
lc_status tb_new_buf_const(tbuffer **out, const void *bytes, uint32_t length) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(bytes);
    auto *buffer = static_cast<tbuffer *>(calloc(1, sizeof(tbuffer)));
    CHECK_NULL(buffer);
    buffer->buffer = static_cast<uint8_t *>(const_cast<void *>(bytes));
    buffer->length = buffer->size = length;
    buffer->constant = 1;
    *out = buffer;
    return LC_OK;
}
lc_status tb_free(tbuffer **inout) {
    CHECK_NULL(inout);
    if (*inout) {
        if (!(*inout)->constant)
            free((*inout)->buffer);
        if (!(*inout)->placed)
            free(*inout);
    }
    *inout = nullptr;
    return LC_OK;
}
lc_status tb_detach(tbuffer **inout, uint8_t **out_bytes, uint32_t *out_length) {
    CHECK_NULL(inout);
    CHECK_NULL(*inout);
    CHECK_NULL(out_bytes);
    CHECK_CONDITION(!(*inout)->constant);
    *out_bytes = (*inout)->buffer;
    if (out_length)
        *out_length = (*inout)->length;
    free(*inout);
    *inout = nullptr;
    return LC_OK;
}
lc_status tb_dup(const tbuffer *buffer, tbuffer **out) {
    CHECK_NULL(out);
    *out = nullptr;
    CHECK_NULL(buffer);
    CHECK_CONDITION(buffer->length < tb_size_max);
    owned<tbuffer, tb_release> copy;
    CHECK_STATUS(tb_new_size(&copy.pointer, buffer->length + 1));
    CHECK_STATUS(tb_append_buf(copy.pointer, buffer->buffer, buffer->length));
    copy.pointer->auto_shrink = buffer->auto_shrink;
    *out = copy.take();
    return LC_OK;
}

// --- Plain access

int32_t tb_length(const tbuffer *buffer) {
    return buffer ? static_cast<int32_t>(buffer->length) : -1;
}
uint32_t tb_size(const tbuffer *buffer) {
    return buffer ? buffer->size : 0;
}
uint32_t tb_avail(const tbuffer *buffer) {
    return buffer ? buffer->size - buffer->length : 0;
}
uint8_t *tb_buf_maybe(const tbuffer *buffer) {
    return buffer ? buffer->buffer : nullptr;
}
uint8_t *tb_buf(const tbuffer *buffer) {
    if (!buffer)
        (void)lc_check_null(__func__, LC_FILE_NAME, __LINE__);
    return tb_buf_maybe(buffer);
}
lc_status tb_ensure_size(tbuffer *buffer, uint32_t size) {
    CHECK_NULL(buffer);
    return size > buffer->size ? adapt_buffer_size(buffer, size) : LC_OK;
}
lc_status tb_set_length(tbuffer *buffer, uint32_t length) {
    CHECK_NULL(buffer);
    CHECK_CONDITION(!buffer->constant);
    if (length > buffer->size)
        FAIL_WITH(LC_GENERIC);
    const bool shorter = length < buffer->length;
    end_buffer_at(buffer, length);
    // Frees memory if auto_shrink is set.
    return shorter ? adapt_buffer_size(buffer, uint64_t{length} + 1) : LC_OK;
}
lc_status tb_clear(tbuffer *buffer) {
    return tb_set_length(buffer, 0);
}
lc_status tb_delete_bytes(tbuffer *buffer, uint32_t offset, uint32_t count) {
    CHECK_NULL(buffer);
    CHECK_CONDITION(!buffer->constant);
    // In two comparisons, since the sum of the two could overflow.
    if (offset > buffer->length || count > buffer->length - offset)
        FAIL_WITH(LC_NO_BUFFER_SPACE);
    memmove(buffer->buffer + offset, buffer->buffer + offset + count, buffer->length - offset - count);
    return tb_set_length(buffer, buffer->length - count);
}

// --- Writing

lc_status tb_put_buf(tbuffer *buffer, uint32_t offset, const void *bytes, uint32_t count) {
    CHECK_NULL(buffer);
    CHECK_CONDITION(!buffer->constant);
    if (count)
        CHECK_NULL(bytes);
    const uint64_t end = uint64_t{offset} + count;
    if (end > buffer->length) {
        if (end + 1 > buffer->size) {
            // Growing may move the buffer, and `bytes` would then point to freed memory.
            const auto *source = static_cast<const uint8_t *>(bytes);
            CHECK_CONDITION(source < buffer->buffer || source >= buffer->buffer + buffer->size);
            CHECK_QUIET(adapt_buffer_size(buffer, end + 1));
        }
        // These bytes may be left over from a time when the buffer was longer.
        if (offset > buffer->length)
            memset(buffer->buffer + buffer->length, 0, offset - buffer->length);
    }
    // memmove: the bytes may be in this buffer.
    if (count)
        memmove(buffer->buffer + offset, bytes, count);
    if (end > buffer->length)
        end_buffer_at(buffer, static_cast<uint32_t>(end));
    return LC_OK;
}
lc_status tb_append_buf(tbuffer *buffer, const void *bytes, uint32_t count) {
    CHECK_NULL(buffer);
    return tb_put_buf(buffer, buffer->length, bytes, count);
}
lc_status tb_put_byte(tbuffer *buffer, uint32_t offset, uint8_t byte) {
    return tb_put_buf(buffer, offset, &byte, 1);
}

namespace {

lc_status get_number(const tbuffer *buffer, uint32_t offset, void *out, uint32_t size) {
    CHECK_NULL(out);
    memset(out, 0, size);
    CHECK_NULL(buffer);
    CHECK_CONDITION(offset <= buffer->length && size <= buffer->length - offset);
    memcpy(out, buffer->buffer + offset, size);
    return LC_OK;
}

} // namespace

// Defines tb_put_uint32, tb_append_uint32 and tb_get_uint32 for the width 32, and so on.
#define TB_NUMBER(width)                                                                                     \
    lc_status tb_put_uint##width(tbuffer *buffer, uint32_t offset, uint##width##_t value) {                  \
        return tb_put_buf(buffer, offset, &value, sizeof value);                                             \
    }                                                                                                        \
    lc_status tb_append_uint##width(tbuffer *buffer, uint##width##_t value) {                                \
        return tb_append_buf(buffer, &value, sizeof value);                                                  \
    }                                                                                                        \
    lc_status tb_get_uint##width(const tbuffer *buffer, uint32_t offset, uint##width##_t *out) {             \
        return get_number(buffer, offset, out, sizeof *out);                                                 \
    }
TB_NUMBER(8)
TB_NUMBER(16)
TB_NUMBER(32)
TB_NUMBER(64)
lc_status tb_get_uint128(const tbuffer *buffer, uint32_t offset, uint8_t out[16]) {
    return get_number(buffer, offset, out, 16);
}

// --- Strings

namespace {

uint32_t swap_if(uint32_t number, int swap) {
    return swap ? raw_word(to_be32(number)) : number;
}

lc_status put_counted_text(tbuffer *buffer, uint32_t offset, int add_nul, int length_word, int swap,
                           const char *text, uint32_t length, uint32_t *out_written) {
    CHECK_CONDITION(length < tb_size_max && offset < tb_size_max);
    // The length word includes the NUL, which `length` doesn't.
    const uint32_t counted = length + (add_nul ? 1 : 0);
    uint32_t at = offset;
    if (length_word) {
        CHECK_STATUS(tb_put_uint32(buffer, at, swap_if(counted, swap)));
        at += 4;
    }
    CHECK_STATUS(tb_put_buf(buffer, at, text, length));
    if (add_nul)
        CHECK_STATUS(tb_put_byte(buffer, at + length, 0));
    if (out_written)
        *out_written = at + counted - offset;
    return LC_OK;
}

} // namespace

lc_status tb_put_str(tbuffer *buffer, uint32_t offset, int add_nul, int length_word, int swap,
                     const char *text, int32_t length, uint32_t *out_written) {
    if (out_written)
        *out_written = 0;
    CHECK_NULL(buffer);
    CHECK_NULL(text);
    const size_t bytes = length < 0 ? strlen(text) : static_cast<size_t>(length);
    CHECK_CONDITION(bytes < tb_size_max);
    return put_counted_text(buffer, offset, add_nul, length_word, swap, text, static_cast<uint32_t>(bytes),
                            out_written);
}
lc_status tb_put_tstr(tbuffer *buffer, uint32_t offset, int add_nul, int length_word, int swap,
                      const tstring *string, uint32_t *out_written) {
    const char *text = string ? string->buffer : "";
    return tb_put_str(buffer, offset, add_nul, length_word, swap, text, string ? string->length : 0,
                      out_written);
}
lc_status tb_append_tstr(tbuffer *buffer, int add_nul, int length_word, int swap, const tstring *string) {
    CHECK_NULL(buffer);
    return tb_put_tstr(buffer, buffer->length, add_nul, length_word, swap, string, nullptr);
}
lc_status tb_put_tstr_array(tbuffer *buffer, uint32_t offset, int add_nul, int swap, const tstr_array *array,
                            uint32_t *out_written) {
    if (out_written)
        *out_written = 0;
    const uint32_t count = tstr_array_length_quick(array);
    CHECK_STATUS(tb_put_uint32(buffer, offset, swap_if(count, swap)));
    uint32_t at = offset + 4;
    for (uint32_t i = 0; i < count; i++) {
        uint32_t written = 0;
        CHECK_STATUS(tb_put_tstr(buffer, at, add_nul, 1, swap, tstr_array_get_quick(array, i), &written));
        at += written;
    }
    if (out_written)
        *out_written = at - offset;
    return LC_OK;
}
lc_status tb_append_tstr_array(tbuffer *buffer, int add_nul, int swap, const tstr_array *array) {
    CHECK_NULL(buffer);
    return tb_put_tstr_array(buffer, buffer->length, add_nul, swap, array, nullptr);
}

namespace {

// The position and length of the text in the buffer, without its NUL. `out_used` counts from `offset`.
lc_status find_counted_text(const tbuffer *buffer, uint32_t offset, int32_t length, int expect_nul,
                            int length_word, int swap, uint32_t *out_start, uint32_t *out_length,
                            uint32_t *out_used) {
    CHECK_NULL(buffer);
    uint32_t start = offset, counted;
    if (length_word) {
        CHECK_STATUS(tb_get_uint32(buffer, offset, &counted));
        counted = swap_if(counted, swap);
        start += 4;
    } else {
        CHECK_CONDITION(offset <= buffer->length);
        counted = length < 0 ? buffer->length - offset : static_cast<uint32_t>(length);
    }
    // Compared without an addition, which could overflow.
    if (start > buffer->length || counted > buffer->length - start)
        FAIL_WITH(LC_NO_BUFFER_SPACE);
    if (expect_nul)
        CHECK_CONDITION(counted > 0 && buffer->buffer[start + counted - 1] == 0);
    *out_start = start;
    *out_length = counted - (expect_nul ? 1 : 0);
    if (out_used)
        *out_used = start + counted - offset;
    return LC_OK;
}

} // namespace

lc_status tb_get_str(const tbuffer *buffer, uint32_t offset, int32_t length, int expect_nul, int length_word,
                     int swap, char **out_text, uint32_t *out_length, uint32_t *out_used) {
    CHECK_NULL(out_text);
    *out_text = nullptr;
    uint32_t start = 0, bytes = 0;
    CHECK_STATUS(
        find_counted_text(buffer, offset, length, expect_nul, length_word, swap, &start, &bytes, out_used));
    auto *text = static_cast<char *>(malloc(size_t{bytes} + 1));
    CHECK_NULL(text);
    memcpy(text, buffer->buffer + start, bytes);
    text[bytes] = 0;
    *out_text = text;
    if (out_length)
        *out_length = bytes;
    return LC_OK;
}
lc_status tb_get_tstr(const tbuffer *buffer, uint32_t offset, int32_t length, int expect_nul, int length_word,
                      int swap, tstring **out, uint32_t *out_used) {
    CHECK_NULL(out);
    *out = nullptr;
    owned_text text;
    uint32_t bytes = 0;
    CHECK_STATUS(
        tb_get_str(buffer, offset, length, expect_nul, length_word, swap, &text.pointer, &bytes, out_used));
    CHECK_STATUS(ts_new_str_takeover(out, &text.pointer, static_cast<int32_t>(bytes), -1));
    return LC_OK;
}
lc_status tb_get_tstr_array(const tbuffer *buffer, uint32_t offset, int expect_nul, int swap,
                            tstr_array **out, uint32_t *out_used) {
    CHECK_NULL(out);
    *out = nullptr;
    uint32_t count = 0;
    CHECK_STATUS(tb_get_uint32(buffer, offset, &count));
    count = swap_if(count, swap);
    uint32_t at = offset + 4;
    if (count > (buffer->length - at) / 4) // each string has a length word
        FAIL_WITH(LC_NO_BUFFER_SPACE);
    owned<tstr_array, tstr_array_release> array;
    CHECK_STATUS(tstr_array_new(&array.pointer, nullptr));
    for (uint32_t i = 0; i < count; i++) {
        owned<tstring, ts_release> string;
        uint32_t used = 0;
        CHECK_STATUS(tb_get_tstr(buffer, at, -1, expect_nul, 1, swap, &string.pointer, &used));
        CHECK_STATUS(tstr_array_append_takeover(array.pointer, &string.pointer));
        at += used;
    }
    *out = array.take();
    if (out_used)
        *out_used = at - offset;
    return LC_OK;
}
