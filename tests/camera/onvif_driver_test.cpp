// The ONVIF driver against the camera simulator: presets, moves, snapshot
// addresses, authentication, camera dialects, failures within the time bound.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <thread>

#include "camera/sim_http.h"
#include "host/camera.h"
#include "hostlib/camera/onvif_camera.h"
#include "hostlib/camera/onvif_soap.h"
#include "support/camsim.h"

namespace {

using Faults = std::vector<std::pair<std::string, std::string>>;
using Presets = std::map<int, std::string>;
using Tokens = std::vector<std::string>;

struct ApiDeleter {
    void operator()(CameraAPI* api) const { releaseCameraAPI(api); }
};
using Api = std::unique_ptr<CameraAPI, ApiDeleter>;

Api Onvif(int port, const std::string& password = "secret", const std::string& channel = "") {
    return Api(newCameraAPI("127.0.0.1", port, "admin", password, "onvif", "", channel));
}

Tokens Moved(CamSim& sim) {
    Tokens out;
    for (const auto& m : sim.Moves()) out.push_back(m.token);
    return out;
}

class OnvifDriver : public ::testing::Test {
protected:
    void SetUp() override {
        onvif::ForgetCameras();
        onvif::SetCallTimeoutMs(3000);
    }
    std::string SnapshotPath(CameraAPI& api) {
        std::string path;
        int port = 80, type = 0;
        if (api.GetSnapshotPath(path, port, type) != 0) return "failed";
        EXPECT_EQ(port, sim.Port());
        EXPECT_EQ(type, 1);
        return path;
    }
    CamSim sim;
};

TEST_F(OnvifDriver, PresetsMovesSnapshotPathsAndChannels) {
    EXPECT_FALSE(Api(newCameraAPI("127.0.0.1", 1, "u", "p", "acme", "", "")));
    ASSERT_TRUE(Api(newCameraAPI("127.0.0.1", sim.Port(), "admin", "secret", "ONVIF", "", "")));
    Presets presets;
    ASSERT_EQ(Onvif(sim.Port())->GetPresetList(presets), 0);
    EXPECT_EQ(presets, (Presets{{1, "Home"}, {2, "Door"}, {5, "Gate"}, {9, "Yard"}}));
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(5, "kelo5"), 0);
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(7, "kelo7"), -1);  // not on the camera
    EXPECT_EQ(SnapshotPath(*Onvif(sim.Port())), sim.SnapshotPath());

    // The sub stream has no PTZ unit: snapshots come from it, moves still go
    // through the main profile (the simulator refuses PTZ on the sub profile).
    Api sub = Onvif(sim.Port());
    ASSERT_EQ(sub->SetReso("640x360"), 0);
    EXPECT_EQ(SnapshotPath(*sub), "/snapshot.jpg?profile=Profile_1_sub");
    EXPECT_EQ(sub->GoPreset(9, "kelo9"), 0);
    // The channel picks the video source.
    EXPECT_EQ(SnapshotPath(*Onvif(sim.Port(), "secret", "2")),
              "/snapshot.jpg?profile=Profile_2_main");
    EXPECT_EQ(SnapshotPath(*Onvif(sim.Port(), "secret", "3")), "failed");
    // A snapshot URI that serves a multipart stream is fetched as type 2.
    sim.SetFault("snapshot_stream", "1");
    onvif::ForgetCameras();
    std::string path;
    int port = 80, type = 0;
    ASSERT_EQ(Onvif(sim.Port())->GetSnapshotPath(path, port, type), 0);
    EXPECT_EQ(path + " " + std::to_string(type), "/mjpeg?profile=Profile_1_main&frames=20 2");
    EXPECT_EQ(Onvif(sim.Port(), "secret", "2")->GoPreset(2, "kelo2"), 0);
    EXPECT_EQ(Moved(sim), (Tokens{"5", "9", "2"}));
}

TEST_F(OnvifDriver, TextTokensMapToStablePositionsAndBack) {
    sim.SetPresets({{"Preset_1", "One"}, {"01", "Zero one"}, {"1", "Plain one"}});
    Presets presets;
    ASSERT_EQ(Onvif(sim.Port())->GetPresetList(presets), 0);
    int p1 = onvif::PresetPosition("Preset_1"), p01 = onvif::PresetPosition("01");
    EXPECT_EQ(presets, (Presets{{p1, "One"}, {p01, "Zero one"}, {1, "Plain one"}}));
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(p01, "kelo"), 0);
    // Another process knows only the stored position: the driver asks the
    // camera's list for the token.
    onvif::ForgetCameras();
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(p1, "kelo"), 0);
    // A text position the camera does not have: one look at its list, no move.
    long before = SimRequests(sim.Port());
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(onvif::PresetPosition("Preset_2"), "kelo"), -1);
    EXPECT_EQ(SimRequests(sim.Port()) - before, 1);
    EXPECT_EQ(onvif::LastDiagnosis().failure, onvif::Failure::kNoSuchPreset);
    EXPECT_EQ(Moved(sim), (Tokens{"01", "Preset_1"}));
}

TEST_F(OnvifDriver, WarmCacheCostsOneRoundTripPerCall) {
    ASSERT_EQ(Onvif(sim.Port())->GoPreset(1, "kelo1"), 0);
    long before = SimRequests(sim.Port());
    ASSERT_EQ(Onvif(sim.Port())->GoPreset(2, "kelo2"), 0);
    Presets presets;
    ASSERT_EQ(Onvif(sim.Port())->GetPresetList(presets), 0);
    EXPECT_EQ(SimRequests(sim.Port()) - before, 2);
    // The camera moved its services: the kept paths fail once, the driver
    // discovers afresh within the same call.
    sim.SetFault("alt_paths", "1");
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(5, "kelo5"), 0);
    EXPECT_EQ(Moved(sim), (Tokens{"1", "2", "5"}));
}

