// Reads and writes on non-blocking descriptors, as sessions want them.
#pragma once

#include <cstdint>

#include <sys/types.h>

#include "runtime/common.h"

// Bytes read, until `count` have come; -1 for an error. EAGAIN ends it with what it has; end of file,
// ECONNRESET and EBADF as well, with `out_closed` set.
int64_t lf_read_bytes_closed(int fd, void *buffer, uint64_t count, int *out_closed);
// 0 when all went, 14015 for EAGAIN, 14016 for EPIPE, else 14014; `out_written` has what was written in every
// case. A negative `count` takes the text's length.
lc_status lf_write_bytes(int fd, const void *bytes, int64_t count, uint64_t *out_written);
int lf_is_writable(int fd);
lc_status lf_set_nonblocking(int fd, int on);
lc_status lf_get_file_owner(const char *path, uid_t *out_uid, gid_t *out_gid);
