// tunneld: composes its parts. Commands and roles come from the mailbox, the configuration from mgmtd, the
// health of proxies from checks; what follows from these for the kernel is computed anew after each change,
// and reconciled. One thread with a loop; the user-space data plane has one of its own.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "peers/tunneld/commands.h"
#include "peers/tunneld/course.h"
#include "peers/tunneld/health.h"
#include "peers/tunneld/occurrences.h"
#include "peers/tunneld/plane.h"
#include "peers/tunneld/protection.h"
#include "peers/tunneld/session.h"
#include "peers/tunneld/slot_owners.h"
#include "peers/tunneld/sorting_rules.h"
#include "peers/tunneld/wanted_state.h"

constexpr int64_t TICK_MS = 1000;
// How packets are sorted stays as a killed tunneld has left it until the configuration has been read and
// wccpd has named a router; for the latter, so long at most.
constexpr int64_t TAKE_OVER_WAIT_MS = 10000;
// Between looks whether somebody else has changed what is ours in the kernel.
constexpr int64_t VERIFY_MS = 30000;

// After wccpd has deleted a tunnel, or has ended: routers need a moment to follow.
constexpr int64_t LINGER_MS = 5000;

struct tunneld_options {
    command_options commands;
    std::string plane = "auto"; // or the name of one
};

// An intercept whose proxy is down.
struct outage {
    int64_t since_ms; // monotonic
    bool left;        // the group has left its routers because of it
};

struct lingering_link {
    lingering_tunnel tunnel;
    int64_t until_ms;
};
// A group that is not followed by its configuration alone.
struct followed_group {
    course memory;
    course_decision decided;
    uint32_t flows = 0;
    // Of what mgmtd has heard in this session.
    uint32_t reported_percent = 0; // 0: nothing; a tunneld before may have reported another
    bool reported_overload = false;
    std::optional<std::pair<uint32_t, bool>> reported_progress; // flows left, and whether it is empty
};

struct tunneld {
    tunneld_options options;
    command_desk desk;
    const data_plane *plane = nullptr;
    std::string plane_reason; // why no plane before it in the table could be used
    std::string lack;         // what the kernel lacks for sorting packets, or ""

    lew *loop = nullptr;
    loop_event *mailbox_timer = nullptr, *wake_up_event = nullptr;
    int wake_up = -1; // the socket, -1 for none
    mgmt_link *management = nullptr;
    health_monitor *health = nullptr;

    configured_view configured;
    int64_t configured_ms = -1; // when it was read first
    bool takes_over = false;    // and sorts as the tunneld before did
    int64_t tick_at_ms = 0, last_command_ms = 0, alive_at_ms = 0;
    std::map<uint8_t, bool> forced_l2; // by command, which wins over the configuration
    std::map<uint16_t, bool> roles;    // of the policy groups of groups with an intercept: ACTIVE
    std::map<uint8_t, outage> outages;
    std::vector<uint32_t> own_addresses;
    owners_table owners;
    std::map<uint8_t, followed_group> followed;
    uint32_t reported_session = 0; // that `followed` speaks of
    std::string uncounted;         // why flows could not be counted, or ""

    int32_t roles_of_pid = 0;              // the wccpd whose roles of groups are known
    int64_t active_ms = -1;                // when a group was ACTIVE last
    std::vector<lingering_link> lingering; // of tunnels that have been deleted
    int64_t end_at_ms = -1;                // the program has been told to end, and waits until then

    std::vector<wanted_link> links; // that are there, or were wanted last
    std::optional<wanted_state> applied;
    std::map<std::string, uint32_t> indices; // of the links
    std::string failure;                     // of the last reconciling, or ""
    int64_t again_at_ms = 0, retry_delay_ms = 0;
    occurrences occurred;
    int64_t look_at_counters_ms = 0;
};

// Slow starts, drains and limits of all groups: to call once a second.
void follow_groups(tunneld *daemon);
// Whether new flows of the group may go to its proxy: wccpd runs, a router assigns to this appliance, and no
// role of a policy group is against it.
bool is_active_group(const tunneld &daemon, uint8_t group);
bool is_proxy_up(const tunneld &daemon, uint8_t group, const intercept &rules);
// Of each group whether its flows are protected.
std::map<uint8_t, group_cover> protection_cover(const tunneld &daemon, const plane_counters &plane);
// The program, until a signal ends it. The exit code.
int run_tunneld(const tunneld_options &options);
// The state nodes, in the order of a walk.
std::vector<state_node> tunneld_state(tunneld *daemon);
// Looks at the counters, and at what lasts.
void note_occurrences(tunneld *daemon);
