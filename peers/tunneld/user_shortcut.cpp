#include "peers/tunneld/user_shortcut.h"

#include <arpa/inet.h>
#include <bpf/bpf.h>
#include <bpf/libbpf.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <set>

// The compiled program, as a part of this one.
asm(".pushsection .rodata\n"
    ".balign 8\n"
    "shortcut_program: .incbin \"" WCCP_SHORTCUT_OBJECT "\"\n"
    "shortcut_program_end:\n"
    ".popsection");
extern "C" const uint8_t shortcut_program[], shortcut_program_end[];

namespace {

constexpr auto TCX_INGRESS = static_cast<bpf_attach_type>(46); // newer than the headers of this system

bool fail_shortcut(packet_shortcut *shortcut, const char *what, std::string *out_why_not) {
    *out_why_not = std::string(what) + ": " + strerror(errno);
    shortcut_close(shortcut);
    return false;
}

int attach_to(const packet_shortcut &shortcut, unsigned device) {
    return bpf_link_create(shortcut.program, static_cast<int>(device), TCX_INGRESS, nullptr);
}

shortcut_ends make_ends(uint32_t local, uint32_t remote) {
    return {htonl(local), htonl(remote)};
}

} // namespace

bool shortcut_open(packet_shortcut *shortcut, std::string *out_why_not) {
    *shortcut = {};
    libbpf_set_print(nullptr); // it writes to the standard error output otherwise
    bpf_object_open_opts options = {};
    options.sz = sizeof options;
    options.object_name = "wccp_shortcut";
    shortcut->object = bpf_object__open_mem(
        shortcut_program, static_cast<size_t>(shortcut_program_end - shortcut_program), &options);
    if (!shortcut->object || bpf_object__load(shortcut->object) != 0)
        return fail_shortcut(shortcut, "the program cannot be loaded", out_why_not);
    shortcut->program = bpf_program__fd(bpf_object__find_program_by_name(shortcut->object, "take_shortcut"));
    shortcut->links = bpf_object__find_map_fd_by_name(shortcut->object, "links");
    // A kernel that loads the program may still lack TCX, which is newer than everything that the program
    // uses. Every network namespace has a device lo.
    const int trial = attach_to(*shortcut, if_nametoindex("lo"));
    if (trial < 0)
        return fail_shortcut(shortcut, "the program cannot be attached", out_why_not);
    // Closing the descriptor detaches the program.
    close(trial);
    return true;
}

void shortcut_close(packet_shortcut *shortcut) {
    for (const auto &[device, attachment] : shortcut->devices)
        close(attachment);
    bpf_object__close(shortcut->object);
    *shortcut = {};
}

void shortcut_follow_devices(packet_shortcut *shortcut) {
    ifaddrs *addresses = nullptr;
    if (!shortcut->object || getifaddrs(&addresses) != 0)
        return;
    const std::unique_ptr<ifaddrs, decltype(&freeifaddrs)> owned(addresses, freeifaddrs);
    // An interface is listed once for each of its addresses.
    std::set<unsigned> found;
    for (const ifaddrs *each = addresses; each; each = each->ifa_next)
        if (each->ifa_addr && each->ifa_addr->sa_family == AF_INET && !(each->ifa_flags & IFF_LOOPBACK))
            found.insert(if_nametoindex(each->ifa_name));
    std::erase_if(shortcut->devices, [&](const auto &device) {
        return !found.contains(device.first) && close(device.second) == 0;
    });
    // An index of 0 belongs to a device that has just been removed. A failure is tried again the next time.
    for (const unsigned device : found)
        if (device && !shortcut->devices.contains(device))
            if (const int attachment = attach_to(*shortcut, device); attachment >= 0)
                shortcut->devices[device] = attachment;
}

void shortcut_add_link(packet_shortcut *shortcut, uint32_t local, uint32_t remote, uint32_t index) {
    if (!shortcut->object)
        return;
    const shortcut_ends ends = make_ends(local, remote);
    shortcut_link link = {};
    link.index = index;
    // The entry replaces an old one of these ends, and its counters begin at 0 like those of the new link.
    bpf_map_update_elem(shortcut->links, &ends, &link, BPF_ANY);
}

void shortcut_drop_link(packet_shortcut *shortcut, uint32_t local, uint32_t remote) {
    if (!shortcut->object)
        return;
    const shortcut_ends ends = make_ends(local, remote);
    bpf_map_delete_elem(shortcut->links, &ends);
}

shortcut_link shortcut_count(const packet_shortcut &shortcut, uint32_t local, uint32_t remote) {
    shortcut_link link = {};
    const shortcut_ends ends = make_ends(local, remote);
    if (!shortcut.object || bpf_map_lookup_elem(shortcut.links, &ends, &link) != 0)
        return {};
    return link;
}
