// The camera simulator itself: what the test-support class and other
// developers' tests rely on (auth, moves with times, deliveries, faults).
#include "support/camsim.h"

#include <curl/curl.h>
#include <gtest/gtest.h>

namespace {

struct Reply {
    CURLcode rc = CURLE_OK;
    long status = 0;
    std::string body;
    std::string headers;
};

size_t Append(char* data, size_t size, size_t n, void* out) {
    static_cast<std::string*>(out)->append(data, size * n);
    return size * n;
}

Reply Fetch(int port, const std::string& path, const std::string& post = "",
            const std::string& userpw = "admin:secret") {
    Reply r;
    CURL* curl = curl_easy_init();
    std::string url = "http://127.0.0.1:" + std::to_string(port) + path;
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, 5000L);
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl, CURLOPT_HTTPAUTH, CURLAUTH_DIGEST);
    curl_easy_setopt(curl, CURLOPT_USERPWD, userpw.c_str());
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, Append);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &r.body);
    curl_easy_setopt(curl, CURLOPT_HEADERFUNCTION, Append);
    curl_easy_setopt(curl, CURLOPT_HEADERDATA, &r.headers);
    if (!post.empty()) curl_easy_setopt(curl, CURLOPT_POSTFIELDS, post.c_str());
    r.rc = curl_easy_perform(curl);
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &r.status);
    curl_easy_cleanup(curl);
    return r;
}

std::string Goto(const std::string& token, const std::string& profile = "Profile_1_main") {
    return "<s:Envelope xmlns:s=\"http://www.w3.org/2003/05/soap-envelope\"><s:Body>"
           "<GotoPreset xmlns=\"http://www.onvif.org/ver20/ptz/wsdl\"><ProfileToken>" +
           profile + "</ProfileToken><PresetToken>" + token +
           "</PresetToken></GotoPreset></s:Body></s:Envelope>";
}

TEST(CamSim, MovesAreLoggedWithTheSimulatorsClock) {
    CamSim sim;
    double before = sim.Now();
    Reply r = Fetch(sim.Port(), "/onvif/ptz_service", Goto("5"));
    ASSERT_EQ(r.status, 200) << r.body;
    EXPECT_EQ(Fetch(sim.Port(), "/onvif/ptz_service", Goto("7")).status, 400);  // unknown token
    EXPECT_EQ(Fetch(sim.Port(), "/onvif/ptz_service", Goto("5", "Profile_1_sub")).status, 400);
    double after = sim.Now();
    auto moves = sim.Moves();
    ASSERT_EQ(moves.size(), 1u);
    EXPECT_EQ(moves[0].token, "5");
    EXPECT_GE(moves[0].seconds, before);
    EXPECT_LE(moves[0].seconds, after);
    sim.ClearMoves();
    EXPECT_TRUE(sim.Moves().empty());
}

std::string Ptz(const std::string& inner) {
    return "<s:Envelope xmlns:s=\"http://www.w3.org/2003/05/soap-envelope\"><s:Body>" + inner +
           "</s:Body></s:Envelope>";
}

TEST(CamSim, SetAndRemovePresetsOverOnvif) {
    CamSim sim;
    const std::string ns = " xmlns=\"http://www.onvif.org/ver20/ptz/wsdl\"";
    Reply set = Fetch(sim.Port(), "/onvif/ptz_service",
                      Ptz("<SetPreset" + ns +
                          "><ProfileToken>Profile_1_main</ProfileToken>"
                          "<PresetName>Porch</PresetName></SetPreset>"));
    ASSERT_EQ(set.status, 200) << set.body;
    EXPECT_NE(set.body.find("<tptz:PresetToken>3</tptz:PresetToken>"), std::string::npos);
    EXPECT_EQ(Fetch(sim.Port(), "/onvif/ptz_service",
                    Ptz("<RemovePreset" + ns +
                        "><ProfileToken>Profile_1_main</ProfileToken>"
                        "<PresetToken>2</PresetToken></RemovePreset>"))
                  .status,
              200);
    Reply list = Fetch(sim.Port(), "/onvif/ptz_service",
                       Ptz("<GetPresets" + ns +
                           "><ProfileToken>Profile_1_main</ProfileToken>"
                           "</GetPresets>"));
    EXPECT_NE(list.body.find("token=\"3\"><tt:Name>Porch</tt:Name>"), std::string::npos);
    EXPECT_EQ(list.body.find("token=\"2\""), std::string::npos);
    EXPECT_EQ(Fetch(sim.Port(), "/onvif/ptz_service", Goto("2")).status, 400);
    EXPECT_EQ(Fetch(sim.Port(), "/onvif/ptz_service", Goto("3")).status, 200);
}

