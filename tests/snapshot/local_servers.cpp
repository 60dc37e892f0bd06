#include "local_servers.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <random>

extern char** environ;

namespace testsrv {

std::string JpegLike(size_t size, unsigned seed) {
    std::mt19937 rng(seed);
    std::string s(size, '\0');
    for (char& c : s) c = static_cast<char>(rng() & 0xff);
    const char soi[] = "\xff\xd8\xff\xe0";
    for (size_t i = 0; i < 4 && i < size; ++i) s[i] = soi[i];
    if (size >= 6) {
        s[size - 2] = '\xff';
        s[size - 1] = '\xd9';
    }
    return s;
}

TempDir::TempDir() {
    char tmpl[] = "/tmp/ptzsnap.XXXXXX";
    if (mkdtemp(tmpl)) path_ = tmpl;
}

TempDir::~TempDir() {
    if (path_.empty()) return;
    std::string cmd = "rm -rf '" + path_ + "'";
    if (system(cmd.c_str()) != 0) fprintf(stderr, "could not remove %s\n", path_.c_str());
}

void TempDir::Write(const std::string& name, const std::string& content, int mode) const {
    std::string file = path_ + "/" + name;
    std::string dir = file.substr(0, file.rfind('/'));
    std::string cmd = "mkdir -p '" + dir + "'";
    if (system(cmd.c_str()) != 0) return;
    std::ofstream(file, std::ios::binary) << content;
    chmod(file.c_str(), mode);
}

int FreePort() {
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof a;
    int port = 0;
    if (bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0 &&
        getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len) == 0)
        port = ntohs(a.sin_port);
    close(fd);
    return port;
}

static int ConnectOnce(int port) {
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_port = htons(static_cast<uint16_t>(port));
    a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    int rc = connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a);
    close(fd);
    return rc;
}

