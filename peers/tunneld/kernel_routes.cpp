#include "peers/tunneld/kernel_routes.h"

#include <arpa/inet.h>
#include <linux/fib_rules.h>
#include <linux/rtnetlink.h>
#include <net/if.h>

#include <cerrno>
#include <cstring>

#include "peers/tunneld/link_names.h"
#include "peers/tunneld/netlink.h"

namespace {

constexpr uint32_t WHOLE_MARK = 0xFFFFFFFF;

std::string name_of_index(int index) {
    // An interface can be gone before its routes are read. The route then equals no wanted one.
    char name[IFNAMSIZ] = "";
    return index && if_indextoname(static_cast<unsigned>(index), name) ? name : "";
}

bool is_our_table(uint32_t table) {
    return table >= TABLE_LOCAL && table <= TABLE_PASS_FIRST + UINT16_MAX;
}

void read_route(nlmsghdr *message, std::vector<found_route> *out) {
    nlattr *attributes[RTA_MAX + 1] = {};
    if (message->nlmsg_type != RTM_NEWROUTE ||
        nlmsg_parse(message, sizeof(rtmsg), attributes, RTA_MAX, nullptr) < 0)
        return;
    const auto *header = static_cast<const rtmsg *>(nlmsg_data(message));
    // The header has only eight bits for the table's number, as it has for rules.
    const uint32_t table = read_netlink_u32(attributes[RTA_TABLE], header->rtm_table);
    if (header->rtm_protocol != ROUTE_PROTOCOL || header->rtm_family != AF_INET || !is_our_table(table))
        return;
    found_route found;
    found.type = header->rtm_type;
    found.prefix_length = header->rtm_dst_len;
    found.destination = read_netlink_u32(attributes[RTA_DST]);
    found.priority = read_netlink_u32(attributes[RTA_PRIORITY]);
    found.out_index = static_cast<int>(read_netlink_u32(attributes[RTA_OIF]));
    const bool local = header->rtm_type == RTN_LOCAL;
    const uint32_t via = ntohl(read_netlink_u32(attributes[RTA_GATEWAY]));
    found.route = {table, local, local ? "" : name_of_index(found.out_index), via};
    found.odd = (!local && header->rtm_type != RTN_UNICAST) || found.prefix_length || found.priority ||
                (via && !(header->rtm_flags & RTNH_F_ONLINK));
    out->push_back(found);
}

netlink_message route_message(int type, int flags, const wanted_route &route, uint8_t prefix_length,
                              uint8_t route_type) {
    rtmsg header = {};
    header.rtm_family = AF_INET;
    header.rtm_dst_len = prefix_length;
    header.rtm_protocol = ROUTE_PROTOCOL;
    header.rtm_type = route_type;
    if (type == RTM_DELROUTE)
        header.rtm_scope = RT_SCOPE_NOWHERE; // in a delete request: any scope
    else if (route.local)
        header.rtm_scope = RT_SCOPE_HOST;
    else
        header.rtm_scope = route.via ? RT_SCOPE_UNIVERSE : RT_SCOPE_LINK;
    // The kernel then takes the next hop as a neighbour, without a route to it.
    if (route.via && type == RTM_NEWROUTE)
        header.rtm_flags = RTNH_F_ONLINK;
    auto message = make_netlink_message(type, flags, &header, sizeof header);
    nla_put_u32(message.get(), RTA_TABLE, route.table);
    if (route.via)
        nla_put_u32(message.get(), RTA_GATEWAY, htonl(route.via));
    return message;
}

void read_rule(nlmsghdr *message, std::vector<found_rule> *out) {
    nlattr *attributes[FRA_MAX + 1] = {};
    if (message->nlmsg_type != RTM_NEWRULE ||
        nlmsg_parse(message, sizeof(fib_rule_hdr), attributes, FRA_MAX, nullptr) < 0)
        return;
    const auto *header = static_cast<const fib_rule_hdr *>(nlmsg_data(message));
    const nlattr *protocol = attributes[FRA_PROTOCOL];
    if (header->family != AF_INET || !protocol || nla_get_u8(protocol) != ROUTE_PROTOCOL)
        return;
    found_rule found;
    found.rule.preference = read_netlink_u32(attributes[FRA_PRIORITY]);
    found.rule.mark = read_netlink_u32(attributes[FRA_FWMARK]);
    found.rule.table = read_netlink_u32(attributes[FRA_TABLE], header->table);
    if (const nlattr *name = attributes[FRA_IIFNAME])
        found.rule.in_interface.assign(
            static_cast<const char *>(nla_data(name)),
            strnlen(static_cast<const char *>(nla_data(name)), static_cast<size_t>(nla_len(name))));
    // A rule without a mark has no mask either.
    const uint32_t whole = found.rule.mark ? WHOLE_MARK : 0;
    found.odd = header->action != FR_ACT_TO_TBL || header->src_len || header->dst_len || header->tos ||
                (header->flags & FIB_RULE_INVERT) || attributes[FRA_OIFNAME] ||
                read_netlink_u32(attributes[FRA_FWMASK], whole) != whole;
    out->push_back(found);
}

netlink_message rule_message(int type, int flags, const wanted_rule &rule) {
    fib_rule_hdr header = {};
    header.family = AF_INET;
    header.action = FR_ACT_TO_TBL;
    // The table's number does not fit into the header and is sent as an attribute.
    header.table = RT_TABLE_UNSPEC;
    auto message = make_netlink_message(type, flags, &header, sizeof header);
    nla_put_u32(message.get(), FRA_TABLE, rule.table);
    nla_put_u32(message.get(), FRA_PRIORITY, rule.preference);
    nla_put_u8(message.get(), FRA_PROTOCOL, ROUTE_PROTOCOL);
    if (!rule.in_interface.empty())
        nla_put_string(message.get(), FRA_IIFNAME, rule.in_interface.c_str());
    if (rule.mark) {
        nla_put_u32(message.get(), FRA_FWMARK, rule.mark);
        nla_put_u32(message.get(), FRA_FWMASK, WHOLE_MARK);
    }
    return message;
}

} // namespace

