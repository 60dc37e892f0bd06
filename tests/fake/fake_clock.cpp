// The clocks, interposed: passed through, or shifted for the thread that holds
// a fake::ClockShift.
#include <dlfcn.h>
#include <errno.h>
#include <sys/time.h>
#include <time.h>

#include <cstdint>
#include <cstdlib>

#include "fake/fake_host.h"

namespace {

constexpr int64_t kNanosPerSecond = 1000000000;

thread_local int64_t wallShiftNs = 0;
thread_local int64_t monotonicShiftNs = 0;

int64_t ShiftOf(clockid_t clock) {
    if (clock == CLOCK_REALTIME) return wallShiftNs;
    if (clock == CLOCK_MONOTONIC) return monotonicShiftNs;
    return 0;
}

// The C library's own functions. With a 64-bit time_t on a 32-bit C library
// the headers name its 64-bit entry points, and so must the look-up.
#ifdef __USE_TIME_BITS64
constexpr char kClockGettime[] = "__clock_gettime64";
constexpr char kClockNanosleep[] = "__clock_nanosleep_time64";
#else
constexpr char kClockGettime[] = "clock_gettime";
constexpr char kClockNanosleep[] = "clock_nanosleep";
#endif

template <typename F>
F Next(const char* name) {
    void* f = dlsym(RTLD_NEXT, name);
    if (!f) abort();
    return reinterpret_cast<F>(f);
}

int RealClockGettime(clockid_t clock, struct timespec* ts) {
    static const auto real = Next<int (*)(clockid_t, struct timespec*)>(kClockGettime);
    return real(clock, ts);
}

int RealClockNanosleep(clockid_t clock, int flags, const struct timespec* request,
                       struct timespec* remain) {
    static const auto real =
        Next<int (*)(clockid_t, int, const struct timespec*, struct timespec*)>(kClockNanosleep);
    return real(clock, flags, request, remain);
}

int64_t Nanos(const struct timespec& ts) {
    return static_cast<int64_t>(ts.tv_sec) * kNanosPerSecond + ts.tv_nsec;
}

// Stores `ns` into `ts`; false when the seconds do not fit time_t (then `ts`
// holds them cut to its width).
bool Store(int64_t ns, struct timespec* ts) {
    const int64_t seconds = ns / kNanosPerSecond;
    ts->tv_sec = static_cast<time_t>(seconds);
    ts->tv_nsec = static_cast<long>(ns % kNanosPerSecond);
    return static_cast<int64_t>(ts->tv_sec) == seconds;
}

// The calling thread's reading of `clock`, shifted.
int ShiftedClockGettime(clockid_t clock, struct timespec* ts) {
    const int64_t shift = ShiftOf(clock);
    if (shift == 0) return RealClockGettime(clock, ts);
    struct timespec real;
    if (RealClockGettime(clock, &real) != 0) return -1;
    if (!Store(Nanos(real) + shift, ts)) {
        errno = EOVERFLOW;
        return -1;
    }
    return 0;
}

}  // namespace

namespace fake {

ClockShift::ClockShift(std::chrono::microseconds wall, std::chrono::microseconds monotonic) {
    wallShiftNs = std::chrono::nanoseconds(wall).count();
    monotonicShiftNs = std::chrono::nanoseconds(monotonic).count();
}

ClockShift::~ClockShift() {
    wallShiftNs = 0;
    monotonicShiftNs = 0;
}

}  // namespace fake

extern "C" {

int clock_gettime(clockid_t clock, struct timespec* ts) noexcept {
    return ShiftedClockGettime(clock, ts);
}

int gettimeofday(struct timeval* tv, void*) noexcept {
    struct timespec ts;
    const int rc = ShiftedClockGettime(CLOCK_REALTIME, &ts);
    if (rc != 0 && errno != EOVERFLOW) return rc;
    tv->tv_sec = ts.tv_sec;
    tv->tv_usec = ts.tv_nsec / 1000;
    return rc;
}

int clock_nanosleep(clockid_t clock, int flags, const struct timespec* request,
                    struct timespec* remain) {
    const int64_t shift = ShiftOf(clock);
    if (shift == 0 || !(flags & TIMER_ABSTIME)) {
        return RealClockNanosleep(clock, flags, request, remain);
    }
    struct timespec real;
    if (!Store(Nanos(*request) - shift, &real)) return EINVAL;
    return RealClockNanosleep(clock, flags, &real, remain);
}

}  // extern "C"
