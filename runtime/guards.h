// Scope guards. Threads are ended by cancellation, which unwinds the stack and runs these destructors:
// whatever is held goes in one of them. A destructor must not reach a cancellation point (close, write, poll,
// ...), since a cancellation inside it ends the process; what has to call one turns cancellation off around
// it.
#pragma once

#include <pthread.h>

#include <cstdlib>

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

// No cancellation from here to the end of the scope.
struct cancel_off_guard {
    cancel_off_guard() { pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &previous); }
    ~cancel_off_guard() { pthread_setcancelstate(previous, nullptr); }
    cancel_off_guard(const cancel_off_guard &) = delete;
    cancel_off_guard &operator=(const cancel_off_guard &) = delete;
    int previous = PTHREAD_CANCEL_ENABLE;
};

// Owns a pointer until taken; `Free` is called with it otherwise.
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
