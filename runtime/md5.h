// MD5 (RFC 1321) in streaming form, by libmd.
#pragma once

#include <cstddef>
#include <cstdint>

#include <md5.h>

using md5_state = MD5_CTX;
constexpr size_t MD5_DIGEST_BYTES = 16;

inline void md5_init(md5_state *state) {
    MD5Init(state);
}
inline void md5_append(md5_state *state, const void *bytes, size_t count) {
    MD5Update(state, static_cast<const uint8_t *>(bytes), count);
}
inline void md5_finish(md5_state *state, uint8_t digest[MD5_DIGEST_BYTES]) {
    MD5Final(digest, state);
}
