// tunneld as wccpd sees it: takes commands from the mailbox, keeps the table of tunnels, answers and prints
// each command. What a tunnel is made of is the caller's: `apply` is called after each change of the table.
#pragma once

#include <cstdint>
#include <cstdio>
#include <functional>
#include <map>
#include <optional>
#include <string>

#include <nlohmann/json_fwd.hpp>

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
    // Makes what the table says, and fills in the indices of tunnels that have none yet. Null: indices are
    // handed out from `first_index`.
    std::function<void(std::map<uint16_t, command_tunnel> *tunnels)> apply;
    std::function<void(uint8_t group, bool forced)> set_l2_return;

    bool attached = false;
    uint32_t next_index = 0;
    std::map<uint16_t, command_tunnel> tunnels;
    std::map<uint16_t, bool> ordered;           // tunnel ids that the present wccpd has ordered
    std::optional<mailbox_command> passed_over; // the command that is left unanswered, printed once
    std::map<uint16_t, uint32_t> roles;         // of policy groups, where not UNKNOWN
};

// False, with a line in the log, when shared memory cannot be used.
bool start_commands(command_desk *desk, const command_options &options, FILE *out);
// Takes the pending command, if there is one. False when there was nothing to do. `out_end` is set when a
// signal came while the command was under way.
bool take_command(command_desk *desk, bool *out_end);
// The time to the next look at the mailbox, by the time since the last command or the start.
int64_t mailbox_pause_ms(bool attached, int64_t quiet_ms);
void print_roles(command_desk *desk);
// One line to `out`: the object, or the text.
void print_line(const command_desk &desk, const nlohmann::ordered_json &line, const std::string &text);
