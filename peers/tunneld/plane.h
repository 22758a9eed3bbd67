// The data planes, as tables of functions. In both `kernel` and `user` each tunnel has a network interface of
// its own: packets that the router sends through the tunnel arrive there without their outer headers, and
// packets that are routed out of it are sent to the router in GRE. Rules and routes are therefore the same.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "peers/tunneld/view.h"

constexpr uint32_t LINK_GROUP = 2048; // IFLA_GROUP of all interfaces that tunneld makes
constexpr uint32_t LINK_MTU = 1500;

// The purpose of an interface.
enum class link_kind : uint8_t {
    tunnel,   // packets from and to a router
    accepted, // the same for an accepted source of a tunnel
    member,   // packets from and to another appliance, which pass flows on to each other
    passing,  // sends nothing: packets of a member's slots enter the kernel by it, to be passed on to the
              // member if they have no socket here
};
// An interface that is wanted. The interface's alias keeps all of this for the next tunneld.
struct link_wish {
    uint16_t tunnel_id;     // 0 for `member` and `passing`
    uint32_t local, remote; // host order
    link_kind kind = link_kind::tunnel;
    auto operator<=>(const link_wish &) const = default;
};

// Why packets are refused.
enum refusal : uint8_t {
    REFUSED_SOURCE,   // not from a router or an accepted source
    REFUSED_FLAGS,    // GRE flags or a version that are not supported
    REFUSED_CHECKSUM, // of the outer IP header or of GRE
    REFUSED_PROTOCOL, // does not carry IPv4
    REFUSED_LENGTH,   // a length field that is larger than the packet
    REFUSED_INNER,    // the inner packet is not valid IPv4
    REFUSED_ROOM,     // a queue was full
    REFUSALS
};
extern const char *const refusal_words[REFUSALS]; // "source", "flags", ...

struct link_counters {
    uint64_t packets_in = 0, bytes_in = 0;   // accepted packets, without outer headers
    uint64_t packets_out = 0, bytes_out = 0; // sent to the router
    uint64_t redirect_headers = 0;           // received packets that had one; only counted by `user`
    uint64_t fragments = 0;                  // received fragments of outer packets
    uint64_t refused[REFUSALS] = {};
};
struct plane_counters {
    std::map<std::string, link_counters> links;   // by interface name
    std::map<uint32_t, uint64_t> refused_sources; // by address, host order; REFUSED_SOURCES_MAX
    uint64_t refused[REFUSALS] = {};              // without those that belong to a link
};

// How packets of a service group are passed on by the bucket in their redirect header.
struct passing_group {
    uint32_t local = 0;            // this host's end of the links to the members
    bool by_source_port = false;   // `ports` are source ports, not destination ports
    std::vector<port_range> ports; // of packets that are passed on; empty: all
    std::vector<uint32_t> members; // by bucket: the member that gets the packets, or 0
    bool operator==(const passing_group &) const = default;
};
using passing_table = std::map<uint8_t, passing_group>;

struct data_plane {
    const char *name;
    // Whether the kernel supports this plane. `out_why_not` is shown to the operator.
    bool (*probe)(std::string *out_why_not);
    bool (*open)(std::string *out_error);
    // Stops carrying packets and releases what the process holds. The interfaces stay.
    void (*close)();
    // Makes the interface, or takes over an existing one of this name. The caller sets its group, alias and
    // MTU afterwards.
    bool (*make_link)(const std::string &name, const link_wish &wish, uint32_t *out_index,
                      std::string *out_error);
    bool (*drop_link)(const std::string &name, std::string *out_error);
    void (*read_counters)(plane_counters *inout);
    // Sets which packets are passed on by the bucket in their redirect header. Null if the plane can't see
    // it.
    void (*set_passing)(const passing_table &table) = nullptr;
    // Called every few seconds: the host may have other devices now. Null if that makes no difference.
    void (*follow_devices)() = nullptr;
};
extern const data_plane kernel_plane; // GRE links of the kernel
extern const data_plane user_plane;   // a packet ring, and a TUN device for each tunnel
extern const data_plane table_plane;  // carries nothing: only a table of tunnels, for tests
// In the order in which they are tried.
extern const data_plane *const data_planes[3];

// Options of the plane `user`, to be set before it is opened.
struct user_plane_options {
    bool redirect_header = false; // returned packets are sent as type 0x883E with their redirect header
};
extern user_plane_options user_plane_settings;
