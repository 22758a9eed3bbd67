// TUN devices that outlive the process: what is written comes in by the interface, what is routed out there
// is read. Both with a virtio header before each packet, and large ones where the kernel has them.
#pragma once

#include <cstdint>
#include <string>

struct tun_device {
    int fd = -1; // non-blocking; the owner closes it
    uint32_t index = 0;
    bool takes_large_udp = false;
};

// Whether such devices can be made here.
bool tun_probe(std::string *out_why_not);
// Makes the device or takes over one of that name, which keeps its index.
bool tun_open(const std::string &name, tun_device *out, std::string *out_error);
// Removes the interface, of whatever kind it is. One that isn't there is removed already.
bool remove_interface(const std::string &name, std::string *out_error);
