// Changes of the configuration that arrive while the start is still reading it.
//
// mgmtd sends a change at the moment of its commit, so that it can arrive before an answer of the start, or
// after the answer in the same read, while the groups of that answer don't exist yet. Changes are therefore
// kept, in order, until the whole configuration has been read, and are applied then. A change that was
// committed before the answer was given is in the answer as well; wccpd_config_apply is told, and takes it
// without complaint.
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
