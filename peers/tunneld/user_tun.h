// TUN devices that outlive the process. A packet that is written arrives at the interface; a packet that is
// routed out of the interface is read. Each has a virtio header before it and can be a large one of several
// segments.
#pragma once

#include <cstdint>
#include <string>

struct tun_device {
    int fd = -1; // non-blocking; closed by the owner of this struct
    uint32_t index = 0;
    bool takes_large_udp = false;
};

// Whether the kernel has such devices.
bool tun_probe(std::string *out_why_not);
// Makes the device, or opens an existing one of this name, which keeps its index.
bool tun_open(const std::string &name, tun_device *out, std::string *out_error);
// Removes the interface, of whatever kind it is. True also when there is none.
bool remove_interface(const std::string &name, std::string *out_error);
