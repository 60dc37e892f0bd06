// Validity of wall-clock event timestamps.
#include <sys/time.h>

#include <cstdint>

#include "host/timer.h"

namespace {
// Event sources and this host may disagree by a little; a timestamp at most
// this far in the future is taken as "now".
constexpr int64_t kFutureToleranceMicros = 1000000;
}  // namespace

int IsTimeStampValid(struct timeval timestamp, int spanMicroseconds) {
    if (spanMicroseconds < 0) return 0;
    struct timeval now;
    // With a 32-bit time_t the wall clock cannot be read after 2038-01-19
    // (EOVERFLOW): without a "now" no timestamp can be judged valid.
    if (gettimeofday(&now, nullptr) != 0) return 0;
    const int64_t nowUs = static_cast<int64_t>(now.tv_sec) * 1000000 + now.tv_usec;
    const int64_t tsUs = static_cast<int64_t>(timestamp.tv_sec) * 1000000 + timestamp.tv_usec;
    const int64_t age = nowUs - tsUs;
    if (age < 0) return -age <= kFutureToleranceMicros ? 1 : 0;
    return age <= spanMicroseconds ? 1 : 0;
}
