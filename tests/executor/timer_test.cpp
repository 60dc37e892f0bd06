// The host timers the executors pace and time with, and event timestamp validity.
#include <gtest/gtest.h>
#include <sys/time.h>

#include <chrono>
#include <thread>

#include "host/timer.h"

namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

double Since(Clock::time_point t) { return std::chrono::duration<double>(Clock::now() - t).count(); }

TEST(TimeCount, ExceedsOnceTheLengthHasElapsedSinceTheBegin) {
    TimeCount count;
    count.SetCountingTime(100000);
    count.BeginCountFromNow();
    EXPECT_EQ(count.IsExceed(), 0);
    std::this_thread::sleep_for(120ms);
    EXPECT_NE(count.IsExceed(), 0);

    count.SetCountingTime(300000);  // a new length does not restart the count
    EXPECT_EQ(count.IsExceed(), 0);
    count.SetCountingTime(0);
    EXPECT_NE(count.IsExceed(), 0);

    // A length far beyond 32 bits of microseconds (71 minutes) is kept whole.
    count.SetCountingTime(4295ULL * 1000000ULL);
    count.BeginCountFromNow();
    std::this_thread::sleep_for(50ms);
    EXPECT_EQ(count.IsExceed(), 0);
}

TEST(DelayTimer, PassesKeepToTheGridAndDoNotDrift) {
    DelayTimer pacer(50000);
    const auto start = Clock::now();
    pacer.BeginTiming();
    for (int pass = 0; pass < 10; ++pass) {
        std::this_thread::sleep_for(30ms);  // the work of a pass
        pacer.Delay();
    }
    // Ten periods, not ten periods plus the work.
    EXPECT_GE(Since(start), 0.5 - 0.005);
    EXPECT_LT(Since(start), 0.5 + 0.2);
}

TEST(DelayTimer, AnOverrunRestartsTheGridInsteadOfABurst) {
    DelayTimer pacer(50000);
    pacer.BeginTiming();
    std::this_thread::sleep_for(300ms);  // a long camera call: six periods missed
    pacer.Delay();                       // at once
    const auto after = Clock::now();
    pacer.Delay();
    pacer.Delay();
    EXPECT_GE(Since(after), 0.1 - 0.005);  // then one period apart again
}

struct timeval Ago(double seconds) {
    struct timeval now;
    gettimeofday(&now, nullptr);
    const long long us = now.tv_sec * 1000000LL + now.tv_usec - static_cast<long long>(seconds * 1e6);
    struct timeval t;
    t.tv_sec = static_cast<time_t>(us / 1000000);
    t.tv_usec = static_cast<suseconds_t>(us % 1000000);
    return t;
}

TEST(IsTimeStampValid, WithinTheSpanBeforeNowAndALittleAhead) {
    EXPECT_EQ(IsTimeStampValid(Ago(5), 10000000), 1);
    EXPECT_EQ(IsTimeStampValid(Ago(11), 10000000), 0);
    EXPECT_EQ(IsTimeStampValid(Ago(-0.5), 10000000), 1);  // clock skew: taken as now
    EXPECT_EQ(IsTimeStampValid(Ago(-3), 10000000), 0);    // too far ahead
    EXPECT_EQ(IsTimeStampValid(Ago(0), -1), 0);
    EXPECT_EQ(IsTimeStampValid(Ago(2000), 2147483647), 1);
}

}  // namespace
