// The records of the engine: the global record wccp_g, the service groups, and what each group owns. The
// functions that work on them are declared in the headers of their own files.
//
// All of it is guarded by wccp_g.lock, the engine lock. The lock is not recursive: a function documented as
// "lock held" never takes it. be32 and be16 values are in network byte order, as on the wire, and are only
// compared for equality; all other numbers are in host order. Times are values of wccp_g.seconds, which a
// tick advances by 1.
//
// Lists are intrusive: `next` points to the following record and `prev_link` to the pointer that points here,
// so that a record can be unlinked without the list's head. New records are inserted at the head unless a
// function says otherwise.
#pragma once

#include <pthread.h>

#include <atomic>
#include <cstddef>
#include <cstdint>

#include "engine/wccp_reasons.h"
#include "runtime/byte_order.h"

constexpr uint32_t WCCP_MAX_GROUPS = 256;
constexpr uint32_t WCCP_MAX_ROUTERS = 32;
constexpr uint32_t WCCP_MAX_APPLIANCES = 32;
constexpr uint32_t WCCP_MAX_BUCKETS = 256;
constexpr uint32_t WCCP_MAX_MASK_BITS = 7;
constexpr uint32_t WCCP_MAX_MASK_VALUES = 128;
constexpr uint32_t WCCP_MAX_INTERFACES = 127;
constexpr uint32_t WCCP_IF_NAME_BYTES = 16;   // with the terminating NUL
constexpr uint32_t WCCP_PASSWORD_BYTES = 8;   // zero-padded, no terminating NUL
constexpr uint32_t WCCP_MAX_PACKET = 4096;    // bytes of a message, its header included
constexpr uint8_t WCCP_LAST_STANDARD_ID = 50; // higher service ids are dynamic services

struct cthread;
struct wccp_service_group;

enum : uint32_t { WCCP_LINK_READY = 1, WCCP_IPA_READY = 2, WCCP_ALL_READY = 3 }; // ready_flags
enum : uint32_t { WCCP_ADMIN_UP = 1, WCCP_ADMIN_DOWN = 2 };
enum : uint32_t { WCCP_METHOD_NONE = 0, WCCP_METHOD_GRE = 1, WCCP_METHOD_L2 = 2, WCCP_METHOD_EITHER = 3 };
enum : uint32_t { WCCP_ASSIGN_NONE = 0, WCCP_ASSIGN_HASH = 1, WCCP_ASSIGN_MASK = 2, WCCP_ASSIGN_EITHER = 3 };
enum : uint32_t { WCCP_COMPAT_IOS = 1, WCCP_COMPAT_NEXUS = 2 };
enum : uint32_t { WCCP_ROLE_ACTIVE = 0, WCCP_ROLE_BACKUP = 1, WCCP_ROLE_UNKNOWN = 2 };
enum : uint16_t { WCCP_ALARM_ADJACENCY = 1, WCCP_ALARM_ASSIGNMENT = 2 }; // raised_alarms
enum : uint32_t {                                                        // state_flags
    WCCP_STATE_INIT = 1,
    WCCP_STATE_ACTIVE = 2,
    WCCP_STATE_BACKUP = 4,
    WCCP_STATE_MASK = 7,
    WCCP_CAPABILITIES_SET = 8,
    WCCP_DESG_ELECT_PENDING = 16,
    WCCP_SHUTTING_DOWN = 32,
};
enum : uint32_t { // flags of a sending router
    WCCP_RTR_ONE_WAY = 1,
    WCCP_RTR_TWO_WAY = 2,
    WCCP_RTR_ASSIGN_UNACKED = 4,
    WCCP_RTR_HAS_TUNNEL = 8,
};

// A message and its cursor.
struct wccp_pkt {
    be32 ipa;        // destination, 0.0.0.0 for the group's configured ones; of a received message its source
    uint32_t length; // bytes written so far, or bytes received
    uint32_t offset; // bytes written or read so far
    uint8_t *cursor; // data + offset
    uint8_t data[WCCP_MAX_PACKET];
};

struct wccp_timer {
    uint8_t active;     // 1: running
    uint8_t mode;       // one of the two below
    uint16_t remaining; // expiries left, for WCCP_TIMER_COUNTS
    uint32_t period;    // seconds
    uint32_t countdown; // seconds to the next expiry
};
enum : uint8_t { WCCP_TIMER_REPEATS = 1, WCCP_TIMER_COUNTS = 2 };

// The budget of log lines about the packets of an interface (wccp_complaints.h). Zero-initialised.
struct wccp_complaint_budget {
    uint32_t spent;              // lines logged that have not been refilled yet
    uint32_t refill_time;        // when `spent` was last reduced
    uint32_t suppressed;         // lines suppressed since the last report of their number
    uint32_t suppressed_since;   // when the first of them was suppressed
    uint32_t suppressed_at_tick; // `suppressed` at the last tick
};

