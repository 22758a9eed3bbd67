// wccpd with a stopwatch on its engine lock: for each second of the clock one line on standard output, with
// how often the lock was held, for how long on average and at most, and for how much processor time at most;
// then the same count and maxima for the main thread, which answers monitoring queries. The rest of the time
// of a hold is waiting, for a processor or another thread.
//
// The program's own pthread_mutex_lock and pthread_mutex_unlock call those of the C library. The figures are
// guarded by the measured lock itself.
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <ctime>

#include <dlfcn.h>
#include <pthread.h>
#include <unistd.h>

#include "daemon/wccpd_main.h"
#include "engine/wccp_records.h"
#include "runtime/guards.h"

namespace {

struct hold {
    int64_t wall, cpu; // nanoseconds
};
hold read_clocks() {
    const auto of = [](clockid_t clock) {
        timespec time = {};
        clock_gettime(clock, &time);
        return time.tv_sec * int64_t{1'000'000'000} + time.tv_nsec;
    };
    return {of(CLOCK_REALTIME), of(CLOCK_THREAD_CPUTIME_ID)};
}

struct second {
    int64_t number, holds, wall, wall_max, cpu_max, main_holds, main_wall_max, main_cpu_max;
};
hold taken;
second current;

// Returns the finished second if this hold is the first of the next one, otherwise one without holds.
second count_hold(const hold &given) {
    second over = {};
    const int64_t wall = given.wall - taken.wall, cpu = given.cpu - taken.cpu;
    if (current.number != given.wall / 1'000'000'000) {
        over = current;
        current = {given.wall / 1'000'000'000, 0, 0, 0, 0, 0, 0, 0};
    }
    current.holds++;
    current.wall += wall;
    current.wall_max = std::max(current.wall_max, wall);
    current.cpu_max = std::max(current.cpu_max, cpu);
    // The id of the main thread is that of the process.
    if (gettid() == getpid()) {
        current.main_holds++;
        current.main_wall_max = std::max(current.main_wall_max, wall);
        current.main_cpu_max = std::max(current.main_cpu_max, cpu);
    }
    return over;
}

using mutex_function = int (*)(pthread_mutex_t *);
mutex_function find_real_function(const char *name) {
    return reinterpret_cast<mutex_function>(dlsym(RTLD_NEXT, name));
}

} // namespace

extern "C" int pthread_mutex_lock(pthread_mutex_t *mutex) noexcept {
    static const mutex_function real = find_real_function("pthread_mutex_lock");
    const int result = real(mutex);
    if (mutex == &wccp_g.lock)
        // After the lock has been acquired: the wait for it is not part of the hold.
        taken = read_clocks();
    return result;
}

extern "C" int pthread_mutex_unlock(pthread_mutex_t *mutex) noexcept {
    static const mutex_function real = find_real_function("pthread_mutex_unlock");
    second over = {};
    if (mutex == &wccp_g.lock)
        // Still with the lock, which guards the figures.
        over = count_hold(read_clocks());
    const int result = real(mutex);
    if (over.holds) {
        // After the unlock, so that the write is not part of a hold. dprintf is a cancellation point, which
        // pthread_mutex_unlock must not be.
        const cancel_off_guard uncancelled;
        dprintf(1, "%lld holds %lld mean %lld max %lld cpu %lld us main %lld max %lld cpu %lld us\n",
                static_cast<long long>(over.number), static_cast<long long>(over.holds),
                static_cast<long long>(over.wall / over.holds / 1000),
                static_cast<long long>(over.wall_max / 1000), static_cast<long long>(over.cpu_max / 1000),
                static_cast<long long>(over.main_holds), static_cast<long long>(over.main_wall_max / 1000),
                static_cast<long long>(over.main_cpu_max / 1000));
    }
    return result;
}

int main() {
    return wccpd_main();
}
