// Executors end to end: patrols stored in PostgreSQL, the camera a simulator
// reached through the ONVIF driver. The simulator records preset tokens only
// (GotoPreset carries no name); the names sent are checked by the unit tests.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <memory>
#include <thread>

#include "common/pg_test_util.h"
#include "executor/guardExecutor.h"
#include "executor/patrolExecutor.h"
#include "hostlib/db/camera_status.h"
#include "hostlib/camera/onvif_camera.h"
#include "patrol/patrol.h"
#include "support/camsim.h"

namespace {

using namespace std::chrono_literals;
using ::testing::ElementsAre;

class ExecutorOnSimulator : public ::testing::Test {
protected:
    void SetUp() override {
        pgtest::ResetTables();
        HostResetCamConnStatus();
        onvif::ForgetCameras();
        sim_ = std::make_unique<CamSim>();  // presets 1, 2, 5, 9
        pgtest::Exec(
            "INSERT INTO camera (id, host, port, username, password, vendor) VALUES (3, "
            "'127.0.0.1', " +
            itos(sim_->Port()) + ", 'admin', 'secret', 'onvif');");
    }
    static int StorePatrol(int stayTime, const std::vector<int>& positions) {
        Patrol p(3, "tour", stayTime);
        for (int position : positions)
            p.AddPresetToList({position, "P" + std::to_string(position)});
        EXPECT_EQ(p.Save(), 0);
        return p.GetId();
    }
    // The tokens received, once there are `n` (and the executor is idle) or after 15 s.
    std::vector<std::string> Tokens(size_t n, bool idle = true) {
        const auto waiting = [&] {
            return sim_->Moves().size() < n || (idle && executor.GetStatus() != PATROL_STATUS_IDLE);
        };
        for (int i = 0; i < 3000 && waiting(); ++i) {
            std::this_thread::sleep_for(5ms);
        }
        std::vector<std::string> out;
        for (const auto& m : sim_->Moves()) out.push_back(m.token);
        return out;
    }
    std::unique_ptr<CamSim> sim_;
    PatrolExecutor executor;  // idle until a request
};

TEST_F(ExecutorOnSimulator, ThreePresetPatrolRunsOneStayApart) {
    ASSERT_EQ(executor.Execute(StorePatrol(1, {5, 2, 9}), PATROL_EXEC_DIRECT), 0);
    EXPECT_THAT(Tokens(4), ElementsAre("5", "2", "9", "5"));
    const auto moves = sim_->Moves();
    for (size_t i = 1; i < moves.size(); ++i) {
        // One stay, at most one pass more, and the camera call (generous on a shared machine).
        EXPECT_GE(moves[i].seconds - moves[i - 1].seconds, 1.0) << "move " << i;
        EXPECT_LE(moves[i].seconds - moves[i - 1].seconds, 1.0 + 0.25 + 0.5) << "move " << i;
    }
}

TEST_F(ExecutorOnSimulator, GuardRunsTwiceAroundADirectRequest) {
    const int guarded = StorePatrol(1, {1, 2});
    const int direct = StorePatrol(0, {9});
    GuardExecutor guard(1);
    ASSERT_EQ(guard.Init(&executor, 2, 1, 10), 0);
    guard.AnalyzeSchedule({}, {}, {guarded, GUARD_MODE_CONTINUOUS});
    ASSERT_EQ(Tokens(1, false).size(), 1u);
    // The host's request displaces the guard run; the guard patrol then starts
    // again from its first preset, and the guard makes its second run after it.
    executor.Execute(direct, PATROL_EXEC_DIRECT);
    EXPECT_THAT(Tokens(9), ElementsAre("1", "9", "9", "1", "2", "1", "1", "2", "1"));
    std::this_thread::sleep_for(1500ms);  // the pause: no third run
    EXPECT_EQ(sim_->Moves().size(), 9u);
    EXPECT_EQ(guard.Terminate(), 0);
}

}  // namespace
