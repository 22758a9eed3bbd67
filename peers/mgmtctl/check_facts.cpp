// The facts that "mgmtctl check" examines. Nothing is changed, and facts that cannot be read are noted.
#include <arpa/inet.h>
#include <dirent.h>
#include <ifaddrs.h>
#include <linux/capability.h>
#include <net/if.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/timex.h>
#include <sys/utsname.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <set>
#include <sstream>

#include <nftables/libnftables.h>

#include "mgmt/node_paths.h"
#include "peers/mgmtctl/check.h"
#include "peers/mgmtctl/groups.h"
#include "platform/limits.h"
#include "runtime/capabilities.h"
#include "runtime/cmem.h"

namespace {
std::optional<std::string> first_line(const std::string &path) {
    std::ifstream in(path);
    std::string line;
    return std::getline(in, line) ? std::optional(line) : std::nullopt;
}

std::optional<long> number_in(const std::string &path) {
    const std::optional<std::string> line = first_line(path);
    return line ? std::optional(number_of(*line, 0L)) : std::nullopt;
}

std::string link_text(const std::string &path) {
    char text[256];
    // readlink() adds no terminating zero.
    const ssize_t length = readlink(path.c_str(), text, sizeof text);
    return length > 0 ? std::string(text, static_cast<size_t>(length)) : std::string();
}

std::vector<std::string> names_in(const std::string &path) {
    std::vector<std::string> names;
    DIR *directory = opendir(path.c_str());
    while (const dirent *entry = directory ? readdir(directory) : nullptr)
        names.emplace_back(entry->d_name);
    if (directory)
        closedir(directory);
    return names;
}

// --- Groups and interfaces

void gather_groups(const ctl_link &link, check_facts *out) {
    std::vector<listed_group> listed;
    const group_result result = list_groups(link, NODE_GROUP_CONFIG, &listed);
    out->mgmtd_error = result.exit == CTL_OK ? "" : result.error.empty() ? "no answer" : result.error;
    const auto value_of = [](const listed_group &group, const char *name, const char *otherwise) {
        const auto found = group.nodes.find(name);
        return found == group.nodes.end() ? std::string(otherwise) : found->second;
    };
    for (const listed_group &group : listed)
        out->groups.push_back({number_of(group.number, 0), value_of(group, "interface", ""),
                               value_of(group, "admin", "up") != "down", value_of(group, "encap", "either")});
}

void gather_interfaces(check_facts *out) {
    ifaddrs *all = nullptr;
    if (getifaddrs(&all) != 0)
        return;
    // The ioctl for the MTU takes any socket.
    const int fd = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    const std::string settings = "/proc/sys/net/ipv4/conf/";
    // One entry for each address. An interface without an address has an AF_PACKET entry all the same.
    for (const ifaddrs *one = all; one; one = one->ifa_next) {
        std::string name = one->ifa_name;
        name.resize(std::min(name.size(), name.find(':'))); // an alias such as eth0:1
        check_interface &interface = out->interfaces[name];
        // IFF_RUNNING is cleared when the carrier is lost.
        interface.up = (one->ifa_flags & IFF_UP) && (one->ifa_flags & IFF_RUNNING);
        interface.rp_filter = number_in(settings + name + "/rp_filter");
        interface.forwarding = number_in(settings + name + "/forwarding");
        ifreq request = {};
        strncpy(request.ifr_name, name.c_str(), sizeof request.ifr_name - 1);
        if (fd >= 0 && ioctl(fd, SIOCGIFMTU, &request) == 0)
            interface.mtu = request.ifr_mtu;
        char text[INET_ADDRSTRLEN];
        if (one->ifa_addr && one->ifa_addr->sa_family == AF_INET &&
            inet_ntop(AF_INET, &reinterpret_cast<const sockaddr_in *>(one->ifa_addr)->sin_addr, text,
                      sizeof text))
            interface.addresses.emplace_back(text);
    }
    if (fd >= 0)
        close(fd);
    freeifaddrs(all);
    out->all_rp_filter = number_in(settings + "all/rp_filter");
}

// --- Processes and sockets

// Calls function(process id, its directory) until it returns false.
template <typename Function>
void for_processes(const Function &function) {
    for (const std::string &name : names_in("/proc")) {
        // Only the directories of processes begin with a number.
        const int id = number_of(name, 0);
        if (id > 0 && !function(id, "/proc/" + name))
            return;
    }
}

// An address in /proc: words of 32 bits in host order. Empty: an IPv6 address that receives no IPv4.
std::string address_of(const std::string &text) {
    static const std::string mapped = "0000000000000000FFFF0000", any = std::string(32, '0');
    if (text == any)
        return "0.0.0.0";
    if (text.size() != 8 && !text.starts_with(mapped))
        return "";
    in_addr address = {};
    // The kernel prints s_addr as one number of this machine. Reading that number gives network order again.
    address.s_addr = static_cast<uint32_t>(strtoul(text.substr(text.size() - 8).c_str(), nullptr, 16));
    char out[INET_ADDRSTRLEN];
    return inet_ntop(AF_INET, &address, out, sizeof out) ? out : "";
}

// Sockets of the port, by inode.
void read_sockets(const char *path, std::map<std::string, check_socket> *inout) {
    std::ifstream in(path);
    std::string line;
    std::getline(in, line); // the column titles
    while (std::getline(in, line)) {
        std::istringstream words(line);
        std::string slot, local, skipped, inode;
        words >> slot >> local;
        // Remote address, state, queues, timer, retransmissions, user, timeout.
        for (int i = 0; i < 7; i++)
            words >> skipped;
        words >> inode;
        const size_t colon = local.find(':');
        if (!words || colon == std::string::npos ||
            strtoul(local.c_str() + colon + 1, nullptr, 16) != WCCP_UDP_PORT)
            continue;
        const std::string address = address_of(local.substr(0, colon));
        if (!address.empty())
            (*inout)["socket:[" + inode + "]"].address = address;
    }
}

void gather_sockets(check_facts *out) {
    if (access("/proc/net/udp", R_OK) != 0) {
        out->ports_error = std::string("/proc/net/udp: ") + strerror(errno);
        return;
    }
    std::map<std::string, check_socket> sockets;
    read_sockets("/proc/net/udp", &sockets);
    read_sockets("/proc/net/udp6", &sockets);
    if (!sockets.empty())
        // A process has the socket if a link in its fd directory names the inode. Without root those of other
        // users cannot be read, and their sockets stay without a name.
        for_processes([&](int id, const std::string &directory) {
            const std::string descriptors = directory + "/fd/";
            for (const std::string &name : names_in(descriptors)) {
                const auto found = sockets.find(link_text(descriptors + name));
                if (found == sockets.end())
                    continue;
                found->second.program = first_line(directory + "/comm").value_or("");
                found->second.process = id;
            }
            return true;
        });
    for (const auto &[inode, socket] : sockets)
        out->sockets.push_back(socket);
}

// The limits of the wccpd in this network namespace, where that can be determined.
void gather_wccpd(check_facts *out) {
    const std::string network = link_text("/proc/self/ns/net");
    for_processes([&](int, const std::string &directory) {
        // Without root the namespace of another user's process cannot be read; it is assumed to be this one.
        const std::string other = link_text(directory + "/ns/net");
        if (first_line(directory + "/comm").value_or("") != "wccpd" || (!other.empty() && other != network))
            return true;
        out->wccpd_runs = true;
        std::string line;
        bool known = false;
        for (std::ifstream in(directory + "/status"); std::getline(in, line);)
            if (line.starts_with("CapEff:"))
                out->may_lock = strtoull(line.c_str() + 7, nullptr, 16) >> CAP_IPC_LOCK & 1;
        for (std::ifstream in(directory + "/limits"); std::getline(in, line);) {
            static const std::string heading = "Max locked memory";
            if (!line.starts_with(heading))
                continue;
            known = true;
            std::istringstream rest(line.substr(heading.size()));
            uint64_t bytes = 0;
            if (rest >> bytes) // "unlimited" is not a number
                out->lock_limit_bytes = bytes;
        }
        if (!known)
            out->lock_limit_error = directory + "/limits cannot be read";
        return false;
    });
}

// --- The packet filter

void gather_filter(check_facts *out) {
    const bool may = lc_has_capability(CAP_NET_ADMIN); // without it the library prints to standard error
    nft_ctx *context = may ? nft_ctx_new(NFT_CTX_DEFAULT) : nullptr;
    if (!may)
        out->filter_error = "it takes root, or CAP_NET_ADMIN";
    else if (!context || nft_ctx_buffer_output(context) != 0 || nft_ctx_buffer_error(context) != 0)
        out->filter_error = "out of memory";
    else {
        // Protocols as numbers: their names would come from the host's /etc/protocols.
        nft_ctx_output_set_flags(context, NFT_CTX_OUTPUT_JSON | NFT_CTX_OUTPUT_NUMERIC_PROTO);
        const bool done = nft_run_cmd_from_buffer(context, "list ruleset") == 0;
        const char *text = done ? nft_ctx_get_output_buffer(context) : nft_ctx_get_error_buffer(context);
        std::string &to = done ? out->filter_listing : out->filter_error;
        to = text && *text ? text : "no reason given";
        // The lines after the first repeat the command and mark a column.
        if (!done)
            to.resize(std::min(to.size(), to.find('\n')));
    }
    if (context)
        nft_ctx_free(context);
    // The old iptables of the kernel. The file exists only when its module is loaded, and only root may read
    // it.
    std::ifstream tables("/proc/net/ip_tables_names");
    if (!tables && access("/proc/net/ip_tables_names", F_OK) == 0)
        out->legacy_error = strerror(EACCES);
    for (std::string name; std::getline(tables, name);)
        out->legacy_tables += (out->legacy_tables.empty() ? "" : " ") + name;
}

// --- The kernel

// Functions of the kernel, whether built in or in loaded modules, and modules that can be loaded.
void gather_kernel(check_facts *out) {
    struct {
        const char *function, *module;
        check_feature *feature;
        bool found = false;
    } wanted[] = {{"ipgre_newlink", "/ip_gre.ko", &out->gre},
                  {"tun_chr_open", "/tun.ko", &out->tun},
                  {"nft_tproxy_eval", "/nft_tproxy.ko", &out->tproxy}};
    utsname kernel = {};
    uname(&kernel);
    const std::string modules = std::string("/lib/modules/") + kernel.release + "/modules.";
    std::string line;
    for (const char *list : {"dep", "builtin"})
        for (std::ifstream in(modules + list); std::getline(in, line);) {
            // After the colon, modules.dep has the modules that this one needs.
            line.resize(std::min(line.size(), line.find(':')));
            for (auto &one : wanted)
                one.found = one.found || line.find(one.module) != std::string::npos;
        }
    bool all = std::all_of(std::begin(wanted), std::end(wanted), [](const auto &one) { return one.found; });
    bool readable = false;
    // In a container /lib/modules is often missing, but the symbols are those of the running kernel. Without
    // root the addresses are zero; the names are not hidden.
    if (!all)
        for (std::ifstream in("/proc/kallsyms"); std::getline(in, line); readable = true) {
            const size_t name = line.find(' ', line.find(' ') + 1) + 1; // ADDRESS TYPE NAME [MODULE]
            for (auto &one : wanted)
                one.found = one.found || line.compare(name, line.find('\t', name) - name, one.function) == 0;
        }
    for (const auto &one : wanted)
        *one.feature = one.found  ? check_feature::present
                       : readable ? check_feature::missing
                                  : check_feature::unknown;
}

void gather_clock(check_facts *out) {
    timex state = {}; // no modes: it is only read
    const int result = adjtimex(&state);
    if (result >= 0)
        out->clock_synchronised = result != TIME_ERROR && !(state.status & STA_UNSYNC);
}

// --- Files

void gather_files(check_facts *out) {
    const cmem_conf_faults memory = cmem_check_conf(CMEM_CONF_PATH, "wccpd_mailbox");
    out->mem_conf = {memory.error, memory.bad_line, memory.has_key};
    std::ifstream in(PLATFORM_CONF_PATH);
    if (!in || (in.peek() == EOF && in.bad())) { // the second case is a directory
        out->platform_conf.error = errno;
        return;
    }
    (void)platform_limits_read(PLATFORM_CONF_PATH, &out->platform_conf.bad_line);
}
} // namespace

check_facts gather_facts(const ctl_link &link) {
    check_facts facts;
    facts.root = geteuid() == 0;
    gather_groups(link, &facts);
    gather_interfaces(&facts);
    gather_wccpd(&facts);
    gather_sockets(&facts);
    gather_filter(&facts);
    gather_kernel(&facts);
    gather_clock(&facts);
    gather_files(&facts);
    return facts;
}
