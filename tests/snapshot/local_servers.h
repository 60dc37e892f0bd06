// Third-party servers for the snapshot integration tests and benchmarks, on
// 127.0.0.1, started in the foreground with our own config files in a scratch
// directory and stopped by pid: nginx (Content-Length, Basic auth under
// /auth/), lighttpd (a CGI: chunked, Digest auth on /cgi-bin/auth.cgi) and
// ffmpeg's mpjpeg muxer (one multipart client).
#ifndef TESTS_SNAPSHOT_LOCAL_SERVERS_H
#define TESTS_SNAPSHOT_LOCAL_SERVERS_H

#include <sys/types.h>

#include <memory>
#include <string>
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

// A child process given its config; SIGTERM (then SIGKILL) to its pid on destruction.
class Server {
public:
    ~Server() { Stop(); }
    int Port() const { return port_; }
    bool Ok() const { return ok_; }
    const std::string& Dir() const { return dir_.Path(); }

protected:
    // Writes `conf(dir, port)` (if any) to `confName` and runs `argv`, retrying on another
    // port (when port_ was 0); `probe`: waits until the port accepts connections.
    void Start(const std::string& confName, std::string (*conf)(const std::string& dir, int port),
               const std::vector<std::string>& argv, bool probe = true);
    void Stop();
    TempDir dir_;
    int port_ = 0;
    bool ok_ = false;
    pid_t pid_ = -1;
};

// `files` (name -> bytes) at /<name> and /auth/<name> (Basic admin:secret); /moved.jpg redirects.
class Nginx : public Server {
public:
    explicit Nginx(const std::vector<std::pair<std::string, std::string>>& files);
};

// `image` through /cgi-bin/snap.cgi (chunked) and /cgi-bin/auth.cgi (Digest admin:secret).
class Lighttpd : public Server {
public:
    explicit Lighttpd(const std::string& image);
};

// A test pattern at /stream.mjpeg for `seconds` to one client; not probed (the
// probe would be its one client): callers retry a refused connection.
class FfmpegMjpeg : public Server {
public:
    explicit FfmpegMjpeg(int seconds = 20);
    std::string Path() const { return "/stream.mjpeg"; }
};

}  // namespace testsrv

#endif  // TESTS_SNAPSHOT_LOCAL_SERVERS_H
