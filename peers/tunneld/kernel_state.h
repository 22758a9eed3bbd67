// The kernel's side of what is wanted: found by its marks, compared, and changed where it differs.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "peers/tunneld/wanted_state.h"

// Interfaces of ours that are there, whoever made them, by the alias that they carry.
std::vector<wanted_link> find_own_links();

// Brings the kernel to what is wanted, links first, then rules, routes and settings, sorting rules last; what
// is no longer wanted goes in the opposite order. Goes on after a failure and gives the first one: what could
// be done is done, and the next call tries the rest again. `out_indices`: interface indices of the links that
// are there.
bool reconcile_kernel_state(const data_plane &plane, const wanted_state &wanted,
                            std::map<std::string, uint32_t> *out_indices, std::string *out_error);
// Before the configuration is known: links, with the routes and rules of their own, come and go with their
// tunnels. What sorts packets stays as an earlier tunneld has left it, and so do its settings and routes.
bool reconcile_kernel_links(const data_plane &plane, const wanted_state &wanted,
                            std::map<std::string, uint32_t> *out_indices, std::string *out_error);
// Whether an earlier tunneld has left anything that routes packets.
bool is_kernel_state_left();
// Everything of ours goes, and settings are as they were before. Also what an earlier tunneld has left.
bool remove_kernel_state(const data_plane &plane, std::string *out_error);
