// SnapshotGet against third-party servers started here on 127.0.0.1: nginx
// (Content-Length, Basic auth), lighttpd through a CGI (chunked, Digest auth)
// and ffmpeg's mpjpeg muxer (chunked multipart, Content-Type without boundary).
#include <gtest/gtest.h>

#include <thread>

#include "host/http.h"
#include "local_servers.h"
#include "snapshot/snapshot.h"
#include "static_api.h"

namespace {

struct Fetched {
    int rc = -1;
    std::string bytes;
};

Fetched Fetch(int port, const std::string& path, int type, const std::string& user = "",
              const std::string& password = "") {
    StaticApi api(path, type);
    unsigned char* buffer = nullptr;
    int size = 0;
    Fetched f;
    f.rc = SnapshotGet("127.0.0.1", port, user, password, api, "640x480", &buffer, &size);
    if (f.rc == 0) f.bytes.assign(reinterpret_cast<char*>(buffer), size);
    if (f.rc != 0) {
        EXPECT_EQ(buffer, nullptr);
    }
    SnapshotFree(buffer);
    return f;
}

// Whether the server framed its answer with a Content-Length.
bool HasContentLength(int port, const std::string& path) {
    OvHttpClient client("127.0.0.1", port, path, "", "", 5);
    int status = 0;
    std::string length;
    EXPECT_EQ(client.SendRequest(OV_HTTP_GET), 0);
    EXPECT_EQ(client.CheckResponse(status), 0);
    EXPECT_EQ(status, 200);
    return client.GetHttpContent(HTTP_CONTENT_LENGTH, length) == 0;
}

TEST(SnapshotServers, NginxWithContentLengthAndBasicAuth) {
    const std::string image = testsrv::JpegLike(300000, 11);
    testsrv::Nginx nginx({{"snap.jpg", image}, {"empty.jpg", ""}});
    ASSERT_TRUE(nginx.Ok());
    EXPECT_TRUE(HasContentLength(nginx.Port(), "/snap.jpg"));
    Fetched f = Fetch(nginx.Port(), "/snap.jpg", 1);
    EXPECT_EQ(f.rc, 0);
    EXPECT_TRUE(f.bytes == image);
    f = Fetch(nginx.Port(), "/auth/snap.jpg", 1, "admin", "secret");
    EXPECT_EQ(f.rc, 0);
    EXPECT_TRUE(f.bytes == image);
    EXPECT_EQ(Fetch(nginx.Port(), "/auth/snap.jpg", 1, "admin", "wrong").rc, -1);
    EXPECT_EQ(Fetch(nginx.Port(), "/auth/snap.jpg", 1).rc, -1);
    EXPECT_EQ(Fetch(nginx.Port(), "/missing.jpg", 1).rc, -1);
    EXPECT_EQ(Fetch(nginx.Port(), "/moved.jpg", 1).rc, -1);  // redirects are not followed
    EXPECT_EQ(Fetch(nginx.Port(), "/empty.jpg", 1).rc, -1);  // Content-Length: 0
}

TEST(SnapshotServers, LighttpdCgiChunkedWithDigestAuth) {
    const std::string image = testsrv::JpegLike(200000, 12);
    testsrv::Lighttpd lighttpd(image);
    ASSERT_TRUE(lighttpd.Ok());
    EXPECT_FALSE(HasContentLength(lighttpd.Port(), "/cgi-bin/snap.cgi"));
    Fetched f = Fetch(lighttpd.Port(), "/cgi-bin/snap.cgi", 1);
    EXPECT_EQ(f.rc, 0);
    EXPECT_TRUE(f.bytes == image);
    f = Fetch(lighttpd.Port(), "/cgi-bin/auth.cgi", 1, "admin", "secret");
    EXPECT_EQ(f.rc, 0);
    EXPECT_TRUE(f.bytes == image);
    EXPECT_EQ(Fetch(lighttpd.Port(), "/cgi-bin/auth.cgi", 1, "admin", "wrong").rc, -1);
}

TEST(SnapshotServers, FfmpegMpjpegFirstFrame) {
    testsrv::FfmpegMjpeg ffmpeg(30);
    // ffmpeg serves one client and cannot be probed: retry while it is not listening yet.
    Fetched f;
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(15);
    while ((f = Fetch(ffmpeg.Port(), ffmpeg.Path(), 2)).rc != 0 &&
           std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    ASSERT_EQ(f.rc, 0);
    ASSERT_GT(f.bytes.size(), 1000u);
    EXPECT_EQ(f.bytes.substr(0, 2), "\xff\xd8");  // one whole JPEG: SOI ... EOI
    EXPECT_EQ(f.bytes.substr(f.bytes.size() - 2), "\xff\xd9");
}

}  // namespace
