// The ptzpatrol tool as a user runs it: argument and error handling (exit
// code and one line on stderr), then a whole session against the camera
// simulator and the throwaway cluster.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <nlohmann/json.hpp>
#include <sstream>

#include "common/pg_test_util.h"
#include "support/camsim.h"

extern char** environ;

namespace {

using nlohmann::json;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

// A running ptzpatrol with its output on pipes.
class Tool {
public:
    explicit Tool(const std::vector<std::string>& args, const std::vector<std::string>& env = {}) {
        std::vector<std::string> argv = {PTZPATROL_BINARY};
        argv.insert(argv.end(), args.begin(), args.end());
        std::vector<std::string> envv;
        for (char** e = environ; *e; ++e) {
            const std::string entry = *e, name = entry.substr(0, entry.find('='));
            bool replaced = false;
            for (const auto& o : env) replaced = replaced || o.substr(0, o.find('=')) == name;
            if (!replaced) envv.push_back(entry);
        }
        envv.insert(envv.end(), env.begin(), env.end());
        int out[2], err[2];
        EXPECT_EQ(pipe2(out, O_CLOEXEC), 0);
        EXPECT_EQ(pipe2(err, O_CLOEXEC), 0);
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
        posix_spawn_file_actions_adddup2(&actions, out[1], 1);
        posix_spawn_file_actions_adddup2(&actions, err[1], 2);
        std::vector<char*> a, e;
        for (auto& s : argv) a.push_back(&s[0]);
        for (auto& s : envv) e.push_back(&s[0]);
        a.push_back(nullptr);
        e.push_back(nullptr);
        EXPECT_EQ(posix_spawn(&pid_, PTZPATROL_BINARY, &actions, nullptr, a.data(), e.data()), 0);
        posix_spawn_file_actions_destroy(&actions);
        close(out[1]);
        close(err[1]);
        out_ = out[0];
        err_ = err[0];
    }
    ~Tool() {
        if (pid_ > 0) {
            kill(pid_, SIGKILL);
            waitpid(pid_, nullptr, 0);
        }
        close(out_);
        close(err_);
    }

    // The next line of stdout within `timeout` ("" at its end or on timeout).
    std::string ReadLine(std::chrono::milliseconds timeout = std::chrono::milliseconds(10000)) {
        const auto deadline = std::chrono::steady_clock::now() + timeout;
        while (outText_.find('\n', outRead_) == std::string::npos) {
            const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                deadline - std::chrono::steady_clock::now());
            struct pollfd p = {out_, POLLIN, 0};
            if (left.count() <= 0 || poll(&p, 1, static_cast<int>(left.count())) <= 0) return "";
            if (!Drain(out_, outText_)) return "";
        }
        const size_t nl = outText_.find('\n', outRead_);
        std::string line = outText_.substr(outRead_, nl - outRead_);
        outRead_ = nl + 1;
        return line;
    }
    void Signal(int sig) { kill(pid_, sig); }
    // Waits for the exit (30 s at most); the exit code, -1 for a signal or timeout.
    int Wait() {
        int status = 0;
        for (int i = 0; i < 3000; ++i) {
            struct pollfd p[2] = {{out_, POLLIN, 0}, {err_, POLLIN, 0}};
            if (poll(p, 2, 10) > 0) {
                if (p[0].revents) Drain(out_, outText_);
                if (p[1].revents) Drain(err_, errText_);
            }
            if (waitpid(pid_, &status, WNOHANG) == pid_) {
                pid_ = -1;
                while (Drain(out_, outText_)) {
                }
                while (Drain(err_, errText_)) {
                }
                return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
            }
        }
        return -1;
    }
    std::string Out() const { return outText_.substr(outRead_); }
    const std::string& Err() const { return errText_; }

private:
    static bool Drain(int fd, std::string& into) {
        char buf[4096];
        const ssize_t n = read(fd, buf, sizeof buf);
        if (n > 0) into.append(buf, static_cast<size_t>(n));
        return n > 0;
    }
    pid_t pid_ = -1;
    int out_ = -1, err_ = -1;
    std::string outText_, errText_;
    size_t outRead_ = 0;
};

struct Result {
    int code;
    std::string out, err;
};

Result RunTool(const std::vector<std::string>& args, const std::vector<std::string>& env = {}) {
    Tool tool(args, env);
    const int code = tool.Wait();
    return {code, tool.Out(), tool.Err()};
}

