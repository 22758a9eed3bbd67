// The data plane in user space. One thread takes GRE packets out of a packet ring, checks them, and writes
// what they carry into the TUN device of their tunnel, segments of a flow merged into large ones. What it
// reads from a TUN device is split again and sent to the router through a raw socket.
//
// The thread holds the lock while it works on a batch, and sleeps in epoll_wait without it. Batches follow
// each other closely under load: whoever else wants the lock says so first, and the thread lets it go before.

#include <linux/filter.h>
#include <net/if.h>
#include <netinet/in.h>
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
#include "peers/tunneld/user_ring.h"
#include "peers/tunneld/user_tun.h"

user_plane_options user_plane_settings;

namespace {

constexpr uint32_t RING_BATCH = 256; // packets that wait for a flush at most
// After a round with so many packets, others are under way: gathering them for a moment saves a wake-up for
// each and lets more of them be merged. A packet on a quiet line never waits.
constexpr uint32_t BUSY_PACKETS = 8;
constexpr timespec GATHER_TIME = {0, 50000};
constexpr int THREAD_NICE = -10; // the ring overflows while the thread waits for a processor
constexpr int OUTER_TTL = 64, SEND_BUFFER = 8 << 20;
constexpr uint64_t WAKE_SERIAL = 0, RING_SERIAL = 1, FIRST_LINK_SERIAL = 2;

struct user_link {
    uint64_t serial; // in epoll's data
    link_wish wish;
    tun_device tun;
    bool gone = false; // somebody has removed the interface
    int out = -1;      // raw socket from `local` to `remote`
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

// Redirect headers by flow, for packets that go back. A newer flow takes the place of an older one.
struct remembered_redirect {
    uint64_t link = 0; // serial, 0 for an empty place
    uint64_t addresses = 0;
    uint32_t ports = 0;
    uint8_t protocol = 0;
    gre_wire_redirect header = {};
};
constexpr size_t REMEMBERED_BITS = 14;

// Packets on their way to one router. They point into `received` and into themselves.
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
    std::mutex lock;              // of all below but what only the thread uses
    std::atomic<int> waiting = 0; // for the lock, beside the thread
    std::atomic<bool> stop = false;
    std::map<std::string, owned_link> links; // by interface name
    std::unordered_map<uint64_t, user_link *> by_ends, by_serial;
    std::unordered_map<uint64_t, user_link *> passing_by_ends;
    passing_lookup passing;
    uint64_t next_serial = FIRST_LINK_SERIAL;
    uint64_t refused[REFUSALS] = {};
    std::map<uint32_t, uint64_t> refused_sources;
    int epoll = -1, wake = -1;
    packet_ring ring;
    std::thread thread;
    // The thread's own:
    coalescer merger = {};
    out_batch out;
    std::unique_ptr<remembered_redirect[]> remembered;
};
std::unique_ptr<user_state> state;

// The lock for everybody but the thread.
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

bool fail(std::string *out_error, const std::string &what) {
    *out_error = what + ": " + strerror(errno);
    return false;
}

uint64_t key_of_ends(uint32_t local, uint32_t remote) {
    return uint64_t{local} << 32 | remote;
}

// --- redirect headers

remembered_redirect flow_of(const user_link &link, const uint8_t *packet, size_t length) {
    const auto *ip = reinterpret_cast<const ip4_wire_header *>(packet);
    const size_t header = ip4_header_length(*ip);
    remembered_redirect flow;
    flow.link = link.serial;
    memcpy(&flow.addresses, &ip->source, sizeof flow.addresses);
    flow.protocol = ip->protocol;
    const bool has_ports = ip->protocol == PROTOCOL_TCP || ip->protocol == PROTOCOL_UDP;
    if (has_ports && !(to_host(ip->fragment) & IP4_FRAGMENT) && length >= header + sizeof flow.ports)
        memcpy(&flow.ports, packet + header, sizeof flow.ports);
    return flow;
}

remembered_redirect *place_of(user_state *plane, const remembered_redirect &flow) {
    const uint64_t key = (flow.addresses ^ (uint64_t{flow.ports} << 16) ^ flow.link) + flow.protocol;
    return &plane->remembered[(key * 0x9e3779b97f4a7c15u) >> (64 - REMEMBERED_BITS)];
}

void remember_redirect(user_state *plane, const user_link &link, const gre_content &content) {
    remembered_redirect flow = flow_of(link, content.packet, content.length);
    remembered_redirect *place = place_of(plane, flow);
    if (!content.has_redirect)
        flow.link = 0;
    flow.header = content.redirect;
    *place = flow;
}

const gre_wire_redirect *recall_redirect(user_state *plane, const user_link &link, const uint8_t *packet,
                                         size_t length) {
    const remembered_redirect flow = flow_of(link, packet, length);
    const remembered_redirect *place = place_of(plane, flow);
    const bool same = place->link == flow.link && place->addresses == flow.addresses &&
                      place->ports == flow.ports && place->protocol == flow.protocol;
    return same ? &place->header : nullptr;
}

// --- from the router

void write_to_tun(void *target, const iovec *parts, size_t count, uint32_t packets) {
    auto *link = static_cast<user_link *>(target);
    if (writev(link->tun.fd, parts, static_cast<int>(count)) < 0)
        link->counters.refused[REFUSED_ROOM] += packets;
}

void refuse_source(user_state *plane, const gre_outer &outer) {
    bool ours = false; // other GRE of this host is none of our business
    for (const auto &[name, link] : plane->links)
        ours = ours || link->wish.local == outer.local;
    if (!ours)
        return;
    plane->refused[REFUSED_SOURCE]++;
    const auto known = plane->refused_sources.find(outer.remote);
    if (known != plane->refused_sources.end())
        known->second++;
    else if (plane->refused_sources.size() < REFUSED_SOURCES_MAX)
        plane->refused_sources[outer.remote] = 1;
}

// Where the packet goes to the kernel: by the link that it came in by, or as one that is another appliance's
// unless the kernel has a socket for it. What another appliance has passed on has no redirect header.
user_link *choose_way(user_state *plane, user_link *link, const gre_content &content) {
    uint32_t local = 0;
    const uint32_t member = find_passing_member(plane->passing, content, &local);
    if (!member || link->wish.kind == link_kind::member)
        return link;
    const auto found = plane->passing_by_ends.find(key_of_ends(local, member));
    return found == plane->passing_by_ends.end() || found->second->gone ? link : found->second;
}

// A packet that the sender's kernel, on this machine, or this one's receive offload has left large.
refusal carry_large(user_state *plane, user_link *link, user_link *way, const ring_packet &from,
                    const gre_content &content) {
    virtio_header header = from.header;
    header.header_length = 0;
    header.checksum_start = static_cast<uint16_t>(header.checksum_start - (content.packet - from.bytes));
    uint32_t packets;
    if (!large_packet_is_valid(header, content.packet, content.length, &packets))
        return REFUSED_INNER;
    if (header.gso_type == VIRTIO_LARGE_UDP && !way->tun.takes_large_udp)
        return REFUSED_ROOM;
    link->counters.packets_in += packets;
    link->counters.bytes_in += content.length;
    coalesce_flush(&plane->merger); // what came before it
    const iovec parts[2] = {{&header, sizeof header}, {content.packet, content.length}};
    write_to_tun(way, parts, 2, packets);
    return REFUSALS;
}

refusal carry_payload(user_state *plane, user_link *link, const ring_packet &from, const gre_outer &outer) {
    gre_content content;
    const bool merged = from.header.gso_type != VIRTIO_NOT_LARGE;
    const refusal why = read_gre_payload(outer.payload, outer.length, merged, &content);
    if (why != REFUSALS)
        return why;
    if (user_plane_settings.redirect_header)
        remember_redirect(plane, *link, content);
    link->counters.redirect_headers += content.has_redirect;
    user_link *const way = choose_way(plane, link, content);
    if (merged)
        return carry_large(plane, link, way, from, content);
    link->counters.packets_in++;
    link->counters.bytes_in += content.length;
    plane->merger.merge_udp = way->tun.takes_large_udp;
    coalesce_packet(&plane->merger, way, content.packet, content.length);
    return REFUSALS;
}

void carry_packet(user_state *plane, const ring_packet &packet) {
    if (packet.lost) {
        plane->refused[REFUSED_ROOM]++;
        return;
    }
    // From a sender on this machine: the checksum inside is as yet the pseudo-header's.
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

// Packets taken.
uint32_t drain_ring(user_state *plane) {
    ring_packet packet;
    uint32_t count = 0;
    while (count < RING_BATCH && ring_next(&plane->ring, &packet)) {
        count++;
        carry_packet(plane, packet);
        if (packet.shared)
            coalesce_flush(&plane->merger);
    }
    coalesce_flush(&plane->merger);
    ring_release(&plane->ring);
    return count;
}

// --- to the router

void send_batch(out_batch *batch, user_link *link) {
    bool again = true; // an error that an earlier packet met is reported by the next send
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
            link->counters.refused[REFUSED_ROOM] += batch->count - sent;
            break;
        } else if (again) {
            again = false;
        } else {
            link->counters.refused[REFUSED_ROOM]++;
            sent++;
        }
    }
    batch->count = 0;
}

