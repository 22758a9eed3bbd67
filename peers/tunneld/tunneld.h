// tunneld: the tunnel daemon of the appliance, as far as wccpd sees it. It takes commands from the mailbox,
// answers them with indices of its own, keeps a table of its tunnels and prints each command.
#pragma once

#include <cstdint>
#include <cstdio>
#include <map>
#include <optional>
#include <string>

struct tunneld_options {
    uint32_t first_index = 1; // index of the first tunnel, rising from there; WCCP_NO_INDEX gives none to any
    uint32_t slow_ms = 0;     // time that a command takes
    bool refuse = false;      // every command fails
    bool silent = false;      // no command is answered
    bool json = false;        // one JSON object a line
    bool roles = false;       // changes of policy group roles are printed too
};

struct tunneld_tunnel {
    uint32_t local, remote; // host order
    uint32_t index;
};

// A command as it stood in the mailbox.
struct tunneld_command {
    uint16_t code;
    uint16_t tunnel_id;
    uint32_t local, remote, index;
    uint8_t l2_group;
    uint32_t l2_value;
    bool operator==(const tunneld_command &) const = default;
};

struct tunneld {
    tunneld_options options;
    FILE *out = stdout;
    bool attached = false;
    uint32_t next_index = 0;
    std::map<uint16_t, tunneld_tunnel> tunnels; // by tunnel id
    std::optional<tunneld_command> passed_over; // the command that is left unanswered, printed once
    std::map<uint16_t, uint32_t> roles;         // of policy groups, where not UNKNOWN
};

// False, with a line in the log, when shared memory cannot be used.
bool tunneld_start(tunneld *daemon, const tunneld_options &options, FILE *out);
// Takes the pending command, if there is one. False when there was nothing to do.
bool tunneld_step(tunneld *daemon);
// Until SIGTERM, SIGINT or SIGHUP, which the caller has blocked.
void tunneld_run(tunneld *daemon);
