// Snapshot fetching, each beside its baseline in the same run:
//  - SnapshotGet of a 2 MiB image from a local nginx vs curl_easy_perform of
//    the same URL into memory (goal: within 1.05x);
//  - the first frame of an MJPEG stream (served by nginx) with SnapshotGet vs
//    ffmpeg grabbing one frame (-frames:v 1).
// Ratios are printed after the table.
#include <curl/curl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstring>
#include <map>
#include <memory>

#include "bench_result.h"
#include "hostlib/http/curl_global.h"
#include "local_servers.h"
#include "snapshot/snapshot.h"
#include "static_api.h"

extern char** environ;

namespace {

constexpr size_t kImageBytes = 2 * 1024 * 1024;

struct Servers {
    std::unique_ptr<testsrv::TempDir> dir;
    std::unique_ptr<testsrv::Nginx> nginx;
    std::string image;
    bool ok = false;
};

// Runs a command to its end; true on exit status 0.
bool Run(const std::vector<std::string>& argv) {
    std::vector<char*> args;
    for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    pid_t pid;
    if (posix_spawnp(&pid, args[0], nullptr, nullptr, args.data(), environ) != 0) return false;
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

std::string ReadFile(const std::string& path) {
    std::string out;
    if (FILE* f = fopen(path.c_str(), "rb")) {
        char buf[65536];
        size_t n;
        while ((n = fread(buf, 1, sizeof buf, f)) > 0) out.append(buf, n);
        fclose(f);
    }
    return out;
}

Servers& S() {
    static Servers* s = [] {
        auto* s = new Servers;
        s->dir = std::make_unique<testsrv::TempDir>();
        s->image = testsrv::JpegLike(kImageBytes, 42);
        // An MJPEG stream file of real frames, made by ffmpeg's mpjpeg muxer.
        std::string mjpeg = s->dir->Path() + "/stream.mjpeg";
        if (!Run({"ffmpeg", "-nostdin", "-v", "error", "-f", "lavfi", "-i", "testsrc=size=640x480:rate=10",
                  "-frames:v", "20", "-f", "mpjpeg", "-y", mjpeg}))
            return s;
        s->nginx = std::make_unique<testsrv::Nginx>(std::vector<std::pair<std::string, std::string>>{
            {"snap.jpg", s->image}, {"stream.mjpeg", ReadFile(mjpeg)}});
        s->ok = s->nginx->Ok();
        return s;
    }();
    return *s;
}

std::string Url(const std::string& path) {
    return "http://127.0.0.1:" + std::to_string(S().nginx->Port()) + path;
}

void BM_SnapshotGet_2MiB(benchmark::State& state) {
    if (!S().ok) return state.SkipWithError("nginx did not start");
    // The user-defined camera serves a fixed location, as a camera without ONVIF would.
    std::unique_ptr<CameraAPI, void (*)(CameraAPI*)> api(
        newUserDefinedAPI("127.0.0.1", S().nginx->Port(), "", "", "/snap.jpg", "1"), releaseCameraAPI);
    for (auto _ : state) {
        unsigned char* buffer = nullptr;
        int size = 0;
        if (SnapshotGet("127.0.0.1", S().nginx->Port(), "", "", *api, "", &buffer, &size) != 0 ||
            size != static_cast<int>(kImageBytes))
            state.SkipWithError("fetch failed");
        benchmark::DoNotOptimize(buffer);
        SnapshotFree(buffer);
    }
    state.SetBytesProcessed(state.iterations() * kImageBytes);
}

size_t Append(char* data, size_t size, size_t n, void* out) {
    static_cast<std::string*>(out)->append(data, size * n);
    return size * n;
}

void BM_CurlEasyPerform_2MiB(benchmark::State& state) {
    if (!S().ok) return state.SkipWithError("nginx did not start");
    HostCurlGlobalInit();
    std::string url = Url("/snap.jpg");
    for (auto _ : state) {
        std::string body;
        body.reserve(kImageBytes);
        CURL* curl = curl_easy_init();
        curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
        curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
        curl_easy_setopt(curl, CURLOPT_BUFFERSIZE, 65536L);  // as SnapshotGet's transport
        curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, Append);
        curl_easy_setopt(curl, CURLOPT_WRITEDATA, &body);
        if (curl_easy_perform(curl) != CURLE_OK || body.size() != kImageBytes) state.SkipWithError("fetch failed");
        curl_easy_cleanup(curl);
        benchmark::DoNotOptimize(body);
    }
    state.SetBytesProcessed(state.iterations() * kImageBytes);
}

void BM_SnapshotGet_MjpegFirstFrame(benchmark::State& state) {
    if (!S().ok) return state.SkipWithError("nginx did not start");
    // The user-defined camera serves a fixed location, as a camera without ONVIF would.
    std::unique_ptr<CameraAPI, void (*)(CameraAPI*)> api(
        newUserDefinedAPI("127.0.0.1", S().nginx->Port(), "", "", "/stream.mjpeg", "2"), releaseCameraAPI);
    for (auto _ : state) {
        unsigned char* buffer = nullptr;
        int size = 0;
        if (SnapshotGet("127.0.0.1", S().nginx->Port(), "", "", *api, "", &buffer, &size) != 0)
            state.SkipWithError("fetch failed");
        SnapshotFree(buffer);
    }
}

void BM_Ffmpeg_MjpegFirstFrame(benchmark::State& state) {
    if (!S().ok) return state.SkipWithError("nginx did not start");
    std::string out = S().dir->Path() + "/frame.jpg";
    for (auto _ : state) {
        if (!Run({"ffmpeg", "-nostdin", "-v", "error", "-f", "mpjpeg", "-i", Url("/stream.mjpeg"),
                  "-frames:v", "1", "-c", "copy", "-f", "image2", "-y", out}))
            state.SkipWithError("ffmpeg failed");
    }
}

BENCHMARK(BM_SnapshotGet_2MiB)->Unit(benchmark::kMillisecond)->MinTime(2.0);
BENCHMARK(BM_CurlEasyPerform_2MiB)->Unit(benchmark::kMillisecond)->MinTime(2.0);
BENCHMARK(BM_SnapshotGet_MjpegFirstFrame)->Unit(benchmark::kMillisecond)->MinTime(2.0);
BENCHMARK(BM_Ffmpeg_MjpegFirstFrame)->Unit(benchmark::kMillisecond)->MinTime(2.0);

// Keeps each benchmark's real time per iteration for the ratios.
class RatioReporter : public benchmark::ConsoleReporter {
public:
    void ReportRuns(const std::vector<Run>& runs) override {
        for (const Run& r : runs) {
            if (!r.error_occurred) times[r.benchmark_name()] = r.GetAdjustedRealTime();
        }
        ConsoleReporter::ReportRuns(runs);
    }
    std::map<std::string, double> times;
};

// Prints ours / base for the benchmarks whose names start with those texts.
void PrintRatio(const RatioReporter& r, const std::string& ours, const std::string& base, const char* goal) {
    // With --benchmark_repetitions the median is used, else the single run.
    auto find = [&](const std::string& prefix) {
        double plain = 0.0;
        for (const auto& t : r.times) {
            if (t.first.rfind(prefix, 0) != 0) continue;
            if (t.first.size() > 7 && t.first.compare(t.first.size() - 7, 7, "_median") == 0) return t.second;
            bool aggregate = false;
            for (const char* suffix : {"_mean", "_stddev", "_cv"}) {
                size_t n = strlen(suffix);
                aggregate = aggregate || (t.first.size() > n && t.first.compare(t.first.size() - n, n, suffix) == 0);
            }
            if (!aggregate) plain = t.second;
        }
        return plain;
    };
    double a = find(ours), b = find(base);
    if (a <= 0 || b <= 0) return;
    printf("ratio %s / %s = %.3f (%s)\n", ours.c_str(), base.c_str(), a / b, goal);
    ReportRatio(ours, a, b, "ms", goal);
}

}  // namespace

int main(int argc, char** argv) {
    benchmark::Initialize(&argc, argv);
    RatioReporter reporter;
    benchmark::RunSpecifiedBenchmarks(&reporter);
    PrintRatio(reporter, "BM_SnapshotGet_2MiB", "BM_CurlEasyPerform_2MiB", "<= 1.05");
    PrintRatio(reporter, "BM_SnapshotGet_MjpegFirstFrame", "BM_Ffmpeg_MjpegFirstFrame", "< 1");
    S().nginx.reset();  // stop the server before exit
    S().dir.reset();
    return 0;
}
