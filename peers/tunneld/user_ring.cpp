#include "peers/tunneld/user_ring.h"

#include <arpa/inet.h>
#include <linux/filter.h>
#include <linux/if_ether.h>
#include <linux/if_packet.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "peers/tunneld/ip_packet.h"

namespace {

// A frame holds a GRE packet with an inner packet of 1500 bytes, and what the kernel writes before it. The
// size is an odd number of cache lines: with a power of two, the beginnings of all frames would share a few
// sets of the processor's cache, and the kernel would wait for memory at each packet. Blocks consist of whole
// pages.
constexpr uint32_t CACHE_LINE = 64, FRAME_SIZE = 27 * CACHE_LINE, FRAMES_PER_BLOCK = 64;
// At 10 Gbit/s the ring holds what arrives in 5 ms. A larger one would not fit into the processor's cache.
constexpr uint32_t FRAMES = 4096;
constexpr uint32_t BLOCK_SIZE = FRAME_SIZE * FRAMES_PER_BLOCK;
static_assert(BLOCK_SIZE % 4096 == 0);
constexpr size_t RING_SIZE = size_t{FRAME_SIZE} * FRAMES;
constexpr size_t LARGE_SIZE = sizeof(virtio_header) + 256 + IP4_MAX_PACKET; // with a link-layer header
constexpr int LARGE_QUEUE = 4 << 20;          // bytes of large packets in the socket's queue
constexpr unsigned FANOUT_UNIQUE_ID = 0x2000; // newer than the headers of this system

bool fail_ring(std::string *out_error, const char *what) {
    *out_error = std::string("packet ring, ") + what + ": " + strerror(errno);
    return false;
}

template <typename Value>
bool set_option(int fd, int level, int option, const Value &value, const char *what, std::string *out_error) {
    return setsockopt(fd, level, option, &value, sizeof value) == 0 || fail_ring(out_error, what);
}

// Accepts packets to this host with protocol GRE.
bool set_ring_filter(int fd, std::string *out_error) {
    // Offsets from SKF_NET_OFF count from the network header: link-layer headers differ in length. The
    // version needs no check, since the socket is bound to IPv4.
    sock_filter code[] = {
        BPF_STMT(BPF_LD | BPF_B | BPF_ABS, static_cast<uint32_t>(SKF_AD_OFF + SKF_AD_PKTTYPE)),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, PACKET_HOST, 0, 3),
        BPF_STMT(BPF_LD | BPF_B | BPF_ABS,
                 static_cast<uint32_t>(SKF_NET_OFF) + offsetof(ip4_wire_header, protocol)),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, PROTOCOL_GRE, 0, 1),
        BPF_STMT(BPF_RET | BPF_K, 0x7fffffff),
        BPF_STMT(BPF_RET | BPF_K, 0),
    };
    const sock_fprog program = {sizeof code / sizeof code[0], code};
    return set_option(fd, SOL_SOCKET, SO_ATTACH_FILTER, program, "filter", out_error);
}

bool map_frames(packet_ring *ring, std::string *out_error) {
    tpacket_req request = {};
    request.tp_block_size = BLOCK_SIZE;
    request.tp_block_nr = static_cast<unsigned>(RING_SIZE / BLOCK_SIZE);
    request.tp_frame_size = FRAME_SIZE;
    request.tp_frame_nr = FRAMES;
    if (!set_option(ring->fd, SOL_PACKET, PACKET_RX_RING, request, "frames", out_error))
        return false;
    void *memory = mmap(nullptr, RING_SIZE, PROT_READ | PROT_WRITE, MAP_SHARED, ring->fd, 0);
    if (memory == MAP_FAILED)
        return fail_ring(out_error, "memory");
    ring->memory = static_cast<uint8_t *>(memory);
    return true;
}

// A fanout group of one socket has the kernel reassemble fragments before they get into the ring. A socket
// can join the group only when it receives already: fragments that come before that are refused like other
// broken packets.
bool start_ring(const packet_ring *ring, std::string *out_error) {
    sockaddr_ll any = {};
    any.sll_family = AF_PACKET;
    any.sll_protocol = htons(ETH_P_IP);
    if (bind(ring->fd, reinterpret_cast<const sockaddr *>(&any), sizeof any) != 0)
        return fail_ring(out_error, "start");
    // How packets are distributed makes no difference in a group of one socket.
    constexpr unsigned mode = (PACKET_FANOUT_CPU | PACKET_FANOUT_FLAG_DEFRAG | FANOUT_UNIQUE_ID) << 16;
    return set_option(ring->fd, SOL_PACKET, PACKET_FANOUT, mode, "reassembly", out_error);
}

