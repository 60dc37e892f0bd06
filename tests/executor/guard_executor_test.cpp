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

TEST_F(GuardExecutorTest, InitWithoutExecutorStartsNothing) {
    GuardExecutor guard(1);
    EXPECT_EQ(guard.Init(nullptr, 1, 1, 10), -2);
    EXPECT_EQ(guard.Terminate(), -1);
    guard.AnalyzeSchedule(Present(), Present(), {5, GUARD_MODE_CONTINUOUS});  // ignored
    EXPECT_EQ(Peer::State(guard), GUARD_STATE_IDLE);
}

// The decision of AnalyzeSchedule, with the command slot held (no thread).
TEST_F(GuardExecutorTest, DecisionTable) {
    struct Case {
        const char* what;
        int state;
        GuardScheduleInfo current;
        EVENT_STATUS first, second;
        GuardScheduleInfo info;
        int expected;
    };
    const GuardScheduleInfo none{0, GUARD_MODE_OFF};
    const EVENT_STATUS expired = Event(1, 20);  // validity is 10 s
    const EVENT_STATUS future = Event(1, -5);   // beyond the 1 s tolerance
    const Case cases[] = {
        {"off, idle", GUARD_STATE_IDLE, none, Present(), Present(), {5, GUARD_MODE_OFF},
         GUARD_CMD_NONE},
        {"continuous, idle", GUARD_STATE_IDLE, none, Absent(), Absent(),
         {5, GUARD_MODE_CONTINUOUS}, GUARD_CMD_START},
        {"first present", GUARD_STATE_IDLE, none, Present(), Absent(),
         {5, GUARD_MODE_FIRST_EVENT}, GUARD_CMD_START},
        {"first inactive", GUARD_STATE_IDLE, none, Absent(), Present(),
         {5, GUARD_MODE_FIRST_EVENT}, GUARD_CMD_NONE},
        {"first active but expired", GUARD_STATE_IDLE, none, expired, Absent(),
         {5, GUARD_MODE_FIRST_EVENT}, GUARD_CMD_NONE},
        {"first active but in the future", GUARD_STATE_IDLE, none, future, Absent(),
         {5, GUARD_MODE_FIRST_EVENT}, GUARD_CMD_NONE},
        {"second present", GUARD_STATE_IDLE, none, Absent(), Present(),
         {5, GUARD_MODE_SECOND_EVENT}, GUARD_CMD_START},
        {"second: only first present", GUARD_STATE_IDLE, none, Present(), expired,
         {5, GUARD_MODE_SECOND_EVENT}, GUARD_CMD_NONE},
        {"any: only second present", GUARD_STATE_IDLE, none, Absent(), Present(),
         {5, GUARD_MODE_ANY_EVENT}, GUARD_CMD_START},
        {"any: only first present", GUARD_STATE_IDLE, none, Present(), Absent(),
         {5, GUARD_MODE_ANY_EVENT}, GUARD_CMD_START},
        {"any: both expired", GUARD_STATE_IDLE, none, expired, expired, {5, GUARD_MODE_ANY_EVENT},
         GUARD_CMD_NONE},
        {"unknown mode", GUARD_STATE_IDLE, none, Present(), Present(), {5, 9}, GUARD_CMD_NONE},
        {"continuous while running the same entry", GUARD_STATE_RUNNING,
         {5, GUARD_MODE_CONTINUOUS}, Absent(), Absent(), {5, GUARD_MODE_CONTINUOUS},
         GUARD_CMD_NONE},
        {"other patrol while running", GUARD_STATE_RUNNING, {5, GUARD_MODE_CONTINUOUS}, Absent(),
         Absent(), {6, GUARD_MODE_CONTINUOUS}, GUARD_CMD_STOP},
        {"other mode while pausing", GUARD_STATE_INTERVAL, {5, GUARD_MODE_CONTINUOUS}, Present(),
         Absent(), {5, GUARD_MODE_FIRST_EVENT}, GUARD_CMD_STOP},
        {"off while pausing", GUARD_STATE_INTERVAL, {5, GUARD_MODE_CONTINUOUS}, Absent(),
         Absent(), {5, GUARD_MODE_OFF}, GUARD_CMD_STOP},
        {"off while running in off mode", GUARD_STATE_RUNNING, {5, GUARD_MODE_OFF}, Absent(),
         Absent(), {5, GUARD_MODE_OFF}, GUARD_CMD_STOP},
        {"new entry during hold-off: judged, not idle", GUARD_STATE_HOLDOFF,
         {5, GUARD_MODE_CONTINUOUS}, Present(), Present(), {6, GUARD_MODE_ANY_EVENT},
         GUARD_CMD_NONE},
    };
    PatrolExecutor executor;
    GuardExecutor guard(1);
    Peer::PrepareWithoutThread(guard, &executor, 1, 1, 10);
    for (const Case& c : cases) {
        Peer::SetState(guard, c.state);
        Peer::SetCurrent(guard, c.current);
        Peer::SetCommand(guard, GUARD_CMD_NONE);
        guard.AnalyzeSchedule(c.first, c.second, c.info);
        EXPECT_EQ(Peer::Command(guard), c.expected) << c.what;
        EXPECT_EQ(Peer::Pending(guard).patrolId, c.info.patrolId) << c.what;
        EXPECT_EQ(Peer::Pending(guard).mode, c.info.mode) << c.what;
    }

    // An untaken command is never overwritten, though pending is.
    Peer::SetState(guard, GUARD_STATE_RUNNING);
    Peer::SetCurrent(guard, {5, GUARD_MODE_CONTINUOUS});
    Peer::SetCommand(guard, GUARD_CMD_START);
    guard.AnalyzeSchedule(Absent(), Absent(), {7, GUARD_MODE_OFF});
    EXPECT_EQ(Peer::Command(guard), GUARD_CMD_START);
    EXPECT_EQ(Peer::Pending(guard).patrolId, 7);
    Peer::Unprepare(guard);
}

TEST_F(GuardExecutorTest, EventValiditySpanDoesNotOverflow) {
    PatrolExecutor executor;
    GuardExecutor guard(1);
    // 3000 s in microseconds does not fit 32 bits: the span saturates instead
    // of turning negative, so a 100 s old event is still present.
    Peer::PrepareWithoutThread(guard, &executor, 1, 1, 3000);
    guard.AnalyzeSchedule(Event(1, 100), Absent(), {5, GUARD_MODE_FIRST_EVENT});
    EXPECT_EQ(Peer::Command(guard), GUARD_CMD_START);
    Peer::Unprepare(guard);

    GuardExecutor negative(2);  // a negative validity counts as 0
    Peer::PrepareWithoutThread(negative, &executor, 1, 1, -5);
    negative.AnalyzeSchedule(Event(1, 2), Absent(), {5, GUARD_MODE_FIRST_EVENT});
    EXPECT_EQ(Peer::Command(negative), GUARD_CMD_NONE);
    Peer::Unprepare(negative);
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

TEST_F(GuardExecutorTest, DestructorTerminatesAForgottenGuard) {
    PatrolExecutor executor;
    {
        GuardExecutor guard(1);
        ASSERT_EQ(guard.Init(&executor, 1, 1, 10), 0);
        EXPECT_EQ(guard.Init(&executor, 1, 1, 10), -1);  // one thread per guard
    }
    SUCCEED();
}

}  // namespace
