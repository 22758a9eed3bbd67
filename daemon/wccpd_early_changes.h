// Configuration changes that arrive while the start is still reading the configuration.
//
// mgmtd sends a change when it is committed. A change can arrive together with the answer to a query and
// would then reach the engine before the groups of that answer exist. Changes are therefore kept, in order,
// and applied when the whole configuration has been read. A change that was committed before the answer was
// given is also contained in the answer; wccpd_config_apply allows for that.
//
// Main thread only. The memory used is limited.
#pragma once

#include "mgmt/bnode.h"
#include "runtime/common.h"

// Bytes of names and values, plus an estimate for the records around them. A change of all nodes of 256
// groups takes 5 MB.
constexpr size_t EARLY_CHANGES_MAX_BYTES = 32 << 20;

// Changes are kept as long as an object of this type exists. Its destructor frees those that were not
// applied.
struct early_changes_scope {
    early_changes_scope();
    ~early_changes_scope();
    early_changes_scope(const early_changes_scope &) = delete;
    early_changes_scope &operator=(const early_changes_scope &) = delete;
};
bool early_changes_are_kept();

// Keeps the new values of a change event and takes ownership of them. On failure the caller still owns them
// and the change is lost: LC_NO_SPACE, with a line in the log, at the limit; LC_NULL without memory.
lc_status keep_early_change(bn_binding_array **inout_new_values);
// Call it when an answer from mgmtd has arrived: it contains every change kept so far.
void early_changes_are_answered();
// Applies and frees the kept changes in order. A failure is logged, and the next change is applied.
void apply_early_changes();
