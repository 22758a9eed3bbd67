// tunneld as wccpd sees it: takes commands from the mailbox, keeps the table of tunnels, answers and prints
// each command. What a tunnel is made of is the caller's: `apply` is called after each change of the table.
// Also knows which wccpd has ordered the tunnels: those that a new one doesn't order go after a time.
#pragma once

#include <cstdint>
#include <cstdio>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>

#include <nlohmann/json_fwd.hpp>

// Tunnels that a new wccpd does not order go after this time.
constexpr int64_t UNORDERED_MS = 60000;
// The process id of the wccpd that the tunnels were ordered by, for the next tunneld.
constexpr char WCCPD_FILE[] = "/run/tunneld/wccpd";

struct command_options {
    uint32_t first_index = 1; // without `apply`: index of the first tunnel, WCCP_NO_INDEX gives none to any
    uint32_t slow_ms = 0;     // time that a command takes
    bool refuse = false;      // every command fails
    bool silent = false;      // no command is answered
    bool json = false;        // one JSON object a line
    bool roles = false;       // changes of policy group roles are printed too
};

struct command_tunnel {
    uint32_t local, remote; // host order
    uint32_t index;         // of the interface
};

// A command as it was found in the mailbox.
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
    // Makes what the table says, and fills in the indices: WCCP_NO_INDEX where there is no interface. Null:
    // indices are handed out from `first_index`.
    std::function<void(std::map<uint16_t, command_tunnel> *tunnels)> apply;
    std::function<void(uint8_t group, bool forced)> set_l2_return;

    bool attached = false;
    uint32_t next_index = 0;
    std::map<uint16_t, command_tunnel> tunnels;
    std::set<uint16_t> ordered;                 // tunnel ids that the present wccpd has ordered
    std::optional<mailbox_command> passed_over; // the command that is left unanswered, printed once
    std::map<uint16_t, uint32_t> roles;         // of policy groups, where not UNKNOWN
    int32_t wccpd_pid = 0;                      // that the tunnels were ordered by; 0 unknown
    bool wccpd_lives = false;                   // by the last look
    int64_t unordered_until_ms = -1;            // -1: no tunnel waits to be ordered anew
};

// False, with a line in the log, when shared memory cannot be used.
bool start_commands(command_desk *desk, const command_options &options, FILE *out);
// Takes the pending command, if there is one. False when there was nothing to do. `out_end` is set when a
// signal came while the command was under way.
bool take_command(command_desk *desk, bool *out_end);
// Looks whether wccpd has been started anew. To be called now and then; take_command() does it too, before it
// takes a command of a wccpd that has only just been started.
void watch_wccpd(command_desk *desk, int64_t now_ms);
// Removes the tunnels whose time is over.
void drop_unordered(command_desk *desk, int64_t now_ms);
// At an orderly end, after which there are no tunnels.
void forget_wccpd();
// The socket by which wccpd wakes this process (platform/tunnel_mailbox.h), in the place of one that a killed
// tunneld has left; -1, with a line in the log, when there can't be one. The caller holds the lock that keeps
// other tunnelds away.
int open_wake_up();
void take_wake_ups(int fd);
void close_wake_up(int *inout_fd);
// The time to the next look at the mailbox, by the time since the last command or the start. `is_woken`: a
// command comes with a wake-up, and looking for one is a second chance.
int64_t mailbox_pause_ms(bool attached, bool is_woken, int64_t quiet_ms);
void print_roles(command_desk *desk);
// One line to `out`: the object, or the text.
void print_line(const command_desk &desk, const nlohmann::ordered_json &line, const std::string &text);