// Fills the last message, whose segment is there already.
void finish_message(out_batch *batch, const gre_wire_redirect *redirect) {
    const size_t at = batch->count++;
    split_segment &segment = batch->segments[at];
    iovec *const parts = batch->parts[at];
    parts[0] = {batch->gre[at], write_gre_header(batch->gre[at], redirect)};
    size_t count = 1;
    if (segment.header_length)
        parts[count++] = {segment.header, segment.header_length};
    parts[count++] = {const_cast<uint8_t *>(segment.payload), segment.payload_length};
    batch->messages[at] = {};
    batch->messages[at].msg_hdr.msg_iov = parts;
    batch->messages[at].msg_hdr.msg_iovlen = count;
}

void give_back(user_state *plane, user_link *link, const virtio_header &header, uint8_t *packet,
               size_t length) {
    if ((length > 0 && packet[0] >> 4 != 4) || link->out < 0)
        return; // the kernel looks for IPv6 neighbours on every interface
    out_batch *batch = &plane->out;
    packet_split split;
    if (!split_begin(&split, header, packet, length)) {
        link->counters.refused[REFUSED_INNER]++;
        return;
    }
    const gre_wire_redirect *redirect = nullptr;
    if (user_plane_settings.redirect_header)
        redirect = recall_redirect(plane, *link, packet, length);
    while (split_next(&split, &batch->segments[batch->count])) {
        finish_message(batch, redirect);
        if (batch->count == OUT_BATCH)
            send_batch(batch, link);
    }
}

