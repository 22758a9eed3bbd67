// Output for people and for scripts, and the report of a failure to either.
#pragma once

#include <string>
#include <vector>

#include "peers/mgmtctl/commands.h"
#include "peers/mgmtctl/ctl_json.h"

// To standard output; a failed write is reported at the end of the program.
void write_output(const std::string &text);
std::string json_line(const ctl_json &value); // with its newline

// Numbers and durations become JSON numbers, booleans JSON booleans, a node without a value null.
ctl_json json_value(const ctl_binding &binding);
ctl_json json_node(const ctl_binding &binding, bool secrets); // name, type, value
// The value. Unless `secrets`, a password becomes eight stars, in a dump as well.
std::string shown_value(const ctl_binding &binding, bool secrets);
// "NAME = VALUE"; further lines of the value are indented.
std::string text_node(const ctl_binding &binding, bool secrets);

struct ctl_failure {
    int exit;
    std::string node; // or empty
    std::string error;
    std::string hint; // or empty
    uint32_t code = 0;
};
int exit_of(uint32_t code); // of a status code that mgmtd answered
ctl_json json_failure(const ctl_failure &failure);
// To standard error, or as JSON to standard output. Returns the exit code. Prints nothing when a signal ends
// the program.
int tell_failure(const ctl_options &options, const ctl_failure &failure);

// The active alarms, from a walk of NODE_ALARMS_RAISED.
struct ctl_alarm {
    std::string type, source, name, text, since, reporter;
    std::string reason, cause; // why, by its code and in words; empty: unknown
};
std::vector<ctl_alarm> alarms_of(const std::vector<ctl_binding> &bindings);
ctl_json json_alarms(const std::vector<ctl_alarm> &alarms);
std::string text_alarms(const std::vector<ctl_alarm> &alarms);
