// The ONVIF driver against the camera simulator: presets, moves, snapshot
// addresses, authentication, camera dialects, failures within the time bound.
#include <curl/curl.h>
#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <thread>

#include "host/camera.h"
#include "hostlib/onvif_camera.h"
#include "hostlib/onvif_soap.h"
#include "support/camsim.h"

namespace {

using Ms = std::chrono::milliseconds;

struct ApiDeleter {
    void operator()(CameraAPI* api) const { releaseCameraAPI(api); }
};
using Api = std::unique_ptr<CameraAPI, ApiDeleter>;

Api Onvif(int port, const std::string& password = "secret", const std::string& channel = "") {
    return Api(newCameraAPI("127.0.0.1", port, "admin", password, "onvif", "", channel));
}

size_t Append(char* data, size_t size, size_t n, void* out) {
    static_cast<std::string*>(out)->append(data, size * n);
    return size * n;
}

// Requests the simulator received (control endpoints aside).
long Requests(int port) {
    std::string body;
    CURL* curl = curl_easy_init();
    std::string url = "http://127.0.0.1:" + std::to_string(port) + "/control/requests";
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, Append);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &body);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, 5000L);
    curl_easy_perform(curl);
    curl_easy_cleanup(curl);
    return atol(body.c_str());
}

std::vector<std::string> Tokens(CamSim& sim) {
    std::vector<std::string> out;
    for (const auto& m : sim.Moves()) out.push_back(m.token);
    return out;
}

class OnvifDriver : public ::testing::Test {
protected:
    void SetUp() override {
        onvif::ForgetCameras();
        onvif::SetCallTimeoutMs(3000);
    }
    void TearDown() override { onvif::SetCallTimeoutMs(5000); }
};

TEST_F(OnvifDriver, PresetsMovesAndSnapshotPath) {
    CamSim sim;
    Api api = Onvif(sim.Port());
    ASSERT_TRUE(api);
    std::map<int, std::string> presets;
    ASSERT_EQ(api->GetPresetList(presets), 0);
    EXPECT_EQ(presets,
              (std::map<int, std::string>{{1, "Home"}, {2, "Door"}, {5, "Gate"}, {9, "Yard"}}));

    EXPECT_EQ(api->GoPreset(5, "kelo5"), 0);
    EXPECT_EQ(api->GoPreset(7, "kelo7"), -1);  // not on the camera
    EXPECT_EQ(Tokens(sim), std::vector<std::string>{"5"});

    std::string path;
    int port = 80, type = 0;
    ASSERT_EQ(api->GetSnapshotPath(path, port, type), 0);
    EXPECT_EQ(path, "/snapshot.jpg?profile=Profile_1_main");
    EXPECT_EQ(port, sim.Port());
    EXPECT_EQ(type, 1);

    // The sub stream has no PTZ unit: snapshots come from it, moves still go
    // through the main profile (the simulator refuses PTZ on the sub profile).
    Api sub = Onvif(sim.Port());
    ASSERT_EQ(sub->SetReso("640x360"), 0);
    ASSERT_EQ(sub->GetSnapshotPath(path, port, type), 0);
    EXPECT_EQ(path, "/snapshot.jpg?profile=Profile_1_sub");
    EXPECT_EQ(sub->GoPreset(9, "kelo9"), 0);
    presets.clear();
    EXPECT_EQ(sub->GetPresetList(presets), 0);
    EXPECT_EQ(presets.size(), 4u);
    Api unknownReso = Onvif(sim.Port());
    unknownReso->SetReso("123x45");
    ASSERT_EQ(unknownReso->GetSnapshotPath(path, port, type), 0);
    EXPECT_EQ(path, "/snapshot.jpg?profile=Profile_1_main");
    EXPECT_EQ(Tokens(sim), (std::vector<std::string>{"5", "9"}));
}

TEST_F(OnvifDriver, ChannelPicksTheVideoSource) {
    CamSim sim;
    std::string path;
    int port = 0, type = 0;
    ASSERT_EQ(Onvif(sim.Port(), "secret", "2")->GetSnapshotPath(path, port, type), 0);
    EXPECT_EQ(path, "/snapshot.jpg?profile=Profile_2_main");
    ASSERT_EQ(Onvif(sim.Port(), "secret", "0")->GetSnapshotPath(path, port, type), 0);
    EXPECT_EQ(path, "/snapshot.jpg?profile=Profile_1_main");
    EXPECT_EQ(Onvif(sim.Port(), "secret", "3")->GetSnapshotPath(path, port, type), -1);
    EXPECT_EQ(Onvif(sim.Port(), "secret", "2")->GoPreset(2, "kelo2"), 0);
}

