// traffic_wrap DEVICE, for bench/traffic.sh: until SIGTERM, packets that leave by DEVICE for 10.2.0.2 are
// sent in GRE from 10.0.0.1 to 10.0.0.101, as a router redirects them for the dynamic service 51. A BPF
// program at the device's egress does it: it costs the router little and keeps packets in batches, so that
// the appliance is the bottleneck. The program is detached when the process ends.

#include <arpa/inet.h>
#include <linux/bpf.h>
#include <linux/if_ether.h>
#include <net/if.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iterator>

namespace {

constexpr uint32_t ROUTER = 0x0a000001, APPLIANCE = 0x0a000065, SERVER = 0x0a020002;
constexpr int IP_HEADER = 20, WRAPPING = IP_HEADER + 4 + 4; // GRE, redirect header
constexpr uint16_t TTL_AND_GRE = 64 << 8 | 47;
// Newer than the headers of this system.
constexpr uint32_t ATTACH_EGRESS = 47; // BPF_TCX_EGRESS
constexpr int NEXT_PROGRAM = -1;       // TCX_NEXT
struct link_request {
    uint32_t program, device, attach_type, flags;
    uint32_t relative, padding;
    uint64_t expected_revision;
};

constexpr uint8_t R0 = 0, R1 = 1, R2 = 2, R3 = 3, R4 = 4, R5 = 5, PACKET = 6, LENGTH = 7, SUM = 8, FRAME = 10;
constexpr bpf_insn make_operation(int code, uint8_t to, uint8_t from, int offset, int value) {
    bpf_insn made = {};
    made.code = static_cast<uint8_t>(code);
    made.dst_reg = to & 15;
    made.src_reg = from & 15;
    made.off = static_cast<int16_t>(offset);
    made.imm = value;
    return made;
}
constexpr bpf_insn set_register(uint8_t to, int value) {
    return make_operation(BPF_ALU64 | BPF_MOV | BPF_K, to, 0, 0, value);
}
constexpr bpf_insn copy_register(uint8_t to, uint8_t from) {
    return make_operation(BPF_ALU64 | BPF_MOV | BPF_X, to, from, 0, 0);
}
constexpr bpf_insn change_register(int operation, uint8_t to, int value) {
    return make_operation(BPF_ALU64 | operation | BPF_K, to, 0, 0, value);
}
constexpr bpf_insn load_field(uint8_t to, uint8_t from, int offset) {
    return make_operation(BPF_LDX | BPF_MEM | BPF_W, to, from, offset, 0);
}
constexpr bpf_insn store_field(int size, int offset, int value) {
    return make_operation(BPF_ST | BPF_MEM | size, FRAME, 0, offset, value);
}
constexpr bpf_insn call_helper(int function) {
    return make_operation(BPF_JMP | BPF_CALL, 0, 0, 0, function);
}
// Stores the lower 16 bits of a register in the frame, in network order.
constexpr bpf_insn to_wire(uint8_t reg) {
    return make_operation(BPF_ALU | BPF_END | BPF_TO_BE, reg, 0, 0, 16);
}
constexpr bpf_insn store_half(int offset, uint8_t from) {
    return make_operation(BPF_STX | BPF_MEM | BPF_H, FRAME, from, offset, 0);
}
int wire_word(uint32_t host_order) {
    return static_cast<int>(htonl(host_order));
}

[[noreturn]] void die(const char *what) {
    fprintf(stderr, "traffic_wrap: %s: %s\n", what, strerror(errno));
    exit(1);
}
int call_bpf(int command, void *request, size_t size) {
    return static_cast<int>(syscall(SYS_bpf, command, request, size));
}

int load_program() {
    constexpr int AT = -32; // offset of the new headers in the frame
    constexpr int constant = 0x4500 + TTL_AND_GRE + (ROUTER >> 16) + (ROUTER & 0xffff) + (APPLIANCE >> 16) +
                             (APPLIANCE & 0xffff); // part of the header's checksum
    bpf_insn code[] = {
        copy_register(PACKET, R1),
        load_field(R1, PACKET, offsetof(__sk_buff, protocol)),
        // The offsets of all jumps are filled in below.
        make_operation(BPF_JMP | BPF_JNE | BPF_K, R1, 0, 0, htons(ETH_P_IP)),
        copy_register(R1, PACKET),
        // The destination address of the packet.
        set_register(R2, ETH_HLEN + 16),
        copy_register(R3, FRAME),
        change_register(BPF_ADD, R3, -4),
        set_register(R4, 4),
        call_helper(BPF_FUNC_skb_load_bytes),
        make_operation(BPF_JMP | BPF_JNE | BPF_K, R0, 0, 0, 0),
        load_field(R1, FRAME, -4),
        make_operation(BPF_JMP32 | BPF_JNE | BPF_K, R1, 0, 0, wire_word(SERVER)),
        copy_register(R1, PACKET),
        set_register(R2, WRAPPING),
        // Room between the Ethernet header and the packet.
        set_register(R3, BPF_ADJ_ROOM_MAC),
        set_register(R4, 0),
        call_helper(BPF_FUNC_skb_adjust_room),
        make_operation(BPF_JMP | BPF_JNE | BPF_K, R0, 0, 0, 0),
        // Includes the new room by now.
        load_field(LENGTH, PACKET, offsetof(__sk_buff, len)),
        change_register(BPF_SUB, LENGTH, ETH_HLEN),
        copy_register(SUM, LENGTH),
        change_register(BPF_ADD, SUM, constant),
        copy_register(R1, SUM), // folded twice
        change_register(BPF_RSH, R1, 16),
        change_register(BPF_AND, SUM, 0xffff),
        make_operation(BPF_ALU64 | BPF_ADD | BPF_X, SUM, R1, 0, 0),
        copy_register(R1, SUM),
        change_register(BPF_RSH, R1, 16),
        make_operation(BPF_ALU64 | BPF_ADD | BPF_X, SUM, R1, 0, 0),
        change_register(BPF_XOR, SUM, 0xffff),
        to_wire(SUM),
        to_wire(LENGTH),
        store_field(BPF_H, AT, htons(0x4500)),
        store_half(AT + 2, LENGTH),
        store_field(BPF_W, AT + 4, 0),
        store_field(BPF_H, AT + 8, htons(TTL_AND_GRE)),
        store_half(AT + 10, SUM),
        store_field(BPF_W, AT + 12, wire_word(ROUTER)),
        store_field(BPF_W, AT + 16, wire_word(APPLIANCE)),
        // GRE without options, and the redirect header: dynamic service 51, bucket 0.
        store_field(BPF_W, AT + 20, wire_word(0x0000883e)),
        store_field(BPF_W, AT + 24, wire_word(0x80330000)),
        copy_register(R1, PACKET),
        set_register(R2, ETH_HLEN),
        copy_register(R3, FRAME),
        change_register(BPF_ADD, R3, AT),
        set_register(R4, WRAPPING),
        set_register(R5, 0),
        call_helper(BPF_FUNC_skb_store_bytes),
        set_register(R0, NEXT_PROGRAM), // target of all jumps
        make_operation(BPF_JMP | BPF_EXIT, 0, 0, 0, 0),
    };
    constexpr size_t count = std::size(code);
    for (size_t i = 0; i < count; i++)
        if (code[i].code == (BPF_JMP | BPF_JNE | BPF_K) || code[i].code == (BPF_JMP32 | BPF_JNE | BPF_K))
            // Relative to the next instruction, to the last but one.
            code[i].off = static_cast<int16_t>(count - 2 - i - 1);
    static char log[65536];
    bpf_attr request = {};
    request.prog_type = BPF_PROG_TYPE_SCHED_CLS;
    request.insns = reinterpret_cast<uintptr_t>(code);
    request.insn_cnt = count;
    // None of the functions that it calls needs a particular license.
    request.license = reinterpret_cast<uintptr_t>("");
    request.log_buf = reinterpret_cast<uintptr_t>(log);
    request.log_size = sizeof log;
    request.log_level = 1;
    const int program = call_bpf(BPF_PROG_LOAD, &request, sizeof request);
    if (program < 0) {
        fputs(log, stderr);
        die("program");
    }
    return program;
}

} // namespace

int main(int argc, char **argv) {
    const unsigned device = argc == 2 ? if_nametoindex(argv[1]) : 0;
    if (device == 0)
        die("a device?");
    sigset_t ends;
    sigemptyset(&ends);
    sigaddset(&ends, SIGTERM);
    sigprocmask(SIG_BLOCK, &ends, nullptr);
    link_request request = {};
    request.program = static_cast<uint32_t>(load_program());
    request.device = device;
    request.attach_type = ATTACH_EGRESS;
    if (call_bpf(BPF_LINK_CREATE, &request, sizeof request) < 0)
        die("link");
    puts("ready");
    fflush(stdout);
    // The descriptor of the link is never closed here: the kernel detaches the program when the process ends.
    int number = 0;
    sigwait(&ends, &number);
    return 0;
}
