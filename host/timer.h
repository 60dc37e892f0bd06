// Timers the library takes from the host. All lengths are in microseconds and
// measured on the monotonic clock, so changes of the wall clock do not affect them.
#ifndef HOST_TIMER_H
#define HOST_TIMER_H

#include <sys/time.h>

#include <cstdint>

#include "common/ptzpatrol_config.h"  // time_t: the library's width

// Counts a set length from a starting moment.
class TimeCount {
public:
    TimeCount();
    // Sets the length of the count. Does not restart it.
    void SetCountingTime(unsigned long long microseconds);
    // Starts the count at the present moment.
    void BeginCountFromNow();
    // Non-zero once the set length has elapsed since the count began; 0 before.
    int IsExceed();

private:
    unsigned long long length_;
    int64_t start_;  // monotonic microseconds
};

// Paces a loop: passes start one period apart, on a fixed grid of absolute
// deadlines, so a pass that takes a while does not shift the ones after it.
// The library's worker loops pace themselves instead (WorkerPacer in
// common/worker_thread.h): Delay cannot be woken, so a loop sleeping in it
// would hold up the shutdown of its executor.
class DelayTimer {
public:
    explicit DelayTimer(int periodMicroseconds);
    // Sets the first deadline one period from now.
    void BeginTiming();
    // Sleeps until the next deadline. When passes have overrun by more than a
    // period, the grid restarts from now instead of firing a burst of passes.
    void Delay();

private:
    int64_t period_;
    int64_t next_;  // monotonic microseconds
};

// Whether a wall-clock timestamp lies within `spanMicroseconds` before now.
// 1: valid; 0: older than the span, or a negative span. A timestamp in the
// future by at most one second (clock skew between the event source and this
// host) counts as valid; further in the future it is not. 0 as well when the
// wall clock cannot be read (with a 32-bit time_t: after 2038-01-19).
int IsTimeStampValid(struct timeval timestamp, int spanMicroseconds);

#endif  // HOST_TIMER_H
