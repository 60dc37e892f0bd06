// The executors against the fake host with the real timers: PatrolExecutor
// precedence, failures, stay times and shutdown; GuardExecutor decisions,
// repeats, pauses, hold-off and shutdown; the pacing timer.
#include <gtest/gtest.h>
#include <pthread.h>
#include <sys/time.h>
#include <time.h>

#include <algorithm>
#include <atomic>
#include <climits>
#include <cstdlib>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <tuple>

#include "common/worker_thread.h"
#include "executor/guardExecutor.h"
#include "executor/patrolExecutor.h"
#include "fake/fake_host.h"
#include "host/timer.h"

// Lets a test judge entries with no guard thread to take the command.
struct GuardExecutorPeer {
    static void PrepareWithoutThread(GuardExecutor& g) {
        pthread_mutex_init(&g.mutex, nullptr);
        InitWorkerCond(&g.wake);
        g.started = true;
    }
    static void StartThread(GuardExecutor& g) {
        pthread_create(&g.thread, nullptr, GuardExecutor::ThreadFuncExcute, &g);
    }
    static void Set(GuardExecutor& g, int state, int eventValidSeconds) {
        g.state = state;
        g.eventValidSeconds = eventValidSeconds;
        g.current = {5, GUARD_MODE_CONTINUOUS};
    }
    static std::pair<int, int> Take(GuardExecutor& g) {  // command and pending id; clears
        pthread_mutex_lock(&g.mutex);
        const std::pair<int, int> taken{g.command, g.pending.patrolId};
        g.command = GUARD_CMD_NONE;
        pthread_mutex_unlock(&g.mutex);
        return taken;
    }
    static int State(GuardExecutor& g) { return g.state.load(); }
};

