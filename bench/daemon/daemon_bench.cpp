// Cost of ptzpatrold guarding N cameras (default 256) spread over a few
// camera simulators (default 4), each camera with one first-event entry in
// force, its events subscribed and its guard idle:
//   - idle CPU of the service while nothing happens, in % of one core (goal
//     under 1 %);
//   - resident memory per camera beyond the executors: the service's
//     growth from no camera to N, minus N executor-and-guard pairs measured
//     in this process in the same run, over N (goal under 64 KiB);
//   - event delay: POST /control/event motion=1 on one simulator to the
//     first move of the first and of the last of its cameras' guards, as the
//     simulator saw them (goal under 1 s);
//   - SIGTERM to the exit of the service with every camera guarded.
// The database is that of scripts/bench (PG* and PTZ_PG_DIR), or a
// throwaway cluster started here.
//
//   build-bench/bench/daemon/daemon_bench [cameras] [simulators] [idle seconds] [rounds]
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "bench_result.h"
#include "executor/guardExecutor.h"
#include "executor/patrolExecutor.h"
#include "host/database.h"
#include "support/camsim.h"

extern char** environ;

namespace {

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

double Monotonic() {
    struct timespec ts;
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return ts.tv_sec + ts.tv_nsec / 1e9;
}

// VmRSS of a process, KiB.
long RssKiB(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(in, line))
        if (line.rfind("VmRSS:", 0) == 0) return atol(line.c_str() + 6);
    return 0;
}

// User plus system CPU seconds of a process.
double CpuSeconds(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/stat");
    std::string stat((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    std::istringstream fields(stat.substr(stat.rfind(')') + 2));
    std::string f;
    unsigned long utime = 0, stime = 0;
    for (int i = 3; i <= 15 && fields >> f; ++i) {
        if (i == 14) utime = std::stoul(f);
        if (i == 15) stime = std::stoul(f);
    }
    return double(utime + stime) / sysconf(_SC_CLK_TCK);
}

double Median(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    return v.empty() ? 0 : v[v.size() / 2];
}

bool Sql(const std::string& sql) {
    if (OvDBExecute(sql) == 0) return true;
    fprintf(stderr, "daemon_bench: statement failed: %s\n", sql.substr(0, 200).c_str());
    return false;
}

// The service as a child process; its stdout on a pipe.
class Daemon {
public:
    Daemon() {
        int out[2];
        if (pipe2(out, O_CLOEXEC) != 0) return;
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, out[1], 1);
        std::vector<std::string> args = {PTZPATROLD_BINARY, "--listen", "127.0.0.1:0"};
        std::vector<char*> argv;
        for (auto& a : args) argv.push_back(&a[0]);
        argv.push_back(nullptr);
        if (posix_spawn(&pid_, argv[0], &actions, nullptr, argv.data(), environ) != 0) pid_ = -1;
        posix_spawn_file_actions_destroy(&actions);
        close(out[1]);
        out_ = out[0];
        std::string text;
        char buf[256];
        struct pollfd p = {out_, POLLIN, 0};
        while (text.find('\n') == std::string::npos && poll(&p, 1, 10000) > 0) {
            const ssize_t n = read(out_, buf, sizeof buf);
            if (n <= 0) break;
            text.append(buf, static_cast<size_t>(n));
        }
        if (text.rfind("listening on ", 0) == 0) address_ = text.substr(13, text.find('\n') - 13);
    }
    ~Daemon() {
        if (pid_ > 0) {
            kill(pid_, SIGKILL);
            waitpid(pid_, nullptr, 0);
        }
        if (out_ >= 0) close(out_);
    }
    pid_t Pid() const { return pid_; }
    const std::string& Address() const { return address_; }
    // SIGTERM and the wait for the exit; milliseconds, -1 if not gone in 10 s.
    double Terminate() {
        const auto t0 = Clock::now();
        kill(pid_, SIGTERM);
        int status = 0;
        while (waitpid(pid_, &status, WNOHANG) != pid_) {
            if (Clock::now() - t0 > 10s) return -1;
            std::this_thread::sleep_for(1ms);
        }
        pid_ = -1;
        return std::chrono::duration<double, std::milli>(Clock::now() - t0).count();
    }
    // The status request's answer (curl, so that the bench needs no HTTP code).
    std::string Status() const {
        std::string cmd = "curl -sf --max-time 5 http://" + address_ + "/status";
        FILE* f = popen(cmd.c_str(), "r");
        if (f == nullptr) return "";
        std::string body;
        char buf[65536];
        size_t n;
        while ((n = fread(buf, 1, sizeof buf, f)) > 0) body.append(buf, n);
        pclose(f);
        return body;
    }

private:
    pid_t pid_ = -1;
    int out_ = -1;
    std::string address_;
};

size_t Count(const std::string& text, const std::string& what) {
    size_t n = 0;
    for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
    return n;
}

// A throwaway cluster unless scripts/bench made one.
struct Cluster {
    std::string dir;
    bool ok = true;
    Cluster() {
        if (getenv("PTZ_PG_DIR") != nullptr && getenv("PGHOST") != nullptr) return;
        dir = "/tmp/ptzdaemonbench." + std::to_string(getpid());
        ok = std::system((std::string(PTZ_SOURCE_DIR) + "/scripts/pg_cluster.sh start " + dir +
                          " >/dev/null")
                             .c_str()) == 0;
        setenv("PGHOST", dir.c_str(), 1);
        setenv("PGUSER", "ptz", 1);
        setenv("PGDATABASE", "ptztest", 1);
    }
    ~Cluster() {
        if (!dir.empty())
            std::system(
                (std::string(PTZ_SOURCE_DIR) + "/scripts/pg_cluster.sh stop " + dir + " >/dev/null")
                    .c_str());
    }
};

}  // namespace

