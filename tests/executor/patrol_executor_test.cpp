// PatrolExecutor against the fake host with the real timers: request
// precedence, runs, failures and shutdown.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <memory>
#include <random>
#include <thread>

#include "executor/patrolExecutor.h"
#include "executor_test_util.h"

namespace {

using namespace extest;

constexpr auto kPass = 250ms;
constexpr auto kSlack = 400ms;  // scheduling on a loaded machine and sanitizers

const char* kFile = "patrolExecutor.cpp";

class PatrolExecutorTest : public ::testing::Test {
protected:
    void SetUp() override { fake::Reset(); }

    static bool WaitForStatus(PatrolExecutor& e, int status,
                              std::chrono::milliseconds timeout = 2000ms) {
        return fake::WaitFor([&] { return e.GetStatus() == status; }, timeout);
    }
    // The fake saw exactly `moves` and nothing more arrives within two passes.
    static void ExpectMovesSettle(const std::vector<std::string>& moves) {
        ASSERT_TRUE(WaitForMoves(moves.size()));
        std::this_thread::sleep_for(2 * kPass);
        EXPECT_EQ(fake::Moves(), moves);
    }
};

TEST_F(PatrolExecutorTest, FreshExecutorIsIdleAndRefusesOtherKinds) {
    PatrolExecutor executor;
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_IDLE);
    EXPECT_EQ(executor.Execute(1, PATROL_EXEC_NONE), -2);
    EXPECT_EQ(executor.Execute(1, static_cast<PATROL_EXEC_TYPE>(7)), -2);
    EXPECT_EQ(executor.RemovePatrol(PATROL_EXEC_NONE), -2);
    std::this_thread::sleep_for(3 * kPass);
    EXPECT_TRUE(fake::Statements().empty());
    EXPECT_TRUE(fake::CameraCalls().empty());
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_IDLE);
}

TEST_F(PatrolExecutorTest, RunVisitsPresetsInOrderOneStayApartAndEnds) {
    StorePatrol({10, 3, 1, {5, 2, 9}});
    PatrolExecutor executor;
    const auto posted = Clock::now();
    ASSERT_EQ(executor.Execute(10, PATROL_EXEC_GUARD), 0);
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_RUNNING));
    ASSERT_TRUE(WaitForMoves(4, 6000ms));
    EXPECT_EQ(fake::Moves(), MovesTo({5, 2, 9, 5}));

    const auto times = MoveTimes();
    ASSERT_EQ(times.size(), 4u);
    EXPECT_LE(Seconds(times[0] - posted), Seconds(kPass + kSlack));
    for (size_t i = 1; i < times.size(); ++i) {
        const double gap = Seconds(times[i] - times[i - 1]);
        EXPECT_GE(gap, 1.0) << "move " << i;
        EXPECT_LE(gap, 1.0 + Seconds(kPass + kSlack)) << "move " << i;
    }
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE));
    // The request was consumed: the tour is not repeated.
    ExpectMovesSettle(MovesTo({5, 2, 9, 5}));
    EXPECT_EQ(Loads(10), 1);
    EXPECT_EQ(fake::ApisOutstanding(), 0);
    EXPECT_EQ(fake::ResultsOutstanding(), 0);
    // One control object per move, made for camera 3 and released.
    const auto calls = fake::CameraCallNames();
    EXPECT_EQ(std::count_if(calls.begin(), calls.end(),
                            [](const std::string& c) {
                                return c.rfind("newCameraAPI cam3 80 ", 0) == 0;
                            }),
              5);  // four moves and the preset synchronisation of the load
}

