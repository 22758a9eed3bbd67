// The kernel's own GRE links, one for each tunnel.

#include <net/if.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "peers/tunneld/kernel_links.h"
#include "peers/tunneld/link_names.h"
#include "peers/tunneld/plane.h"

namespace {

// Ends of documentation: no other link has them.
constexpr char PROBE_NAME[] = "wccp-probe";
constexpr uint32_t PROBE_LOCAL = 0xC0000201, PROBE_REMOTE = 0xC0000202;

bool remove_by_name(const std::string &name, int *out_error) {
    const unsigned index = if_nametoindex(name.c_str());
    *out_error = index ? remove_link(static_cast<int>(index)) : 0;
    return *out_error == 0;
}

// Making one loads the module where it isn't loaded yet.
bool probe(std::string *out_why_not) {
    int error = make_gre_link(PROBE_NAME, PROBE_LOCAL, PROBE_REMOTE);
    if (error && error != EEXIST) { // a probe that was killed has left it
        *out_why_not = std::string("the kernel cannot make GRE links: ") + strerror(error);
        return false;
    }
    if (!remove_by_name(PROBE_NAME, &error)) {
        *out_why_not = std::string("cannot remove the GRE link ") + PROBE_NAME + ": " + strerror(error);
        return false;
    }
    return true;
}

bool open_plane(std::string *) {
    return true;
}

bool take_over(const std::string &name, const gre_ends &wanted) {
    std::vector<found_link> links;
    int error = find_links(false, &links);
    const auto link =
        std::find_if(links.begin(), links.end(), [&](const found_link &one) { return one.name == name; });
    if (error || link == links.end() || link->kind != "gre")
        return false;
    if (link->gre == wanted)
        return true;
    remove_link(link->index);
    return false;
}

bool make_link(const std::string &name, const link_wish &wish, uint32_t *out_index, std::string *out_error) {
    int error = make_gre_link(name, wish.local, wish.remote);
    if (error == EEXIST && take_over(name, wanted_gre(wish.local, wish.remote)))
        error = 0;
    else if (error == EEXIST)
        error = make_gre_link(name, wish.local, wish.remote);
    *out_index = error ? 0 : if_nametoindex(name.c_str());
    if (!error && !*out_index)
        error = errno;
    if (error)
        *out_error = "cannot make link " + name + " (GRE " + address_text(wish.local) + " to " +
                     address_text(wish.remote) + "): " + strerror(error);
    return !error;
}

bool drop_link(const std::string &name, std::string *out_error) {
    int error;
    if (!remove_by_name(name, &error))
        *out_error = "cannot remove link " + name + ": " + strerror(error);
    return !error;
}

void read_counters(plane_counters *inout) {
    std::vector<found_link> links;
    if (find_links(true, &links))
        return;
    for (auto &link : links) {
        if (link.kind != "gre" || !link_number(link.name))
            continue;
        link_counters &counters = inout->links[link.name];
        link.counters.fragments = counters.fragments; // counted by the sorting rules: here packets are whole
        counters = link.counters;
    }
}

} // namespace

const data_plane kernel_plane = {"kernel",  probe,     open_plane,    [] {},
                                 make_link, drop_link, read_counters, nullptr};
