// Named threads. All of them block every signal, so that only the main thread ever takes one and no sleep or
// wait of the engine is cut short; their stacks are small, since all memory of the process is locked.
#pragma once

#include <cstddef>
#include <cstdint>

#include <pthread.h>

// A packet, the log buffers and what lies between them; the sanitizers need more.
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
    uint64_t heartbeat; // milliseconds since boot
    uint32_t policy;
    int32_t priority;
    uint32_t cpu;
};

cthread *cthread_init(const char *name, void *(*start_fn)(void *), void *start_arg, void *(*end_fn)(void *),
                      void *end_arg, uint32_t policy, int32_t priority, uint32_t cpu, uint32_t max_wait);
int cthread_start(cthread *context); // 0, or 1 when the thread could not be created
void cthread_cancel(cthread *context);
void cthread_join(cthread *context); // waits for its end and frees it
void cthread_cancel_all();           // cancels and joins; no engine lock held
// The two halves of cthread_cancel_all, for a caller that cancels under a lock which the threads may be
// waiting for and joins once it has let go of it. The first gives a chain (through `next`) for the second.
cthread *cthread_cancel_listed();
void cthread_join_chain(cthread *chain);