void leave_interface(user_state *plane, user_link *link) {
    epoll_ctl(plane->epoll, EPOLL_CTL_DEL, link->tun.fd, nullptr);
    link->gone = true;
}

// Packets taken, large ones counted once.
uint32_t drain_tun(user_state *plane, user_link *link) {
    out_batch *batch = &plane->out;
    size_t used = 0;
    uint32_t reads = 0;
    for (; reads < OUT_BATCH && used + IP4_MAX_PACKET <= RECEIVE_BUFFER; reads++) {
        virtio_header header;
        uint8_t *const packet = batch->received + used;
        const iovec parts[2] = {{&header, sizeof header}, {packet, IP4_MAX_PACKET}};
        const ssize_t got = readv(link->tun.fd, parts, 2);
        if (got < static_cast<ssize_t>(sizeof header)) {
            if (got < 0 && errno == EAGAIN)
                break;
            if (got < 0 && (errno == EBADFD || errno == EIO)) {
                leave_interface(plane, link);
                break;
            }
            link->counters.refused[REFUSED_ROOM]++;
            continue;
        }
        const size_t length = static_cast<size_t>(got) - sizeof header;
        give_back(plane, link, header, packet, length);
        used += length;
    }
    send_batch(batch, link);
    return reads;
}

// --- the thread

