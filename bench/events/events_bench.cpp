// Cost of the ONVIF event sources as the guard service runs them: N sources
// (default 256) subscribed to a few camera simulators (default 4), driven by
// one hub. Reports, each beside its goal as a ratio (below 1 meets it):
//   - idle CPU of this process while nothing happens (long polls, renewals),
//     in % of one core (goal: under 1 %);
//   - resident memory per source once all are subscribed (goal: 64 KiB);
//   - the delay from POST /control/event on one simulator to the changed
//     EVENT_STATUS of its first and of its last source (goal: 1 s), against
//     the round trip of that POST itself, measured in the same run.
//
//   build-bench/bench/events/events_bench [sources] [simulators] [idle seconds]
#include <stdio.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/time.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "bench_result.h"
#include "hostlib/camera/onvif_events.h"
#include "support/camsim.h"

namespace {

using Clock = std::chrono::steady_clock;

long RssKiB() {
    std::ifstream in("/proc/self/status");
    std::string line;
    while (std::getline(in, line))
        if (line.rfind("VmRSS:", 0) == 0) return atol(line.c_str() + 6);
    return 0;
}

double CpuSeconds(bool system = true, bool user = true) {
    struct rusage ru;
    getrusage(RUSAGE_SELF, &ru);
    return (user ? ru.ru_utime.tv_sec + ru.ru_utime.tv_usec / 1e6 : 0) +
           (system ? ru.ru_stime.tv_sec + ru.ru_stime.tv_usec / 1e6 : 0);
}

double Ms(Clock::duration d) { return std::chrono::duration<double, std::milli>(d).count(); }

double Median(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    return v.empty() ? 0 : v[v.size() / 2];
}

}  // namespace

int main(int argc, char** argv) {
    const int n = argc > 1 ? atoi(argv[1]) : 256;
    const int sims = argc > 2 ? std::max(1, atoi(argv[2])) : 4;
    const int idleSeconds = argc > 3 ? atoi(argv[3]) : 30;

    std::vector<std::unique_ptr<CamSim>> cameras;
    CamSim::Options so;
    so.threads = n / sims + 64;  // one per waiting pull, and spares
    for (int i = 0; i < sims; ++i) {
        cameras.push_back(std::make_unique<CamSim>(so));
        cameras.back()->SetFault("event_slots", std::to_string(n));
    }
    // The bench's own buffers and libcurl's setup before the baseline.
    std::vector<EVENT_STATUS> seen(n);
    const long rssBefore = RssKiB();

    onvif::EventHub hub;
    std::vector<std::unique_ptr<onvif::EventSource>> sources;
    for (int i = 0; i < n; ++i) {
        onvif::EventSourceOptions o;
        o.host = "127.0.0.1";
        o.port = cameras[i % sims]->Port();
        o.username = "admin";
        o.password = "secret";
        sources.push_back(std::make_unique<onvif::EventSource>(hub, o));
    }
    auto start = Clock::now();
    for (;;) {
        int ready = 0;
        for (auto& s : sources) {
            auto st = s->Status();
            ready += st.subscribed && st.first.known && st.second.known;
        }
        if (ready == n) break;
        if (Clock::now() - start > std::chrono::seconds(60)) {
            fprintf(stderr, "events_bench: only %d of %d sources subscribed\n", ready, n);
            return 1;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    printf("%d sources on %d simulators subscribed in %.0f ms\n", n, sims,
           Ms(Clock::now() - start));
    std::this_thread::sleep_for(std::chrono::seconds(2));  // settle
    const long rssAfter = RssKiB();

    // Idle: nothing happens on the cameras; the hub long-polls and renews.
    double cpu0 = CpuSeconds(), sys0 = CpuSeconds(true, false);
    auto t0 = Clock::now();
    std::this_thread::sleep_for(std::chrono::seconds(idleSeconds));
    double elapsed = Ms(Clock::now() - t0) / 1000;
    double idleCpu = (CpuSeconds() - cpu0) / elapsed * 100;
    double idleSys = (CpuSeconds(true, false) - sys0) / elapsed * 100;
    long pulls = 0;
    for (auto& c : cameras) pulls += c->Events().pulls;

    // Delay: toggle motion on simulator 0 and watch its sources.
    std::vector<double> first, last, post;
    for (int round = 0; round < 10; ++round) {
        bool on = round % 2 == 0;
        auto sent = Clock::now();
        cameras[0]->SetEvents(on ? "motion=1" : "motion=0");
        post.push_back(Ms(Clock::now() - sent));
        double firstMs = -1;
        for (;;) {
            int changed = 0;
            for (int i = 0; i < n; i += sims) changed += sources[i]->Status().first.value == on;
            double now = Ms(Clock::now() - sent);
            if (changed > 0 && firstMs < 0) firstMs = now;
            if (changed == (n + sims - 1) / sims) {
                first.push_back(firstMs);
                last.push_back(now);
                break;
            }
            if (now > 10000) {
                fprintf(stderr, "events_bench: round %d: %d sources changed\n", round, changed);
                return 1;
            }
            std::this_thread::sleep_for(std::chrono::microseconds(200));
        }
    }

    const double perSource = double(rssAfter - rssBefore) / n;
    printf(
        "idle CPU           %8.3f %% of a core   (over %d s, %.3f %% in the kernel)   ratio to 1 "
        "%%:     %.3f\n",
        idleCpu, idleSeconds, idleSys, idleCpu / 1.0);
    printf("                   %ld pulls so far\n", pulls);
    printf("resident / source  %8.1f KiB            (%ld KiB for %d)  ratio to 64 KiB: %.3f\n",
           perSource, rssAfter - rssBefore, n, perSource / 64);
    printf("event delay        first %.1f ms, last %.1f ms (median of 10; worst last %.1f ms)\n",
           Median(first), Median(last), *std::max_element(last.begin(), last.end()));
    printf(
        "                   baseline: the POST's own round trip %.1f ms; ratio of last to 1 s: "
        "%.3f\n",
        Median(post), Median(last) / 1000);
    auto st = sources[0]->Status();
    printf("source 0: %lu alarms, %lu subscriptions, last error \"%s\"\n", st.first.alarms,
           st.subscriptions, st.lastError.c_str());

    auto stop = Clock::now();
    sources.clear();
    const double stopMs = Ms(Clock::now() - stop);
    printf("stopping %d sources took %.1f ms\n", n, stopMs);
    const std::string of = " (" + std::to_string(n) + " event sources)";
    ReportAbsolute("Event sources idle: CPU" + of, idleCpu, "% of a core", "< 1 %");
    ReportAbsolute("Event sources: resident memory each" + of, perSource, "KiB", "< 64 KiB");
    ReportRatio("Event on the camera to EVENT_STATUS changed (median)", Median(last), Median(post), "ms",
                "< 1000 ms");
    ReportAbsolute("Stop all event sources" + of, stopMs, "ms", "< 1000 ms");
    return 0;
}