TEST_F(PatrolExecutorTest, StayTimesOutsideTheUsualRange) {
    StorePatrol({11, 1, -5, {1, 2}});    // negative: no stay
    StorePatrol({12, 1, 4295, {3, 4}});  // 4295 s does not fit 32 bits in microseconds
    StorePatrol({13, 1, 0, {6}});        // one preset: visited twice
    PatrolExecutor executor;

    executor.Execute(11, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(3, 2000ms));
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE));

    executor.Execute(12, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(4));
    std::this_thread::sleep_for(3 * kPass);
    EXPECT_EQ(fake::Moves(), MovesTo({1, 2, 1, 3}));
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_RUNNING);

    executor.Execute(13, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(6));
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE));
    ExpectMovesSettle(MovesTo({1, 2, 1, 3, 6, 6}));
    const auto times = MoveTimes();
    EXPECT_LE(Seconds(times[5] - times[4]), Seconds(kPass + kSlack));
}

TEST_F(PatrolExecutorTest, DirectDisplacesGuardRunWhichThenRestartsFromItsFirstPreset) {
    StorePatrol({20, 1, 1, {1, 2, 3}});
    StorePatrol({21, 1, 0, {7, 8}});
    PatrolExecutor executor;
    executor.Execute(20, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(1));
    executor.Execute(20, PATROL_EXEC_GUARD);  // the same request again: run undisturbed
    ASSERT_TRUE(WaitForMoves(2, 3000ms));
    EXPECT_EQ(Loads(20), 1);
    executor.Execute(21, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(6, 3000ms));
    EXPECT_EQ(fake::Moves(), MovesTo({1, 2, 7, 8, 7, 1}));
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_RUNNING);
    EXPECT_EQ(Loads(20), 2);  // loaded again for the restart
    executor.RemovePatrol(PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE));
}

TEST_F(PatrolExecutorTest, GuardRequestWaitsBehindDirectRunEvenWhenItsRemovalIsOvertaken) {
    StorePatrol({30, 1, 1, {7, 8}});
    StorePatrol({31, 1, 0, {1, 2}});
    PatrolExecutor executor;
    executor.Execute(30, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(1));
    // Both within one pass: the guard's Execute replaces the removal command,
    // so the direct run goes on to the end of its tour.
    executor.RemovePatrol(PATROL_EXEC_DIRECT);
    executor.Execute(31, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(6, 5000ms));
    EXPECT_EQ(fake::Moves(), MovesTo({7, 8, 7, 1, 2, 1}));
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE));
    EXPECT_EQ(Loads(30), 1);
    EXPECT_EQ(Loads(31), 1);
}

TEST_F(PatrolExecutorTest, RemovalOfTheRunningKindAndOfTheOtherKind) {
    StorePatrol({50, 1, 1, {1, 2, 3}});
    StorePatrol({51, 1, 1, {7, 8}});
    PatrolExecutor executor;

    // Removing the kind that is not running only empties its slot.
    executor.Execute(50, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(1));
    executor.RemovePatrol(PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(2, 3000ms));
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_RUNNING);

    // Removing the running guard kind: idle at the next pass, nothing started.
    executor.RemovePatrol(PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE, kPass + kSlack));
    ExpectMovesSettle(MovesTo({1, 2}));

    // Removing a direct run hands over to the pending guard request at once.
    executor.Execute(51, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(3));
    executor.Execute(50, PATROL_EXEC_GUARD);  // waits behind the direct run
    std::this_thread::sleep_for(kPass + 50ms);
    const auto removed = Clock::now();
    executor.RemovePatrol(PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(4));
    EXPECT_EQ(fake::Moves(), MovesTo({1, 2, 7, 1}));
    EXPECT_LE(Seconds(MoveTimes()[3] - removed), Seconds(kPass + kSlack));
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_RUNNING);
    executor.RemovePatrol(PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE));
}

