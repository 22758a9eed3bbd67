// `lew`: the event loop with the guarantees that the daemon needs, over libevent. Its operations are declared
// in runtime/loop_host.h, so that lower rooms can use them.
#pragma once

#include <atomic>

#include "runtime/loop_host.h"

constexpr int LEW_SIGNAL_MAX = 65;
// The loop that has registered each signal, by signal number; null for none.
extern std::atomic<loop_context *> le_signal_contexts[LEW_SIGNAL_MAX + 1];
