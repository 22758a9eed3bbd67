// The configuration file. It is read at the start and by SIGHUP, and written at each commit.
#pragma once

#include <optional>
#include <string>

#include "peers/nodes/config_text.h"

struct config_file {
    std::string path;                // "": the configuration is in memory only
    std::optional<std::string> seen; // the content when mgmtd last read or wrote it; none: there was no file
};
// A file that does not exist gives an empty tree. False when there are errors.
bool config_load(config_file *file, config_text *out);
// Replaces the file in one step, with mode 0600 because it contains passwords. False with the reason, also
// when the file was edited since mgmtd has seen it, and when reading the new text would not give the same
// configuration.
bool config_save(config_file *file, const node_tree &tree, const config_comments &comments,
                 std::string *out_reason);
// Removes the rights of group and others. Returns a line for the log, or "" if there was nothing to remove.
std::string config_protect(const std::string &path);
