// PatrolExecutor::GetRunProgress against the fake host: what each snapshot
// says at every move of a run and after it, and that readers racing a run
// never see a torn snapshot.
#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include "executor/patrolExecutor.h"
#include "fake/fake_host.h"

namespace {

using namespace std::chrono_literals;

// Scripts patrol `id` of camera 1 with the positions and a stay of 0 or more seconds.
void StorePatrol(int id, int stayTime, const std::vector<int>& positions) {
    const std::string ids = std::to_string(id);
    fake::Row row{
        {"id", ids}, {"camId", "1"}, {"name", "t"}, {"stayTime", std::to_string(stayTime)}};
    fake::OnSql("SELECT * FROM patrol WHERE id = " + ids + ";", {0, {row}});
    fake::FakeCamera camera;
    camera.settings.id = 1;
    camera.settings.host = "cam1";
    fake::AddCamera(camera);
    fake::Answer presets;
    for (int p : positions) {
        presets.rows.push_back({{"position", std::to_string(p)}, {"name", "P"}});
        fake::CameraHost("cam1").presets[p] = "P";
    }
    fake::OnSql("FROM patrol_preset WHERE patrolId = " + ids + " ORDER BY", presets);
}

auto Fields(const PATROL_RUN_PROGRESS& p) {
    return std::make_tuple(p.running, p.patrolId, static_cast<int>(p.type), p.presetCount,
                           p.presetIndex, p.position, p.runMoves, p.moves, p.runs);
}

class RunProgressTest : public ::testing::Test {
protected:
    void SetUp() override { fake::Reset(); }
    bool WaitForMoves(unsigned int moves, std::chrono::milliseconds timeout = 3000ms) {
        return fake::WaitFor([&] { return executor.GetRunProgress().moves >= moves; }, timeout);
    }
    PatrolExecutor executor;
};

TEST_F(RunProgressTest, EachMoveIsShownUntilTheNextAndTheLastRunStaysAfterItsEnd) {
    EXPECT_EQ(Fields(executor.GetRunProgress()),
              std::make_tuple(0, 0, static_cast<int>(PATROL_EXEC_NONE), 0, -1, 0, 0, 0u, 0u));
    StorePatrol(30, 0, {5, 2, 9});
    StorePatrol(31, 1, {7, 8});
    StorePatrol(32, 1, {5, 2, 9});
    // What a reader sees while each move is under way: the move before it.
    std::vector<PATROL_RUN_PROGRESS> seen;
    fake::OnGoPreset([&](int, const std::string&) { seen.push_back(executor.GetRunProgress()); });
    executor.Execute(30, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(4));
    ASSERT_TRUE(fake::WaitFor([&] { return executor.GetRunProgress().running == 0; }, 1000ms));
    const int guard = PATROL_EXEC_GUARD, direct = PATROL_EXEC_DIRECT;
    using F = decltype(Fields(seen[0]));
    const std::vector<F> expected = {
        F{1, 30, guard, 3, -1, 0, 0, 0u, 1u},  // the first move: none made yet
        F{1, 30, guard, 3, 0, 5, 1, 1u, 1u}, F{1, 30, guard, 3, 1, 2, 2, 2u, 1u},
        F{1, 30, guard, 3, 2, 9, 3, 3u, 1u},  // the closing move, back to index 0
    };
    ASSERT_EQ(seen.size(), expected.size());
    for (size_t i = 0; i < seen.size(); ++i)
        EXPECT_EQ(Fields(seen[i]), expected[i]) << "move " << i;
    EXPECT_EQ(Fields(executor.GetRunProgress()), (F{0, 30, guard, 3, 0, 5, 4, 4u, 1u}));

    // A direct run displaces a guard run, which then starts again: new runs.
    fake::OnGoPreset(nullptr);
    executor.Execute(32, PATROL_EXEC_GUARD);
    ASSERT_TRUE(WaitForMoves(5));
    executor.Execute(31, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(6));
    EXPECT_EQ(Fields(executor.GetRunProgress()), (F{1, 31, direct, 2, 0, 7, 1, 6u, 3u}));
    executor.RemovePatrol(PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(7));
    EXPECT_EQ(Fields(executor.GetRunProgress()), (F{1, 32, guard, 3, 0, 5, 1, 7u, 4u}));
}

// Patrol 40 visits 100, 101, 102 and patrol 41 visits 200 .. 204, so a
// snapshot's position must follow from its patrol and index. Readers loop
// while the worker switches between the two as fast as it moves.
TEST_F(RunProgressTest, ReadersRacingRunsSeeOnlyWholeSnapshots) {
    StorePatrol(40, 0, {100, 101, 102});
    StorePatrol(41, 0, {200, 201, 202, 203, 204});
    std::atomic<bool> stop{false};
    std::atomic<int> faults{0};
    std::atomic<unsigned int> distinctMoves{0};
    const auto reader = [&] {
        unsigned int moves = 0, runs = 0, changes = 0;
        while (!stop.load()) {
            const PATROL_RUN_PROGRESS p = executor.GetRunProgress();
            const int base = p.patrolId == 40 ? 100 : 200, count = p.patrolId == 40 ? 3 : 5;
            bool whole = p.moves >= moves && p.runs >= runs;
            if (p.runs > 0) {
                whole = whole && (p.patrolId == 40 || p.patrolId == 41) && p.presetCount == count &&
                        p.type == PATROL_EXEC_DIRECT && p.presetIndex >= -1 &&
                        p.presetIndex < p.presetCount &&
                        p.position == (p.presetIndex < 0 ? 0 : base + p.presetIndex) &&
                        p.presetIndex == (p.runMoves == 0 ? -1 : (p.runMoves - 1) % p.presetCount);
            }
            if (!whole) ++faults;
            if (p.moves != moves) ++changes;
            moves = p.moves;
            runs = p.runs;
        }
        distinctMoves += changes;
    };
    std::vector<std::thread> readers;
    for (int i = 0; i < 3; ++i) readers.emplace_back(reader);
    for (int i = 0; i < 6; ++i) {
        const unsigned int before = executor.GetRunProgress().moves;
        executor.Execute(i % 2 == 0 ? 40 : 41, PATROL_EXEC_DIRECT);
        ASSERT_TRUE(WaitForMoves(before + 2));
    }
    stop = true;
    for (auto& t : readers) t.join();
    EXPECT_EQ(faults.load(), 0);
    EXPECT_GE(distinctMoves.load(), 3u * 10u);  // every reader saw the moves go by
}

}  // namespace
