// All metrics, in the order of the output. metric_place() finds a family by name, at compile time;
// docs/metrics.md lists the same names.
#pragma once

#include <cstddef>
#include <string_view>

enum class metric_kind { gauge, counter, info };
struct metric_family {
    std::string_view name; // without the suffix of its kind: "_total" of a counter, "_info" of an info
    metric_kind kind;
    std::string_view labels; // separated by blanks; a sample may leave out the first
    std::string_view help;
};

inline constexpr metric_family metric_families[] = {
    {"wccp_daemon_up", metric_kind::gauge, "daemon", "Whether the daemon answers."},
    {"wccp_build", metric_kind::info, "version", "The version of wccpd."},
    {"wccp_process_restarts", metric_kind::counter, "process",
     "How often the daemon has been started again since the start of mgmtd."},
    {"wccp_alarms", metric_kind::gauge, "", "Alarms that are active."},
    {"wccp_alarm_active", metric_kind::gauge, "alarm source", "1 for each active alarm."},

    // Groups.
    {"wccp_group_enabled", metric_kind::gauge, "group",
     "Whether the group is enabled. It is not while it is drained or has left its routers."},
    {"wccp_group_active", metric_kind::gauge, "group", "Whether the role of this appliance is ACTIVE."},
    {"wccp_group_designated", metric_kind::gauge, "group",
     "Whether this appliance is the designated one of the group."},
    {"wccp_group_uptime_seconds", metric_kind::gauge, "group",
     "Time since the role became ACTIVE or BACKUP, 0 in any other state."},
    {"wccp_group_weight", metric_kind::gauge, "group", "Weight that this appliance announces."},
    {"wccp_group_configured_routers", metric_kind::gauge, "group",
     "Routers that are configured, 0 for a multicast address."},
    {"wccp_group_routers", metric_kind::gauge, "group", "Routers that answer."},
    {"wccp_group_appliances", metric_kind::gauge, "group", "Appliances that the routers report."},
    {"wccp_group_pending_acks", metric_kind::gauge, "group",
     "Routers that have not acknowledged the assignment sent last."},
    {"wccp_group_rx_icus", metric_kind::counter, "group", "I-See-You messages received."},
    {"wccp_group_rx_icu_failures", metric_kind::counter, "group",
     "I-See-You messages whose contents were refused."},
    {"wccp_group_rx_removal_queries", metric_kind::counter, "group", "Removal Query messages received."},
    {"wccp_group_rx_removal_failures", metric_kind::counter, "group",
     "Removal Query messages whose contents were refused."},
    {"wccp_group_rx_failures", metric_kind::counter, "group",
     "Messages refused because of the group's security."},
    {"wccp_group_rx_auth_failures", metric_kind::counter, "group", "Messages with another password."},
    {"wccp_group_rx_auth_mismatches", metric_kind::counter, "group",
     "Messages with security where none is configured, or without where it is."},
    {"wccp_group_rx_service_mismatches", metric_kind::counter, "group",
     "Messages whose priority, protocol or flags differ from the group's."},
    {"wccp_group_rx_unknown_capabilities", metric_kind::counter, "group", "Unknown capabilities received."},
    {"wccp_group_tx_here_i_am", metric_kind::counter, "group", "Here-I-Am messages sent."},
    {"wccp_group_tx_redirect_assign", metric_kind::counter, "group", "Redirect-Assign messages sent."},
    {"wccp_group_tx_removal_replies", metric_kind::counter, "group",
     "Here-I-Am messages sent in answer to Removal Queries."},
    {"wccp_group_tx_failures", metric_kind::counter, "group",
     "Messages that could not be built or sent, not counting those dropped without a link."},
    {"wccp_group_tx_build_failures", metric_kind::counter, "group", "Messages that could not be built."},
    {"wccp_group_tx_send_errors", metric_kind::counter, "group", "Messages that the kernel refused to send."},
    {"wccp_group_tx_link_drops", metric_kind::counter, "group",
     "Messages not sent because the interface had no link or no address."},
    {"wccp_group_routers_timed_out", metric_kind::counter, "group",
     "Routers lost after 40 seconds without an I-See-You."},
    {"wccp_group_transitions", metric_kind::counter, "group", "Changes of the role to ACTIVE or BACKUP."},
    {"wccp_group_view_changes", metric_kind::counter, "group",
     "Changes of the routers and appliances in this appliance's view."},
    {"wccp_group_adjacency_checks", metric_kind::counter, "group",
     "Checks scheduled for the adjacency alarm."},
    {"wccp_group_assignment_checks", metric_kind::counter, "group",
     "Checks scheduled for the assignment alarm."},

    // Routers and appliances of a group.
    {"wccp_router_two_way", metric_kind::gauge, "group router address",
     "Whether the router reports this appliance."},
    {"wccp_router_heard_seconds", metric_kind::gauge, "group router address",
     "Time since the router's last I-See-You."},
    {"wccp_router_connected_seconds", metric_kind::gauge, "group router address",
     "Time since the router became one-way or two-way."},
    {"wccp_router_own_buckets", metric_kind::gauge, "group router address",
     "Hash buckets or mask values that the router assigns to this appliance."},
    {"wccp_router_buckets", metric_kind::gauge, "group router address",
     "Hash buckets or mask values that the router assigns to any appliance."},
    {"wccp_appliance_weight", metric_kind::gauge, "group appliance",
     "Weight of an appliance as the routers report it."},

    // What keeps a group, or packets of no group, from working.
    {"wccp_reason_occurrences", metric_kind::gauge, "group reason sender",
     "How often an active reason has occurred."},
    {"wccp_reason_last_seconds", metric_kind::gauge, "group reason sender",
     "Time since the reason last occurred."},

    // wccpd as a whole.
    {"wccp_interface_ready", metric_kind::gauge, "interface", "Whether it has a link and an address."},
    {"wccp_interface_starts", metric_kind::counter, "interface",
     "How often its groups were started after a change of the link or address."},
    {"wccp_interface_stops", metric_kind::counter, "interface",
     "How often its groups were stopped for a change of the link or address."},
    {"wccp_interface_link_downs", metric_kind::counter, "interface", "How often the link was lost."},
    {"wccp_interface_address_changes", metric_kind::counter, "interface", "Changes of the address."},
    {"wccp_rx_failures", metric_kind::counter, "", "Messages refused, of any group or of none."},
    {"wccp_allocations", metric_kind::counter, "", "Blocks of memory that the engine has allocated."},
    {"wccp_frees", metric_kind::counter, "", "Blocks of memory that the engine has freed."},
    {"wccp_allocation_failures", metric_kind::counter, "", "Allocations of the engine that failed."},

    // Tunnels.
    {"wccp_data_plane", metric_kind::info, "plane", "How redirected packets are carried."},
    {"wccp_tunnel", metric_kind::info, "tunnel router interface",
     "Router and interface of a tunnel by its number, which only this appliance uses."},
    {"wccp_tunnel_received_packets", metric_kind::counter, "tunnel",
     "Packets that the router redirected through the tunnel."},
    {"wccp_tunnel_received_bytes", metric_kind::counter, "tunnel",
     "Bytes that the router redirected through the tunnel."},
    {"wccp_tunnel_returned_packets", metric_kind::counter, "tunnel",
     "Packets returned to the router through the tunnel."},
    {"wccp_tunnel_returned_bytes", metric_kind::counter, "tunnel",
     "Bytes returned to the router through the tunnel."},
    {"wccp_tunnel_fragments", metric_kind::counter, "tunnel", "Fragments of GRE packets received."},
    {"wccp_tunnel_refused_packets", metric_kind::counter, "tunnel reason",
     "GRE packets from the tunnel's router that were refused."},
    {"wccp_tunnel_sorted_packets", metric_kind::counter, "tunnel way",
     "Redirected packets by their outcome; way=in counts all of them."},
    {"wccp_tunnel_sorted_bytes", metric_kind::counter, "tunnel way",
     "Redirected bytes by their outcome; way=in counts all of them."},
    {"wccp_gre_refused_packets", metric_kind::counter, "reason",
     "GRE packets that belong to no tunnel, by the reason for their refusal."},
    {"wccp_gre_refused_source_packets", metric_kind::counter, "source",
     "GRE packets from addresses that are not accepted as routers."},
    {"wccp_own_packets", metric_kind::counter, "",
     "Redirected packets that this appliance itself had sent; they are returned."},
    {"wccp_clamped_syn_acks", metric_kind::counter, "",
     "SYN-ACKs whose segment size was lowered to fit the tunnel."},

    // Intercepts.
    {"wccp_intercept_active", metric_kind::gauge, "group",
     "Whether the group's role lets new flows go to the proxy."},
    {"wccp_intercept_left", metric_kind::gauge, "group",
     "Whether the group has left its routers because of its proxy."},
    {"wccp_intercept_overloaded", metric_kind::gauge, "group",
     "Whether the proxy has more flows than its limit."},
    {"wccp_intercept_weight_ratio", metric_kind::gauge, "group",
     "Part of the configured weight that is announced, below 1 during a slow start."},
    {"wccp_intercept_flows", metric_kind::gauge, "group", "Connections that the proxy has."},
    {"wccp_intercept_packets", metric_kind::counter, "group way",
     "Redirected packets by their outcome; way=in counts all of them."},
    {"wccp_intercept_bytes", metric_kind::counter, "group way",
     "Redirected bytes by their outcome; way=in counts all of them."},
    {"wccp_proxy_up", metric_kind::gauge, "group",
     "Whether the proxy passes its health check; absent until that is known."},
    {"wccp_proxy_state_seconds", metric_kind::gauge, "group",
     "Time since the result of the health check changed."},

    // Packets of flows that another appliance's proxy has.
    {"wccp_protection_covered", metric_kind::gauge, "group",
     "Whether established flows of the group are protected when buckets move."},
    {"wccp_protection_packets", metric_kind::counter, "appliance way",
     "Packets exchanged with another appliance: passed to it; received from it, and of these delivered to "
     "the "
     "proxy or returned."},
};

// The place of a family in the table.
consteval size_t metric_place(std::string_view name) {
    for (size_t i = 0; i < sizeof metric_families / sizeof *metric_families; i++)
        if (metric_families[i].name == name)
            return i;
    throw "no such metric";
}