namespace {

using Peer = GuardExecutorPeer;
using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

constexpr auto kPass = 250ms;
constexpr auto kSlack = 400ms;  // scheduling on a loaded machine and sanitizers

// Scripts the two SELECTs of Patrol::Load and gives camera `camId` the
// positions. Call before any executor thread can reach the camera.
void StorePatrol(int id, int camId, int stayTime, const std::vector<int>& positions) {
    const auto str = [](int v) { return std::to_string(v); };
    const std::string ids = str(id), host = "cam" + str(camId);
    fake::Row row{{"id", ids}, {"camId", str(camId)}, {"name", "t"}, {"stayTime", str(stayTime)}};
    fake::OnSql("SELECT * FROM patrol WHERE id = " + ids + ";", {0, {row}});
    fake::FakeCamera camera;
    camera.settings.id = camId;
    camera.settings.host = host;
    fake::AddCamera(camera);
    fake::Answer presets;
    for (int p : positions) {
        presets.rows.push_back({{"position", str(p)}, {"name", "P" + str(p)}});
        fake::CameraHost(host).presets[p] = "P" + str(p);
    }
    fake::OnSql("FROM patrol_preset WHERE patrolId = " + ids + " ORDER BY", presets);
}

// "5 kelo5" for each position.
std::vector<std::string> MovesTo(const std::vector<int>& positions) {
    std::vector<std::string> out;
    for (int p : positions) out.push_back(std::to_string(p) + " kelo" + std::to_string(p));
    return out;
}

bool WaitForMoves(size_t count, std::chrono::milliseconds timeout = 3000ms) {
    return fake::WaitFor([count] { return fake::Moves().size() >= count; }, timeout);
}

// How often patrol `id` was loaded (its row read).
int Loads(int id) {
    const auto s = fake::Statements();
    const std::string row = "SELECT * FROM patrol WHERE id = " + std::to_string(id) + ";";
    return static_cast<int>(std::count(s.begin(), s.end(), row));
}

double Since(Clock::time_point t) {
    return std::chrono::duration<double>(Clock::now() - t).count();
}

// Whether "patrolExecutor.cpp:<line>:<function>(): <message>" was logged.
bool Logged(const std::string& what) {
    for (const auto& t : fake::LogTexts()) {
        if (t.rfind("patrolExecutor.cpp:", 0) == 0 && t.find(what) != t.npos) return true;
    }
    return false;
}

class ExecutorTest : public ::testing::Test {
protected:
    void SetUp() override { fake::Reset(); }
    bool WaitForStatus(int status, std::chrono::milliseconds timeout = kPass + kSlack) {
        return fake::WaitFor([&] { return executor.GetStatus() == status; }, timeout);
    }
    bool WaitForState(int state, std::chrono::milliseconds timeout = kPass + kSlack) {
        return fake::WaitFor([&] { return Peer::State(guard) == state; }, timeout);
    }
    void Judge(int patrolId, int mode) { guard.AnalyzeSchedule({}, {}, {patrolId, mode}); }
    // The fake saw exactly `moves`, and nothing more arrives within two passes.
    static void ExpectMovesSettle(const std::vector<int>& moves) {
        ASSERT_TRUE(WaitForMoves(moves.size()));
        std::this_thread::sleep_for(2 * kPass);
        EXPECT_EQ(fake::Moves(), MovesTo(moves));
    }
    PatrolExecutor executor;  // idle until a request
    GuardExecutor guard{1};   // no thread until Init
};

TEST_F(ExecutorTest, PrecedenceOfDirectAndGuardRequestsAndRemovals) {
    StorePatrol(20, 1, 1, {1, 2, 3});
    StorePatrol(21, 1, 0, {7, 8});
    executor.Execute(20, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(1));
    executor.Execute(20, PATROL_EXEC_GUARD);  // the same request again: run undisturbed
    ASSERT_TRUE(WaitForMoves(2));
    executor.Execute(21, PATROL_EXEC_DIRECT);  // displaces the guard run, which restarts
    ASSERT_TRUE(WaitForMoves(6));
    EXPECT_EQ(fake::Moves(), MovesTo({1, 2, 7, 8, 7, 1}));
    executor.RemovePatrol(PATROL_EXEC_DIRECT);  // not running: only its slot emptied
    ASSERT_TRUE(WaitForMoves(7));
    executor.RemovePatrol(PATROL_EXEC_GUARD);  // running: idle at the next pass
    ASSERT_TRUE(WaitForStatus(PATROL_STATUS_IDLE));
    ExpectMovesSettle({1, 2, 7, 8, 7, 1, 2});
    executor.Execute(20, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(8));
    executor.Execute(21, PATROL_EXEC_GUARD);  // waits behind the direct run
    ExpectMovesSettle({1, 2, 7, 8, 7, 1, 2, 1});
}

TEST_F(ExecutorTest, ZeroAndNegativeIdsAndStayTimes) {
    StorePatrol(60, 1, 1, {1, 2, 3});
    StorePatrol(11, 1, -5, {4, 5});    // no stay
    StorePatrol(12, 1, 4295, {6, 7});  // 4295 s does not fit 32 bits in microseconds
    executor.Execute(60, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(1));
    executor.Execute(0, PATROL_EXEC_GUARD);  // the running kind, other slot empty: stops
    ASSERT_TRUE(WaitForStatus(PATROL_STATUS_IDLE));
    executor.Execute(60, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(2));
    executor.Execute(-3, PATROL_EXEC_DIRECT);  // picked, dropped, stops the guard run
    ASSERT_TRUE(WaitForStatus(PATROL_STATUS_IDLE));
    ExpectMovesSettle({1, 1});
    EXPECT_TRUE(fake::LogTexts().empty());
    executor.RemovePatrol(PATROL_EXEC_GUARD);  // the guard request was still waiting
    executor.Execute(11, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(5, 2 * kPass + kSlack));
    executor.Execute(12, PATROL_EXEC_DIRECT);
    ExpectMovesSettle({1, 1, 4, 5, 4, 6});
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_RUNNING);
}

