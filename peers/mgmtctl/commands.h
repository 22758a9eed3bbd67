// The commands of mgmtctl, their options and their exit codes.
#pragma once

#include <string>
#include <vector>

#include "peers/mgmtctl/session.h"

// Scripts rely on these.
enum ctl_exit : int {
    CTL_OK = 0,
    CTL_REFUSED = 1,      // mgmtd or wccpd refused; nothing was changed
    CTL_USAGE = 2,        // the command line
    CTL_UNREACHABLE = 3,  // no mgmtd, no answer, or the session was lost
    CTL_NOT_FOUND = 4,    // no such node or group
    CTL_PARTLY = 5,       // no longer used: every command is one commit
    CTL_WOULD_CHANGE = 1, // apply --check: there is a difference; every failure is 2
    CTL_ALARM = 6,        // alarms --check: an alarm is active
    CTL_OUTPUT = 7,       // standard output could not be written completely
};

struct ctl_options {
    bool json = false;
    bool watch = false;
    bool secrets = false; // passwords are shown
    int colour = -1;      // 1 yes, 0 no, -1 when standard output is a terminal
    int below = 0;        // rows at the top of the terminal that another program uses
    std::string html;     // the file that show writes a page to, "-" for standard output; empty: none
    int64_t timeout_ms = 10'000;
    std::string cause; // of commits, for the history: the command and its verb
};

// One function for each command. It prints its output and returns the exit code.

// Nodes by their names (node_cli.cpp).
int ctl_get(const ctl_options &options, const std::vector<std::string> &names);
int ctl_walk_nodes(const ctl_options &options, const std::string &name, ctl_walk how);
// `words` are NAME VALUE, or NAME=VALUE...; `existing`: no group, policy group or router is made.
int ctl_change_nodes(const ctl_options &options, const std::vector<std::string> &words, bool existing);
int ctl_delete(const ctl_options &options, const std::vector<std::string> &names);
int ctl_alarms(const ctl_options &options, bool check);
// Prints nothing but completions, even on failure: the shell calls it while somebody types.
int ctl_complete(const std::string &word);

// Groups in an operator's words (group_cli.cpp): "group add 51 interface eth0 router 10.0.0.1 weight 100".
// `words` follow "group" or "policy".
int ctl_group(const ctl_options &options, const std::vector<std::string> &words);
int ctl_policy(const ctl_options &options, const std::vector<std::string> &words);

// Redirected packets (traffic_cli.cpp): "intercept add 51 port 80 to 3128".
int ctl_intercept(const ctl_options &options, const std::vector<std::string> &words);
int ctl_bypass(const ctl_options &options, const std::vector<std::string> &words);
int ctl_tunnel(const ctl_options &options, const std::vector<std::string> &words);
// Groups emptied before they leave their routers (drain.cpp): "drain 51 for 60 wait".
int ctl_drain(const ctl_options &options, const std::vector<std::string> &words);

// The configuration as a whole (config_cli.cpp).
struct ctl_apply_options {
    bool check = false;           // only report whether it would change anything
    bool yes = false;             // don't ask
    bool merge = false;           // nodes that the file doesn't name stay
    uint32_t confirm_minutes = 0; // until it is undone, unless "mgmtctl confirm" follows; 0: it stays
};
constexpr uint32_t CTL_CONFIRM_MAX_MINUTES = 7 * 24 * 60;
// `file`: mgmtd's format or JSON; "-" is standard input.
int ctl_apply(const ctl_options &options, const std::string &file, const ctl_apply_options &how);
int ctl_confirm(const ctl_options &options);
int ctl_export(const ctl_options &options);
int ctl_history(const ctl_options &options);
// Numbers of commits; 0: not given.
int ctl_diff(const ctl_options &options, uint32_t from, uint32_t to);
int ctl_rollback(const ctl_options &options, uint32_t number);
// How long packets of flows whose slots have moved are passed on to their former owners: "protection time
// 300".
int ctl_protection(const ctl_options &options, const std::vector<std::string> &words);

// Metrics: to standard output, or the answer to an HTTP request there (metrics_http.cpp).
int ctl_metrics(const ctl_options &options, bool text, bool http);

// The whole appliance (show.cpp).
int ctl_show(const ctl_options &options);
// Why the group, or the whole appliance (-1), does not work (explain.cpp). 0: nothing needs attention, 1:
// something does, 2: there is no such group, or no answer.
int ctl_explain(const ctl_options &options, int group);
int ctl_list_reasons(const ctl_options &options); // all reasons that can occur
// Checks this host, with or without mgmtd (check.cpp). 0: nothing to fix, 1: something.
int ctl_check(const ctl_options &options);
// Commands that are run at each change of a role, an alarm or a proxy's health (notify.cpp): "run" or "list".
struct ctl_notify_options {
    std::string directory = "/etc/wccpd/notify.d";
    std::string state_file = "/var/lib/wccp-notify/reported"; // states that commands have been run for
    std::string user;                                         // that root becomes
    uint32_t limit_s = 30;                                    // for a command
};
int ctl_notify(const ctl_options &options, const std::string &word, const ctl_notify_options &how);
// Events as they arrive (watch.cpp). `count` 0: until a signal ends the program.
int ctl_watch(const ctl_options &options, const std::vector<std::string> &names, uint64_t count);
