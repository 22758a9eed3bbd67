// The names and aliases of tunneld's interfaces.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "peers/tunneld/plane.h"

// Between a link's number and the name of its interface, "wccp7". link_number() returns nothing for any other
// name, and for a number above 65535.
std::string link_name(uint32_t number);
std::optional<uint32_t> link_number(const std::string &name);

// Between a link and the alias of its interface, "tunneld 3 10.0.0.101 10.0.0.1 accepted". parse_link_alias()
// returns nothing for any other text.
std::string link_alias(const link_wish &wish);
std::optional<link_wish> parse_link_alias(const std::string &alias);

// Whether an operator's text can be an interface name, and can safely be part of a path and of a rule.
bool is_interface_name(const std::string &name);

std::string address_text(uint32_t host_order);
