// File operations of the platform.
#pragma once

#include <cstdint>

#include <sys/types.h>

#include "runtime/common.h"

// The directory of `path` exists afterwards, made with `mode` where it was missing.
lc_status lf_ensure_dir_of_file(const char *path, mode_t mode);
// The file holds exactly these bytes with exactly this mode. A symbolic link, a file that is not regular or
// one with more than one link is refused. `overwrite` 0 refuses an existing file.
lc_status lf_write_file(const char *path, mode_t mode, const char *bytes, int overwrite, uint32_t count);
