// The data planes, behind one table of functions. Both give each tunnel a network interface of its own: what
// the router sends through the tunnel comes in there without its outer headers, and what is routed out there
// goes to the router in GRE. Rules and routes are the same for both.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "peers/tunneld/view.h"

constexpr uint32_t LINK_GROUP = 2048; // of all interfaces that are ours (IFLA_GROUP)
constexpr uint32_t LINK_MTU = 1500;

// What an interface carries.
enum class link_kind : uint8_t {
    tunnel,   // to and from a router
    accepted, // beside a tunnel, for a further source
    member,   // to and from another appliance: packets of its flows, and of ours
    passing,  // nothing to anybody: by it the kernel gets packets that are the member's unless it has their
              // flow
};
// One interface. What it is for is kept in its alias, so that the next tunneld knows it again.
struct link_wish {
    uint16_t tunnel_id;     // 0 for members
    uint32_t local, remote; // host order
    link_kind kind = link_kind::tunnel;
    auto operator<=>(const link_wish &) const = default;
};

// Why packets are refused, by the order of the table `refusals`.
enum refusal : uint8_t {
    REFUSED_SOURCE,   // from no router of ours
    REFUSED_FLAGS,    // GRE flags or version that are not for us
    REFUSED_CHECKSUM, // of the GRE header
    REFUSED_PROTOCOL, // carries something else
    REFUSED_LENGTH,   // a length that the packet does not have
    REFUSED_INNER,    // what it carries is no valid IPv4 packet
    REFUSED_ROOM,     // no room on the way in or out
    REFUSALS
};
extern const char *const refusal_words[REFUSALS]; // "source", "flags", ...

struct link_counters {
    uint64_t packets_in = 0, bytes_in = 0;   // carried packets, without outer headers
    uint64_t packets_out = 0, bytes_out = 0; // given back to the router
    uint64_t redirect_headers = 0;           // packets that came in with one (user-space plane)
    uint64_t fragments = 0;                  // of outer packets, that came in
    uint64_t refused[REFUSALS] = {};
};
struct plane_counters {
    std::map<std::string, link_counters> links;   // by interface name
    std::map<uint32_t, uint64_t> refused_sources; // by address, host order; REFUSED_SOURCES_MAX
    uint64_t refused[REFUSALS] = {};              // that belong to no link
};

// Packets that are passed on by the bucket in their redirect header, by service group.
struct passing_group {
    uint32_t local = 0;            // this host's end of the links to the members
    bool by_source_port = false;   // the ports are those of the sender
    std::vector<port_range> ports; // that are passed on; none: all
    std::vector<uint32_t> members; // by bucket: who gets its packets, or 0
    bool operator==(const passing_group &) const = default;
};
using passing_table = std::map<uint8_t, passing_group>;

struct data_plane {
    const char *name;
    // Whether the kernel can do it; the reason why not is for the operator.
    bool (*probe)(std::string *out_why_not);
    bool (*open)(std::string *out_error);
    // Stops carrying packets and releases what the process holds. The interfaces stay.
    void (*close)();
    // Makes the interface, or takes over one of that name. Gives its index. Group, alias, MTU and addresses
    // are set by the caller afterwards.
    bool (*make_link)(const std::string &name, const link_wish &wish, uint32_t *out_index,
                      std::string *out_error);
    bool (*drop_link)(const std::string &name, std::string *out_error);
    void (*read_counters)(plane_counters *inout);
    // What is passed on by the bucket in its redirect header, from now on. Null where the plane cannot see
    // it.
    void (*set_passing)(const passing_table &table) = nullptr;
};
extern const data_plane kernel_plane; // GRE links of the kernel
extern const data_plane user_plane;   // a packet ring and a TUN device for each tunnel
extern const data_plane table_plane;  // carries nothing: a table of tunnels, for tests
// In the order in which they are tried.
extern const data_plane *const data_planes[3];

// The options of the user-space plane, set before open().
struct user_plane_options {
    bool redirect_header = false; // returned packets carry the redirect header, as type 0x883E
};
extern user_plane_options user_plane_settings;