TEST_F(PatrolExecutorTest, ZeroAndNegativeIdsAreNothingToRun) {
    StorePatrol({60, 1, 1, {1, 2, 3}});
    PatrolExecutor executor;

    // Id 0 for the running kind, other slot empty: the run stops.
    executor.Execute(60, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(1));
    executor.Execute(0, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE, kPass + kSlack));
    ExpectMovesSettle(MovesTo({1}));

    // A negative direct id is picked, dropped, and stops the guard run; the
    // guard request waits for the next command.
    executor.Execute(60, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(2));
    executor.Execute(-3, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE, kPass + kSlack));
    ExpectMovesSettle(MovesTo({1, 1}));
    executor.Execute(0, PATROL_EXEC_DIRECT);  // the next pick serves the waiting request
    ASSERT_TRUE(WaitForMoves(3));
    EXPECT_EQ(fake::Moves(), MovesTo({1, 1, 1}));
    EXPECT_EQ(Loads(60), 3);
    EXPECT_TRUE(fake::LogTexts().empty());
    executor.RemovePatrol(PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE));
}

TEST_F(PatrolExecutorTest, RequestsThatDoNotLoadOrHaveNoPresets) {
    StorePatrol({70, 1, 0, {4, 5}});
    StorePatrol({71, 1, 0, {}});
    PatrolExecutor executor;

    executor.Execute(71, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(fake::WaitFor(
        [] { return Logged(kFile, "ExecPatrol", "No preset to execute."); }, 2000ms));
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_IDLE);

    // A guard request that does not load: logged, idle, slot emptied.
    executor.Execute(42, PATROL_EXEC_GUARD);
    ASSERT_TRUE(fake::WaitFor([] { return Logged(kFile, "ChangeExcutePatrol",
                                                 "Load patrol 42 failure."); },
                              2000ms));
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_IDLE);
    executor.Execute(0, PATROL_EXEC_DIRECT);  // a pick again: the guard slot is empty
    std::this_thread::sleep_for(2 * kPass);
    EXPECT_EQ(Loads(42), 1);

    // A failing direct request hands over to the pending guard request.
    executor.Execute(43, PATROL_EXEC_DIRECT);
    executor.Execute(70, PATROL_EXEC_GUARD);  // overtakes the command; slots both filled
    ASSERT_TRUE(WaitForMoves(3));
    EXPECT_TRUE(Logged(kFile, "ChangeExcutePatrol", "Load patrol 43 failure."));
    EXPECT_EQ(fake::Moves(), MovesTo({4, 5, 4}));
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE));
    EXPECT_EQ(Loads(71), 1);
    EXPECT_EQ(fake::ResultsOutstanding(), 0);
}

TEST_F(PatrolExecutorTest, FailedDirectLoadRestartsTheInterruptedGuardRun) {
    StorePatrol({80, 1, 1, {1, 2, 3}});
    PatrolExecutor executor;
    executor.Execute(80, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(2, 3000ms));
    executor.Execute(99, PATROL_EXEC_DIRECT);  // no such patrol
    ASSERT_TRUE(WaitForMoves(3, 2000ms));
    EXPECT_TRUE(Logged(kFile, "ChangeExcutePatrol", "Load patrol 99 failure."));
    // Not left loading without a run: the guard patrol starts again.
    EXPECT_EQ(fake::Moves(), MovesTo({1, 2, 1}));
    EXPECT_EQ(executor.GetStatus(), PATROL_STATUS_RUNNING);
    ASSERT_TRUE(WaitForMoves(6, 5000ms));
    EXPECT_EQ(fake::Moves(), MovesTo({1, 2, 1, 2, 3, 1}));
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE));
}

TEST_F(PatrolExecutorTest, CameraRefusingTheSecondPresetEndsTheRun) {
    StorePatrol({100, 2, 0, {5, 2, 9}});
    fake::CameraHost(CameraHostName(2)).refusedPositions = {2};
    PatrolExecutor executor;
    executor.Execute(100, PATROL_EXEC_GUARD);
    ASSERT_TRUE(fake::WaitFor([] {
        return Logged(kFile, "ExecPatrol", "Go to camera preset failed. Position=2, Name=kelo2");
    }, 2000ms));
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE));
    ExpectMovesSettle(MovesTo({5, 2}));
    EXPECT_EQ(fake::ApisOutstanding(), 0);
}