TEST(CamSim, RequiresCredentialsExceptOnControlEndpoints) {
    CamSim::Options o;
    o.password = "other";
    CamSim sim(o);
    EXPECT_EQ(Fetch(sim.Port(), sim.SnapshotPath()).status, 401);
    EXPECT_EQ(Fetch(sim.Port(), sim.SnapshotPath(), "", "admin:other").status, 200);
    EXPECT_EQ(Fetch(sim.Port(), "/onvif/ptz_service", Goto("1")).status, 401);
    EXPECT_TRUE(sim.Moves().empty());
}

TEST(CamSim, SnapshotShowsThePresetInEveryDelivery) {
    CamSim sim;
    std::string grey = Fetch(sim.Port(), sim.SnapshotPath()).body;
    ASSERT_EQ(Fetch(sim.Port(), "/onvif/ptz_service", Goto("2")).status, 200);
    Reply at2 = Fetch(sim.Port(), sim.SnapshotPath());
    ASSERT_EQ(at2.status, 200);
    ASSERT_GT(at2.body.size(), 100u);
    EXPECT_EQ(at2.body.substr(0, 2), "\xff\xd8");
    EXPECT_NE(at2.body, grey);
    EXPECT_NE(at2.headers.find("Content-Length"), std::string::npos);

    sim.SetFault("snapshot_delivery", "chunked");
    Reply chunked = Fetch(sim.Port(), sim.SnapshotPath());
    EXPECT_EQ(chunked.body, at2.body);
    EXPECT_NE(chunked.headers.find("chunked"), std::string::npos);

    sim.SetFault("snapshot_delivery", "close");
    Reply closed = Fetch(sim.Port(), sim.SnapshotPath());
    EXPECT_EQ(closed.rc, CURLE_OK);
    EXPECT_EQ(closed.body, at2.body);
    std::string last = closed.headers.substr(closed.headers.rfind("HTTP/1.1"));
    EXPECT_EQ(last.find("Content-Length"), std::string::npos) << last;
    EXPECT_EQ(last.find("chunked"), std::string::npos) << last;
}

TEST(CamSim, BrokenBodiesAndStatusFaults) {
    CamSim sim;
    sim.SetFault("drop_mid_body", "1");
    EXPECT_EQ(Fetch(sim.Port(), sim.SnapshotPath()).rc, CURLE_PARTIAL_FILE);
    sim.ClearFaults();
    sim.SetFault("lie_length", "1");
    Reply lie = Fetch(sim.Port(), sim.SnapshotPath());
    EXPECT_EQ(lie.rc, CURLE_PARTIAL_FILE);
    sim.ClearFaults();
    sim.SetFault("status", "503");
    EXPECT_EQ(Fetch(sim.Port(), sim.SnapshotPath()).status, 503);
    sim.SetFault("status", "");
    EXPECT_EQ(Fetch(sim.Port(), sim.SnapshotPath()).status, 200);
}

TEST(CamSim, MjpegStreamHasPartsWithAndWithoutLength) {
    CamSim sim;
    Reply r = Fetch(sim.Port(), "/mjpeg?frames=3");
    EXPECT_EQ(r.rc, CURLE_OK);
    EXPECT_NE(r.headers.find("multipart/x-mixed-replace; boundary=camsimframe"), std::string::npos);
    size_t parts = 0, lengths = 0;
    for (size_t at = r.body.find("--camsimframe\r\n"); at != std::string::npos;
         at = r.body.find("--camsimframe\r\n", at + 1)) {
        ++parts;
        if (r.body.compare(at + 41, 15, "Content-Length:") == 0) ++lengths;
    }
    EXPECT_EQ(parts, 3u);
    EXPECT_EQ(lengths, 2u);
    EXPECT_NE(r.body.find("--camsimframe--"), std::string::npos);
}

TEST(CamSim, SeveralRunAtOnceWithTheirOwnPresets) {
    CamSim a;
    CamSim::Options o;
    o.presets = {{"Preset_1", "One"}};
    CamSim b(o);
    EXPECT_NE(a.Port(), b.Port());
    EXPECT_EQ(Fetch(b.Port(), "/onvif/ptz_service", Goto("Preset_1")).status, 200);
    EXPECT_EQ(Fetch(a.Port(), "/onvif/ptz_service", Goto("Preset_1")).status, 400);
    b.SetPresets({});
    EXPECT_EQ(Fetch(b.Port(), "/onvif/ptz_service", Goto("Preset_1")).status, 400);
    EXPECT_EQ(b.Moves().size(), 1u);
    EXPECT_TRUE(a.Moves().empty());
}

}  // namespace