int main(int argc, char** argv) {
    const int n = argc > 1 ? atoi(argv[1]) : 256;
    const int sims = argc > 2 ? std::max(1, atoi(argv[2])) : 4;
    const int idleSeconds = argc > 3 ? atoi(argv[3]) : 60;
    const int rounds = argc > 4 ? atoi(argv[4]) : 8;
    Cluster cluster;
    if (!cluster.ok) return 1;
    setenv("CAMSIM_QUIET", "1", 1);  // no line per move on stderr

    std::vector<std::unique_ptr<CamSim>> cameras;
    CamSim::Options so;
    so.threads = n / sims + 64;  // one per waiting pull, and spares
    so.presets = {{"1", "Home"}, {"5", "Gate"}};
    for (int i = 0; i < sims; ++i) {
        cameras.push_back(std::make_unique<CamSim>(so));
        cameras.back()->SetFault("event_slots", std::to_string(n));
    }
    // Camera i on simulator i % sims; patrol i of camera i (1 then 5, 1 s
    // each); no schedule yet.
    std::string ports = "ARRAY[";
    for (int i = 0; i < sims; ++i) ports += (i ? "," : "") + std::to_string(cameras[i]->Port());
    ports += "]";
    const std::string count = std::to_string(n), nsims = std::to_string(sims);
    if (!Sql("TRUNCATE guard_schedule, patrol, patrol_preset, camera RESTART IDENTITY;") ||
        !Sql("INSERT INTO camera (id, host, port, username, password, vendor) SELECT g, "
             "'127.0.0.1', (" +
             ports + ")[g % " + nsims +
             " + 1], 'admin', 'secret', 'onvif' FROM generate_series(1, " + count + ") g;") ||
        !Sql("INSERT INTO patrol (id, camId, name, stayTime) SELECT g, g, 'bench', 1 FROM "
             "generate_series(1, " +
             count + ") g;") ||
        !Sql("INSERT INTO patrol_preset (camId, patrolId, position, name, sequence) SELECT g, g, "
             "p.position, p.name, p.sequence FROM generate_series(1, " +
             count + ") g, (VALUES (1, 'Home', 0), (5, 'Gate', 1)) p(position, name, sequence);"))
        return 1;

    Daemon daemon;
    if (daemon.Address().empty()) {
        fprintf(stderr, "daemon_bench: ptzpatrold did not start\n");
        return 1;
    }
    std::this_thread::sleep_for(3s);
    const long rssEmpty = RssKiB(daemon.Pid());

    auto start = Clock::now();
    if (!Sql("INSERT INTO guard_schedule (camId, patrolId, mode, eventValidSeconds) SELECT g, g, "
             "2, 1 FROM generate_series(1, " +
             count + ") g;"))
        return 1;
    for (;;) {
        const std::string s = daemon.Status();
        const size_t ready = Count(s, "\"subscribed\":true");
        if (ready == static_cast<size_t>(n) && Count(s, "\"known\":true") == 2u * n) break;
        if (Clock::now() - start > 60s) {
            fprintf(stderr, "daemon_bench: %zu of %d cameras subscribed\n", ready, n);
            return 1;
        }
        std::this_thread::sleep_for(500ms);
    }
    printf("%d cameras on %d simulators guarded and subscribed in %.0f ms\n", n, sims,
           std::chrono::duration<double, std::milli>(Clock::now() - start).count());
    std::this_thread::sleep_for(3s);  // settle
    const long rssFull = RssKiB(daemon.Pid());

    // Idle: nothing happens; the service ticks, the hub long-polls and renews.
    const double cpu0 = CpuSeconds(daemon.Pid());
    const auto t0 = Clock::now();
    std::this_thread::sleep_for(std::chrono::seconds(idleSeconds));
    const double idle = (CpuSeconds(daemon.Pid()) - cpu0) /
                        std::chrono::duration<double>(Clock::now() - t0).count() * 100;

    // The executors' and guards' own share, measured here in the same run.
    long pairs = 0;
    {
        const long before = RssKiB(getpid());
        std::vector<std::unique_ptr<PatrolExecutor>> executors;
        std::vector<std::unique_ptr<GuardExecutor>> guards;
        for (int i = 0; i < n; ++i) {
            executors.push_back(std::make_unique<PatrolExecutor>());
            guards.push_back(std::make_unique<GuardExecutor>(i));
            guards.back()->Init(executors.back().get(), 1, 1, 1);
        }
        std::this_thread::sleep_for(1s);
        pairs = RssKiB(getpid()) - before;
        for (auto& g : guards) g->Terminate();
    }

    // Event delay: motion on one simulator at a time (a different one each
    // round, its guards idle again by then), to the first "1" moves that
    // follow on it: the first and the last of its cameras.
    std::vector<double> firstMs, lastMs;
    const size_t perSim = static_cast<size_t>((n + sims - 1) / sims);
    for (int round = 0; round < rounds; ++round) {
        CamSim& sim = *cameras[round % sims];
        sim.ClearMoves();
        const double sent = Monotonic();
        sim.SetEvents("motion=1");
        double first = -1, last = -1;
        for (const auto deadline = Clock::now() + 10s; Clock::now() < deadline && last < 0;
             std::this_thread::sleep_for(20ms)) {
            size_t ones = 0;
            for (const CamSim::Move& m : sim.Moves()) {
                if (m.token != "1") continue;
                if (++ones == 1) first = (m.monotonic - sent) * 1000;
                if (ones == perSim) last = (m.monotonic - sent) * 1000;
            }
        }
        sim.SetEvents("motion=0");
        if (last < 0) {
            fprintf(stderr, "daemon_bench: round %d: not every camera moved\n", round);
            return 1;
        }
        firstMs.push_back(first);
        lastMs.push_back(last);
        // Runs of 2 s, then the 5 s hold-off; the event valid 1 s.
        if (round + 1 < rounds && (round + 1) % sims == 0) std::this_thread::sleep_for(8s);
    }

    const double stopMs = daemon.Terminate();
    const double perCamera = double(rssFull - rssEmpty - pairs) / n;
    printf("idle CPU           %.3f %% of a core over %d s\n", idle, idleSeconds);
    printf(
        "resident           %ld KiB with no camera, %ld KiB with %d; executors and guards %ld "
        "KiB (%.1f KiB a pair): %.1f KiB a camera beyond them\n",
        rssEmpty, rssFull, n, pairs, double(pairs) / n, perCamera);
    printf(
        "event delay        first camera %.0f ms, last of %zu %.0f ms (median of %d; worst "
        "last %.0f ms)\n",
        Median(firstMs), perSim, Median(lastMs), rounds,
        *std::max_element(lastMs.begin(), lastMs.end()));
    printf("stop               %.0f ms from SIGTERM to exit\n", stopMs);
    ReportAbsolute("ptzpatrold, " + count + " cameras: idle CPU", idle, "% of a core", "< 1 %");
    ReportAbsolute("ptzpatrold: resident per camera beyond executor and guard", perCamera, "KiB",
                   "< 64 KiB");
    ReportAbsolute("ptzpatrold: event to the first move (median)", Median(firstMs), "ms",
                   "< 1000 ms");
    ReportAbsolute("ptzpatrold: event to the move of all " + std::to_string(perSim) +
                       " cameras of a simulator (worst)",
                   *std::max_element(lastMs.begin(), lastMs.end()), "ms", "< 1000 ms");
    ReportAbsolute("ptzpatrold: SIGTERM to exit with " + count + " cameras", stopMs, "ms",
                   "< 1000 ms");
    return 0;
}
