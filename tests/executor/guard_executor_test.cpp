// GuardExecutor against the fake host with a real PatrolExecutor and the real
// timers: the decision of AnalyzeSchedule, repeats, pauses, hold-off, shutdown.
#include <gtest/gtest.h>
#include <sys/time.h>

#include <thread>

#include "executor/guardExecutor.h"
#include "executor/patrolExecutor.h"
#include "executor_test_util.h"

// Lets a test hold commands in the slot (no guard thread yet) and read state.
struct GuardExecutorPeer {
    static void PrepareWithoutThread(GuardExecutor& g, PatrolExecutor* executor, int repeatCount,
                                     int pauseMinutes, int eventValidSeconds) {
        g.executor = executor;
        g.repeatCount = repeatCount;
        g.pauseMinutes = pauseMinutes;
        g.eventValidSeconds = eventValidSeconds;
        pthread_mutex_init(&g.mutex, nullptr);
        pthread_cond_init(&g.wake, nullptr);
        g.started = true;
    }
    static void StartThread(GuardExecutor& g) {
        pthread_create(&g.thread, nullptr, GuardExecutor::ThreadFuncExcute, &g);
    }
    static void Unprepare(GuardExecutor& g) {
        pthread_mutex_destroy(&g.mutex);
        pthread_cond_destroy(&g.wake);
        g.started = false;
    }
    static int Command(GuardExecutor& g) {
        pthread_mutex_lock(&g.mutex);
        const int c = g.command;
        pthread_mutex_unlock(&g.mutex);
        return c;
    }
    static void SetCommand(GuardExecutor& g, int command) {
        pthread_mutex_lock(&g.mutex);
        g.command = command;
        pthread_mutex_unlock(&g.mutex);
    }
    static GuardScheduleInfo Pending(GuardExecutor& g) {
        pthread_mutex_lock(&g.mutex);
        const GuardScheduleInfo p = g.pending;
        pthread_mutex_unlock(&g.mutex);
        return p;
    }
    static GuardScheduleInfo Current(GuardExecutor& g) {
        pthread_mutex_lock(&g.mutex);
        const GuardScheduleInfo c = g.current;
        pthread_mutex_unlock(&g.mutex);
        return c;
    }
    static void SetCurrent(GuardExecutor& g, GuardScheduleInfo info) { g.current = info; }
    static void SetState(GuardExecutor& g, int state) { g.state = state; }
    static int State(GuardExecutor& g) { return g.state.load(); }
};

