// Finds tunneld's objects in the kernel by their marks, compares them with the wanted state, and changes
// those that differ.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "peers/tunneld/wanted_state.h"

// The existing interfaces whose alias says that a tunneld has made them: this one or an earlier one.
std::vector<wanted_link> find_own_links();

// Brings the kernel to the wanted state: links first, then routes and rules, the sorting rules last; objects
// that are no longer wanted are removed in the opposite order. Continues after a failure and returns the
// first one; the next call tries the rest again. `out_indices`: interface indices of the existing links.
bool reconcile_kernel_state(const data_plane &plane, const wanted_state &wanted,
                            std::map<std::string, uint32_t> *out_indices, std::string *out_error);
// For the time before the configuration is known: adds and removes only links with their own routes and
// rules. The sorting rules, settings and other routes of an earlier tunneld stay.
bool reconcile_kernel_links(const data_plane &plane, const wanted_state &wanted,
                            std::map<std::string, uint32_t> *out_indices, std::string *out_error);
// Whether an earlier tunneld has left rules that route packets.
bool is_kernel_state_left();
// Removes everything that this or an earlier tunneld has made, and restores the settings.
bool remove_kernel_state(const data_plane &plane, std::string *out_error);
