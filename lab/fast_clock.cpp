// A library for LD_PRELOAD that gives the programs of a lab a faster clock: with FAST_CLOCK=8 their timers
// run eight times as fast.
//
// Clocks that count from boot run faster, and sleeps and the timeouts of poll and epoll_wait are shorter
// accordingly. All programs multiply the same clock; therefore they agree on the time. Two things keep real
// time, because they concern work and not the protocol: the time of day, which timeouts of sessions with
// mgmtd and log lines use; and waits of up to LEAST_WAIT, which some programs repeat a fixed number of times
// while another process works.
//
// The replaced functions call the real ones, found by name in the libraries after this one, and the real ones
// do the waiting: threads can be cancelled in them as without this library.
#include <dlfcn.h>
#include <poll.h>
#include <sys/epoll.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>

namespace {

constexpr int64_t SECOND = 1'000'000'000, MILLISECOND = 1'000'000;
constexpr int64_t LEAST_WAIT = 20 * MILLISECOND;

int64_t clock_speed() {
    static const int64_t factor = [] {
        const char *text = getenv("FAST_CLOCK");
        // Without the variable, real time.
        return std::clamp<int64_t>(text ? atoi(text) : 1, 1, 60);
    }();
    return factor;
}

template <typename function>
function *find_real(function *, const char *name) {
    return reinterpret_cast<function *>(dlsym(RTLD_NEXT, name));
}
// No initializer for the static variable: if the thread is cancelled during it, the guard would stay locked.
#define REAL(name)                                                                                           \
    static decltype(&::name) real_##name;                                                                    \
    if (!real_##name)                                                                                        \
        real_##name = find_real(&::name, #name);

int64_t to_ns(const timespec &time) {
    return time.tv_sec * SECOND + time.tv_nsec;
}
timespec from_ns(int64_t ns) {
    return {ns / SECOND, ns % SECOND};
}
int64_t shorten_wait(int64_t ns) {
    // Short waits stay as they are; longer ones never become shorter than LEAST_WAIT.
    return std::max(ns / clock_speed(), std::min(ns, LEAST_WAIT));
}
int shorten_wait_ms(int ms) {
    // Rounded up: a wait of 0 would make a loop spin until its timer is due. Negative times have no limit.
    return ms <= 0 ? ms : static_cast<int>((shorten_wait(ms * MILLISECOND) + MILLISECOND - 1) / MILLISECOND);
}
bool is_fast(clockid_t clock) {
    return clock == CLOCK_MONOTONIC || clock == CLOCK_MONOTONIC_COARSE || clock == CLOCK_MONOTONIC_RAW ||
           clock == CLOCK_BOOTTIME;
}

} // namespace

extern "C" {

int clock_gettime(clockid_t clock, timespec *out) noexcept {
    REAL(clock_gettime)
    const int result = real_clock_gettime(clock, out);
    if (result == 0 && is_fast(clock))
        *out = from_ns(to_ns(*out) * clock_speed());
    return result;
}

int clock_nanosleep(clockid_t clock, int flags, const timespec *time, timespec *left) {
    REAL(clock_nanosleep)
    if (flags & TIMER_ABSTIME) {
        // The time is on the program's clock; the kernel's runs slower.
        const timespec until = is_fast(clock) ? from_ns(to_ns(*time) / clock_speed()) : *time;
        return real_clock_nanosleep(clock, flags, &until, left);
    }
    const int64_t asked = to_ns(*time), wait = shorten_wait(asked);
    const timespec part = from_ns(wait);
    const int result = real_clock_nanosleep(clock, flags, &part, left);
    if (result != 0 && left && wait > 0)
        *left = from_ns(to_ns(*left) * asked / wait);
    return result;
}

int nanosleep(const timespec *time, timespec *left) {
    // This library's own function. It returns the error; nanosleep() puts it in errno.
    const int result = clock_nanosleep(CLOCK_MONOTONIC, 0, time, left);
    if (result == 0)
        return 0;
    errno = result;
    return -1;
}

unsigned sleep(unsigned seconds) {
    const timespec time = {seconds, 0};
    timespec left = {};
    // Rounded up, because the rest of a second is left too.
    return nanosleep(&time, &left) == 0 ? 0 : static_cast<unsigned>(left.tv_sec + 1);
}

int poll(pollfd *fds, nfds_t count, int ms) {
    REAL(poll)
    return real_poll(fds, count, shorten_wait_ms(ms));
}

int epoll_wait(int fd, epoll_event *events, int count, int ms) {
    REAL(epoll_wait)
    return real_epoll_wait(fd, events, count, shorten_wait_ms(ms));
}

} // extern "C"
