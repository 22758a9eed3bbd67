// The block of shared memory between wccpd and tunneld, and tunneld's side of it.
//
// One command slot, one table of policy group roles. `command` hands the slot over: it is written last and
// read first, with release and acquire ordering on both sides. wccpd writes the inputs only while it is 0,
// tunneld the outputs only while it is not. A role is one 32-bit store, read at any time.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>

constexpr const char *WCCP_MAILBOX_NAME = "wccpd_mailbox";
// tunneld's datagram socket (AF_UNIX): a datagram there, of whatever content, says that a command is given.
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
    uint16_t policy_group; // its own index
    uint16_t padding;
    std::atomic<uint32_t> role; // 0 ACTIVE, 1 BACKUP, 2 UNKNOWN
};
struct wccp_tunnel_mailbox {
    std::atomic<uint16_t> command;
    uint16_t tunnel_id;
    uint32_t status; // 1 failure, any other value success
    uint32_t local_ip;
    uint32_t remote_ip;
    uint32_t fmst_index;
    uint8_t l2_group;
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

// A 16-byte address: the IPv4 value, host order, in the low 32 bits of the first word, zero in all the rest.
struct mailbox_address {
    uint64_t words[2];
};

// A field, as one access of its own width.
template <typename T>
T mailbox_get(const T &field) {
    return __atomic_load_n(&field, __ATOMIC_ACQUIRE);
}
template <typename T>
void mailbox_put(T &field, T value) {
    __atomic_store_n(&field, value, __ATOMIC_RELEASE);
}

// This process's pointer to the block, null until it has created or attached it.
extern wccp_tunnel_mailbox *wccp_mailbox;
// Attaches the block that wccpd created, if it exists and is long enough; false when there is none.
bool wccp_attach_mailbox();

// wccpd's side: takes back an add that it does not wait for any longer. False when tunneld has answered it;
// the answer is then in the outputs.
bool wccp_withdraw_command(wccp_tunnel_mailbox *mailbox);
// wccpd's side: wakes a tunneld that waits for a command, after `command` has been written. Neither blocks
// nor fails nor is a cancellation point: a tunneld that isn't woken finds the command by polling.
void wccp_wake_tunneld();

// tunneld's side. Without the block these give the defaults or do nothing.
uint16_t wccp_get_tunnel_command();
void wccp_get_tunnel_parameters(uint16_t *out_tunnel_id, mailbox_address *out_local,
                                mailbox_address *out_remote, uint32_t *out_index);
void wccp_get_config_paramters(uint8_t *out_group, uint32_t *out_value);
void wccp_set_fmst_index(uint32_t index);
uint32_t wccp_get_fmst_index();
// Comes last: it releases the waiting wccpd. False when the command had been withdrawn, or there is no block.
bool wccp_set_tunnel_command_status(uint32_t status);
uint32_t wccp_get_role(uint16_t policy_group);
