// A growable buffer of bytes, for frames and binary values. A NUL follows the last byte. Readers check the
// length: a number that would end past it is LC_ASSERTION, a string LC_NO_BUFFER_SPACE. Offsets, lengths and
// sizes are in bytes. A null buffer is LC_NULL. Not locked: the owner's lock guards a buffer.
#pragma once

#include <cstdint>

#include "runtime/common.h"

struct tstring;
struct tstr_array;

constexpr uint32_t tb_size_initial = 128;
constexpr uint32_t tb_size_growth_factor = 4;
constexpr uint32_t tb_size_max = 0x10000000;
constexpr uint32_t tb_size_max_extra_growth = 0x800000;
constexpr uint32_t tb_size_chunk_size_mask = 0xfff;
constexpr uint32_t tb_size_shrink_threshold = 6;

struct tbuffer {
    uint8_t *buffer;
    uint32_t length;     // bytes in use
    uint32_t size;       // bytes allocated, without the one for the NUL
    uint8_t auto_shrink; // set by the owner: the buffer frees memory when it becomes shorter
    uint8_t constant;    // the bytes belong to somebody else; writers return LC_ASSERTION
    uint8_t placed;      // the record belongs to somebody else, see tb_place
};

lc_status tb_new(tbuffer **out);
lc_status tb_new_size(tbuffer **out, uint32_t size);
lc_status tb_new_buf(tbuffer **out, const void *bytes, int32_t length); // a copy; -1 means strlen
// Takes over memory of malloc(); on failure it stays the caller's.
lc_status tb_new_takeover(tbuffer **out, uint8_t **inout_bytes, uint32_t length, uint32_t size);
// A constant buffer over bytes that stay the caller's and must outlive it.
lc_status tb_new_buf_const(tbuffer **out, const void *bytes, uint32_t length);
// Initialises a constant buffer in a record and over bytes that both belong to the caller and must outlive
// it. A NUL follows the bytes. Freeing the buffer frees nothing.
inline void tb_place(tbuffer *record, uint8_t *bytes, uint32_t length) {
    *record = {bytes, length, length, 0, 1, 1};
}
lc_status tb_free(tbuffer **inout);
// Frees the record and gives the bytes to the caller, who frees them with free().
lc_status tb_detach(tbuffer **inout, uint8_t **out_bytes, uint32_t *out_length);
lc_status tb_dup(const tbuffer *buffer, tbuffer **out);

int32_t tb_length(const tbuffer *buffer); // -1 for null
uint32_t tb_size(const tbuffer *buffer);
uint32_t tb_avail(const tbuffer *buffer); // size minus length
// The bytes; valid until the buffer is changed. Null for a null buffer, which only the first one logs.
uint8_t *tb_buf(const tbuffer *buffer);
uint8_t *tb_buf_maybe(const tbuffer *buffer);
lc_status tb_ensure_size(tbuffer *buffer, uint32_t size);
// LC_GENERIC for more than the size. With these two a caller can fill the buffer by read(), for example.
lc_status tb_set_length(tbuffer *buffer, uint32_t length);
lc_status tb_clear(tbuffer *buffer);
// Moves up what follows. LC_NO_BUFFER_SPACE past the end.
lc_status tb_delete_bytes(tbuffer *buffer, uint32_t offset, uint32_t count);

// Overwrites or appends; a gap between the length and the offset is filled with zero bytes. `bytes` may be in
// the buffer itself unless the buffer has to grow.
lc_status tb_put_buf(tbuffer *buffer, uint32_t offset, const void *bytes, uint32_t count);
lc_status tb_append_buf(tbuffer *buffer, const void *bytes, uint32_t count);
// One number in host byte order: the caller converts it from and to network byte order.
lc_status tb_put_byte(tbuffer *buffer, uint32_t offset, uint8_t byte);
lc_status tb_put_uint8(tbuffer *buffer, uint32_t offset, uint8_t value);
lc_status tb_put_uint16(tbuffer *buffer, uint32_t offset, uint16_t value);
lc_status tb_put_uint32(tbuffer *buffer, uint32_t offset, uint32_t value);
lc_status tb_put_uint64(tbuffer *buffer, uint32_t offset, uint64_t value);
lc_status tb_append_uint8(tbuffer *buffer, uint8_t value);
lc_status tb_append_uint16(tbuffer *buffer, uint16_t value);
lc_status tb_append_uint32(tbuffer *buffer, uint32_t value);
lc_status tb_append_uint64(tbuffer *buffer, uint64_t value);
lc_status tb_get_uint8(const tbuffer *buffer, uint32_t offset, uint8_t *out);
lc_status tb_get_uint16(const tbuffer *buffer, uint32_t offset, uint16_t *out);
lc_status tb_get_uint32(const tbuffer *buffer, uint32_t offset, uint32_t *out);
lc_status tb_get_uint64(const tbuffer *buffer, uint32_t offset, uint64_t *out);
lc_status tb_get_uint128(const tbuffer *buffer, uint32_t offset, uint8_t out[16]);

// A string, with a NUL if `add_nul` is set, after an optional 4-byte length word (`length_word`), which
// counts that NUL and is in network byte order if `swap` is set. `length` -1 means strlen. Outs may be null;
// `out_written` and `out_used` count all of these bytes.
lc_status tb_put_str(tbuffer *buffer, uint32_t offset, int add_nul, int length_word, int swap,
                     const char *text, int32_t length, uint32_t *out_written);
lc_status tb_put_tstr(tbuffer *buffer, uint32_t offset, int add_nul, int length_word, int swap,
                      const tstring *string, uint32_t *out_written); // a null string: the empty one
lc_status tb_append_tstr(tbuffer *buffer, int add_nul, int length_word, int swap, const tstring *string);
// A 4-byte count, then each string with its length word.
lc_status tb_put_tstr_array(tbuffer *buffer, uint32_t offset, int add_nul, int swap, const tstr_array *array,
                            uint32_t *out_written);
lc_status tb_append_tstr_array(tbuffer *buffer, int add_nul, int swap, const tstr_array *array);
// Without a length word `length` is the number of bytes to read, -1 for all that follow. The result is the
// caller's.
lc_status tb_get_str(const tbuffer *buffer, uint32_t offset, int32_t length, int expect_nul, int length_word,
                     int swap, char **out_text, uint32_t *out_length, uint32_t *out_used);
lc_status tb_get_tstr(const tbuffer *buffer, uint32_t offset, int32_t length, int expect_nul, int length_word,
                      int swap, tstring **out, uint32_t *out_used);
lc_status tb_get_tstr_array(const tbuffer *buffer, uint32_t offset, int expect_nul, int swap,
                            tstr_array **out, uint32_t *out_used);

// For scope guards: owned<tbuffer, tb_release>.
inline void tb_release(tbuffer *buffer) {
    (void)tb_free(&buffer);
}
