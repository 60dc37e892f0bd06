// Snapshots from the camera simulator: every delivery of the image and the
// stream, Digest auth, faults, the snapshot file through the camera layer,
// and cameras that stall or trickle.
#include <gtest/gtest.h>
#include <unistd.h>

#include <functional>
#include <thread>

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

// Seconds from the start of the call that failed to its -1; -1 when nothing failed.
using Fetcher = std::function<double(CamSim&)>;

// An image through the host's client with a 1 s timeout, from SendRequest on.
double HostImage(CamSim& sim) {
    OvHttpClient client("127.0.0.1", sim.Port(), sim.SnapshotPath(), "admin", "secret", 1);
    auto start = Clock::now();
    int status = 0;
    std::string body(200000, '\0');
    if (client.SendRequest(OV_HTTP_GET) != 0 || client.CheckResponse(status) != 0 ||
        client.ReadData(&body[0], static_cast<int>(body.size())) < 0)
        return SecondsSince(start);
    return -1;
}

// Parts of the stream through the host's reader with a 1 s timeout: `whole`
// parts must come (taking longer than the timeout when there are many), then
// the next NextPartInfo call is timed.
Fetcher HostStream(int whole) {
    return [whole](CamSim& sim) -> double {
        MultipartFetch reader("127.0.0.1", sim.Port(), sim.MjpegPath().c_str(), "admin", "secret",
                              1);
        unsigned int length = 0;
        char info[100];
        auto start = Clock::now();
        for (int i = 0; i < whole; ++i) {
            std::string part(100000, '\0');
            if (reader.NextPartInfo(length, info, sizeof info) != 0 || length > part.size() ||
                reader.FetchContent(reinterpret_cast<unsigned char*>(&part[0]), length) != 0)
                return -2;
        }
        if (whole > 0 && SecondsSince(start) < 1.2) return -3;  // did not outlast the timeout
        start = Clock::now();
        return reader.NextPartInfo(length, info, sizeof info) != 0 ? SecondsSince(start) : -1;
    };
}

// The first frame through SnapshotGet: the library's own 10 s timeout.
double LibraryStream(CamSim& sim) {
    auto start = Clock::now();
    std::string got = FetchSnapshot(sim.Port(), sim.MjpegPath(), 2, "admin", "secret");
    return got == "FAILED" ? SecondsSince(start) : -1;  // a failure leaves no buffer
}

// A camera that stalls before answering, or that declares 100000 bytes and
// sends one every 100 ms: every fetch fails with -1 at its deadline, however
// slowly data keeps coming; a stream's later parts each get the whole timeout.
// The cases run at once, one simulator each.
TEST(SnapshotCamSim, StalledOrTricklingCamerasFailAtTheDeadline) {
    const Faults stall = {{"delay_ms", "60000"}}, trickle = {{"trickle_ms", "100"}},
                 trickle16th = {{"trickle_ms", "100"}, {"trickle_frame", "15"}};
    struct Case {
        const char* name;
        Faults faults;
        Fetcher fetch;
        double deadline;  // seconds
    } cases[] = {
        {"image, stalled", stall, HostImage, 1},
        {"image, trickled body", trickle, HostImage, 1},
        {"stream, stalled", stall, HostStream(0), 1},
        {"stream, trickled first part", trickle, HostStream(0), 1},
        {"stream, 15 parts then a trickled one", trickle16th, HostStream(15), 1},
        {"SnapshotGet, trickled first part", trickle, LibraryStream, 10},
    };
    std::vector<double> seconds(std::size(cases));
    std::vector<std::thread> threads;
    for (size_t i = 0; i < std::size(cases); ++i)
        threads.emplace_back([&, i] {
            CamSim sim;
            for (const auto& f : cases[i].faults) sim.SetFault(f.first, f.second);
            seconds[i] = cases[i].fetch(sim);
        });
    for (std::thread& t : threads) t.join();
    for (size_t i = 0; i < std::size(cases); ++i) {
        SCOPED_TRACE(cases[i].name);
        EXPECT_GE(seconds[i], cases[i].deadline - 0.05);
        EXPECT_LE(seconds[i], cases[i].deadline + 0.5);
        printf("%s: -1 after %.3f s\n", cases[i].name, seconds[i]);
    }
}

}  // namespace
