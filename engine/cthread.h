// Named threads with small stacks, in which all signals are blocked.
#pragma once

#include <cstddef>
#include <cstdint>

#include <pthread.h>

// Bytes. The sanitizers need more.
#ifdef WCCP_SANITIZED
constexpr size_t CTHREAD_STACK_BYTES = 512 * 1024;
#else
constexpr size_t CTHREAD_STACK_BYTES = 128 * 1024;
#endif

struct cthread {
    cthread *next, **prev_link;
    uint8_t listed;
    char name[64];
    pthread_t thread;
    pthread_attr_t attributes;
    void *(*start_fn)(void *);
    void *start_arg;
    void *(*end_fn)(void *);
    void *end_arg;
    uint32_t max_wait;
    uint64_t heartbeat; // when it was started, in milliseconds since boot; 0: not started
    uint32_t policy;    // SCHED_OTHER or another scheduling policy
    int32_t priority;   // the nice value with SCHED_OTHER, otherwise the scheduling priority
    uint32_t cpu;       // the only CPU that the thread runs on
};

// A context owned by the caller, or null, with a line in the log, when there is no memory. The name is
// copied, at most 63 bytes. A null start_fn ends the thread at once; a null end_fn ends it with the value -1.
cthread *cthread_init(const char *name, void *(*start_fn)(void *), void *start_arg, void *(*end_fn)(void *),
                      void *end_arg, uint32_t policy, int32_t priority, uint32_t cpu, uint32_t max_wait);
int cthread_start(cthread *context); // 0, or 1 when the thread could not be created
// Asks the thread to end at its next cancellation point. Null and a context that was not started: nothing.
void cthread_cancel(cthread *context);
// Waits for the thread's end, if it was started, and frees the context. Null: nothing.
void cthread_join(cthread *context);
// Cancels and joins all threads. The caller must hold no lock that they take.
void cthread_cancel_all();
// The two halves of cthread_cancel_all, for a caller that holds such a lock while it cancels and has released
// it when it joins. The first returns a list, linked by `next`, for the second.
cthread *cthread_cancel_listed();
void cthread_join_chain(cthread *chain);
