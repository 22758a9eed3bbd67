// A file that is replaced as a whole, or not at all.
#pragma once

#include <string>

// Writes a new file beside `path`, syncs it and renames it over `path`; a path that is a link stays one. The
// permissions are those of the old file, or as for any new file. False with the reason: the old file is as it
// was. Anything but a regular file is refused, because a device would be replaced by a file.
bool write_page_file(const std::string &path, const std::string &content, std::string *out_reason);
