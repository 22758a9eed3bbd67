// The side of tunneld that wccpd sees: takes commands from the mailbox, keeps the table of tunnels, answers
// and prints each command. The caller makes the tunnels: `apply` is called after each change of the table.
// Also keeps track of which wccpd has ordered the tunnels; those that a new wccpd does not order again are
// removed.
#pragma once

#include <cstdint>
#include <cstdio>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>

#include <nlohmann/json_fwd.hpp>

// How long after the start of a new wccpd tunnels stay that it has not ordered again.
constexpr int64_t UNORDERED_MS = 60000;
// Keeps the process id of the wccpd that has ordered the tunnels, for the next tunneld.
constexpr char WCCPD_FILE[] = "/run/tunneld/wccpd";

struct command_options {
    uint32_t first_index = 1; // without `apply`: index of the first tunnel; WCCP_NO_INDEX: no tunnel gets one
    uint32_t slow_ms = 0;     // how long each command takes
    bool refuse = false;      // every command fails
    bool silent = false;      // no command is answered
    bool json = false;        // prints one JSON object for each line
    bool roles = false;       // also prints changes of policy group roles
};

struct command_tunnel {
    uint32_t local, remote; // host order
    uint32_t index;         // of the interface
};

// A command as read from the mailbox; addresses in host order.
struct mailbox_command {
    uint16_t code;
    uint16_t tunnel_id;
    uint32_t local, remote, index;
    uint8_t l2_group;
    uint32_t l2_value;
    bool operator==(const mailbox_command &) const = default;
};

struct command_desk {
    command_options options;
    FILE *out = stdout;
    // Makes the tunnels of the table and fills in their indices: WCCP_NO_INDEX for a tunnel without an
    // interface. Null: no tunnels are made, and indices are assigned from `first_index` on.
    std::function<void(std::map<uint16_t, command_tunnel> *tunnels)> apply;
    std::function<void(uint8_t group, bool forced)> set_l2_return;

    bool attached = false;
    uint32_t next_index = 0;
    std::map<uint16_t, command_tunnel> tunnels;
    std::set<uint16_t> ordered;                 // tunnel ids that the running wccpd has ordered
    std::optional<mailbox_command> passed_over; // with `silent`: the pending command, once it was printed
    std::map<uint16_t, uint32_t> roles;         // by policy group, without UNKNOWN ones
    int32_t wccpd_pid = 0;                      // of the wccpd that has ordered the tunnels; 0: unknown
    bool wccpd_lives = false;                   // by the last watch_wccpd()
    int64_t unordered_until_ms = -1;            // when drop_unordered() removes tunnels; -1: never
};

// False, with a line in the log, when shared memory cannot be used.
bool start_commands(command_desk *desk, const command_options &options, FILE *out);
// Executes and answers the pending command. False when there is none, and with `silent`. `out_end`: a signal
// has interrupted the command, which happens only with `slow_ms`.
bool take_command(command_desk *desk, bool *out_end);
// Notices that a new wccpd has been started. To be called about once a second; take_command() also does it,
// because the first command of a new wccpd can come before that.
void watch_wccpd(command_desk *desk, int64_t now_ms);
// Removes the tunnels that the new wccpd has not ordered within UNORDERED_MS.
void drop_unordered(command_desk *desk, int64_t now_ms);
// Removes WCCPD_FILE. For an orderly end, which leaves no tunnels.
void forget_wccpd();
// Opens the socket at which wccpd wakes this process (platform/tunnel_mailbox.h); replaces one that a killed
// tunneld has left. -1, with a line in the log, when it cannot be opened. The caller holds the lock that
// keeps a second tunneld from running.
int open_wake_up();
void take_wake_ups(int fd); // reads all datagrams
void close_wake_up(int *inout_fd);
// How long to wait before the next poll of the mailbox. `quiet_ms`: time since the last command or the start.
// `is_woken`: the wake-up socket is open, and polling only covers lost datagrams.
int64_t mailbox_pause_ms(bool attached, bool is_woken, int64_t quiet_ms);
// Prints the roles of policy groups that have changed since the last call.
void print_roles(command_desk *desk);
// Prints one line to `desk.out`: the object with `json`, otherwise the text.
void print_line(const command_desk &desk, const nlohmann::ordered_json &line, const std::string &text);
