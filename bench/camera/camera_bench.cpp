// Cost of the ONVIF driver per patrol step: a fresh control object reads the
// preset list, another makes one move (as Patrol::Load and a patrol run do),
// against bare libcurl POSTs of the same two signed SOAP envelopes on one
// kept connection. Both run against one simulator in the same process; the
// ratio driver / bare is printed at the end (goal: at most 1.2).
//
//   build/bench/camera/camera_bench [--benchmark_min_time=2]
#include <benchmark/benchmark.h>
#include <curl/curl.h>
#include <stdlib.h>
#include <time.h>

#include <map>
#include <memory>

#include "host/camera.h"
#include "hostlib/onvif_soap.h"
#include "support/camsim.h"

namespace {

CamSim* gSim = nullptr;

void DriverPresetListAndGoPreset(benchmark::State& state) {
    int i = 0;
    for (auto _ : state) {
        CameraAPI* api = newCameraAPI("127.0.0.1", gSim->Port(), "admin", "secret", "onvif", "", "");
        std::map<int, std::string> presets;
        if (api->GetPresetList(presets) != 0 || presets.size() != 4) state.SkipWithError("list");
        releaseCameraAPI(api);
        api = newCameraAPI("127.0.0.1", gSim->Port(), "admin", "secret", "onvif", "", "");
        int position = (i++ % 2) ? 2 : 1;
        if (api->GoPreset(position, "kelo" + std::to_string(position)) != 0) state.SkipWithError("move");
        releaseCameraAPI(api);
    }
}

size_t Discard(char*, size_t size, size_t n, void*) { return size * n; }

void BareCurlPosts(benchmark::State& state) {
    onvif::UsernameToken token{"admin", "secret", "0123456789abcdef", onvif::FormatUtc(time(nullptr))};
    const std::string list = onvif::Envelope(onvif::GetPresetsBody("Profile_1_main"), &token);
    const std::string go1 = onvif::Envelope(onvif::GotoPresetBody("Profile_1_main", "1"), &token);
    const std::string go2 = onvif::Envelope(onvif::GotoPresetBody("Profile_1_main", "2"), &token);
    const std::string url = "http://127.0.0.1:" + std::to_string(gSim->Port()) + "/onvif/ptz_service";
    CURL* curl = curl_easy_init();
    struct curl_slist* headers =
        curl_slist_append(nullptr, "Content-Type: application/soap+xml; charset=utf-8");
    auto post = [&](const std::string& body) {
        curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
        curl_easy_setopt(curl, CURLOPT_POSTFIELDS, body.c_str());
        curl_easy_setopt(curl, CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
        curl_easy_setopt(curl, CURLOPT_HTTPHEADER, headers);
        curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, Discard);
        curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
        curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, 5000L);
        long status = 0;
        if (curl_easy_perform(curl) != CURLE_OK) return false;
        curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
        return status == 200;
    };
    int i = 0;
    for (auto _ : state) {
        if (!post(list)) state.SkipWithError("list");
        if (!post((i++ % 2) ? go2 : go1)) state.SkipWithError("move");
    }
    curl_slist_free_all(headers);
    curl_easy_cleanup(curl);
}

// Keeps the mean real time of each benchmark, then prints the ratio.
class RatioReporter : public benchmark::ConsoleReporter {
public:
    void ReportRuns(const std::vector<Run>& runs) override {
        ConsoleReporter::ReportRuns(runs);
        for (const Run& r : runs)
            if (r.run_type == Run::RT_Iteration && !r.error_occurred)
                times_[r.run_name.function_name] = r.GetAdjustedRealTime();
    }
    void Finalize() override {
        ConsoleReporter::Finalize();
        auto d = times_.find("DriverPresetListAndGoPreset");
        auto b = times_.find("BareCurlPosts");
        if (d != times_.end() && b != times_.end() && b->second > 0)
            printf("ratio driver / bare libcurl = %.3f (goal <= 1.2)\n", d->second / b->second);
    }

private:
    std::map<std::string, double> times_;
};

}  // namespace

BENCHMARK(BareCurlPosts)->Unit(benchmark::kMicrosecond)->UseRealTime();
BENCHMARK(DriverPresetListAndGoPreset)->Unit(benchmark::kMicrosecond)->UseRealTime();

int main(int argc, char** argv) {
    setenv("CAMSIM_QUIET", "1", 1);
    benchmark::Initialize(&argc, argv);
    CamSim sim;
    gSim = &sim;
    // Warm the driver's knowledge of the camera, as a running host has it.
    CameraAPI* api = newCameraAPI("127.0.0.1", sim.Port(), "admin", "secret", "onvif", "", "");
    std::map<int, std::string> presets;
    api->GetPresetList(presets);
    releaseCameraAPI(api);
    RatioReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    benchmark::Shutdown();
    gSim = nullptr;
    return 0;
}
