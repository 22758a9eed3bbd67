// Named threads.
//
// A context belongs to its creator until cthread_join frees it. While its thread is running and has not been
// cancelled, the context is also on the process's thread list. The list has a mutex of its own; while it is
// held, no other lock is taken and no thread is joined.
//
// Signals: all signals are blocked in these threads, so that only the main thread receives them and no sleep
// or wait of the engine is cut short.
//
// Stacks: all memory of the process is locked; therefore the whole stack counts, used or not. 128 KiB is
// several times what the deepest path of the engine needs with a packet of 4 KiB and the buffers of a log
// line.
//
// Ending takes two steps, cancelling and joining. A caller can cancel while it holds a lock that the threads
// may be waiting for, release the lock, and then join. All threads are cancelled before the first is joined,
// so that ending all of them takes only as long as the slowest one.

#include "engine/cthread.h"

#include <sched.h>
#include <signal.h>
#include <sys/resource.h>
#include <time.h>

#include <cstdlib>

#include "runtime/common.h"
#include "runtime/guards.h"
#include "runtime/list.h"
#include "runtime/logging.h"

namespace {

constexpr uint32_t CPU_LIMIT = 128;

pthread_mutex_t thread_list_mutex = PTHREAD_MUTEX_INITIALIZER;
cthread *thread_list;

void *exit_at_start(void *) {
    pthread_exit(nullptr);
}

void *exit_at_end(void *) {
    pthread_exit(reinterpret_cast<void *>(intptr_t{-1}));
}

uint64_t milliseconds_since_boot() {
    timespec now = {};
    clock_gettime(CLOCK_BOOTTIME, &now);
    return static_cast<uint64_t>(now.tv_sec) * 1000 + static_cast<uint64_t>(now.tv_nsec) / 1000000;
}

void *thread_main(void *argument) {
    auto *context = static_cast<cthread *>(argument);
    // The kernel's thread names have at most 15 characters; pthread_setname_np refuses longer ones.
    char kernel_name[16];
    strlcpy(kernel_name, context->name, sizeof kernel_name);
    pthread_setname_np(pthread_self(), kernel_name);

    // On Linux each thread has its own nice value; 0 is the calling one.
    if (context->policy == SCHED_OTHER && setpriority(PRIO_PROCESS, 0, context->priority) != 0)
        QV_LOG(LC_LOG_ERR, "%s: can't set priority for thread %s\n", __func__, context->name);
    cpu_set_t cpus;
    CPU_ZERO(&cpus);
    if (context->cpu < CPU_LIMIT) // otherwise the set stays empty, which the call below refuses
        CPU_SET(context->cpu, &cpus);
    if (sched_setaffinity(0, sizeof cpus, &cpus) != 0)
        QV_LOG(LC_LOG_ERR, "%s: can't set affinity for thread %s\n", __func__, context->name);

    context->start_fn(context->start_arg);
    return context->end_fn(context->end_arg);
}

} // namespace

cthread *cthread_init(const char *name, void *(*start_fn)(void *), void *start_arg, void *(*end_fn)(void *),
                      void *end_arg, uint32_t policy, int32_t priority, uint32_t cpu, uint32_t max_wait) {
    auto *context = static_cast<cthread *>(calloc(1, sizeof(cthread)));
    if (!context) {
        QV_LOG(LC_LOG_ERR, "%s: allocation error\n", __func__);
        return nullptr;
    }
    strlcpy(context->name, name ? name : "", sizeof context->name);
    context->start_fn = start_fn ? start_fn : exit_at_start;
    context->start_arg = start_arg;
    context->end_fn = end_fn ? end_fn : exit_at_end;
    context->end_arg = end_arg;
    context->policy = policy;
    context->priority = priority;
    context->cpu = cpu;
    context->max_wait = max_wait;
    return context;
}

namespace {

int build_thread_attributes(pthread_attr_t *attributes, const cthread *context) {
    if (pthread_attr_init(attributes) != 0)
        return 1;
    const int policy = static_cast<int>(context->policy);
    sched_param parameters = {};
    // SCHED_OTHER accepts only 0; thread_main applies the nice value.
    parameters.sched_priority = policy == SCHED_OTHER ? 0 : context->priority;
    // Without PTHREAD_EXPLICIT_SCHED the creator's policy would be inherited and these attributes ignored.
    if (pthread_attr_setstacksize(attributes, CTHREAD_STACK_BYTES) == 0 &&
        pthread_attr_setinheritsched(attributes, PTHREAD_EXPLICIT_SCHED) == 0 &&
        pthread_attr_setschedpolicy(attributes, policy) == 0 &&
        pthread_attr_setschedparam(attributes, &parameters) == 0)
        return 0;
    pthread_attr_destroy(attributes);
    return 1;
}

} // namespace

int cthread_start(cthread *context) {
    if (!context || build_thread_attributes(&context->attributes, context))
        return 1;
    sigset_t all, previous;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &previous); // the new thread inherits the mask
    const int error = pthread_create(&context->thread, &context->attributes, thread_main, context);
    pthread_sigmask(SIG_SETMASK, &previous, nullptr);
    if (error != 0) {
        pthread_attr_destroy(&context->attributes);
        return 1;
    }
    // Only from here on can the thread be cancelled and joined.
    context->heartbeat = milliseconds_since_boot();
    const mutex_guard guard(&thread_list_mutex);
    list_push_head(&thread_list, context);
    context->listed = 1;
    return 0;
}

namespace {

// thread_list_mutex held.
void remove_from_thread_list(cthread *context) {
    if (!context->listed)
        return;
    list_unlink(context);
    context->listed = 0;
}

void cancel_thread(cthread *context) {
    const int error = pthread_cancel(context->thread);
    if (error != 0)
        QV_LOG(LC_LOG_ERR, "%s: failed to cancel %s with error %d\n", "cthread_cancel", context->name, error);
}

} // namespace

void cthread_cancel(cthread *context) {
    if (!context || context->heartbeat == 0) // 0: never started
        return;
    const mutex_guard guard(&thread_list_mutex);
    remove_from_thread_list(context);
    cancel_thread(context);
}

void cthread_join(cthread *context) {
    if (!context)
        return;
    if (context->heartbeat != 0) { // 0: never started
        {
            const mutex_guard guard(&thread_list_mutex);
            remove_from_thread_list(context);
        }
        pthread_join(context->thread, nullptr);
        pthread_attr_destroy(&context->attributes);
    }
    free(context);
}

cthread *cthread_cancel_listed() {
    const mutex_guard guard(&thread_list_mutex);
    cthread *chain = thread_list;
    thread_list = nullptr;
    for (cthread *context = chain; context; context = context->next) {
        context->prev_link = nullptr;
        context->listed = 0;
        cancel_thread(context);
    }
    return chain;
}

void cthread_join_chain(cthread *chain) {
    while (cthread *context = chain) {
        chain = context->next;
        cthread_join(context);
    }
}

void cthread_cancel_all() {
    cthread_join_chain(cthread_cancel_listed());
}
