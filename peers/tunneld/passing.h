// Selects the packets that the data plane `user` passes on to another appliance by the bucket in their
// redirect header: TCP packets that do not begin a flow. The kernel decides whether this host has their flow
// after all: they are written to an interface of kind `passing`, whose rules look for a socket first.
#pragma once

#include <bitset>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "peers/tunneld/gre.h"
#include "peers/tunneld/plane.h"

// A passing_group in a form that is fast to look up for each packet.
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
// The member that the packet is passed on to, or 0. `out_local`: this host's end of the link to it.
uint32_t find_passing_member(const passing_lookup &lookup, const gre_content &content, uint32_t *out_local);

// Between the table and the lines of a file. Lines that cannot be read are left out.
std::string passing_file_text(const passing_table &table);
passing_table read_passing_file(const std::string &text);