std::string FileBytes(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

bool IsJpeg(const std::string& bytes) {
    return bytes.size() > 100 && bytes.compare(0, 2, "\xff\xd8") == 0 &&
           bytes.compare(bytes.size() - 2, 2, "\xff\xd9") == 0;
}

class ToolTest : public ::testing::Test {
protected:
    void SetUp() override {
        pgtest::ResetTables();
        port_ = std::to_string(sim_.Port());
    }
    // Adds an ONVIF camera of the simulator; its id.
    std::string AddCamera(const std::string& password = "secret", const std::string& port = "") {
        Result r = RunTool({"--json", "camera", "add", "--host", "127.0.0.1", "--port",
                            port.empty() ? port_ : port, "--user", "admin"},
                           {"PTZ_CAMERA_PASSWORD=" + password});
        EXPECT_EQ(r.code, 0) << r.err;
        return std::to_string(json::parse(r.out).value("id", 0));
    }
    CamSim sim_;
    std::string port_;
};

// Every failure: its exit code, one line on stderr naming the cause, nothing on stdout.
TEST_F(ToolTest, FailuresGiveTheirExitCodeAndOneLine) {
    const std::string wrong = AddCamera("wrong");
    const std::string silent = AddCamera("secret", "1");  // nothing listens on port 1
    const std::string cam = AddCamera();
    pgtest::Exec("INSERT INTO patrol (id, camId, name, stayTime) VALUES (50, " + silent +
                 ", 's', 1), (51, " + wrong + ", 'w', 1);");
    struct Case {
        std::vector<std::string> args, env;
        int code;
        std::string says;
    } cases[] = {
        {{}, {}, 64, "subcommand is required"},
        {{"run"}, {}, 64, "ID is required"},
        {{"run", "abc"}, {}, 64, "abc"},
        {{"run", "1", "--frobnicate"}, {}, 64, "frobnicate"},
        {{"patrol", "create", cam, "n", "--stay", "3000", "1"}, {}, 64, "--stay"},
        {{"patrol", "create", cam, "n", "--stay", "1", "one"}, {}, 64, "POSITION"},
        {{"guard", "1", "--mode", "sometimes"}, {}, 64, "--mode"},
        {{"camera", "add", "--host", "h", "--vendor", "userdefined"}, {}, 64, "--path"},
        {{"camera", "add", "--host", "h", "--id", cam}, {}, 64, "exists"},
        {{"camera", "add", "--host", "h", "--password-file", "/nonexistent/pw"},
         {},
         66,
         "/nonexistent/pw"},
        {{"patrol", "list", cam},
         {"PGHOST=/nonexistent-dir"},
         69,
         "socket /nonexistent-dir/.s.PGSQL.5432"},
        {{"camera", "list"}, {"PGHOST=127.0.0.1", "PGPORT=1"}, 69, "host 127.0.0.1 port 1"},
        {{"camera", "list"}, {"PGDATABASE=postgres"}, 78, "init-db"},
        {{"run", "99"}, {}, 65, "no patrol 99"},
        {{"patrol", "show", "99"}, {}, 65, "no patrol 99"},
        {{"patrol", "delete", "99"}, {}, 65, "no patrol 99"},
        {{"patrol", "list", "99"}, {}, 65, "no camera 99"},
        {{"presets", "99"}, {}, 65, "no camera 99"},
        {{"snapshot", "99"}, {}, 65, "no camera 99"},
        {{"camera", "remove", "99"}, {}, 65, "no camera 99"},
        {{"patrol", "create", cam, "n", "--stay", "1", "7"}, {}, 65, "no preset 7"},
        {{"presets", wrong}, {}, 77, "password refused"},
        {{"snapshot", wrong}, {}, 77, "password refused"},
        {{"presets", silent}, {}, 68, "no answer"},
        {{"run", "50"}, {}, 68, "no answer"},
        {{"guard", "51", "--mode", "any"}, {}, 77, "password refused"},
        {{"patrol", "create", silent, "n", "--stay", "1", "1"}, {}, 68, "no answer"},
        {{"snapshot", cam, "-o", "/nonexistent/x.jpg"}, {}, 73, "/nonexistent/x.jpg"},
        {{"schedule", "add", cam, "--patrol", "50", "--mode", "often"}, {}, 64, "--mode"},
        {{"schedule", "add", cam, "--patrol", "50", "--mode", "any", "--to", "24:00"},
         {},
         64,
         "--to"},
        {{"schedule", "add", cam, "--patrol", "50", "--mode", "any", "--days", "mon,fun"},
         {},
         64,
         "--days"},
        {{"schedule", "add", "99", "--patrol", "50", "--mode", "any"}, {}, 65, "no camera 99"},
        {{"schedule", "add", cam, "--patrol", "50", "--mode", "any"},
         {},
         65,
         "of camera " + silent},
        {{"schedule", "remove", "99"}, {}, 65, "no schedule entry 99"},
        {{"status", "--daemon", "localhost"}, {}, 64, "--daemon"},
        {{"status", "--daemon", "127.0.0.1:1"}, {}, 69, "ptzpatrold at 127.0.0.1:1"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(::testing::PrintToString(c.args));
        const Result r = RunTool(c.args, c.env);
        EXPECT_EQ(r.code, c.code);
        EXPECT_THAT(r.err, HasSubstr(c.says));
        EXPECT_EQ(std::count(r.err.begin(), r.err.end(), '\n'), 1) << r.err;
        EXPECT_EQ(r.out, "");
    }
}

// init-db, a camera, a patrol, a preset gone from the camera, a run whose
// moves the tool prints as the simulator receives them, snapshots, Ctrl-C.
TEST_F(ToolTest, SessionAgainstTheSimulator) {
    ASSERT_EQ(RunTool({"init-db"}).code, 0);
    ASSERT_EQ(RunTool({"init-db"}).code, 0);  // again: nothing to do
    const std::string cam = AddCamera();
    Result r =
        RunTool({"--json", "patrol", "create", cam, "Tour", "--stay", "0", "5:Gate", "2", "9"});
    ASSERT_EQ(r.code, 0) << r.err;
    const std::string id = std::to_string(json::parse(r.out).value("id", 0));
    EXPECT_THAT(RunTool({"patrol", "list", cam}).out, HasSubstr(id + "\tTour"));

    sim_.SetPresets({{"1", "Home"}, {"2", "Door"}, {"5", "Gate"}});
    r = RunTool({"patrol", "show", id});
    EXPECT_THAT(r.out, HasSubstr("dropped: position 9 (Yard)"));
    EXPECT_THAT(RunTool({"patrol", "show", id}).out, ::testing::Not(HasSubstr("dropped")));

    sim_.ClearMoves();
    r = RunTool({"--json", "run", id});
    ASSERT_EQ(r.code, 0) << r.err;
    std::vector<int> printed;
    std::vector<double> printedAt;
    std::istringstream lines(r.out);
    for (std::string line; std::getline(lines, line);) {
        const json event = json::parse(line);
        if (event["event"] != "move") continue;
        printed.push_back(event["position"]);
        printedAt.push_back(event["mono"]);
        EXPECT_EQ(event["closing"], printed.size() == 3);
    }
    EXPECT_THAT(printed, ElementsAre(5, 2, 5));
    const auto moves = sim_.Moves();
    ASSERT_EQ(moves.size(), 3u);
    for (size_t i = 0; i < moves.size(); ++i) {
        EXPECT_EQ(moves[i].token, std::to_string(printed[i]));
        // Printed after the camera received it (the printing delay itself is benchmarked).
        EXPECT_GE(printedAt[i] + 0.001, moves[i].monotonic);
    }

    const std::string file = ::testing::TempDir() + "/tool_snapshot.jpg";
    r = RunTool({"snapshot", cam, "-o", file});
    EXPECT_EQ(r.code, 0) << r.err;
    EXPECT_THAT(r.out, HasSubstr("single image"));
    EXPECT_TRUE(IsJpeg(FileBytes(file)));
    // A user-defined camera reading the simulator's MJPEG stream, into its /tmp file.
    r = RunTool(
        {"camera", "add", "--id", "4242", "--host", "127.0.0.1", "--port", port_, "--user", "admin",
         "--vendor", "userdefined", "--path", "/mjpeg?frames=3", "--fetch", "stream"},
        {"PTZ_CAMERA_PASSWORD=secret"});
    ASSERT_EQ(r.code, 0) << r.err;
    r = RunTool({"snapshot", "4242"});
    EXPECT_EQ(r.code, 0) << r.err;
    EXPECT_THAT(r.out, HasSubstr("MJPEG"));
    EXPECT_TRUE(IsJpeg(FileBytes("/tmp/ov_snapshot_id_4242.jpg")));
    EXPECT_EQ(RunTool({"camera", "remove", "4242"}).code, 0);
    EXPECT_NE(access("/tmp/ov_snapshot_id_4242.jpg", F_OK), 0);

    // Ctrl-C during a stay: exit 130 and no move after it.
    RunTool({"patrol", "delete", id});
    r = RunTool({"--json", "patrol", "create", cam, "Slow", "--stay", "30", "1", "2"});
    const std::string slow = std::to_string(json::parse(r.out).value("id", 0));
    sim_.ClearMoves();
    Tool run({"run", slow});
    while (true) {
        const std::string line = run.ReadLine();
        ASSERT_NE(line, "") << run.Err();
        if (line.find("position 1") != std::string::npos) break;
    }
    run.Signal(SIGINT);
    EXPECT_EQ(run.Wait(), 130);
    EXPECT_EQ(sim_.Moves().size(), 1u);
}

}  // namespace