TEST_F(OnvifDriver, TextTokensMapToStableNegativePositions) {
    CamSim::Options o;
    o.presets = {{"Preset_1", "One"}, {"01", "Zero one"}, {"1", "Plain one"}};
    CamSim sim(o);
    std::map<int, std::string> presets;
    ASSERT_EQ(Onvif(sim.Port())->GetPresetList(presets), 0);
    int p1 = onvif::PresetPosition("Preset_1"), p01 = onvif::PresetPosition("01");
    EXPECT_EQ(presets,
              (std::map<int, std::string>{{p1, "One"}, {p01, "Zero one"}, {1, "Plain one"}}));

    EXPECT_EQ(Onvif(sim.Port())->GoPreset(p01, "kelo"), 0);
    // Another process knows only the stored position: the driver asks the
    // camera's list for the token.
    onvif::ForgetCameras();
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(p1, "kelo"), 0);
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(1, "kelo1"), 0);
    // A text position the camera does not have: one look at its list, no move.
    long before = Requests(sim.Port());
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(onvif::PresetPosition("Preset_2"), "kelo"), -1);
    EXPECT_EQ(Requests(sim.Port()) - before, 1);
    EXPECT_EQ(Tokens(sim), (std::vector<std::string>{"01", "Preset_1", "1"}));
}

TEST_F(OnvifDriver, WarmCacheCostsOneRoundTripPerCall) {
    CamSim sim;
    ASSERT_EQ(Onvif(sim.Port())->GoPreset(1, "kelo1"), 0);
    long before = Requests(sim.Port());
    ASSERT_EQ(Onvif(sim.Port())->GoPreset(2, "kelo2"), 0);
    std::map<int, std::string> presets;
    ASSERT_EQ(Onvif(sim.Port())->GetPresetList(presets), 0);
    EXPECT_EQ(Requests(sim.Port()) - before, 2);

    // The camera moved its services: the kept paths fail once, the driver
    // discovers afresh within the same call.
    sim.SetFault("alt_paths", "1");
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(5, "kelo5"), 0);
    EXPECT_EQ(Tokens(sim), (std::vector<std::string>{"1", "2", "5"}));
}

TEST_F(OnvifDriver, Authentication) {
    CamSim sim;
    std::map<int, std::string> presets;
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(Onvif(sim.Port(), "wrong")->GetPresetList(presets), -1);
    EXPECT_EQ(Onvif(sim.Port(), "wrong")->GoPreset(1, "kelo1"), -1);
    EXPECT_LT(std::chrono::steady_clock::now() - start, Ms(2000));
    EXPECT_TRUE(presets.empty());

    // A camera that wants HTTP Digest and ignores WS-Security.
    sim.SetFault("http_auth_only", "1");
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(1, "kelo1"), 0);
    EXPECT_EQ(Onvif(sim.Port(), "wrong")->GoPreset(2, "kelo2"), -1);  // 401 after credentials
    EXPECT_EQ(Tokens(sim), std::vector<std::string>{"1"});
}

TEST_F(OnvifDriver, ClockOffsetSignsForTheCamerasClock) {
    CamSim sim;
    sim.SetFault("clock_skew_s", "7200");  // tokens more than 300 s off are refused
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(1, "kelo1"), 0);
    onvif::ForgetCameras();
    sim.SetFault("time_auth", "1");  // the time itself needs credentials
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(2, "kelo2"), 0);
    onvif::ForgetCameras();
    sim.ClearFaults();
    sim.SetFault("time_no_utc", "1");  // local clock then
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(5, "kelo5"), 0);
    EXPECT_EQ(Tokens(sim), (std::vector<std::string>{"1", "2", "5"}));
}

TEST_F(OnvifDriver, ServiceAddressesOfDifferentCameras) {
    CamSim sim;
    for (const char* fault : {"no_get_services", "no_get_capabilities", "alt_paths"}) {
        onvif::ForgetCameras();
        sim.ClearFaults();
        sim.SetFault(fault, "1");
        EXPECT_EQ(Onvif(sim.Port())->GoPreset(9, "kelo9"), 0) << fault;
    }
    // Behind NAT: the camera names its internal address; host and port stay ours.
    onvif::ForgetCameras();
    sim.ClearFaults();
    sim.SetFault("internal_address", "10.9.9.9:8080");
    Api api = Onvif(sim.Port());
    EXPECT_EQ(api->GoPreset(2, "kelo2"), 0);
    std::string path;
    int port = 0, type = 0;
    ASSERT_EQ(api->GetSnapshotPath(path, port, type), 0);
    EXPECT_EQ(path, "/snapshot.jpg?profile=Profile_1_main");
    EXPECT_EQ(port, sim.Port());
    EXPECT_EQ(Tokens(sim), (std::vector<std::string>{"9", "9", "9", "2"}));
}

