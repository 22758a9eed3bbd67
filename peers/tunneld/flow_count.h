// The number of flows that each proxy has: transparent TCP connections, counted from the kernel's sockets.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "peers/tunneld/view.h"

// The ends of a connection as this host's socket has them. Addresses and ports in host order.
struct flow_ends {
    uint32_t local, remote;
    uint16_t local_port, remote_port;
    bool operator==(const flow_ends &) const = default;
};
constexpr size_t FLOWS_MAX = 1'000'000; // further ones are not counted

// Lists the connections whose local address is not this host's, without ended ones that no packet can use any
// more. `own_addresses` is sorted. Takes about 1 ms for 5000 sockets of the host. False: the kernel has not
// answered; the error is one line.
bool read_transparent_flows(const std::vector<uint32_t> &own_addresses, std::vector<flow_ends> *out,
                            std::string *out_error);
// The number of flows by group, for intercepts of TCP. A port in the intercepts of several groups counts for
// each of them.
std::map<uint8_t, uint32_t> count_flows(const std::vector<flow_ends> &flows,
                                        const std::map<uint8_t, intercept> &intercepts);
