// Preset synchronisation end to end: a patrol stored in PostgreSQL, its
// camera a simulator reached through the ONVIF driver, Patrol::Load dropping
// what the camera no longer has.
#include <curl/curl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "common/pg_test_util.h"
#include "hostlib/camera_status.h"
#include "hostlib/onvif_camera.h"
#include "hostlib/onvif_soap.h"
#include "patrol/patrol.h"
#include "support/camsim.h"

namespace {

using ::testing::ElementsAre;

const int kCam = 7;

size_t Append(char* data, size_t size, size_t n, void* out) {
    static_cast<std::string*>(out)->append(data, size * n);
    return size * n;
}

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

PRESET_INFO Preset(int position, const std::string& name) {
    PRESET_INFO p;
    p.position = position;
    p.name = name;
    return p;
}

std::vector<std::pair<int, std::string>> Presets(const Patrol& p) {
    std::vector<std::pair<int, std::string>> out;
    for (int i = 0; i < p.GetPresetListNum(); ++i) {
        PRESET_INFO info;
        p.GetPresetFromList(i, &info);
        out.emplace_back(info.position, info.name);
    }
    return out;
}

std::vector<std::string> Stored(int patrolId) {
    std::vector<std::string> out;
    auto positions =
        pgtest::Column("SELECT position FROM patrol_preset WHERE patrolId = " + itos(patrolId) +
                           " ORDER BY sequence;",
                       "position");
    auto sequences =
        pgtest::Column("SELECT sequence FROM patrol_preset WHERE patrolId = " + itos(patrolId) +
                           " ORDER BY sequence;",
                       "sequence");
    for (size_t i = 0; i < positions.size(); ++i) out.push_back(sequences[i] + ":" + positions[i]);
    return out;
}

class PresetSync : public ::testing::Test {
protected:
    void SetUp() override {
        pgtest::ResetTables();
        HostResetCamConnStatus();
        onvif::ForgetCameras();
        CamSim::Options o;
        o.presets = {{"1", "Home"}, {"2", "Door"}, {"5", "Gate"}, {"Attic_A", "Attic"}};
        sim_ = std::make_unique<CamSim>(o);
        pgtest::Exec("INSERT INTO camera (id, host, port, username, password, vendor) VALUES (" +
                     itos(kCam) + ", '127.0.0.1', " + itos(sim_->Port()) +
                     ", 'admin', 'secret', 'onvif');");
        attic_ = onvif::PresetPosition("Attic_A");
        Patrol p(kCam, "tour", 5);
        p.AddPresetToList(Preset(5, "gate"));
        p.AddPresetToList(Preset(1, "home"));
        p.AddPresetToList(Preset(attic_, "attic"));
        p.AddPresetToList(Preset(2, "door"));
        ASSERT_EQ(p.Save(), 0);
        id_ = p.GetId();
    }

    std::unique_ptr<CamSim> sim_;
    int attic_ = 0;
    int id_ = 0;
};

TEST_F(PresetSync, LoadDropsPresetsTheCameraNoLongerHas) {
    Patrol p;
    ASSERT_EQ(p.Load(id_), 0);
    EXPECT_EQ(p.GetPresetListNum(), 4);  // all still on the camera: nothing rewritten

    sim_->SetPresets({{"2", "Door"}, {"5", "Gate"}, {"Attic_A", "Attic"}, {"9", "Yard"}});
    Patrol q;
    ASSERT_EQ(q.Load(id_), 0);
    EXPECT_EQ(Presets(q), (std::vector<std::pair<int, std::string>>{
                              {5, "gate"}, {attic_, "attic"}, {2, "door"}}));
    EXPECT_THAT(Stored(id_), ElementsAre("0:5", "1:" + std::to_string(attic_), "2:2"));

    // The stored text-token position still drives the camera.
    CameraAPI* api = newCameraAPI("127.0.0.1", sim_->Port(), "admin", "secret", "onvif", "", "");
    ASSERT_NE(api, nullptr);
    EXPECT_EQ(api->GoPreset(attic_, "kelo" + std::to_string(attic_)), 0);
    releaseCameraAPI(api);
    ASSERT_EQ(sim_->Moves().size(), 1u);
    EXPECT_EQ(sim_->Moves()[0].token, "Attic_A");

    // A camera with no presets left empties the patrol.
    sim_->SetPresets({});
    Patrol r;
    ASSERT_EQ(r.Load(id_), 0);
    EXPECT_EQ(r.GetPresetListNum(), 0);
    EXPECT_TRUE(Stored(id_).empty());
}

TEST_F(PresetSync, CameraNotOnlineIsNotContacted) {
    sim_->SetPresets({{"2", "Door"}});
    long before = Requests(sim_->Port());
    HostSetCamConnStatus(kCam, CAM_CONN_OFFLINE);
    Patrol p;
    ASSERT_EQ(p.Load(id_), 0);
    EXPECT_EQ(p.GetPresetListNum(), 4);
    EXPECT_EQ(Requests(sim_->Port()), before);
    EXPECT_THAT(Stored(id_), ElementsAre("0:5", "1:1", "2:" + std::to_string(attic_), "3:2"));

    HostSetCamConnStatus(kCam, CAM_CONN_ONLINE_PTZ);  // 5 lets presets be read, as 1 does
    ASSERT_EQ(p.Load(id_), 0);
    EXPECT_EQ(Presets(p), (std::vector<std::pair<int, std::string>>{{2, "door"}}));
    EXPECT_THAT(Stored(id_), ElementsAre("0:2"));
}

TEST_F(PresetSync, UnreachableCameraLeavesThePatrolAlone) {
    onvif::SetCallTimeoutMs(1000);
    sim_.reset();  // camera gone
    Patrol p;
    auto start = std::chrono::steady_clock::now();
    ASSERT_EQ(p.Load(id_), 0);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(2500));
    EXPECT_EQ(p.GetPresetListNum(), 4);
    EXPECT_EQ(Stored(id_).size(), 4u);
    onvif::SetCallTimeoutMs(5000);
}

}  // namespace
