// The program, composed of its parts. Commands and roles come from the mailbox, the configuration from mgmtd,
// the health of proxies from checks. After each change the wanted state of the kernel is computed from all of
// these, and the kernel is reconciled with it. All of it runs in one thread with an event loop; the data
// plane `user` has a second thread.
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
// The sorting rules that a killed tunneld has left stay until the configuration has been read and wccpd has
// named a router. This is how long a router is waited for.
constexpr int64_t TAKE_OVER_WAIT_MS = 10000;
// How often the kernel is compared with the wanted state when nothing has changed here: others may have
// changed it.
constexpr int64_t VERIFY_MS = 30000;

// How long links stay after wccpd has deleted their tunnels or has ended: routers still send for a moment.
constexpr int64_t LINGER_MS = 5000;

struct tunneld_options {
    command_options commands;
    std::string plane = "auto"; // or the name of a data plane
};

// An intercept whose proxy is down.
struct outage {
    int64_t since_ms; // monotonic
    bool left;        // the group has left its routers for this reason
};

struct lingering_link {
    lingering_tunnel tunnel;
    int64_t until_ms;
};
// A group with an intercept or a drain: its slow start, its limit and the progress of its drain.
struct followed_group {
    course memory;
    course_decision decided;
    uint32_t flows = 0; // of its proxy, by the last count
    // Reported to mgmtd in this session. An earlier tunneld may have reported something else.
    uint32_t reported_percent = 0; // 0: nothing yet
    bool reported_overload = false;
    std::optional<std::pair<uint32_t, bool>> reported_progress; // remaining flows, and whether it is empty
};

struct tunneld {
    tunneld_options options;
    command_desk desk;
    const data_plane *plane = nullptr;
    std::string plane_reason; // why the planes before it in the table could not be used
    std::string lack;         // what the sorting rules need and the kernel lacks, or ""

    lew *loop = nullptr;
    loop_event *mailbox_timer = nullptr, *wake_up_event = nullptr;
    int wake_up = -1; // the socket at which wccpd wakes this process, or -1
    mgmt_link *management = nullptr;
    health_monitor *health = nullptr;

    configured_view configured;
    int64_t configured_ms = -1; // when the configuration was read for the first time
    bool takes_over = false;    // the sorting rules of an earlier tunneld are still in place
    int64_t tick_at_ms = 0, last_command_ms = 0, alive_at_ms = 0;
    std::map<uint8_t, bool> forced_l2; // by group, from commands; overrides the configuration
    std::map<uint16_t, bool> roles;    // by policy group, of groups with an intercept: whether it is ACTIVE
    std::map<uint8_t, outage> outages;
    std::vector<uint32_t> own_addresses;
    owners_table owners;
    std::map<uint8_t, followed_group> followed;
    uint32_t reported_session = 0; // to which the `reported_` values of `followed` belong
    std::string uncounted;         // why flows could not be counted, or ""

    int32_t roles_of_pid = 0;              // process id of the wccpd that has reported the groups' roles
    int64_t active_ms = -1;                // the last time a group was ACTIVE
    std::vector<lingering_link> lingering; // of deleted tunnels
    int64_t end_at_ms = -1;                // after a signal: when the program ends

    std::vector<wanted_link> links; // as last wanted; before that, as found at the start
    std::optional<wanted_state> applied;
    std::map<std::string, uint32_t> indices;     // of the links' interfaces, by name
    std::string failure;                         // of the last reconciliation, or ""
    int64_t again_at_ms = 0, retry_delay_ms = 0; // of the next reconciliation without a change
    occurrences occurred;
    int64_t look_at_counters_ms = 0; // when the counters are read next
};

// Updates the slow starts, drains and limits of all groups. To be called once a second.
void follow_groups(tunneld *daemon);
// Whether new flows of the group may go to its proxy: wccpd runs, a router assigns packets to this appliance,
// and the policy group, if there is one, has the role ACTIVE.
bool is_active_group(const tunneld &daemon, uint8_t group);
bool is_proxy_up(const tunneld &daemon, uint8_t group, const intercept &rules);
// Whether each group's flows are protected.
std::map<uint8_t, group_cover> protection_cover(const tunneld &daemon, const plane_counters &plane);
// Runs the program until a signal ends it. Returns its exit code.
int run_tunneld(const tunneld_options &options);
// The state nodes, in the order in which a walk lists them. Notes occurrences first.
std::vector<state_node> tunneld_state(tunneld *daemon);
// Reads the counters, and updates `occurred`.
void note_occurrences(tunneld *daemon);
