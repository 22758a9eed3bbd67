#include "peers/mgmtd/router_addresses.h"

#include <memory>

#include <arpa/inet.h>
#include <ifaddrs.h>

#include "mgmt/node_paths.h"

namespace {

uint32_t read_host_order(const sockaddr *address) {
    return ntohl(reinterpret_cast<const sockaddr_in *>(address)->sin_addr.s_addr);
}

} // namespace

std::vector<local_address> find_local_addresses() {
    std::vector<local_address> out;
    ifaddrs *first = nullptr;
    if (getifaddrs(&first) != 0)
        return out;
    const std::unique_ptr<ifaddrs, void (*)(ifaddrs *)> held(first, freeifaddrs);
    for (const ifaddrs *at = first; at; at = at->ifa_next) {
        // An interface without an address has a null pointer.
        if (!at->ifa_addr || at->ifa_addr->sa_family != AF_INET)
            continue;
        const uint32_t address = read_host_order(at->ifa_addr);
        // A network of one or two addresses (/32, /31) has no broadcast address.
        const uint32_t hosts = at->ifa_netmask ? ~read_host_order(at->ifa_netmask) : 0;
        out.push_back({address, hosts > 1 ? address | hosts : 0});
    }
    return out;
}

namespace {

bool is_multicast(uint32_t address) {
    return address >> 28 == 0xe;
}

// The reason why the address cannot belong to a router; null: it can.
const char *find_fault(uint32_t address, size_t routers, const std::vector<local_address> &local) {
    // The routers of a multicast group are known from their answers; the one address stands for all of them.
    if (is_multicast(address))
        return routers > 1 ? "is a multicast address, which must be the only router of its group" : nullptr;
    if (address >> 24 == 127)
        return "is a loopback address; give the address of the router";
    // 240.0.0.0/4, with 255.255.255.255.
    if (address >> 24 == 0 || address >> 28 == 0xf)
        return "is a broadcast or reserved address; give the address of the router";
    for (const local_address &own : local) {
        if (address == own.address)
            return "is an address of this appliance; give the address of the router";
        if (own.broadcast && address == own.broadcast)
            return "is the broadcast address of a network of this appliance; give the address of the router";
    }
    return nullptr;
}

node_list collect_routers(const node_tree &tree, const node_name &group) {
    node_list out;
    // The leaves are the addresses; the numbers of the routers don't matter here.
    collect_nodes(tree.nodes, group.below("router"), {true, false, true}, &out);
    return out;
}

bool are_same_routers(const node_list &a, const node_list &b) {
    if (a.size() != b.size())
        return false;
    for (size_t i = 0; i < a.size(); i++)
        if (*a[i] != *b[i])
            return false;
    return true;
}

} // namespace

std::vector<std::string> find_bad_routers(const node_tree &tree, const node_tree *before,
                                          const std::vector<local_address> &local) {
    static const node_name groups = parsed_name(NODE_GROUP_CONFIG);
    std::vector<std::string> out;
    node_list roots;
    collect_nodes(tree.nodes, groups, {false, false, false}, &roots);
    for (const auto *root : roots) {
        const node_list routers = collect_routers(tree, root->first);
        // A group that the change doesn't touch must not prevent it, even if its routers have become bad
        // meanwhile.
        if (before && are_same_routers(routers, collect_routers(*before, root->first)))
            continue;
        for (const auto *router : routers) {
            in_addr address = {};
            // Can't fail: the value has the type of an address.
            (void)inet_pton(AF_INET, router->second.text.c_str(), &address);
            if (const char *fault = find_fault(ntohl(address.s_addr), routers.size(), local))
                out.push_back(router->first.text() + ": " + router->second.text + " " + fault);
        }
    }
    return out;
}
