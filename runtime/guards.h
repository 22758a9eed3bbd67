// Scope guards. The threads of the engine are ended by cancellation, which takes effect at the next
// cancellation point (close, write, poll, sleep, ...) and unwinds the stack, running destructors. A resource
// that is held across a cancellation point must therefore be owned by a guard.
//
// A destructor must not reach a cancellation point itself: destructors are noexcept, and unwinding out of one
// ends the process. One that has to call close() for example disables cancellation first (cancel_off_guard).
#pragma once

#include <pthread.h>

#include <cstdlib>

// Holds a mutex until the end of the scope or release(), whichever comes first.
struct mutex_guard {
    explicit mutex_guard(pthread_mutex_t *mutex) : held(mutex) { pthread_mutex_lock(held); }
    ~mutex_guard() { release(); }
    mutex_guard(const mutex_guard &) = delete;
    mutex_guard &operator=(const mutex_guard &) = delete;
    void release() {
        if (held) {
            pthread_mutex_unlock(held);
            held = nullptr;
        }
    }
    pthread_mutex_t *held;
};

// Disables cancellation of the calling thread for a scope. A request that arrives meanwhile takes effect at
// the first cancellation point after it. Guards nest.
struct cancel_off_guard {
    cancel_off_guard() { pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &previous); }
    ~cancel_off_guard() { pthread_setcancelstate(previous, nullptr); }
    cancel_off_guard(const cancel_off_guard &) = delete;
    cancel_off_guard &operator=(const cancel_off_guard &) = delete;
    int previous = PTHREAD_CANCEL_ENABLE;
};

// Owns a pointer and calls `Free` with it at the end of the scope, unless it is null or has been taken.
// `pointer` may be passed as an out argument; a pointer that it held before is not freed.
template <typename T, void (*Free)(T *)>
struct owned {
    explicit owned(T *taken = nullptr) : pointer(taken) {}
    ~owned() {
        if (pointer)
            Free(pointer);
    }
    owned(const owned &) = delete;
    owned &operator=(const owned &) = delete;
    T *take() {
        T *out = pointer;
        pointer = nullptr;
        return out;
    }
    T *pointer;
};

inline void free_memory(char *memory) {
    free(memory);
}
using owned_text = owned<char, free_memory>;
