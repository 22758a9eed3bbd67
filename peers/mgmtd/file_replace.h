// Reads whole files, and replaces files in one step: a reader finds the old content or the new one, and so
// does the next start after a loss of power.
#pragma once

#include <functional>
#include <optional>
#include <string>

#include <sys/types.h>

// `out` has no value when the file does not exist. False with the reason; files of more than 16 MiB, and
// anything but regular files, are refused.
bool read_whole_file(const std::string &path, std::optional<std::string> *out, std::string *out_reason);

// Called before the old file is replaced, with the new content as read back from the file system. False with
// the reason keeps the old file.
using accept_file = std::function<bool(const std::string &written, std::string *out_reason)>;
// If `path` is a symbolic link, its target is replaced or created. `accept` may be null. False with the
// reason.
bool replace_file(const std::string &path, const std::string &content, mode_t mode, const accept_file &accept,
                  std::string *out_reason);
// Renames a file within its directory and syncs the directory. False with errno.
bool rename_file(const std::string &from, const std::string &to);
// Removes the file that an interrupted replacement has left. True if there was one.
bool remove_unfinished_file(const std::string &path);