TEST_F(ExecutorTest, RefusedPresetNoPresetsAndLoadFailures) {
    StorePatrol(100, 2, 0, {5, 2, 9});
    fake::CameraHost("cam2").refusedPositions = {2};
    StorePatrol(71, 1, 0, {});
    StorePatrol(80, 1, 1, {1, 2, 3});
    executor.Execute(100, PATROL_EXEC_GUARD);  // the camera refuses the second preset
    ASSERT_TRUE(WaitForMoves(2));
    ASSERT_TRUE(WaitForStatus(PATROL_STATUS_IDLE));
    EXPECT_TRUE(Logged("ExecPatrol(): Go to camera preset failed. Position=2, Name=kelo2"));
    executor.Execute(71, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(fake::WaitFor([] { return Logged("ExecPatrol(): No preset to execute."); }, 1s));
    executor.Execute(42, PATROL_EXEC_GUARD);
    ASSERT_TRUE(fake::WaitFor([] { return Logged("(): Load patrol 42 failure."); }, 1s));
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_IDLE);
    // A direct request fails to load while the guard slot names the
    // interrupted guard run: that run starts again, not left loading.
    executor.Execute(80, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(4));
    executor.Execute(99, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(5));
    EXPECT_TRUE(Logged("ChangeExcutePatrol(): Load patrol 99 failure."));
    EXPECT_EQ(fake::Moves(), MovesTo({5, 2, 1, 2, 1}));
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_RUNNING);
    EXPECT_EQ(fake::ResultsOutstanding(), 0);
}

