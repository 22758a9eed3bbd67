// Whole configurations: read from a file that a person wrote, compared, and turned into the items of one
// commit.
#pragma once

#include <string>
#include <vector>

#include "peers/mgmtctl/nodes.h"
#include "peers/mgmtctl/render.h"
#include "peers/nodes/config_text.h"

// A configuration in mgmtd's format, or as a JSON object of values by the names of their nodes. A hidden
// password keeps its value of `present`. With `merge`, the nodes that it does not name keep theirs, too.
// False with the errors, one in a line.
bool read_config(const std::string &content, const std::string &file, const node_tree &present, bool merge,
                 node_tree *out, std::string *out_errors);

// The changes from one to the other that an operator wants to see: without the defaults of a group that is
// added or deleted.
std::vector<node_change> config_changes(const node_tree &before, const node_tree &after);
std::vector<ctl_change_item> items_of(const std::vector<node_change> &changes, const node_tree &after);
// How the commit affects running groups.
change_notes config_notes(const std::vector<ctl_change_item> &items, const node_tree &before);

std::string text_change(const node_change &change, bool secrets);
ctl_json json_change(const node_change &change, bool secrets);

// The formats that read_config reads.
std::string export_text(const config_text &config, bool secrets);
ctl_json export_json(const node_tree &tree, bool secrets);