// Packets taken.
uint32_t serve(user_state *plane, const epoll_event &event) {
    const uint64_t serial = event.data.u64; // a copy: epoll_event is packed, and the member may be misaligned
    if (serial == WAKE_SERIAL)
        return 0;
    if (serial == RING_SERIAL)
        return drain_ring(plane);
    const auto found = plane->by_serial.find(serial);
    if (found == plane->by_serial.end() || found->second->gone)
        return 0;
    return drain_tun(plane, found->second);
}

// One look at what epoll has to tell, which is waited for. Packets taken.
uint32_t serve_events(user_state *plane) {
    epoll_event events[16];
    const int count = epoll_wait(plane->epoll, events, 16, -1);
    while (plane->waiting)
        std::this_thread::yield();
    const std::lock_guard<std::mutex> guard(plane->lock);
    uint32_t packets = 0;
    for (int i = 0; i < count; i++)
        packets += serve(plane, events[i]);
    return packets;
}

void run(user_state *plane) {
    prctl(PR_SET_NAME, "tunneld_plane");
    prctl(PR_SET_TIMERSLACK, 1000);            // nanoseconds
    setpriority(PRIO_PROCESS, 0, THREAD_NICE); // of this thread; it may be refused
    while (!plane->stop) {
        const uint32_t packets = serve_events(plane);
        if (packets >= BUSY_PACKETS && packets < RING_BATCH)
            nanosleep(&GATHER_TIME, nullptr);
    }
}

bool watch(user_state *plane, int fd, uint64_t serial, std::string *out_error) {
    epoll_event event = {};
    event.events = EPOLLIN;
    event.data.u64 = serial;
    return epoll_ctl(plane->epoll, EPOLL_CTL_ADD, fd, &event) == 0 || fail(out_error, "epoll");
}

bool start_thread(user_state *plane, std::string *out_error) {
    sigset_t all, before;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before); // signals are for the main thread
    bool started = true;
    try {
        plane->thread = std::thread(run, plane);
    } catch (const std::system_error &error) {
        *out_error = std::string("thread: ") + error.what();
        started = false;
    }
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    return started;
}

void close_plane() {
    if (!state)
        return;
    state->stop = true;
    if (state->thread.joinable()) {
        const uint64_t one = 1;
        (void)!write(state->wake, &one, sizeof one);
        state->thread.join();
    }
    ring_close(&state->ring);
    for (const int fd : {state->epoll, state->wake})
        if (fd >= 0)
            close(fd);
    state.reset();
}

bool open_plane(std::string *out_error) {
    if (state)
        return true;
    state = std::make_unique<user_state>();
    state->merger.sink = write_to_tun;
    state->remembered = std::make_unique<remembered_redirect[]>(size_t{1} << REMEMBERED_BITS);
    state->epoll = epoll_create1(EPOLL_CLOEXEC);
    state->wake = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    bool opened = state->epoll >= 0 && state->wake >= 0;
    if (!opened)
        fail(out_error, "epoll");
    opened = opened && ring_open(&state->ring, out_error) &&
             watch(state.get(), state->wake, WAKE_SERIAL, out_error) &&
             watch(state.get(), state->ring.fd, RING_SERIAL, out_error) &&
             start_thread(state.get(), out_error);
    if (!opened)
        close_plane();
    return opened;
}

// --- links