TEST_F(ExecutorTest, DestructionDuringARunMakesNoFurtherMove) {
    StorePatrol(110, 1, 0, {1, 2, 3});
    std::atomic<int> entered{0};
    std::atomic<size_t> stack{0};
    fake::OnGoPreset([&](int, const std::string&) {
        pthread_attr_t attr;  // the worker's own stack: bounded, whatever the ulimit
        size_t size = 0;
        if (pthread_getattr_np(pthread_self(), &attr) == 0) {
            pthread_attr_getstacksize(&attr, &size);
            pthread_attr_destroy(&attr);
        }
        stack = size;
        if (++entered == 2) std::this_thread::sleep_for(300ms);  // a slow camera call
    });
    auto own = std::make_unique<PatrolExecutor>();
    own->Execute(110, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(fake::WaitFor([&] { return entered.load() == 2; }, 2000ms));
    own.reset();  // while the second move is under way
    EXPECT_EQ(fake::Moves(), MovesTo({1, 2}));
    EXPECT_EQ(fake::ApisOutstanding(), 0);
    EXPECT_GT(stack.load(), 0u);
    EXPECT_LE(stack.load(), 1024u * 1024u);
}

// The executor is destroyed while its worker is in a slow call (300 ms): the
// destructor returns as soon as that call has, and no further load or move
// is begun.
TEST_F(ExecutorTest, DestructionDuringASlowCallBeginsNoFurtherCall) {
    enum Where { kPresetRead, kClosingMove, kFailingDirectLoad };
    struct Case {
        const char* name;
        Where where;
        std::vector<int> moves;
        int guardLoads;
    };
    const Case cases[] = {
        {"the preset read of a load: no first move", kPresetRead, {}, 0},
        {"the closing move of a run: the guard request is not loaded", kClosingMove, {4, 4}, 0},
        {"a failing direct load: the guard patrol is not loaded again", kFailingDirectLoad, {6}, 1},
    };
    std::atomic<bool> entered{false};
    Clock::time_point returned;  // written by the worker, read after the join
    std::atomic<int> moves{0};
    const Case* now = nullptr;
    const auto slow = [&](Where where) {
        if (now->where != where) return;
        entered = true;
        std::this_thread::sleep_for(300ms);
        returned = Clock::now();
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        fake::Reset();
        now = &c;
        entered = false;
        moves = 0;
        StorePatrol(30, 1, 0, {4});   // the direct patrol
        StorePatrol(31, 1, 60, {6});  // the guard patrol
        fake::OnGetPresetList([&] { slow(kPresetRead); });
        fake::OnGoPreset([&](int, const std::string&) {
            if (++moves == 2) slow(kClosingMove);
        });
        fake::OnSqlHandler([&](const std::string& sql) -> std::optional<fake::Answer> {
            if (sql.find("WHERE id = 99;") != sql.npos) slow(kFailingDirectLoad);
            return std::nullopt;
        });
        auto own = std::make_unique<PatrolExecutor>();
        if (c.where == kFailingDirectLoad) {
            own->Execute(31, PATROL_EXEC_GUARD);
            ASSERT_TRUE(WaitForMoves(1));
            own->Execute(99, PATROL_EXEC_DIRECT);  // no such patrol
        } else {
            own->Execute(30, PATROL_EXEC_DIRECT);
            own->Execute(31, PATROL_EXEC_GUARD);  // waits behind the direct run
        }
        ASSERT_TRUE(fake::WaitFor([&] { return entered.load(); }, 2000ms));
        own.reset();
        EXPECT_LT(std::chrono::duration<double>(Clock::now() - returned).count(), 0.125);
        EXPECT_EQ(fake::Moves(), MovesTo(c.moves));
        EXPECT_EQ(Loads(31), c.guardLoads);
        EXPECT_EQ(fake::ApisOutstanding(), 0);
        EXPECT_EQ(fake::ResultsOutstanding(), 0);
    }
}

// Right after the pass that began a wait (a stay; a pause; a hold-off) the
// next pass is nearly a period away: the destructor and Terminate do not wait
// for it.
TEST_F(ExecutorTest, DestroyAndTerminateDoNotWaitForTheNextPass) {
    StorePatrol(120, 1, 60, {1, 2});
    StorePatrol(121, 1, 0, {3});
    auto own = std::make_unique<PatrolExecutor>();
    own->Execute(120, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(1));
    auto t0 = Clock::now();
    own.reset();  // in a 60 s stay
    EXPECT_LT(Since(t0), 0.125);
    EXPECT_EQ(fake::Moves(), MovesTo({1}));

    // Continuous mode pauses after its one run; a switch to off holds off.
    for (int state : {GUARD_STATE_INTERVAL, GUARD_STATE_HOLDOFF}) {
        SCOPED_TRACE(state);
        GuardExecutor g{2};
        ASSERT_EQ(g.Init(&executor, 1, 1, 10), 0);
        g.AnalyzeSchedule({}, {}, {121, GUARD_MODE_CONTINUOUS});
        ASSERT_TRUE(fake::WaitFor([&] { return Peer::State(g) == GUARD_STATE_RUNNING; }, 1s));
        if (state == GUARD_STATE_HOLDOFF) g.AnalyzeSchedule({}, {}, {121, GUARD_MODE_OFF});
        ASSERT_TRUE(fake::WaitFor([&] { return Peer::State(g) == state; }, 3000ms));
        t0 = Clock::now();
        EXPECT_EQ(g.Terminate(), 0);
        EXPECT_LT(Since(t0), 0.125);
    }
}

// Passes keep to their grid without drift, also while other posts signal the
// condition variable; after an overrun of more than a period the grid
// restarts from now. The library's pacer and the host's DelayTimer alike.
TEST(Pacing, PassesKeepToTheirGridAndRestartAfterAnOverrun) {
    pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
    pthread_cond_t wake;
    InitWorkerCond(&wake);
    std::atomic<bool> done{false};
    std::thread poster([&] {  // posts that are not an exit
        while (!done) {
            pthread_cond_signal(&wake);
            std::this_thread::sleep_for(5ms);
        }
    });
    WorkerPacer pacer(50000);
    DelayTimer host(50000);
    const auto waitPacer = [&] {
        pthread_mutex_lock(&mutex);
        pacer.WaitNext(&mutex, &wake, [] { return false; });
        pthread_mutex_unlock(&mutex);
    };
    const std::pair<std::function<void()>, std::function<void()>> timers[] = {
        {[&] { pacer.BeginTiming(); }, waitPacer},
        {[&] { host.BeginTiming(); }, [&] { host.Delay(); }},
    };
    for (const auto& [begin, wait] : timers) {
        const auto start = Clock::now();
        begin();
        for (int pass = 0; pass < 10; ++pass) {
            std::this_thread::sleep_for(30ms);  // the work of a pass
            wait();
        }
        EXPECT_GE(Since(start), 0.5 - 0.005);  // ten periods, not ten periods plus the work
        EXPECT_LT(Since(start), 0.5 + 0.2);
        std::this_thread::sleep_for(130ms);  // a pass overruns by more than a period
        auto t = Clock::now();
        wait();
        EXPECT_LT(Since(t), 0.045);  // the next pass at once
        t = Clock::now();
        wait();
        EXPECT_GE(Since(t), 0.05 - 0.005);  // then a period later, not a burst
    }
    done = true;
    poster.join();
    pthread_cond_destroy(&wake);
}

// An event status `ageSeconds` old (negative: in the future).
EVENT_STATUS Event(unsigned char active, double ageSeconds) {
    struct timeval now;
    gettimeofday(&now, nullptr);
    const long long us =
        now.tv_sec * 1000000LL + now.tv_usec - static_cast<long long>(ageSeconds * 1e6);
    return {active, 0, {static_cast<time_t>(us / 1000000), static_cast<suseconds_t>(us % 1000000)}};
}

TEST_F(ExecutorTest, InitWithNullThenDecisionTableThenAnUntakenStartIsKept) {
    EXPECT_EQ(guard.Init(nullptr, 1, 1, 10), -2);
    EXPECT_EQ(guard.Terminate(), -1);
    Judge(5, GUARD_MODE_CONTINUOUS);  // ignored
    enum { OFF, CONT, FIRST, SECOND, ANY };
    enum { IDLE, RUNNING, INTERVAL, HOLDOFF };
    enum { NONE, START, STOP };
    const EVENT_STATUS on = Event(1, 0.5), off = Event(0, 0.5), expired = Event(1, 20);
    const EVENT_STATUS ahead = Event(1, -5), skewed = Event(1, -0.5);  // tolerance: 1 s
    // state, event validity in seconds, first and second event, entry mode and patrol, decision
    const std::tuple<int, int, EVENT_STATUS, EVENT_STATUS, int, int, int> cases[] = {
        // clang-format off
        {IDLE, 10, off, off, CONT, 5, START},      {IDLE, 10, on, on, OFF, 5, NONE},
        {IDLE, 10, on, off, FIRST, 5, START},      {IDLE, 10, off, on, FIRST, 5, NONE},
        {IDLE, 10, expired, off, FIRST, 5, NONE},  {IDLE, 10, ahead, off, FIRST, 5, NONE},
        {IDLE, 10, skewed, off, FIRST, 5, START},  {IDLE, 10, off, on, SECOND, 5, START},
        {IDLE, 10, on, off, SECOND, 5, NONE},      {IDLE, 10, off, expired, SECOND, 5, NONE},
        {IDLE, 10, off, on, ANY, 5, START},        {IDLE, 10, off, off, ANY, 5, NONE},
        {IDLE, 10, expired, expired, ANY, 5, NONE}, {RUNNING, 10, off, off, CONT, 5, NONE},
        {RUNNING, 10, off, off, CONT, 6, STOP},    {INTERVAL, 10, on, off, FIRST, 5, STOP},
        {INTERVAL, 10, off, off, OFF, 5, STOP},    {HOLDOFF, 10, on, on, ANY, 6, NONE},
        {IDLE, -1, on, off, FIRST, 5, NONE},       // a negative validity counts as 0
        {IDLE, 3000, Event(1, 100), off, FIRST, 5, START},  // span saturates, not negative
        // clang-format on
    };
    Peer::PrepareWithoutThread(guard);
    for (const auto& [state, validity, first, second, mode, patrolId, expected] : cases) {
        Peer::Set(guard, state, validity);
        guard.AnalyzeSchedule(first, second, {patrolId, mode});
        EXPECT_EQ(Peer::Take(guard).first, expected) << "mode " << mode << ", state " << state;
    }
    // A START not yet taken is not replaced by a STOP; pending follows the newest entry.
    Peer::Set(guard, IDLE, 10);
    Judge(201, CONT);
    Peer::Set(guard, INTERVAL, 10);
    Judge(202, CONT);  // would post a STOP
    EXPECT_EQ(Peer::Take(guard), std::make_pair(static_cast<int>(START), 202));
    Peer::StartThread(guard);  // for Terminate
    EXPECT_EQ(guard.Terminate(), 0);
}

// repeatCount 2: two runs back to back, a pause, off while pausing, the 5 s
// hold-off, a start again; then Terminate during a run.
TEST_F(ExecutorTest, ContinuousRunsTwicePausesHoldsOffAndTerminates) {
    StorePatrol(210, 1, 1, {3});
    ASSERT_EQ(guard.Init(&executor, 2, 1, 10), 0);
    Judge(210, GUARD_MODE_CONTINUOUS);
    ASSERT_TRUE(fake::WaitFor([] { return Loads(210) == 2; }, 2000ms + kPass + kSlack));
    ASSERT_TRUE(WaitForState(GUARD_STATE_INTERVAL, 3000ms));
    Judge(210, GUARD_MODE_CONTINUOUS);  // pausing: starts nothing
    Judge(210, GUARD_MODE_OFF);
    ASSERT_TRUE(WaitForState(GUARD_STATE_HOLDOFF));
    const auto holdoff = Clock::now();
    ASSERT_TRUE(WaitForState(GUARD_STATE_IDLE, 5000ms + kPass + kSlack));
    EXPECT_GE(Since(holdoff), 5.0 - 0.25);
    EXPECT_EQ(Loads(210), 2);
    Judge(210, GUARD_MODE_CONTINUOUS);
    ASSERT_TRUE(WaitForMoves(5));
    const auto asked = Clock::now();
    EXPECT_EQ(guard.Terminate(), 0);
    EXPECT_LE(Since(asked), 0.25 + 0.4);  // a pass and the slack
    ASSERT_TRUE(WaitForMoves(6));         // the executor's tour goes on to its end
    EXPECT_EQ(fake::Moves(), MovesTo({3, 3, 3, 3, 3, 3}));
}

// repeatCount 0 repeats until a new entry stops it (hold-off, no more runs).
TEST_F(ExecutorTest, RepeatsWithoutEndUntilANewEntryStopsIt) {
    StorePatrol(250, 1, 0, {1});
    ASSERT_EQ(guard.Init(&executor, 0, 1, 10), 0);
    Judge(250, GUARD_MODE_CONTINUOUS);
    ASSERT_TRUE(fake::WaitFor([] { return Loads(250) == 3; }, 5000ms));
    Judge(251, GUARD_MODE_CONTINUOUS);
    ASSERT_TRUE(WaitForState(GUARD_STATE_HOLDOFF));
    std::this_thread::sleep_for(1500ms);  // longer than one run and the wait after it
    EXPECT_EQ(Loads(250), 3);
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_IDLE);
}