int find_routes(std::vector<found_route> *out) {
    rtmsg header = {};
    header.rtm_family = AF_INET;
    header.rtm_protocol = ROUTE_PROTOCOL; // filtered by the kernel: a host may have a million other routes
    const auto message = make_netlink_message(RTM_GETROUTE, NLM_F_DUMP, &header, sizeof header);
    return query_kernel(
        message.get(), [out](nlmsghdr *answer) { read_route(answer, out); }, [out] { out->clear(); });
}

int find_rules(std::vector<found_rule> *out) {
    fib_rule_hdr header = {};
    header.family = AF_INET;
    const auto message = make_netlink_message(RTM_GETRULE, NLM_F_DUMP, &header, sizeof header);
    return query_kernel(
        message.get(), [out](nlmsghdr *answer) { read_rule(answer, out); }, [out] { out->clear(); });
}

int put_route(const wanted_route &route) {
    // A local route needs some device, and lo always exists.
    const unsigned index = if_nametoindex(route.local ? "lo" : route.interface.c_str());
    if (!index)
        return ENODEV;
    // A different route of the table is replaced in one step: no packet finds the table empty.
    const auto message = route_message(RTM_NEWROUTE, NLM_F_CREATE | NLM_F_REPLACE, route, 0,
                                       route.local ? uint8_t{RTN_LOCAL} : uint8_t{RTN_UNICAST});
    nla_put_u32(message.get(), RTA_OIF, index);
    return change_kernel(message.get());
}

int remove_route(const found_route &found) {
    // With every attribute that was found: the kernel deletes the first route that matches those given.
    const auto message = route_message(RTM_DELROUTE, 0, found.route, found.prefix_length, found.type);
    if (found.out_index)
        nla_put_u32(message.get(), RTA_OIF, static_cast<uint32_t>(found.out_index));
    if (found.priority)
        nla_put_u32(message.get(), RTA_PRIORITY, found.priority);
    if (found.prefix_length)
        nla_put_u32(message.get(), RTA_DST, found.destination);
    const int error = change_kernel(message.get());
    return error == ESRCH ? 0 : error;
}

int add_rule(const wanted_rule &rule) {
    // Without NLM_F_EXCL the kernel would add an identical second rule.
    const int error = change_kernel(rule_message(RTM_NEWRULE, NLM_F_CREATE | NLM_F_EXCL, rule).get());
    return error == EEXIST ? 0 : error;
}

int remove_rule(const wanted_rule &rule) {
    const int error = change_kernel(rule_message(RTM_DELRULE, 0, rule).get());
    return error == ENOENT ? 0 : error;
}

std::string route_text(const wanted_route &route) {
    return "the default route of table " + std::to_string(route.table) +
           (route.local      ? " (local)"
            : route.via == 0 ? " (" + route.interface + ")"
                             : " (" + route.interface + " via " + address_text(route.via) + ")");
}

std::string rule_text(const wanted_rule &rule) {
    char mark[24] = "";
    if (rule.mark)
        snprintf(mark, sizeof mark, " mark 0x%08x", rule.mark);
    return "the rule " + std::to_string(rule.preference) +
           (rule.in_interface.empty() ? "" : " from " + rule.in_interface) + mark + " for table " +
           std::to_string(rule.table);
}
