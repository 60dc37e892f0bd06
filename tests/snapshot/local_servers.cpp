#include "local_servers.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <fstream>
#include <random>
#include <thread>

extern char** environ;

namespace testsrv {
namespace {

// connect() to 127.0.0.1:port, or bind() there when `bindIt` (port 0: any); the port or -1.
int Socket(int port, bool bindIt) {
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_port = htons(static_cast<uint16_t>(port));
    a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof a;
    int rc = bindIt ? bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) |
                          getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len)
                    : connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a);
    close(fd);
    return rc == 0 ? ntohs(a.sin_port) : -1;
}

void Sleep(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }

}  // namespace

std::string JpegLike(size_t size, unsigned seed) {
    std::mt19937 rng(seed);
    std::string s(size, '\0');
    for (char& c : s) c = static_cast<char>(rng());
    s.replace(0, std::min<size_t>(4, size), std::string("\xff\xd8\xff\xe0", std::min<size_t>(4, size)));
    if (size >= 6) s.replace(size - 2, 2, "\xff\xd9");
    return s;
}

TempDir::TempDir() {
    char tmpl[] = "/tmp/ptzsnap.XXXXXX";
    if (mkdtemp(tmpl)) path_ = tmpl;
}

TempDir::~TempDir() {
    if (!path_.empty() && system(("rm -rf '" + path_ + "'").c_str()) != 0) perror(path_.c_str());
}

void TempDir::Write(const std::string& name, const std::string& content, int mode) const {
    std::string file = path_ + "/" + name;
    if (system(("mkdir -p '" + file.substr(0, file.rfind('/')) + "'").c_str()) != 0) return;
    std::ofstream(file, std::ios::binary) << content;
    chmod(file.c_str(), mode);
}

void Server::Start(const std::string& confName, std::string (*conf)(const std::string&, int),
                   const std::vector<std::string>& argv, bool probe) {
    std::vector<char*> args;
    for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    for (int attempt = 0; attempt < 3 && !ok_; ++attempt) {
        Stop();
        if (attempt > 0 || port_ == 0) port_ = Socket(0, true);
        if (conf) dir_.Write(confName, conf(dir_.Path(), port_));
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
        if (posix_spawnp(&pid_, args[0], &actions, nullptr, args.data(), environ) != 0) pid_ = -1;
        posix_spawn_file_actions_destroy(&actions);
        for (int i = 0; probe && pid_ > 0 && i < 500 && Socket(port_, false) < 0; ++i) Sleep(20);
        ok_ = pid_ > 0 && waitpid(pid_, nullptr, WNOHANG) == 0 && (!probe || Socket(port_, false) >= 0);
    }
}

void Server::Stop() {
    // SIGTERM every 10 ms until reaped (never a pid already reaped); SIGKILL after 5 s.
    for (int i = 0; pid_ > 0 && i < 1000 && waitpid(pid_, nullptr, WNOHANG) == 0; ++i, Sleep(10))
        kill(pid_, i < 500 ? SIGTERM : SIGKILL);
    pid_ = -1;
}

Nginx::Nginx(const std::vector<std::pair<std::string, std::string>>& files) {
    for (const auto& f : files) {
        dir_.Write("www/" + f.first, f.second);
        dir_.Write("www/auth/" + f.first, f.second);
    }
    dir_.Write("htpasswd", "admin:{PLAIN}secret\n");
    const std::string& d = dir_.Path();
    Start("nginx.conf", [](const std::string& d, int port) {
        return "daemon off; master_process off; worker_processes 1;\n"
               "pid " + d + "/nginx.pid; error_log " + d + "/error.log warn;\n"
               "events { worker_connections 256; }\n"
               "http { access_log off; sendfile on; keepalive_requests 100000;\n"
               "  client_body_temp_path " + d + "/tmp; proxy_temp_path " + d + "/tmp;\n"
               "  fastcgi_temp_path " + d + "/tmp; uwsgi_temp_path " + d + "/tmp; scgi_temp_path " + d + "/tmp;\n"
               "  server { listen 127.0.0.1:" + std::to_string(port) + "; root " + d + "/www;\n"
               "    location /auth/ { auth_basic \"cam\"; auth_basic_user_file " + d + "/htpasswd; }\n"
               "    location = /moved.jpg { return 302 /snap.jpg; } } }\n";
    }, {"nginx", "-p", d, "-c", d + "/nginx.conf", "-e", d + "/error.log"});
}

Lighttpd::Lighttpd(const std::string& image) {
    const std::string& d = dir_.Path();
    dir_.Write("img.bin", image);
    // The image in two writes with a pause between: lighttpd streams it chunked.
    std::string cgi = "#!/bin/sh\nprintf 'Content-Type: image/jpeg\\r\\n\\r\\n'\nhead -c 1000 '" + d +
                      "/img.bin'\nsleep 0.1\ntail -c +1001 '" + d + "/img.bin'\n";
    dir_.Write("www/cgi-bin/snap.cgi", cgi, 0755);
    dir_.Write("www/cgi-bin/auth.cgi", cgi, 0755);
    dir_.Write("users", "admin:secret\n");
    Start("lighttpd.conf", [](const std::string& d, int port) {
        return "server.document-root = \"" + d + "/www\"\nserver.bind = \"127.0.0.1\"\n"
               "server.port = " + std::to_string(port) + "\nserver.errorlog = \"" + d + "/error.log\"\n"
               "server.stream-response-body = 2\n"
               "server.modules = (\"mod_auth\", \"mod_authn_file\", \"mod_cgi\")\n"
               "cgi.assign = (\".cgi\" => \"\")\nauth.backend = \"plain\"\n"
               "auth.backend.plain.userfile = \"" + d + "/users\"\n"
               "$HTTP[\"url\"] =~ \"^/cgi-bin/auth\" { auth.require = (\"\" => (\"method\" => \"digest\","
               " \"realm\" => \"cam\", \"require\" => \"valid-user\")) }\n";
    }, {"lighttpd", "-D", "-f", d + "/lighttpd.conf"});
}

FfmpegMjpeg::FfmpegMjpeg(int seconds) {
    port_ = Socket(0, true);
    std::string url = "http://127.0.0.1:" + std::to_string(port_) + "/stream.mjpeg";
    Start("", nullptr,
          {"ffmpeg", "-nostdin", "-hide_banner", "-loglevel", "error", "-re", "-f", "lavfi", "-i",
           "testsrc=size=320x240:rate=10", "-t", std::to_string(seconds), "-f", "mpjpeg", "-listen", "1", url},
          false);
}

}  // namespace testsrv