// Wall-clock timestamps past 2038-01-19 03:14:07 UTC, the last second of a
// 32-bit time_t: with the clock just past it (events stamped either side) and
// in 2039, an event counts by its age. With a 32-bit time_t the wall clock
// cannot be read then, and no event counts as present.
TEST_F(ExecutorTest, EventsStampedPast2038CountByTheirAge) {
    const bool wide = sizeof(time_t) * CHAR_BIT >= 64;
    enum { NONE = GUARD_CMD_NONE, START = GUARD_CMD_START };
    const int64_t moments[] = {int64_t{1} << 31, 2190499200 /* 2039-06-01 */};
    Peer::PrepareWithoutThread(guard);
    Peer::Set(guard, GUARD_STATE_IDLE, 10);
    for (const int64_t moment : moments) {
        struct timespec real;
        clock_gettime(CLOCK_REALTIME, &real);
        const auto shift = std::chrono::seconds(moment) + 500ms -
                           std::chrono::seconds(real.tv_sec) -
                           std::chrono::nanoseconds(real.tv_nsec);
        const fake::ClockShift at(std::chrono::duration_cast<std::chrono::microseconds>(shift),
                                  0us);
        struct timeval now;
        const int rc = gettimeofday(&now, nullptr);
        if (wide) {
            ASSERT_TRUE(rc == 0 && now.tv_sec >= moment) << "the clock is not shifted";
        }
        // age in seconds (1: before 2^31 s for the first moment), decision
        const std::pair<double, int> cases[] = {
            {0.2, START}, {1, START}, {9, START}, {20, NONE}, {-5, NONE}};
        for (const auto& [age, expected] : cases) {
            guard.AnalyzeSchedule(Event(1, age), {}, {5, GUARD_MODE_FIRST_EVENT});
            EXPECT_EQ(Peer::Take(guard).first, wide ? expected : NONE)
                << "now " << moment << " s + 0.5 s, event " << age << " s old";
        }
    }
    Peer::StartThread(guard);  // for Terminate
    EXPECT_EQ(guard.Terminate(), 0);
}