TEST_F(PatrolExecutorTest, DestructionDuringARunMakesNoFurtherMove) {
    StorePatrol({110, 1, 0, {1, 2, 3}});
    std::atomic<int> entered{0};
    fake::OnGoPreset([&](int, const std::string&) {
        if (++entered == 2) std::this_thread::sleep_for(300ms);  // a slow camera call
    });
    auto executor = std::make_unique<PatrolExecutor>();
    executor->Execute(110, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(fake::WaitFor([&] { return entered.load() == 2; }, 2000ms));
    executor.reset();  // posted while the second move is under way
    EXPECT_EQ(fake::Moves(), MovesTo({1, 2}));
    EXPECT_EQ(fake::ApisOutstanding(), 0);
}

TEST_F(PatrolExecutorTest, ConcurrentPostersLeaveAConsistentExecutor) {
    StorePatrol({130, 1, 0, {1, 2}});
    StorePatrol({131, 1, 0, {3}});
    PatrolExecutor executor;
    std::vector<std::thread> posters;
    for (int t = 0; t < 4; ++t) {
        posters.emplace_back([&executor, t] {
            std::mt19937 rng(t);
            for (int i = 0; i < 200; ++i) {
                const auto kind = static_cast<PATROL_EXEC_TYPE>(rng() % 2);
                if (rng() % 3 == 0) {
                    executor.RemovePatrol(kind);
                } else {
                    executor.Execute(130 + static_cast<int>(rng() % 3), kind);  // 132 does not load
                }
                const int status = executor.GetStatus();
                EXPECT_TRUE(status >= PATROL_STATUS_IDLE && status <= PATROL_STATUS_RUNNING);
                std::this_thread::sleep_for(std::chrono::microseconds(rng() % 5000));
            }
        });
    }
    for (auto& p : posters) p.join();
    executor.RemovePatrol(PATROL_EXEC_DIRECT);
    executor.RemovePatrol(PATROL_EXEC_GUARD);
    // The second removal overtakes the first: a direct run may finish its tour.
    ASSERT_TRUE(WaitForStatus(executor, PATROL_STATUS_IDLE, 3000ms));
    EXPECT_EQ(fake::ApisOutstanding(), 0);
    EXPECT_EQ(fake::ResultsOutstanding(), 0);
}

}  // namespace

#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
#include <sys/resource.h>

namespace {

// Address space of this process in bytes (VmSize).
size_t AddressSpace() {
    FILE* f = fopen("/proc/self/statm", "r");
    unsigned long pages = 0;
    if (f != nullptr) {
        if (fscanf(f, "%lu", &pages) != 1) pages = 0;
        fclose(f);
    }
    return pages * static_cast<size_t>(sysconf(_SC_PAGESIZE));
}

// A worker that cannot be created (no room for its stack, as in a crowded
// 32-bit process) is reported, and the destructor does not join it.
TEST_F(PatrolExecutorTest, WorkerThatCannotBeCreatedIsReportedAndNotJoined) {
    struct rlimit old;
    ASSERT_EQ(getrlimit(RLIMIT_AS, &old), 0);
    struct rlimit tight = old;
    tight.rlim_cur = AddressSpace() + (2u << 20);  // less than one default thread stack
    ASSERT_EQ(setrlimit(RLIMIT_AS, &tight), 0);
    auto executor = std::make_unique<PatrolExecutor>();
    ASSERT_EQ(setrlimit(RLIMIT_AS, &old), 0);
    if (fake::LogTexts().empty()) {
        // The C library reused the stack of an earlier thread of this process.
        GTEST_SKIP() << "thread created from a cached stack";
    }
    EXPECT_TRUE(Logged(kFile, "PatrolExecutor", "Create worker thread failed: 11."));
    EXPECT_EQ(executor->Execute(1, PATROL_EXEC_DIRECT), 0);
    EXPECT_EQ(executor->GetStatus(), PATROL_STATUS_IDLE);
    executor.reset();
}

}  // namespace
#endif
