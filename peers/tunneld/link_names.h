// How links of ours are named and marked.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "peers/tunneld/plane.h"

// "wccp7", and back: nothing for any other name or a number above 65535.
std::string link_name(uint32_t number);
std::optional<uint32_t> link_number(const std::string &name);

// "tunneld 3 10.0.0.101 10.0.0.1 accepted", and back: nothing for any other text.
std::string link_alias(const link_wish &wish);
std::optional<link_wish> parse_link_alias(const std::string &alias);

// An interface that an operator may name: fit for a path below /proc/sys and for a rule.
bool is_interface_name(const std::string &name);

std::string address_text(uint32_t host_order);
