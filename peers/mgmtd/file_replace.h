// Whole files: read, and replaced in one step, so that a reader, or a loss of power, finds the old one or the
// new one.
#pragma once

#include <functional>
#include <optional>
#include <string>

#include <sys/types.h>

// No value when there is no such file. False with the reason, also for a file of more than 16 MiB and for
// anything but a regular file.
bool read_whole_file(const std::string &path, std::optional<std::string> *out, std::string *out_reason);

// Asked before the old file is replaced, with what the file system gives back of the new one. False, with the
// reason, keeps the old one.
using accept_file = std::function<bool(const std::string &written, std::string *out_reason)>;
// A path that is a link stays one: its target is replaced, or created.
bool replace_file(const std::string &path, const std::string &content, mode_t mode, const accept_file &accept,
                  std::string *out_reason);
// Renames a file within its directory, and syncs that. False with errno.
bool rename_file(const std::string &from, const std::string &to);
// Removes what a replacement that was killed has left. True when there was something.
bool remove_unfinished_file(const std::string &path);