// Sends only: what comes in is the ring's.
bool open_raw_socket(const link_wish &wish, int *out_fd, std::string *out_error) {
    const int fd = socket(AF_INET, SOCK_RAW | SOCK_NONBLOCK | SOCK_CLOEXEC, IPPROTO_GRE);
    if (fd < 0)
        return fail(out_error, "raw socket");
    *out_fd = fd;
    sock_filter refuse_all[] = {BPF_STMT(BPF_RET | BPF_K, 0)};
    const sock_fprog program = {1, refuse_all};
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
        return fail(out_error, "raw socket's options");
    if (bind(fd, reinterpret_cast<const sockaddr *>(&local), sizeof local) != 0)
        return fail(out_error, "raw socket's address");
    if (connect(fd, reinterpret_cast<const sockaddr *>(&remote), sizeof remote) != 0)
        return fail(out_error, "raw socket's destination");
    return true;
}

void forget_link(user_state *plane, const std::string &name) {
    const auto found = plane->links.find(name);
    if (found == plane->links.end())
        return;
    const user_link &link = *found->second;
    const auto by_ends = plane->by_ends.find(key_of_ends(link.wish.local, link.wish.remote));
    if (by_ends != plane->by_ends.end() && by_ends->second == &link)
        plane->by_ends.erase(by_ends);
    if (link.wish.kind == link_kind::passing)
        plane->passing_by_ends.erase(key_of_ends(link.wish.local, link.wish.remote));
    plane->by_serial.erase(link.serial);
    plane->links.erase(found); // closing takes it out of epoll
}

// The link that is there already, when it is as wished and its interface hasn't gone.
bool find_link(user_state *plane, const std::string &name, const link_wish &wish, uint32_t *out_index) {
    const auto found = plane->links.find(name);
    if (found == plane->links.end() || found->second->wish != wish || found->second->gone ||
        if_nametoindex(name.c_str()) != found->second->tun.index)
        return false;
    *out_index = found->second->tun.index;
    return true;
}

bool make_link(const std::string &name, const link_wish &wish, uint32_t *out_index, std::string *out_error) {
    if (!state) {
        *out_error = "the user-space plane is not open";
        return false;
    }
    user_state *plane = state.get();
    const guest_guard guard(plane);
    if (find_link(plane, name, wish, out_index))
        return true;
    forget_link(plane, name);
    owned_link link(new user_link);
    link->serial = plane->next_serial++;
    link->wish = wish;
    const bool carries = wish.kind != link_kind::passing;
    if ((carries && !open_raw_socket(wish, &link->out, out_error)) || !tun_open(name, &link->tun, out_error))
        return false;
    if (!watch(plane, link->tun.fd, link->serial, out_error))
        return false;
    *out_index = link->tun.index;
    plane->by_serial[link->serial] = link.get();
    (carries ? plane->by_ends : plane->passing_by_ends)[key_of_ends(wish.local, wish.remote)] = link.get();
    plane->links[name] = std::move(link);
    return true;
}

bool drop_link(const std::string &name, std::string *out_error) {
    if (state) {
        const guest_guard guard(state.get());
        forget_link(state.get(), name);
    }
    return remove_interface(name, out_error);
}

void read_counters(plane_counters *inout) {
    if (!state)
        return;
    const guest_guard guard(state.get());
    state->refused[REFUSED_ROOM] += ring_take_losses(&state->ring);
    for (const auto &[name, link] : state->links) {
        link_counters &out = inout->links[name];
        const uint64_t fragments = out.fragments; // counted by the sorting rules: what comes in here is whole
        out = link->counters;
        out.fragments = fragments;
    }
    inout->refused_sources = state->refused_sources;
    memcpy(inout->refused, state->refused, sizeof inout->refused);
}

void set_passing(const passing_table &table) {
    if (!state)
        return;
    passing_lookup lookup;
    fill_passing_lookup(table, &lookup);
    const guest_guard guard(state.get());
    std::swap(state->passing, lookup);
}

bool probe(std::string *out_why_not) {
    if (!tun_probe(out_why_not))
        return false;
    packet_ring ring;
    const bool opened = ring_open(&ring, out_why_not);
    ring_close(&ring);
    return opened;
}

} // namespace

const data_plane user_plane = {"user",    probe,     open_plane,    close_plane,
                               make_link, drop_link, read_counters, set_passing};
