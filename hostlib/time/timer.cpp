// Monotonic timers: TimeCount measures a length from a start, DelayTimer paces
// a loop on a grid of absolute deadlines.
#include "host/timer.h"

#include <errno.h>
#include <time.h>

namespace {

int64_t NowMicros() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<int64_t>(ts.tv_sec) * 1000000 + ts.tv_nsec / 1000;
}

void SleepUntil(int64_t deadlineMicros) {
    struct timespec ts;
    ts.tv_sec = static_cast<time_t>(deadlineMicros / 1000000);
    ts.tv_nsec = static_cast<long>((deadlineMicros % 1000000) * 1000);
    while (clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &ts, nullptr) == EINTR) {
    }
}

}  // namespace

TimeCount::TimeCount() : length_(0), start_(NowMicros()) {}

void TimeCount::SetCountingTime(unsigned long long microseconds) { length_ = microseconds; }

void TimeCount::BeginCountFromNow() { start_ = NowMicros(); }

int TimeCount::IsExceed() {
    const int64_t elapsed = NowMicros() - start_;
    return static_cast<unsigned long long>(elapsed) >= length_ ? 1 : 0;
}

DelayTimer::DelayTimer(int periodMicroseconds)
    : period_(periodMicroseconds > 0 ? periodMicroseconds : 0), next_(NowMicros()) {}

void DelayTimer::BeginTiming() { next_ = NowMicros() + period_; }

void DelayTimer::Delay() {
    const int64_t now = NowMicros();
    if (now - next_ > period_) {
        // Overran by more than a period (a long camera call): start a new grid
        // rather than running the missed passes back to back.
        next_ = now;
    }
    SleepUntil(next_);
    next_ += period_;
}
