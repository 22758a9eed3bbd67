// The configuration file: read at start, written at each commit.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "peers/mgmtd/node_tree.h"

// What the file holds besides values: comment lines, each kept with the node or the section that it precedes,
// under "" at the end of the file.
struct config_comments {
    std::map<std::string, std::string> before;
};

// The content of a file.
struct config_text {
    node_tree tree; // whole only when there are no errors
    config_comments comments;
    std::map<node_name, int> lines; // where a node is set, or an instance made by its section
    std::string errors;             // each as "FILE:LINE: reason", with a newline
};
// False when there are errors. `file` is its name in them.
bool config_parse(const std::string &content, const std::string &file, config_text *out);
std::string config_format(const node_tree &tree, const config_comments &comments);
// "FILE:LINE: REASON" and a newline. A reason begins with the node that it is about, and ": ".
std::string config_complaint(const std::string &file, const std::map<node_name, int> &lines,
                             const std::string &reason);

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
