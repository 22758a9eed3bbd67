// Hides passwords, in nodes and in the dumps of wccpd: eight stars are shown instead.
#pragma once

#include <map>
#include <string>

#include "peers/nodes/schema.h"

constexpr const char *HIDDEN = "********";

bool is_secret(const node_name &name);
// The value of a node with its passwords hidden. An empty password stays empty.
std::string hidden_value(const std::string &name, const std::string &value);
void hide_secrets(std::map<node_name, std::string> *inout);
