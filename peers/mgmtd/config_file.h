// The configuration file: read at start, written at each commit.
#pragma once

#include <optional>
#include <string>

#include "peers/nodes/config_text.h"

// A file as mgmtd has seen it, so that it notices when somebody else has changed it.
struct config_file {
    std::string path;                // "" keeps the configuration in memory only
    std::optional<std::string> seen; // as it was last read or written; none: there was no file
};
// A file that doesn't exist gives an empty tree. False when there are errors.
bool config_load(config_file *file, config_text *out);
// The file is replaced in one step, readable by its owner only, since it holds passwords. Refused, with the
// reason, when it does not hold what was seen of it, or when what was written would not be read the same.
bool config_save(config_file *file, const node_tree &tree, const config_comments &comments,
                 std::string *out_reason);
// Takes the rights of everybody but the owner away. What there is to report of it, or "".
std::string config_protect(const std::string &path);