bool set_up_ring(packet_ring *ring, std::string *out_error) {
    // Without a protocol the socket receives nothing before its filter is set.
    ring->fd = socket(AF_PACKET, SOCK_RAW | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (ring->fd < 0)
        return fail_ring(out_error, "socket");
    // The version and the virtio header can only be set before the frames exist. PACKET_COPY_THRESH also puts
    // a packet that is too large for a frame into the socket's queue.
    constexpr int version = TPACKET_V2, on = 1, queue = LARGE_QUEUE;
    if (!set_ring_filter(ring->fd, out_error) ||
        !set_option(ring->fd, SOL_PACKET, PACKET_VERSION, version, "version", out_error) ||
        !set_option(ring->fd, SOL_PACKET, PACKET_VNET_HDR, on, "virtio header", out_error) ||
        !set_option(ring->fd, SOL_PACKET, PACKET_COPY_THRESH, on, "large packets", out_error) ||
        !set_option(ring->fd, SOL_SOCKET, SO_RCVBUFFORCE, queue, "large packets", out_error))
        return false;
    ring->large = static_cast<uint8_t *>(malloc(LARGE_SIZE));
    if (!ring->large)
        return fail_ring(out_error, "memory");
    return map_frames(ring, out_error) && start_ring(ring, out_error);
}

tpacket2_hdr *frame_at(const packet_ring *ring, uint32_t number) {
    return reinterpret_cast<tpacket2_hdr *>(ring->memory + size_t{number % FRAMES} * FRAME_SIZE);
}

// A packet that does not fit into a frame is in the socket's queue as a whole.
void fetch_large_packet(packet_ring *ring, size_t link_header, ring_packet *out) {
    // With MSG_TRUNC the result is the whole length, which shows that a packet did not fit.
    const ssize_t got = recv(ring->fd, ring->large, LARGE_SIZE, MSG_DONTWAIT | MSG_TRUNC);
    const size_t before = sizeof out->header + link_header;
    if (got < 0 || static_cast<size_t>(got) < before || static_cast<size_t>(got) > LARGE_SIZE) {
        out->lost = true;
        return;
    }
    out->bytes = ring->large + before;
    out->length = static_cast<size_t>(got) - before;
    out->shared = true;
    memcpy(&out->header, ring->large, sizeof out->header);
}

} // namespace

bool ring_open(packet_ring *ring, std::string *out_error) {
    *ring = {};
    if (set_up_ring(ring, out_error))
        return true;
    ring_close(ring);
    return false;
}

void ring_close(packet_ring *ring) {
    if (ring->memory)
        munmap(ring->memory, RING_SIZE);
    free(ring->large);
    if (ring->fd >= 0)
        close(ring->fd);
    *ring = {};
}

bool ring_next(packet_ring *ring, ring_packet *out) {
    // The next frame would be the first of the held ones, whose status says that it is ready.
    if (ring->held == FRAMES)
        return false;
    const tpacket2_hdr *frame = frame_at(ring, ring->next);
    // The kernel writes the status last. With acquire order, everything else in the frame is there as well.
    const uint32_t status = __atomic_load_n(&frame->tp_status, __ATOMIC_ACQUIRE);
    if (!(status & TP_STATUS_USER))
        return false;
    ring->next = (ring->next + 1) % FRAMES;
    ring->held++;
    *out = {};
    const size_t link = frame->tp_mac, network = frame->tp_net, size = frame->tp_snaplen;
    const size_t link_header = network > link ? network - link : 0;
    // The frame has only the beginning of the packet. The queue has the large packets in the order of the
    // frames.
    if (status & TP_STATUS_COPY) {
        fetch_large_packet(ring, link_header, out);
    } else if (link < sizeof out->header || network < link || link_header > size ||
               link + size > FRAME_SIZE || frame->tp_len > size) {
        out->lost = true;
    } else {
        // The frame that was just taken, but writable. The virtio header is directly before the link-layer
        // header.
        uint8_t *const bytes = reinterpret_cast<uint8_t *>(frame_at(ring, ring->next + FRAMES - 1));
        out->bytes = bytes + network;
        out->length = size - link_header;
        memcpy(&out->header, bytes + link - sizeof out->header, sizeof out->header);
    }
    // The kernel counts from the link-layer header on, which `bytes` leaves out.
    if (!out->lost && (out->header.flags & VIRTIO_NEEDS_CHECKSUM))
        out->header.checksum_start = static_cast<uint16_t>(out->header.checksum_start - link_header);
    return true;
}

void ring_release(packet_ring *ring) {
    // The oldest first, which is the one that the kernel fills next.
    for (; ring->held > 0; ring->held--)
        __atomic_store_n(&frame_at(ring, ring->next + FRAMES - ring->held)->tp_status, TP_STATUS_KERNEL,
                         __ATOMIC_RELEASE);
}

uint32_t ring_take_losses(packet_ring *ring) {
    tpacket_stats stats = {};
    socklen_t length = sizeof stats;
    // Reading the statistics resets them.
    if (getsockopt(ring->fd, SOL_PACKET, PACKET_STATISTICS, &stats, &length) != 0)
        return 0;
    return stats.tp_drops;
}
