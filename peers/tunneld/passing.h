// Packets that the user-space plane passes on by the bucket in their redirect header: of TCP, without
// starting a flow. Whether this host has their flow after all, the kernel says: they are given to it by an
// interface of their own.
#pragma once

#include <bitset>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "peers/tunneld/gre.h"
#include "peers/tunneld/plane.h"

// The same, as it is looked up for each packet.
struct passing_service {
    uint32_t local;
    bool by_source_port;
    std::bitset<65536> ports;
    uint32_t members[256];
};
struct passing_lookup {
    std::unique_ptr<passing_service> services[256];
    bool any = false;
};
void fill_passing_lookup(const passing_table &table, passing_lookup *out);
// The member that gets the packet, or 0, and this host's end of the link.
uint32_t find_passing_member(const passing_lookup &lookup, const gre_content &content, uint32_t *out_local);

// The table as lines for a file, and back. What cannot be read is left out.
std::string passing_file_text(const passing_table &table);
passing_table read_passing_file(const std::string &text);
