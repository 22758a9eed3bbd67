// Changes of the configuration that arrive while the start is still reading it.
//
// mgmtd sends a change at the moment of its commit. The change can follow an answer in the same read, and
// would then reach the engine before the groups of that answer exist. Changes are therefore kept, in order,
// and applied once the whole configuration has been read. One that was committed before the answer was given
// is also part of the answer; wccpd_config_apply treats it accordingly.
//
// Main thread only. The memory in use is bounded.
#pragma once

#include "mgmt/bnode.h"
#include "runtime/common.h"

// Names and values, and an estimate for the records around them. A change of all nodes of 256 groups is 5 MB.
constexpr size_t EARLY_CHANGES_MAX_BYTES = 32 << 20;

// Changes are kept for as long as one of these exists; those not applied by then are freed.
struct early_changes_scope {
    early_changes_scope();
    ~early_changes_scope();
    early_changes_scope(const early_changes_scope &) = delete;
    early_changes_scope &operator=(const early_changes_scope &) = delete;
};
bool early_changes_are_kept();

// Takes the new values of a change event over. LC_NO_SPACE: the bound is reached; LC_NULL: no memory. The
// caller keeps them then, and the change is lost.
lc_status keep_early_change(bn_binding_array **inout_new_values);
// An answer has arrived: it contains every change kept so far.
void early_changes_are_answered();
// Applies what is kept, first to last. A failure is logged, and the next change is applied all the same.
void apply_early_changes();
