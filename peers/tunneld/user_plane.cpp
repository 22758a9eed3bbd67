// The data plane `user`. Its thread takes GRE packets out of a packet ring, checks them, and writes what they
// carry into the TUN device of their tunnel, with segments of a flow merged into large ones. The packets that
// it reads from a TUN device are split again and sent to the router through a raw socket. UDP packets take a
// shortcut in the kernel where there is one.
//
// The thread holds the lock while it works on a batch of packets, but not while it waits. Under load it would
// take the lock again at once: other threads therefore announce that they want it, and the thread lets them
// go first.

#include <linux/filter.h>
#include <net/if.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <memory>
#include <mutex>
#include <thread>
#include <unordered_map>

#include "peers/nodes/value_lists.h"
#include "peers/tunneld/coalesce.h"
#include "peers/tunneld/gre.h"
#include "peers/tunneld/passing.h"
#include "peers/tunneld/plane.h"
#include "peers/tunneld/redirect_memory.h"
#include "peers/tunneld/user_ring.h"
#include "peers/tunneld/user_shortcut.h"
#include "peers/tunneld/user_tun.h"
#include "runtime/logging.h"

user_plane_options user_plane_settings;

namespace {

constexpr uint32_t RING_BATCH = 256; // packets that are taken from the ring at once
// After a batch of this many packets, more are on their way. Waiting for them once, instead of being woken
// for every few, saves most of the processor time, and more segments can be merged. On a quiet line no packet
// waits.
constexpr uint32_t BUSY_PACKETS = 8;
constexpr timespec GATHER_TIME = {0, 200'000};
constexpr int THREAD_NICE = -10; // the ring can overflow while the thread waits for a processor
constexpr int OUTER_TTL = 64, SEND_BUFFER = 8 << 20;
constexpr int EVENTS_MAX = 16;
constexpr uint64_t WAKE_SERIAL = 0, FIRST_LINK_SERIAL = 1;

struct user_link {
    uint64_t serial; // identifies the link in epoll's data
    link_wish wish;
    tun_device tun;
    bool gone = false; // somebody else has removed the interface
    int out = -1;      // raw socket from `local` to `remote`; passing links have none
    link_counters counters;
};

void free_link(user_link *link) {
    if (link->tun.fd >= 0)
        close(link->tun.fd);
    if (link->out >= 0)
        close(link->out);
    delete link;
}
struct link_freer {
    void operator()(user_link *link) const { free_link(link); }
};
using owned_link = std::unique_ptr<user_link, link_freer>;

// Packets on their way to one router. The messages point into `received` and into the batch itself.
constexpr size_t OUT_BATCH = 64, RECEIVE_BUFFER = 4 * 65536;
struct out_batch {
    size_t count = 0;
    mmsghdr messages[OUT_BATCH];
    iovec parts[OUT_BATCH][3];
    uint8_t gre[OUT_BATCH][GRE_MAX_WRITTEN];
    split_segment segments[OUT_BATCH];
    uint8_t received[RECEIVE_BUFFER];
};

struct user_state {
    std::mutex lock;              // of everything that is not the thread's own
    std::atomic<int> waiting = 0; // number of other threads that want the lock
    std::atomic<bool> stop = false;
    std::map<std::string, owned_link> links; // by interface name
    std::unordered_map<uint64_t, user_link *> by_ends, by_serial;
    std::unordered_map<uint64_t, user_link *> passing_by_ends;
    passing_lookup passing;
    uint64_t next_serial = FIRST_LINK_SERIAL;
    uint64_t refused[REFUSALS] = {};
    std::map<uint32_t, uint64_t> refused_sources;
    int epoll = -1; // of the TUN devices and `wake`
    int wake = -1;  // readable when the thread is to stop
    packet_ring ring;
    packet_shortcut shortcut; // of the main thread
    std::thread thread;
    // The thread's own:
    coalescer merger = {};
    out_batch out;
    redirect_memory redirects;
};
std::unique_ptr<user_state> state;

// Holds the lock; for all threads but the plane's own.
struct guest_guard {
    explicit guest_guard(user_state *of) : held(of) {
        held->waiting++;
        held->lock.lock();
        held->waiting--;
    }
    ~guest_guard() { held->lock.unlock(); }
    guest_guard(const guest_guard &) = delete;
    guest_guard &operator=(const guest_guard &) = delete;
    user_state *held;
};

bool fail_with_errno(std::string *out_error, const std::string &what) {
    *out_error = what + ": " + strerror(errno);
    return false;
}

uint64_t key_of_ends(uint32_t local, uint32_t remote) {
    return uint64_t{local} << 32 | remote;
}

// --- From the router

void write_to_tun(void *target, const iovec *parts, size_t count, uint32_t packets) {
    auto *link = static_cast<user_link *>(target);
    // A device takes a packet as a whole or fails, for example while its interface is down.
    if (writev(link->tun.fd, parts, static_cast<int>(count)) < 0)
        link->counters.refused[REFUSED_ROOM] += packets;
}

void refuse_source(user_state *plane, const gre_outer &outer) {
    bool ours = false; // the host may have GRE tunnels that are not tunneld's
    for (const auto &[name, link] : plane->links)
        ours = ours || link->wish.local == outer.local;
    if (!ours)
        return;
    plane->refused[REFUSED_SOURCE]++;
    const auto known = plane->refused_sources.find(outer.remote);
    // Sources beyond the limit are only part of the total: forged ones must not fill the memory.
    if (known != plane->refused_sources.end())
        known->second++;
    else if (plane->refused_sources.size() < REFUSED_SOURCES_MAX)
        plane->refused_sources[outer.remote] = 1;
}

// The interface by which the kernel gets the packet: that of its tunnel, or, for a packet of another
// appliance's bucket, the passing link to that appliance. What another appliance has passed on is not passed
// on again.
user_link *choose_interface(user_state *plane, user_link *link, const gre_content &content) {
    uint32_t local = 0;
    const uint32_t member = find_passing_member(plane->passing, content, &local);
    if (!member || link->wish.kind == link_kind::member)
        return link;
    // Without a passing link, the packet is sorted like those of our own slots.
    const auto found = plane->passing_by_ends.find(key_of_ends(local, member));
    return found == plane->passing_by_ends.end() || found->second->gone ? link : found->second;
}

// A packet of several segments: left large by a sender on this machine, or merged by a device's receive
// offload.
refusal carry_large(user_state *plane, user_link *link, user_link *to, const ring_packet &from,
                    const gre_content &content) {
    virtio_header header = from.header;
    // The hint counts the outer headers as well. With 0 the kernel works out the length itself.
    header.header_length = 0;
    // A position before the inner packet wraps around, and large_packet_is_valid() refuses it.
    header.checksum_start = static_cast<uint16_t>(header.checksum_start - (content.packet - from.bytes));
    uint32_t packets;
    if (!large_packet_is_valid(header, content.packet, content.length, &packets))
        return REFUSED_INNER;
    // The device of an older kernel would refuse the write.
    if (header.gso_type == VIRTIO_LARGE_UDP && !to->tun.takes_large_udp)
        return REFUSED_ROOM;
    link->counters.packets_in += packets;
    link->counters.bytes_in += content.length;
    coalesce_flush(&plane->merger); // earlier packets of its flow go first
    const iovec parts[2] = {{&header, sizeof header}, {content.packet, content.length}};
    write_to_tun(to, parts, 2, packets);
    return REFUSALS;
}

refusal carry_payload(user_state *plane, user_link *link, const ring_packet &from, const gre_outer &outer) {
    gre_content content;
    const bool merged = from.header.gso_type != VIRTIO_NOT_LARGE;
    const refusal why = read_gre_payload(outer.payload, outer.length, merged, &content);
    if (why != REFUSALS)
        return why;
    // Also for a packet without a redirect header, which makes the memory forget an older one.
    if (user_plane_settings.redirect_header)
        remember_redirect(&plane->redirects, link->serial, content);
    link->counters.redirect_headers += content.has_redirect;
    // The packet is counted for the link by which it came, even if it leaves by another one.
    user_link *const to = choose_interface(plane, link, content);
    if (merged)
        return carry_large(plane, link, to, from, content);
    link->counters.packets_in++;
    link->counters.bytes_in += content.length;
    plane->merger.merge_udp = to->tun.takes_large_udp;
    coalesce_packet(&plane->merger, to, content.packet, content.length);
    return REFUSALS;
}

void carry_packet(user_state *plane, const ring_packet &packet) {
    // Nothing is known about the packet, not even its link.
    if (packet.lost) {
        plane->refused[REFUSED_ROOM]++;
        return;
    }
    // A sender on this machine leaves the inner checksum to the device: so far it covers the pseudo-header
    // only.
    if (packet.header.gso_type == VIRTIO_NOT_LARGE &&
        !complete_checksum(packet.header, packet.bytes, packet.length)) {
        plane->refused[REFUSED_LENGTH]++;
        return;
    }
    gre_outer outer;
    refusal why = read_gre_outer(packet.bytes, packet.length, &outer);
    if (why != REFUSALS) {
        plane->refused[why]++;
        return;
    }
    const auto found = plane->by_ends.find(key_of_ends(outer.local, outer.remote));
    if (found == plane->by_ends.end())
        return refuse_source(plane, outer);
    why = carry_payload(plane, found->second, packet, outer);
    if (why != REFUSALS)
        found->second->counters.refused[why]++;
}

// Returns the number of packets.
uint32_t drain_ring(user_state *plane) {
    ring_packet packet;
    uint32_t count = 0;
    // The limit gives TUN devices and other threads their turn.
    while (count < RING_BATCH && ring_next(&plane->ring, &packet)) {
        count++;
        carry_packet(plane, packet);
        if (packet.shared) // the next large packet overwrites this one
            coalesce_flush(&plane->merger);
    }
    coalesce_flush(&plane->merger);
    // Only after the flush: the merger refers to the frames, which the kernel may then overwrite.
    ring_release(&plane->ring);
    return count;
}

// --- To the router

void send_batch(out_batch *batch, user_link *link) {
    bool again = true; // sendmmsg() can report an error that an earlier packet has caused
    for (size_t sent = 0; sent < batch->count;) {
        const int result = sendmmsg(link->out, batch->messages + sent,
                                    static_cast<unsigned>(batch->count - sent), MSG_DONTWAIT);
        if (result > 0) {
            for (const size_t end = sent + static_cast<size_t>(result); sent < end; sent++) {
                const split_segment &segment = batch->segments[sent];
                link->counters.packets_out++;
                link->counters.bytes_out += segment.header_length + segment.payload_length;
            }
        } else if (errno == EAGAIN) {
            // The send buffer is full: it has no room for the other packets either.
            link->counters.refused[REFUSED_ROOM] += batch->count - sent;
            break;
        } else if (again) {
            // Reporting an old error has cleared it, and the packet gets a second attempt.
            again = false;
        } else {
            // This packet itself cannot be sent. The others follow.
            link->counters.refused[REFUSED_ROOM]++;
            sent++;
        }
    }
    batch->count = 0;
}

// Makes a message of the segment that has been written to the next place of the batch.
void finish_message(out_batch *batch, const gre_wire_redirect *redirect) {
    const size_t at = batch->count++;
    split_segment &segment = batch->segments[at];
    iovec *const parts = batch->parts[at];
    parts[0] = {batch->gre[at], write_gre_header(batch->gre[at], redirect)};
    size_t count = 1;
    if (segment.header_length)
        parts[count++] = {segment.header, segment.header_length};
    // sendmsg() only reads, although iovec is not const.
    parts[count++] = {const_cast<uint8_t *>(segment.payload), segment.payload_length};
    batch->messages[at] = {};
    batch->messages[at].msg_hdr.msg_iov = parts;
    batch->messages[at].msg_hdr.msg_iovlen = count;
}

void return_packet(user_state *plane, user_link *link, const virtio_header &header, uint8_t *packet,
                   size_t length) {
    // Without IPv6: the kernel looks for neighbours on every interface. A passing link has no socket.
    if ((length > 0 && packet[0] >> 4 != 4) || link->out < 0)
        return;
    out_batch *batch = &plane->out;
    packet_split split;
    if (!split_begin(&split, header, packet, length)) {
        link->counters.refused[REFUSED_INNER]++;
        return;
    }
    const gre_wire_redirect *redirect = nullptr;
    if (user_plane_settings.redirect_header)
        redirect = recall_redirect(plane->redirects, link->serial, packet, length);
    // A large packet can have more segments than the batch has places.
    while (split_next(&split, &batch->segments[batch->count])) {
        finish_message(batch, redirect);
        if (batch->count == OUT_BATCH)
            send_batch(batch, link);
    }
}

void leave_interface(user_state *plane, user_link *link) {
    // epoll would report the dead descriptor for ever. The main thread replaces the link when its next
    // comparison with the kernel finds that the interface is missing.
    epoll_ctl(plane->epoll, EPOLL_CTL_DEL, link->tun.fd, nullptr);
    link->gone = true;
}

// Returns the number of packets; a large one counts once.
uint32_t drain_tun(user_state *plane, user_link *link) {
    out_batch *batch = &plane->out;
    size_t used = 0;
    uint32_t reads = 0;
    // Packets stay in the buffer until they are sent. Each read needs room for the largest packet, but keeps
    // only what it has used.
    for (; reads < OUT_BATCH && used + IP4_MAX_PACKET <= RECEIVE_BUFFER; reads++) {
        virtio_header header;
        uint8_t *const packet = batch->received + used;
        const iovec parts[2] = {{&header, sizeof header}, {packet, IP4_MAX_PACKET}};
        const ssize_t got = readv(link->tun.fd, parts, 2);
        if (got < static_cast<ssize_t>(sizeof header)) {
            if (got < 0 && errno == EAGAIN)
                break;
            // The interface has been deleted, and the descriptor no longer belongs to a device.
            if (got < 0 && (errno == EBADFD || errno == EIO)) {
                leave_interface(plane, link);
                break;
            }
            link->counters.refused[REFUSED_ROOM]++;
            continue;
        }
        const size_t length = static_cast<size_t>(got) - sizeof header;
        return_packet(plane, link, header, packet, length);
        used += length;
    }
    send_batch(batch, link);
    return reads;
}

// --- The thread

// Waits for packets, or after a busy batch gathers them. The ring is not in epoll's set: an entry there would
// be woken for each packet, while one of poll() exists only as long as the thread sleeps. Returns the number
// of events of TUN devices.
int wait_for_packets(user_state *plane, uint32_t taken, epoll_event (&events)[EVENTS_MAX]) {
    if (taken < BUSY_PACKETS) {
        pollfd ready[] = {{plane->ring.fd, POLLIN, 0}, {plane->epoll, POLLIN, 0}};
        // Only the ring has packets, which is the usual case: epoll_wait() is not needed.
        if (poll(ready, std::size(ready), -1) > 0 && !ready[1].revents)
            return 0;
    } else if (taken < RING_BATCH) {
        // A full batch does not wait: the ring has more, and could overflow.
        nanosleep(&GATHER_TIME, nullptr);
    }
    return epoll_wait(plane->epoll, events, EVENTS_MAX, 0);
}

// Returns the number of packets.
uint32_t serve_event(user_state *plane, const epoll_event &event) {
    const uint64_t serial = event.data.u64; // a copy: epoll_event is packed, and the member may be misaligned
    const auto found = plane->by_serial.find(serial); // not there: `wake`, or a link that was just removed
    return found == plane->by_serial.end() || found->second->gone ? 0 : drain_tun(plane, found->second);
}

void carry_packets(user_state *plane) {
    prctl(PR_SET_NAME, "tunneld_plane");
    // The default of 50 microseconds would be a quarter of GATHER_TIME.
    prctl(PR_SET_TIMERSLACK, 1000);            // nanoseconds
    setpriority(PRIO_PROCESS, 0, THREAD_NICE); // of this thread; it may be refused
    uint32_t taken = 0;
    while (!plane->stop) {
        epoll_event events[EVENTS_MAX];
        const int count = wait_for_packets(plane, taken, events);
        while (plane->waiting)
            std::this_thread::yield();
        const std::lock_guard<std::mutex> guard(plane->lock);
        taken = drain_ring(plane);
        for (int i = 0; i < count; i++)
            taken += serve_event(plane, events[i]);
    }
}

bool watch_descriptor(user_state *plane, int fd, uint64_t serial, std::string *out_error) {
    epoll_event event = {};
    event.events = EPOLLIN;
    event.data.u64 = serial;
    return epoll_ctl(plane->epoll, EPOLL_CTL_ADD, fd, &event) == 0 || fail_with_errno(out_error, "epoll");
}

bool start_thread(user_state *plane, std::string *out_error) {
    sigset_t all, before;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before); // signals are for the main thread
    bool started = true;
    try {
        plane->thread = std::thread(carry_packets, plane);
    } catch (const std::system_error &error) {
        *out_error = std::string("thread: ") + error.what();
        started = false;
    }
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    return started;
}

void close_user_plane() {
    if (!state)
        return;
    state->stop = true;
    if (state->thread.joinable()) {
        const uint64_t one = 1;
        // The thread sleeps without a time limit, and sees `stop` only when something wakes it.
        (void)!write(state->wake, &one, sizeof one);
        state->thread.join();
    }
    // Not before the thread has ended, which uses all of these.
    shortcut_close(&state->shortcut);
    ring_close(&state->ring);
    for (const int fd : {state->epoll, state->wake})
        if (fd >= 0)
            close(fd);
    // Closes the TUN devices as well. They are persistent, and their interfaces stay for the next tunneld.
    state.reset();
}

// With --return-redirect, the redirect header of every packet has to be remembered.
void open_shortcut(user_state *plane) {
    std::string why_not = "redirect headers are returned";
    if (!user_plane_settings.redirect_header && shortcut_open(&plane->shortcut, &why_not))
        LC_LOG(LC_LOG_INFO, "UDP packets take the shortcut in the kernel");
    else
        LC_LOG(LC_LOG_INFO, "No shortcut for UDP packets: %s", why_not.c_str());
}

bool open_user_plane(std::string *out_error) {
    if (state)
        return true;
    state = std::make_unique<user_state>();
    state->merger.sink = write_to_tun;
    state->epoll = epoll_create1(EPOLL_CLOEXEC);
    state->wake = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    bool opened = state->epoll >= 0 && state->wake >= 0;
    if (!opened)
        fail_with_errno(out_error, "epoll");
    opened = opened && ring_open(&state->ring, out_error) &&
             watch_descriptor(state.get(), state->wake, WAKE_SERIAL, out_error) &&
             start_thread(state.get(), out_error);
    if (opened)
        open_shortcut(state.get());
    else
        close_user_plane();
    return opened;
}

// --- Links
//
// Only the program's main thread makes and drops links. It opens and closes devices and sockets without the
// lock, since that takes milliseconds, in which the ring could overflow.

// For sending only: packets are received by the ring, and the socket's filter refuses all.
bool open_raw_socket(const link_wish &wish, int *out_fd, std::string *out_error) {
    const int fd = socket(AF_INET, SOCK_RAW | SOCK_NONBLOCK | SOCK_CLOEXEC, IPPROTO_GRE);
    if (fd < 0)
        return fail_with_errno(out_error, "raw socket");
    // From here on the link owns the descriptor, even if one of the next steps fails.
    *out_fd = fd;
    // A raw socket of this protocol would get a copy of every GRE packet.
    sock_filter refuse_all[] = {BPF_STMT(BPF_RET | BPF_K, 0)};
    const sock_fprog program = {1, refuse_all};
    // Without IP_HDRINCL the kernel writes the outer header, and without path MTU discovery it fragments
    // packets that are too large instead of refusing them.
    constexpr int ttl = OUTER_TTL, fragment = IP_PMTUDISC_DONT, buffer = SEND_BUFFER, on = 1;
    sockaddr_in local = {}, remote = {};
    local.sin_family = remote.sin_family = AF_INET;
    local.sin_addr.s_addr = htonl(wish.local);
    remote.sin_addr.s_addr = htonl(wish.remote);
    if (setsockopt(fd, SOL_SOCKET, SO_ATTACH_FILTER, &program, sizeof program) != 0 ||
        setsockopt(fd, SOL_SOCKET, SO_SNDBUFFORCE, &buffer, sizeof buffer) != 0 ||
        setsockopt(fd, IPPROTO_IP, IP_TTL, &ttl, sizeof ttl) != 0 ||
        setsockopt(fd, IPPROTO_IP, IP_MTU_DISCOVER, &fragment, sizeof fragment) != 0 ||
        setsockopt(fd, IPPROTO_IP, IP_FREEBIND, &on, sizeof on) != 0)
        return fail_with_errno(out_error, "raw socket's options");
    if (bind(fd, reinterpret_cast<const sockaddr *>(&local), sizeof local) != 0)
        return fail_with_errno(out_error, "raw socket's address");
    if (connect(fd, reinterpret_cast<const sockaddr *>(&remote), sizeof remote) != 0)
        return fail_with_errno(out_error, "raw socket's destination");
    return true;
}

// Takes the link out of the tables. The caller closes it without the lock, which also takes it out of epoll's
// set.
owned_link take_link_out(user_state *plane, const std::string &name) {
    const guest_guard guard(plane);
    const auto found = plane->links.find(name);
    if (found == plane->links.end())
        return nullptr;
    owned_link link = std::move(found->second);
    const uint64_t ends = key_of_ends(link->wish.local, link->wish.remote);
    auto &by_ends = link->wish.kind == link_kind::passing ? plane->passing_by_ends : plane->by_ends;
    // A link of another name may have the same ends by now, and keeps its entry.
    if (const auto same = by_ends.find(ends); same != by_ends.end() && same->second == link.get()) {
        by_ends.erase(same);
        if (link->wish.kind != link_kind::passing)
            shortcut_drop_link(&plane->shortcut, link->wish.local, link->wish.remote);
    }
    plane->by_serial.erase(link->serial);
    plane->links.erase(found);
    return link;
}

// The existing link, if it is as wished and its interface is still there.
bool find_user_link(user_state *plane, const std::string &name, const link_wish &wish, uint32_t *out_index) {
    const guest_guard guard(plane);
    const auto found = plane->links.find(name);
    // An interface with this name but another index was made by somebody else.
    if (found == plane->links.end() || found->second->wish != wish || found->second->gone ||
        if_nametoindex(name.c_str()) != found->second->tun.index)
        return false;
    *out_index = found->second->tun.index;
    return true;
}

bool make_user_link(const std::string &name, const link_wish &wish, uint32_t *out_index,
                    std::string *out_error) {
    if (!state) {
        *out_error = "the user-space plane is not open";
        return false;
    }
    user_state *plane = state.get();
    if (find_user_link(plane, name, wish, out_index))
        return true;
    take_link_out(plane, name).reset(); // its device has to be closed before it can be opened again
    owned_link link(new user_link);
    link->serial = plane->next_serial++;
    link->wish = wish;
    const bool carries = wish.kind != link_kind::passing;
    if ((carries && !open_raw_socket(wish, &link->out, out_error)) || !tun_open(name, &link->tun, out_error))
        return false;
    *out_index = link->tun.index;
    // The device by which the router's packets arrive may be as new as its tunnel.
    shortcut_follow_devices(&plane->shortcut);
    const guest_guard guard(plane);
    if (!watch_descriptor(plane, link->tun.fd, link->serial, out_error))
        return false;
    plane->by_serial[link->serial] = link.get();
    (carries ? plane->by_ends : plane->passing_by_ends)[key_of_ends(wish.local, wish.remote)] = link.get();
    if (carries)
        shortcut_add_link(&plane->shortcut, wish.local, wish.remote, link->tun.index);
    plane->links[name] = std::move(link);
    return true;
}

bool drop_user_link(const std::string &name, std::string *out_error) {
    if (state)
        take_link_out(state.get(), name).reset();
    return remove_interface(name, out_error);
}

void read_user_counters(plane_counters *inout) {
    if (!state)
        return;
    const guest_guard guard(state.get());
    // The kernel's count begins at 0 again with each reading.
    state->refused[REFUSED_ROOM] += ring_take_losses(&state->ring);
    for (const auto &[name, link] : state->links) {
        link_counters &out = inout->links[name];
        // Fragments are counted by the sorting rules: the ring gets whole packets.
        const uint64_t fragments = out.fragments;
        out = link->counters;
        out.fragments = fragments;
        if (link->wish.kind == link_kind::passing)
            continue;
        const shortcut_link taken = shortcut_count(state->shortcut, link->wish.local, link->wish.remote);
        out.packets_in += taken.packets;
        out.bytes_in += taken.bytes;
        out.redirect_headers += taken.redirect_headers;
    }
    inout->refused_sources = state->refused_sources;
    memcpy(inout->refused, state->refused, sizeof inout->refused);
}

void follow_user_devices() {
    if (state)
        shortcut_follow_devices(&state->shortcut);
}

void set_user_passing(const passing_table &table) {
    if (!state)
        return;
    // Filled before the lock is taken, and the old table is freed after it has been released: both take a
    // while.
    passing_lookup lookup;
    fill_passing_lookup(table, &lookup);
    const guest_guard guard(state.get());
    std::swap(state->passing, lookup);
}

bool probe_user_plane(std::string *out_why_not) {
    if (!tun_probe(out_why_not))
        return false;
    packet_ring ring;
    const bool opened = ring_open(&ring, out_why_not);
    ring_close(&ring);
    return opened;
}

} // namespace

const data_plane user_plane = {
    "user",         probe_user_plane,   open_user_plane,  close_user_plane,   make_user_link,
    drop_user_link, read_user_counters, set_user_passing, follow_user_devices};
