// `lew`: the loop with the guarantees that the daemon relies on, over libevent. The operations stand in
// runtime/loop_host.h, so that rooms below the daemon can use them.
#pragma once

#include <atomic>

#include "runtime/loop_host.h"

constexpr int LEW_SIGNAL_MAX = 65;
// The context that owns each signal, by number; null for none.
extern std::atomic<loop_context *> le_signal_contexts[LEW_SIGNAL_MAX + 1];
