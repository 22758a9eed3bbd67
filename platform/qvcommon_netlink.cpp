// Notifications of link and address changes, from rtnetlink(7).
//
// The first qv_start_netlink_monitor starts a thread that runs until the process has ended. It owns the table
// of known interfaces and the socket that receives the kernel's notifications; other threads only use the
// atomic variables (callbacks, started kinds, the request for a scan) and the eventfd that wakes it. It
// blocks all signals, holds no lock, and sleeps until there is something to read.
//
// Events. A link state event is a change of an interface's name, administrative state (IFF_UP) or operational
// state (IFF_RUNNING); a notification that changes none of these is not an event. An address event is any
// notification about an IPv4 address of the interface. If a name disappears, because its interface is
// deleted, renamed or moved to another namespace, it is reported as down, followed by an address event,
// before a new name is reported; but not if another interface has the name by then. When a kind is started,
// every interface is reported, so that no change between the caller's own query and the start is lost.
//
// Scans. All interfaces are queried when a kind is started, when the socket's queue has overrun (because of
// many changes, or a callback that took long), and when a notification is about an unknown interface.
// Notifications that are older than the scan would undo its result; therefore the queue is emptied first.
// That drops notifications of both kinds, and so each started kind reports every interface afterwards,
// changed or not. An interface that is gone is reported as down; a name that belongs to another interface now
// is reported as down, and then in its new state. Notifications that arrive during the scan are read after it
// and lead to the latest state. A scan that fails is repeated after 200 ms.
//
// The thread still runs while the process is in exit(). Therefore no object here has a destructor, and only
// the core of libnl is used, which has none either; libnl-route has tables that are destroyed at exit.

#include "platform/qvcommon_netlink.h"

#include <linux/if_addr.h>
#include <linux/if_link.h>
#include <linux/rtnetlink.h>
#include <net/if.h>
#include <netlink/msg.h>
#include <netlink/netlink.h>
#include <netlink/socket.h>
#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "runtime/guards.h"

