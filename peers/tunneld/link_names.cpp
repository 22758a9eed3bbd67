#include "peers/tunneld/link_names.h"

#include <arpa/inet.h>
#include <net/if.h>

#include <algorithm>
#include <cstdio>

namespace {

constexpr char LINK_PREFIX[] = "wccp";
constexpr size_t ALIAS_CHARACTERS = 80;
constexpr const char *kind_words[] = {"", "accepted", "member", "passing"}; // by link_kind

} // namespace

std::string link_name(uint32_t number) {
    return LINK_PREFIX + std::to_string(number);
}

std::optional<uint32_t> link_number(const std::string &name) {
    const size_t start = sizeof LINK_PREFIX - 1;
    // Five digits cannot overflow.
    if (!name.starts_with(LINK_PREFIX) || name.size() == start || name.size() > start + 5)
        return std::nullopt;
    uint32_t number = 0;
    for (const char digit : name.substr(start)) {
        if (digit < '0' || digit > '9')
            return std::nullopt;
        number = number * 10 + static_cast<uint32_t>(digit - '0');
    }
    // The second comparison excludes leading zeros.
    if (number > UINT16_MAX || link_name(number) != name)
        return std::nullopt;
    return number;
}

std::string link_alias(const link_wish &wish) {
    return "tunneld " + std::to_string(wish.tunnel_id) + " " + address_text(wish.local) + " " +
           address_text(wish.remote) + (*kind_words[static_cast<size_t>(wish.kind)] ? " " : "") +
           kind_words[static_cast<size_t>(wish.kind)];
}

std::optional<link_wish> parse_link_alias(const std::string &alias) {
    char local[INET_ADDRSTRLEN], remote[INET_ADDRSTRLEN], word[10] = "";
    uint16_t id;
    in_addr from, to;
    // The fourth word is only there for some kinds of links.
    if (alias.size() > ALIAS_CHARACTERS ||
        sscanf(alias.c_str(), "tunneld %5hu %15s %15s %9s", &id, local, remote, word) < 3 ||
        inet_pton(AF_INET, local, &from) != 1 || inet_pton(AF_INET, remote, &to) != 1)
        return std::nullopt;
    for (size_t kind = 0; kind < std::size(kind_words); kind++) {
        const link_wish wish = {id, ntohl(from.s_addr), ntohl(to.s_addr), static_cast<link_kind>(kind)};
        if (link_alias(wish) == alias) // otherwise tunneld has not written it
            return wish;
    }
    return std::nullopt;
}

bool is_interface_name(const std::string &name) {
    // Names become parts of paths below /proc/sys, where "all" and "default" are not interfaces, and of texts
    // for nftables.
    if (name.empty() || name.size() >= IFNAMSIZ || name == "." || name == ".." || name == "all" ||
        name == "default")
        return false;
    return std::all_of(name.begin(), name.end(), [](char c) {
        return c > ' ' && c < 127 && c != '/' && c != '"' && c != '\\' && c != '*';
    });
}

std::string address_text(uint32_t host_order) {
    const in_addr wire = {htonl(host_order)};
    char text[INET_ADDRSTRLEN];
    return inet_ntop(AF_INET, &wire, text, sizeof text);
}
