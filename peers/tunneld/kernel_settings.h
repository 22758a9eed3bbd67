// Settings of interfaces, below /proc/sys/net/ipv4/conf. What was there before is kept in a state file, so
// that the next tunneld can bring it back when this one is killed.
#pragma once

#include <string>
#include <vector>

#include "peers/tunneld/wanted_state.h"

// Writes what differs. Where one of `all` is lowered, each other interface (and `default`) is raised to what
// `all` had, since the larger of the two counted for it. Goes on after a failure and gives the first one.
bool apply_settings(const std::vector<wanted_setting> &wanted, std::string *out_error);
// Brings back what is no longer wanted, unless somebody else has changed it since, and removes the file with
// the last of them.
bool restore_settings(const std::vector<wanted_setting> &wanted, std::string *out_error);

// IPv6 is of no use on a link: its own packets would go to the router.
void disable_ipv6(const std::string &interface);
