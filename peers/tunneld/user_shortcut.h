// Loads the program of shortcut.bpf.c into the kernel and attaches it to the host's devices. The kernel
// detaches it when the process ends, in whatever way.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "peers/tunneld/shortcut_map.h"

struct bpf_object;
struct packet_shortcut {
    bpf_object *object = nullptr;    // null: there is no shortcut
    int program = -1, links = -1;    // descriptors that belong to `object`
    std::map<unsigned, int> devices; // a descriptor for each device that it is attached to, by index
};

// False when the kernel can't do it: it has to be 6.6 or later, and the process needs CAP_BPF.
bool shortcut_open(packet_shortcut *shortcut, std::string *out_why_not);
// The other functions do nothing without a shortcut.
void shortcut_close(packet_shortcut *shortcut);
// Attaches the program to all devices that have an IPv4 address, and forgets those that are gone.
void shortcut_follow_devices(packet_shortcut *shortcut);
// Addresses are in host order. Packets of a link that is not added, because there are too many, take the long
// way.
void shortcut_add_link(packet_shortcut *shortcut, uint32_t local, uint32_t remote, uint32_t index);
void shortcut_drop_link(packet_shortcut *shortcut, uint32_t local, uint32_t remote);
// What has taken the shortcut; nothing for an unknown link.
shortcut_link shortcut_count(const packet_shortcut &shortcut, uint32_t local, uint32_t remote);