TEST_F(OnvifDriver, FaultsAreFailures) {
    CamSim sim;
    ASSERT_EQ(Onvif(sim.Port())->GoPreset(1, "kelo1"), 0);
    sim.SetFault("refuse", "2");
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(2, "kelo2"), -1);
    sim.SetFault("fault_http_status", "200");  // a fault in a 200 reply
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(2, "kelo2"), -1);
    sim.ClearFaults();
    sim.SetFault("garbage", "1");
    std::map<int, std::string> presets;
    EXPECT_EQ(Onvif(sim.Port())->GetPresetList(presets), -1);
    sim.ClearFaults();
    sim.SetFault("status", "500");
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(5, "kelo5"), -1);
    sim.ClearFaults();
    sim.SetFault("drop_mid_body", "1");
    EXPECT_EQ(Onvif(sim.Port())->GetPresetList(presets), -1);
    sim.ClearFaults();
    EXPECT_EQ(Onvif(sim.Port())->GoPreset(5, "kelo5"), 0);
    EXPECT_EQ(Tokens(sim), (std::vector<std::string>{"1", "5"}));
}

TEST_F(OnvifDriver, DownOrSlowCameraFailsWithinTheTimeout) {
    onvif::SetCallTimeoutMs(1000);
    int port;
    {
        CamSim sim;
        port = sim.Port();
        ASSERT_EQ(Onvif(port)->GoPreset(1, "kelo1"), 0);  // cache warm
        sim.SetFault("delay_ms", "3000");
        auto start = std::chrono::steady_clock::now();
        EXPECT_EQ(Onvif(port)->GoPreset(2, "kelo2"), -1);
        std::map<int, std::string> presets;
        EXPECT_EQ(Onvif(port)->GetPresetList(presets), -1);
        EXPECT_LT(std::chrono::steady_clock::now() - start, Ms(2 * 1000 + 500));
    }
    auto start = std::chrono::steady_clock::now();
    std::map<int, std::string> presets;
    EXPECT_EQ(Onvif(port)->GetPresetList(presets), -1);  // simulator stopped
    std::string path;
    int p = 0, type = 0;
    EXPECT_EQ(Onvif(port)->GetSnapshotPath(path, p, type), -1);
    EXPECT_LT(std::chrono::steady_clock::now() - start, Ms(2 * 1000 + 500));
}

TEST_F(OnvifDriver, ThreadsShareOneCameraSafely) {
    CamSim sim;
    std::vector<std::thread> threads;
    std::atomic<int> failures{0};
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < 5; ++i) {
                std::map<int, std::string> presets;
                if (Onvif(sim.Port())->GetPresetList(presets) != 0 || presets.size() != 4)
                    ++failures;
                if (Onvif(sim.Port())->GoPreset(t % 2 ? 2 : 9, "kelo") != 0) ++failures;
            }
        });
    for (auto& th : threads) th.join();
    EXPECT_EQ(failures.load(), 0);
    EXPECT_EQ(sim.Moves().size(), 20u);
}

TEST(CameraFactory, VendorsAndUserDefinedCameras) {
    Api a(newCameraAPI("127.0.0.1", 1, "u", "p", "ONVIF", "", ""));
    EXPECT_TRUE(a);
    EXPECT_EQ(newCameraAPI("127.0.0.1", 1, "u", "p", "acme", "", ""), nullptr);
    EXPECT_EQ(newCameraAPI("127.0.0.1", 1, "u", "p", "", "", ""), nullptr);

    for (auto [text, want] : std::vector<std::pair<std::string, int>>{
             {"1", 1}, {"2", 2}, {"3", -1}, {"", -1}, {"01", -1}}) {
        Api u(newUserDefinedAPI("cam", 8080, "u", "p", "/img.jpg?x=1", text));
        ASSERT_TRUE(u);
        EXPECT_EQ(u->SetReso("640x480"), 0);
        std::string path;
        int port = 8080, type = 0;
        EXPECT_EQ(u->GetSnapshotPath(path, port, type), 0);
        EXPECT_EQ(path, "/img.jpg?x=1");
        EXPECT_EQ(port, 8080);
        EXPECT_EQ(type, want) << text;
        std::map<int, std::string> presets;
        EXPECT_EQ(u->GetPresetList(presets), -1);
        EXPECT_EQ(u->GoPreset(1, "kelo1"), -1);
    }
}

}  // namespace
