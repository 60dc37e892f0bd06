// ptzpatrold end to end against the camera simulator and the throwaway
// cluster, its schedule managed with the ptzpatrol tool: an event starts the
// guard's runs, the status request reports them, a schedule change is
// followed without a restart, SIGTERM stops it within a second.
#include <curl/curl.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <functional>
#include <nlohmann/json.hpp>
#include <string>
#include <thread>
#include <vector>

#include "common/pg_test_util.h"
#include "support/camsim.h"

extern char** environ;

namespace {

using nlohmann::json;
using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

// A child process with its stdout on a pipe (stderr passed through).
class Process {
public:
    explicit Process(std::vector<std::string> argv) {
        int out[2];
        EXPECT_EQ(pipe2(out, O_CLOEXEC), 0);
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
        posix_spawn_file_actions_adddup2(&actions, out[1], 1);
        std::vector<char*> args;
        for (auto& a : argv) args.push_back(&a[0]);
        args.push_back(nullptr);
        EXPECT_EQ(posix_spawn(&pid_, args[0], &actions, nullptr, args.data(), environ), 0);
        posix_spawn_file_actions_destroy(&actions);
        close(out[1]);
        out_ = out[0];
    }
    ~Process() {
        if (pid_ > 0) {
            kill(pid_, SIGKILL);
            waitpid(pid_, nullptr, 0);
        }
        close(out_);
    }
    // The next line of stdout, "" at its end or after `timeout`.
    std::string ReadLine(std::chrono::milliseconds timeout = 10000ms) {
        const auto deadline = Clock::now() + timeout;
        size_t nl;
        while ((nl = text_.find('\n')) == std::string::npos) {
            const auto left =
                std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
            struct pollfd p = {out_, POLLIN, 0};
            char buf[4096];
            ssize_t n = 0;
            if (left.count() <= 0 || poll(&p, 1, static_cast<int>(left.count())) <= 0 ||
                (n = read(out_, buf, sizeof buf)) <= 0)
                return "";
            text_.append(buf, static_cast<size_t>(n));
        }
        std::string line = text_.substr(0, nl);
        text_.erase(0, nl + 1);
        return line;
    }
    std::string Rest() {
        std::string rest;
        while (true) {
            const std::string line = ReadLine(30000ms);
            if (line.empty() && text_.empty()) return rest;
            rest += line + "\n";
        }
    }
    void Signal(int sig) { kill(pid_, sig); }
    // The exit code once it exits within `timeout`; -1 after a signal or on timeout.
    int Wait(std::chrono::milliseconds timeout = 30000ms) {
        const auto deadline = Clock::now() + timeout;
        int status = 0;
        while (waitpid(pid_, &status, WNOHANG) != pid_) {
            if (Clock::now() > deadline) return -1;
            std::this_thread::sleep_for(2ms);
        }
        pid_ = -1;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }

private:
    pid_t pid_ = -1;
    int out_ = -1;
    std::string text_;
};

// ptzpatrol ARGS...: its exit code and stdout.
std::pair<int, std::string> Tool(std::vector<std::string> args) {
    args.insert(args.begin(), PTZPATROL_BINARY);
    Process p(args);
    std::string out = p.Rest();
    return {p.Wait(), out};
}

// The id a `ptzpatrol --json ... add|create` printed.
int NewId(const std::vector<std::string>& args) {
    std::vector<std::string> json = {"--json"};
    json.insert(json.end(), args.begin(), args.end());
    const auto r = Tool(json);
    EXPECT_EQ(r.first, 0) << r.second;
    return json::parse(r.second, nullptr, false).value("id", 0);
}

size_t Collect(char* data, size_t size, size_t count, void* into) {
    static_cast<std::string*>(into)->append(data, size * count);
    return size * count;
}

// GET /status of the service; null when it does not answer.
json Status(const std::string& address) {
    CURL* curl = curl_easy_init();
    std::string body;
    const std::string url = "http://" + address + "/status";
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, Collect);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &body);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, 5000L);
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    const CURLcode rc = curl_easy_perform(curl);
    curl_easy_cleanup(curl);
    return rc == CURLE_OK ? json::parse(body, nullptr, false) : json();
}

// Polls the status of the first camera until `ok` holds (10 s at most).
bool WaitCamera(const std::string& address, const std::function<bool(const json&)>& ok,
                json* last) {
    for (const auto deadline = Clock::now() + 10s; Clock::now() < deadline;
         std::this_thread::sleep_for(20ms)) {
        const json s = Status(address);
        if (s.is_object() && s["cameras"].size() == 1) {
            *last = s["cameras"][0];
            if (ok(*last)) return true;
        }
    }
    return false;
}

class DaemonTest : public ::testing::Test {
protected:
    void SetUp() override {
        pgtest::ResetTables();
        pgtest::Exec("TRUNCATE guard_schedule RESTART IDENTITY;");
        setenv("PTZ_CAMERA_PASSWORD", "secret", 1);
    }
    CamSim sim_;
};

