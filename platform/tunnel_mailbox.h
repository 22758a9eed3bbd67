// The mailbox: the block of shared memory through which wccpd commands tunneld, and tunneld's functions on
// it. wccpd's side is engine/wccpd_common.cpp.
//
// It has a slot for one command and a table with the role of each policy group. `command` says whose turn it
// is: wccpd writes the inputs while it is 0 and then sets it, tunneld writes the outputs while it isn't 0 and
// then clears it, each with release order, and each reads it first, with acquire order. A role is a single
// 32-bit word that may be read at any time. Addresses and numbers are in host order.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>

constexpr const char *WCCP_MAILBOX_NAME = "wccpd_mailbox";
// A Unix datagram socket of tunneld; a datagram of any content means that there is a command.
constexpr char WCCP_WAKE_UP_PATH[] = "/run/tunneld/wake-up";
constexpr uint32_t WCCP_POLICY_GROUPS = 65536;
constexpr uint32_t WCCP_NO_INDEX = 0xFFFFFFFF;
enum : uint16_t {
    MAILBOX_IDLE = 0,
    MAILBOX_DELETE_TUNNEL = 1,
    MAILBOX_ADD_TUNNEL = 2,
    MAILBOX_L2_RETURN = 3
};

struct wccp_policy_role {
    uint16_t policy_group; // the index of the entry
    uint16_t padding;
    std::atomic<uint32_t> role; // 0 ACTIVE, 1 BACKUP, 2 UNKNOWN
};
struct wccp_tunnel_mailbox {
    std::atomic<uint16_t> command;
    uint16_t tunnel_id;
    uint32_t status;     // output: 1 failure, any other value success
    uint32_t local_ip;   // host order
    uint32_t remote_ip;  // host order
    uint32_t fmst_index; // input and output: tunneld's index of the tunnel, or WCCP_NO_INDEX
    uint8_t l2_group;    // inputs of MAILBOX_L2_RETURN
    uint8_t padding[3];
    uint32_t l2_value;
    wccp_policy_role policy_roles[WCCP_POLICY_GROUPS];
};
static_assert(offsetof(wccp_tunnel_mailbox, tunnel_id) == 2 && offsetof(wccp_tunnel_mailbox, status) == 4);
static_assert(offsetof(wccp_tunnel_mailbox, local_ip) == 8 && offsetof(wccp_tunnel_mailbox, remote_ip) == 12);
static_assert(offsetof(wccp_tunnel_mailbox, fmst_index) == 16 &&
              offsetof(wccp_tunnel_mailbox, l2_group) == 20);
static_assert(offsetof(wccp_tunnel_mailbox, l2_value) == 24);
static_assert(offsetof(wccp_tunnel_mailbox, policy_roles) == 28);
static_assert(sizeof(wccp_policy_role) == 8 && offsetof(wccp_policy_role, role) == 4);
static_assert(sizeof(wccp_tunnel_mailbox) == 524316);

// An IPv4 address, in host order, in the lower 32 bits of the first word; the rest is zero.
struct mailbox_address {
    uint64_t words[2];
};

// Read and write a field in one access of its width, with acquire and release order.
template <typename T>
T mailbox_get(const T &field) {
    return __atomic_load_n(&field, __ATOMIC_ACQUIRE);
}
template <typename T>
void mailbox_put(T &field, T value) {
    __atomic_store_n(&field, value, __ATOMIC_RELEASE);
}

// The block in this process; null until it has been created or attached.
extern wccp_tunnel_mailbox *wccp_mailbox;
// Attaches the block that wccpd has created. False if it doesn't exist, or is too short, which is logged
// once.
bool wccp_attach_mailbox();

// For wccpd: withdraws a command for which it doesn't wait any longer. False if tunneld has just answered it;
// the outputs are then valid.
bool wccp_withdraw_command(wccp_tunnel_mailbox *mailbox);
// For wccpd, after `command` has been set: wakes tunneld. Never blocks, and is not a cancellation point. It
// may fail silently, since tunneld also polls.
void wccp_wake_tunneld();

// For tunneld, on one thread. Without the block they return defaults, leave the outs unchanged, or do
// nothing.
uint16_t wccp_get_tunnel_command();
void wccp_get_tunnel_parameters(uint16_t *out_tunnel_id, mailbox_address *out_local,
                                mailbox_address *out_remote, uint32_t *out_index);
void wccp_get_config_paramters(uint8_t *out_group, uint32_t *out_value);
void wccp_set_fmst_index(uint32_t index);
uint32_t wccp_get_fmst_index();
// Answers a command. This is the last step, after the outputs are set. False if wccpd has withdrawn the
// command, or there is no block.
bool wccp_set_tunnel_command_status(uint32_t status);
uint32_t wccp_get_role(uint16_t policy_group); // 2, UNKNOWN, without the block
