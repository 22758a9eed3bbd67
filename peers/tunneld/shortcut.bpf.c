// The shortcut of the data plane `user`: a program at the ingress of the devices by which GRE packets arrive.
// UDP packets of many flows have nothing that tunneld could merge. They lose their outer headers here and
// enter the kernel by the interface of their tunnel, where tunneld would have written them. All other
// packets, including invalid ones, are left to the packet ring, which gets a packet only after this program.

#include <linux/bpf.h>
#include <linux/if_ether.h>
#include <linux/if_packet.h>
#include <linux/in.h>
#include <linux/ip.h>

#include <bpf/bpf_endian.h>
#include <bpf/bpf_helpers.h>

#include "peers/tunneld/shortcut_map.h"

#define TCX_NEXT (-1) // newer than the headers of this system
#define WITHOUT_OPTIONS 0x45
#define FRAGMENT 0x3fff // more fragments, offset
#define GRE_TYPE_IPV4 0x0800
#define GRE_TYPE_REDIRECT 0x883e
#define REDIRECT_FLAGS 0xc0 // all that the first byte of a redirect header can have

struct {
    __uint(type, BPF_MAP_TYPE_HASH);
    __uint(max_entries, SHORTCUT_LINKS_MAX);
    __type(key, struct shortcut_ends);
    __type(value, struct shortcut_link);
} links SEC(".maps");

struct outer_headers {
    struct iphdr ip;
    __be16 flags, type;
    __u8 redirect[4]; // or the first bytes of the inner packet
};

static __always_inline int is_plain_header(const struct iphdr *ip, __u8 protocol) {
    const __u16 *words = (const __u16 *)ip;
    __u32 sum = 0;
    if (*(const __u8 *)ip != WITHOUT_OPTIONS || ip->protocol != protocol ||
        ip->frag_off & bpf_htons(FRAGMENT))
        return 0;
#pragma unroll
    for (int i = 0; i < 10; i++)
        sum += words[i];
    // The byte order does not matter for a comparison with 0xffff, and one fold is enough: ten words carry at
    // most 9.
    return (__u16)(sum + (sum >> 16)) == 0xffff;
}

// Whether the packet has `length` bytes after `at`.
static __always_inline int is_complete(struct __sk_buff *packet, __u32 at, __u32 length) {
    __u8 last;
    // The packet's own length includes a link-layer header, which not every device has. Loading the last byte
    // relative to the IP header fails if the packet is too short.
    return length >= sizeof(struct iphdr) &&
           bpf_skb_load_bytes_relative(packet, at + length - 1, &last, 1, BPF_HDR_START_NET) == 0;
}

SEC("tc")
int take_shortcut(struct __sk_buff *packet) {
    struct outer_headers outer;
    struct iphdr inner;
    // A packet with a VLAN tag comes by the VLAN's device as well, without the tag.
    if (packet->protocol != bpf_htons(ETH_P_IP) || packet->pkt_type != PACKET_HOST || packet->vlan_present ||
        packet->gso_size || bpf_skb_load_bytes_relative(packet, 0, &outer, sizeof outer, BPF_HDR_START_NET) ||
        !is_plain_header(&outer.ip, IPPROTO_GRE) || outer.flags)
        return TCX_NEXT;
    if (outer.type != bpf_htons(GRE_TYPE_IPV4) && outer.type != bpf_htons(GRE_TYPE_REDIRECT))
        return TCX_NEXT;
    // Not every router that uses this type sends a redirect header. The first byte of an IP header has other
    // bits set.
    const int has_redirect =
        outer.type == bpf_htons(GRE_TYPE_REDIRECT) && !(outer.redirect[0] & ~REDIRECT_FLAGS);
    const __u32 before = sizeof outer - (has_redirect ? 0 : sizeof outer.redirect);
    if (bpf_skb_load_bytes_relative(packet, before, &inner, sizeof inner, BPF_HDR_START_NET) ||
        !is_plain_header(&inner, IPPROTO_UDP))
        return TCX_NEXT;
    const __u32 length = bpf_ntohs(inner.tot_len);
    if (bpf_ntohs(outer.ip.tot_len) < before + length || !is_complete(packet, before, length))
        return TCX_NEXT;
    // The link-layer header stays before the inner packet. The redirection to an interface without one
    // removes it.
    const struct shortcut_ends ends = {outer.ip.daddr, outer.ip.saddr};
    struct shortcut_link *link = bpf_map_lookup_elem(&links, &ends);
    if (!link || bpf_skb_adjust_room(packet, -(__s32)before, BPF_ADJ_ROOM_MAC, 0))
        return TCX_NEXT;
    // From here on the packet cannot be left to the ring any more: its outer headers are gone.
    __sync_fetch_and_add(&link->packets, 1);
    __sync_fetch_and_add(&link->bytes, length);
    if (has_redirect)
        __sync_fetch_and_add(&link->redirect_headers, 1);
    packet->mark = 0; // the sorting rules distinguish packets by it
    return bpf_redirect(link->index, BPF_F_INGRESS);
}

// Nothing that it calls requires one.
char program_license[] SEC("license") = "";
