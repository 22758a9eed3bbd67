// The configuration file: read at start, written after each commit.
#pragma once

#include <map>
#include <string>

#include "peers/mgmtd/node_tree.h"

// What the file holds beside values: comment lines, each kept with the node or the section that it stands
// in front of, under "" at the end of the file.
struct config_comments {
    std::map<std::string, std::string> before;
};

// Every bad line is told, as "FILE:LINE: reason"; the tree is whole only when there is none.
bool config_parse(const std::string &content, const std::string &file, node_tree *out_tree,
                  config_comments *out_comments, std::string *out_errors);
std::string config_format(const node_tree &tree, const config_comments &comments);

// A file that doesn't exist gives an empty tree.
bool config_load(const std::string &file, node_tree *out_tree, config_comments *out_comments,
                 std::string *out_errors);
// The file is replaced in one step, readable by its owner only: it holds passwords.
bool config_save(const std::string &file, const node_tree &tree, const config_comments &comments,
                 std::string *out_error);