// An interface that a group uses, or the primary one. It never moves and is never removed.
struct wccp_interface {
    char name[WCCP_IF_NAME_BYTES];
    be32 ipa;
    uint32_t link_up;
    uint32_t ready_flags;
    int32_t ucast_fd; // -1: closed. Both change under the descriptor lock of wccp_packet_io.cpp
    int32_t mcast_fd; // and the engine lock
    uint32_t ucast_bound;
    uint32_t mcast_bound;
    cthread *rx_thread;         // set once; stays set when the thread has ended
    wccp_service_group *groups; // linked by if_next
    uint32_t stop_count;
    uint32_t start_count;
    uint32_t link_down_count;
    uint32_t ipa_change_count;
    wccp_complaint_budget complaints;
    int32_t device;         // the kernel's index of the device when the sockets were opened, 0 for none
    be32 mcast_bound_ipa;   // the address that mcast_fd is bound to
    uint32_t network_flaws; // the parts of the socket set-up that failed
    uint32_t network_tried; // time of the last attempt
    int32_t network_error;  // errno of the last set-up or join that failed
};
enum : uint32_t { WCCP_FLAW_SOCKETS = 1, WCCP_FLAW_JOIN = 2 }; // network_flaws

// An appliance in the designated appliance's table.
struct wccp_dsg_appliance {
    be32 ipa;
    uint8_t up; // 0: it has left since the last computation
    uint16_t weight;
    uint16_t assigned; // hash buckets or mask values
};

struct wccp_mask {
    uint32_t src_ip, dst_ip;
    uint16_t src_port, dst_port;
};
struct wccp_mask_value {
    uint32_t src_ip, dst_ip;
    uint16_t src_port, dst_port;
    be32 appliance_ipa;
};

// Whether all sending routers listed an appliance when the table was last computed.
enum wccp_appliance_listing : uint8_t { WCCP_LISTED_BY_ALL, WCCP_NOT_LISTED_BY_ALL, WCCP_NOT_LISTED_LOGGED };

// An entry of the group's views, the unions of what its routers report.
struct wccp_view_appliance {
    wccp_view_appliance *next, **prev_link;
    be32 ipa;
    uint16_t weight;
    uint16_t ref_count; // sending routers that report it
    wccp_appliance_listing listing;
};
struct wccp_view_router {
    wccp_view_router *next, **prev_link;
    be32 ipa;
    uint16_t ref_count; // sending routers that report it
};

// An entry of one router's last report.
struct wccp_rtr_view_router {
    be32 ipa;
    uint32_t flags; // bit 0: used by the view update
};
struct wccp_rtr_view_appliance {
    be32 ipa;
    uint16_t weight;
    uint32_t flags;            // bit 0: used by the view update
    uint16_t buckets_assigned; // hash buckets or mask values
    uint16_t buckets_total;
    uint32_t bucket_bits[8]; // hash: words in host order; mask: value i is bit i mod 8 of byte i / 8
};

struct wccp_sending_router {
    wccp_sending_router *next, **prev_link;
    be32 router_id;
    be32 src_ipa;
    be32 receive_id; // both are sent back as received
    be32 change_number;
    uint32_t last_icu_time;               // of its last I-See-You
    uint32_t state_time;                  // when it became one-way or two-way
    uint32_t flags;                       // WCCP_RTR_*
    uint8_t cap_fwd, cap_assign, cap_ret; // what it offers, as bit sets: bit 0 is method 1, bit 1 method 2
    uint32_t assign_tx_count; // Redirect-Assign messages that have named it since the key last changed
    uint32_t view_router_count;
    uint32_t view_appliance_count;
    wccp_rtr_view_router view_routers[WCCP_MAX_ROUTERS];
    wccp_rtr_view_appliance view_appliances[WCCP_MAX_APPLIANCES];
    uint32_t map_src_ip, map_dst_ip; // the masks of its last Assignment Map
    uint16_t map_src_port, map_dst_port;
    uint16_t self_buckets;  // buckets or values that it assigns to this appliance
    uint16_t total_buckets; // and to all appliances
    bool map_in_order;      // its last map has this group's masks, and the values in this group's order
};

// A Here-I-Am that is sent in reply to a Removal Query.
struct wccp_removal_reply {
    wccp_removal_reply *next, **prev_link;
    uint8_t tx_left;
    wccp_pkt pkt;
};

