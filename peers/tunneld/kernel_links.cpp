#include "peers/tunneld/kernel_links.h"

#include <arpa/inet.h>
#include <linux/if_link.h>
#include <linux/if_tunnel.h>
#include <linux/rtnetlink.h>

#include <cerrno>
#include <cstring>

#include "peers/tunneld/link_names.h"
#include "peers/tunneld/netlink.h"

namespace {

constexpr uint8_t TUNNEL_TTL = 64;
constexpr uint32_t SKIP_STATISTICS = RTEXT_FILTER_SKIP_STATS;

std::string read_text(const nlattr *attribute) {
    if (!attribute)
        return "";
    const auto *text = static_cast<const char *>(nla_data(attribute));
    // The kernel's texts end with a zero byte, which is part of the attribute.
    return {text, strnlen(text, static_cast<size_t>(nla_len(attribute)))};
}

uint16_t read_u16(const nlattr *attribute) {
    return attribute && nla_len(attribute) >= 2 ? nla_get_u16(attribute) : uint16_t{0};
}
uint8_t read_u8(const nlattr *attribute) {
    return attribute && nla_len(attribute) >= 1 ? nla_get_u8(attribute) : uint8_t{0};
}

gre_ends read_gre(nlattr *data) {
    nlattr *attributes[IFLA_GRE_MAX + 1] = {};
    gre_ends ends;
    if (!data || nla_parse_nested(attributes, IFLA_GRE_MAX, data, nullptr) < 0)
        return ends;
    ends.local = ntohl(read_netlink_u32(attributes[IFLA_GRE_LOCAL]));
    ends.remote = ntohl(read_netlink_u32(attributes[IFLA_GRE_REMOTE]));
    ends.flags_in = read_u16(attributes[IFLA_GRE_IFLAGS]);
    ends.flags_out = read_u16(attributes[IFLA_GRE_OFLAGS]);
    ends.ttl = read_u8(attributes[IFLA_GRE_TTL]);
    ends.path_mtu = read_u8(attributes[IFLA_GRE_PMTUDISC]);
    ends.ignore_df = read_u8(attributes[IFLA_GRE_IGNORE_DF]);
    return ends;
}

link_counters read_statistics(const nlattr *attribute) {
    rtnl_link_stats64 all = {};
    // An older kernel has fewer fields than the headers of this program, a newer one can have more.
    if (attribute)
        memcpy(&all, nla_data(attribute), std::min(sizeof all, static_cast<size_t>(nla_len(attribute))));
    link_counters counters;
    counters.packets_in = all.rx_packets;
    counters.bytes_in = all.rx_bytes;
    counters.packets_out = all.tx_packets;
    counters.bytes_out = all.tx_bytes;
    // The kernel counts these on the link. Packets of an unknown source belong to no link.
    counters.refused[REFUSED_CHECKSUM] = all.rx_crc_errors;
    counters.refused[REFUSED_LENGTH] = all.rx_length_errors;
    counters.refused[REFUSED_INNER] = all.rx_frame_errors;
    counters.refused[REFUSED_ROOM] = all.rx_dropped + all.tx_dropped;
    return counters;
}

std::optional<found_link> read_link(nlmsghdr *message) {
    nlattr *attributes[IFLA_MAX + 1] = {}, *info[IFLA_INFO_MAX + 1] = {};
    if (message->nlmsg_type != RTM_NEWLINK ||
        nlmsg_parse(message, sizeof(ifinfomsg), attributes, IFLA_MAX, nullptr) < 0 ||
        !attributes[IFLA_LINKINFO] ||
        nla_parse_nested(info, IFLA_INFO_MAX, attributes[IFLA_LINKINFO], nullptr) < 0)
        return std::nullopt;
    found_link link;
    link.name = read_text(attributes[IFLA_IFNAME]);
    link.kind = read_text(info[IFLA_INFO_KIND]);
    link.group = read_netlink_u32(attributes[IFLA_GROUP]);
    // By name as well: a tunneld that was killed between making and marking a link has left it without the
    // group.
    if ((link.kind != "tun" && link.kind != "gre") || (link.group != LINK_GROUP && !link_number(link.name)))
        return std::nullopt;
    const auto *header = static_cast<const ifinfomsg *>(nlmsg_data(message));
    link.index = header->ifi_index;
    link.is_up = header->ifi_flags & IFF_UP;
    link.mtu = read_netlink_u32(attributes[IFLA_MTU]);
    link.alias = read_text(attributes[IFLA_IFALIAS]);
    link.wish = parse_link_alias(link.alias);
    // Only GRE links have ends of their own in the kernel. Those of TUN devices are in the alias.
    if (link.kind == "gre")
        link.gre = read_gre(info[IFLA_INFO_DATA]);
    link.counters = read_statistics(attributes[IFLA_STATS64]);
    return link;
}

netlink_message change_link(int index, unsigned flags) {
    ifinfomsg header = {};
    header.ifi_family = AF_UNSPEC;
    header.ifi_index = index;
    // `ifi_change` is the mask of the flags that are changed.
    header.ifi_flags = header.ifi_change = flags;
    return make_netlink_message(RTM_NEWLINK, 0, &header, sizeof header);
}

} // namespace

