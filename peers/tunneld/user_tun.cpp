#include "peers/tunneld/user_tun.h"

#include <fcntl.h>
#include <linux/if_tun.h>
#include <net/if.h>
#include <netlink/route/link.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "peers/tunneld/virtio_header.h"

namespace {

constexpr const char *TUN_PATH = "/dev/net/tun";
// TUN_F_USO4 and TUN_F_USO6, newer than the headers of this system. The kernel takes both or neither.
constexpr unsigned TUN_LARGE_UDP = 0x20 | 0x40;

bool fail_tun(std::string *out_error, const std::string &what) {
    *out_error = what + ": " + strerror(errno);
    return false;
}

// After a process has ended, the kernel can hold its device for a moment.
bool attach_device(int fd, ifreq *request) {
    for (int tries = 0; tries < 20; tries++) {
        if (ioctl(fd, TUNSETIFF, request) == 0)
            return true;
        if (errno != EBUSY)
            break;
        usleep(2000);
    }
    return false;
}

bool set_up_device(int fd, const std::string &name, tun_device *out, std::string *out_error) {
    ifreq request = {};
    if (name.size() >= sizeof request.ifr_name) {
        errno = ENAMETOOLONG;
        return fail_tun(out_error, name);
    }
    memcpy(request.ifr_name, name.c_str(), name.size() + 1);
    request.ifr_flags = IFF_TUN | IFF_NO_PI | IFF_VNET_HDR;
    if (!attach_device(fd, &request))
        return fail_tun(out_error, "TUN device " + name);
    // An existing device keeps the size that its last program has set.
    int header = sizeof(virtio_header);
    if (ioctl(fd, TUNSETVNETHDRSZ, &header) != 0)
        return fail_tun(out_error, name + ": virtio header");
    constexpr unsigned offloads = TUN_F_CSUM | TUN_F_TSO4 | TUN_F_TSO_ECN;
    // The flags say what this program can read. A kernel that knows those for UDP also takes large UDP
    // packets that are written.
    out->takes_large_udp = ioctl(fd, TUNSETOFFLOAD, offloads | TUN_LARGE_UDP) == 0;
    if (!out->takes_large_udp && ioctl(fd, TUNSETOFFLOAD, offloads) != 0)
        return fail_tun(out_error, name + ": offloads");
    // Last: a new device that could not be set up vanishes with its descriptor.
    if (ioctl(fd, TUNSETPERSIST, 1) != 0)
        return fail_tun(out_error, name + ": persistence");
    out->index = if_nametoindex(name.c_str());
    return out->index != 0 || fail_tun(out_error, name);
}

} // namespace

bool tun_probe(std::string *out_why_not) {
    const int fd = open(TUN_PATH, O_RDWR | O_CLOEXEC);
    if (fd < 0)
        return fail_tun(out_why_not, TUN_PATH);
    unsigned features = 0;
    const bool known = ioctl(fd, TUNGETFEATURES, &features) == 0 && (features & IFF_VNET_HDR);
    close(fd);
    if (!known)
        *out_why_not = std::string(TUN_PATH) + ": no virtio headers";
    return known;
}

bool tun_open(const std::string &name, tun_device *out, std::string *out_error) {
    *out = {};
    // Non-blocking, because the device is read until it is empty.
    const int fd = open(TUN_PATH, O_RDWR | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0)
        return fail_tun(out_error, TUN_PATH);
    if (!set_up_device(fd, name, out, out_error)) {
        close(fd);
        return false;
    }
    out->fd = fd;
    return true;
}

bool remove_interface(const std::string &name, std::string *out_error) {
    const unsigned index = if_nametoindex(name.c_str());
    if (index == 0)
        return true;
    nl_sock *socket = nl_socket_alloc();
    rtnl_link *link = rtnl_link_alloc();
    int error = -NLE_NOMEM;
    if (socket && link) {
        rtnl_link_set_ifindex(link, static_cast<int>(index));
        error = nl_connect(socket, NETLINK_ROUTE);
        if (error == 0)
            error = rtnl_link_delete(socket, link);
    }
    rtnl_link_put(link);
    nl_socket_free(socket);
    // Somebody else may have removed it in the meantime.
    if (error == 0 || error == -NLE_NODEV || error == -NLE_OBJ_NOTFOUND)
        return true;
    *out_error = name + ": " + nl_geterror(error);
    return false;
}
