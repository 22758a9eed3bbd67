// A configuration as text, as mgmtd's file has it.
#pragma once

#include <map>
#include <string>

#include "peers/nodes/node_tree.h"

// A comment that begins so is a note of mgmtd's own about the file that it stands in, and is read over.
constexpr const char *CONFIG_NOTE = "#%";

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
// False when there are errors. `file` is its name in them. Part of a configuration, which only has to fit
// together with the rest, is read by the second.
bool config_parse(const std::string &content, const std::string &file, config_text *out);
bool config_parse_part(const std::string &content, const std::string &file, config_text *out);
std::string config_format(const node_tree &tree, const config_comments &comments);
// "FILE:LINE: REASON" and a newline. A reason begins with the node that it is about, and ": ".
std::string config_complaint(const std::string &file, const std::map<node_name, int> &lines,
                             const std::string &reason);
