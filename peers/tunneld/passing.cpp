#include "peers/tunneld/passing.h"

#include <algorithm>
#include <sstream>

#include "peers/tunneld/ip_packet.h"
#include "peers/tunneld/link_names.h"
#include "peers/tunneld/session_config.h"

namespace {

constexpr uint8_t ALTERNATIVE_USED = 0x40; // of the redirect header's flags
constexpr size_t BUCKETS = 256;
constexpr uint8_t FLOW_FLAGS = TCP_FIN | TCP_SYN | TCP_RST | TCP_ACK;

// Null for other protocols and for fragments.
const tcp_wire_header *find_tcp_header(const gre_content &content) {
    const auto *ip = reinterpret_cast<const ip4_wire_header *>(content.packet);
    const size_t header = ip4_header_length(*ip);
    if (ip->protocol != PROTOCOL_TCP || (to_host(ip->fragment) & IP4_FRAGMENT) ||
        content.length < header + sizeof(tcp_wire_header))
        return nullptr;
    return reinterpret_cast<const tcp_wire_header *>(content.packet + header);
}

} // namespace

void fill_passing_lookup(const passing_table &table, passing_lookup *out) {
    *out = {};
    for (const auto &[number, group] : table) {
        auto service = std::make_unique<passing_service>();
        service->local = group.local;
        service->by_source_port = group.by_source_port;
        // Wider than a port: with 16 bits a range that ends at 65535 would never end.
        for (const port_range &range : group.ports)
            for (uint32_t port = range.first; port <= range.last; port++)
                service->ports.set(port);
        if (group.ports.empty())
            service->ports.set();
        for (size_t i = 0; i < BUCKETS; i++)
            service->members[i] = i < group.members.size() ? group.members[i] : 0;
        out->any |= std::any_of(group.members.begin(), group.members.end(), [](uint32_t one) { return one; });
        out->services[number] = std::move(service);
    }
}

uint32_t find_passing_member(const passing_lookup &lookup, const gre_content &content, uint32_t *out_local) {
    if (!lookup.any || !content.has_redirect)
        return 0;
    const gre_wire_redirect &redirect = content.redirect;
    const passing_service *service = lookup.services[redirect.service].get();
    if (!service)
        return 0;
    // The service and the bucket are those that the router has used for this packet.
    const uint32_t member = service->members[redirect.flags & ALTERNATIVE_USED ? redirect.alternative_bucket
                                                                               : redirect.primary_bucket];
    const tcp_wire_header *tcp = member ? find_tcp_header(content) : nullptr;
    // A packet that opens a flow stays here: the flow will be this appliance's.
    if (!tcp || (tcp->flags & FLOW_FLAGS) == TCP_SYN ||
        !service->ports[to_host(service->by_source_port ? tcp->source_port : tcp->destination_port)])
        return 0;
    *out_local = service->local;
    return member;
}

// --- The file
//
// A line for each group: NUMBER LOCAL source|destination PORTS COUNT*MEMBER ..., where PORTS are "all" or
// ranges separated by commas, and each COUNT*MEMBER is a run of buckets with the same member.

std::string passing_file_text(const passing_table &table) {
    std::ostringstream text;
    for (const auto &[number, group] : table) {
        text << unsigned{number} << " " << address_text(group.local)
             << (group.by_source_port ? " source " : " destination ");
        for (size_t i = 0; i < group.ports.size(); i++)
            text << (i ? "," : "") << group.ports[i].first << "-" << group.ports[i].last;
        if (group.ports.empty())
            text << "all";
        for (size_t first = 0, next; first < group.members.size(); first = next) {
            for (next = first + 1;
                 next < group.members.size() && group.members[next] == group.members[first];)
                next++;
            text << " " << next - first << "*" << address_text(group.members[first]);
        }
        text << "\n";
    }
    return text.str();
}

namespace {

bool take_passing_line(const std::string &line, unsigned *out_number, passing_group *out) {
    std::istringstream words(line);
    std::string local, kind, ports, run;
    if (!(words >> *out_number >> local >> kind >> ports) || *out_number > 255 ||
        !parse_address(local, &out->local) || (kind != "source" && kind != "destination"))
        return false;
    out->by_source_port = kind == "source";
    std::replace(ports.begin(), ports.end(), ',', ' ');
    if (!parse_ports(ports, &out->ports))
        return false;
    while (words >> run) {
        const size_t star = run.find('*');
        uint32_t member = 0;
        // At most three digits, which std::stoul() can always read.
        if (star == std::string::npos || star == 0 || star > 3 ||
            run.find_first_not_of("0123456789") != star || !parse_address(run.substr(star + 1), &member))
            return false;
        const size_t count = std::stoul(run.substr(0, star));
        if (count > BUCKETS - out->members.size())
            return false;
        out->members.insert(out->members.end(), count, member);
    }
    return out->members.size() == BUCKETS;
}

} // namespace

passing_table read_passing_file(const std::string &text) {
    passing_table table;
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
        unsigned number = 0;
        passing_group group;
        if (take_passing_line(line, &number, &group))
            table[static_cast<uint8_t>(number)] = std::move(group);
    }
    return table;
}
