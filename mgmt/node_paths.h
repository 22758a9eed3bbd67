// The names of nodes, events and actions that more than one program uses, and the numbers of the alarm types.
// They are macros so that they can be extended to longer literals: NODE_GROUP_CONFIG "/*/weight".
#pragma once

// --- Configuration nodes
#define NODE_WCCPD "/qv/wccpd"
#define NODE_WCCPD_CONFIG NODE_WCCPD "/system/config"
#define NODE_MCAST_TTL NODE_WCCPD_CONFIG "/mcast_ttl"
#define NODE_GROUP_CONFIG NODE_WCCPD "/wccp/srv_grp/config"     // service groups, by id
#define NODE_POLICY_CONFIG NODE_WCCPD "/wccp/policy_grp/config" // policy groups, by number
#define NODE_SYSTEM_CONFIG "/qv/tunneld/system/config"
#define NODE_SYSTEM_MODE NODE_SYSTEM_CONFIG "/mode"
#define NODE_SYSTEM_BONDING NODE_SYSTEM_CONFIG "/bonding"
#define NODE_SYSTEM_10G NODE_SYSTEM_CONFIG "/10g"
#define NODE_INTERCEPT_CONFIG "/qv/tunneld/intercept/config" // by service group
#define NODE_BYPASS_CONFIG "/qv/tunneld/bypass/config"       // by prefix
#define NODE_ACCEPT_CONFIG "/qv/tunneld/accept/config"       // by address
#define NODE_PROTECTION_CONFIG "/qv/tunneld/protection/config"
#define NODE_PROTECTION_TIME                                                                                 \
    NODE_PROTECTION_CONFIG "/time" // seconds for which flows are protected; 0: not at all
#define NODE_DRAIN_TIME "/qv/tunneld/drain/config/time" // seconds that a drain may take
#define NODE_SYSLOG "/logging/syslog"
#define NODE_SYSLOG_FACILITY NODE_SYSLOG "/facility"
#define NODE_SYSTEM_FACILITY NODE_SYSLOG_FACILITY "/system"

// --- State nodes of wccpd
#define NODE_WCCPD_STATE NODE_WCCPD "/system/state"
#define NODE_WCCPD_STATUS NODE_WCCPD_STATE "/is_alive"
#define NODE_WCCPD_VERSION NODE_WCCPD_STATE "/version"
#define NODE_GROUP_STATE NODE_WCCPD "/wccp/srv_grp/state"

// --- State nodes of tunneld
#define NODE_PLANE_STATE "/qv/tunneld/plane/state"
#define NODE_TUNNEL_STATE "/qv/tunneld/tunnel/state"       // by tunnel id
#define NODE_INTERCEPT_STATE "/qv/tunneld/intercept/state" // by service group
#define NODE_PROTECTION_STATE "/qv/tunneld/protection/state"

// --- State nodes of mgmtd
#define NODE_ALARM_STATE "/qv/alarms/state"
#define NODE_ALARMS_RAISED NODE_ALARM_STATE "/raised" // by type and source
#define NODE_ROLES NODE_ALARM_STATE "/role"           // by group
#define NODE_LEFT_GROUPS NODE_ALARM_STATE "/left"     // groups that have left their routers for now, by id
#define NODE_DRAINS NODE_ALARM_STATE "/drain"         // groups that an operator drains or has drained, by id
#define NODE_PROCESSES NODE_ALARM_STATE "/process"    // the daemons, by name

#define NODE_CONFIG_STATE "/mgmtd/config/state"
#define NODE_CONFIG_TEXT NODE_CONFIG_STATE "/text" // the configuration in the format of its file
#define NODE_COMMITS NODE_CONFIG_STATE "/commit"   // the commits in the history, by number

// --- Events
#define EVENT_CONFIG_CHANGE "/mgmtd/notify/dbchange" // after each commit
#define EVENT_RAISE_ALARM "/qv/alarms/events/raise_alarm"
#define EVENT_CLEAR_ALARM "/qv/alarms/events/clear_alarm"
#define EVENT_ROLE_CHANGE "/qv/state/events/role_change"
// From tunneld: a group is to leave its routers, or to join them again, without a configuration change.
#define EVENT_GROUP_LEAVE "/qv/tunneld/events/group_leave"
#define EVENT_GROUP_JOIN "/qv/tunneld/events/group_join"
#define EVENT_PROXY_CHANGE "/qv/tunneld/events/proxy_change"
#define EVENT_GROUP_WEIGHT "/qv/tunneld/events/group_weight"     // the percentage of its weight to announce
#define EVENT_DRAIN_PROGRESS "/qv/tunneld/events/drain_progress" // the number of flows that are left
// From mgmtd: a drain begins, changes or ends. NODE_DRAINS has the current ones.
#define EVENT_DRAIN "/qv/tunneld/events/drain"
#define EVENT_PROCESS_CRASH "/pm/events/failure/crash"
#define EVENT_PROCESS_EXIT "/pm/events/failure/unexpected_exit"
#define EVENT_PROCESS_TERMINATE "/pm/events/proc/terminate"
#define EVENT_TIME_ZONE "/time/notify/zonechange"

// The changes in the event of a commit: EVENT_CHANGES "/1", EVENT_CHANGES "/2" and so on, each with bindings
// below it.
#define EVENT_CHANGES "/mgmtd/notification/dbchange"

// --- Actions of mgmtd
#define ACTION_ADD_INTEREST "/mgmtd/events/actions/interest/add"
#define ACTION_REMOVE_INTEREST "/mgmtd/events/actions/interest/remove"
#define ACTION_CONFIRM "/mgmtd/config/actions/confirm"
#define ACTION_REPORT_PROCESS "/mgmtd/process/actions/report"
#define ACTION_DRAIN "/qv/tunneld/drain/actions/begin"
#define ACTION_DRAIN_CANCEL "/qv/tunneld/drain/actions/cancel"

// --- Alarm types
#define ALARM_TYPE_ADJACENCY 196638  // no router reports this appliance
#define ALARM_TYPE_ASSIGNMENT 196639 // the table of a router differs from that of the designated appliance
#define ALARM_TYPE_OVERLOAD 196640   // a proxy has more flows than its intercept allows
#define ALARM_TYPE_RESTARTS 196641   // a daemon is restarted again and again