// The timers with the monotonic clock past 2^31 s: a count that crosses it,
// then a paced loop beyond it.
TEST(Timers, CountAndPaceAcross2To31SecondsOfTheMonotonicClock) {
    if (sizeof(time_t) * CHAR_BIT < 64) GTEST_SKIP() << "a 32-bit time_t ends at 2^31 s";
    struct timespec real;
    clock_gettime(CLOCK_MONOTONIC, &real);
    const auto shift = std::chrono::seconds(int64_t{1} << 31) - 100ms -
                       std::chrono::seconds(real.tv_sec) - std::chrono::nanoseconds(real.tv_nsec);
    const fake::ClockShift at(0us, std::chrono::duration_cast<std::chrono::microseconds>(shift));
    struct timespec now;
    ASSERT_EQ(clock_gettime(CLOCK_MONOTONIC, &now), 0);
    ASSERT_GE(now.tv_sec, (int64_t{1} << 31) - 1) << "the clock is not shifted";

    TimeCount count;
    count.SetCountingTime(300000);
    const auto begun = Clock::now();
    count.BeginCountFromNow();
    EXPECT_EQ(count.IsExceed(), 0);
    ASSERT_TRUE(fake::WaitFor([&] { return count.IsExceed() != 0; }, 2000ms));
    EXPECT_GE(Since(begun), 0.3 - 0.005);

    DelayTimer pacer(50000);
    const auto paced = Clock::now();
    pacer.BeginTiming();
    for (int pass = 0; pass < 4; ++pass) pacer.Delay();
    EXPECT_GE(Since(paced), 0.2 - 0.005);
    EXPECT_LT(Since(paced), 0.2 + 0.2);
}

// The width of time_t in this build, against the one the caller configured
// (the cross-build check sets PTZ_EXPECT_TIME_T_BITS).
TEST(TimeAbi, TimeTHasTheConfiguredWidth) {
    const char* expected = getenv("PTZ_EXPECT_TIME_T_BITS");
    if (!expected) GTEST_SKIP() << "time_t: " << sizeof(time_t) * CHAR_BIT << " bits";
    EXPECT_EQ(std::to_string(sizeof(time_t) * CHAR_BIT), expected);
}

}  // namespace
