// The event loop of the program and its decisions.
//
// wccpd sends a datagram when it has put a command into the mailbox. Since a datagram can get lost and wccpd
// waits no longer than two seconds for the answer, the mailbox is also polled four times a second. If the
// wake-up socket could not be opened, the mailbox is polled every millisecond for a second after a command,
// since more commands usually follow, and less often later. Periodic work is done on the same timer.
//
// A killed tunneld leaves its interfaces, routes and rules, and the next one takes them over. Until that one
// has read the configuration, however long this takes, it executes the commands that add and delete tunnels
// but leaves the sorting rules as they are. Flows that are being served therefore continue.
#include "peers/tunneld/tunneld.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <ifaddrs.h>
#include <net/if.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <ctime>

#include <nlohmann/json.hpp>

#include "peers/tunneld/kernel_state.h"
#include "peers/tunneld/protection.h"
#include "platform/tunnel_mailbox.h"
#include "runtime/capabilities.h"
#include "runtime/common.h"
#include "runtime/logging.h"
#include "runtime/loop_host.h"
#include "runtime/service_notify.h"
#include "runtime/ttime.h"

namespace {

constexpr uint32_t COMPONENT_TUNNELD = 257u << 16;
constexpr int64_t RETRY_FIRST_MS = 1000, RETRY_MAX_MS = 30000;
constexpr uint32_t ROLE_ACTIVE = 0;
constexpr int64_t EARLIER_END_MS = 10000; // how long the end of an earlier tunneld is waited for

std::vector<uint32_t> find_own_addresses() {
    std::vector<uint32_t> out;
    ifaddrs *list = nullptr;
    if (getifaddrs(&list) != 0)
        return out;
    for (const ifaddrs *entry = list; entry; entry = entry->ifa_next) {
        if (!entry->ifa_addr || entry->ifa_addr->sa_family != AF_INET || (entry->ifa_flags & IFF_LOOPBACK))
            continue;
        const auto *address = reinterpret_cast<const sockaddr_in *>(entry->ifa_addr);
        out.push_back(ntohl(address->sin_addr.s_addr));
    }
    freeifaddrs(list);
    std::sort(out.begin(), out.end());
    return out;
}

// --- Reconciliation of the kernel

appliance_view view_appliance(const tunneld &daemon) {
    appliance_view view;
    for (const auto &[id, tunnel] : daemon.desk.tunnels)
        view.tunnels[id] = {tunnel.local, tunnel.remote};
    view.groups = daemon.configured.groups;
    for (const auto &[group, forced] : daemon.forced_l2)
        if (const auto found = view.groups.find(group); found != view.groups.end())
            found->second.force_l2_return = forced;
    view.intercepts = daemon.configured.intercepts;
    for (const auto &[group, rules] : view.intercepts) {
        const auto followed = daemon.followed.find(group);
        // While the program ends, no group counts as draining: `down drop` would drop packets that must be
        // returned.
        view.conditions[group] = {is_proxy_up(daemon, group, rules), is_active_group(daemon, group),
                                  daemon.configured.drains.contains(group) && daemon.end_at_ms < 0,
                                  followed != daemon.followed.end() && followed->second.decided.overloaded};
    }
    for (const lingering_link &each : daemon.lingering)
        view.lingering.push_back(each.tunnel);
    // The end of a bypass is a time of day, not of the monotonic clock.
    const int64_t now = time(nullptr);
    for (const bypass_entry &entry : daemon.configured.bypasses)
        if (entry.until == 0 || entry.until > now)
            view.bypasses.push_back(entry);
    view.accepted = daemon.configured.accepted;
    view.protections = find_protections(daemon.owners, view.groups, daemon.configured.protection_s);
    view.own_addresses = daemon.own_addresses;
    return view;
}

void report_failure(tunneld *daemon, const std::string &error) {
    if (!error.empty()) {
        // The pause doubles with each failure: the cause may last, and each attempt lists all tables of the
        // kernel.
        daemon->retry_delay_ms = std::clamp(daemon->retry_delay_ms * 2, RETRY_FIRST_MS, RETRY_MAX_MS);
        daemon->again_at_ms = lt_monotonic_ms() + daemon->retry_delay_ms;
        if (error != daemon->failure)
            LC_LOG(LC_LOG_ERR, "The kernel is not as wanted: %s", error.c_str());
    } else {
        if (!daemon->failure.empty())
            LC_LOG(LC_LOG_NOTICE, "The kernel is as wanted again");
        daemon->retry_delay_ms = 0;
        daemon->again_at_ms = lt_monotonic_ms() + VERIFY_MS;
    }
    daemon->failure = error;
}

// Interfaces come and go: only the indices that the last reconciliation has found are valid.
void note_indices(tunneld *daemon) {
    for (auto &[id, tunnel] : daemon->desk.tunnels) {
        tunnel.index = WCCP_NO_INDEX;
        for (const wanted_link &link : daemon->links)
            if (const auto index = daemon->indices.find(link.name);
                link.wish.kind == link_kind::tunnel && link.wish.local == tunnel.local &&
                link.wish.remote == tunnel.remote && index != daemon->indices.end())
                tunnel.index = index->second;
    }
}

// Brings the kernel to the state that is wanted now. Without a change since the last call it only does so
// when a retry or the next verification is due.
void reconcile_now(tunneld *daemon) {
    if (daemon->plane == &table_plane)
        return;
    wanted_state wanted = make_wanted_state(view_appliance(*daemon), daemon->links,
                                            daemon->plane == &user_plane, daemon->takes_over);
    if (daemon->applied == wanted && lt_monotonic_ms() < daemon->again_at_ms)
        return;
    std::string error;
    (void)(daemon->takes_over ? reconcile_kernel_links : reconcile_kernel_state)(*daemon->plane, wanted,
                                                                                 &daemon->indices, &error);
    report_failure(daemon, error);
    const passing_table none;
    // For the next tunneld. During a take-over the file still has what the earlier one has passed on.
    if (!daemon->takes_over && wanted.passing != (daemon->applied ? daemon->applied->passing : none))
        save_passing(wanted.passing);
    // Also after a failure: links keep their numbers, by which the next attempt finds them.
    daemon->links = wanted.links;
    daemon->applied = std::move(wanted);
    note_indices(daemon);
}

// Replaces the sorting rules of the earlier tunneld once everything that the new ones need is known. Which
// groups redirect by L2 is known only when wccpd has named their routers; if it names none, or does not run,
// the wait ends after TAKE_OVER_WAIT_MS.
void end_take_over(tunneld *daemon) {
    if (!daemon->takes_over || daemon->configured_ms < 0)
        return;
    const auto &groups = daemon->configured.groups;
    const bool has_router = std::any_of(groups.begin(), groups.end(),
                                        [](const auto &group) { return !group.second.routers.empty(); });
    // Without any group there is no router to wait for.
    if (!has_router && !groups.empty() && lt_monotonic_ms() < daemon->configured_ms + TAKE_OVER_WAIT_MS)
        return;
    // The next call of reconcile_now() applies everything, even if the wanted state is the same.
    daemon->takes_over = false;
    daemon->applied.reset();
}

bool has_ends(const command_desk &desk, const tunnel_ends &ends) {
    return std::any_of(desk.tunnels.begin(), desk.tunnels.end(), [&](const auto &each) {
        return each.second.local == ends.local && each.second.remote == ends.remote;
    });
}

// `wanted`, or the next lower one that is free; below 0 it wraps around.
uint16_t find_free_tunnel_id(const tunneld &daemon, uint16_t wanted) {
    // Ends, since there are far fewer tunnels than ids.
    for (uint16_t id = wanted;; id--)
        if (!daemon.desk.tunnels.contains(id) &&
            std::ranges::none_of(daemon.lingering, [id](const auto &each) { return each.tunnel.id == id; }))
            return id;
}

// The link of a deleted tunnel stays for LINGER_MS, and its new flows are returned.
void let_links_linger(tunneld *daemon) {
    const int64_t until_ms = lt_monotonic_ms() + LINGER_MS;
    std::erase_if(daemon->lingering,
                  [&](const lingering_link &each) { return has_ends(daemon->desk, each.tunnel.ends); });
    for (const wanted_link &link : daemon->links) {
        const tunnel_ends ends = {link.wish.local, link.wish.remote};
        const bool known = std::any_of(daemon->lingering.begin(), daemon->lingering.end(),
                                       [&](const lingering_link &each) { return each.tunnel.ends == ends; });
        // Unless a group has been ACTIVE, no router sends anything that could still arrive.
        if (daemon->active_ms >= 0 && link.wish.kind == link_kind::tunnel && !known &&
            !has_ends(daemon->desk, ends))
            daemon->lingering.push_back(
                {{find_free_tunnel_id(*daemon, link.wish.tunnel_id), ends}, until_ms});
    }
}

// Makes the tunnels of the command table.
void apply_tunnels(tunneld *daemon) {
    let_links_linger(daemon);
    // An unchanged table is applied as well: wccpd may order a tunnel again that others have removed.
    daemon->applied.reset();
    reconcile_now(daemon);
}

// --- Health

void follow_health(tunneld *daemon) {
    const int64_t now = lt_monotonic_ms();
    const auto &states = health_states(daemon->health);
    for (const auto &[group, rules] : daemon->configured.intercepts) {
        const auto state = states.find(group);
        // A proxy that has not been checked yet neither begins an outage nor ends one.
        if (state == states.end() || state->second.state == proxy_health::unknown)
            continue;
        if (state->second.state == proxy_health::up) {
            const auto outage = daemon->outages.find(group);
            if (outage == daemon->outages.end())
                continue;
            if (outage->second.left) {
                LC_LOG(LC_LOG_NOTICE, "Group %d joins its routers again: the proxy is up", group);
                mgmt_link_group_joins(daemon->management, group);
            }
            daemon->outages.erase(outage);
            continue;
        }
        outage &down = daemon->outages.try_emplace(group, outage{now, false}).first->second;
        // The operator has changed the intercept while the group was away.
        if (down.left && rules.leave_after_s == 0) {
            LC_LOG(LC_LOG_NOTICE, "Group %d joins its routers again: its leave time is 0 now", group);
            mgmt_link_group_joins(daemon->management, group);
            down = {now, false};
        }
        if (down.left || rules.leave_after_s == 0 ||
            now - down.since_ms < int64_t{rules.leave_after_s} * 1000)
            continue;
        down.left = true;
        LC_LOG(LC_LOG_WARNING, "Group %d leaves its routers: the proxy has been down for %u s: %s", group,
               rules.leave_after_s, state->second.reason.c_str());
        mgmt_link_group_leaves(daemon->management, group, "proxy down: " + state->second.reason);
    }
}

// Reports all of them to a new session. mgmtd may still have what an earlier tunneld has reported.
void report_outages(tunneld *daemon) {
    const auto &states = health_states(daemon->health);
    for (const auto &[group, state] : states) {
        const auto outage = daemon->outages.find(group);
        if (outage != daemon->outages.end() && outage->second.left)
            mgmt_link_group_leaves(daemon->management, group, "proxy down: " + state.reason);
        else if (state.state == proxy_health::up)
            mgmt_link_group_joins(daemon->management, group);
    }
}

void proxy_changed(tunneld *daemon, uint8_t group) {
    const auto &states = health_states(daemon->health);
    const auto found = states.find(group);
    if (found == states.end() || found->second.state == proxy_health::unknown)
        return;
    const bool up = found->second.state == proxy_health::up;
    LC_LOG(up ? LC_LOG_NOTICE : LC_LOG_WARNING, "Group %d: the proxy is %s%s%s", group, up ? "up" : "down",
           up ? "" : ": ", up ? "" : found->second.reason.c_str());
    mgmt_link_proxy_changed(daemon->management, group, up, found->second.reason);
    // An earlier tunneld may have reported that the group leaves.
    if (up && !daemon->outages.contains(group))
        mgmt_link_group_joins(daemon->management, group);
    follow_health(daemon);
    reconcile_now(daemon);
}

// --- Configuration and roles

void read_roles(tunneld *daemon) {
    std::map<uint16_t, bool> roles;
    for (const auto &[group, rules] : daemon->configured.intercepts)
        if (const auto found = daemon->configured.groups.find(group);
            found != daemon->configured.groups.end() && found->second.policy_group != 0)
            roles[found->second.policy_group] = wccp_get_role(found->second.policy_group) == ROLE_ACTIVE;
    daemon->roles = std::move(roles);
}

void take_configuration(tunneld *daemon, const configured_view &view) {
    daemon->configured = view;
    if (daemon->configured_ms < 0)
        daemon->configured_ms = lt_monotonic_ms();
    // From now on, reconciling the kernel replaces the earlier tunneld's rules.
    end_take_over(daemon);
    daemon->own_addresses = find_own_addresses();
    for (auto it = daemon->outages.begin(); it != daemon->outages.end();) {
        if (view.intercepts.contains(it->first)) {
            ++it;
            continue;
        }
        // Without its intercept nothing keeps the group from its routers.
        mgmt_link_group_joins(daemon->management, it->first);
        it = daemon->outages.erase(it);
    }
    std::erase_if(daemon->forced_l2, [&](const auto &entry) { return !view.groups.contains(entry.first); });
    keep_owners_of(&daemon->owners, view.groups);
    health_set_checks(daemon->health, view.intercepts);
    read_roles(daemon);
    report_outages(daemon);
    reconcile_now(daemon);
    daemon->last_command_ms = lt_monotonic_ms(); // commands may follow
}

void take_owners_text(tunneld *daemon, uint8_t group, const std::string &text) {
    if (take_owners(&daemon->owners, group, text, daemon->configured.protection_s))
        reconcile_now(daemon);
}

// The roles that a killed wccpd has reported are no longer valid. Until the next wccpd reports that a group
// is ACTIVE, its new flows are returned and its existing flows continue.
void forget_old_roles(tunneld *daemon) {
    const command_desk &desk = daemon->desk;
    if (desk.wccpd_lives && desk.wccpd_pid == daemon->roles_of_pid)
        return;
    // 0 while no wccpd runs. Its end and the start of the next one are two changes.
    const int32_t pid = desk.wccpd_lives ? desk.wccpd_pid : 0;
    if (daemon->roles_of_pid == pid)
        return;
    daemon->roles_of_pid = pid;
    for (auto &[id, group] : daemon->configured.groups)
        group.active = group.alone = false;
    if (daemon->management)
        mgmt_link_forget_roles(daemon->management);
}

void note_activity(tunneld *daemon, int64_t now) {
    for (const auto &[id, group] : daemon->configured.groups)
        if (group.active)
            daemon->active_ms = now;
}

// --- The loop

void do_periodic_work(tunneld *daemon, int64_t now) {
    watch_wccpd(&daemon->desk, now);
    forget_old_roles(daemon);
    note_activity(daemon, now);
    drop_unordered(&daemon->desk, now);
    std::erase_if(daemon->lingering, [&](const lingering_link &each) { return now >= each.until_ms; });
    end_take_over(daemon);
    if (daemon->desk.options.roles && daemon->desk.attached)
        print_roles(&daemon->desk);
    // All facts first, then the decisions that depend on them, and the kernel last.
    read_roles(daemon);
    follow_health(daemon);
    daemon->own_addresses = find_own_addresses();
    follow_groups(daemon);
    reconcile_now(daemon);
    if (now >= daemon->look_at_counters_ms) {
        note_occurrences(daemon);
        if (daemon->plane->follow_devices)
            daemon->plane->follow_devices();
        daemon->look_at_counters_ms = now + OCCURRENCE_LOOK_MS;
    }
    if (now >= daemon->alive_at_ms && service_watchdog_ms() >= 0) {
        service_report("WATCHDOG=1");
        // Several times within the limit, so that one late call does not end the program.
        daemon->alive_at_ms = now + service_watchdog_ms() / 4;
    }
}

void poll_mailbox(int, short, void *data) {
    auto *daemon = static_cast<tunneld *>(data);
    const int64_t now = lt_monotonic_ms();
    bool end = false;
    // Before the command: it may come from a wccpd whose start has not been noticed yet.
    if (now >= daemon->tick_at_ms) {
        daemon->tick_at_ms = now + TICK_MS;
        do_periodic_work(daemon, now);
    }
    if (take_command(&daemon->desk, &end)) {
        daemon->last_command_ms = now;
        if (daemon->management)
            mgmt_link_ask_routers(daemon->management); // a new tunnel can belong to a new router
    }
    if (daemon->end_at_ms >= 0 && now >= daemon->end_at_ms)
        LOG_STATUS(lew_escape_from_dispatch(daemon->loop));
    const int64_t pause =
        mailbox_pause_ms(daemon->desk.attached, daemon->wake_up >= 0, now - daemon->last_command_ms);
    LOG_STATUS(loop_event_set_timer(daemon->mailbox_timer, pause));
}

// The datagrams are read before the mailbox: one that arrives afterwards causes another call.
void take_wake_up(int fd, short, void *data) {
    take_wake_ups(fd);
    poll_mailbox(-1, 0, data);
}

// When the program may end. After wccpd has left its routers they still send for a moment, and their packets
// are returned. A wccpd that still runs has left no router: it has to notice at once that tunneld ends.
int64_t find_end_time(tunneld *daemon, int64_t now) {
    watch_wccpd(&daemon->desk, now);
    if (daemon->plane == &table_plane || daemon->active_ms < 0 || daemon->desk.wccpd_lives)
        return now;
    int64_t end = daemon->active_ms + TICK_MS + LINGER_MS; // `active_ms` is up to a tick old
    for (const lingering_link &each : daemon->lingering)
        end = std::max(end, each.until_ms);
    return end;
}

lc_status take_signal(int number, short, void *data, lew *loop) {
    auto *daemon = static_cast<tunneld *>(data);
    const int64_t now = lt_monotonic_ms(), end = find_end_time(daemon, now);
    LC_LOG(LC_LOG_INFO, "Received %s", lc_signal_num_to_name(number));
    // The second signal ends the program at once.
    if (daemon->end_at_ms >= 0 || end <= now)
        return lew_escape_from_dispatch(loop);
    LC_LOG(LC_LOG_NOTICE, "Routers may still send: their packets are returned for %lld ms",
           static_cast<long long>(end - now));
    daemon->end_at_ms = end;
    reconcile_now(daemon);
    return LC_OK;
}

// --- Start and end

// The privileges that data planes need and this process lacks, or "".
std::string missing_privileges() {
    static const struct {
        int capability;
        const char *name;
    } needed[] = {{CAP_NET_ADMIN, "CAP_NET_ADMIN"}, {CAP_NET_RAW, "CAP_NET_RAW"}};
    std::string out;
    for (const auto &each : needed)
        if (!lc_has_capability(each.capability))
            out += (out.empty() ? "" : ", ") + std::string(each.name);
    return out;
}

bool choose_plane(tunneld *daemon) {
    std::string reasons;
    for (const data_plane *plane : data_planes) {
        // The table carries nothing, and is used only on request.
        if (daemon->options.plane == "auto" ? plane == &table_plane : daemon->options.plane != plane->name)
            continue;
        std::string why_not;
        if (plane->probe(&why_not) && plane->open(&why_not)) {
            daemon->plane = plane;
            break;
        }
        reasons += (reasons.empty() ? "" : "; ") + std::string(plane->name) + ": " + why_not;
    }
    daemon->plane_reason = reasons;
    if (!daemon->plane) {
        if (const std::string missing = missing_privileges(); !missing.empty())
            reasons += "; missing privileges: " + missing;
        fprintf(stderr, "tunneld: no data plane works here: %s\n", reasons.c_str());
        LC_LOG(LC_LOG_ERR, "No data plane works here: %s", reasons.c_str());
        return false;
    }
    LC_LOG(LC_LOG_NOTICE, "Data plane: %s%s%s", daemon->plane->name,
           reasons.empty() ? "" : "; not used: ", reasons.c_str());
    print_line(daemon->desk, {{"event", "plane"}, {"name", daemon->plane->name}, {"not_used", reasons}},
               std::string("data plane ") + daemon->plane->name +
                   (reasons.empty() ? "" : " (not used: " + reasons + ")"));
    return true;
}

// Takes over what a killed tunneld has left. Of two links with the same tunnel id the later one counts: it
// was replacing the other.
void take_over_kernel_state(tunneld *daemon) {
    daemon->owners = load_owners();
    daemon->links = find_own_links();
    daemon->takes_over = !daemon->links.empty() || is_kernel_state_left();
    if (!daemon->takes_over)
        return;
    for (const wanted_link &link : daemon->links)
        if (link.wish.kind == link_kind::tunnel)
            daemon->desk.tunnels[link.wish.tunnel_id] = {link.wish.local, link.wish.remote, WCCP_NO_INDEX};
    // Until the configuration has been read, sources that the earlier tunneld has accepted stay accepted.
    for (const wanted_link &link : daemon->links)
        if (const auto beside = daemon->desk.tunnels.find(link.wish.tunnel_id);
            link.wish.kind == link_kind::accepted && beside != daemon->desk.tunnels.end())
            daemon->configured.accepted.push_back({link.wish.remote, beside->second.remote});
    LC_LOG(LC_LOG_NOTICE, "%zu tunnels are taken over", daemon->desk.tunnels.size());
    reconcile_now(daemon);
    // Only after the links have been made, to which the table refers.
    if (daemon->plane->set_passing)
        daemon->plane->set_passing(load_passing());
}

void start_plane(tunneld *daemon) {
    daemon->lack = probe_sorting_rules();
    if (!daemon->lack.empty())
        LC_LOG(LC_LOG_ERR, "Packets cannot be sorted, and all of them are returned: %s",
               daemon->lack.c_str());
    daemon->desk.apply = [daemon](std::map<uint16_t, command_tunnel> *) { apply_tunnels(daemon); };
    daemon->desk.set_l2_return = [daemon](uint8_t group, bool forced) {
        daemon->forced_l2[group] = forced;
        reconcile_now(daemon);
    };
    take_over_kernel_state(daemon);
}

bool start_parts(tunneld *daemon) {
    loop_context *context = nullptr;
    if (lew_init(&daemon->loop) != LC_OK || lew_get_event_context(daemon->loop, &context) != LC_OK ||
        loop_event_new(context, poll_mailbox, daemon, &daemon->mailbox_timer) != LC_OK)
        return false;
    daemon->wake_up = open_wake_up();
    if (daemon->wake_up >= 0 &&
        (loop_event_new(context, take_wake_up, daemon, &daemon->wake_up_event) != LC_OK ||
         loop_event_set_fd(daemon->wake_up_event, daemon->wake_up, LOOP_READ) != LC_OK))
        return false;
    static lew_event *slots[3];
    size_t taken = 0;
    for (const int number : {SIGTERM, SIGINT, SIGHUP})
        if (lew_event_reg_signal(daemon->loop, &slots[taken++], number, take_signal, daemon) != LC_OK)
            return false;
    if (!start_commands(&daemon->desk, daemon->options.commands, stdout) || !choose_plane(daemon))
        return false;
    daemon->health = health_new(context, [daemon](uint8_t group) { proxy_changed(daemon, group); });
    if (daemon->plane != &table_plane)
        start_plane(daemon);
    if (daemon->options.commands.silent) // for tests: a program that hangs has no session either
        return true;
    daemon->management = mgmt_link_new(
        daemon->loop,
        {[daemon](const configured_view &view) { take_configuration(daemon, view); },
         [daemon] { return tunneld_state(daemon); },
         [daemon](uint8_t group, const std::string &text) { take_owners_text(daemon, group, text); }});
    return daemon->management != nullptr;
}

// If two tunnelds ran, the one that ends would remove what the other has taken over. A killed tunneld
// releases the lock at once, one that ends in order, for example after the loss of its mgmtd, a moment later.
// False when another one still runs. A lock file that cannot be made is only logged: packets are carried all
// the same.
bool take_process_lock(int *out_fd) {
    (void)mkdir("/run/tunneld", 0755);
    *out_fd = open("/run/tunneld/lock", O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    if (*out_fd < 0) {
        LC_LOG(LC_LOG_WARNING, "/run/tunneld/lock: %s", strerror(errno));
        return true;
    }
    const int64_t until = lt_monotonic_ms() + EARLIER_END_MS;
    while (flock(*out_fd, LOCK_EX | LOCK_NB) != 0) {
        if (lt_monotonic_ms() >= until) {
            fprintf(stderr, "tunneld: another tunneld runs here\n");
            LC_LOG(LC_LOG_ERR, "Another tunneld runs here");
            return false;
        }
        const timespec pause = {0, 20'000'000};
        nanosleep(&pause, nullptr);
    }
    return true;
}

void end_parts(tunneld *daemon) {
    if (daemon->health)
        health_free(daemon->health);
    std::string error;
    if (daemon->plane && daemon->plane != &table_plane && !remove_kernel_state(*daemon->plane, &error))
        LC_LOG(LC_LOG_ERR, "Not everything could be removed from the kernel: %s", error.c_str());
    if (daemon->management)
        mgmt_link_ends(daemon->management); // nothing is left for the next tunneld to take over
    if (daemon->plane) {
        forget_wccpd();
        daemon->plane->close();
    }
    if (daemon->management)
        mgmt_link_free(daemon->management);
    if (daemon->mailbox_timer)
        loop_event_free(&daemon->mailbox_timer);
    if (daemon->wake_up_event)
        loop_event_free(&daemon->wake_up_event);
    close_wake_up(&daemon->wake_up);
    if (daemon->loop) {
        (void)lew_delete_all_events(daemon->loop);
        (void)lew_deinit(&daemon->loop);
    }
}

} // namespace

// Before its first check a proxy counts as up, so that a restart of tunneld interrupts nothing. With `down
// drop` it counts as down: no packet may get past the proxy there.
bool is_proxy_up(const tunneld &daemon, uint8_t group, const intercept &rules) {
    const auto &states = health_states(daemon.health);
    const auto found = states.find(group);
    if (found == states.end() || found->second.state == proxy_health::unknown)
        return !rules.drop_when_down;
    return found->second.state == proxy_health::up;
}

bool is_active_group(const tunneld &daemon, uint8_t group) {
    const auto found = daemon.configured.groups.find(group);
    if (found == daemon.configured.groups.end())
        return true; // not configured: there is no role to wait for
    if (!found->second.active || !daemon.desk.wccpd_lives || daemon.end_at_ms >= 0)
        return false;
    if (found->second.policy_group == 0)
        return true;
    const auto role = daemon.roles.find(found->second.policy_group);
    return role != daemon.roles.end() && role->second;
}

// Until the first packet has come, routers are assumed to send redirect headers, as most of them do.
std::map<uint8_t, group_cover> protection_cover(const tunneld &daemon, const plane_counters &plane) {
    uint64_t packets = 0, headers = 0;
    for (const wanted_link &link : daemon.links)
        if (const auto found = plane.links.find(link.name);
            found != plane.links.end() && link.wish.kind == link_kind::tunnel) {
            packets += found->second.packets_in;
            headers += found->second.redirect_headers;
        }
    return find_covers(view_appliance(daemon), daemon.plane == &user_plane,
                       daemon.configured.protection_s != 0, packets == 0 || headers != 0);
}

int run_tunneld(const tunneld_options &options) {
    int lock = -1;
    lc_init();
    lc_log_init("tunneld", nullptr, 0, COMPONENT_TUNNELD, LC_LOG_INFO,
                lc_log_get_facility(nullptr, "tunneld"), 1);
    // A write to a session that the other side has closed is an error, not the end of the program.
    signal(SIGPIPE, SIG_IGN);
    service_open();
    tunneld daemon;
    daemon.options = options;
    daemon.desk.options = options.commands;
    daemon.last_command_ms = lt_monotonic_ms();
    bool good = take_process_lock(&lock) && start_parts(&daemon);
    if (good) {
        service_report("READY=1");
        // The first call sets the timer, which repeats it.
        poll_mailbox(-1, 0, &daemon);
        good = lew_dispatch(daemon.loop, nullptr, nullptr) == LC_OK;
        service_report("STOPPING=1");
    }
    end_parts(&daemon);
    if (lock >= 0)
        close(lock);
    lc_log_close();
    return good ? 0 : 1;
}