TEST_F(DaemonTest, GuardsFromScheduleAndEventsFollowsChangesStopsOnSigterm) {
    const std::string cam = std::to_string(NewId({"camera", "add", "--host", "127.0.0.1", "--port",
                                                  std::to_string(sim_.Port()), "--user", "admin"}));
    const std::string patrol =
        std::to_string(NewId({"patrol", "create", cam, "Tour", "--stay", "1", "1", "5", "9"}));
    // First event, runs without end until the entry changes.
    const int first = NewId({"schedule", "add", cam, "--patrol", patrol, "--mode", "first",
                             "--repeat", "0", "--event-valid", "2"});

    Process daemon({PTZPATROLD_BINARY, "--listen", "127.0.0.1:0", "--poll", "1"});
    const std::string listening = daemon.ReadLine();
    ASSERT_EQ(listening.rfind("listening on 127.0.0.1:", 0), 0u) << listening;
    const std::string address = listening.substr(strlen("listening on "));

    json c;
    ASSERT_TRUE(WaitCamera(
        address,
        [&](const json& c) {
            return c["entry"].is_object() && c["events"]["subscribed"] == true &&
                   c["events"]["first"]["known"] == true;
        },
        &c))
        << c.dump();
    EXPECT_EQ(c["entry"]["id"], first);
    EXPECT_EQ(c["guard"], "idle");
    EXPECT_TRUE(sim_.Moves().empty());

    // Motion: the guard runs the patrol on the camera, the status shows it.
    sim_.SetEvents("motion=1");
    ASSERT_TRUE(WaitCamera(
        address,
        [](const json& c) {
            return c["guard"] == "running" && c["run"]["running"] == true &&
                   c["run"]["type"] == "guard" && c["run"]["runMoves"] >= 1;
        },
        &c))
        << c.dump();
    EXPECT_EQ(c["run"]["patrol"], std::stoi(patrol));
    EXPECT_EQ(c["run"]["count"], 3);
    EXPECT_EQ(c["events"]["first"]["state"], true);
    ASSERT_FALSE(sim_.Moves().empty());
    EXPECT_EQ(sim_.Moves()[0].token, "1");
    const auto shown = Tool({"--json", "status", "--daemon", address});
    ASSERT_EQ(shown.first, 0);
    EXPECT_EQ(json::parse(shown.second)["cameras"][0]["guard"], "running");

    // The entry gives way to one on the second event with another repeat
    // count: the guard is replaced, its run withdrawn, and motion alone
    // starts nothing any more.
    ASSERT_EQ(Tool({"schedule", "remove", std::to_string(first)}).first, 0);
    const int second = NewId({"schedule", "add", cam, "--patrol", patrol, "--mode", "second",
                              "--repeat", "1", "--event-valid", "2"});
    ASSERT_TRUE(WaitCamera(
        address,
        [&](const json& c) {
            return c["entry"].is_object() && c["entry"]["id"] == second &&
                   c["run"]["running"] == false && c["guard"] == "idle";
        },
        &c))
        << c.dump();
    EXPECT_EQ(c["guardInit"]["repeat"], 1);
    const size_t before = sim_.Moves().size();
    sim_.SetEvents("input=1");
    ASSERT_TRUE(WaitCamera(
        address,
        [&](const json& c) { return c["guard"] == "running" && sim_.Moves().size() > before; }, &c))
        << c.dump();

    // SIGTERM: gone within a second, its subscription given back.
    const auto sent = Clock::now();
    daemon.Signal(SIGTERM);
    EXPECT_EQ(daemon.Wait(), 0);
    EXPECT_LT(Clock::now() - sent, 1s);
    EXPECT_EQ(sim_.Events().live, 0);
}

// A database that stops answering (its statements wait out their timeout)
// does not hold up the stop: the service leaves within a second all the same.
TEST_F(DaemonTest, StopsWithinASecondWhileTheDatabaseStalls) {
    const std::string cam = std::to_string(NewId({"camera", "add", "--host", "127.0.0.1", "--port",
                                                  std::to_string(sim_.Port()), "--user", "admin"}));
    const std::string patrol =
        std::to_string(NewId({"patrol", "create", cam, "Tour", "--stay", "1", "1", "5"}));
    NewId({"schedule", "add", cam, "--patrol", patrol, "--mode", "continuous", "--repeat", "0"});
    Process daemon({PTZPATROLD_BINARY, "--listen", "127.0.0.1:0", "--poll", "1"});
    const std::string address = daemon.ReadLine().substr(strlen("listening on "));
    json c;
    ASSERT_TRUE(WaitCamera(
        address, [](const json& c) { return c["run"]["running"] == true; }, &c))
        << c.dump();

    ASSERT_EQ(pgtest::Cluster("stall"), 0);
    struct Resume {
        ~Resume() { pgtest::Cluster("resume"); }
    } resume;
    // Reading every second, the reader is waiting for the database once its
    // last read is 2 s old (its guard's moves wait too: they read the camera record).
    std::string readAt;
    auto unchanged = Clock::now();
    for (const auto deadline = Clock::now() + 10s; Clock::now() - unchanged < 2s;
         std::this_thread::sleep_for(100ms)) {
        ASSERT_LT(Clock::now(), deadline);
        const json s = Status(address);
        ASSERT_TRUE(s.is_object());
        if (s["schedule"]["readAt"].dump() != readAt) {
            readAt = s["schedule"]["readAt"].dump();
            unchanged = Clock::now();
        }
    }
    const auto sent = Clock::now();
    daemon.Signal(SIGTERM);
    EXPECT_EQ(daemon.Wait(), 0);
    EXPECT_LT(Clock::now() - sent, 1s);
}

TEST(DaemonArgs, StatusServedOnLoopbackOnly) {
    for (const char* address :
         {"0.0.0.0:7478", "192.0.2.1:7478", "localhost:7478", "127.0.0.1:x"}) {
        Process daemon({PTZPATROLD_BINARY, "--listen", address});
        EXPECT_EQ(daemon.Wait(), 64) << address;
    }
}

}  // namespace
