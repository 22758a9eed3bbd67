// Reading and writing on non-blocking descriptors. No lock.
#pragma once

#include <cstdint>

#include <sys/types.h>

#include "runtime/common.h"

// Reads up to `count` bytes and returns their number, or -1 for an error (errno). It ends early at EAGAIN,
// and at end of file, ECONNRESET and EBADF, for which it sets `out_closed`.
int64_t lf_read_bytes_closed(int fd, void *buffer, uint64_t count, int *out_closed);
// Writes `count` bytes, or strlen(bytes) for a negative count. LC_IO_WOULD_BLOCK for EAGAIN, LC_IO_CLOSED for
// EPIPE, LC_IO_ERROR for any other error, none of them logged; `out_written` is always the number of bytes
// written.
lc_status lf_write_bytes(int fd, const void *bytes, int64_t count, uint64_t *out_written);
int lf_is_writable(int fd); // 1 or 0, without waiting
lc_status lf_set_nonblocking(int fd, int on);
// LC_FILE_NOT_FOUND, not logged. The outs may be null.
lc_status lf_get_file_owner(const char *path, uid_t *out_uid, gid_t *out_gid);
