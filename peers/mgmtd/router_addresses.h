// Finds configured router addresses that cannot belong to a router.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "peers/nodes/node_tree.h"

// An IPv4 address of this machine and the broadcast address of its network, in host order.
struct local_address {
    uint32_t address, broadcast; // 0: the network has no broadcast address
};
std::vector<local_address> find_local_addresses();

// One reason for each such address, which begins with the name of the node and ": ". With `before`, only
// groups whose routers differ from those in `before` are checked.
std::vector<std::string> find_bad_routers(const node_tree &tree, const node_tree *before,
                                          const std::vector<local_address> &local);