int find_links(bool with_counters, std::vector<found_link> *out) {
    ifinfomsg header = {};
    const auto message = make_netlink_message(RTM_GETLINK, NLM_F_DUMP, &header, sizeof header);
    if (!with_counters)
        nla_put_u32(message.get(), IFLA_EXT_MASK, SKIP_STATISTICS);
    return query_kernel(
        message.get(),
        [out](nlmsghdr *answer) {
            if (auto link = read_link(answer))
                out->push_back(std::move(*link));
        },
        [out] { out->clear(); });
}

int mark_link(int index, const link_wish &wish) {
    const auto message = change_link(index, 0);
    const std::string alias = link_alias(wish);
    nla_put_u32(message.get(), IFLA_GROUP, LINK_GROUP);
    nla_put_u32(message.get(), IFLA_MTU, LINK_MTU);
    nla_put(message.get(), IFLA_IFALIAS, static_cast<int>(alias.size()), alias.data());
    return change_kernel(message.get());
}

int bring_link_up(int index) {
    return change_kernel(change_link(index, IFF_UP).get());
}

int remove_link(int index) {
    ifinfomsg header = {};
    header.ifi_index = index;
    // ENODEV: somebody else has removed the link.
    const int error = change_kernel(make_netlink_message(RTM_DELLINK, 0, &header, sizeof header).get());
    return error == ENODEV ? 0 : error;
}

gre_ends wanted_gre(uint32_t local, uint32_t remote) {
    // Without a key, and without a checksum on packets that are sent. Without path MTU discovery and with DF
    // of the inner packet ignored, packets that are too large are fragmented instead of dropped.
    return {local, remote, 0, 0, TUNNEL_TTL, 0, 1};
}

int make_gre_link(const std::string &name, uint32_t local, uint32_t remote) {
    ifinfomsg header = {};
    const auto message = make_netlink_message(RTM_NEWLINK, NLM_F_CREATE | NLM_F_EXCL, &header, sizeof header);
    nl_msg *request = message.get();
    nla_put_string(request, IFLA_IFNAME, name.c_str());
    nla_put_u32(request, IFLA_GROUP, LINK_GROUP);
    nla_put_u32(request, IFLA_MTU, LINK_MTU);
    nlattr *info = nla_nest_start(request, IFLA_LINKINFO);
    nla_put_string(request, IFLA_INFO_KIND, "gre");
    nlattr *data = nla_nest_start(request, IFLA_INFO_DATA);
    const gre_ends wanted = wanted_gre(local, remote);
    nla_put_u32(request, IFLA_GRE_LOCAL, htonl(wanted.local));
    nla_put_u32(request, IFLA_GRE_REMOTE, htonl(wanted.remote));
    nla_put_u16(request, IFLA_GRE_IFLAGS, wanted.flags_in);
    nla_put_u16(request, IFLA_GRE_OFLAGS, wanted.flags_out);
    nla_put_u8(request, IFLA_GRE_TTL, wanted.ttl);
    nla_put_u8(request, IFLA_GRE_PMTUDISC, wanted.path_mtu);
    nla_put_u8(request, IFLA_GRE_IGNORE_DF, wanted.ignore_df);
    nla_nest_end(request, data);
    nla_nest_end(request, info);
    return change_kernel(request);
}
