// Passwords, which are shown as eight stars: in nodes, and in the dumps of groups that wccpd answers with.
#pragma once

#include <map>
#include <string>

#include "peers/nodes/schema.h"

constexpr const char *HIDDEN = "********";

bool is_secret(const node_name &name);
// The value of a node with its passwords hidden, if it has any. An empty password is none.
std::string hidden_value(const std::string &name, const std::string &value);
void hide_secrets(std::map<node_name, std::string> *inout);
