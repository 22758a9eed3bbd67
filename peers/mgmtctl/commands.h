// The words of mgmtctl's command line, and what every one of them keeps to.
#pragma once

#include <string>
#include <vector>

#include "peers/mgmtctl/session.h"

// What a script can rely on.
enum ctl_exit : int {
    CTL_OK = 0,
    CTL_REFUSED = 1,     // mgmtd or wccpd said no; nothing was changed
    CTL_USAGE = 2,       // the command line
    CTL_UNREACHABLE = 3, // no mgmtd, no answer, or the session was lost
    CTL_NOT_FOUND = 4,   // no such node or group
    CTL_PARTLY = 5,      // a change of several commits stopped in between; what is left undone is told
    CTL_STANDING = 6,    // alarms --check: an alarm stands
    CTL_OUTPUT = 7,      // standard output took not all of it
};

struct ctl_options {
    bool json = false;
    bool watch = false;
    bool secrets = false; // passwords are shown
    int colour = -1;      // 1 yes, 0 no, -1 when standard output is a terminal
    int below = 0;        // rows at the top of the terminal that are somebody else's
    int64_t timeout_ms = 10'000;
};

// Words that an operator thinks in (group_cli.cpp): "group add 51 interface eth0 router 10.0.0.1 weight 100".
// `words` follow "group" or "policy". The result is the exit code; messages have been printed.
int ctl_group(const ctl_options &options, const std::vector<std::string> &words);
int ctl_policy(const ctl_options &options, const std::vector<std::string> &words);
// The picture of the whole appliance (show.cpp).
int ctl_show(const ctl_options &options);
