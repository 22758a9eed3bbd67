// Finds, marks, brings up and removes tunneld's interfaces in the kernel. Functions that return an int return
// 0 or an errno.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "peers/tunneld/plane.h"

struct gre_ends {                   // ends and options of a GRE link
    uint32_t local = 0, remote = 0; // host order
    uint16_t flags_in = 0, flags_out = 0;
    uint8_t ttl = 0, path_mtu = 0, ignore_df = 0;
    bool operator==(const gre_ends &) const = default;
};
struct found_link {
    int index = 0;
    std::string name, kind, alias; // kind: "gre" or "tun"
    uint32_t group = 0, mtu = 0;
    bool is_up = false;
    std::optional<link_wish> wish; // from the alias
    gre_ends gre;
    link_counters counters; // 0 unless requested
};

// Lists the GRE and TUN interfaces that have a name or the group of tunneld's.
int find_links(bool with_counters, std::vector<found_link> *out);

// Sets group, alias and MTU.
int mark_link(int index, const link_wish &wish);
int bring_link_up(int index);
int remove_link(int index); // 0 also when it is already gone

// Makes a GRE link with the options of wanted_gre(), in tunneld's interface group.
int make_gre_link(const std::string &name, uint32_t local, uint32_t remote);
gre_ends wanted_gre(uint32_t local, uint32_t remote);
