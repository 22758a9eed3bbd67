// Flows that proxies have: transparent TCP connections of this host, counted from the kernel's sockets.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "peers/tunneld/view.h"

// A connection, as the socket of this host has it. Addresses in host order.
struct flow_ends {
    uint32_t local, remote;
    uint16_t local_port, remote_port;
    bool operator==(const flow_ends &) const = default;
};
constexpr size_t FLOWS_MAX = 1'000'000; // that are read; further ones are not counted

// Connections in the name of addresses that are not this host's. Ended ones that nobody can send by any more
// are left out. Costs about 1 ms for 5000 sockets of the host. False: the kernel has not answered, one line.
bool read_transparent_flows(const std::vector<uint32_t> &own_addresses, std::vector<flow_ends> *out,
                            std::string *out_error);
// By group, for the intercepts of TCP. A port that several groups want counts for each of them.
std::map<uint8_t, uint32_t> count_flows(const std::vector<flow_ends> &flows,
                                        const std::map<uint8_t, intercept> &intercepts);
