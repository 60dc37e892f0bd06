// Snapshots from the camera simulator: every delivery of the image and the
// stream, Digest auth, faults, the snapshot file through the camera layer,
// and a stalled camera.
#include <gtest/gtest.h>
#include <unistd.h>

#include "camsim.h"
#include "host/http.h"
#include "hostlib/camera/onvif_camera.h"
#include "static_api.h"

namespace {

using Clock = std::chrono::steady_clock;
using Faults = std::vector<std::pair<std::string, std::string>>;

std::string Fetch(CamSim& sim, int type, const Faults& faults = {}, const std::string& password = "secret") {
    sim.ClearFaults();
    for (const auto& f : faults) sim.SetFault(f.first, f.second);
    return FetchSnapshot(sim.Port(), type == 1 ? sim.SnapshotPath() : sim.MjpegPath(), type, "admin", password);
}

TEST(SnapshotCamSim, DeliveriesGiveTheSameImageAndFaultsFail) {
    CamSim sim;
    const std::string reference = Fetch(sim, 1);
    ASSERT_GT(reference.size(), 100u);
    ASSERT_EQ(reference.substr(0, 2) + reference.substr(reference.size() - 2), "\xff\xd8\xff\xd9");
    struct Case {
        int type;
        Faults faults;
        bool ok;
        const char* password;
    } cases[] = {
        {1, {{"snapshot_delivery", "chunked"}}, true, "secret"},
        {1, {{"snapshot_delivery", "close"}}, true, "secret"},
        {2, {}, true, "secret"},                       // the stream's first frame
        {2, {{"drop_mid_body", "1"}}, true, "secret"},  // cut in frame 2: frame 1 is whole
        {1, {}, false, "wrong"},
        {2, {}, false, "wrong"},
        {1, {{"status", "404"}}, false, "secret"},
        {2, {{"status", "503"}}, false, "secret"},
        {1, {{"drop_mid_body", "1"}}, false, "secret"},
        {1, {{"drop_mid_body", "1"}, {"snapshot_delivery", "chunked"}}, false, "secret"},
        {1, {{"lie_length", "1"}}, false, "secret"},  // the body ends before its length
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(::testing::PrintToString(c.faults) + " type " + std::to_string(c.type) + " " + c.password);
        std::string got = Fetch(sim, c.type, c.faults, c.password);
        if (c.ok) {
            EXPECT_TRUE(got == reference);
        } else {
            EXPECT_EQ(got, "FAILED");
        }
    }
    // The stream's parts alternate with and without their own Content-Length.
    sim.ClearFaults();
    MultipartFetch reader("127.0.0.1", sim.Port(), sim.MjpegPath().c_str(), "admin", "secret", 10);
    for (int i = 0; i < 4; ++i) {
        unsigned int length = 0;
        char info[100];
        ASSERT_EQ(reader.NextPartInfo(length, info, sizeof info), 0);
        EXPECT_EQ(std::string(info).find("Content-Length") != std::string::npos, i % 2 == 0) << i;
        std::string part(length, '\0');
        ASSERT_EQ(reader.FetchContent(reinterpret_cast<unsigned char*>(&part[0]), length), 0);
        EXPECT_EQ(part.substr(0, 2) + part.substr(length - 2), "\xff\xd8\xff\xd9") << i;
    }
    // The snapshot file, through the camera layer's own control object.
    sim.ClearFaults();
    Camera camera;
    const int id = 800000000 + getpid() % 100000;
    camera.SetSettings({id, "127.0.0.1", sim.Port(), "admin", "secret", "onvif", "", "1", "", "1920x1080"});
    ASSERT_EQ(SnapshotFileGet(&camera), 0);
    EXPECT_TRUE(FileContent("/tmp/ov_snapshot_id_" + std::to_string(id) + ".jpg") == reference);
    // A camera whose snapshot URI is its MJPEG stream: the driver says type 2
    // and the file holds the stream's first frame.
    sim.SetFault("snapshot_stream", "1");
    onvif::ForgetCameras();
    ASSERT_EQ(SnapshotFileGet(&camera), 0);
    EXPECT_TRUE(FileContent("/tmp/ov_snapshot_id_" + std::to_string(id) + ".jpg") == reference);
    EXPECT_EQ(SnapshotFileDelete(id), 0);
}

double SecondsSince(Clock::time_point start) { return std::chrono::duration<double>(Clock::now() - start).count(); }

// A camera that accepts the connection and never answers: the stream fails
// once its 10 s timeout has passed; the image client honours its own timeout
// (1 s here instead of the 30 s SnapshotGet passes, which the unit tests pin).
TEST(SnapshotCamSim, AStalledCameraFailsAfterTheTimeout) {
    CamSim sim;
    auto start = Clock::now();
    EXPECT_EQ(Fetch(sim, 2, {{"delay_ms", "60000"}}), "FAILED");
    EXPECT_GE(SecondsSince(start), 9.5);
    EXPECT_LE(SecondsSince(start), 14);
    start = Clock::now();
    OvHttpClient client("127.0.0.1", sim.Port(), sim.SnapshotPath(), "admin", "secret", 1);
    int status = 0;
    EXPECT_TRUE(client.SendRequest(OV_HTTP_GET) != 0 || client.CheckResponse(status) != 0);
    EXPECT_GE(SecondsSince(start), 0.9);
    EXPECT_LE(SecondsSince(start), 3);
}

}  // namespace
