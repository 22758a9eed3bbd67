// A faster clock for the programs of a lab, preloaded into them: with FAST_CLOCK=8 the seconds of their
// timers pass in an eighth of the time.
//
// The clocks that count from the start of the machine run faster, and what waits for time (sleeps, and the
// limits of poll and epoll_wait) waits accordingly shorter. As all programs multiply the same clock, they
// agree on it. Two things keep their pace, because they are about real work and not about the seconds of a
// protocol: the time of day, by which the sessions with mgmtd limit their waiting and log lines are stamped;
// and waits of up to LEAST_WAIT, of which some are counted until another process has answered.
//
// The real functions are found by name in the libraries after this one. They remain what waits, so that a
// thread can be cancelled in them as ever.
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

int64_t speed() {
    static const int64_t factor = [] {
        const char *text = getenv("FAST_CLOCK");
        return std::clamp<int64_t>(text ? atoi(text) : 1, 1, 60);
    }();
    return factor;
}

template <typename function>
function *behind(function *, const char *name) {
    return reinterpret_cast<function *>(dlsym(RTLD_NEXT, name));
}
// A function without a local guard: cancelled in its first call, a guard would stay taken.
#define REAL(name)                                                                                           \
    static decltype(&::name) real_##name;                                                                    \
    if (!real_##name)                                                                                        \
        real_##name = behind(&::name, #name);

int64_t to_ns(const timespec &time) {
    return time.tv_sec * SECOND + time.tv_nsec;
}
timespec from_ns(int64_t ns) {
    return {ns / SECOND, ns % SECOND};
}
int64_t shorter(int64_t ns) {
    return std::max(ns / speed(), std::min(ns, LEAST_WAIT));
}
int shorter_ms(int ms) {
    return ms <= 0 ? ms : static_cast<int>((shorter(ms * MILLISECOND) + MILLISECOND - 1) / MILLISECOND);
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
        *out = from_ns(to_ns(*out) * speed());
    return result;
}

int clock_nanosleep(clockid_t clock, int flags, const timespec *time, timespec *left) {
    REAL(clock_nanosleep)
    if (flags & TIMER_ABSTIME) {
        const timespec until = is_fast(clock) ? from_ns(to_ns(*time) / speed()) : *time;
        return real_clock_nanosleep(clock, flags, &until, left);
    }
    const int64_t asked = to_ns(*time), wait = shorter(asked);
    const timespec part = from_ns(wait);
    const int result = real_clock_nanosleep(clock, flags, &part, left);
    if (result != 0 && left && wait > 0)
        *left = from_ns(to_ns(*left) * asked / wait);
    return result;
}

int nanosleep(const timespec *time, timespec *left) {
    const int result = clock_nanosleep(CLOCK_MONOTONIC, 0, time, left);
    if (result == 0)
        return 0;
    errno = result;
    return -1;
}

unsigned sleep(unsigned seconds) {
    const timespec time = {seconds, 0};
    timespec left = {};
    return nanosleep(&time, &left) == 0 ? 0 : static_cast<unsigned>(left.tv_sec + 1);
}

int poll(pollfd *fds, nfds_t count, int ms) {
    REAL(poll)
    return real_poll(fds, count, shorter_ms(ms));
}

int epoll_wait(int fd, epoll_event *events, int count, int ms) {
    REAL(epoll_wait)
    return real_epoll_wait(fd, events, count, shorter_ms(ms));
}

} // extern "C"
