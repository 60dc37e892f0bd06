// Servers for the snapshot integration tests and benchmarks, all on
// 127.0.0.1 and started in the foreground with our own config files in a
// scratch directory: nginx (a JPEG with Content-Length, Basic auth under
// /auth/), lighttpd (the JPEG through a CGI: chunked, Digest auth under
// /cgi-bin/auth.cgi), ffmpeg's mpjpeg muxer (one multipart client), and a
// scripted raw server for transport faults. Each stops its process by pid.
#ifndef TESTS_SNAPSHOT_LOCAL_SERVERS_H
#define TESTS_SNAPSHOT_LOCAL_SERVERS_H

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

namespace testsrv {

// Bytes shaped like a JPEG (SOI ... EOI) of exactly `size` bytes.
std::string JpegLike(size_t size, unsigned seed);

// A fresh directory under /tmp, removed with its content on destruction.
class TempDir {
public:
    TempDir();
    ~TempDir();
    const std::string& Path() const { return path_; }
    void Write(const std::string& name, const std::string& content, int mode = 0644) const;

private:
    std::string path_;
};

// A port on 127.0.0.1 that was free a moment ago.
int FreePort();
// Polls until something accepts connections on 127.0.0.1:port.
bool WaitForPort(int port, std::chrono::milliseconds timeout);

// A child process; SIGTERM then, after 5 s, SIGKILL to its pid on destruction.
class Process {
public:
    explicit Process(const std::vector<std::string>& argv);
    ~Process();
    pid_t Pid() const { return pid_; }
    bool Running();

private:
    pid_t pid_ = -1;
};

class Nginx {
public:
    // Serves `files` (name -> bytes) at /<name> and at /auth/<name> (Basic auth
    // admin:secret); /moved.jpg redirects to /snap.jpg.
    explicit Nginx(const std::vector<std::pair<std::string, std::string>>& files);
    int Port() const { return port_; }
    bool Ok() const { return ok_; }

private:
    TempDir dir_;
    int port_ = 0;
    bool ok_ = false;
    std::unique_ptr<Process> process_;
};

class Lighttpd {
public:
    // Serves `image` through /cgi-bin/snap.cgi (chunked) and /cgi-bin/auth.cgi
    // (the same behind Digest auth admin:secret).
    explicit Lighttpd(const std::string& image);
    int Port() const { return port_; }
    bool Ok() const { return ok_; }

private:
    TempDir dir_;
    int port_ = 0;
    bool ok_ = false;
    std::unique_ptr<Process> process_;
};

// ffmpeg's mpjpeg muxer serving a test pattern at /stream.mjpeg to one
// client; it stops after `seconds` of stream. Not probed (a probe would be its
// one client): callers retry a refused connection.
class FfmpegMjpeg {
public:
    explicit FfmpegMjpeg(int seconds = 20);
    int Port() const { return port_; }
    std::string Path() const { return "/stream.mjpeg"; }

private:
    int port_ = 0;
    std::unique_ptr<Process> process_;
};

// A raw TCP server: each connection's request head is read, then `reply`
// writes whatever it likes on the socket. `Stopping()` tells a reply that
// stalls when to give up.
class ScriptServer {
public:
    using Reply = std::function<void(int fd, const std::string& request, ScriptServer& server)>;
    explicit ScriptServer(Reply reply);
    ~ScriptServer();
    int Port() const { return port_; }
    bool Stopping() const { return stop_; }
    int Connections() const { return connections_; }
    // Writes all of `bytes`; false when the peer went away.
    static bool Send(int fd, const std::string& bytes);
    // Waits until the peer closes or the server stops (at most `limit`).
    void Hold(int fd, std::chrono::milliseconds limit);

private:
    void Run();
    Reply reply_;
    int listenFd_ = -1;
    int port_ = 0;
    std::atomic<bool> stop_{false};
    std::atomic<int> connections_{0};
    std::thread thread_;
};

}  // namespace testsrv

#endif  // TESTS_SNAPSHOT_LOCAL_SERVERS_H
