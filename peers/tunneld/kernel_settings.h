// Settings of interfaces, below /proc/sys/net/ipv4/conf. The previous values are kept in a state file, so
// that the next tunneld can restore them when this one is killed.
#pragma once

#include <string>
#include <vector>

#include "peers/tunneld/wanted_state.h"

// Writes the settings that differ. Where a setting of `all` is lowered, the other interfaces and `default`
// are raised to the old value of `all`: for an interface, the larger of its own value and that of `all`
// counts. Continues after a failure and returns the first one.
bool apply_settings(const std::vector<wanted_setting> &wanted, std::string *out_error);
// Restores the settings that are no longer wanted, except those that somebody else has changed since. Removes
// the state file when nothing is left in it.
bool restore_settings(const std::vector<wanted_setting> &wanted, std::string *out_error);

// Tunnels carry IPv4 only, and without this the kernel's own IPv6 packets would go out by the link.
void disable_ipv6(const std::string &interface);