struct wccp_service_group {
    wccp_service_group *next, **prev_link;
    wccp_service_group *if_next, **if_prev_link;
    uint8_t id;
    uint8_t if_count;
    wccp_interface *interfaces[WCCP_MAX_INTERFACES];
    uint8_t priority;
    uint8_t protocol;
    uint32_t service_flags;
    uint32_t mask_src_ip, mask_dst_ip;
    uint16_t mask_src_port, mask_dst_port;
    uint32_t mask_bits;
    uint32_t security_option; // 0 none, 1 MD5
    char password[WCCP_PASSWORD_BYTES];
    uint16_t weight;
    uint32_t mcast_configured;
    be32 mcast_ipa;
    uint16_t ucast_router_count;
    be32 ucast_routers[WCCP_MAX_ROUTERS];
    uint32_t cfg_fwd_method;
    uint32_t cfg_assign_method;
    uint32_t admin_state;
    uint32_t force_l2_return;
    be32 appliance_ipa;
    uint32_t compat_mode;
    uint32_t fwd_method;
    uint32_t assign_method;
    uint32_t ret_method;
    uint32_t change_number;
    uint32_t state_flags;
    uint32_t state_time;
    uint32_t designated;
    // The assignment block, cleared as a whole by wccp_clear_assignment_block: from here ...
    uint32_t dsg_appliance_count;
    uint32_t dsg_active_count;
    wccp_dsg_appliance dsg_appliances[WCCP_MAX_APPLIANCES];
    uint32_t bucket_count;
    be32 bucket_ipa[WCCP_MAX_BUCKETS];
    uint8_t bucket_index[WCCP_MAX_BUCKETS];
    uint32_t mask_value_bits;
    wccp_mask mask_in_use;
    uint32_t mask_bit_count;
    wccp_mask mask_bit_array[WCCP_MAX_MASK_BITS + 1];
    uint32_t mask_value_count;
    wccp_mask_value mask_values[WCCP_MAX_MASK_VALUES];
    uint32_t dsg_key_change;
    uint8_t pending_acks; // ... to here
    uint8_t redirecting_routers;
    uint32_t appliance_view_count;
    wccp_view_appliance *appliance_view;
    uint32_t not_listed_count; // appliances that the last computation left out
    uint32_t not_listed_time;  // when all of them were last logged
    uint32_t sending_router_count;
    wccp_sending_router *sending_routers;
    uint32_t router_view_count;
    wccp_view_router *router_view;
    uint32_t removal_reply_count;
    wccp_removal_reply *removal_replies;
    wccp_timer hia_timer;
    wccp_timer assign_timer;
    wccp_timer monitor_timer;
    wccp_timer router_alarm_timer;
    wccp_timer assign_alarm_timer;
    wccp_pkt *tx_pkt; // owned; rebuilt for each Here-I-Am and Redirect-Assign
    uint16_t raised_alarms;
    uint32_t transitions;
    uint32_t rx_icus;
    uint32_t rx_removal_queries;
    uint32_t tx_here_i_am;
    uint32_t tx_redirect_assign;
    uint32_t tx_removal_replies;
    uint32_t tx_link_drops;
    uint32_t routers_timed_out;
    uint32_t alarm_router_sched;
    uint32_t alarm_assign_sched;
    uint32_t rx_unknown_capabilities;
    uint32_t rx_failures;
    uint32_t rx_icu_failures;
    uint32_t rx_removal_failures;
    uint32_t tx_failures;
    uint32_t tx_build_failures;
    uint32_t tx_send_errors; // destinations that the kernel refused; not part of tx_failures
    uint32_t rx_auth_failures;
    uint32_t rx_auth_mismatches;
    uint32_t rx_service_mismatches;
    uint32_t start_time; // when it was last started or stopped
    wccp_reason reasons[WCCP_GROUP_REASONS];
};

struct wccp_global {
    pthread_mutex_t lock;
    uint32_t seconds;
    uint32_t group_count;
    wccp_service_group *groups[WCCP_MAX_GROUPS];
    wccp_service_group *group_list;
    uint8_t if_count;
    wccp_interface interfaces[WCCP_MAX_INTERFACES];
    wccp_interface *primary_if;
    uint32_t track_primary;
    uint8_t mcast_ttl;
    std::atomic<uint32_t> stat_allocs; // these three are counted without the lock as well
    std::atomic<uint32_t> stat_frees;
    std::atomic<uint32_t> stat_alloc_fails;
    uint32_t rx_failures;
    wccp_reason reasons[WCCP_OTHER_REASONS]; // of packets that belong to no group
};
extern wccp_global wccp_g;

// The parameters of a group, filled by configuration. The engine copies them and keeps no pointer.
struct wccp_grp_config {
    uint32_t config_flags; // WCCP_CFG_*, the field that a modification changes
    uint8_t group_id;
    uint8_t priority;
    uint8_t protocol;
    char password[WCCP_PASSWORD_BYTES + 1];
    uint16_t router_count;
    be32 routers[WCCP_MAX_ROUTERS];
    uint16_t weight;
    uint32_t admin;
    uint32_t fwd_method;
    uint32_t assign_method;
    uint32_t hash_src_ip, hash_dst_ip, hash_src_port, hash_dst_port;
    uint32_t mask_src_ip, mask_dst_ip;
    uint16_t mask_src_port, mask_dst_port;
    uint32_t force_l2_return;
    uint8_t interface_set;
    char interface[WCCP_IF_NAME_BYTES];
    uint32_t compatibility;
};