bool WaitForPort(int port, std::chrono::milliseconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (ConnectOnce(port) != 0) {
        if (std::chrono::steady_clock::now() >= deadline) return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return true;
}

Process::Process(const std::vector<std::string>& argv) {
    std::vector<char*> args;
    for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    if (posix_spawnp(&pid_, args[0], &actions, nullptr, args.data(), environ) != 0) pid_ = -1;
    posix_spawn_file_actions_destroy(&actions);
}

bool Process::Running() {
    if (pid_ <= 0) return false;
    int status;
    if (waitpid(pid_, &status, WNOHANG) == pid_) {
        pid_ = -1;
        return false;
    }
    return true;
}

Process::~Process() {
    if (!Running()) return;
    kill(pid_, SIGTERM);
    for (int i = 0; i < 500; ++i) {
        if (waitpid(pid_, nullptr, WNOHANG) == pid_) return;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
}

Nginx::Nginx(const std::vector<std::pair<std::string, std::string>>& files) {
    const std::string& d = dir_.Path();
    for (const auto& f : files) {
        dir_.Write("www/" + f.first, f.second);
        dir_.Write("www/auth/" + f.first, f.second);
    }
    dir_.Write("htpasswd", "admin:{PLAIN}secret\n");
    for (int attempt = 0; attempt < 3 && !ok_; ++attempt) {
        port_ = FreePort();
        dir_.Write("nginx.conf",
                   "daemon off; master_process off; worker_processes 1;\n"
                   "pid " + d + "/nginx.pid; error_log " + d + "/error.log warn;\n"
                   "events { worker_connections 256; }\n"
                   "http {\n"
                   "  access_log off; sendfile on; keepalive_requests 100000;\n"
                   "  client_body_temp_path " + d + "/tmp; proxy_temp_path " + d + "/tmp;\n"
                   "  fastcgi_temp_path " + d + "/tmp; uwsgi_temp_path " + d + "/tmp;\n"
                   "  scgi_temp_path " + d + "/tmp;\n"
                   "  server { listen 127.0.0.1:" + std::to_string(port_) + "; root " + d + "/www;\n"
                   "    location /auth/ { auth_basic \"cam\"; auth_basic_user_file " + d + "/htpasswd; }\n"
                   "    location = /moved.jpg { return 302 /snap.jpg; }\n"
                   "  }\n"
                   "}\n");
        process_ = std::make_unique<Process>(std::vector<std::string>{
            "nginx", "-p", d, "-c", d + "/nginx.conf", "-e", d + "/error.log"});
        ok_ = WaitForPort(port_, std::chrono::seconds(10)) && process_->Running();
    }
}

Lighttpd::Lighttpd(const std::string& image) {
    const std::string& d = dir_.Path();
    dir_.Write("img.bin", image);
    // The image in two writes with a pause between: lighttpd streams it chunked.
    std::string cgi = "#!/bin/sh\nprintf 'Content-Type: image/jpeg\\r\\n\\r\\n'\n"
                      "head -c 1000 '" + d + "/img.bin'\nsleep 0.1\n"
                      "tail -c +1001 '" + d + "/img.bin'\n";
    dir_.Write("www/cgi-bin/snap.cgi", cgi, 0755);
    dir_.Write("www/cgi-bin/auth.cgi", cgi, 0755);
    dir_.Write("users", "admin:secret\n");
    for (int attempt = 0; attempt < 3 && !ok_; ++attempt) {
        port_ = FreePort();
        dir_.Write("lighttpd.conf",
                   "server.document-root = \"" + d + "/www\"\n"
                   "server.bind = \"127.0.0.1\"\n"
                   "server.port = " + std::to_string(port_) + "\n"
                   "server.errorlog = \"" + d + "/error.log\"\n"
                   "server.stream-response-body = 2\n"
                   "server.modules = (\"mod_auth\", \"mod_authn_file\", \"mod_cgi\")\n"
                   "cgi.assign = (\".cgi\" => \"\")\n"
                   "auth.backend = \"plain\"\n"
                   "auth.backend.plain.userfile = \"" + d + "/users\"\n"
                   "$HTTP[\"url\"] =~ \"^/cgi-bin/auth\" {\n"
                   "  auth.require = (\"\" => (\"method\" => \"digest\", \"realm\" => \"cam\","
                   " \"require\" => \"valid-user\"))\n"
                   "}\n");
        process_ = std::make_unique<Process>(
            std::vector<std::string>{"lighttpd", "-D", "-f", d + "/lighttpd.conf"});
        ok_ = WaitForPort(port_, std::chrono::seconds(10)) && process_->Running();
    }
}

FfmpegMjpeg::FfmpegMjpeg(int seconds) {
    port_ = FreePort();
    process_ = std::make_unique<Process>(std::vector<std::string>{
        "ffmpeg", "-nostdin", "-hide_banner", "-loglevel", "error", "-re", "-f", "lavfi", "-i",
        "testsrc=size=320x240:rate=10", "-t", std::to_string(seconds), "-f", "mpjpeg", "-listen",
        "1", "http://127.0.0.1:" + std::to_string(port_) + "/stream.mjpeg"});
}

ScriptServer::ScriptServer(Reply reply) : reply_(std::move(reply)) {
    listenFd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    int one = 1;
    setsockopt(listenFd_, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof a;
    if (bind(listenFd_, reinterpret_cast<sockaddr*>(&a), sizeof a) == 0 && listen(listenFd_, 16) == 0 &&
        getsockname(listenFd_, reinterpret_cast<sockaddr*>(&a), &len) == 0)
        port_ = ntohs(a.sin_port);
    thread_ = std::thread([this] { Run(); });
}

ScriptServer::~ScriptServer() {
    stop_ = true;
    thread_.join();
    close(listenFd_);
}

void ScriptServer::Run() {
    // One connection at a time, up to 64 of them; polls so that stop_ is seen.
    for (int served = 0; served < 64 && !stop_;) {
        pollfd p{listenFd_, POLLIN, 0};
        if (poll(&p, 1, 50) <= 0) continue;
        int fd = accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) continue;
        ++served;
        ++connections_;
        std::string request;
        char buf[4096];
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
        while (request.find("\r\n\r\n") == std::string::npos && !stop_ &&
               std::chrono::steady_clock::now() < deadline) {
            pollfd q{fd, POLLIN, 0};
            if (poll(&q, 1, 50) <= 0) continue;
            ssize_t n = recv(fd, buf, sizeof buf, 0);
            if (n <= 0) break;
            request.append(buf, n);
        }
        if (request.find("\r\n\r\n") != std::string::npos) reply_(fd, request, *this);
        close(fd);
    }
}

bool ScriptServer::Send(int fd, const std::string& bytes) {
    size_t at = 0;
    while (at < bytes.size()) {
        ssize_t n = send(fd, bytes.data() + at, bytes.size() - at, MSG_NOSIGNAL);
        if (n <= 0) return false;
        at += static_cast<size_t>(n);
    }
    return true;
}

void ScriptServer::Hold(int fd, std::chrono::milliseconds limit) {
    auto deadline = std::chrono::steady_clock::now() + limit;
    char buf[256];
    while (!stop_ && std::chrono::steady_clock::now() < deadline) {
        pollfd q{fd, POLLIN, 0};
        if (poll(&q, 1, 50) <= 0) continue;
        if (recv(fd, buf, sizeof buf, 0) <= 0) return;
    }
}

}  // namespace testsrv
