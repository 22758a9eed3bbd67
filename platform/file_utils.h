// Safe file operations. On failure errno has the reason when they return. No lock; not cancellation points.
#pragma once

#include <cstdint>

#include <sys/types.h>

#include "runtime/common.h"

// Creates the directories above `path` that don't exist, with exactly this mode. Existing ones are not
// changed. LC_BAD_PATH if one of them isn't a directory.
lc_status lf_ensure_dir_of_file(const char *path, mode_t mode);
// Writes a file of exactly `count` bytes and this mode, or leaves an existing file unchanged. A symbolic
// link, a file that isn't regular and one with several links are LC_BAD_FILE. With `overwrite` 0 an existing
// file is LC_IO_FILE_EXISTS. LC_FILE_NOT_FOUND for a missing directory, LC_NO_SPACE, LC_IO_ERROR. The file is
// not synced to disk.
lc_status lf_write_file(const char *path, mode_t mode, const char *bytes, int overwrite, uint32_t count);
