// SnapshotGet against third-party servers started here on 127.0.0.1: nginx
// (Content-Length, Basic auth), lighttpd through a CGI (chunked, Digest auth)
// and ffmpeg's mpjpeg muxer (chunked multipart, Content-Type without boundary).
#include <gtest/gtest.h>

#include <unistd.h>

#include <chrono>
#include <fstream>
#include <thread>

#include "host/http.h"
#include "local_servers.h"
#include "static_api.h"

namespace {

// Whether the server framed its answer with a Content-Length.
bool HasContentLength(int port, const std::string& path) {
    OvHttpClient client("127.0.0.1", port, path, "", "", 5);
    int status = 0;
    std::string length;
    EXPECT_EQ(client.SendRequest(OV_HTTP_GET), 0);
    EXPECT_EQ(client.CheckResponse(status), 0);
    return client.GetHttpContent(HTTP_CONTENT_LENGTH, length) == 0;
}

TEST(SnapshotServers, NginxWithContentLengthAndBasicAuth) {
    const std::string image = testsrv::JpegLike(300000, 11);
    testsrv::Nginx nginx({{"snap.jpg", image}, {"empty.jpg", ""}});
    ASSERT_TRUE(nginx.Ok());
    EXPECT_TRUE(HasContentLength(nginx.Port(), "/snap.jpg"));
    EXPECT_TRUE(FetchSnapshot(nginx.Port(), "/snap.jpg", 1) == image);
    EXPECT_TRUE(FetchSnapshot(nginx.Port(), "/auth/snap.jpg", 1, "admin", "secret") == image);
    EXPECT_EQ(FetchSnapshot(nginx.Port(), "/auth/snap.jpg", 1, "admin", "wrong"), "FAILED");
    EXPECT_EQ(FetchSnapshot(nginx.Port(), "/auth/snap.jpg", 1), "FAILED");
    EXPECT_EQ(FetchSnapshot(nginx.Port(), "/missing.jpg", 1), "FAILED");
    EXPECT_EQ(FetchSnapshot(nginx.Port(), "/moved.jpg", 1), "FAILED");  // redirects are not followed
    EXPECT_EQ(FetchSnapshot(nginx.Port(), "/empty.jpg", 1), "FAILED");  // Content-Length: 0
}

long RssKiB() {
    std::ifstream in("/proc/self/status");
    std::string line;
    while (std::getline(in, line))
        if (line.rfind("VmRSS:", 0) == 0) return std::stol(line.substr(6));
    return -1;
}

// A client that reads slowly holds the server back: memory does not grow with
// what the server has to send (1 GiB here).
TEST(SnapshotServers, ASlowReaderKeepsMemoryBounded) {
    testsrv::Nginx nginx({{std::string("big.bin"), std::string()}});
    ASSERT_TRUE(nginx.Ok());
    ASSERT_EQ(truncate((nginx.Dir() + "/www/big.bin").c_str(), 1L << 30), 0);
    OvHttpClient client("127.0.0.1", nginx.Port(), "/big.bin", "", "", 5);
    int status = 0;
    ASSERT_EQ(client.SendRequest(OV_HTTP_GET), 0);
    ASSERT_EQ(client.CheckResponse(status), 0);
    long before = RssKiB();
    char buf[100];
    for (int i = 0; i < 50; ++i, std::this_thread::sleep_for(std::chrono::milliseconds(20)))
        ASSERT_EQ(client.ReadData(buf, sizeof buf), 100);
    EXPECT_LT(RssKiB() - before, 32L << 10) << "the client kept reading into memory";
}

TEST(SnapshotServers, LighttpdCgiChunkedWithDigestAuth) {
    const std::string image = testsrv::JpegLike(200000, 12);
    testsrv::Lighttpd lighttpd(image);
    ASSERT_TRUE(lighttpd.Ok());
    EXPECT_FALSE(HasContentLength(lighttpd.Port(), "/cgi-bin/snap.cgi"));
    EXPECT_TRUE(FetchSnapshot(lighttpd.Port(), "/cgi-bin/snap.cgi", 1) == image);
    EXPECT_TRUE(FetchSnapshot(lighttpd.Port(), "/cgi-bin/auth.cgi", 1, "admin", "secret") == image);
    EXPECT_EQ(FetchSnapshot(lighttpd.Port(), "/cgi-bin/auth.cgi", 1, "admin", "wrong"), "FAILED");
}

TEST(SnapshotServers, FfmpegMpjpegFirstFrame) {
    testsrv::FfmpegMjpeg ffmpeg(30);
    std::string frame;  // ffmpeg serves one client: retry while it is not listening yet
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(15);
    while ((frame = FetchSnapshot(ffmpeg.Port(), ffmpeg.Path(), 2)) == "FAILED" &&
           std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    ASSERT_GT(frame.size(), 1000u);  // one whole JPEG: SOI ... EOI
    EXPECT_EQ(frame.substr(0, 2) + frame.substr(frame.size() - 2), "\xff\xd8\xff\xd9");
}

}  // namespace
