// Cost of the ONVIF driver per patrol step: a fresh control object reads the
// preset list, another makes one move (as Patrol::Load and a patrol run do),
// against bare libcurl POSTs of the same two signed SOAP envelopes on one
// kept connection. Both run against one simulator in the same process; the
// ratios driver / bare are printed at the end (goal: at most 1.2): of the
// separate runs, and of the two measured in turn within each iteration.
//
//   build/bench/camera/camera_bench --benchmark_min_time=1 --benchmark_repetitions=5
#include <benchmark/benchmark.h>
#include <curl/curl.h>
#include <stdlib.h>
#include <time.h>

#include <algorithm>
#include <chrono>
#include <map>
#include <memory>
#include <vector>

#include "bench/ratio_reporter.h"
#include "host/camera.h"
#include "hostlib/camera/onvif_soap.h"
#include "support/camsim.h"

namespace {

CamSim* gSim = nullptr;

// One patrol step through the driver: a fresh object lists, another moves.
bool DriverStep(int i) {
    CameraAPI* api = newCameraAPI("127.0.0.1", gSim->Port(), "admin", "secret", "onvif", "", "");
    std::map<int, std::string> presets;
    bool ok = api->GetPresetList(presets) == 0 && presets.size() == 4;
    releaseCameraAPI(api);
    api = newCameraAPI("127.0.0.1", gSim->Port(), "admin", "secret", "onvif", "", "");
    int position = (i % 2) ? 2 : 1;
    ok = api->GoPreset(position, "kelo" + std::to_string(position)) == 0 && ok;
    releaseCameraAPI(api);
    return ok;
}

size_t Discard(char*, size_t size, size_t n, void*) { return size * n; }

// The same two SOAP envelopes POSTed with one kept libcurl handle, replies unread.
class BarePoster {
public:
    BarePoster() {
        onvif::UsernameToken token{"admin", "secret", "0123456789abcdef",
                                   onvif::FormatUtc(time(nullptr))};
        list_ = onvif::Envelope(onvif::GetPresetsBody("Profile_1_main"), &token);
        go1_ = onvif::Envelope(onvif::GotoPresetBody("Profile_1_main", "1"), &token);
        go2_ = onvif::Envelope(onvif::GotoPresetBody("Profile_1_main", "2"), &token);
        url_ = "http://127.0.0.1:" + std::to_string(gSim->Port()) + "/onvif/ptz_service";
        curl_ = curl_easy_init();
        headers_ = curl_slist_append(nullptr, "Content-Type: application/soap+xml; charset=utf-8");
    }
    ~BarePoster() {
        curl_slist_free_all(headers_);
        curl_easy_cleanup(curl_);
    }
    bool Step(int i) { return Post(list_) && Post((i % 2) ? go2_ : go1_); }

private:
    bool Post(const std::string& body) {
        curl_easy_setopt(curl_, CURLOPT_URL, url_.c_str());
        curl_easy_setopt(curl_, CURLOPT_POSTFIELDS, body.c_str());
        curl_easy_setopt(curl_, CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
        curl_easy_setopt(curl_, CURLOPT_HTTPHEADER, headers_);
        curl_easy_setopt(curl_, CURLOPT_WRITEFUNCTION, Discard);
        curl_easy_setopt(curl_, CURLOPT_NOSIGNAL, 1L);
        curl_easy_setopt(curl_, CURLOPT_TIMEOUT_MS, 5000L);
        long status = 0;
        if (curl_easy_perform(curl_) != CURLE_OK) return false;
        curl_easy_getinfo(curl_, CURLINFO_RESPONSE_CODE, &status);
        return status == 200;
    }
    std::string list_, go1_, go2_, url_;
    CURL* curl_;
    struct curl_slist* headers_;
};

void DriverPresetListAndGoPreset(benchmark::State& state) {
    int i = 0;
    for (auto _ : state)
        if (!DriverStep(i++)) state.SkipWithError("driver step failed");
}

void BareCurlPosts(benchmark::State& state) {
    BarePoster bare;
    int i = 0;
    for (auto _ : state)
        if (!bare.Step(i++)) state.SkipWithError("POST failed");
}

// Both in turn within each iteration, so load from other processes falls on
// both alike; the counter "ratio" is driver time / bare time.
void Interleaved(benchmark::State& state) {
    using Clock = std::chrono::steady_clock;
    BarePoster bare;
    double driverSeconds = 0, bareSeconds = 0;
    int i = 0;
    auto timed = [](auto&& step, double& seconds) {
        auto t0 = Clock::now();
        bool ok = step();
        seconds += std::chrono::duration<double>(Clock::now() - t0).count();
        return ok;
    };
    for (auto _ : state) {
        // Which goes first alternates, so neither gains from going second.
        bool ok;
        if (i % 2) {
            ok = timed([&] { return bare.Step(i); }, bareSeconds) &&
                 timed([&] { return DriverStep(i); }, driverSeconds);
        } else {
            ok = timed([&] { return DriverStep(i); }, driverSeconds) &&
                 timed([&] { return bare.Step(i); }, bareSeconds);
        }
        ++i;
        if (!ok) state.SkipWithError("step failed");
    }
    if (bareSeconds > 0) state.counters["ratio"] = driverSeconds / bareSeconds;
}

// The project's reporter prints "ratio CameraStep <ours/baseline>"; this one
// adds the median of the interleaved ratios.
class CameraRatioReporter : public RatioReporter {
public:
    CameraRatioReporter() : RatioReporter(Goals{{"CameraStep", "<= 1.2"}}) {}
    void ReportRuns(const std::vector<Run>& runs) override {
        RatioReporter::ReportRuns(runs);
        for (const Run& r : runs) {
            auto ratio = r.counters.find("ratio");
            if (ratio == r.counters.end() || r.error_occurred) continue;
            if (r.run_type == Run::RT_Iteration || r.aggregate_name == "median")
                ratios_.push_back(ratio->second.value);
        }
    }
    void Finalize() override {
        RatioReporter::Finalize();
        if (ratios_.empty()) return;
        std::sort(ratios_.begin(), ratios_.end());
        const double median = ratios_[ratios_.size() / 2];
        printf("ratio CameraStep interleaved                   %.3f (goal <= 1.2)\n", median);
        std::printf("BENCH_RESULT\tCameraStep (interleaved)\t-\t-\t%.3f\t<= 1.2\n", median);
    }

private:
    std::vector<double> ratios_;
};

}  // namespace

int main(int argc, char** argv) {
    setenv("CAMSIM_QUIET", "1", 1);
    benchmark::Initialize(&argc, argv);
    benchmark::RegisterBenchmark("CameraStep/baseline", BareCurlPosts)
        ->Unit(benchmark::kMicrosecond)
        ->UseRealTime();
    benchmark::RegisterBenchmark("CameraStep/ours", DriverPresetListAndGoPreset)
        ->Unit(benchmark::kMicrosecond)
        ->UseRealTime();
    benchmark::RegisterBenchmark("CameraStep/interleaved", Interleaved)
        ->Unit(benchmark::kMicrosecond)
        ->UseRealTime();
    CamSim sim;
    gSim = &sim;
    // Warm the driver's knowledge of the camera, as a running host has it.
    CameraAPI* api = newCameraAPI("127.0.0.1", sim.Port(), "admin", "secret", "onvif", "", "");
    std::map<int, std::string> presets;
    api->GetPresetList(presets);
    releaseCameraAPI(api);
    CameraRatioReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    benchmark::Shutdown();
    gSim = nullptr;
    return 0;
}