TEST_F(OnvifDriver, Authentication) {
    Presets presets;
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(Onvif(sim.Port(), "wrong")->GetPresetList(presets), -1);
    EXPECT_EQ(onvif::LastDiagnosis().failure, onvif::Failure::kUnauthorized);
    EXPECT_EQ(Onvif(sim.Port(), "wrong")->GoPreset(1, "kelo1"), -1);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
    // A camera that wants HTTP Digest and ignores WS-Security.
    sim.SetFault("http_auth_only", "1");
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(1, "kelo1"), 0);
    EXPECT_EQ(onvif::LastDiagnosis().failure, onvif::Failure::kNone);
    EXPECT_EQ(Onvif(sim.Port(), "wrong")->GoPreset(2, "kelo2"), -1);  // 401 after credentials
    EXPECT_EQ(onvif::LastDiagnosis().failure, onvif::Failure::kUnauthorized);
    EXPECT_EQ(Moved(sim), Tokens{"1"});
}

TEST_F(OnvifDriver, CameraDialects) {
    for (const Faults& faults : std::vector<Faults>{
             // Tokens more than 300 s off the camera's clock are refused, the
             // camera's time needs credentials.
             {{"clock_skew_s", "7200"}, {"time_auth", "1"}},
             {{"time_no_utc", "1"}},  // local clock then
             {{"no_get_services", "1"}},
             {{"no_get_capabilities", "1"}},
             {{"alt_paths", "1"}},
             {{"internal_address", "10.9.9.9:8080"}},  // behind NAT: host and port stay ours
         }) {
        onvif::ForgetCameras();  // what the driver learnt; the simulator gets just these faults
        sim.ClearFaults();
        for (const auto& f : faults) sim.SetFault(f.first, f.second);
        Api api = Onvif(sim.Port());
        EXPECT_EQ(api->GoPreset(9, "kelo9"), 0) << faults[0].first;
        EXPECT_EQ(SnapshotPath(*api), sim.SnapshotPath()) << faults[0].first;
    }
    EXPECT_EQ(sim.Moves().size(), 6u);
}

TEST_F(OnvifDriver, FaultsAndBrokenRepliesAreFailuresNeverEmptyLists) {
    ASSERT_EQ(Onvif(sim.Port())->GoPreset(1, "kelo1"), 0);
    for (const Faults& faults : std::vector<Faults>{
             {{"refuse", "2"}},
             {{"refuse", "2"}, {"fault_http_status", "200"}},  // a fault in a 200 reply
             {{"garbage", "1"}},
             {{"status", "500"}},
             {{"drop_mid_body", "1"}}}) {
        for (const auto& f : faults) sim.SetFault(f.first, f.second);
        EXPECT_EQ(Onvif(sim.Port())->GoPreset(2, "kelo2"), -1) << faults[0].first;
        // The camera answered: refused, never taken for a wrong password or silence.
        EXPECT_EQ(onvif::LastDiagnosis().failure, onvif::Failure::kRefused) << faults[0].first;
        Presets presets;  // GetPresets is not refused
        EXPECT_EQ(Onvif(sim.Port())->GetPresetList(presets), faults[0].first == "refuse" ? 0 : -1)
            << faults[0].first;
        sim.ClearFaults();
    }
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(5, "kelo5"), 0);
}

TEST_F(OnvifDriver, SlowOrStoppedCameraFailsWithinTheTimeout) {
    onvif::SetCallTimeoutMs(300);
    // Each failing call ends near the 300 ms bound; only they are timed (the
    // set-up, a simulator started and warmed, can be slow on a loaded machine).
    const auto failsInTime = [](const std::function<bool()>& call) {
        const auto start = std::chrono::steady_clock::now();
        const bool failed = call();
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(1000));
        return failed;
    };
    ASSERT_EQ(Onvif(sim.Port())->GoPreset(1, "kelo1"), 0);  // cache warm
    sim.SetFault("delay_ms", "1500");
    EXPECT_TRUE(failsInTime([&] { return Onvif(sim.Port())->GoPreset(2, "kelo2") == -1; }));
    auto stopped = std::make_unique<CamSim>();
    int port = stopped->Port();
    ASSERT_EQ(Onvif(port)->GoPreset(1, "kelo1"), 0);
    stopped.reset();
    Presets presets;
    EXPECT_TRUE(failsInTime([&] { return Onvif(port)->GetPresetList(presets) == -1; }));
    EXPECT_EQ(onvif::LastDiagnosis().failure, onvif::Failure::kUnreachable);
    EXPECT_TRUE(failsInTime([&] { return SnapshotPath(*Onvif(port)) == "failed"; }));
}

TEST_F(OnvifDriver, ThreadsShareOneCameraSafely) {
    std::vector<std::thread> threads;
    std::atomic<int> failures{0};
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&] {
            for (int i = 0; i < 5; ++i) {
                Presets p;
                failures += Onvif(sim.Port())->GetPresetList(p) != 0 || p.size() != 4 ||
                            Onvif(sim.Port())->GoPreset(2, "kelo") != 0;
            }
        });
    for (auto& th : threads) th.join();
    EXPECT_EQ(failures.load(), 0);
    EXPECT_EQ(sim.Moves().size(), 20u);
}

}  // namespace
