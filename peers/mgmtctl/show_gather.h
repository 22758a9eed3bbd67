// Gathering a snapshot of the appliance from mgmtd and, through it, wccpd.
#pragma once

#include <functional>

#include "peers/mgmtctl/session.h"
#include "peers/mgmtctl/show_model.h"

// What one gathering may cost. More groups than `detailed` are gathered briefly, and of them as many as
// `listed`.
struct snapshot_limits {
    size_t detailed = 256;
    size_t listed = 256;
    size_t alarms = 256;
    int only = -1;         // the one group to be gathered; -1: all
    size_t queries = 8192; // groups that are left when these are used up count as not shown
};

// A query of mgmtd; false with the reason when there is no answer.
using snapshot_query =
    std::function<bool(ctl_walk walk, const std::string &name, ctl_reply *out, std::string *out_reason)>;
snapshot gather_snapshot(const snapshot_query &query, const snapshot_limits &limits);
