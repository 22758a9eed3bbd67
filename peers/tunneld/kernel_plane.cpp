// The data plane `kernel`: a GRE link of the kernel for each tunnel.

#include <net/if.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "peers/tunneld/kernel_links.h"
#include "peers/tunneld/link_names.h"
#include "peers/tunneld/plane.h"

namespace {

// Addresses reserved for documentation: no other link has them.
constexpr char PROBE_NAME[] = "wccp-probe";
constexpr uint32_t PROBE_LOCAL = 0xC0000201, PROBE_REMOTE = 0xC0000202;

bool remove_link_by_name(const std::string &name, int *out_error) {
    const unsigned index = if_nametoindex(name.c_str());
    *out_error = index ? remove_link(static_cast<int>(index)) : 0;
    return *out_error == 0;
}

// Making a link also loads the module ip_gre where it isn't loaded yet.
bool probe_kernel_gre(std::string *out_why_not) {
    int error = make_gre_link(PROBE_NAME, PROBE_LOCAL, PROBE_REMOTE);
    if (error && error != EEXIST) { // left by a tunneld that was killed during its probe
        *out_why_not = std::string("the kernel cannot make GRE links: ") + strerror(error);
        return false;
    }
    if (!remove_link_by_name(PROBE_NAME, &error)) {
        *out_why_not = std::string("cannot remove the GRE link ") + PROBE_NAME + ": " + strerror(error);
        return false;
    }
    return true;
}

bool open_kernel_plane(std::string *) {
    return true;
}

// Whether a GRE link of this name has the wanted ends and options. One that differs is removed.
bool take_over_gre_link(const std::string &name, const gre_ends &wanted) {
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

bool make_kernel_link(const std::string &name, const link_wish &wish, uint32_t *out_index,
                      std::string *out_error) {
    int error = make_gre_link(name, wish.local, wish.remote);
    // The kernel also refuses a second GRE link with the same ends, whatever its name. If it is a foreign
    // link, the second attempt fails as well.
    if (error == EEXIST && take_over_gre_link(name, wanted_gre(wish.local, wish.remote)))
        error = 0;
    else if (error == EEXIST)
        error = make_gre_link(name, wish.local, wish.remote);
    *out_index = error ? 0 : if_nametoindex(name.c_str());
    // Somebody else has removed it in the meantime.
    if (!error && !*out_index)
        error = errno;
    if (error)
        *out_error = "cannot make link " + name + " (GRE " + address_text(wish.local) + " to " +
                     address_text(wish.remote) + "): " + strerror(error);
    return !error;
}

bool drop_kernel_link(const std::string &name, std::string *out_error) {
    int error;
    if (!remove_link_by_name(name, &error))
        *out_error = "cannot remove link " + name + ": " + strerror(error);
    return !error;
}

void read_kernel_counters(plane_counters *inout) {
    std::vector<found_link> links;
    if (find_links(true, &links))
        return;
    for (auto &link : links) {
        if (link.kind != "gre" || !link_number(link.name))
            continue;
        link_counters &counters = inout->links[link.name];
        // Fragments are counted by the sorting rules: the link gets whole packets.
        link.counters.fragments = counters.fragments;
        counters = link.counters;
    }
}

} // namespace

const data_plane kernel_plane = {"kernel",         probe_kernel_gre, open_kernel_plane,    [] {},
                                 make_kernel_link, drop_kernel_link, read_kernel_counters, nullptr};
