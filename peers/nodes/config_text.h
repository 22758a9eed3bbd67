// Reads and writes configurations as text, in the format of mgmtd's file.
#pragma once

#include <map>
#include <string>

#include "peers/nodes/node_tree.h"

// Comments that begin with this are notes of mgmtd itself, in the files of the history. They are ignored.
constexpr const char *CONFIG_NOTE = "#%";

// The comment lines of a file.
struct config_comments {
    std::map<std::string, std::string>
        before; // by the node, or "[section]", that they precede; "": at the end
};

struct config_text {
    node_tree tree; // complete only if there are no errors
    config_comments comments;
    std::map<node_name, int> lines; // where a node is set, or an instance made by its section
    std::string errors;             // "FILE:LINE: reason" and a newline for each
};
// False when there are errors, in which the file is named `file`. The second reads a part of a configuration,
// which is not checked as a whole.
bool config_parse(const std::string &content, const std::string &file, config_text *out);
bool config_parse_part(const std::string &content, const std::string &file, config_text *out);
std::string config_format(const node_tree &tree, const config_comments &comments);
// Returns "FILE:LINE: REASON" and a newline. The reason begins with the name of a node and ": ", which gives
// the line.
std::string config_complaint(const std::string &file, const std::map<node_name, int> &lines,
                             const std::string &reason);