namespace {

constexpr int RECEIVE_BUFFER_BYTES = 208 * 1024;
constexpr int SCAN_AGAIN_MS = 200;
constexpr int SCAN_TRIES = 5; // a scan during which interfaces change is inconsistent, and is repeated
#ifdef WCCP_SANITIZED
constexpr size_t STACK_BYTES = 512 * 1024;
#else
constexpr size_t STACK_BYTES = 128 * 1024;
#endif

struct interface {
    int index;
    char name[IFNAMSIZ]; // empty: another interface has the name now
    uint32_t admin_up, link_up;
};
struct interface_table {
    interface *entries;
    uint32_t count, room;
};

std::atomic<qv_netlink_callback> callbacks[QV_NOTIFY_KINDS];
std::atomic<uint32_t> started; // a bit per kind
std::atomic<bool> scan_wanted; // a scan is to be made
int wake_fd = -1;              // an eventfd: scan_wanted has been set
pthread_mutex_t start_mutex = PTHREAD_MUTEX_INITIALIZER;
bool running; // the thread has been started; start_mutex guards it

// Used by the thread only.
nl_sock *monitor_socket;
interface_table known;

void report_link(const char *name, uint32_t admin_up, uint32_t link_up) {
    if (!name[0] || !(started.load(std::memory_order_acquire) & (1u << QV_NOTIFY_LINK_STATE)))
        return;
    qv_if_state_info info = {};
    memcpy(info.name, name, sizeof info.name);
    info.admin_up = admin_up;
    info.link_up = link_up;
    callbacks[QV_NOTIFY_LINK_STATE].load(std::memory_order_acquire)(&info);
}

void report_address(const char *name) {
    if (!name[0] || !(started.load(std::memory_order_acquire) & (1u << QV_NOTIFY_IPA_CHANGE)))
        return;
    char copy[IFNAMSIZ];
    memcpy(copy, name, sizeof copy);
    callbacks[QV_NOTIFY_IPA_CHANGE].load(std::memory_order_acquire)(copy);
}

interface *find_by_index(const interface_table *table, int index) {
    for (uint32_t i = 0; i < table->count; i++)
        if (table->entries[i].index == index)
            return &table->entries[i];
    return nullptr;
}

interface *find_by_name(const interface_table *table, const char *name) {
    for (uint32_t i = 0; i < table->count; i++)
        if (strncmp(table->entries[i].name, name, IFNAMSIZ) == 0)
            return &table->entries[i];
    return nullptr;
}

bool add_interface(interface_table *table, const interface *entry) {
    if (table->count == table->room) {
        const uint32_t room = table->room ? table->room * 2 : 16;
        void *grown = realloc(table->entries, room * sizeof(interface));
        if (!grown)
            return false;
        table->entries = static_cast<interface *>(grown);
        table->room = room;
    }
    table->entries[table->count++] = *entry;
    return true;
}

// Reports a name that no interface has any more.
void report_gone(const char *name) {
    report_link(name, 0, 0);
    report_address(name);
}

bool parse_link(nlmsghdr *header, interface *out) {
    nlattr *attributes[IFLA_MAX + 1];
    if (nlmsg_parse(header, sizeof(ifinfomsg), attributes, IFLA_MAX, nullptr) < 0)
        return false;
    const auto *link = static_cast<const ifinfomsg *>(nlmsg_data(header));
    // A bridge sends messages about its ports, of family AF_BRIDGE; a port that leaves the bridge is deleted
    // there, but still exists.
    if (link->ifi_family != AF_UNSPEC || !attributes[IFLA_IFNAME])
        return false;
    *out = {};
    out->index = link->ifi_index;
    nla_strlcpy(out->name, attributes[IFLA_IFNAME], sizeof out->name);
    out->admin_up = (link->ifi_flags & IFF_UP) ? 1 : 0;
    out->link_up = (link->ifi_flags & IFF_RUNNING) ? 1 : 0;
    return out->name[0] != '\0';
}

void request_scan() {
    scan_wanted.store(true, std::memory_order_release);
}

void update_link(const interface *now) {
    interface *holder = find_by_name(&known, now->name);
    if (holder && holder->index != now->index)
        holder->name[0] = '\0'; // it has been renamed or deleted, and its own notification follows
    interface *before = find_by_index(&known, now->index);
    if (!before) {
        // Without memory, a scan tries again later.
        if (!add_interface(&known, now))
            return request_scan();
        report_link(now->name, now->admin_up, now->link_up);
        report_address(now->name);
        return;
    }
    // Copied, since the table changes before the callbacks run.
    const interface old = *before;
    *before = *now;
    const bool renamed = strncmp(old.name, now->name, IFNAMSIZ) != 0;
    if (renamed && old.name[0])
        report_gone(old.name);
    if (renamed || old.admin_up != now->admin_up || old.link_up != now->link_up)
        report_link(now->name, now->admin_up, now->link_up);
    if (renamed)
        report_address(now->name);
}

void remove_link(int index) {
    interface *entry = find_by_index(&known, index);
    if (!entry)
        return;
    const interface old = *entry;
    // The last entry takes the free place.
    *entry = known.entries[--known.count];
    if (old.name[0])
        report_gone(old.name);
}

int on_notification(nl_msg *message, void *) {
    nlmsghdr *header = nlmsg_hdr(message);
    interface link;
    switch (header->nlmsg_type) {
    case RTM_NEWLINK:
        if (parse_link(header, &link))
            update_link(&link);
        break;
    case RTM_DELLINK:
        if (parse_link(header, &link))
            remove_link(link.index);
        break;
    case RTM_NEWADDR:
    case RTM_DELADDR:
        if (nlmsg_valid_hdr(header, sizeof(ifaddrmsg))) {
            const auto *address = static_cast<const ifaddrmsg *>(nlmsg_data(header));
            char name[IFNAMSIZ];
            if (const interface *entry = find_by_index(&known, static_cast<int>(address->ifa_index)))
                report_address(entry->name);
            else if (if_indextoname(address->ifa_index, name))
                request_scan(); // it exists, and its own notification has been missed
        }
        break;
    default:
        break;
    }
    return NL_OK;
}

int on_scan_answer(nl_msg *message, void *table) {
    nlmsghdr *header = nlmsg_hdr(message);
    interface link;
    if (header->nlmsg_type == RTM_NEWLINK && parse_link(header, &link) &&
        !add_interface(static_cast<interface_table *>(table), &link))
        return -NLE_NOMEM;
    return NL_OK;
}

// Discards all notifications that are queued. The queue can't hold more than a few thousand; the limit only
// prevents an endless loop while new ones keep arriving.
void empty_queue() {
    char byte;
    for (int i = 0; i < 100000; i++)
        if (recv(nl_socket_get_fd(monitor_socket), &byte, 1, MSG_DONTWAIT) < 0 && errno != ENOBUFS &&
            errno != EINTR)
            return;
}

nl_sock *open_netlink_socket() {
    nl_sock *socket = nl_socket_alloc();
    if (socket && nl_connect(socket, NETLINK_ROUTE) == 0)
        return socket;
    nl_socket_free(socket);
    return nullptr;
}

// Queries all interfaces, on a socket of its own. False if there is no complete and consistent answer.
bool query_all_links(interface_table *out) {
    nl_sock *socket = open_netlink_socket();
    if (!socket)
        return false;
    nl_socket_modify_cb(socket, NL_CB_VALID, NL_CB_CUSTOM, on_scan_answer, out);
    int result = -NLE_DUMP_INTR;
    for (int tries = 0; tries < SCAN_TRIES && result == -NLE_DUMP_INTR; tries++) {
        // Family AF_UNSPEC, which is 0, asks for all interfaces.
        ifinfomsg all = {};
        out->count = 0;
        result = nl_send_simple(socket, RTM_GETLINK, NLM_F_DUMP, &all, sizeof all);
        if (result >= 0)
            result = nl_recvmsgs_default(socket);
    }
    nl_socket_free(socket);
    return result >= 0;
}

bool scan_links() {
    empty_queue();
    interface_table fresh = {};
    if (!query_all_links(&fresh)) {
        free(fresh.entries);
        return false;
    }
    // The table is replaced before anything is reported.
    interface_table old = known;
    known = fresh;
    for (uint32_t i = 0; i < old.count; i++) {
        const interface *now = find_by_index(&known, old.entries[i].index);
        // Renamed counts as gone: the groups know an interface by its name.
        if (!now || strncmp(now->name, old.entries[i].name, IFNAMSIZ) != 0)
            report_gone(old.entries[i].name);
    }
    free(old.entries);
    for (uint32_t i = 0; i < known.count; i++) {
        const interface entry = known.entries[i];
        report_link(entry.name, entry.admin_up, entry.link_up);
        report_address(entry.name);
    }
    return true;
}

void *run_monitor(void *) {
    for (;;) {
        int wait = -1;
        // Before the scan, so that a request made during it isn't lost.
        if (scan_wanted.exchange(false, std::memory_order_acq_rel) && !scan_links()) {
            request_scan();
            wait = SCAN_AGAIN_MS;
        }
        pollfd fds[2] = {{nl_socket_get_fd(monitor_socket), POLLIN, 0}, {wake_fd, POLLIN, 0}};
        if (poll(fds, 2, wait) < 0)
            continue;
        uint64_t ignored;
        // Reading sets the eventfd's counter back to 0.
        if (fds[1].revents && read(wake_fd, &ignored, sizeof ignored) < 0)
            continue;
        if (fds[0].revents) {
            const int result = nl_recvmsgs_default(monitor_socket);
            // Most of all ENOBUFS: the queue has overrun.
            if (result < 0 && result != -NLE_AGAIN && result != -NLE_INTR)
                request_scan();
        }
    }
    return nullptr;
}

void close_descriptors() {
    nl_socket_free(monitor_socket);
    if (wake_fd >= 0)
        close(wake_fd);
    monitor_socket = nullptr;
    wake_fd = -1;
}

bool open_descriptors() {
    monitor_socket = open_netlink_socket();
    wake_fd = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (!monitor_socket || wake_fd < 0)
        return false;
    // Multicast notifications have no sequence number that could be checked.
    nl_socket_disable_seq_check(monitor_socket);
    nl_socket_modify_cb(monitor_socket, NL_CB_VALID, NL_CB_CUSTOM, on_notification, nullptr);
    return nl_socket_set_nonblocking(monitor_socket) == 0 &&
           nl_socket_set_buffer_size(monitor_socket, RECEIVE_BUFFER_BYTES, 0) == 0 &&
           nl_socket_add_memberships(monitor_socket, RTNLGRP_LINK, RTNLGRP_IPV4_IFADDR, RTNLGRP_NONE) == 0;
}

int start_monitor_thread() {
    pthread_attr_t attributes;
    if (const int error = pthread_attr_init(&attributes))
        return error;
    pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
    pthread_attr_setstacksize(&attributes, STACK_BYTES);
    sigset_t all, previous;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &previous); // the new thread inherits the mask
    pthread_t thread;
    const int error = pthread_create(&thread, &attributes, run_monitor, nullptr);
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
    pthread_attr_destroy(&attributes);
    if (error == 0)
        pthread_setname_np(thread, "qv_netlink");
    return error;
}

} // namespace

int qv_netlink_register(uint32_t kind, qv_netlink_callback callback) {
    if (kind >= QV_NOTIFY_KINDS || !callback)
        return EINVAL;
    callbacks[kind].store(callback, std::memory_order_release);
    return 0;
}

int qv_netlink_start(uint32_t kind) {
    if (kind >= QV_NOTIFY_KINDS || !callbacks[kind].load(std::memory_order_acquire))
        return EINVAL;
    // Cancelled in between, the caller would leave descriptors without the thread that uses them.
    const cancel_off_guard whole;
    const mutex_guard guard(&start_mutex);
    int error = 0;
    if (!running) {
        error = open_descriptors() ? start_monitor_thread() : EIO;
        if (error == 0)
            running = true;
        else
            close_descriptors();
    }
    if (error == 0) {
        // Before the scan, which reports only to kinds that have been started.
        started.fetch_or(1u << kind, std::memory_order_acq_rel);
        request_scan();
        const uint64_t one = 1;
        if (write(wake_fd, &one, sizeof one) < 0)
            error = EIO;
    }
    return error;
}
