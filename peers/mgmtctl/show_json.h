// What "show" and "explain" have in common for scripts.
#pragma once

#include "peers/mgmtctl/ctl_json.h"

#include "peers/mgmtctl/commands.h"
#include "peers/mgmtctl/reasons.h"

ctl_json reason_json(const reason &one);
// What "explain" prints of a snapshot, and its exit code. `group` -1: all of it.
int tell_reasons(const ctl_options &options, const snapshot &shown, int group);
