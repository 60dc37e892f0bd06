// CamSim: starts tools/camsim and talks to its control endpoints with libcurl.
#include "camsim.h"

#include <curl/curl.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <sstream>
#include <stdexcept>
#include <thread>

extern char** environ;

namespace {

std::string Binary() {
    const char* env = getenv("PTZ_CAMSIM");
    if (env && *env) return env;
#ifdef CAMSIM_BINARY
    return CAMSIM_BINARY;
#else
    const char* dir = getenv("PTZ_BINARY_DIR");
    return std::string(dir ? dir : ".") + "/tools/camsim/camsim";
#endif
}

size_t Collect(char* data, size_t size, size_t n, void* out) {
    static_cast<std::string*>(out)->append(data, size * n);
    return size * n;
}

// Reads the "CAMSIM_PORT=<n>" line from `fd` within `timeout`; 0 on failure.
int ReadPort(int fd, std::chrono::milliseconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    std::string got;
    while (got.find('\n') == std::string::npos) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
            deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) return 0;
        struct pollfd p = {fd, POLLIN, 0};
        if (poll(&p, 1, static_cast<int>(left.count())) <= 0) continue;
        char buf[128];
        ssize_t n = read(fd, buf, sizeof buf);
        if (n <= 0) return 0;
        got.append(buf, n);
    }
    if (got.rfind("CAMSIM_PORT=", 0) != 0) return 0;
    return atoi(got.c_str() + 12);
}

}  // namespace

CamSim::CamSim() : CamSim(Options()) {}

CamSim::CamSim(Options options) {
    int in[2], out[2];
    if (pipe2(in, O_CLOEXEC) != 0) throw std::runtime_error("CamSim: pipe failed");
    if (pipe2(out, O_CLOEXEC) != 0) {
        close(in[0]);
        close(in[1]);
        throw std::runtime_error("CamSim: pipe failed");
    }
    std::string binary = Binary();
    std::vector<std::string> args = {binary,       "--exit-on-stdin-eof", "--user",
                                     options.user, "--password",          options.password};
    if (options.port > 0) args.insert(args.end(), {"--port", std::to_string(options.port)});
    if (options.threads > 0)
        args.insert(args.end(), {"--threads", std::to_string(options.threads)});
    std::vector<char*> argv;
    for (std::string& a : args) argv.push_back(&a[0]);
    argv.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, in[0], 0);
    posix_spawn_file_actions_adddup2(&actions, out[1], 1);
    int rc = posix_spawn(&pid_, binary.c_str(), &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    close(in[0]);
    close(out[1]);
    stdinFd_ = in[1];
    if (rc != 0) {
        pid_ = -1;
        close(out[0]);
        close(stdinFd_);
        throw std::runtime_error("CamSim: cannot start " + binary);
    }
    port_ = ReadPort(out[0], std::chrono::seconds(10));
    close(out[0]);
    if (port_ <= 0) {
        this->~CamSim();
        throw std::runtime_error("CamSim: simulator did not report its port");
    }
    // It listens before it prints its port; wait until it answers all the same.
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    while (Control("GET", "/control/ping", "") != "ok\n") {
        if (std::chrono::steady_clock::now() > deadline) {
            this->~CamSim();
            throw std::runtime_error("CamSim: simulator does not answer");
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    SetPresets(options.presets);
}

CamSim::~CamSim() {
    if (stdinFd_ >= 0) close(stdinFd_);  // the simulator exits at end of input
    stdinFd_ = -1;
    if (pid_ <= 0) return;
    kill(pid_, SIGTERM);
    for (int i = 0; i < 200; ++i) {  // at most 2 s, then kill
        if (waitpid(pid_, nullptr, WNOHANG) == pid_) {
            pid_ = -1;
            return;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
    pid_ = -1;
}

int CamSim::Port() const { return port_; }

std::string CamSim::Control(const char* method, const std::string& path, const std::string& body) {
    CURL* curl = curl_easy_init();
    if (!curl) return {};
    std::string url = "http://127.0.0.1:" + std::to_string(port_) + path;
    std::string reply;
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, 5000L);
    curl_easy_setopt(curl, CURLOPT_NOPROXY, "*");
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, Collect);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &reply);
    if (std::string(method) == "POST") {
        curl_easy_setopt(curl, CURLOPT_POSTFIELDS, body.c_str());
        curl_easy_setopt(curl, CURLOPT_POSTFIELDSIZE, static_cast<long>(body.size()));
    }
    CURLcode rc = curl_easy_perform(curl);
    long status = 0;
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &status);
    curl_easy_cleanup(curl);
    if (rc != CURLE_OK || status != 200) return {};
    return reply;
}

void CamSim::SetPresets(const std::vector<std::pair<std::string, std::string>>& presets) {
    std::string body;
    for (const auto& p : presets) body += p.first + "\t" + p.second + "\n";
    if (Control("POST", "/control/presets", body) != "ok\n")
        throw std::runtime_error("CamSim: setting presets failed");
}

std::vector<CamSim::Move> CamSim::Moves() {
    std::vector<Move> moves;
    std::istringstream in(Control("GET", "/control/moves", ""));
    std::string line;
    while (std::getline(in, line)) {
        size_t tab = line.find('\t');
        if (tab == std::string::npos) continue;
        char* end = nullptr;
        const double seconds = strtod(line.c_str() + tab + 1, &end);
        moves.push_back({line.substr(0, tab), seconds, strtod(end, nullptr)});
    }
    return moves;
}

void CamSim::ClearMoves() { Control("POST", "/control/moves/clear", ""); }

double CamSim::Now() { return strtod(Control("GET", "/control/now", "").c_str(), nullptr); }

void CamSim::SetFault(const std::string& name, const std::string& value) {
    if (Control("POST", "/control/fault", name + "=" + value) != "ok\n")
        throw std::runtime_error("CamSim: setting fault " + name + " failed");
}

void CamSim::ClearFaults() { Control("POST", "/control/faults/clear", ""); }

void CamSim::SetEvents(const std::string& states) {
    if (Control("POST", "/control/event", states) != "ok\n")
        throw std::runtime_error("CamSim: setting events " + states + " failed");
}

CamSim::EventStats CamSim::Events() {
    EventStats s;
    std::istringstream in(Control("GET", "/control/events/stats", ""));
    std::string word;
    while (in >> word) {
        size_t eq = word.find('=');
        if (eq == std::string::npos) continue;
        int v = atoi(word.c_str() + eq + 1);
        std::string k = word.substr(0, eq);
        if (k == "live") s.live = v;
        if (k == "created") s.created = v;
        if (k == "renewed") s.renewed = v;
        if (k == "unsubscribed") s.unsubscribed = v;
        if (k == "pulls") s.pulls = v;
    }
    return s;
}

void CamSim::DropSubscriptions() { Control("POST", "/control/events/drop", ""); }

std::string CamSim::SnapshotPath() const { return "/snapshot.jpg?profile=Profile_1_main"; }

std::string CamSim::MjpegPath() const { return "/mjpeg?profile=Profile_1_main&frames=50"; }
