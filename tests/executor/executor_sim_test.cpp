// Executors end to end: patrols stored in PostgreSQL, the camera a simulator
// reached through the ONVIF driver. The simulator records preset tokens only
// (GotoPreset carries no name); the names sent are checked by the unit tests.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <thread>

#include "common/pg_test_util.h"
#include "executor/guardExecutor.h"
#include "executor/patrolExecutor.h"
#include "hostlib/camera_status.h"
#include "hostlib/onvif_camera.h"
#include "patrol/patrol.h"
#include "support/camsim.h"

namespace {

using namespace std::chrono_literals;
using ::testing::ElementsAre;

constexpr int kCam = 3;
constexpr double kPass = 0.25;

bool WaitFor(const std::function<bool()>& condition, std::chrono::milliseconds timeout) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!condition()) {
        if (std::chrono::steady_clock::now() >= deadline) return false;
        std::this_thread::sleep_for(5ms);
    }
    return true;
}

class ExecutorOnSimulator : public ::testing::Test {
protected:
    void SetUp() override {
        pgtest::ResetTables();
        HostResetCamConnStatus();
        onvif::ForgetCameras();
        sim_ = std::make_unique<CamSim>();  // presets 1, 2, 5, 9
        pgtest::Exec("INSERT INTO camera (id, host, port, username, password, vendor) VALUES (" +
                     itos(kCam) + ", '127.0.0.1', " + itos(sim_->Port()) +
                     ", 'admin', 'secret', 'onvif');");
    }

    static int StorePatrol(int stayTime, const std::vector<int>& positions) {
        Patrol p(kCam, "tour", stayTime);
        for (int position : positions) {
            PRESET_INFO preset;
            preset.position = position;
            preset.name = "P" + std::to_string(position);
            p.AddPresetToList(preset);
        }
        EXPECT_EQ(p.Save(), 0);
        return p.GetId();
    }

    std::vector<std::string> Tokens() {
        std::vector<std::string> out;
        for (const auto& m : sim_->Moves()) out.push_back(m.token);
        return out;
    }
    bool WaitForMoves(size_t n, std::chrono::milliseconds timeout) {
        return WaitFor([&] { return sim_->Moves().size() >= n; }, timeout);
    }

    std::unique_ptr<CamSim> sim_;
};

TEST_F(ExecutorOnSimulator, ThreePresetPatrolRunsOneStayApart) {
    const int id = StorePatrol(1, {5, 2, 9});
    PatrolExecutor executor;
    ASSERT_EQ(executor.Execute(id, PATROL_EXEC_DIRECT), 0);
    ASSERT_TRUE(WaitForMoves(4, 10000ms));
    ASSERT_TRUE(WaitFor([&] { return executor.GetStatus() == PATROL_STATUS_IDLE; }, 2000ms));
    const auto moves = sim_->Moves();
    EXPECT_THAT(Tokens(), ElementsAre("5", "2", "9", "5"));
    for (size_t i = 1; i < moves.size(); ++i) {
        const double gap = moves[i].seconds - moves[i - 1].seconds;
        // One stay, at most one pass more, and the camera call (generous on a
        // shared machine).
        EXPECT_GE(gap, 1.0) << "move " << i;
        EXPECT_LE(gap, 1.0 + kPass + 0.5) << "move " << i;
    }
}

TEST_F(ExecutorOnSimulator, GuardRunsTwiceAroundADirectRequest) {
    const int guarded = StorePatrol(1, {1, 2});
    const int direct = StorePatrol(0, {9});
    PatrolExecutor executor;
    GuardExecutor guard(1);
    ASSERT_EQ(guard.Init(&executor, 2, 1, 10), 0);
    EVENT_STATUS none{};
    guard.AnalyzeSchedule(none, none, {guarded, GUARD_MODE_CONTINUOUS});
    ASSERT_TRUE(WaitForMoves(1, 5000ms));

    // The host's request displaces the guard run; the guard patrol then starts
    // again from its first preset, and the guard makes its second run after it.
    executor.Execute(direct, PATROL_EXEC_DIRECT);
    ASSERT_TRUE(WaitForMoves(9, 15000ms));
    EXPECT_THAT(Tokens(), ElementsAre("1", "9", "9", "1", "2", "1", "1", "2", "1"));
    ASSERT_TRUE(WaitFor([&] { return executor.GetStatus() == PATROL_STATUS_IDLE; }, 2000ms));
    std::this_thread::sleep_for(1500ms);  // the pause: no third run
    EXPECT_EQ(sim_->Moves().size(), 9u);
    EXPECT_EQ(guard.Terminate(), 0);
}

}  // namespace