namespace {

using namespace extest;
using Peer = GuardExecutorPeer;

constexpr auto kPass = 250ms;
constexpr auto kSlack = 400ms;

// An event status `ageSeconds` old (negative: in the future).
EVENT_STATUS Event(unsigned char active, double ageSeconds) {
    EVENT_STATUS e{};
    e.active = active;
    struct timeval now;
    gettimeofday(&now, nullptr);
    const long long us = static_cast<long long>(now.tv_sec) * 1000000 + now.tv_usec -
                         static_cast<long long>(ageSeconds * 1e6);
    e.timestamp.tv_sec = static_cast<time_t>(us / 1000000);
    e.timestamp.tv_usec = static_cast<suseconds_t>(us % 1000000);
    return e;
}
EVENT_STATUS Present() { return Event(1, 0.5); }
EVENT_STATUS Absent() { return Event(0, 0.5); }

bool WaitForState(GuardExecutor& g, int state, std::chrono::milliseconds timeout) {
    return fake::WaitFor([&] { return Peer::State(g) == state; }, timeout);
}

class GuardExecutorTest : public ::testing::Test {
protected:
    void SetUp() override { fake::Reset(); }
};

TEST_F(GuardExecutorTest, Lifecycle) {
    GuardExecutor unbound(1);
    EXPECT_EQ(unbound.Init(nullptr, 1, 1, 10), -2);
    EXPECT_EQ(unbound.Terminate(), -1);  // no thread to join
    unbound.AnalyzeSchedule(Present(), Present(), {5, GUARD_MODE_CONTINUOUS});  // ignored

    PatrolExecutor executor;
    GuardExecutor forgotten(2);
    ASSERT_EQ(forgotten.Init(&executor, 1, 1, 10), 0);
    EXPECT_EQ(forgotten.Init(&executor, 1, 1, 10), -1);  // one thread per guard
    // Not terminated by the host: the destructor joins the thread.
}

// The decision of AnalyzeSchedule, with the command slot held (no thread).
TEST_F(GuardExecutorTest, DecisionTable) {
    enum { OFF, CONT, FIRST, SECOND, ANY };
    enum { IDLE, RUNNING, INTERVAL, HOLDOFF };
    enum { NONE, START, STOP };
    const EVENT_STATUS on = Present(), off = Absent();
    const EVENT_STATUS expired = Event(1, 20);  // validity is 10 s
    const EVENT_STATUS ahead = Event(1, -5);    // beyond the 1 s tolerance
    struct Case {
        int state;
        GuardScheduleInfo current;
        EVENT_STATUS first, second;
        GuardScheduleInfo info;
        int expected;
    } const cases[] = {
        {IDLE, {0, OFF}, on, on, {5, OFF}, NONE},
        {IDLE, {0, OFF}, off, off, {5, CONT}, START},
        {IDLE, {0, OFF}, on, off, {5, FIRST}, START},
        {IDLE, {0, OFF}, off, on, {5, FIRST}, NONE},
        {IDLE, {0, OFF}, expired, off, {5, FIRST}, NONE},  // active but expired
        {IDLE, {0, OFF}, ahead, off, {5, FIRST}, NONE},
        {IDLE, {0, OFF}, off, on, {5, SECOND}, START},
        {IDLE, {0, OFF}, on, expired, {5, SECOND}, NONE},
        {IDLE, {0, OFF}, off, on, {5, ANY}, START},
        {IDLE, {0, OFF}, on, off, {5, ANY}, START},
        {IDLE, {0, OFF}, expired, expired, {5, ANY}, NONE},
        {IDLE, {0, OFF}, on, on, {5, 9}, NONE},  // unknown mode
        {RUNNING, {5, CONT}, off, off, {5, CONT}, NONE},
        {RUNNING, {5, CONT}, off, off, {6, CONT}, STOP},  // other patrol
        {INTERVAL, {5, CONT}, on, off, {5, FIRST}, STOP},  // other mode
        {INTERVAL, {5, CONT}, off, off, {5, OFF}, STOP},
        {RUNNING, {5, OFF}, off, off, {5, OFF}, STOP},
        {HOLDOFF, {5, CONT}, on, on, {6, ANY}, NONE},  // judged only once idle
    };
    PatrolExecutor executor;
    GuardExecutor guard(1);
    Peer::PrepareWithoutThread(guard, &executor, 1, 1, 10);
    for (size_t i = 0; i < sizeof cases / sizeof cases[0]; ++i) {
        const Case& c = cases[i];
        Peer::SetState(guard, c.state);
        Peer::SetCurrent(guard, c.current);
        Peer::SetCommand(guard, GUARD_CMD_NONE);
        guard.AnalyzeSchedule(c.first, c.second, c.info);
        EXPECT_EQ(Peer::Command(guard), c.expected) << "case " << i;
        EXPECT_EQ(Peer::Pending(guard).patrolId, c.info.patrolId) << "case " << i;
        EXPECT_EQ(Peer::Pending(guard).mode, c.info.mode) << "case " << i;
    }

    // An untaken command is never overwritten, though pending is.
    Peer::SetState(guard, RUNNING);
    Peer::SetCurrent(guard, {5, CONT});
    Peer::SetCommand(guard, START);
    guard.AnalyzeSchedule(off, off, {7, OFF});
    EXPECT_EQ(Peer::Command(guard), START);
    EXPECT_EQ(Peer::Pending(guard).patrolId, 7);
    Peer::Unprepare(guard);

    // 3000 s in microseconds does not fit 32 bits: the span saturates instead
    // of turning negative, so a 100 s old event is still present.
    GuardExecutor longSpan(2);
    Peer::PrepareWithoutThread(longSpan, &executor, 1, 1, 3000);
    longSpan.AnalyzeSchedule(Event(1, 100), off, {5, FIRST});
    EXPECT_EQ(Peer::Command(longSpan), START);
    Peer::Unprepare(longSpan);
}

TEST_F(GuardExecutorTest, StartTakesTheNewestPendingEntry) {
    StorePatrol({201, 1, 0, {1}});
    StorePatrol({202, 1, 0, {2}});
    PatrolExecutor executor;
    GuardExecutor guard(1);
    Peer::PrepareWithoutThread(guard, &executor, 1, 1, 10);
    guard.AnalyzeSchedule(Absent(), Absent(), {201, GUARD_MODE_CONTINUOUS});
    guard.AnalyzeSchedule(Absent(), Absent(), {202, GUARD_MODE_CONTINUOUS});
    EXPECT_EQ(Peer::Command(guard), GUARD_CMD_START);
    Peer::StartThread(guard);
    ASSERT_TRUE(WaitForMoves(2));
    EXPECT_EQ(fake::Moves(), MovesTo({2, 2}));
    EXPECT_EQ(Peer::Current(guard).patrolId, 202);
    EXPECT_EQ(Loads(201), 0);
    EXPECT_EQ(guard.Terminate(), 0);
}

TEST_F(GuardExecutorTest, ContinuousRunsTwiceBackToBackThenPauses) {
    StorePatrol({210, 1, 0, {3}});
    PatrolExecutor executor;
    GuardExecutor guard(1);
    ASSERT_EQ(guard.Init(&executor, 2, 1, 10), 0);
    const GuardScheduleInfo entry{210, GUARD_MODE_CONTINUOUS};
    guard.AnalyzeSchedule(Absent(), Absent(), entry);
    ASSERT_TRUE(WaitForState(guard, GUARD_STATE_INTERVAL, 6000ms));
    EXPECT_EQ(Loads(210), 2);
    EXPECT_EQ(fake::Moves(), MovesTo({3, 3, 3, 3}));
    // The second run was requested about a second after the first (the wait
    // after each Execute), not after a pause.
    const auto times = MoveTimes();
    EXPECT_LE(Seconds(times[2] - times[0]), 1.0 + Seconds(2 * kPass + kSlack));

    // Pausing: the same entry starts nothing.
    guard.AnalyzeSchedule(Absent(), Absent(), entry);
    std::this_thread::sleep_for(3 * kPass);
    EXPECT_EQ(Loads(210), 2);
    EXPECT_EQ(Peer::State(guard), GUARD_STATE_INTERVAL);

    // Off while pausing: stop, 5 s hold-off, then idle.
    guard.AnalyzeSchedule(Absent(), Absent(), {210, GUARD_MODE_OFF});
    ASSERT_TRUE(WaitForState(guard, GUARD_STATE_HOLDOFF, kPass + kSlack));
    const auto holdoff = Clock::now();
    ASSERT_TRUE(WaitForState(guard, GUARD_STATE_IDLE, 5000ms + kPass + kSlack));
    EXPECT_GE(Seconds(Clock::now() - holdoff), 5.0 - Seconds(kPass));
    EXPECT_EQ(Loads(210), 2);
    EXPECT_EQ(guard.Terminate(), 0);
}

TEST_F(GuardExecutorTest, AfterThePauseTheNextAnalyzeStartsAgain) {
    StorePatrol({220, 1, 0, {3}});
    PatrolExecutor executor;
    GuardExecutor guard(1);
    ASSERT_EQ(guard.Init(&executor, 2, 0, 10), 0);  // no pause
    const GuardScheduleInfo entry{220, GUARD_MODE_CONTINUOUS};
    guard.AnalyzeSchedule(Absent(), Absent(), entry);
    ASSERT_TRUE(fake::WaitFor([] { return Loads(220) == 2; }, 4000ms));
    ASSERT_TRUE(WaitForState(guard, GUARD_STATE_IDLE, 2000ms + kSlack));
    std::this_thread::sleep_for(2 * kPass);
    EXPECT_EQ(Loads(220), 2);  // idle until the host judges again
    guard.AnalyzeSchedule(Absent(), Absent(), entry);
    ASSERT_TRUE(fake::WaitFor([] { return Loads(220) == 4; }, 4000ms));
    EXPECT_EQ(guard.Terminate(), 0);
}

TEST_F(GuardExecutorTest, RepeatCountZeroRunsUntilStopped) {
    StorePatrol({230, 1, 0, {4}});
    PatrolExecutor executor;
    GuardExecutor guard(1);
    ASSERT_EQ(guard.Init(&executor, 0, 1, 10), 0);
    guard.AnalyzeSchedule(Absent(), Absent(), {230, GUARD_MODE_CONTINUOUS});
    ASSERT_TRUE(fake::WaitFor([] { return Loads(230) >= 3; }, 5000ms));
    EXPECT_EQ(Peer::State(guard), GUARD_STATE_RUNNING);
    guard.AnalyzeSchedule(Absent(), Absent(), {230, GUARD_MODE_OFF});
    ASSERT_TRUE(WaitForState(guard, GUARD_STATE_HOLDOFF, kPass + kSlack));
    ASSERT_TRUE(fake::WaitFor([&] { return executor.GetStatus() == PATROL_STATUS_IDLE; },
                              kPass + kSlack));
    const int loads = Loads(230);
    std::this_thread::sleep_for(1500ms);  // longer than one run and the wait after it
    EXPECT_EQ(Loads(230), loads);
    EXPECT_EQ(guard.Terminate(), 0);
}

TEST_F(GuardExecutorTest, EventModeRunsOnceThenHoldsOff) {
    StorePatrol({240, 1, 0, {5}});
    PatrolExecutor executor;
    GuardExecutor guard(1);
    ASSERT_EQ(guard.Init(&executor, 1, 1, 10), 0);
    const GuardScheduleInfo entry{240, GUARD_MODE_ANY_EVENT};
    guard.AnalyzeSchedule(Event(1, 20), Absent(), entry);  // expired: no start
    std::this_thread::sleep_for(2 * kPass);
    EXPECT_EQ(Peer::State(guard), GUARD_STATE_IDLE);
    guard.AnalyzeSchedule(Absent(), Present(), entry);
    ASSERT_TRUE(WaitForState(guard, GUARD_STATE_HOLDOFF, 3000ms));
    EXPECT_EQ(Loads(240), 1);
    guard.AnalyzeSchedule(Present(), Present(), entry);  // held off
    std::this_thread::sleep_for(2 * kPass);
    EXPECT_EQ(Loads(240), 1);
    ASSERT_TRUE(WaitForState(guard, GUARD_STATE_IDLE, 5000ms + kSlack));
    guard.AnalyzeSchedule(Present(), Absent(), entry);
    ASSERT_TRUE(fake::WaitFor([] { return Loads(240) == 2; }, 2000ms));
    EXPECT_EQ(guard.Terminate(), 0);
}

TEST_F(GuardExecutorTest, NewEntryWhileRunningStopsHoldsOffThenIsJudged) {
    StorePatrol({250, 1, 0, {1}});
    StorePatrol({251, 1, 0, {2}});
    PatrolExecutor executor;
    GuardExecutor guard(1);
    ASSERT_EQ(guard.Init(&executor, 0, 1, 10), 0);
    guard.AnalyzeSchedule(Absent(), Absent(), {250, GUARD_MODE_CONTINUOUS});
    ASSERT_TRUE(WaitForMoves(1));
    const GuardScheduleInfo next{251, GUARD_MODE_CONTINUOUS};
    guard.AnalyzeSchedule(Absent(), Absent(), next);
    ASSERT_TRUE(WaitForState(guard, GUARD_STATE_HOLDOFF, kPass + kSlack));
    guard.AnalyzeSchedule(Absent(), Absent(), next);  // during the hold-off: nothing
    ASSERT_TRUE(WaitForState(guard, GUARD_STATE_IDLE, 5000ms + kSlack));
    EXPECT_EQ(Loads(251), 0);
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_IDLE);
    guard.AnalyzeSchedule(Absent(), Absent(), next);
    ASSERT_TRUE(fake::WaitFor([] { return Loads(251) == 1; }, 2000ms));
    EXPECT_EQ(Peer::Current(guard).patrolId, 251);
    EXPECT_EQ(guard.Terminate(), 0);
}

TEST_F(GuardExecutorTest, TerminateDuringARunLeavesTheTourToFinish) {
    StorePatrol({260, 1, 1, {1, 2, 3}});
    PatrolExecutor executor;
    GuardExecutor guard(1);
    ASSERT_EQ(guard.Init(&executor, 0, 1, 10), 0);
    guard.AnalyzeSchedule(Absent(), Absent(), {260, GUARD_MODE_CONTINUOUS});
    ASSERT_TRUE(WaitForMoves(1));
    const auto asked = Clock::now();
    EXPECT_EQ(guard.Terminate(), 0);
    EXPECT_LE(Seconds(Clock::now() - asked), Seconds(kPass + kSlack));
    ASSERT_TRUE(WaitForMoves(4, 5000ms));
    ASSERT_TRUE(fake::WaitFor([&] { return executor.GetStatus() == PATROL_STATUS_IDLE; },
                              1000ms));
    std::this_thread::sleep_for(1500ms);
    EXPECT_EQ(fake::Moves(), MovesTo({1, 2, 3, 1}));
    EXPECT_EQ(Loads(260), 1);
}

}  // namespace
